#include "omd/Transaction.h"

#include "Ombrel/OMLog.h"
#include "Ombrel/OMMakeError.h"
#include "omd/OMDConduitClient.h"
#include "omd/OMDServer.h"
#include "platform/Fatal.h"
#include "platform/Probes.h"

namespace om {

std::optional<Value> conduit_dictionary_get_array(const Value& dictionary, std::string_view key)
{
    const Value& value = dictionary[key];
    if (!value.isArray())
        return std::nullopt;
    return value;
}

std::optional<Value> conduit_dictionary_get_dictionary(const Value& dictionary, std::string_view key)
{
    const Value& value = dictionary[key];
    if (!value.isDictionary())
        return std::nullopt;
    return value;
}

Transaction::Transaction(const ConduitEvent& request, std::shared_ptr<OMDConduitClient> client)
    : m_client(std::move(client))
    , m_request(request.message)
    , m_requestId(request.requestId)
{
}

Transaction::~Transaction() = default;

const std::shared_ptr<OMDServer>& Transaction::server() const
{
    return m_client->server();
}

std::shared_ptr<ConduitConnection> Transaction::connection() const
{
    return m_client->connection();
}

void Transaction::dispatch()
{
    const std::string* name = m_request.stringFor("request");
    m_version = m_request["version"].asUInt64().value_or(0);

    // Answered even for a client that no longer accepts work: the version check comes first.
    if (m_version != kOMProtocolVersionOldest && m_version != kOMProtocolVersionCurrent) {
        return fail(7,
            format("unsupported protocol version %d (current %d)",
                static_cast<int32_t>(static_cast<uint32_t>(m_version)),
                static_cast<int32_t>(kOMProtocolVersionCurrent)));
    }
    if (!m_client->acceptWork())
        return;

    pid_t pid = m_client->pid();
    const char* nameText = name ? name->c_str() : nullptr;
    OMLog::ops().debug("client %d requested %{public}s", pid, nameText);
    OM_PROBE2(request, pid, nameText);

    // Per-request scope: whatever the handler makes while it runs here is owned by its locals and
    // released when it returns. A handler that finishes later on another queue keeps what it needs
    // (shared_from_this() at least) in the work it queued, never in this frame.
    {
        if (!name)
            return fail(4, "invalid request format (missing type)");
        runHandler(*name);
    }
}

void Transaction::done()
{
    OM_ASSERT(!m_replied);
    m_replied = true;

    Value reply = m_reply.build();
    pid_t pid = m_client->pid();
    auto connection = this->connection();
    // Nothing goes out for a message that awaited no reply, or once the peer is gone.
    if (!connection || m_requestId == 0)
        return;
    if (OM_PROBE_ENABLED(request__output)) {
        std::string text = reply.description();
        OM_PROBE2(request__output, pid, text.c_str());
    }
    connection->sendReply(m_requestId, reply);
}

void Transaction::fail(int64_t code, std::optional<std::string_view> message)
{
    m_reply.set("errorcode", Value::unsignedInteger(static_cast<uint64_t>(code)));
    if (message)
        m_reply.set("error", Value::string(std::string(*message)));
    done();
}

void Transaction::fail(int64_t code, const OMError& error)
{
    if (error.domain() == kOMErrorDomain)
        return fail(error.code(), error.description());
    fail(code, error.localizedDescription());
}

} // namespace om
