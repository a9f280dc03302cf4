#include "platform/ConduitConnectionState.h"

#include <sys/socket.h>

#include <cerrno>
#include <cstring>

namespace om {

namespace {

constexpr size_t kReadChunk = 64 * 1024;
// Bytes read from one connection per I/O round before the others get their turn.
constexpr size_t kReadBudget = 1024 * 1024;
// Output a connection keeps allocated once everything is written: replies usually go out
// directly, so only a burst that met a full socket needs more, and it gives that back.
constexpr size_t kRetainedOutbound = 64 * 1024;

// Writes what the socket takes now: the count written, or -1 with errno when the peer is gone.
ssize_t sendSome(int fd, const uint8_t* bytes, size_t size)
{
    size_t written = 0;
    while (written < size) {
        const ssize_t result = ::send(fd, bytes + written, size - written, MSG_NOSIGNAL | MSG_DONTWAIT);
        if (result > 0) {
            written += size_t(result);
            continue;
        }
        if (result < 0 && errno == EINTR)
            continue;
        if (result < 0 && (errno == EAGAIN || errno == EWOULDBLOCK))
            break;
        return -1;
    }
    return ssize_t(written);
}

} // namespace

std::shared_ptr<ConduitConnection> ConduitConnection::State::make(
    Role role, UniqueFd socket, AuditToken token, std::string name)
{
    std::shared_ptr<ConduitConnection> connection(new ConduitConnection());
    connection->m_auditToken = std::move(token);
    connection->m_state = std::make_unique<State>(*connection, role, std::move(socket), std::move(name));
    return connection;
}

ConduitConnection::State::State(ConduitConnection& owner, Role role, UniqueFd socket, std::string name)
    : m_role(role)
    , m_name(std::move(name))
    , m_owner(owner)
    , m_socket(std::move(socket))
    , m_outbound(kRetainedOutbound)
{
    if (!m_socket.valid())
        m_closed = m_invalid = true;
}

ConduitConnection::State::~State()
{
    // Only a connection that was never resumed (or never registered) can still have requests
    // outstanding here: a registered one is held by the I/O thread until it is closed.
    for (auto& [id, reply] : m_pending)
        completeLater(std::move(reply), invalidError());
}

OMError ConduitConnection::State::invalidError()
{
    return OMError(kConduitErrorDomain, kConduitConnectionInvalid, "Connection invalid");
}

void ConduitConnection::State::resume()
{
    if (m_resumed.exchange(true))
        return;
    // Posted even from the I/O thread, so that a connection that is already invalid never runs its
    // handler inside the caller of resume().
    ConduitIoThread::shared().post([self = m_owner.shared_from_this()] { self->m_state->start(); });
}

void ConduitConnection::State::start()
{
    {
        std::lock_guard lock(m_mutex);
        if (!m_closed) {
            const uint32_t events = EPOLLIN | EPOLLRDHUP | (m_outbound.empty() ? 0u : uint32_t(EPOLLOUT));
            // The registry's reference keeps the connection alive until it is closed.
            std::shared_ptr<ConduitIoThread::Source> source(m_owner.shared_from_this(), this);
            m_ioKey = ConduitIoThread::shared().add(m_socket.get(), events, std::move(source));
            m_writeArmed = (events & EPOLLOUT) != 0;
            if (m_ioKey != 0)
                return;
        }
    }
    if (m_closed)
        deliverInvalid();
    else
        closeNow(std::nullopt);
}

void ConduitConnection::State::cancel()
{
    {
        std::lock_guard lock(m_mutex);
        if (m_invalid)
            return;
        m_invalid = true;
    }
    // Posted even from the I/O thread: cancel() may be called from this connection's own handler,
    // and the ConnectionInvalid event must not run inside it.
    ConduitIoThread::shared().post([self = m_owner.shared_from_this()] { self->m_state->closeNow(std::nullopt); });
}

void ConduitConnection::State::write(
    ConduitFrame::Kind kind, uint64_t replyTo, const Value& payload, std::optional<PendingReply> reply)
{
    auto frame = ConduitFrame::encode(kind, replyTo, payload);
    if (!frame.ok()) {
        ConduitIoThread::log().error("cannot send to pid %d: %s", peerPid(), frame.error().localizedDescription());
        if (reply)
            completeLater(std::move(*reply), frame.error());
        else if (kind == ConduitFrame::Kind::Reply)
            cancel(); // the peer waits for this reply: better it learns now that none will come
        return;
    }

    std::unique_lock lock(m_mutex);
    if (m_invalid) {
        lock.unlock();
        if (reply)
            completeLater(std::move(*reply), invalidError());
        return;
    }
    if (reply) {
        // Allocated under the lock that orders the writes, so ids increase on the wire too.
        const uint64_t id = ++m_lastRequestId;
        ConduitFrame::setId(frame.value(), id);
        m_pending.emplace(id, std::move(*reply));
    }
    enqueueLocked(frame.value());
}

void ConduitConnection::State::terminationImminent()
{
    write(ConduitFrame::Kind::TerminationImminent, 0, Value(), std::nullopt);
}

void ConduitConnection::State::enqueueLocked(std::span<const uint8_t> frame)
{
    if (m_outbound.empty() && m_socket.valid()) {
        const ssize_t written = sendSome(m_socket.get(), frame.data(), frame.size());
        if (written < 0)
            return; // the peer is gone; reading will see the end of the stream
        frame = frame.subspan(size_t(written));
        if (frame.empty())
            return;
    }
    if (!m_outbound.append(frame, Conduit::maxPendingBytes())) {
        m_invalid = true;
        const size_t pending = m_outbound.size() + frame.size();
        ConduitIoThread::shared().post([self = m_owner.shared_from_this(), pending] {
            self->m_state->closeNow(OMError::platform(
                kPlatformErrorLimit, "peer stopped reading (" + std::to_string(pending) + " bytes pending)"));
        });
        return;
    }
    armWriteLocked();
}

void ConduitConnection::State::armWriteLocked()
{
    if (m_writeArmed || m_ioKey == 0)
        return;
    ConduitIoThread::shared().modify(m_socket.get(), m_ioKey, EPOLLIN | EPOLLRDHUP | EPOLLOUT);
    m_writeArmed = true;
}

void ConduitConnection::State::flush()
{
    std::lock_guard lock(m_mutex);
    if (!m_outbound.empty() && m_socket.valid()) {
        const ssize_t written = sendSome(m_socket.get(), m_outbound.data(), m_outbound.size());
        if (written < 0)
            m_outbound.clear(); // the peer is gone; reading will see the end of the stream
        else
            m_outbound.consume(size_t(written));
        if (!m_outbound.empty())
            return; // EAGAIN: stay armed
    }
    if (m_writeArmed && m_ioKey != 0) {
        ConduitIoThread::shared().modify(m_socket.get(), m_ioKey, EPOLLIN | EPOLLRDHUP);
        m_writeArmed = false;
    }
}

void ConduitConnection::State::handleEvents(uint32_t events)
{
    if (events & EPOLLOUT)
        flush();
    if (events & (EPOLLIN | EPOLLRDHUP | EPOLLHUP | EPOLLERR))
        readAvailable();
}

void ConduitConnection::State::readAvailable()
{
    static uint8_t chunk[kReadChunk]; // the I/O thread is the only reader
    size_t budget = kReadBudget;
    while (budget > 0 && m_socket.valid()) {
        const ssize_t count = ::recv(m_socket.get(), chunk, sizeof chunk, MSG_DONTWAIT);
        if (count > 0) {
            budget -= std::min(budget, size_t(count));
            m_reader.append({ chunk, size_t(count) });
            if (!drainFrames())
                return;
            // A short read emptied the socket; epoll is level-triggered, so anything arriving
            // later wakes us again, and a second recv here would only return EAGAIN.
            if (size_t(count) < sizeof chunk)
                return;
            continue;
        }
        if (count == 0)
            return closeNow(m_reader.finish());
        if (errno == EINTR)
            continue;
        if (errno != EAGAIN && errno != EWOULDBLOCK) {
            ConduitIoThread::log().debug("connection to pid %d: recv: %s", peerPid(), OMError::errnoDescription(errno));
            closeNow(std::nullopt);
        }
        return;
    }
}

// False once the connection is closed.
bool ConduitConnection::State::drainFrames()
{
    for (;;) {
        auto next = m_reader.next();
        if (!next.ok()) {
            closeNow(next.error());
            return false;
        }
        if (!next.value())
            return true;
        if (!handleFrame(std::move(*next.value())))
            return false;
    }
}

bool ConduitConnection::State::handleFrame(ConduitFrame frame)
{
    switch (frame.kind) {
    case ConduitFrame::Kind::Message:
    case ConduitFrame::Kind::Request:
        deliver(ConduitEvent { ConduitEvent::Kind::Message, std::move(frame.payload), frame.id });
        return true;
    case ConduitFrame::Kind::TerminationImminent:
        deliver(ConduitEvent { ConduitEvent::Kind::TerminationImminent, Value(), 0 });
        return true;
    case ConduitFrame::Kind::Reply:
        break;
    }
    std::optional<PendingReply> reply;
    {
        std::lock_guard lock(m_mutex);
        if (auto found = m_pending.find(frame.id); found != m_pending.end()) {
            reply = std::move(found->second);
            m_pending.erase(found);
        }
    }
    if (!reply) {
        closeNow(OMError::platform(
            kPlatformErrorMalformed, "reply to request " + std::to_string(frame.id) + ", which is not outstanding"));
        return false;
    }
    completeNow(std::move(*reply), std::move(frame.payload));
    return true;
}

void ConduitConnection::State::closeNow(std::optional<OMError> protocolError)
{
    std::unordered_map<uint64_t, PendingReply> pending;
    {
        std::lock_guard lock(m_mutex);
        if (m_closed)
            return;
        m_closed = m_invalid = true;
        pending.swap(m_pending);
        m_outbound.clear();
        if (m_ioKey != 0)
            ConduitIoThread::shared().remove(m_socket.get(), m_ioKey);
        m_ioKey = 0;
        m_socket.reset();
        m_reader = ConduitFrameReader();
    }
    ConduitIoThread::shared().descriptorFreed();
    if (protocolError)
        ConduitIoThread::log().error(
            "protocol error on connection to pid %d: %s; closing it", peerPid(), protocolError->localizedDescription());
    else
        ConduitIoThread::log().debug("connection to pid %d closed", peerPid());
    for (auto& [id, reply] : pending)
        completeNow(std::move(reply), invalidError());
    if (m_resumed.load())
        deliverInvalid();
}

void ConduitConnection::State::deliverInvalid()
{
    if (m_invalidDelivered)
        return;
    m_invalidDelivered = true;
    deliver(ConduitEvent { ConduitEvent::Kind::ConnectionInvalid, Value(), 0 });
}

void ConduitConnection::State::deliver(ConduitEvent event)
{
    if (!m_targetQueue)
        return dispatch(event);
    m_targetQueue->async(
        [self = m_owner.shared_from_this(), event = std::move(event)] { self->m_state->dispatch(event); });
}

// Serial per connection: the target queue, or the I/O thread.
void ConduitConnection::State::dispatch(const ConduitEvent& event)
{
    if (event.kind != ConduitEvent::Kind::ConnectionInvalid) {
        if (m_handler)
            m_handler(event);
        return;
    }
    // The last event: the handler goes with it, breaking handler -> owner -> connection cycles.
    // Whoever called dispatch holds a reference, so dropping the handler cannot free us here.
    auto handler = std::move(m_handler);
    m_handler = nullptr;
    if (handler)
        handler(event);
}

void ConduitConnection::State::completeNow(PendingReply reply, Result<Value> result)
{
    if (!reply.handler)
        return;
    if (!reply.queue)
        return reply.handler(std::move(result));
    completeLater(std::move(reply), std::move(result));
}

// Never runs the handler on the caller's stack, which may hold locks of its own.
void ConduitConnection::State::completeLater(PendingReply reply, Result<Value> result)
{
    if (!reply.handler)
        return;
    auto work
        = [handler = std::move(reply.handler), result = std::move(result)]() mutable { handler(std::move(result)); };
    if (reply.queue)
        reply.queue->async(std::move(work));
    else
        ConduitIoThread::shared().post(std::move(work));
}

std::string ConduitConnection::State::describe() const
{
    std::lock_guard lock(m_mutex);
    std::string text = m_role == Role::Client ? "service " + m_name : std::string("peer");
    text += " pid " + std::to_string(peerPid());
    if (m_closed)
        text += " (invalid)";
    return text;
}

} // namespace om
