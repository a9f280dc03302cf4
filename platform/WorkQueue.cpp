#include "platform/WorkQueue.h"

#include <pthread.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <optional>
#include <vector>

#include "platform/Fatal.h"

namespace om {

namespace {

// The queues the calling thread is on: its own queue for a queue thread, plus every queue it holds
// through sync(). Nested sync into another queue pushes a second entry.
thread_local std::vector<const WorkQueue*> t_currentQueues;

// Guards every queue's holder and every thread's wait, so that one thread's check of the chain
// sees a picture no other thread changes under it. sync() takes it a few times per call; async()
// and the running of items never do.
std::mutex& cycleCheckMutex()
{
    static std::mutex mutex;
    return mutex;
}

// Longer chains than this are not followed: a cycle among other threads is theirs to find.
constexpr size_t kLongestChain = 256;

// Set by ~WorkQueue when the last reference was dropped on the queue's own thread: what was still
// queued, to be run by that thread after it has left every member of the dead queue behind.
thread_local std::optional<std::deque<std::function<void()>>> t_orphanedItems;

// The handshake of one sync() call. Shared with the barrier item, which may still be waking up on
// the queue thread when the caller returns.
struct SyncBarrier {
    std::mutex mutex;
    std::condition_variable changed;
    bool held = false;
    bool released = false;

