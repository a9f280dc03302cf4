// JobServer: jobd itself. It listens on its Conduit service, records which host processes may
// launch which executables (grants), launches instances under bubblewrap, stops them, keeps their
// busy assertions and answers the list and busy queries.
//
// Requests are dictionaries with "request" naming the operation; every reply holds "status" (a
// JobManagerStatus) and, on failure, "error" (text):
//   "add"     {"pid", "start", "path", "overlay"}        manager only
//   "launch"  {"target": executable path or bundle id}   the granted host; the reply carries
//             {"pid", "identifier"} and one descriptor, the host's end of the instance socket
//   "remove"  {"identifier", "version"}                  manager only; answered once they are gone
//   "list"    {}                  -> {"instances": [...]} manager, root or jobd's own user
//   "assert"  {"busy": boolean}                          an instance, about itself
//   "busy"    {"identifiers": [...]} -> {"instances": [...]} manager only
//
// All state lives on the "service" queue. Bounds (what one host can make jobd hold): kMaxHosts
// hosts with grants, kMaxGrantsPerHost grants and kMaxInstancesPerHost running instances per host,
// kMaxRequestsInFlight unanswered requests per connection (beyond it the connection is closed).
#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/Conduit.h"
#include "platform/JobManager.h"
#include "platform/Log.h"
#include "platform/WorkQueue.h"
#include "services/jobd/JobSpec.h"
#include "services/jobd/JobWatcher.h"

namespace om {

class JobServer : public std::enable_shared_from_this<JobServer> {
public:
    static constexpr size_t kMaxHosts = 1024;
    static constexpr size_t kMaxGrantsPerHost = 64;
    static constexpr size_t kMaxInstancesPerHost = 32;
    static constexpr size_t kMaxRequestsInFlight = 64;
    static constexpr std::chrono::milliseconds kDefaultKillGrace { 5000 };

    static Result<std::shared_ptr<JobServer>> create(const std::string& serviceName);
    // Starts listening; returns at once.
    void start();

    // JOBD_KILL_GRACE_MS, else kDefaultKillGrace.
    static std::chrono::milliseconds killGrace();
    static const Log& log();

private:
    struct Client;
    struct Request;
    struct Host;
    struct Instance;
    using Handler = void (JobServer::*)(const std::shared_ptr<Request>&);

    JobServer(std::string serviceName, std::shared_ptr<WorkQueue> queue, std::shared_ptr<JobWatcher> watcher);

    // Connections and dispatch (JobServer.cpp).
    void accept(const std::shared_ptr<ConduitConnection>& connection);
    void received(const std::shared_ptr<Client>& client, const ConduitEvent& event);
    void dispatch(const std::shared_ptr<Request>& request);
    void closed(const std::shared_ptr<Client>& client);
    static void reply(Request& request, JobManagerStatus status, const std::string& error = {});
    static void reply(Request& request, const Value& body, ConduitDescriptors descriptors = {});
    static bool requireManager(Request& request);

    // Grants and launches (JobServerGrants.cpp).
    void addService(const std::shared_ptr<Request>& request);
    void launch(const std::shared_ptr<Request>& request);
    void hostExited(pid_t pid, uint64_t generation);
    Host* liveHost(const AuditToken& peer);

    // Instances (JobServerInstances.cpp).
    void removeService(const std::shared_ptr<Request>& request);
    void list(const std::shared_ptr<Request>& request);
    void assertBusy(const std::shared_ptr<Request>& request);
    void busy(const std::shared_ptr<Request>& request);
    void terminate(Instance& instance);
    void killAfterGrace(uint64_t instanceId);
    void instanceExited(uint64_t instanceId);
    Instance* instanceOf(const AuditToken& peer);

    const std::string m_serviceName;
    const std::shared_ptr<WorkQueue> m_queue; // "service"
    const std::shared_ptr<JobWatcher> m_watcher;
    std::shared_ptr<ConduitListener> m_listener;
    const std::string m_bwrap;
    const std::string m_profiles;

    // "service" queue only.
    std::unordered_map<pid_t, std::unique_ptr<Host>> m_hosts;
    std::map<uint64_t, std::unique_ptr<Instance>> m_instances; // by id, in launch order
    uint64_t m_lastInstanceId = 0;
    uint64_t m_lastHostGeneration = 0;
};

} // namespace om
