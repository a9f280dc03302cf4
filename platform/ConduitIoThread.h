// The transport's one I/O thread: an epoll loop that owns every Conduit socket of the process.
//
// Sources (connections, listeners, the SIGTERM signalfd) are registered by descriptor; each
// registration gets a key that carries a generation, so that an event queued for a descriptor
// that was closed and reused in the same round is recognised as stale and dropped. The registry
// holds each source strongly until it is removed. Work from other threads reaches the loop
// through post(), which wakes it with an eventfd. Timers need no descriptor of their own: the
// loop's wait times out for the earliest one, so they work while the process is out of
// descriptors, which is when the listener needs them.
//
// The thread starts on first use and is never stopped or destroyed: it may be the thread that
// calls exit(), and nothing may run its destructor under it.
//
// It also keeps the process-wide termination state: the peer connections that hear "termination
// imminent" on SIGTERM, and the count of open KeepAlive units that hold the exit back.
#pragma once

#include <sys/epoll.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <thread>
#include <unordered_map>
#include <vector>

#include "platform/Log.h"
#include "platform/UniqueFd.h"

namespace om {

class ConduitConnection;

class ConduitIoThread {
public:
    class Source {
    public:
        virtual ~Source() = default;
        // On the I/O thread, with the epoll event bits. Events are hints: a handler reads or
        // writes until EAGAIN and never trusts a bit alone.
        virtual void handleEvents(uint32_t events) = 0;
    };

    static ConduitIoThread& shared();
    // The transport's log handle (category "conduit").
    static const Log& log();

    bool isCurrent() const { return std::this_thread::get_id() == m_threadId; }
    // Runs work on the I/O thread, after the events of the current round.
    void post(std::function<void()> work);
    // Runs work now when already on the I/O thread, otherwise posts it.
    void run(std::function<void()> work);

    // I/O thread only. Returns the key that modify() needs.
    uint64_t add(int fd, uint32_t events, std::shared_ptr<Source> source);
    void remove(int fd, uint64_t key);
    // Any thread, for a descriptor still registered under key.
    void modify(int fd, uint64_t key, uint32_t events);

    // I/O thread only. Runs work on the I/O thread once delay has passed.
    void after(std::chrono::milliseconds delay, std::function<void()> work);
    // I/O thread only. Runs work (posted) the next time the transport closes one of its sockets.
    void whenDescriptorFreed(std::function<void()> work);
    // I/O thread only: a socket of the transport was just closed.
    void descriptorFreed();

    // Peer connections: those accepted by a listener of this process.
    void addPeer(const std::shared_ptr<ConduitConnection>& connection);

    // Installs the SIGTERM signalfd. SIGTERM must already be blocked in every thread.
    void exitOnTermination();
    static void keepAliveOpened();
    static void keepAliveClosed();

private:
    ConduitIoThread();
    void loop();
    int waitTimeout() const;
    void runPosted();
    void runDueTimers();
    void terminate();
    void exitWhenIdle();

    struct Registration {
        uint64_t key;
        std::shared_ptr<Source> source;
    };

    UniqueFd m_epoll;
    UniqueFd m_wake; // eventfd
    std::thread::id m_threadId;

    // I/O thread only.
    std::unordered_map<int, Registration> m_sources;
    uint32_t m_generation = 0;
    bool m_terminating = false;
    std::multimap<std::chrono::steady_clock::time_point, std::function<void()>> m_timers;
    std::vector<std::function<void()>> m_descriptorWaiters;

    std::mutex m_postedMutex;
    std::vector<std::function<void()>> m_posted;
    bool m_wakePending = false;

    std::mutex m_peersMutex;
    std::vector<std::weak_ptr<ConduitConnection>> m_peers;
    size_t m_peersPruneAt = 64;

    static std::atomic<int64_t> s_keepAlives;
    static std::atomic<bool> s_terminating;
};

} // namespace om
