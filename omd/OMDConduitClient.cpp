#include "omd/OMDConduitClient.h"

#include "Ombrel/OMBundle.h"
#include "Ombrel/OMLog.h"
#include "omd/OMDServer.h"
#include "omd/Transaction.h"
#include "platform/CodeSigning.h"
#include "platform/Probes.h"
#include "platform/Process.h"

namespace om {

OMDConduitClient::OMDConduitClient(
    const std::shared_ptr<ConduitConnection>& connection, std::shared_ptr<OMDServer> server)
    : m_connection(connection)
    , m_server(std::move(server))
    , m_pid(connection->pid())
    , m_auditToken(connection->auditToken())
{
}

OMDConduitClient::~OMDConduitClient() = default;

std::shared_ptr<OMDConduitClient> OMDConduitClient::initWithConnection(
    std::shared_ptr<ConduitConnection> connection, std::shared_ptr<OMDServer> server)
{
    std::shared_ptr<OMDConduitClient> client(new OMDConduitClient(connection, std::move(server)));
    pid_t pid = client->m_pid;

    if (auto path = Process::executablePath(connection->auditToken());
        path.ok() && path->size() < kExecutablePathBufferSize) {
        client->m_bundle = OMBundle::initWithExecutablePath(*path);
        client->m_path = std::move(path).releaseValue();
    }
    OMLog::ops().debug("new client %d %s", pid, client->m_path ? client->m_path->c_str() : "");
    OM_PROBE1(client__new, pid);

    client->_task = CodeSigningTask::create(connection->auditToken());

    connection->setContext(client);
    // The handler holds the record too; the transport drops the handler after ConnectionInvalid.
    connection->setEventHandler([client](const ConduitEvent& event) { client->handleEvent(event); });
    connection->resume();
    return client;
}

void OMDConduitClient::handleEvent(const ConduitEvent& event)
{
    switch (event.kind) {
    case ConduitEvent::Kind::TerminationImminent:
        return dying();
    case ConduitEvent::Kind::ConnectionInvalid:
        return dead();
    case ConduitEvent::Kind::Message:
        if (event.message.isDictionary())
            return submitRequest(event);
        OMLog::ops().error("unexpected message: %{public}@ from: %d", event.message, pid());
        return;
    }
    // Only reached if the transport grows an event kind this record does not know.
    OMLog::ops().error("unexpected error type from conduit: %{public}@", Value::integer(static_cast<int>(event.kind)));
}

void OMDConduitClient::submitRequest(const ConduitEvent& event)
{
    pid_t pid = this->pid();
    if (OM_PROBE_ENABLED(request__input)) {
        std::string text = event.message.description();
        OM_PROBE2(request__input, pid, text.c_str());
    }

    if (m_cutOff)
        return;
    if (m_waitingRequests.fetch_add(1, std::memory_order_relaxed) >= kMaxWaitingRequests) {
        // A client this far ahead of its replies is misbehaving: it loses its own connection,
        // and the requests it already queued are dropped at dispatch like any dead client's.
        m_waitingRequests.fetch_sub(1, std::memory_order_relaxed);
        m_cutOff = true;
        OMLog::ops().error("client %d has %u requests waiting; closing its connection", pid,
            static_cast<uint32_t>(kMaxWaitingRequests));
        if (auto connection = m_connection.lock())
            connection->cancel();
        return;
    }
    auto transaction = std::make_shared<Transaction>(event, shared_from_this());
    m_server->submitWork([transaction] {
        auto& client = *transaction->client();
        client.m_waitingRequests.fetch_sub(1, std::memory_order_relaxed);
        uint32_t count = ++client.m_requestCount;
        if (count % 1000 == 0)
            OMLog::ops().debug("client %d used %u requests so far", client.pid(), count);
        transaction->dispatch();
    });
}

void OMDConduitClient::dying()
{
    OMLog::ops().debug("client %d termination imminent", pid());
}

void OMDConduitClient::dead()
{
    m_server->unholdClient(*this);
    OMLog::ops().debug("client %d is dead", pid());
    m_acceptWork.store(false, std::memory_order_relaxed);
    OM_PROBE1(client__done, pid());
}

pid_t OMDConduitClient::pid() const
{
    if (auto connection = m_connection.lock())
        return connection->pid();
    return m_pid;
}

Value OMDConduitClient::entitlementValueForKey(std::string_view key) const
{
    if (!_task)
        return {};
    auto value = _task->entitlementValue(key);
    if (!value.ok()) {
        OMLog::ops().error("error retrieving entitlements for client %d", pid());
        return {};
    }
    return std::move(value).releaseValue();
}

bool OMDConduitClient::hasEntitlement(std::string_view key) const
{
    return entitlementHeld(entitlementValueForKey(key));
}

bool OMDConduitClient::entitlementHeld(const Value& value)
{
    // Numbers compare numerically, so 0 and 0.0 equal false here as well.
    return !value.isNone() && value != Value::boolean(false);
}

bool OMDConduitClient::isSandboxed() const
{
    auto connection = m_connection.lock();
    return connection && Process::isSandboxed(connection->auditToken());
}

std::string OMDConduitClient::description() const
{
    auto connection = m_connection.lock();
    if (!connection)
        return format("<OMDConduitClient %p NO CONNECTION>", static_cast<const void*>(this));
    return format("<OMDConduitClient %p con=%@ pid=%d path=%@>", static_cast<const void*>(this),
        connection->description(), connection->pid(), m_path ? *m_path : std::string("(null)"));
}

} // namespace om
