// omctl's "consent" subcommand: the user's privacy-consent grants per application, written to and
// read from the consent store directly; no daemon is involved.
#pragma once

#include <string>
#include <vector>

#include "tools/omctl/OmctlContext.h"

namespace om {

class OmctlConsent {
public:
    static const char* const kHelp;

    static int consent(OmctlContext& context, const std::vector<std::string>& arguments);
};

} // namespace om
