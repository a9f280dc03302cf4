// omctl's view of jobd: "ps" lists the plug-in instances jobd is running.
#pragma once

#include <string>
#include <vector>

#include "platform/JobManager.h"
#include "tools/omctl/OmctlContext.h"

namespace om {

class OmctlJobs {
public:
    static const char* const kPsHelp;

    static int ps(OmctlContext& context, const std::vector<std::string>& arguments);

    // The instances as "ps" prints them: a table with a header line, or a sentence when there are
    // none; and as the value --json prints.
    static std::string table(const std::vector<JobInstanceInfo>& instances);
    static Value value(const std::vector<JobInstanceInfo>& instances);
};

} // namespace om
