// One connected peer of the daemon's service: who it is (pid, executable, bundle, entitlements)
// and the receiver of its connection's events, which turns each request into a Transaction.
//
// Ownership: the connection holds the record (its context and its event handler); the record
// refers to the connection only weakly. Transactions in flight hold the record strongly.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Conduit.h"
#include "platform/Process.h"
#include "platform/Value.h"

namespace om {

class CodeSigningTask;
class OMBundle;
class OMDServer;

class OMDConduitClient : public std::enable_shared_from_this<OMDConduitClient> {
public:
    // Identifies the peer, installs the event handler and resumes the connection. Never fails:
    // facts that cannot be learned (the executable path, the signing identity) stay absent.
    static std::shared_ptr<OMDConduitClient> initWithConnection(
        std::shared_ptr<ConduitConnection> connection, std::shared_ptr<OMDServer> server);
    ~OMDConduitClient();

    OMDConduitClient(const OMDConduitClient&) = delete;
    OMDConduitClient& operator=(const OMDConduitClient&) = delete;

    void dying();
    void dead();

    pid_t pid() const;
    // The peer as pinned when it connected (pid with its pidfd): what grants made for it name.
    const AuditToken& auditToken() const { return m_auditToken; }
    // None when the entitlement is absent or cannot be read.
    Value entitlementValueForKey(std::string_view key) const;
    // Held unless absent, false or numerically zero.
    bool hasEntitlement(std::string_view key) const;
    // The rule hasEntitlement applies to an entitlement's value.
    static bool entitlementHeld(const Value& value);
    std::string description() const;
    // Whether the peer runs in a sandbox (another user or mount namespace, or a seccomp filter).
    bool isSandboxed() const;

    std::shared_ptr<ConduitConnection> connection() const { return m_connection.lock(); }
    const std::shared_ptr<OMDServer>& server() const { return m_server; }
    const std::optional<std::string>& path() const { return m_path; }
    const std::shared_ptr<OMBundle>& bundle() const { return m_bundle; }
    bool acceptWork() const { return m_acceptWork.load(std::memory_order_relaxed); }
    uint32_t requestCount() const { return m_requestCount; }

    // The executable path is read into a buffer of this size; a longer path counts as unreadable.
    static constexpr size_t kExecutablePathBufferSize = 2048;
    // Requests of one client that may wait for the service queue at once. Every reply is bounded
    // by the transport; this bounds what a client that sends without reading replies can make the
    // daemon hold. Far above what any well-behaved client pipelines.
    static constexpr uint32_t kMaxWaitingRequests = 4096;

private:
    OMDConduitClient(const std::shared_ptr<ConduitConnection>& connection, std::shared_ptr<OMDServer> server);
    void handleEvent(const ConduitEvent& event);
    void submitRequest(const ConduitEvent& event);

    std::weak_ptr<ConduitConnection> m_connection;
    std::shared_ptr<OMDServer> m_server;
    std::optional<std::string> m_path;
    std::shared_ptr<OMBundle> m_bundle;
    // Written on the connection's delivery thread (dead), read on "service" (dispatch). A request
    // racing with dead is either answered or dropped; both are fine.
    std::atomic<bool> m_acceptWork { true };
    std::atomic<uint32_t> m_waitingRequests { 0 }; // submitted, not yet dispatched
    // Set once the client went over kMaxWaitingRequests. Its connection closes soon after, but
    // the requests already decoded still arrive; they are dropped without another word. Touched
    // only by the connection's serial event delivery.
    bool m_cutOff = false;
    // Null when no signing identity could be made: every entitlement then counts as absent.
    std::shared_ptr<CodeSigningTask> _task;
    // Touched only on "service"; wraps at 2^32.
    uint32_t m_requestCount = 0;
    // The pid as first read; answered once the connection object is gone (nothing relies on it).
    pid_t m_pid = -1;
    AuditToken m_auditToken;
};

} // namespace om
