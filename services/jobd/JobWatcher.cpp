#include "services/jobd/JobWatcher.h"

#include <sys/epoll.h>
#include <sys/eventfd.h>

#include <algorithm>
#include <cerrno>
#include <vector>

#include "platform/PollTimeout.h"

namespace om {

namespace {

constexpr uint64_t kWakeKey = 0;
constexpr int kEventsPerRound = 32;

} // namespace

Result<std::shared_ptr<JobWatcher>> JobWatcher::create(std::shared_ptr<WorkQueue> queue)
{
    UniqueFd epoll(::epoll_create1(EPOLL_CLOEXEC));
    if (!epoll.valid())
        return OMError::fromErrno("epoll_create1", errno);
    UniqueFd wake(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    if (!wake.valid())
        return OMError::fromErrno("eventfd", errno);
    epoll_event event {};
    event.events = EPOLLIN;
    event.data.u64 = kWakeKey;
    if (::epoll_ctl(epoll.get(), EPOLL_CTL_ADD, wake.get(), &event) < 0)
        return OMError::fromErrno("epoll_ctl", errno);
    return std::shared_ptr<JobWatcher>(new JobWatcher(std::move(queue), std::move(epoll), std::move(wake)));
}

JobWatcher::JobWatcher(std::shared_ptr<WorkQueue> queue, UniqueFd epoll, UniqueFd wake)
    : m_queue(std::move(queue))
    , m_epoll(std::move(epoll))
    , m_wake(std::move(wake))
{
    m_thread = std::thread([this] { loop(); });
}

JobWatcher::~JobWatcher()
{
    {
        std::lock_guard lock(m_mutex);
        m_stopping = true;
    }
    const uint64_t one = 1;
    (void)!::write(m_wake.get(), &one, sizeof one);
    m_thread.join();
}

uint64_t JobWatcher::watch(int pidfd, std::function<void()> handler)
{
    std::lock_guard lock(m_mutex);
    const uint64_t key = ++m_lastKey;
    epoll_event event {};
    event.events = EPOLLIN | EPOLLONESHOT;
    event.data.u64 = key;
    if (::epoll_ctl(m_epoll.get(), EPOLL_CTL_ADD, pidfd, &event) < 0)
        return 0;
    m_handlers.emplace(key, std::move(handler));
    return key;
}

void JobWatcher::unwatch(int pidfd, uint64_t key)
{
    std::lock_guard lock(m_mutex);
    if (m_handlers.erase(key) > 0)
        (void)::epoll_ctl(m_epoll.get(), EPOLL_CTL_DEL, pidfd, nullptr);
}

void JobWatcher::after(std::chrono::milliseconds delay, std::function<void()> work)
{
    {
        std::lock_guard lock(m_mutex);
        m_timers.emplace(std::chrono::steady_clock::now() + delay, std::move(work));
    }
    const uint64_t one = 1;
    (void)!::write(m_wake.get(), &one, sizeof one);
}

// Milliseconds to the earliest timer, rounded up; -1 without timers. Under m_mutex.
int JobWatcher::timeout()
{
    return m_timers.empty() ? -1 : pollTimeoutUntil(m_timers.begin()->first);
}

void JobWatcher::loop()
{
    epoll_event events[kEventsPerRound];
    for (;;) {
        int wait;
        {
            std::lock_guard lock(m_mutex);
            if (m_stopping)
                return;
            wait = timeout();
        }
        const int count = ::epoll_wait(m_epoll.get(), events, kEventsPerRound, wait);
        if (count < 0 && errno != EINTR)
            return;
        std::vector<std::function<void()>> due;
        std::lock_guard lock(m_mutex);
        for (int i = 0; i < count; ++i) {
            if (events[i].data.u64 == kWakeKey) {
                uint64_t ignored;
                (void)!::read(m_wake.get(), &ignored, sizeof ignored);
                continue;
            }
            // One-shot: the registration stays disarmed until unwatch() deletes it.
            if (auto found = m_handlers.find(events[i].data.u64); found != m_handlers.end()) {
                due.push_back(std::move(found->second));
                m_handlers.erase(found);
            }
        }
        const auto now = std::chrono::steady_clock::now();
        while (!m_timers.empty() && m_timers.begin()->first <= now) {
            due.push_back(std::move(m_timers.begin()->second));
            m_timers.erase(m_timers.begin());
        }
        for (auto& work : due)
            m_queue->async(std::move(work));
    }
}

} // namespace om
