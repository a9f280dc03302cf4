#include "services/jobd/JobdMain.h"

#include <getopt.h>
#include <unistd.h>

#include "platform/Conduit.h"
#include "platform/RunLoop.h"
#include "services/jobd/JobServer.h"

namespace om {

std::optional<JobdOptions> parseJobdOptions(int argc, char* const argv[])
{
    JobdOptions options;
    optind = 0;
    opterr = 0;
    int option;
    // NOLINTNEXTLINE(concurrency-mt-unsafe): the command line is parsed once, on one thread.
    while ((option = ::getopt(argc, argv, "+S:")) != -1) {
        if (option != 'S')
            return std::nullopt;
        options.serviceName = optarg;
    }
    if (optind < argc || !Conduit::isValidServiceName(options.serviceName))
        return std::nullopt;
    return options;
}

int jobdMain(int argc, char* const argv[])
{
    auto options = parseJobdOptions(argc, argv);
    if (!options) {
        (void)!::write(STDERR_FILENO, kJobdUsageText.data(), kJobdUsageText.size());
        return kJobdExitUsage;
    }
    auto server = JobServer::create(options->serviceName);
    if (!server.ok()) {
        JobServer::log().error("cannot start jobd: %s", server.error().localizedDescription());
        return kJobdExitStartFailed;
    }
    server.value()->start();
    RunLoop::runForever();
}

} // namespace om
