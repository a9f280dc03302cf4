#include "platform/ConduitIoThread.h"

#include <pthread.h>
#include <signal.h>
#include <sys/eventfd.h>
#include <sys/signalfd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <utility>

#include "platform/ConduitConnectionState.h"
#include "platform/Fatal.h"
#include "platform/PollTimeout.h"

namespace om {

namespace {

constexpr uint64_t kWakeKey = 0;
constexpr int kEventsPerRound = 64;

uint64_t makeKey(uint32_t generation, int fd)
{
    return uint64_t(generation) << 32 | uint32_t(fd);
}

int fdOfKey(uint64_t key)
{
    return int(uint32_t(key));
}

// Reads the signalfd and starts the termination sequence on SIGTERM.
class TerminationSignal final : public ConduitIoThread::Source {
public:
    TerminationSignal(UniqueFd fd, std::function<void()> onTerminate)
        : m_fd(std::move(fd))
        , m_onTerminate(std::move(onTerminate))
    {
    }
    void handleEvents(uint32_t) override
    {
        signalfd_siginfo info;
        bool terminate = false;
        while (::read(m_fd.get(), &info, sizeof info) == ssize_t(sizeof info))
            terminate = terminate || info.ssi_signo == SIGTERM;
        if (terminate)
            m_onTerminate();
    }
    int fd() const { return m_fd.get(); }

private:
    UniqueFd m_fd;
    std::function<void()> m_onTerminate;
};

} // namespace

std::atomic<int64_t> ConduitIoThread::s_keepAlives { 0 };
std::atomic<bool> ConduitIoThread::s_terminating { false };

ConduitIoThread& ConduitIoThread::shared()
{
    // Leaked on purpose: exit() may run on this very thread, and static destructors must not
    // join or free it under its own feet.
    static ConduitIoThread* thread = new ConduitIoThread;
    return *thread;
}

const Log& ConduitIoThread::log()
{
    static const Log* log = [] {
        auto created = Log::create("com.orvex.platform", "conduit");
        return created.ok() ? new Log(*created.value()) : &Log::defaultLog();
    }();
    return *log;
}

ConduitIoThread::ConduitIoThread()
    : m_epoll(::epoll_create1(EPOLL_CLOEXEC))
    , m_wake(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK))
{
    if (!m_epoll.valid() || !m_wake.valid())
        internalInconsistency(
            std::string("conduit I/O thread: cannot create epoll or eventfd: ") + OMError::errnoDescription(errno));
    epoll_event event {};
    event.events = EPOLLIN;
    event.data.u64 = kWakeKey;
    if (::epoll_ctl(m_epoll.get(), EPOLL_CTL_ADD, m_wake.get(), &event) < 0)
        internalInconsistency(std::string("conduit I/O thread: epoll_ctl: ") + OMError::errnoDescription(errno));

    // The thread is born with SIGTERM blocked, so that it never takes the signal's default action
    // in place of the signalfd, whenever exitOnTermination() is called.
    sigset_t blocked;
    sigset_t previous;
    sigemptyset(&blocked);
    sigaddset(&blocked, SIGTERM);
    ::pthread_sigmask(SIG_BLOCK, &blocked, &previous);
    std::thread thread([this] { loop(); });
    ::pthread_sigmask(SIG_SETMASK, &previous, nullptr);
    m_threadId = thread.get_id();
    thread.detach();
}

void ConduitIoThread::post(std::function<void()> work)
{
    std::lock_guard lock(m_postedMutex);
    m_posted.push_back(std::move(work));
    if (m_wakePending)
        return;
    m_wakePending = true;
    const uint64_t one = 1;
    // The eventfd counter cannot overflow at one write per drain; a failure here is impossible.
    (void)!::write(m_wake.get(), &one, sizeof one);
}

void ConduitIoThread::run(std::function<void()> work)
{
    if (isCurrent())
        work();
    else
        post(std::move(work));
}

uint64_t ConduitIoThread::add(int fd, uint32_t events, std::shared_ptr<Source> source)
{
    if (++m_generation == 0)
        m_generation = 1; // key 0 is the wake eventfd's
    const uint64_t key = makeKey(m_generation, fd);
    epoll_event event {};
    event.events = events;
    event.data.u64 = key;
    if (::epoll_ctl(m_epoll.get(), EPOLL_CTL_ADD, fd, &event) < 0) {
        log().error("epoll_ctl(ADD) of descriptor %d: %s", fd, OMError::errnoDescription(errno));
        return 0;
    }
    m_sources[fd] = Registration { key, std::move(source) };
    return key;
}

void ConduitIoThread::remove(int fd, uint64_t key)
{
    auto found = m_sources.find(fd);
    if (found == m_sources.end() || found->second.key != key)
        return;
    (void)::epoll_ctl(m_epoll.get(), EPOLL_CTL_DEL, fd, nullptr); // fails only for a closed fd
    // The caller keeps its source alive while it runs; this may still be the registry's last
    // reference for sources removed from posted work.
    auto source = std::move(found->second.source);
    m_sources.erase(found);
}

void ConduitIoThread::after(std::chrono::milliseconds delay, std::function<void()> work)
{
    m_timers.emplace(std::chrono::steady_clock::now() + delay, std::move(work));
}

