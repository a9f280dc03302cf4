// The daemon's command line and start-up steps, as functions so that tests can call them; main.cpp
// only arranges signal handling and calls omdMain.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace om {

struct OMDOptions {
    static constexpr uint32_t kDefaultCacheLimit = 1000000;

    uint32_t cacheLimit = kDefaultCacheLimit;
    std::optional<std::string> databasePath; // "-d"; none: the annotation store's default file
    std::string serviceName = "com.orvex.ombrel.omd";
};

// Exit statuses of omd.
inline constexpr int kOMDExitConstructionFailed = 1;
inline constexpr int kOMDExitUsage = 2;

// Exactly what a bad command line prints on standard error.
inline constexpr std::string_view kOMDUsageText = "Usage: omd [-S servicename] [-v]\n";

// Parses "-c count", "-d path", "-S name" and "-v" (each "-v" logs that it does nothing). Later
// options replace earlier ones. None on an unknown option, a missing argument or a leftover
// operand; the caller prints the usage text.
std::optional<OMDOptions> parseOMDOptions(int argc, char* const argv[]);

// Logs the launch, parses the command line, builds the server and runs it. Returns only on
// failure, with the process's exit status; a running daemon ends by signal.
int omdMain(int argc, char* const argv[]);

} // namespace om
