// omctl's look at the Registrar without the daemon: "registrar dump" lists the registered
// applications and plug-ins from the Registrar's database, opened read-only.
#pragma once

#include <string>
#include <vector>

#include "tools/omctl/OmctlContext.h"

namespace om {

class OmctlRegistrar {
public:
    static const char* const kHelp;

    static int registrar(OmctlContext& context, const std::vector<std::string>& arguments);
};

} // namespace om
