// The engine behind a ConduitConnection: socket, framing, outbound queue, outstanding requests and
// the serial delivery of events. Shared by the connection, the listener that accepts peers and the
// I/O thread; nothing outside the transport includes it.
//
// Threads: reading, decoding and closing happen only on the I/O thread. Writes come from any thread
// and are serialised by m_mutex, which also guards everything that both sides touch. Event delivery
// is serial: on the target queue when there is one, else inline on the I/O thread.
#pragma once

#include <sys/socket.h>

#include <atomic>
#include <deque>
#include <memory>
#include <mutex>
#include <optional>
#include <span>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/ByteQueue.h"
#include "platform/Conduit.h"
#include "platform/ConduitFrame.h"
#include "platform/ConduitIoThread.h"
#include "platform/UniqueFd.h"

namespace om {

struct ConduitConnection::State final : ConduitIoThread::Source {
    enum class Role : uint8_t { Client, Peer };

    struct PendingReply {
        std::shared_ptr<WorkQueue> queue; // null: the I/O thread
        ReplyHandler handler;
        DescriptorReplyHandler descriptorHandler; // instead of handler, when the caller takes descriptors
    };

    // socket invalid: a client whose service could not be reached; it is born closed.
    static std::shared_ptr<ConduitConnection> make(Role role, UniqueFd socket, AuditToken token, std::string name);
    State(ConduitConnection& owner, Role role, UniqueFd socket, std::string name);
    ~State() override;

    void handleEvents(uint32_t events) override;

    void resume();
    void cancel();
    void write(ConduitFrame::Kind kind, uint64_t replyTo, const Value& payload, std::optional<PendingReply> reply,
        ConduitDescriptors descriptors = {});
    void terminationImminent();
    std::string describe() const;

    const Role m_role;
    const std::string m_name; // the service name of a client connection; empty for peers

    // Set before resume(), read only by delivery afterwards.
    EventHandler m_handler;
    std::shared_ptr<WorkQueue> m_targetQueue;
    std::atomic<bool> m_resumed { false };

    mutable std::mutex m_mutex;
    std::shared_ptr<void> m_context;

private:
    void start();
    void readAvailable();
    bool drainFrames();
    bool handleFrame(ConduitFrame frame);
    bool receiveDescriptors(msghdr& message);
    bool checkStrayDescriptors();
    void flush();
    void enqueueLocked(std::span<const uint8_t> frame, ConduitDescriptors descriptors);
    void discardOutboundLocked();
    void armWriteLocked();
    void closeNow(std::optional<OMError> protocolError);
    void deliver(ConduitEvent event);
    void dispatch(const ConduitEvent& event);
    void deliverInvalid();
    pid_t peerPid() const { return m_owner.m_auditToken.pid; }

    using SharedDescriptors = std::shared_ptr<ConduitDescriptors>;
    static void completeNow(PendingReply reply, Result<Value> result, SharedDescriptors descriptors = nullptr);
    static void completeLater(PendingReply reply, Result<Value> result, SharedDescriptors descriptors = nullptr);
    static OMError invalidError();

    ConduitConnection& m_owner;

    // Guarded by m_mutex. The socket is written (closed) only on the I/O thread, under the mutex,
    // so the I/O thread may read it without the mutex.
    UniqueFd m_socket;
    bool m_closed = false; // the socket is gone
    bool m_invalid = false; // no more output is accepted (closed, cancelled or over budget)
    uint64_t m_lastRequestId = 0;
    std::unordered_map<uint64_t, PendingReply> m_pending;
    // Unwritten output, charged against Conduit::maxPendingBytes() by what it allocates.
    ByteQueue m_outbound;
    // Descriptors waiting in m_outbound, each with the stream offset of the frame they go with.
    struct OutboundDescriptors {
        uint64_t offset;
        ConduitDescriptors descriptors;
    };
    std::deque<OutboundDescriptors> m_outboundDescriptors;
    uint64_t m_outboundOffset = 0; // stream offset of m_outbound's first byte
    uint64_t m_ioKey = 0; // registration with the I/O thread; 0 when not registered
    bool m_writeArmed = false;

    // I/O thread only.
    ConduitFrameReader m_reader;
    std::deque<UniqueFd> m_inbound; // received descriptors not yet claimed by a frame
    bool m_invalidDelivered = false;
};

} // namespace om
