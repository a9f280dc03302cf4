#include "omd/OMDServer.h"

#include <algorithm>
#include <mutex>
#include <semaphore>

#include "Ombrel/OMLog.h"
#include "omd/OMDConduitClient.h"
#include "omd/OMDPlugInHold.h"
#include "platform/JobManager.h"
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

Value describeRecords(const RegistrarPlugInRecords& records)
{
    ArrayBuilder described;
    for (const auto& record : records)
        described.append(Value::string(record->description()));
    return described.build();
}

// The version jobd knows an instance by: the one its bundle declares, else "1".
std::string jobVersion(const RegistrarPlugInRecord& record)
{
    if (const std::string* version = record.infoDictionary().stringFor("VBBundleVersion"))
        return *version;
    return "1";
}

Value optionalText(const std::optional<std::string>& text)
{
    return text ? Value::string(*text) : Value();
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
    Value described = describeRecords(records);
    terminatePlugIns(records, [described] { OMLog::ops().debug("removal complete for %@", described); });
}

bool OMDServer::holdOnPlugIn(const std::shared_ptr<OMDPlugIn>& plugIn)
{
    bool held = false;
    m_syncQueue->sync([&] {
        held = std::any_of(m_holds.begin(), m_holds.end(), [&](const auto& hold) { return hold->blocks(plugIn); });
    });
    return held;
}

void OMDServer::addHold(std::shared_ptr<OMDPlugInHold> hold)
{
    m_syncQueue->sync([&] { m_holds.push_back(std::move(hold)); });
    notifyAnnotationChange();
}

void OMDServer::unholdToken(const Uuid& token)
{
    m_syncQueue->sync([&] {
        auto found
            = std::find_if(m_holds.begin(), m_holds.end(), [&](const auto& hold) { return hold->uuid() == token; });
        if (found == m_holds.end())
            return;
        OMLog::ops().debug("releasing plug-in hold %{public}@ at client's request", token.string());
        m_holds.erase(found);
        notifyAnnotationChange();
    });
}

void OMDServer::unholdClient(const OMDConduitClient& client)
{
    m_syncQueue->sync([&] {
        for (;;) {
            auto found
                = std::find_if(m_holds.begin(), m_holds.end(), [&](const auto& hold) { return hold->heldBy(client); });
            if (found == m_holds.end())
                return;
            OMLog::ops().debug(
                "releasing plug-in hold %{public}@ for dead client pid %d", (*found)->uuid().string(), client.pid());
            m_holds.erase(found);
            notifyAnnotationChange();
        }
    });
}

void OMDServer::terminatePlugIns(const RegistrarPlugInRecords& records, std::function<void()> reply)
{
    // Queues of this call alone: jobd's answers arrive on one, the wait for all of them runs on the
    // other, so that neither the caller's queue nor another termination is held up.
    auto killer = WorkQueue::create("killer");
    auto waiter = WorkQueue::create("killer-waiter");
    auto replies = std::make_shared<std::counting_semaphore<>>(0);
    const int count = static_cast<int>(records.size());

    for (const auto& record : records) {
        const std::string version = jobVersion(*record);
        const std::string uuid = record->uuid().string();
        OMLog::ops().debug("requesting termination for %@(%@) jobd:%@ %@", optionalText(record->bundleIdentifier()),
            optionalText(record->bundleVersion()), version, uuid);
        JobManagerRemoveService(record->bundleIdentifier().value_or(""), version, killer, [uuid, replies](int status) {
            if (status == kJobManagerSuccess)
                OMLog::ops().info("one or more plug-ins have been terminated for uuid=%@", uuid);
            else if (status == kJobManagerNothingOnRecord)
                OMLog::ops().debug("jobd reported no plug-ins on record for uuid=%@", uuid);
            else
                OMLog::ops().error("jobd error attempting to terminate plug-ins: error=%d for uuid=%@", status, uuid);
            replies->release();
        });
    }

    // The block keeps both queues alive until every answer has been counted.
    waiter->async([count, replies, reply = std::move(reply), killer, waiter] {
        OMLog::ops().debug("waiting for %d termination replies", count);
        for (int index = 0; index < count; ++index) {
            OMLog::ops().debug("awaiting termination reply #%d", index);
            replies->acquire();
        }
        OMLog::ops().debug("sending termination reply");
        reply();
    });
}

} // namespace om
