// Writes a Value as the XML form of a vlist, in the one layout the daemon produces: two spaces of
// indentation per level, a scalar (or empty container) on its key's line, UTF-8 throughout.
//
// Writing cannot fail, but XML 1.0 cannot carry every string: NUL and the other control
// characters except tab, newline and carriage return, U+FFFE and U+FFFF, and bytes that are not
// UTF-8 are each written as U+FFFD REPLACEMENT CHARACTER, in keys as in strings. A dictionary
// whose keys become equal that way keeps the first of them. Values that need such strings exactly
// belong in the binary form, which carries every string as it is.
#pragma once

#include <string>

#include "platform/Value.h"

namespace om {

class VlistXmlWriter {
public:
    // value must not be none.
    static std::string write(const Value& value);

    // The lines of one dictionary entry at the indentation of level, exactly as write() puts them
    // inside a dictionary at that level: for documents assembled from entries that change one at a
    // time. key must be representable; value must not be none.
    static void appendDictionaryEntry(std::string& out, std::string_view key, const Value& value, unsigned level);

    // True when every character of text is written as itself (escaped or not).
    static bool representable(std::string_view text);
};

} // namespace om
