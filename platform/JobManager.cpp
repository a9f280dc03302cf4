#include "platform/JobManager.h"

#include <condition_variable>
#include <cstdlib>
#include <map>
#include <mutex>
#include <optional>
#include <thread>

#include "platform/Conduit.h"

namespace om {

namespace {

// How long a call waits for jobd's answer. A removal also waits for the instances to stop, so it
// is given room for jobd's grace period.
constexpr std::chrono::seconds kReplyTimeout { 15 };
constexpr std::chrono::seconds kRemoveTimeout { 60 };

std::mutex s_nameMutex;
std::string s_serviceName;

OMError statusError(int status, std::string message)
{
    return OMError(kJobManagerErrorDomain, status, std::move(message));
}

int statusOf(const Value& reply)
{
    const auto status = reply["status"].asInt64();
    return status ? int(*status) : kJobManagerInvalid;
}

// One request on its own connection, answered or given up on within timeout.
struct Answer {
    Result<Value> reply = statusError(kJobManagerUnreachable, "no answer from jobd");
    ConduitDescriptors descriptors;
};

Answer call(const Value& request, std::chrono::seconds timeout)
{
    struct Shared {
        std::mutex mutex;
        std::condition_variable done;
        std::optional<Answer> answer;
    };
    auto shared = std::make_shared<Shared>();
    auto connection = ConduitConnection::connectToService(JobManagerServiceName(), nullptr);
    connection->setEventHandler([](const ConduitEvent&) {});
    connection->resume();
    connection->sendWithReplyDescriptors(request, {}, nullptr, [shared](Result<Value> reply, ConduitDescriptors fds) {
        std::lock_guard lock(shared->mutex);
        Answer answer;
        if (reply.ok())
            answer.reply = std::move(reply).releaseValue();
        else
            answer.reply = statusError(kJobManagerUnreachable, "jobd: " + reply.error().localizedDescription());
        answer.descriptors = std::move(fds);
        shared->answer = std::move(answer);
        shared->done.notify_all();
    });
    std::unique_lock lock(shared->mutex);
    const bool answered = shared->done.wait_for(lock, timeout, [&] { return shared->answer.has_value(); });
    lock.unlock();
    connection->cancel();
    if (!answered)
        return Answer();
    lock.lock();
    return std::move(*shared->answer);
}

// The status of a reply, or kJobManagerUnreachable.
int statusCall(const Value& request, std::chrono::seconds timeout)
{
    auto answer = call(request, timeout);
    return answer.reply.ok() ? statusOf(answer.reply.value()) : int(answer.reply.error().code());
}

// Checks a reply that carries data: an error for any status but success.
Result<Value> checked(Answer& answer)
{
    if (!answer.reply.ok())
        return answer.reply.error();
    const Value& reply = answer.reply.value();
    if (const int status = statusOf(reply); status != kJobManagerSuccess) {
        const auto* error = reply.stringFor("error");
        return statusError(status, error ? *error : "jobd status " + std::to_string(status));
    }
    return reply;
}

int addService(const AuditToken& host, uint64_t startTime, const std::string& executablePath, const Value& overlay)
{
    return statusCall(Value::dictionary({ { "request", "add" }, { "pid", int64_t(host.pid) }, { "start", startTime },
                          { "path", executablePath }, { "overlay", overlay } }),
        kReplyTimeout);
}

// Cancels connections still open at their deadline, which answers their pending requests as
// unreachable. One thread for every asynchronous call, started with the first; it holds the
// connections weakly, so an answered call leaves only an expired entry behind.
void cancelAfter(const std::shared_ptr<ConduitConnection>& connection, std::chrono::seconds limit)
{
    struct Watchdog {
        std::mutex mutex;
        std::condition_variable changed;
        std::multimap<std::chrono::steady_clock::time_point, std::weak_ptr<ConduitConnection>> deadlines;

        void run()
        {
            std::unique_lock lock(mutex);
            for (;;) {
                if (deadlines.empty()) {
                    changed.wait(lock);
                    continue;
                }
                auto first = deadlines.begin();
                if (changed.wait_until(lock, first->first) == std::cv_status::no_timeout)
                    continue;
                auto expired = deadlines.begin()->second.lock();
                deadlines.erase(deadlines.begin());
                lock.unlock();
                if (expired)
                    expired->cancel();
                expired.reset();
                lock.lock();
            }
        }
    };
    static Watchdog* watchdog = [] {
        auto* made = new Watchdog; // lives as long as the process; its thread never ends
        std::thread([made] { made->run(); }).detach();
        return made;
    }();
    {
        std::lock_guard lock(watchdog->mutex);
        watchdog->deadlines.emplace(std::chrono::steady_clock::now() + limit, connection);
    }
    watchdog->changed.notify_one();
}

} // namespace

void JobManagerSetServiceName(const std::string& serviceName)
{
    std::lock_guard lock(s_nameMutex);
    s_serviceName = serviceName;
}

std::string JobManagerServiceName()
{
    static const std::string fallback = [] {
        // NOLINTNEXTLINE(concurrency-mt-unsafe): read once, before any other use.
        const char* configured = std::getenv("JOBD_SERVICE_NAME");
        return std::string(configured && *configured ? configured : kJobManagerServiceName);
    }();
    std::lock_guard lock(s_nameMutex);
    return s_serviceName.empty() ? fallback : s_serviceName;
}

int JobManagerAddService(pid_t hostPid, const std::string& executablePath, const Value& overlay)
{
    auto host = Process::forPid(hostPid);
    if (!host.ok())
        return kJobManagerHostGone;
    return JobManagerAddService(host.value(), executablePath, overlay);
}

int JobManagerAddService(const AuditToken& host, const std::string& executablePath, const Value& overlay)
{
    // Read through the token: the time is the token's process's, or the call fails here.
    auto started = Process::startTime(host);
    if (!started.ok())
        return kJobManagerHostGone;
    return addService(host, started.value(), executablePath, overlay);
}

int JobManagerRemoveService(const std::string& bundleIdentifier, const std::string& version)
{
    return statusCall(
        Value::dictionary({ { "request", "remove" }, { "identifier", bundleIdentifier }, { "version", version } }),
        kRemoveTimeout);
}

void JobManagerRemoveService(const std::string& bundleIdentifier, const std::string& version,
    std::shared_ptr<WorkQueue> queue, std::function<void(int)> completion)
{
    auto connection = ConduitConnection::connectToService(JobManagerServiceName(), nullptr);
    connection->setEventHandler([](const ConduitEvent&) {});
    connection->resume();
    // A jobd that stops answering (stopped, not dead) must not keep the caller waiting for ever.
    cancelAfter(connection, kRemoveTimeout);
    // The connection stays alive through its own pending request; it ends with the answer.
    connection->sendWithReply(
        Value::dictionary({ { "request", "remove" }, { "identifier", bundleIdentifier }, { "version", version } }),
        std::move(queue), [connection, completion = std::move(completion)](Result<Value> reply) {
            connection->cancel();
            completion(reply.ok() ? statusOf(reply.value()) : int(kJobManagerUnreachable));
        });
}

Result<JobLaunch> JobManagerLaunch(const std::string& executablePathOrBundleIdentifier)
{
    auto answer = call(
        Value::dictionary({ { "request", "launch" }, { "target", executablePathOrBundleIdentifier } }), kReplyTimeout);
    const Value reply = OM_TRY(checked(answer));
    if (answer.descriptors.size() != 1)
        return statusError(kJobManagerInvalid, "jobd answered a launch without a connection");
    JobLaunch launch;
    launch.pid = pid_t(reply["pid"].asInt64().value_or(-1));
    if (const auto* identifier = reply.stringFor("identifier"))
        launch.bundleIdentifier = *identifier;
    launch.connection = std::move(answer.descriptors.front());
    return launch;
}

Result<std::vector<JobInstanceInfo>> JobManagerList()
{
    auto answer = call(Value::dictionary({ { "request", "list" } }), kReplyTimeout);
    const Value reply = OM_TRY(checked(answer));
    std::vector<JobInstanceInfo> instances;
    for (const auto& entry : reply["instances"].elements()) {
        JobInstanceInfo info;
        info.hostPid = pid_t(entry["host"].asInt64().value_or(-1));
        if (const auto* identifier = entry.stringFor(kJobManagerBundleIdentifierKey))
            info.bundleIdentifier = *identifier;
        info.pid = pid_t(entry["pid"].asInt64().value_or(-1));
        if (const auto* profile = entry.stringFor("profile"))
            info.profile = *profile;
        info.busy = entry["busy"].asBool().value_or(false);
        instances.push_back(std::move(info));
    }
    return instances;
}

Result<Value> JobManagerCall(const Value& request)
{
    auto answer = call(request, kReplyTimeout);
    return checked(answer);
}

bool JobManagerServeInstance(const std::function<Value(const Value& request)>& answer)
{
    const char* fdText = std::getenv(kJobManagerInstanceFdVariable); // NOLINT(concurrency-mt-unsafe)
    if (!fdText)
        return false;
    auto queue = WorkQueue::create("instance");
    auto connection = ConduitConnection::adoptSocket(UniqueFd(std::atoi(fdText)), queue);
    std::mutex mutex;
    std::condition_variable closed;
    bool done = false;
    connection->setEventHandler([&](const ConduitEvent& event) {
        if (event.kind == ConduitEvent::Kind::ConnectionInvalid) {
            std::lock_guard lock(mutex);
            done = true;
            closed.notify_all();
            return;
        }
        const Value reply = answer(event.message);
        if (event.expectsReply())
            connection->sendReply(event.requestId, reply);
    });
    connection->resume();
    std::unique_lock lock(mutex);
    closed.wait(lock, [&] { return done; });
    lock.unlock();
    connection->cancel();
    return true;
}

} // namespace om
