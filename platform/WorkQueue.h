// Serial work queue: runs closures one at a time, in submission order, on its own thread.
//
// sync() runs the closure on the calling thread while holding the queue: it waits until everything
// queued before it has run, keeps the queue from starting anything else, and marks the queue as
// current on the calling thread for the duration. Entering a queue synchronously from code already
// running on it would deadlock, so sync() asserts that it does not, however indirectly: a queue is
// held by the thread running its item or by the caller of sync() holding it, and a thread waits in
// sync() for at most one queue; before it waits, sync() follows "held by a thread that waits for"
// from the queue it wants, across threads, and aborts when the chain ends at a queue the caller
// holds. The daemon's lock-order rule is thereby a checked assertion rather than a hope.
//
// The quality-of-service class maps to the thread's nice value (user-interactive -10 ... background
// 10, clamped to what the process may set).
#pragma once

#include <condition_variable>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace om {

enum class QualityOfService : uint8_t { Background, Utility, Default, UserInitiated, UserInteractive };

class WorkQueue : public std::enable_shared_from_this<WorkQueue> {
public:
    static std::shared_ptr<WorkQueue> create(
        std::string label, QualityOfService qos = QualityOfService::Default, int relativePriority = 0);
    ~WorkQueue(); // runs what is queued, then joins the thread

    WorkQueue(const WorkQueue&) = delete;
    WorkQueue& operator=(const WorkQueue&) = delete;

    void async(std::function<void()> work);
    void sync(const std::function<void()>& work);

    const std::string& label() const { return m_label; }
    QualityOfService qualityOfService() const { return m_qos; }
    bool isCurrent() const;
    void assertCurrent() const;
    void assertNotCurrent() const;

private:
    struct Thread; // what one thread waits for, for the cycle check

    WorkQueue(std::string label, QualityOfService qos, int relativePriority);
    void run();
    static Thread& currentThread();
    // Under the cycle check's lock: the queues from this one to a queue the calling thread holds,
    // following holders and what they wait for; empty when the chain ends elsewhere.
    std::vector<const WorkQueue*> cycleFromCaller() const;
    void refuseCycle() const;

    const std::string m_label;
    const QualityOfService m_qos;
    const int m_relativePriority;
    mutable std::mutex m_mutex;
    std::condition_variable m_wake;
    std::deque<std::function<void()>> m_items;
    bool m_stopping = false;
    // Guarded by m_mutex. An item is running on the queue's thread; a caller of sync() holds the
    // queue without the thread's help (it found the queue idle), so the thread starts nothing.
    bool m_running = false;
    bool m_heldBySync = false;
    std::thread m_thread;
    // Guarded by the cycle check's lock. The holder is the caller of sync() while it holds the
    // queue, else the queue's own thread (which waits for nothing while it is idle).
    Thread* m_syncHolder = nullptr;
    Thread* m_ownThread = nullptr;
};

} // namespace om
