// omctl's plug-in holds: "hold" keeps plug-ins out of discovery and readying for as long as omctl
// waits, "release" ends a hold by its token.
#pragma once

#include <string>
#include <vector>

#include "tools/omctl/OmctlContext.h"

namespace om {

class OmctlHold {
public:
    static const char* const kHoldHelp;
    static const char* const kReleaseHelp;

    static int hold(OmctlContext& context, const std::vector<std::string>& arguments);
    static int release(OmctlContext& context, const std::vector<std::string>& arguments);
};

} // namespace om