    // Runs on the queue thread: everything queued earlier has run; park until the caller is done.
    void holdQueue()
    {
        std::unique_lock lock(mutex);
        held = true;
        changed.notify_all();
        changed.wait(lock, [this] { return released; });
    }
    void waitUntilHeld()
    {
        std::unique_lock lock(mutex);
        changed.wait(lock, [this] { return held; });
    }
    void release()
    {
        std::lock_guard lock(mutex);
        released = true;
        changed.notify_all();
    }
};

int niceValue(QualityOfService qos, int relativePriority)
{
    int base = 0;
    switch (qos) {
    case QualityOfService::Background:
        base = 10;
        break;
    case QualityOfService::Utility:
        base = 5;
        break;
    case QualityOfService::Default:
        base = 0;
        break;
    case QualityOfService::UserInitiated:
        base = -5;
        break;
    case QualityOfService::UserInteractive:
        base = -10;
        break;
    }
    // A relative priority lowers the thread within its class: -15 (lowest) ... 0.
    relativePriority = std::clamp(relativePriority, -15, 0);
    return base - relativePriority / 3;
}

// Without CAP_SYS_NICE a thread may not go below 20 - RLIMIT_NICE, nor below where it already is.
int clampToPermitted(int nice)
{
    errno = 0;
    int current = ::getpriority(PRIO_PROCESS, static_cast<id_t>(::gettid()));
    if (current == -1 && errno != 0)
        current = 0;
    struct rlimit limit;
    int floor = -20;
    if (::getrlimit(RLIMIT_NICE, &limit) == 0 && limit.rlim_cur != RLIM_INFINITY)
        floor = 20 - static_cast<int>(std::min<rlim_t>(limit.rlim_cur, 40));
    return std::clamp(nice, std::min(floor, current), 19);
}

void applyThreadAttributes(const std::string& label, QualityOfService qos, int relativePriority)
{
    // The kernel keeps 15 bytes of a thread name.
    std::string name = label.substr(0, 15);
    (void)::pthread_setname_np(::pthread_self(), name.c_str());

    int nice = clampToPermitted(niceValue(qos, relativePriority));
    // Privilege can still be missing (a container without CAP_SYS_NICE): the queue then keeps the
    // inherited priority, which changes its speed, never its behaviour.
    (void)::setpriority(PRIO_PROCESS, static_cast<id_t>(::gettid()), nice);
}

void runOrphans(std::deque<std::function<void()>> items)
{
    while (!items.empty()) {
        auto item = std::move(items.front());
        items.pop_front();
        item();
    }
}

} // namespace

std::shared_ptr<WorkQueue> WorkQueue::create(std::string label, QualityOfService qos, int relativePriority)
{
    return std::shared_ptr<WorkQueue>(new WorkQueue(std::move(label), qos, relativePriority));
}

WorkQueue::WorkQueue(std::string label, QualityOfService qos, int relativePriority)
    : m_label(std::move(label))
    , m_qos(qos)
    , m_relativePriority(relativePriority)
{
    m_thread = std::thread([this] { run(); });
}

WorkQueue::~WorkQueue()
{
    if (std::this_thread::get_id() == m_thread.get_id()) {
        // One of our own items dropped the last reference. This thread cannot join itself: it
        // runs what is left once the current item returns, without this object, and then ends.
        std::lock_guard lock(m_mutex);
        t_orphanedItems.emplace(std::move(m_items));
        std::erase(t_currentQueues, this);
        m_thread.detach();
        return;
    }
    {
        std::lock_guard lock(m_mutex);
        m_stopping = true;
        m_wake.notify_all();
    }
    m_thread.join();
}

void WorkQueue::async(std::function<void()> work)
{
    // Once the item is visible the queue thread may run it, and if the item drops the last
    // reference this queue could be destroyed before notify touches m_wake. A reference held across
    // the notify lets it happen after unlocking, so the woken thread does not block on our mutex.
    auto protect = weak_from_this().lock();
    std::unique_lock lock(m_mutex);
    m_items.push_back(std::move(work));
    if (!protect) {
        m_wake.notify_one(); // not shared (yet): notify under the lock, as nothing can free us
        return;
    }
    lock.unlock();
    m_wake.notify_one();
}

struct WorkQueue::Thread {
    const WorkQueue* waitingFor = nullptr;
};

WorkQueue::Thread& WorkQueue::currentThread()
{
    thread_local Thread thread;
    return thread;
}

std::vector<const WorkQueue*> WorkQueue::cycleFromCaller() const
{
    const Thread* caller = &currentThread();
    std::vector<const WorkQueue*> chain { this };
    for (const WorkQueue* queue = this; chain.size() <= kLongestChain;) {
        const Thread* holder = queue->m_syncHolder ? queue->m_syncHolder : queue->m_ownThread;
        if (holder == caller)
            return chain;
        if (!holder || !holder->waitingFor)
            return {};
        queue = holder->waitingFor;
        chain.push_back(queue);
    }
    return {};
}

// Aborts naming the queue the caller holds, as for a direct re-entry, and how waiting for this
// queue would lead back to it.
void WorkQueue::refuseCycle() const
{
    std::vector<const WorkQueue*> chain;
    {
        std::lock_guard lock(cycleCheckMutex());
        chain = cycleFromCaller();
        if (chain.empty()) {
            currentThread().waitingFor = this;
            return;
        }
    }
    std::string through;
    for (size_t i = 0; i + 1 < chain.size(); ++i)
        through += (through.empty() ? "" : ", ") + ("\"" + chain[i]->m_label + "\"");
    internalInconsistency("sync onto work queue \"" + chain.back()->m_label
        + "\" from code already running on it (through " + through + ")");
}

void WorkQueue::sync(const std::function<void()>& work)
{
    if (isCurrent())
        internalInconsistency("sync onto work queue \"" + m_label + "\" from code already running on it");
    auto protect = shared_from_this(); // the closure may drop the caller's reference to this queue
    refuseCycle(); // from here on, the caller is recorded as waiting for this queue

    // An idle queue is taken on the spot: nothing queued earlier is left to run, and the queue's
    // thread, asleep, is told to start nothing until the caller is done. Otherwise a barrier item
    // waits its turn and parks the thread while the caller runs.
    std::shared_ptr<SyncBarrier> barrier;
    {
        std::lock_guard lock(m_mutex);
        if (m_running || m_heldBySync || !m_items.empty())
            barrier = std::make_shared<SyncBarrier>();
        else
            m_heldBySync = true;
    }
    if (barrier) {
        async([barrier] { barrier->holdQueue(); });
        barrier->waitUntilHeld();
    }

    struct Hold {
        WorkQueue* queue;
        SyncBarrier* barrier;
        Hold(WorkQueue* q, SyncBarrier* b)
            : queue(q)
            , barrier(b)
        {
            {
                std::lock_guard lock(cycleCheckMutex());
                currentThread().waitingFor = nullptr;
                queue->m_syncHolder = &currentThread();
            }
            t_currentQueues.push_back(queue);
        }
        ~Hold()
        {
            t_currentQueues.pop_back();
            {
                std::lock_guard lock(cycleCheckMutex());
                queue->m_syncHolder = nullptr;
            }
            if (barrier) {
                barrier->release();
                return;
            }
            bool wake;
            {
                std::lock_guard lock(queue->m_mutex);
                queue->m_heldBySync = false;
                wake = !queue->m_items.empty();
            }
            if (wake)
                queue->m_wake.notify_one();
        }
    } hold(this, barrier.get());
    work();
}

bool WorkQueue::isCurrent() const
{
    return std::find(t_currentQueues.begin(), t_currentQueues.end(), this) != t_currentQueues.end();
}

void WorkQueue::assertCurrent() const
{
    if (!isCurrent())
        internalInconsistency("expected to run on work queue \"" + m_label + "\"");
}

void WorkQueue::assertNotCurrent() const
{
    if (isCurrent())
        internalInconsistency("must not run on work queue \"" + m_label + "\"");
}

void WorkQueue::run()
{
    applyThreadAttributes(m_label, m_qos, m_relativePriority);
    t_currentQueues.push_back(this);
    {
        std::lock_guard lock(cycleCheckMutex());
        m_ownThread = &currentThread();
    }
    for (;;) {
        std::function<void()> item;
        {
            std::unique_lock lock(m_mutex);
            m_wake.wait(lock, [this] { return m_stopping || (!m_items.empty() && !m_heldBySync); });
            if (m_items.empty())
                break;
            item = std::move(m_items.front());
            m_items.pop_front();
            m_running = true;
        }
        item();
        item = nullptr; // may release the last reference to this queue
        if (t_orphanedItems) {
            // This queue is gone: touch no member from here on.
            auto orphans = std::move(*t_orphanedItems);
            t_orphanedItems.reset();
            runOrphans(std::move(orphans));
            return;
        }
        std::lock_guard lock(m_mutex);
        m_running = false;
    }
    t_currentQueues.pop_back();
}

} // namespace om
