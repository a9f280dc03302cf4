// omctl's "why": explains which of omd's rules show or hide one plug-in from one host. omctl
// works it out itself from the Registrar's record, omd's "match" answers to omctl, the host's
// executable and the user's preferences, and says what it checked and what it could not.
#pragma once

#include <string>
#include <vector>

#include "tools/omctl/OmctlContext.h"

namespace om {

class OmctlWhy {
public:
    static const char* const kHelp;

    static int why(OmctlContext& context, const std::vector<std::string>& arguments);
};

} // namespace om
