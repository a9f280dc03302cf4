#include "services/jobd/JobServer.h"

#include <unistd.h>

#include <cstdlib>

#include "platform/CodeSigning.h"
#include "services/jobd/JobLauncher.h"
#include "services/jobd/JobServerState.h"
#include "services/jobd/SandboxProfile.h"

namespace om {

namespace {

// Whether the peer may manage jobs: it carries the manager entitlement, in an executable whose
// owner may grant entitlements, and runs as root or as our own user.
bool isManager(const AuditToken& token)
{
    if (token.uid != 0 && token.uid != ::geteuid())
        return false;
    auto task = CodeSigningTask::create(token);
    if (!task || !task->trusted())
        return false;
    auto value = task->entitlementValue(kJobManagerEntitlement);
    return value.ok() && value.value().asBool().value_or(false);
}

} // namespace

const Log& JobServer::log()
{
    static const Log* log = [] {
        auto created = Log::create("com.orvex.jobd", "jobs");
        return created.ok() ? new Log(*created.value()) : &Log::defaultLog();
    }();
    return *log;
}

std::chrono::milliseconds JobServer::killGrace()
{
    // NOLINTNEXTLINE(concurrency-mt-unsafe): jobd never changes its environment.
    const char* configured = std::getenv("JOBD_KILL_GRACE_MS");
    if (!configured || !*configured)
        return kDefaultKillGrace;
    char* end = nullptr;
    const long long value = std::strtoll(configured, &end, 10);
    if (*end != '\0' || value < 0)
        return kDefaultKillGrace;
    return std::chrono::milliseconds(value);
}

Result<std::shared_ptr<JobServer>> JobServer::create(const std::string& serviceName)
{
    auto queue = WorkQueue::create("service", QualityOfService::UserInitiated);
    auto watcher = OM_TRY(JobWatcher::create(queue));
    std::shared_ptr<JobServer> server(new JobServer(serviceName, queue, std::move(watcher)));
    server->m_listener = OM_TRY(ConduitListener::create(serviceName, queue));
    return server;
}

JobServer::JobServer(std::string serviceName, std::shared_ptr<WorkQueue> queue, std::shared_ptr<JobWatcher> watcher)
    : m_serviceName(std::move(serviceName))
    , m_queue(std::move(queue))
    , m_watcher(std::move(watcher))
    , m_bwrap(JobLauncher::bwrapPath())
    , m_profiles(SandboxProfile::directory())
{
}

void JobServer::start()
{
    std::weak_ptr<JobServer> weak = shared_from_this();
    m_listener->setConnectionHandler([weak](std::shared_ptr<ConduitConnection> connection) {
        if (auto self = weak.lock())
            self->accept(connection);
    });
    m_listener->resume();
    log().notice("jobd listening on %s (bwrap %s, profiles %s, grace %lld ms)", m_listener->socketPath(), m_bwrap,
        m_profiles, static_cast<long long>(killGrace().count()));
}

// On the service queue.
void JobServer::accept(const std::shared_ptr<ConduitConnection>& connection)
{
    auto client = std::make_shared<Client>();
    client->connection = connection;
    client->token = connection->auditToken();
    client->manager = isManager(client->token);
    client->mayList = client->manager || client->token.uid == 0 || client->token.uid == ::geteuid();
    log().debug("connection from pid %d (uid %u)%s", client->token.pid, unsigned(client->token.uid),
        client->manager ? ", manager" : "");
    std::weak_ptr<JobServer> weak = shared_from_this();
    // Events arrive on the I/O thread, so that a flood is counted before it is queued.
    connection->setEventHandler([weak, client](const ConduitEvent& event) {
        auto self = weak.lock();
        if (!self)
            return;
        if (event.kind == ConduitEvent::Kind::ConnectionInvalid) {
            self->m_queue->async([self, client] { self->closed(client); });
            return;
        }
        if (event.kind != ConduitEvent::Kind::Message)
            return;
        if (client->inFlight.fetch_add(1) >= kMaxRequestsInFlight) {
            log().error(
                "pid %d has %zu requests waiting; closing its connection", client->token.pid, kMaxRequestsInFlight);
            client->connection->cancel();
            return;
        }
        self->m_queue->async([self, client, event] { self->received(client, event); });
    });
    connection->resume();
}

void JobServer::received(const std::shared_ptr<Client>& client, const ConduitEvent& event)
{
    auto request = std::make_shared<Request>();
    request->client = client;
    request->message = event.message;
    request->id = event.requestId;
    if (!event.message.isDictionary() || !event.message.stringFor("request")) {
        log().error("pid %d sent a message that is no request", client->token.pid);
        reply(*request, kJobManagerInvalid, "not a request");
        return;
    }
    dispatch(request);
}

void JobServer::dispatch(const std::shared_ptr<Request>& request)
{
    static const std::map<std::string, Handler, std::less<>> handlers = {
        { "add", &JobServer::addService },
        { "launch", &JobServer::launch },
        { "remove", &JobServer::removeService },
        { "list", &JobServer::list },
        { "assert", &JobServer::assertBusy },
        { "busy", &JobServer::busy },
    };
    const std::string& name = *request->message.stringFor("request");
    auto found = handlers.find(name);
    if (found == handlers.end()) {
        reply(*request, kJobManagerInvalid, "unknown request " + name);
        return;
    }
    (this->*found->second)(request);
}

void JobServer::closed(const std::shared_ptr<Client>& client)
{
    for (auto& [id, instance] : m_instances) {
        if (instance->busyOwner == client.get()) {
            log().info("instance %d of %s is idle: its assertion connection closed", instance->pid,
                instance->job->bundleIdentifier);
            instance->busyOwner = nullptr;
        }
    }
}

void JobServer::reply(Request& request, JobManagerStatus status, const std::string& error)
{
    DictionaryBuilder body;
    body.set("status", int64_t(status));
    if (!error.empty())
        body.set("error", error);
    reply(request, body.build());
}

void JobServer::reply(Request& request, const Value& body, ConduitDescriptors descriptors)
{
    if (request.answered)
        return;
    request.answered = true;
    request.client->inFlight.fetch_sub(1);
    if (request.id != 0)
        request.client->connection->sendReply(request.id, body, std::move(descriptors));
}

bool JobServer::requireManager(Request& request)
{
    if (request.client->manager)
        return true;
    log().error("pid %d may not ask \"%s\": it lacks %s", request.client->token.pid,
        *request.message.stringFor("request"), kJobManagerEntitlement);
    reply(request, kJobManagerNotPermitted, std::string("requires the entitlement ") + kJobManagerEntitlement);
    return false;
}

} // namespace om
