// The Conduit transport: dictionary messages between processes over Unix stream sockets.
//
// A named service is a socket at $CONDUIT_DIR/<name>. Frames are a little-endian length, a kind
// (1 message, 2 request, 3 reply, 4 termination imminent), a little-endian id and one CBOR item
// (see Cbor.h). One I/O thread (epoll) owns every socket of the process: it reads and decodes
// frames, writes queued output, and delivers each connection's events, in order, either on the
// connection's target queue or, when it has none, on the I/O thread itself. Handlers that run on
// the I/O thread must be short and must never block.
//
// Limits of the wire contract, the same for every peer: a frame's payload is at most 16 MiB
// (kMaxPayload); its CBOR item nests at most 128 levels deep (Cbor::kMaxDepth) and consists of at
// most 2^20 data items, every container, tag, map key and scalar counting as one
// (Cbor::kMaxItems). A frame beyond any of them is invalid.
//
// Descriptors (an addition to the wire contract; peers that never pass any see no change): a frame
// of kind 1-3 may carry up to kMaxDescriptors open descriptors. Their number is in bits 4-6 of the
// kind byte and they travel as SCM_RIGHTS on the sendmsg that writes the frame's first byte. The
// receiver installs them close-on-exec and hands them over with the frame's event or reply;
// whatever nobody takes is closed. Descriptors that arrive without a frame that declares them,
// fewer than a frame declares, more than kMaxDescriptors at once, or a truncated control message
// are a protocol error: the connection is closed and the descriptors with it (a frame that
// completed before the violation showed may have been delivered, never with stray descriptors).
//
// Blame is explicit: a malformed frame, a reply to nothing, a frame over the limit or a peer whose
// unread output would need more than CONDUIT_MAX_PENDING bytes of memory is a protocol error. It
// is logged, that connection is closed, and nothing it decoded is delivered. Other connections
// never notice.
//
// Lifetime: the transport holds each open connection; after it has delivered ConnectionInvalid
// it drops the event handler (breaking handler -> owner -> connection cycles) and its reference.
// The context set with setContext lives exactly as long as the connection object.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/Process.h"
#include "platform/Result.h"
#include "platform/UniqueFd.h"
#include "platform/Value.h"
#include "platform/WorkQueue.h"

namespace om {

// Error domain and codes of transport errors (as reply-handler results and events).
inline constexpr const char* kConduitErrorDomain = "Conduit";
enum ConduitErrorCode : int64_t {
    kConduitConnectionInvalid = 1, // "Connection invalid"
    kConduitTerminationImminent = 2, // "Termination imminent"
};

// Descriptors that travel with one frame.
using ConduitDescriptors = std::vector<UniqueFd>;

struct ConduitEvent {
    enum class Kind : uint8_t { Message, ConnectionInvalid, TerminationImminent };
    Kind kind = Kind::Message;
    Value message; // Kind::Message: the decoded item (any kind, not only dictionaries)
    uint64_t requestId = 0; // non-zero when the peer awaits a reply (frame kind 2)
    // The frame's descriptors, null when it carried none. A handler may move them out; those left
    // are closed with the last copy of the event.
    std::shared_ptr<ConduitDescriptors> descriptors;

    bool expectsReply() const { return requestId != 0; }
};

class ConduitConnection : public std::enable_shared_from_this<ConduitConnection> {
public:
    using EventHandler = std::function<void(const ConduitEvent&)>;
    using ReplyHandler = std::function<void(Result<Value>)>;
    // A reply handler that also takes the descriptors the reply carried (empty on an error).
    using DescriptorReplyHandler = std::function<void(Result<Value>, ConduitDescriptors)>;

    // A client connection to a named service. Never fails here: when the service cannot be
    // reached, the connection becomes invalid once resumed, and every request sent on it gets a
    // kConduitConnectionInvalid error. targetQueue null: deliver on the I/O thread.
    static std::shared_ptr<ConduitConnection> connectToService(
        const std::string& serviceName, std::shared_ptr<WorkQueue> targetQueue);
    // A connection over a connected stream socket made elsewhere (one end of a socketpair handed
    // over by another process). Made non-blocking and close-on-exec here; the peer facts are
    // those the kernel gives for the socket.
    static std::shared_ptr<ConduitConnection> adoptSocket(UniqueFd socket, std::shared_ptr<WorkQueue> targetQueue);
    ~ConduitConnection();

