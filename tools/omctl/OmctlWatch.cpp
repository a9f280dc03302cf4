#include "tools/omctl/OmctlWatch.h"

#include <signal.h>

#include <chrono>
#include <ostream>

#include "platform/Format.h"
#include "platform/NotifyListener.h"
#include "tools/omctl/OmctlJson.h"

namespace om {

const char* const OmctlWatch::kHelp = R"(usage: omctl [--json] watch

Subscribes to omd's notification com.orvex.ombrel.annotation-change and prints
one line for each as it arrives: the time it arrived (UTC) and its name. omd
posts it when elections or other annotations change and when holds come and
go; hosts then run discovery again. Stops at SIGINT (Ctrl-C) or SIGTERM and
exits 0. Once subscribed it says so on standard error.

The notification travels on the session bus (DBUS_SESSION_BUS_ADDRESS) when one
is set or omctl does not run as root, else on the system bus: run watch on the
bus omd posts on. --json prints each notification as a one-line JSON object.
)";

int OmctlWatch::watch(OmctlContext& context, const std::vector<std::string>& arguments)
{
    if (!arguments.empty())
        return context.usage("watch: unexpected argument " + arguments.front());

    // Blocked before the listener's threads exist, so that they inherit the mask and the signals
    // wait for sigwait below instead of ending the process.
    sigset_t stop;
    sigemptyset(&stop);
    sigaddset(&stop, SIGINT);
    sigaddset(&stop, SIGTERM);
    if (const int error = pthread_sigmask(SIG_BLOCK, &stop, nullptr); error != 0)
        return context.failure("watch", OMError::fromErrno("pthread_sigmask", error).localizedDescription());

    auto queue = WorkQueue::create("omctl-watch");
    const bool json = context.json();
    std::ostream& out = context.out();
    auto listener = NotifyListener::create(kAnnotationChange, queue, [json, &out](const std::string& name) {
        const auto now = std::chrono::floor<std::chrono::seconds>(std::chrono::system_clock::now());
        const auto seconds = static_cast<double>(now.time_since_epoch().count());
        if (json) {
            out << OmctlJson::write(
                Value::dictionary({ { "name", name }, { "time", Value::date(seconds) } }), OmctlJson::Layout::OneLine);
        } else {
            out << Value::dateText(seconds) << ' ' << name;
        }
        out << std::endl; // at once: a script reads the line as the notification arrives
    });
    if (!listener.ok())
        return context.failure("watch", listener.error().localizedDescription());
    context.err() << "omctl: watching " << kAnnotationChange << " (Ctrl-C stops)" << std::endl;

    int signal = 0;
    while (sigwait(&stop, &signal) != 0) { }
    // Destroying the listener waits for a handler that is running, so no line is cut short.
    listener.value().reset();
    queue->sync([] {});
    return kOmctlSuccess;
}

} // namespace om
