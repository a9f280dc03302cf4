// omctl's discovery subcommand: "match" asks omd which plug-ins a rule set selects, as omctl's own
// process sees them. Also the lookup the other subcommands share: a plug-in named by UUID or by
// identifier.
#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "platform/Uuid.h"
#include "tools/omctl/OmctlContext.h"

namespace om {

class OmctlDiscovery {
public:
    static const char* const kMatchHelp;

    static int match(OmctlContext& context, const std::vector<std::string>& arguments);

    // target is UUID text, or an identifier that omd shows under exactly one UUID (every version
    // counted). The exit status; uuid is set on kOmctlSuccess.
    static int resolve(OmctlContext& context, std::string_view command, const std::string& target, Uuid& uuid);

    // "on", "off" or "-" (no election made) for a plug-in's annotations.
    static std::string electionState(const OMDaemonClient::MatchedPlugIn& matched);
};

} // namespace om
