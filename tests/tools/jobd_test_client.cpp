// A jobd client for tests that need the calls made by another process than the test's own, with
// or without the manager entitlement (the test entitles a copy of it with scripts/entitle):
//   jobd_test_client add PID EXECUTABLE OVERLAY.vlist [START]
//                                     exit status: jobd's status; START replaces the host's true
//                                     start time (a pid that names another process by now)
//   jobd_test_client remove IDENTIFIER VERSION           exit status: jobd's status
//   jobd_test_client busy IDENTIFIER...                  prints the number of busy instances
//   jobd_test_client launch TARGET                       exit status: jobd's status
// Exits 100 on bad usage.
#include <cstdio>
#include <cstdlib>
#include <set>
#include <string>

#include "platform/Assertions.h"
#include "platform/JobManager.h"
#include "platform/Vlist.h"

int main(int argc, char** argv)
{
    const std::string command = argc > 1 ? argv[1] : "";
    if (command == "add" && (argc == 5 || argc == 6)) {
        auto overlay = om::Vlist::readFile(argv[4]);
        if (!overlay.ok())
            return 100;
        if (argc == 5)
            return om::JobManagerAddService(pid_t(std::atoi(argv[2])), argv[3], overlay.value());
        auto reply = om::JobManagerCall(om::Value::dictionary({ { "request", "add" },
            { "pid", int64_t(std::atoi(argv[2])) }, { "start", uint64_t(std::strtoull(argv[5], nullptr, 10)) },
            { "path", argv[3] }, { "overlay", overlay.value() } }));
        return reply.ok() ? 0 : int(reply.error().code());
    }
    if (command == "remove" && argc == 4)
        return om::JobManagerRemoveService(argv[2], argv[3]);
    if (command == "busy" && argc >= 3) {
        auto busy = om::Assertions::busyInstances(std::set<std::string>(argv + 2, argv + argc));
        if (!busy.ok())
            return int(busy.error().code());
        std::printf("%zu\n", busy.value().size());
        return 0;
    }
    if (command == "launch" && argc == 3) {
        auto launched = om::JobManagerLaunch(argv[2]);
        return launched.ok() ? 0 : int(launched.error().code());
    }
    std::fprintf(stderr, "usage: jobd_test_client add|remove|busy|launch ...\n");
    return 100;
}
