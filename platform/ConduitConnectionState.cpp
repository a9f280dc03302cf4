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

// Writes what the socket takes now of bytes, the descriptors going with the first byte: the count
// written (0 when the socket is full), or -1 with errno when the peer is gone.
ssize_t sendWithDescriptors(int fd, const uint8_t* bytes, size_t size, const ConduitDescriptors& descriptors)
{
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int) * Conduit::kMaxDescriptors)] = {};
    iovec vector { const_cast<uint8_t*>(bytes), size };
    msghdr message {};
    message.msg_iov = &vector;
    message.msg_iovlen = 1;
    message.msg_control = control;
    message.msg_controllen = CMSG_SPACE(sizeof(int) * descriptors.size());
    cmsghdr* header = CMSG_FIRSTHDR(&message);
    header->cmsg_level = SOL_SOCKET;
    header->cmsg_type = SCM_RIGHTS;
    header->cmsg_len = CMSG_LEN(sizeof(int) * descriptors.size());
    auto* fds = reinterpret_cast<int*>(CMSG_DATA(header));
    for (size_t i = 0; i < descriptors.size(); ++i)
        fds[i] = descriptors[i].get();
    ssize_t result;
    do {
        result = ::sendmsg(fd, &message, MSG_NOSIGNAL | MSG_DONTWAIT);
    } while (result < 0 && errno == EINTR);
    if (result < 0)
        return errno == EAGAIN || errno == EWOULDBLOCK ? 0 : -1;
    // The descriptors went with the first byte; the rest is ordinary output.
    const ssize_t rest = sendSome(fd, bytes + result, size - size_t(result));
    return rest < 0 ? -1 : result + rest;
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

void ConduitConnection::State::write(ConduitFrame::Kind kind, uint64_t replyTo, const Value& payload,
    std::optional<PendingReply> reply, ConduitDescriptors descriptors)
{
    auto frame = ConduitFrame::encode(kind, replyTo, payload, descriptors.size());
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
    enqueueLocked(frame.value(), std::move(descriptors));
}

void ConduitConnection::State::terminationImminent()
{
    write(ConduitFrame::Kind::TerminationImminent, 0, Value(), std::nullopt);
}

// Frames whose descriptors wait in the outbound queue; beyond it the peer counts as not reading.
constexpr size_t kMaxQueuedDescriptorFrames = 64;

void ConduitConnection::State::enqueueLocked(std::span<const uint8_t> frame, ConduitDescriptors descriptors)
{
    if (m_outbound.empty() && m_socket.valid()) {
        const ssize_t written = descriptors.empty()
            ? sendSome(m_socket.get(), frame.data(), frame.size())
            : sendWithDescriptors(m_socket.get(), frame.data(), frame.size(), descriptors);
        if (written < 0)
            return; // the peer is gone; reading will see the end of the stream
        if (written > 0)
            descriptors.clear(); // written with the first byte
        m_outboundOffset += size_t(written);
        frame = frame.subspan(size_t(written));
        if (frame.empty())
            return;
    }
    const uint64_t offset = m_outboundOffset + m_outbound.size();
    if (m_outboundDescriptors.size() >= kMaxQueuedDescriptorFrames
        || !m_outbound.append(frame, Conduit::maxPendingBytes())) {
        m_invalid = true;
        const size_t pending = m_outbound.size() + frame.size();
        ConduitIoThread::shared().post([self = m_owner.shared_from_this(), pending] {
            self->m_state->closeNow(OMError::platform(
                kPlatformErrorLimit, "peer stopped reading (" + std::to_string(pending) + " bytes pending)"));
        });
        return;
    }
    if (!descriptors.empty())
        m_outboundDescriptors.push_back(OutboundDescriptors { offset, std::move(descriptors) });
    armWriteLocked();
}

