// omctl's diagnostic subcommands: "raw" sends any request dictionary and prints the reply; "ping"
// checks that omd answers and how fast.
#pragma once

#include <string>
#include <vector>

#include "tools/omctl/OmctlContext.h"

namespace om {

class OmctlDiagnostics {
public:
    static const char* const kRawHelp;
    static const char* const kPingHelp;

    static int raw(OmctlContext& context, const std::vector<std::string>& arguments);
    static int ping(OmctlContext& context, const std::vector<std::string>& arguments);
};

} // namespace om