void ConduitIoThread::whenDescriptorFreed(std::function<void()> work)
{
    m_descriptorWaiters.push_back(std::move(work));
}

void ConduitIoThread::descriptorFreed()
{
    // Posted: the caller is closing a connection inside its own event handler.
    for (auto& work : std::exchange(m_descriptorWaiters, {}))
        post(std::move(work));
}

void ConduitIoThread::modify(int fd, uint64_t key, uint32_t events)
{
    epoll_event event {};
    event.events = events;
    event.data.u64 = key;
    if (::epoll_ctl(m_epoll.get(), EPOLL_CTL_MOD, fd, &event) < 0)
        log().error("epoll_ctl(MOD) of descriptor %d: %s", fd, OMError::errnoDescription(errno));
}

void ConduitIoThread::loop()
{
    epoll_event events[kEventsPerRound];
    for (;;) {
        const int count = ::epoll_wait(m_epoll.get(), events, kEventsPerRound, waitTimeout());
        if (count < 0) {
            if (errno == EINTR)
                continue;
            internalInconsistency(std::string("conduit I/O thread: epoll_wait: ") + OMError::errnoDescription(errno));
        }
        bool woken = false;
        for (int i = 0; i < count; ++i) {
            const uint64_t key = events[i].data.u64;
            if (key == kWakeKey) {
                woken = true; // runPosted() below drains it
                continue;
            }
            auto found = m_sources.find(fdOfKey(key));
            if (found == m_sources.end() || found->second.key != key)
                continue; // removed (and perhaps reused) earlier in this round
            auto source = found->second.source; // a handler may remove its own registration
            source->handleEvents(events[i].events);
        }
        // Posted work always writes the eventfd (see post()), so a round without the wake event
        // has nothing posted; skipping the drain saves a read(2) per request.
        if (woken)
            runPosted();
        runDueTimers();
    }
}

// Milliseconds until the earliest timer, rounded up so that the loop never wakes just before it
// and spins through zero timeouts; -1 (forever) without timers.
int ConduitIoThread::waitTimeout() const
{
    return m_timers.empty() ? -1 : pollTimeoutUntil(m_timers.begin()->first);
}

void ConduitIoThread::runDueTimers()
{
    const auto now = std::chrono::steady_clock::now();
    while (!m_timers.empty() && m_timers.begin()->first <= now) {
        auto work = std::move(m_timers.begin()->second);
        m_timers.erase(m_timers.begin());
        work();
    }
}

void ConduitIoThread::runPosted()
{
    // Drain the eventfd before taking the list: a post that lands after the swap writes it anew.
    uint64_t ignored;
    (void)!::read(m_wake.get(), &ignored, sizeof ignored);
    std::vector<std::function<void()>> work;
    {
        std::lock_guard lock(m_postedMutex);
        work.swap(m_posted);
        m_wakePending = false;
    }
    for (auto& item : work)
        item();
}

void ConduitIoThread::addPeer(const std::shared_ptr<ConduitConnection>& connection)
{
    std::lock_guard lock(m_peersMutex);
    if (m_peers.size() >= m_peersPruneAt) {
        std::erase_if(m_peers, [](const auto& peer) { return peer.expired(); });
        m_peersPruneAt = std::max<size_t>(64, m_peers.size() * 2);
    }
    m_peers.push_back(connection);
}

void ConduitIoThread::exitOnTermination()
{
    sigset_t signals;
    sigemptyset(&signals);
    sigaddset(&signals, SIGTERM);
    UniqueFd fd(::signalfd(-1, &signals, SFD_CLOEXEC | SFD_NONBLOCK));
    if (!fd.valid()) {
        log().error("signalfd: %s; SIGTERM keeps its default action", OMError::errnoDescription(errno));
        return;
    }
    auto source = std::make_shared<TerminationSignal>(std::move(fd), [this] { terminate(); });
    post([this, source] {
        if (add(source->fd(), EPOLLIN, source) == 0)
            log().error("cannot watch for SIGTERM; it keeps its default action");
    });
}

void ConduitIoThread::terminate()
{
    if (m_terminating)
        return;
    m_terminating = true;
    s_terminating.store(true);
    std::vector<std::weak_ptr<ConduitConnection>> peers;
    {
        std::lock_guard lock(m_peersMutex);
        peers = m_peers;
    }
    log().info("SIGTERM: telling %u peer connections that termination is imminent", unsigned(peers.size()));
    for (const auto& weak : peers) {
        if (auto peer = weak.lock())
            peer->m_state->terminationImminent();
    }
    exitWhenIdle();
}

void ConduitIoThread::exitWhenIdle()
{
    // Every other thread is idle or blocked by now: nothing races the static destructors.
    if (s_keepAlives.load() == 0)
        std::exit(0); // NOLINT(concurrency-mt-unsafe)
}

void ConduitIoThread::keepAliveOpened()
{
    s_keepAlives.fetch_add(1);
}

void ConduitIoThread::keepAliveClosed()
{
    if (s_keepAlives.fetch_sub(1) == 1 && s_terminating.load())
        shared().post([] { shared().exitWhenIdle(); });
}

} // namespace om
