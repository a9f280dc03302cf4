// JobWatcher: one epoll thread that tells jobd when watched processes end (their pidfds become
// readable) and when timers are due. Every callback runs on the queue given at creation, so the
// daemon's state is only ever touched there.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <thread>
#include <unordered_map>

#include "platform/Result.h"
#include "platform/UniqueFd.h"
#include "platform/WorkQueue.h"

namespace om {

class JobWatcher {
public:
    static Result<std::shared_ptr<JobWatcher>> create(std::shared_ptr<WorkQueue> queue);
    ~JobWatcher();
    JobWatcher(const JobWatcher&) = delete;
    JobWatcher& operator=(const JobWatcher&) = delete;

    // Runs handler on the queue once, when the process behind pidfd has ended. The descriptor must
    // stay open until the handler has run or unwatch() was called. Returns 0 when epoll refuses it.
    uint64_t watch(int pidfd, std::function<void()> handler);
    // After it returns, the handler of key is not started any more (one already queued still runs,
    // so handlers look their subject up again).
    void unwatch(int pidfd, uint64_t key);
    // Runs work on the queue once delay has passed.
    void after(std::chrono::milliseconds delay, std::function<void()> work);

private:
    JobWatcher(std::shared_ptr<WorkQueue> queue, UniqueFd epoll, UniqueFd wake);
    void loop();
    int timeout();

    const std::shared_ptr<WorkQueue> m_queue;
    UniqueFd m_epoll;
    UniqueFd m_wake; // eventfd: a new timer or stop
    std::mutex m_mutex;
    uint64_t m_lastKey = 0;
    bool m_stopping = false;
    std::unordered_map<uint64_t, std::function<void()>> m_handlers;
    std::multimap<std::chrono::steady_clock::time_point, std::function<void()>> m_timers;
    std::thread m_thread;
};

} // namespace om