void ConduitConnection::State::discardOutboundLocked()
{
    m_outboundOffset += m_outbound.size();
    m_outbound.clear();
    m_outboundDescriptors.clear();
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
    while (!m_outbound.empty() && m_socket.valid()) {
        // Up to the next frame with descriptors, or from it up to the one after.
        size_t limit = m_outbound.size();
        const OutboundDescriptors* attached = nullptr;
        for (const auto& entry : m_outboundDescriptors) {
            const size_t at = size_t(entry.offset - m_outboundOffset);
            if (at == 0) {
                attached = &entry;
                continue;
            }
            limit = std::min(limit, at);
            break;
        }
        const ssize_t written = attached
            ? sendWithDescriptors(m_socket.get(), m_outbound.data(), limit, attached->descriptors)
            : sendSome(m_socket.get(), m_outbound.data(), limit);
        if (written < 0) {
            discardOutboundLocked(); // the peer is gone; reading will see the end of the stream
            break;
        }
        m_outbound.consume(size_t(written));
        m_outboundOffset += size_t(written);
        if (attached && written > 0)
            m_outboundDescriptors.pop_front();
        if (size_t(written) < limit)
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
    alignas(cmsghdr) static char control[CMSG_SPACE(sizeof(int) * Conduit::kMaxDescriptors)];
    size_t budget = kReadBudget;
    while (budget > 0 && m_socket.valid()) {
        iovec vector { chunk, sizeof chunk };
        msghdr message {};
        message.msg_iov = &vector;
        message.msg_iovlen = 1;
        message.msg_control = control;
        message.msg_controllen = sizeof control;
        // The kernel ends a read after a write that carried descriptors, so one read brings the
        // descriptors of at most one frame.
        const ssize_t count = ::recvmsg(m_socket.get(), &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
        if (count >= 0 && !receiveDescriptors(message))
            return;
        if (count > 0) {
            budget -= std::min(budget, size_t(count));
            m_reader.append({ chunk, size_t(count) });
            if (!drainFrames() || !checkStrayDescriptors())
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

// Takes the descriptors a read brought; false once the connection is closed over them.
bool ConduitConnection::State::receiveDescriptors(msghdr& message)
{
    if (message.msg_controllen == 0 && !(message.msg_flags & MSG_CTRUNC))
        return true;
    for (cmsghdr* header = CMSG_FIRSTHDR(&message); header; header = CMSG_NXTHDR(&message, header)) {
        if (header->cmsg_level != SOL_SOCKET || header->cmsg_type != SCM_RIGHTS)
            continue;
        const size_t count = (header->cmsg_len - CMSG_LEN(0)) / sizeof(int);
        const auto* fds = reinterpret_cast<const int*>(CMSG_DATA(header));
        for (size_t i = 0; i < count; ++i) {
            int fd;
            std::memcpy(&fd, fds + i, sizeof fd);
            m_inbound.emplace_back(fd);
        }
    }
    if (message.msg_flags & MSG_CTRUNC) {
        closeNow(OMError::platform(kPlatformErrorLimit,
            "more than " + std::to_string(Conduit::kMaxDescriptors) + " descriptors (truncated control message)"));
        return false;
    }
    if (m_inbound.size() > Conduit::kMaxDescriptors) {
        closeNow(OMError::platform(
            kPlatformErrorLimit, std::to_string(m_inbound.size()) + " descriptors waiting for one frame"));
        return false;
    }
    return true;
}

// Descriptors arrive with the first byte of their frame: once the complete frames have taken
// theirs, any left over must belong to the frame in progress and match what it declares.
bool ConduitConnection::State::checkStrayDescriptors()
{
    if (m_inbound.empty())
        return true;
    const auto declared = m_reader.descriptorsInProgress();
    if (m_reader.buffered() == 0 || (declared && *declared != m_inbound.size())) {
        closeNow(OMError::platform(kPlatformErrorMalformed,
            std::to_string(m_inbound.size()) + " descriptors without a frame that declares them"));
        return false;
    }
    return true;
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
    SharedDescriptors descriptors;
    if (frame.descriptorCount > 0) {
        if (m_inbound.size() < frame.descriptorCount) {
            closeNow(OMError::platform(kPlatformErrorMalformed,
                "frame declares " + std::to_string(frame.descriptorCount) + " descriptors; "
                    + std::to_string(m_inbound.size()) + " arrived"));
            return false;
        }
        descriptors = std::make_shared<ConduitDescriptors>();
        for (uint8_t i = 0; i < frame.descriptorCount; ++i) {
            descriptors->push_back(std::move(m_inbound.front()));
            m_inbound.pop_front();
        }
    }
    switch (frame.kind) {
    case ConduitFrame::Kind::Message:
    case ConduitFrame::Kind::Request:
        deliver(
            ConduitEvent { ConduitEvent::Kind::Message, std::move(frame.payload), frame.id, std::move(descriptors) });
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
    completeNow(std::move(*reply), std::move(frame.payload), std::move(descriptors));
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
        discardOutboundLocked();
        m_inbound.clear();
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

namespace {

ConduitDescriptors takeAll(const std::shared_ptr<ConduitDescriptors>& descriptors)
{
    return descriptors ? std::move(*descriptors) : ConduitDescriptors();
}

} // namespace

void ConduitConnection::State::completeNow(PendingReply reply, Result<Value> result, SharedDescriptors descriptors)
{
    if (!reply.queue && reply.descriptorHandler)
        return reply.descriptorHandler(std::move(result), takeAll(descriptors));
    if (!reply.queue && reply.handler)
        return reply.handler(std::move(result));
    completeLater(std::move(reply), std::move(result), std::move(descriptors));
}

// Never runs the handler on the caller's stack, which may hold locks of its own.
void ConduitConnection::State::completeLater(PendingReply reply, Result<Value> result, SharedDescriptors descriptors)
{
    if (!reply.handler && !reply.descriptorHandler)
        return;
    auto work = [handler = std::move(reply.handler), descriptorHandler = std::move(reply.descriptorHandler),
                    result = std::move(result), descriptors = std::move(descriptors)]() mutable {
        if (descriptorHandler)
            descriptorHandler(std::move(result), takeAll(descriptors));
        else
            handler(std::move(result));
    };
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
