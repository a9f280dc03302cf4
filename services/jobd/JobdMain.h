// jobd's command line and start-up, as functions so that tests can call them; main.cpp only
// arranges signal handling and calls jobdMain.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/JobManager.h"

namespace om {

struct JobdOptions {
    std::string serviceName = kJobManagerServiceName;
};

inline constexpr int kJobdExitStartFailed = 1;
inline constexpr int kJobdExitUsage = 2;
inline constexpr std::string_view kJobdUsageText = "Usage: jobd [-S servicename]\n";

// "-S name"; none on anything else.
std::optional<JobdOptions> parseJobdOptions(int argc, char* const argv[]);

// Parses the command line, starts the server and serves until a signal ends the process. Returns
// only on failure, with the exit status.
int jobdMain(int argc, char* const argv[]);

} // namespace om
