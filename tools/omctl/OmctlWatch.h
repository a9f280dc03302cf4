// omctl's "watch": prints a line for each annotation-change notification omd posts (an election,
// another annotation or a hold changed, so discovery may answer differently) until SIGINT or
// SIGTERM.
#pragma once

#include <string>
#include <vector>

#include "tools/omctl/OmctlContext.h"

namespace om {

class OmctlWatch {
public:
    static constexpr const char* kAnnotationChange = "com.orvex.ombrel.annotation-change";
    static const char* const kHelp;

    static int watch(OmctlContext& context, const std::vector<std::string>& arguments);
};

} // namespace om
