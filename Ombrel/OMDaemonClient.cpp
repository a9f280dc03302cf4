#include "Ombrel/OMDaemonClient.h"

#include <atomic>
#include <future>
#include <string>
#include <utility>

#include "Ombrel/OMLog.h"
#include "Ombrel/OMMakeError.h"
#include "platform/ConduitMessageEncoding.h"
#include "platform/Fatal.h"
#include "platform/Format.h"
#include "platform/ValueTreeConversion.h"

namespace om {

namespace {

Value describeEvent(const ConduitEvent& event)
{
    switch (event.kind) {
    case ConduitEvent::Kind::Message:
        return Value::string(event.message.description());
    case ConduitEvent::Kind::ConnectionInvalid:
        return Value::string("Connection invalid");
    case ConduitEvent::Kind::TerminationImminent:
        return Value::string("Termination imminent");
    }
    return Value::string("unknown event");
}

// "errorcode" is unsigned on the wire, but the daemon widens signed codes into it, so a negative
// code arrives as a large unsigned value (or, from another encoder, as a negative integer).
int64_t replyCode(const Value& reply)
{
    const Value& code = reply["errorcode"];
    if (auto value = code.asInt64())
        return *value;
    if (auto value = code.asUInt64())
        return static_cast<int64_t>(*value);
    return 0;
}

} // namespace

std::shared_ptr<OMDaemonClient> OMDaemonClient::initWithServiceName(const char* name)
{
    auto replyQueue = WorkQueue::create("omd_client");
    auto omd = ConduitConnection::connectToService(name ? name : kDefaultServiceName, replyQueue);
    std::shared_ptr<OMDaemonClient> client(new OMDaemonClient(replyQueue, omd));
    // Our own cancel at destruction also delivers "connection invalid"; that one is not an error.
    omd->setEventHandler([closing = client->m_closing](const ConduitEvent& event) {
        if (!closing->load())
            OMLog::ops().error("Communications error: %{public}@", describeEvent(event));
    });
    client->m_protocolVersion = kCurrentProtocolVersion;
    omd->resume();
    return client;
}

OMDaemonClient::OMDaemonClient(std::shared_ptr<WorkQueue> replyQueue, std::shared_ptr<ConduitConnection> omd)
    : m_replyQueue(std::move(replyQueue))
    , m_omd(std::move(omd))
    , m_closing(std::make_shared<std::atomic<bool>>(false))
{
}

OMDaemonClient::~OMDaemonClient()
{
    // The transport holds open connections; without a cancel this one would outlive its owner.
    m_closing->store(true);
    m_omd->cancel();
}

void OMDaemonClient::addPlugIns(const Value& paths, ReplyBlock reply)
{
    send(request("add", paths).build(), std::move(reply));
}

void OMDaemonClient::removePlugIns(const Value& paths, ReplyBlock reply)
{
    send(request("remove", paths).build(), std::move(reply));
}

void OMDaemonClient::bulkPlugins(uint64_t flags, ReplyBlock reply)
{
    auto message = request("bulk");
    message.set("flags", Value::unsignedInteger(flags));
    send(message.build(), std::move(reply));
}

void OMDaemonClient::readyPlugIns(const std::vector<Uuid>& uuids, uint64_t flags, ReplyBlock reply)
{
    auto message = request("ready");
    message.set("flags", Value::unsignedInteger(flags));
    set(message, uuids);
    send(message.build(), std::move(reply));
}

void OMDaemonClient::accessPlugIns(const std::vector<Uuid>& uuids, uint64_t flags, ReplyBlock reply)
{
    auto message = request("access");
    message.set("flags", Value::unsignedInteger(flags));
    set(message, uuids);
    send(message.build(), std::move(reply));
}

void OMDaemonClient::matchPlugIns(const Value& rules, uint64_t flags, ReplyBlock reply)
{
    auto message = request("match");
    if (auto converted = ValueTreeConversion::toConduit(rules))
        message.set("rules", std::move(*converted));
    message.set("flags", Value::unsignedInteger(flags));
    send(message.build(), std::move(reply));
}

void OMDaemonClient::setPluginAnnotations(const std::vector<Uuid>& uuids, const Value& annotations, ReplyBlock reply)
{
    auto message = request("annotate");
    set(message, uuids);
    if (auto converted = ValueTreeConversion::toConduit(annotations))
        message.set("annotations", std::move(*converted));
    send(message.build(), std::move(reply));
}

void OMDaemonClient::bulkSetPluginAnnotations(const Value& annotations, ReplyBlock reply)
{
    auto message = request("bulk-annotate");
    if (auto converted = ValueTreeConversion::toConduit(annotations))
        message.set("annotations", std::move(*converted));
    send(message.build(), std::move(reply));
}

void OMDaemonClient::holdPlugins(const Value& paths, uint64_t flags, ReplyBlock reply)
{
    auto message = request("lock", paths);
    message.set("flags", Value::unsignedInteger(flags));
    send(message.build(), std::move(reply));
}

void OMDaemonClient::releaseHold(const Uuid& token, ReplyBlock reply)
{
    // No "flags": the daemon tells a release from a hold by "uuids" being an array.
    auto message = request("lock");
    set(message, { token });
    send(message.build(), std::move(reply));
}

std::optional<OMError> OMDaemonClient::errorInReply(const Result<Value>& reply)
{
    if (!reply.ok())
        return OMMakeError(4, reply.error().localizedDescription());

    int64_t code = replyCode(reply.value());
    const std::string* text = reply.value().stringFor("error");
    if (code == 0) {
        if (text)
            internalInconsistency(format("omd reported error without a code: %s", *text));
        return std::nullopt;
    }
    return OMMakeError(code, text ? *text : std::string("unknown error returned by Ombrel subsystem"));
}

DictionaryBuilder OMDaemonClient::request(std::string_view name) const
{
    DictionaryBuilder message;
    message.set("request", Value::string(std::string(name)));
    message.set("version", Value::unsignedInteger(static_cast<uint64_t>(m_protocolVersion)));
    return message;
}

DictionaryBuilder OMDaemonClient::request(std::string_view name, const Value& paths) const
{
    auto message = request(name);
    if (auto converted = ValueTreeConversion::toConduit(paths))
        message.set("paths", std::move(*converted));
    return message;
}

void OMDaemonClient::set(DictionaryBuilder& request, const std::vector<Uuid>& uuids)
{
    ArrayBuilder array;
    for (const Uuid& uuid : uuids)
        array.append(Value::uuid(uuid));
    request.set("uuids", array.build());
}

void OMDaemonClient::send(const Value& request, ReplyBlock reply)
{
    OMLog::traffic().debug("request: %@", request);
    m_omd->sendWithReply(request, m_replyQueue, [reply = std::move(reply)](Result<Value> result) {
        const Log& traffic = OMLog::traffic();
        if (traffic.enabled(LogLevel::Debug)) {
            if (result.ok())
                traffic.debug("reply: %@", result.value());
            else
                traffic.debug("reply: %@", Value::string(result.error().localizedDescription()));
        }
        if (reply)
            reply(result);
    });
}

std::optional<Value> OMDaemonClient::convertToConduit(const Value& tree, int64_t version)
{
    if (version != 3 || tree.isNone())
        return std::nullopt;
    return ConduitMessageEncoding::encode(tree);
}

std::optional<Value> OMDaemonClient::convertFromConduit(const Value& message) const
{
    if (m_protocolVersion != 3)
        return std::nullopt;
    return ConduitMessageEncoding::decode(message);
}

Result<Value> OMDaemonClient::sendSync(const Value& request)
{
    return waitForReply([&](ReplyBlock reply) { send(request, std::move(reply)); });
}

Result<Value> OMDaemonClient::waitForReply(const std::function<void(ReplyBlock)>& start)
{
    m_replyQueue->assertNotCurrent();
    // Shared with the block, which the transport may keep a moment after it has run.
    auto promise = std::make_shared<std::promise<Result<Value>>>();
    auto future = promise->get_future();
    start([promise](const Result<Value>& reply) { promise->set_value(reply); });
    return future.get();
}

} // namespace om
