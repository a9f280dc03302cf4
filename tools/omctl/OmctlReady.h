// omctl's readying subcommands: "ready" asks omd to let omctl's own process launch plug-ins,
// "access" asks for read tokens for their bundles, and "launch" readies one plug-in and starts it
// through jobd.
#pragma once

#include <string>
#include <vector>

#include "tools/omctl/OmctlContext.h"

namespace om {

class OmctlReady {
public:
    static const char* const kReadyHelp;
    static const char* const kAccessHelp;
    static const char* const kLaunchHelp;

    static int ready(OmctlContext& context, const std::vector<std::string>& arguments);
    static int access(OmctlContext& context, const std::vector<std::string>& arguments);
    static int launch(OmctlContext& context, const std::vector<std::string>& arguments);
};

} // namespace om
