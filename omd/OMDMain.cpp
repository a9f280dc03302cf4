#include "omd/OMDMain.h"

#include <getopt.h>
#include <unistd.h>

#include <cstdlib>

#include "Ombrel/OMLog.h"
#include "omd/OMDServer.h"
#include "platform/Log.h"

namespace om {

namespace {

// The standard ASCII-to-integer conversion: optional white space and sign, then leading digits,
// 0 when there are none. glibc's atoi is this strtol call, without atoi's undefined overflow.
uint32_t parseCount(const char* text)
{
    return static_cast<uint32_t>(static_cast<int>(std::strtol(text, nullptr, 10)));
}

void printUsage()
{
    std::string_view text = kOMDUsageText;
    while (!text.empty()) {
        ssize_t written = ::write(STDERR_FILENO, text.data(), text.size());
        if (written <= 0)
            return; // nowhere left to tell anyone
        text.remove_prefix(static_cast<size_t>(written));
    }
}

} // namespace

std::optional<OMDOptions> parseOMDOptions(int argc, char* const argv[])
{
    OMDOptions options;
    // getopt keeps its state in globals: start over on every call, and print nothing of its own,
    // since the usage text is the only thing a bad command line may produce. "+" stops at the
    // first operand instead of reordering argv, so any operand is left over and refused.
    optind = 0;
    opterr = 0;
    int option;
    // NOLINTNEXTLINE(concurrency-mt-unsafe): the command line is parsed once, on one thread.
    while ((option = ::getopt(argc, argv, "+c:d:S:v")) != -1) {
        switch (option) {
        case 'c':
            options.cacheLimit = parseCount(optarg);
            break;
        case 'd':
            options.databasePath = optarg;
            break;
        case 'S':
            options.serviceName = optarg;
            break;
        case 'v':
            Log::defaultLog().error("verbose option -v is ineffective; use log config --subsystem com.orvex.ombrel");
            break;
        default:
            return std::nullopt;
        }
    }
    if (optind < argc)
        return std::nullopt;
    return options;
}

int omdMain(int argc, char* const argv[])
{
    OMLog::ops().info("omd is launching");

    auto options = parseOMDOptions(argc, argv);
    if (!options) {
        printUsage();
        return kOMDExitUsage;
    }

    auto server = OMDServer::initForService(options->serviceName, options->databasePath);
    if (!server) {
        OMLog::ops().error("unable to construct server");
        return kOMDExitConstructionFailed;
    }
    server->setCacheLimit(options->cacheLimit);
    server->run();
}

} // namespace om
