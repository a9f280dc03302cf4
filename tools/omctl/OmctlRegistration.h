// omctl's registration subcommands: "add" registers plug-in bundles with omd, "remove" unregisters
// them.
#pragma once

#include <string>
#include <vector>

#include "tools/omctl/OmctlContext.h"

namespace om {

class OmctlRegistration {
public:
    static const char* const kAddHelp;
    static const char* const kRemoveHelp;

    static int add(OmctlContext& context, const std::vector<std::string>& arguments);
    static int remove(OmctlContext& context, const std::vector<std::string>& arguments);
};

} // namespace om
