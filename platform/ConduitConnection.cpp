#include <fcntl.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

#include "platform/Conduit.h"
#include "platform/ConduitConnectionState.h"

namespace om {

namespace {

// A connected, non-blocking, close-on-exec socket to path, or the reason there is none.
Result<UniqueFd> connectTo(const std::string& path)
{
    sockaddr_un address {};
    address.sun_family = AF_UNIX;
    if (path.size() >= sizeof address.sun_path)
        return OMError::platform(kPlatformErrorLimit, "socket path too long: " + path);
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);

    // Blocking connect: on a Unix socket it only waits while the listener's backlog is full,
    // where a non-blocking one would fail with EAGAIN.
    UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (!fd.valid())
        return OMError::fromErrno("socket", errno);
    int result;
    do {
        result = ::connect(fd.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address);
    } while (result < 0 && errno == EINTR);
    if (result < 0)
        return OMError::fromErrno("connect " + path, errno);
    const int flags = ::fcntl(fd.get(), F_GETFL);
    if (flags < 0 || ::fcntl(fd.get(), F_SETFL, flags | O_NONBLOCK) < 0)
        return OMError::fromErrno("fcntl", errno);
    return fd;
}

} // namespace

ConduitConnection::ConduitConnection() = default;

ConduitConnection::~ConduitConnection() = default;

std::shared_ptr<ConduitConnection> ConduitConnection::connectToService(
    const std::string& serviceName, std::shared_ptr<WorkQueue> targetQueue)
{
    UniqueFd socket;
    AuditToken token;
    if (!Conduit::isValidServiceName(serviceName)) {
        ConduitIoThread::log().error("invalid service name \"%s\"", serviceName);
    } else if (auto connected = connectTo(Conduit::socketPath(serviceName)); !connected.ok()) {
        ConduitIoThread::log().debug(
            "cannot reach service %s: %s", serviceName, connected.error().localizedDescription());
    } else {
        socket = std::move(connected).releaseValue();
        if (auto peer = Process::peerOf(socket.get()); peer.ok())
            token = std::move(peer).releaseValue();
    }
    auto connection = State::make(State::Role::Client, std::move(socket), std::move(token), serviceName);
    connection->m_state->m_targetQueue = std::move(targetQueue);
    return connection;
}

std::shared_ptr<ConduitConnection> ConduitConnection::adoptSocket(
    UniqueFd socket, std::shared_ptr<WorkQueue> targetQueue)
{
    AuditToken token;
    if (socket.valid()) {
        const int flags = ::fcntl(socket.get(), F_GETFL);
        if (flags < 0 || ::fcntl(socket.get(), F_SETFL, flags | O_NONBLOCK) < 0
            || ::fcntl(socket.get(), F_SETFD, FD_CLOEXEC) < 0) {
            ConduitIoThread::log().error("cannot adopt socket %d: %s", socket.get(), OMError::errnoDescription(errno));
            socket.reset();
        } else if (auto peer = Process::peerOf(socket.get()); peer.ok()) {
            token = std::move(peer).releaseValue();
        }
    }
    auto connection = State::make(State::Role::Peer, std::move(socket), std::move(token), std::string());
    connection->m_state->m_targetQueue = std::move(targetQueue);
    return connection;
}

void ConduitConnection::setEventHandler(EventHandler handler)
{
    if (!m_state->m_resumed.load())
        m_state->m_handler = std::move(handler);
}

void ConduitConnection::setTargetQueue(std::shared_ptr<WorkQueue> queue)
{
    if (!m_state->m_resumed.load())
        m_state->m_targetQueue = std::move(queue);
}

void ConduitConnection::resume()
{
    m_state->resume();
}

void ConduitConnection::cancel()
{
    m_state->cancel();
}

void ConduitConnection::send(const Value& message)
{
    m_state->write(ConduitFrame::Kind::Message, 0, message, std::nullopt);
}

void ConduitConnection::sendWithReply(const Value& request, std::shared_ptr<WorkQueue> queue, ReplyHandler handler)
{
    m_state->write(
        ConduitFrame::Kind::Request, 0, request, State::PendingReply { std::move(queue), std::move(handler) });
}

void ConduitConnection::sendReply(uint64_t requestId, const Value& reply)
{
    m_state->write(ConduitFrame::Kind::Reply, requestId, reply, std::nullopt);
}

void ConduitConnection::send(const Value& message, ConduitDescriptors descriptors)
{
    m_state->write(ConduitFrame::Kind::Message, 0, message, std::nullopt, std::move(descriptors));
}

void ConduitConnection::sendReply(uint64_t requestId, const Value& reply, ConduitDescriptors descriptors)
{
    m_state->write(ConduitFrame::Kind::Reply, requestId, reply, std::nullopt, std::move(descriptors));
}

void ConduitConnection::sendWithReplyDescriptors(const Value& request, ConduitDescriptors descriptors,
    std::shared_ptr<WorkQueue> queue, DescriptorReplyHandler handler)
{
    m_state->write(ConduitFrame::Kind::Request, 0, request,
        State::PendingReply { std::move(queue), nullptr, std::move(handler) }, std::move(descriptors));
}

void ConduitConnection::setContext(std::shared_ptr<void> context)
{
    std::shared_ptr<void> previous;
    std::lock_guard lock(m_state->m_mutex);
    previous = std::exchange(m_state->m_context, std::move(context));
    // previous is released after the lock: its destructor may call back into this connection.
}

std::shared_ptr<void> ConduitConnection::context() const
{
    std::lock_guard lock(m_state->m_mutex);
    return m_state->m_context;
}

std::string ConduitConnection::description() const
{
    char address[32];
    (void)std::snprintf(address, sizeof address, "%p", static_cast<const void*>(this));
    return "<ConduitConnection " + std::string(address) + " " + m_state->describe() + ">";
}

ConduitConnection::KeepAlive::KeepAlive()
{
    ConduitIoThread::keepAliveOpened();
}

ConduitConnection::KeepAlive::~KeepAlive()
{
    ConduitIoThread::keepAliveClosed();
}

} // namespace om
