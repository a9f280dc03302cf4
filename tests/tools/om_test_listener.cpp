// A listener on the message bus for end-to-end tests: subscribes to the notification named by
// argv[1], writes "ready" on standard error once the subscription is in place, then one line with
// the name per notification received, until it is killed.
//   om_test_listener NAME   exits 1 when the bus cannot be reached, 2 on bad usage
#include <unistd.h>

#include <cstdio>

#include "platform/NotifyListener.h"
#include "platform/WorkQueue.h"

int main(int argc, char** argv)
{
    if (argc != 2) {
        std::fprintf(stderr, "usage: om_test_listener NAME\n");
        return 2;
    }
    auto queue = om::WorkQueue::create("listener");
    auto listener = om::NotifyListener::create(argv[1], queue, [](const std::string& name) {
        std::fprintf(stderr, "%s\n", name.c_str());
        std::fflush(stderr);
    });
    if (!listener.ok()) {
        std::fprintf(stderr, "om_test_listener: %s\n", listener.error().localizedDescription().c_str());
        return 1;
    }
    std::fprintf(stderr, "ready\n");
    std::fflush(stderr);
    for (;;)
        ::pause();
}
