// The job manager's client side: the calls that omd, hosts and omctl make of jobd, the daemon on
// Conduit service "com.orvex.jobd" that launches plug-in executables in their sandboxes.
//
// omd (a client carrying kJobManagerEntitlement, running as root or as jobd's own user) records
// with JobManagerAddService that a host process may launch an executable with an activation
// overlay; the host then calls JobManagerLaunch and receives a connected socket to the new
// instance, which no other process can obtain. JobManagerRemoveService stops every instance of a
// bundle identifier and version. A grant lives as long as the host process it names.
//
// Every call is synchronous and opens its own connection. When jobd is not running the call fails
// at once (kJobManagerUnreachable); a jobd that stops answering is given up on after a bounded
// wait, so a caller never hangs.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/Process.h"
#include "platform/Result.h"
#include "platform/UniqueFd.h"
#include "platform/Value.h"
#include "platform/WorkQueue.h"

namespace om {

inline constexpr const char* kJobManagerServiceName = "com.orvex.jobd";
// The entitlement (boolean true) that lets a client record grants, stop instances and ask which
// instances are busy.
inline constexpr const char* kJobManagerEntitlement = "com.orvex.jobd.manager";
// The instance property that carries its bundle identifier (busy query, list).
inline constexpr const char* kJobManagerBundleIdentifierKey = "com.orvex.jobd.bundle-identifier";
// The environment variable that tells an instance the descriptor of its host connection.
inline constexpr const char* kJobManagerInstanceFdVariable = "JOBD_INSTANCE_FD";
// The descriptor number of an instance's host connection inside the sandbox.
inline constexpr int kJobManagerInstanceFd = 3;
// Error domain of Result errors that carry a status as their code.
inline constexpr const char* kJobManagerErrorDomain = "com.orvex.jobd";

// Statuses of job manager calls.
enum JobManagerStatus : int {
    kJobManagerSuccess = 0,
    kJobManagerUnreachable = 1, // jobd is not running, or closed the connection, or did not answer
    kJobManagerNotPermitted = 2, // the caller may not do this
    kJobManagerNothingOnRecord = 3, // no such grant or instance
    kJobManagerInvalid = 4, // a malformed request: missing executable, bad overlay or profile
    kJobManagerLimit = 5, // a per-host bound was reached
    kJobManagerLaunchFailed = 6, // the sandbox could not be started
    kJobManagerHostGone = 7, // the host process is gone, or its pid names another process now
};

// One running instance, as the list query reports it.
struct JobInstanceInfo {
    pid_t hostPid = -1;
    std::string bundleIdentifier;
    pid_t pid = -1; // the sandbox's outermost process, as jobd sees it
    std::string profile;
    bool busy = false;
};

// What a launch hands the host.
struct JobLaunch {
    pid_t pid = -1;
    std::string bundleIdentifier;
    UniqueFd connection; // a connected stream socket; the instance holds the other end
};

// Records that the host may launch executablePath with overlay. The host is named by pid; the
// call reads the process's start time now and jobd refuses a pid that names another process by
// then. Prefer the AuditToken form when the host is a connected peer: its start time is checked
// against the peer's pidfd, so a pid reused since the host connected is never granted anything.
int JobManagerAddService(pid_t hostPid, const std::string& executablePath, const Value& overlay);
int JobManagerAddService(const AuditToken& host, const std::string& executablePath, const Value& overlay);

// Stops every instance of bundleIdentifier and version (SIGTERM, then SIGKILL after jobd's grace
// period) and answers once they are gone: 0, kJobManagerNothingOnRecord when none ran, or an
// error status. The asynchronous form answers exactly once, on queue.
int JobManagerRemoveService(const std::string& bundleIdentifier, const std::string& version);
void JobManagerRemoveService(const std::string& bundleIdentifier, const std::string& version,
    std::shared_ptr<WorkQueue> queue, std::function<void(int)> completion);

// Launches, for the calling process, the executable named by path or by bundle identifier (what
// the grant records). The error's code is a JobManagerStatus.
Result<JobLaunch> JobManagerLaunch(const std::string& executablePathOrBundleIdentifier);

// The running instances.
Result<std::vector<JobInstanceInfo>> JobManagerList();

// One request to jobd on its own connection: the reply when its status is success, otherwise an
// error whose code is the status. For the other clients of jobd (process assertions).
Result<Value> JobManagerCall(const Value& request);

// The instance side: answers each request on the host connection jobd gave this process (the
// descriptor named by kJobManagerInstanceFdVariable) with answer's reply, until the host closes
// it. False at once when this process was not started by jobd.
bool JobManagerServeInstance(const std::function<Value(const Value& request)>& answer);

// Service name to use instead of kJobManagerServiceName (tests, a second jobd); empty restores
// it. Without one, JOBD_SERVICE_NAME (which jobd sets for its instances) is used when set.
void JobManagerSetServiceName(const std::string& serviceName);
std::string JobManagerServiceName();

} // namespace om
