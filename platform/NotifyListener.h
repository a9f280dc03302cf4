// NotifyListener: receives named notifications (see Notify) until it is destroyed.
//
// Each listener has its own bus connection and a thread that reads it; the bus filters by name
// (a match rule on arg0), and every notification received is handed to the handler on the given
// queue, in the order the bus delivered them. Notifications posted after create() returns are
// received: the match rules are in place on the bus by then. When the bus goes away the listener
// logs it once at error level and receives nothing more; a new listener is needed.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <unordered_set>
#include <vector>

#include "platform/Notify.h"
#include "platform/Result.h"
#include "platform/UniqueFd.h"
#include "platform/WorkQueue.h"

namespace om {

class NotifyListener {
public:
    using Handler = std::function<void(const std::string& name)>;

    // A bus allows a connection only so many match rules; one listener stays well below that.
    static constexpr size_t kMaxNames = 64;

    // Fails when a name is not valid (Notify::isValidName), there are no names or more than
    // kMaxNames, or the bus cannot be reached or refuses the subscription.
    static Result<std::unique_ptr<NotifyListener>> create(
        std::string name, std::shared_ptr<WorkQueue> queue, Handler handler);
    static Result<std::unique_ptr<NotifyListener>> create(
        std::vector<std::string> names, std::shared_ptr<WorkQueue> queue, Handler handler);

    // Once this returns the handler is not running and is not called again. The handler may
    // destroy its own listener.
    ~NotifyListener();
    NotifyListener(const NotifyListener&) = delete;
    NotifyListener& operator=(const NotifyListener&) = delete;

private:
    // What a queued delivery needs; it may outlive the listener, and then delivers nothing.
    struct Delivery {
        std::shared_ptr<WorkQueue> queue;
        Handler handler;
        std::atomic<bool> cancelled { false };
        std::mutex running; // held while the handler runs
    };

    NotifyListener(
        NotifyBus bus, UniqueFd stop, std::unordered_set<std::string> names, std::shared_ptr<Delivery> delivery);
    Result<void> subscribe();
    void run();
    // On m_thread, for each notification the bus delivers.
    void received(const char* name);

    NotifyBus m_bus; // used by m_thread only, once it runs
    UniqueFd m_stop; // an eventfd: readable when the thread is to end
    const std::unordered_set<std::string> m_names;
    const std::shared_ptr<Delivery> m_delivery;
    std::thread m_thread;
};

} // namespace om
