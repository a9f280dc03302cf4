#include "omd/OMDServer.h"

#include <algorithm>
#include <mutex>

#include "Ombrel/OMLog.h"
#include "omd/OMDConduitClient.h"
#include "omd/OMDPlugInHold.h"
#include "platform/RunLoop.h"

namespace om {

namespace {

struct ProcessServer {
    std::mutex mutex;
    std::weak_ptr<OMDServer> server;
};

ProcessServer& processServer()
{
    static auto* shared = new ProcessServer; // leaked: queue threads may ask while statics unwind
    return *shared;
}

// FIXME: describe each record by its bundle identifier and UUID once the Registrar's record type
// is in the tree; until then the records are opaque here and only their addresses can be shown.
Value describeRecords(const RegistrarPlugInRecords& records)
{
    ArrayBuilder described;
    for (const auto& record : records)
        described.append(Value::string(format("<RegistrarPlugInRecord %p>", static_cast<const void*>(record.get()))));
    return described.build();
}

} // namespace

OMDServer::OMDServer(std::optional<std::string> databasePath)
    : OMDatabase(std::move(databasePath))
{
}

OMDServer::~OMDServer()
{
    if (m_service)
        m_service->cancel();
}

std::shared_ptr<OMDServer> OMDServer::initForService(
    const std::string& serviceName, std::optional<std::string> databasePath)
{
    std::shared_ptr<OMDServer> server(new OMDServer(std::move(databasePath)));
    if (!server->openDatabase().ok())
        return nullptr;

    server->m_conduitQueue = WorkQueue::create("conduit", QualityOfService::Default);
    server->m_mainQueue = WorkQueue::create("service", QualityOfService::UserInitiated, 0);
    server->m_syncQueue = WorkQueue::create("serverSync");

    auto listener = ConduitListener::create(serviceName, server->m_conduitQueue);
    if (!listener.ok()) {
        OMLog::ops().error("unable to listen on %s: %s", serviceName, listener.error().localizedDescription());
        return nullptr;
    }
    server->m_service = std::move(listener).releaseValue();

    {
        auto& shared = processServer();
        std::lock_guard lock(shared.mutex);
        shared.server = server;
    }
    server->setDelegate(std::static_pointer_cast<OMDatabaseDelegate>(server));

    // Weak: the listener lives inside the server, so a strong capture would be a cycle.
    std::weak_ptr<OMDServer> weakServer = server;
    server->m_service->setConnectionHandler([weakServer](std::shared_ptr<ConduitConnection> connection) {
        if (auto strongServer = weakServer.lock())
            strongServer->acceptConnection(std::move(connection));
    });
    server->m_userPrefs = std::make_unique<OMDUserPrefs>();
    return server;
}

std::shared_ptr<OMDServer> OMDServer::server()
{
    auto& shared = processServer();
    std::lock_guard lock(shared.mutex);
    return shared.server.lock();
}

void OMDServer::acceptConnection(std::shared_ptr<ConduitConnection> connection)
{
    m_conduitQueue->assertCurrent();
    // The listener hands over nothing but new connections; an empty one must never become a client.
    if (!connection)
        return;
    auto self = std::static_pointer_cast<OMDServer>(shared_from_this());
    // The connection keeps the record alive through its context; the server keeps no list.
    (void)OMDConduitClient::initWithConnection(std::move(connection), std::move(self));
}

void OMDServer::startListening()
{
    m_service->resume();
}

void OMDServer::run()
{
    startListening();
    RunLoop::runForever();
}

void OMDServer::submitWork(std::function<void()> work)
{
    m_mainQueue->async(std::move(work));
}

void OMDServer::removedPlugIns(const RegistrarPlugInRecords& records)
{
    // FIXME: stop the plug-ins' running instances (terminatePlugIns) and log from its completion,
    // once holds and the job manager are in the tree. Until then there is nothing to wait for.
    OMLog::ops().debug("removal complete for %@", describeRecords(records));
}

bool OMDServer::holdOnPlugIn(const std::shared_ptr<OMDPlugIn>& plugIn)
{
    bool held = false;
    m_syncQueue->sync([&] {
        held = std::any_of(m_holds.begin(), m_holds.end(), [&](const auto& hold) { return hold->blocks(plugIn); });
    });
    return held;
}

void OMDServer::unholdClient(const OMDConduitClient&)
{
    // FIXME: walk m_holds on m_syncQueue once the "lock" request creates holds. Until then no
    // client can own one, so a dying client has none to release.
}

} // namespace om
