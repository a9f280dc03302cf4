// Human-readable output of omctl: a value tree as an indented outline, one entry per line.
#pragma once

#include <string>

#include "platform/Value.h"

namespace om {

class OmctlOutput {
public:
    // Dictionaries as "key: value" lines, arrays as "[index] value" lines, nested containers
    // indented by two spaces under their key. Ends with a newline.
    static std::string tree(const Value& value);
    // One scalar as the outline shows it; containers as {} or [] with their size.
    static std::string scalar(const Value& value);
};

} // namespace om
