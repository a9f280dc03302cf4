// omctl's annotation subcommands: "elect" turns the user's election of a plug-in on or off;
// "annotate" sets annotations of plug-ins, one change for many or ("--bulk") each its own.
#pragma once

#include <string>
#include <vector>

#include "tools/omctl/OmctlContext.h"

namespace om {

class OmctlAnnotation {
public:
    static const char* const kElectHelp;
    static const char* const kAnnotateHelp;

    static int elect(OmctlContext& context, const std::vector<std::string>& arguments);
    static int annotate(OmctlContext& context, const std::vector<std::string>& arguments);
};

} // namespace om
