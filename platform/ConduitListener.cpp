#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <utility>

#include "platform/Conduit.h"
#include "platform/ConduitConnectionState.h"
#include "platform/ConduitIoThread.h"

namespace om {

namespace {

Result<sockaddr_un> addressOf(const std::string& path)
{
    sockaddr_un address {};
    address.sun_family = AF_UNIX;
    if (path.size() >= sizeof address.sun_path)
        return OMError::platform(kPlatformErrorLimit, "socket path too long: " + path);
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
    return address;
}

// mkdir -p with mode 0755 for the parts that do not exist yet.
Result<void> makeDirectories(const std::string& directory)
{
    for (size_t slash = directory.find('/', 1);; slash = directory.find('/', slash + 1)) {
        const std::string prefix = directory.substr(0, slash);
        if (!prefix.empty() && ::mkdir(prefix.c_str(), 0755) < 0 && errno != EEXIST)
            return OMError::fromErrno("mkdir " + prefix, errno);
        if (slash == std::string::npos)
            break;
    }
    struct stat info;
    if (::stat(directory.c_str(), &info) < 0)
        return OMError::fromErrno("stat " + directory, errno);
    if (!S_ISDIR(info.st_mode))
        return OMError::platform(kPlatformErrorUnsupported, directory + " is not a directory");
    return {};
}

// The name is taken when something answers at path. A socket that refuses connections is what a
// listener that died left behind; it is replaced by the rename in bindListeningSocket.
Result<void> refuseIfLive(const std::string& path, const sockaddr_un& address)
{
    struct stat info;
    if (::lstat(path.c_str(), &info) < 0)
        return errno == ENOENT ? Result<void>() : Result<void>(OMError::fromErrno("lstat " + path, errno));
    if (!S_ISSOCK(info.st_mode))
        return OMError::platform(kPlatformErrorUnsupported, path + " exists and is not a socket");
    UniqueFd probe(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    if (!probe.valid())
        return OMError::fromErrno("socket", errno);
    if (::connect(probe.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0 || errno == EAGAIN)
        return OMError::platform(kPlatformErrorUnsupported, "a live listener already owns " + path);
    if (errno != ECONNREFUSED && errno != ENOENT)
        return OMError::fromErrno("connect " + path, errno);
    return {};
}

// The socket is bound and listening under a private name first and then renamed onto the service
// name, so the name never refers to a socket that refuses connections: a client connecting at
// any moment either finds no socket or a listening one, and a second daemon probing the name
// never mistakes a starting listener for a stale one.
Result<UniqueFd> bindListeningSocket(const std::string& path)
{
    const sockaddr_un address = OM_TRY(addressOf(path));
    OM_TRY(refuseIfLive(path, address));
    // A short name in the same directory: rename stays atomic, and any path that fits the
    // socket-address limit has room for it.
    static std::atomic<unsigned> serial { 0 };
    const std::string directory = path.substr(0, path.rfind('/') + 1);
    const std::string staging = directory + "." + std::to_string(::getpid()) + "-" + std::to_string(serial++);
    const sockaddr_un stagingAddress = OM_TRY(addressOf(staging));
    UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    if (!fd.valid())
        return OMError::fromErrno("socket", errno);
    (void)::unlink(staging.c_str()); // left by an earlier process with our pid that died here
    if (::bind(fd.get(), reinterpret_cast<const sockaddr*>(&stagingAddress), sizeof stagingAddress) < 0)
        return OMError::fromErrno("bind " + staging, errno);
    auto fail = [&](const char* call) {
        const int error = errno;
        (void)::unlink(staging.c_str());
        return OMError::fromErrno(std::string(call) + " " + path, error);
    };
    // Everyone may connect: what a peer may do is decided by its entitlements, not by this mode.
    if (::chmod(staging.c_str(), 0666) < 0)
        return fail("chmod");
    if (::listen(fd.get(), SOMAXCONN) < 0)
        return fail("listen");
    if (::rename(staging.c_str(), path.c_str()) < 0)
        return fail("rename");
    return fd;
}

// How long a listener that ran out of descriptors ignores its socket, unless one of the
// transport's sockets closes first.
constexpr std::chrono::milliseconds kAcceptBackoff { 100 };
// Waiting peers turned away in one round of the I/O thread; the rest wait for the next round, so
// that a flood of them does not keep the other connections waiting.
constexpr size_t kMostTurnedAwayAtOnce = 64;

// One descriptor held back for the moment the process runs out: closing it makes room to accept
// the waiting peers and close them, so that they learn at once that they will not be served.
// I/O thread only.
UniqueFd& spareDescriptor()
{
    static UniqueFd spare;
    return spare;
}

void restoreSpareDescriptor()
{
    if (!spareDescriptor().valid())
        spareDescriptor().reset(::open("/dev/null", O_RDONLY | O_CLOEXEC));
}

bool isDescriptorShortage(int error)
{
    return error == EMFILE || error == ENFILE;
}

struct TurnedAway {
    uint64_t count = 0;
    bool backlogLeft = false; // stopped at kMostTurnedAwayAtOnce with peers still waiting
    bool roomAgain = false; // a descriptor was freed meanwhile: the next peer may be served
};

// Accepts and closes the peers waiting on listening, through the spare descriptor, which is
// restored only after the last of them is closed so that its slot is free again. Stops as soon
// as a descriptor can be had besides, so that peers arriving once others have left are served.
TurnedAway turnAwayWaitingPeers(int listening)
{
    TurnedAway result;
    if (!spareDescriptor().valid())
        return result;
    spareDescriptor().reset();
    while (!result.roomAgain) {
        if (result.count == kMostTurnedAwayAtOnce) {
            result.backlogLeft = true;
            break;
        }
        UniqueFd peer(::accept4(listening, nullptr, nullptr, SOCK_CLOEXEC));
        if (!peer.valid()) {
            if (errno == EINTR || errno == ECONNABORTED)
                continue;
            break;
        }
        ++result.count;
        restoreSpareDescriptor(); // takes a slot only if one was freed since
        result.roomAgain = spareDescriptor().valid();
    }
    restoreSpareDescriptor();
    return result;
}

} // namespace

struct ConduitListener::State {
    // The I/O thread's registration. It holds the listener weakly: dropping the last handle to a
    // listener stops it.
    struct Watcher final : ConduitIoThread::Source {
        std::weak_ptr<ConduitListener> listener;
        void handleEvents(uint32_t) override
        {
            if (auto strong = listener.lock())
                strong->m_state->acceptPending(*strong);
        }
    };

    State(std::string socketPath, UniqueFd socket, std::shared_ptr<WorkQueue> deliveryQueue)
        : path(std::move(socketPath))
        , queue(std::move(deliveryQueue))
        , socket(std::make_shared<UniqueFd>(std::move(socket)))
    {
        struct stat info;
        if (::stat(path.c_str(), &info) == 0) {
            device = info.st_dev;
            inode = info.st_ino;
        }
    }

    void start(const std::shared_ptr<ConduitListener>& owner);
    void acceptPending(ConduitListener& owner);
    void outOfResources(ConduitListener& owner, int listening, int error);
    void pauseAccepting(ConduitListener& owner);
    void resumeAccepting();
    void watchSocket(uint32_t events);
    void deliver(const std::shared_ptr<ConduitListener>& owner, std::shared_ptr<ConduitConnection> connection);
    void shutdown();

    const std::string path;
    const std::shared_ptr<WorkQueue> queue; // null: the I/O thread
    ConnectionHandler handler; // set before resume()
    std::atomic<bool> resumed { false };
    std::atomic<bool> cancelled { false };

    std::mutex mutex;
    std::shared_ptr<UniqueFd> socket; // shared with the I/O thread's cleanup
    uint64_t ioKey = 0;
    dev_t device = 0; // identity of the socket file we bound, so that we unlink only our own
    ino_t inode = 0;

    // Running out of descriptors (or other resources accept needs), on the I/O thread only. While
    // paused, the socket's readiness is not watched, so a backlog the process cannot take never
    // spins the loop; one episode, from the first failure to the next served peer, logs twice.
    bool paused = false;
    uint64_t pauseCount = 0; // tells a back-off timer of an earlier pause from the current one's
    bool awaitingDescriptor = false;
    bool exhausted = false;
    uint64_t turnedAway = 0; // peers closed unserved in this episode
};

void ConduitListener::State::start(const std::shared_ptr<ConduitListener>& owner)
{
    restoreSpareDescriptor();
    std::lock_guard lock(mutex);
    if (cancelled.load() || !socket->valid())
        return;
    auto watcher = std::make_shared<Watcher>();
    watcher->listener = owner;
    ioKey = ConduitIoThread::shared().add(socket->get(), EPOLLIN, std::move(watcher));
}

void ConduitListener::State::acceptPending(ConduitListener& owner)
{
    std::shared_ptr<UniqueFd> listening;
    {
        std::lock_guard lock(mutex);
        listening = socket; // shutdown() may swap it out from another thread
    }
    if (!listening->valid() || paused)
        return;
    for (;;) {
        UniqueFd peer(::accept4(listening->get(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK));
        if (!peer.valid()) {
            if (errno == EINTR || errno == ECONNABORTED)
                continue;
            if (errno != EAGAIN && errno != EWOULDBLOCK)
                outOfResources(owner, listening->get(), errno);
            return;
        }
        auto token = Process::peerOf(peer.get());
        if (!token.ok()) {
            const OMError& error = token.error();
            // Without its pidfd a peer could not be told from a successor with its pid.
            if (error.domain() == "POSIX" && isDescriptorShortage(int(error.code()))) {
                peer.reset();
                ++turnedAway;
                outOfResources(owner, listening->get(), int(error.code()));
                return;
            }
            ConduitIoThread::log().error("new connection on %s: %s; closing it", path, error.localizedDescription());
            continue;
        }
        if (std::exchange(exhausted, false))
            ConduitIoThread::log().info("accepting connections on %s again; %llu turned away meanwhile", path,
                static_cast<unsigned long long>(std::exchange(turnedAway, 0)));
        auto connection = ConduitConnection::State::make(
            ConduitConnection::State::Role::Peer, std::move(peer), std::move(token).releaseValue(), std::string());
        ConduitIoThread::shared().addPeer(connection);
        deliver(owner.shared_from_this(), std::move(connection));
    }
}

// The waiting peers are closed rather than left hanging, and the socket goes unwatched until a
// descriptor is freed or the back-off passes, so that neither the loop nor the log spins.
void ConduitListener::State::outOfResources(ConduitListener& owner, int listening, int error)
{
    if (!std::exchange(exhausted, true))
        ConduitIoThread::log().error("accept on %s: %s; turning new connections away until resources are freed", path,
            OMError::errnoDescription(error));
    if (isDescriptorShortage(error)) {
        const TurnedAway result = turnAwayWaitingPeers(listening);
        turnedAway += result.count;
        // Still watched, the socket brings the I/O thread back on its next round.
        if (result.backlogLeft || result.roomAgain)
            return;
    }
    pauseAccepting(owner);
}

void ConduitListener::State::pauseAccepting(ConduitListener& owner)
{
    if (paused)
        return;
    paused = true;
    watchSocket(0);
    const uint64_t pause = ++pauseCount;
    std::weak_ptr<ConduitListener> weak = owner.weak_from_this();
    ConduitIoThread::shared().after(kAcceptBackoff, [weak, pause] {
        if (auto listener = weak.lock(); listener && listener->m_state->pauseCount == pause)
            listener->m_state->resumeAccepting();
    });
    // One waiter at a time, whatever the number of pauses before a descriptor is freed.
    if (std::exchange(awaitingDescriptor, true))
        return;
    ConduitIoThread::shared().whenDescriptorFreed([weak] {
        if (auto listener = weak.lock()) {
            listener->m_state->awaitingDescriptor = false;
            listener->m_state->resumeAccepting();
        }
    });
}

void ConduitListener::State::resumeAccepting()
{
    if (!std::exchange(paused, false))
        return;
    restoreSpareDescriptor();
    // Level-triggered: peers still waiting make the socket readable at once.
    watchSocket(EPOLLIN);
}

void ConduitListener::State::watchSocket(uint32_t events)
{
    std::lock_guard lock(mutex);
    if (ioKey != 0 && socket->valid())
        ConduitIoThread::shared().modify(socket->get(), ioKey, events);
}

void ConduitListener::State::deliver(
    const std::shared_ptr<ConduitListener>& owner, std::shared_ptr<ConduitConnection> connection)
{
    auto hand = [owner, connection = std::move(connection)] {
        auto& state = *owner->m_state;
        // Undelivered connections of a cancelled listener close when this last reference goes.
        if (!state.cancelled.load() && state.handler)
            state.handler(connection);
    };
    if (queue)
        queue->async(std::move(hand));
    else
        hand();
}

void ConduitListener::State::shutdown()
{
    if (cancelled.exchange(true))
        return;
    std::shared_ptr<UniqueFd> closing;
    uint64_t key = 0;
    {
        std::lock_guard lock(mutex);
        closing = std::move(socket);
        socket = std::make_shared<UniqueFd>();
        key = std::exchange(ioKey, 0);
    }
    struct stat info;
    if (::stat(path.c_str(), &info) == 0 && info.st_dev == device && info.st_ino == inode)
        (void)::unlink(path.c_str()); // a successor may already have replaced it: that is fine
    if (key == 0)
        return; // never registered: closing drops the descriptor here
    // A registered descriptor is closed on the I/O thread, after its registration is gone, so
    // that no event of a reused descriptor number can reach a stale registration.
    ConduitIoThread::shared().run([closing, key] { ConduitIoThread::shared().remove(closing->get(), key); });
}

ConduitListener::ConduitListener() = default;

ConduitListener::~ConduitListener()
{
    m_state->shutdown();
}

Result<std::shared_ptr<ConduitListener>> ConduitListener::create(
    const std::string& serviceName, std::shared_ptr<WorkQueue> queue)
{
    if (!Conduit::isValidServiceName(serviceName))
        return OMError::platform(kPlatformErrorUnsupported, "invalid service name \"" + serviceName + "\"");
    OM_TRY(makeDirectories(Conduit::directory()));
    const std::string path = Conduit::socketPath(serviceName);
    UniqueFd socket = OM_TRY(bindListeningSocket(path));
    std::shared_ptr<ConduitListener> listener(new ConduitListener());
    listener->m_state = std::make_unique<State>(path, std::move(socket), std::move(queue));
    return listener;
}

void ConduitListener::setConnectionHandler(ConnectionHandler handler)
{
    if (!m_state->resumed.load())
        m_state->handler = std::move(handler);
}

void ConduitListener::resume()
{
    if (m_state->resumed.exchange(true))
        return;
    ConduitIoThread::shared().post([self = shared_from_this()] { self->m_state->start(self); });
}

void ConduitListener::cancel()
{
    m_state->shutdown();
}

const std::string& ConduitListener::socketPath() const
{
    return m_state->path;
}

} // namespace om