    // Set before resume(); later calls are ignored.
    void setEventHandler(EventHandler handler);
    void setTargetQueue(std::shared_ptr<WorkQueue> queue);
    // Starts event delivery. Nothing is read from the socket before it.
    void resume();
    // Closes the connection; ConnectionInvalid is delivered (once) as for a peer close.
    void cancel();

    // Frame kind 1: no reply expected.
    void send(const Value& message);
    // Frame kind 2: the reply (or a transport error) goes to handler on queue (null: I/O thread).
    void sendWithReply(const Value& request, std::shared_ptr<WorkQueue> queue, ReplyHandler handler);
    // Frame kind 3 answering the peer's request requestId. Written directly when the socket takes
    // it; dropped silently when the connection is gone.
    void sendReply(uint64_t requestId, const Value& reply);
    // The same with descriptors (at most Conduit::kMaxDescriptors), which the connection takes
    // over and closes once they are written or the connection is gone.
    void send(const Value& message, ConduitDescriptors descriptors);
    void sendReply(uint64_t requestId, const Value& reply, ConduitDescriptors descriptors);
    void sendWithReplyDescriptors(const Value& request, ConduitDescriptors descriptors,
        std::shared_ptr<WorkQueue> queue, DescriptorReplyHandler handler);

    // Peer facts captured at connection time (for client connections: the service's process).
    const AuditToken& auditToken() const { return m_auditToken; }
    pid_t pid() const { return m_auditToken.pid; }

    // Opaque context owned by the connection; released when the connection object is destroyed.
    void setContext(std::shared_ptr<void> context);
    std::shared_ptr<void> context() const;

    std::string description() const;

    // Keep-alive unit of open work: while any exists, SIGTERM handling waits before exiting.
    class KeepAlive {
    public:
        KeepAlive();
        ~KeepAlive();
        KeepAlive(const KeepAlive&) = delete;
        KeepAlive& operator=(const KeepAlive&) = delete;
    };

private:
    friend class ConduitIoThread;
    friend class ConduitListener;
    ConduitConnection(); // made only by the transport
    AuditToken m_auditToken;
    struct State;
    std::unique_ptr<State> m_state;
};

// Out of descriptors, a listener accepts and closes the peers waiting on it at once, through a
// spare descriptor it keeps for this, and stops watching its socket until one of the transport's
// sockets closes or 100 ms pass: peers are served or closed, never left waiting, and the I/O
// thread does not spin. One log line starts such an episode and one ends it, with a count.
class ConduitListener : public std::enable_shared_from_this<ConduitListener> {
public:
    using ConnectionHandler = std::function<void(std::shared_ptr<ConduitConnection>)>;

    // Binds $CONDUIT_DIR/<serviceName> (creating the directory; replacing a stale socket that
    // refuses connections; failing when a live listener owns the name). Suspended until resume().
    // New connections are delivered on queue, not yet resumed.
    static Result<std::shared_ptr<ConduitListener>> create(
        const std::string& serviceName, std::shared_ptr<WorkQueue> queue);
    ~ConduitListener();

    void setConnectionHandler(ConnectionHandler handler);
    void resume();
    void cancel();
    const std::string& socketPath() const;

private:
    ConduitListener();
    struct State;
    std::unique_ptr<State> m_state;
};

// Process-wide transport settings and SIGTERM handling.
class Conduit {
public:
    // $CONDUIT_DIR, else $XDG_RUNTIME_DIR/conduit, else /run/conduit.
    static std::string directory();
    static std::string socketPath(const std::string& serviceName);
    // A service name is one non-empty path component: no '/', not "." or "..".
    static bool isValidServiceName(const std::string& serviceName);
    // Largest frame payload accepted and sent (16 MiB).
    static constexpr uint32_t kMaxPayload = 16u << 20;
    // Most descriptors one frame may carry.
    static constexpr size_t kMaxDescriptors = 4;
    // CONDUIT_MAX_PENDING (bytes), default 64 MiB: the memory one connection's unwritten output may
    // take, allocation and all.
    static size_t maxPendingBytes();
    // Overrides CONDUIT_MAX_PENDING for the rest of the process (tests of the outbound bound).
    static void setMaxPendingBytesForTesting(size_t bytes);
    // On SIGTERM: send frame kind 4 on every peer connection of every listener, then exit(0)
    // once no KeepAlive is open. Blocks SIGTERM in the calling thread and installs a signalfd on
    // the I/O thread. main must call it first, before any thread (work queue, transport) starts,
    // so that every thread inherits the blocked signal and none takes its default action.
    static void exitOnTermination();
};

} // namespace om
