// The daemon's one server: the plug-in database plus the queues requests run on, the listening
// endpoint of the Conduit service and the list of plug-in holds. Made once by main, never destroyed.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "omd/OMDUserPrefs.h"
#include "omd/OMDatabase.h"
#include "omd/OMDatabaseDelegate.h"
#include "platform/Conduit.h"
#include "platform/WorkQueue.h"

namespace om {

class OMDConduitClient;
class OMDPlugIn;
class OMDPlugInHold;

class OMDServer final : public OMDatabase, public OMDatabaseDelegate {
public:
    static constexpr const char* kDefaultServiceName = "com.orvex.ombrel.omd";

    // None when the database cannot be opened or the service name cannot be listened on (for
    // instance because another live daemon owns it).
    static std::shared_ptr<OMDServer> initForService(
        const std::string& serviceName, std::optional<std::string> databasePath);
    // The process-wide server, for code that holds no reference to it; null before the first one
    // is made. Only a weak reference is kept: main owns the server for the life of the process.
    static std::shared_ptr<OMDServer> server();

    ~OMDServer() override;

    // Resumes the listening endpoint and parks the calling thread for good.
    [[noreturn]] void run();
    // The first half of run: from here on connections are accepted. Tests that run a server
    // in-process call this instead of run.
    void startListening();

    // Every request's work runs here, one at a time, in submission order.
    void submitWork(std::function<void()> work);

    void removedPlugIns(const RegistrarPlugInRecords& records) override;
    // True when a live hold blocks the plug-in. Enters "serverSync".
    bool holdOnPlugIn(const std::shared_ptr<OMDPlugIn>& plugIn);
    // Appends the hold, then announces the change once "serverSync" is left.
    void addHold(std::shared_ptr<OMDPlugInHold> hold);
    // Releases the hold with this token, if there is one.
    void unholdToken(const Uuid& token);
    // Releases every hold whose client is this very record. Called when its connection dies.
    void unholdClient(const OMDConduitClient& client);
    // Asks jobd to stop the running instances of every record and returns at once; reply runs on
    // a queue of this call's own once jobd has answered every request.
    void terminatePlugIns(const RegistrarPlugInRecords& records, std::function<void()> reply);

    const std::shared_ptr<WorkQueue>& conduitQueue() const { return m_conduitQueue; }
    const std::shared_ptr<WorkQueue>& mainQueue() const { return m_mainQueue; }
    const std::shared_ptr<WorkQueue>& syncQueue() const { return m_syncQueue; }
    const std::shared_ptr<ConduitListener>& service() const { return m_service; }
    OMDUserPrefs& userPrefs() { return *m_userPrefs; }

private:
    explicit OMDServer(std::optional<std::string> databasePath);
    void acceptConnection(std::shared_ptr<ConduitConnection> connection);

    std::shared_ptr<WorkQueue> m_conduitQueue;
    std::shared_ptr<WorkQueue> m_mainQueue;
    std::shared_ptr<ConduitListener> m_service;
    // The user's preference domain: the plug-in exclusions.
    std::unique_ptr<OMDUserPrefs> m_userPrefs;
    // Live holds in the order they were granted; touched only on m_syncQueue.
    std::vector<std::shared_ptr<OMDPlugInHold>> m_holds;
    std::shared_ptr<WorkQueue> m_syncQueue;
};

} // namespace om
