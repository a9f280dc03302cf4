// Named notifications: system-wide "something changed" signals that carry nothing but a name.
//
// A notification is the D-Bus signal com.orvex.Notify.Posted on /com/orvex/notify with one string
// argument, its name, on the session bus when DBUS_SESSION_BUS_ADDRESS is set or the process is
// not root, else on the system bus. Listeners (NotifyListener) subscribe by name with a match rule
// on arg0.
//
// post() never blocks its caller: it hands the name to one poster queue that owns the connection
// (opened on first use, and again after a failure), emits the signal and flushes. Posts leave in
// the order they were made. A kept connection whose bus has gone since is replaced once for the
// post that finds it dead; otherwise, without a reachable bus, a post is logged at debug level
// and dropped, and nothing is retried. The queue is bounded: when kMaxPending names wait (a bus
// that stopped reading), a name already waiting is not queued again, since its one signal still
// tells listeners what changed, and any other name is dropped with an error log line.
#pragma once

#include <cstddef>
#include <deque>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <unordered_map>

#include "platform/Result.h"
#include "platform/WorkQueue.h"

struct sd_bus;

namespace om {

struct NotifyBusRelease {
    void operator()(sd_bus* bus) const;
};
// A connection to the bus that notifications travel on.
using NotifyBus = std::unique_ptr<sd_bus, NotifyBusRelease>;

class Notify {
public:
    static constexpr const char* kObjectPath = "/com/orvex/notify";
    static constexpr const char* kInterface = "com.orvex.Notify";
    static constexpr const char* kMember = "Posted";

    static constexpr size_t kMaxNameLength = 255;
    static constexpr size_t kMaxPending = 1024;

    // 1 to kMaxNameLength printable ASCII characters, without space, quote or backslash (so that a
    // name is a match-rule value as it stands).
    static bool isValidName(std::string_view name);

    // Queues the notification and returns. An invalid name is logged at error level and dropped.
    static void post(std::string_view name);
    // Blocks until every notification posted before the call has been emitted or given up.
    static void flush();

    // Opens a new connection to the notification bus: session or system, as above.
    static Result<NotifyBus> openBus();

private:
    Notify();
    static Notify& shared();

    void enqueue(std::string_view name);
    // On m_queue: emits what waits, oldest first, until nothing does.
    void drain();
    void deliver(const std::string& name);

    const std::shared_ptr<WorkQueue> m_queue;
    std::mutex m_mutex; // guards the members up to m_bus
    std::deque<std::string> m_pending;
    std::unordered_map<std::string, size_t> m_pendingCounts; // how often each name waits in m_pending
    bool m_draining = false; // a drain() is queued or running
    bool m_overflowLogged = false; // the current overflow has been logged
    NotifyBus m_bus; // used on m_queue only
};

} // namespace om
