#include "platform/Assertions.h"

#include <condition_variable>
#include <mutex>
#include <optional>

#include "platform/JobManager.h"

namespace om {

namespace {

constexpr std::chrono::seconds kReplyTimeout { 15 };

} // namespace

std::shared_ptr<Assertions> Assertions::create()
{
    auto connection = ConduitConnection::connectToService(JobManagerServiceName(), nullptr);
    connection->setEventHandler([](const ConduitEvent&) {});
    connection->resume();
    return std::shared_ptr<Assertions>(new Assertions(std::move(connection)));
}

Assertions::Assertions(std::shared_ptr<ConduitConnection> connection)
    : m_connection(std::move(connection))
{
}

Assertions::~Assertions()
{
    m_connection->cancel();
}

Result<void> Assertions::declareBusy()
{
    return declare(true);
}

Result<void> Assertions::declareIdle()
{
    return declare(false);
}

// On this object's own connection: jobd ties the declaration to it and to the pidfd behind it.
Result<void> Assertions::declare(bool busy)
{
    struct Shared {
        std::mutex mutex;
        std::condition_variable done;
        std::optional<Result<Value>> reply;
    };
    auto shared = std::make_shared<Shared>();
    m_connection->sendWithReply(Value::dictionary({ { "request", "assert" }, { "busy", Value::boolean(busy) } }),
        nullptr, [shared](Result<Value> reply) {
            std::lock_guard lock(shared->mutex);
            shared->reply = std::move(reply);
            shared->done.notify_all();
        });
    std::unique_lock lock(shared->mutex);
    if (!shared->done.wait_for(lock, kReplyTimeout, [&] { return shared->reply.has_value(); }))
        return OMError(kJobManagerErrorDomain, kJobManagerUnreachable, "no answer from jobd");
    if (!shared->reply->ok())
        return OMError(kJobManagerErrorDomain, kJobManagerUnreachable, shared->reply->error().localizedDescription());
    const Value& reply = shared->reply->value();
    const int status = int(reply["status"].asInt64().value_or(kJobManagerInvalid));
    if (status != kJobManagerSuccess) {
        const auto* error = reply.stringFor("error");
        return OMError(kJobManagerErrorDomain, status, error ? *error : "jobd status " + std::to_string(status));
    }
    return {};
}

Result<std::vector<Value>> Assertions::busyInstances(const std::set<std::string>& bundleIdentifiers)
{
    std::vector<Value> identifiers(bundleIdentifiers.begin(), bundleIdentifiers.end());
    const Value reply = OM_TRY(
        JobManagerCall(Value::dictionary({ { "request", "busy" }, { "identifiers", Value::array(identifiers) } })));
    const auto instances = reply["instances"].elements();
    return std::vector<Value>(instances.begin(), instances.end());
}

} // namespace om
