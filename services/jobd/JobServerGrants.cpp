// Grants and launches: "add" records what a host may launch; "launch" starts it for that host.
#include <sys/socket.h>

#include <cstdlib>

#include "platform/Conduit.h"
#include "services/jobd/JobLauncher.h"
#include "services/jobd/JobServer.h"
#include "services/jobd/JobServerState.h"
#include "services/jobd/SandboxProfile.h"

namespace om {

namespace {

// Variables of jobd's own environment that an instance inherits unless its overlay sets them.
constexpr const char* kInheritedVariables[] = { "EVLOG_LEVEL", "EVLOG_STDERR", "SANDBOX_KEY" };

std::map<std::string, std::string> instanceEnvironment(const JobSpec& job, const std::string& serviceName)
{
    auto environment = job.environment;
    environment.try_emplace("PATH", "/usr/bin:/bin");
    for (const char* name : kInheritedVariables) {
        // NOLINTNEXTLINE(concurrency-mt-unsafe): jobd never changes its environment.
        if (const char* value = std::getenv(name))
            environment.try_emplace(name, value);
    }
    // Set last: the instance's own connections depend on them.
    environment[kJobManagerInstanceFdVariable] = std::to_string(kJobManagerInstanceFd);
    environment["CONDUIT_DIR"] = Conduit::directory();
    environment["JOBD_SERVICE_NAME"] = serviceName;
    return environment;
}

} // namespace

void JobServer::addService(const std::shared_ptr<Request>& request)
{
    if (!requireManager(*request))
        return;
    const Value& message = request->message;
    const auto pid = message["pid"].asInt64();
    const auto start = message["start"].asUInt64();
    const auto* path = message.stringFor("path");
    if (!pid || *pid <= 0 || *pid > INT32_MAX || !start || !path)
        return reply(*request, kJobManagerInvalid, "\"add\" needs pid, start and path");
    auto job = JobSpec::fromOverlay(*path, message["overlay"]);
    if (!job.ok())
        return reply(*request, kJobManagerInvalid, job.error().localizedDescription());
    if (auto profile = SandboxProfile::load(m_profiles, job->profile); !profile.ok())
        return reply(*request, kJobManagerInvalid, profile.error().localizedDescription());

    auto found = m_hosts.find(pid_t(*pid));
    if (found != m_hosts.end() && (!Process::isAlive(found->second->token) || found->second->startTime != *start)) {
        // The exit event is on its way (or the caller names a newer process): the record is stale.
        m_watcher->unwatch(found->second->token.pidfd->get(), found->second->watchKey);
        m_hosts.erase(found);
        found = m_hosts.end();
    }
    if (found == m_hosts.end()) {
        if (m_hosts.size() >= kMaxHosts)
            return reply(*request, kJobManagerLimit, "jobd holds grants for " + std::to_string(kMaxHosts) + " hosts");
        auto token = Process::forPid(pid_t(*pid));
        if (!token.ok())
            return reply(*request, kJobManagerHostGone, token.error().localizedDescription());
        auto started = Process::startTime(token.value());
        if (!started.ok() || started.value() != *start) {
            log().error("refusing grant for pid %lld: it names another process now", static_cast<long long>(*pid));
            return reply(*request, kJobManagerHostGone, "pid " + std::to_string(*pid) + " names another process");
        }
        auto host = std::make_unique<Host>();
        host->token = std::move(token).releaseValue();
        host->startTime = *start;
        host->generation = ++m_lastHostGeneration;
        std::weak_ptr<JobServer> weak = shared_from_this();
        host->watchKey
            = m_watcher->watch(host->token.pidfd->get(), [weak, hostPid = pid_t(*pid), generation = host->generation] {
                  if (auto self = weak.lock())
                      self->hostExited(hostPid, generation);
              });
        if (host->watchKey == 0)
            return reply(*request, kJobManagerLimit, "cannot watch host " + std::to_string(*pid));
        found = m_hosts.emplace(pid_t(*pid), std::move(host)).first;
    }

    auto& grants = found->second->grants;
    auto shared = std::make_shared<const JobSpec>(std::move(job).releaseValue());
    auto same = std::find_if(grants.begin(), grants.end(),
        [&](const auto& grant) { return grant->executablePath == shared->executablePath; });
    if (same != grants.end()) {
        *same = shared;
    } else if (grants.size() >= kMaxGrantsPerHost) {
        log().error("host %lld already holds %zu grants; refusing %s", static_cast<long long>(*pid), grants.size(),
            shared->executablePath);
        return reply(*request, kJobManagerLimit,
            "host " + std::to_string(*pid) + " holds " + std::to_string(grants.size()) + " grants, the most allowed");
    } else {
        grants.push_back(shared);
    }
    log().info("host %lld may launch %s (%s %s) in profile %s", static_cast<long long>(*pid), shared->executablePath,
        shared->bundleIdentifier, shared->version, shared->profile);
    reply(*request, kJobManagerSuccess);
}

JobServer::Host* JobServer::liveHost(const AuditToken& peer)
{
    auto found = m_hosts.find(peer.pid);
    if (found == m_hosts.end())
        return nullptr;
    // Both alive with the same pid: one process. A dead record is about to be dropped.
    if (!Process::isAlive(found->second->token) || !Process::isAlive(peer))
        return nullptr;
    return found->second.get();
}

void JobServer::launch(const std::shared_ptr<Request>& request)
{
    const auto& peer = request->client->token;
    const auto* target = request->message.stringFor("target");
    if (!target)
        return reply(*request, kJobManagerInvalid, "\"launch\" needs a target");
    Host* host = liveHost(peer);
    if (!host) {
        log().error("pid %d holds no grant; refusing to launch %s", peer.pid, *target);
        return reply(*request, kJobManagerNotPermitted, "pid " + std::to_string(peer.pid) + " holds no grant");
    }
    auto grant = std::find_if(host->grants.begin(), host->grants.end(),
        [&](const auto& job) { return job->executablePath == *target || job->bundleIdentifier == *target; });
    if (grant == host->grants.end()) {
        log().error("pid %d holds no grant for %s", peer.pid, *target);
        return reply(*request, kJobManagerNotPermitted, "no grant for " + *target);
    }
    const auto job = *grant;
    size_t running = 0;
    for (const auto& [id, instance] : m_instances)
        running += instance->hostPid == peer.pid ? 1 : 0;
    if (running >= kMaxInstancesPerHost)
        return reply(*request, kJobManagerLimit,
            "host " + std::to_string(peer.pid) + " runs " + std::to_string(running) + " instances, the most allowed");
    auto profile = SandboxProfile::load(m_profiles, job->profile);
    if (!profile.ok())
        return reply(*request, kJobManagerLaunchFailed, profile.error().localizedDescription());

    int pair[2];
    if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) < 0)
        return reply(*request, kJobManagerLaunchFailed, OMError::fromErrno("socketpair", errno).localizedDescription());
    UniqueFd hostEnd(pair[0]);
    UniqueFd instanceEnd(pair[1]);
    auto child = JobLauncher::spawn(m_bwrap, profile.value()->arguments(*job, Conduit::socketPath(m_serviceName)),
        instanceEnvironment(*job, m_serviceName), instanceEnd, kJobManagerInstanceFd);
    instanceEnd.reset();
    if (!child.ok()) {
        log().error("cannot launch %s: %s", job->executablePath, child.error().localizedDescription());
        return reply(*request, kJobManagerLaunchFailed, child.error().localizedDescription());
    }

    auto instance = std::make_unique<Instance>();
    instance->id = ++m_lastInstanceId;
    instance->pid = child->pid;
    instance->pidfd = std::move(child->pidfd);
    instance->hostPid = peer.pid;
    instance->job = job;
    std::weak_ptr<JobServer> weak = shared_from_this();
    instance->watchKey = m_watcher->watch(instance->pidfd.get(), [weak, id = instance->id] {
        if (auto self = weak.lock())
            self->instanceExited(id);
    });
    log().notice(
        "launched %s for host %d: pid %d, profile %s", job->bundleIdentifier, peer.pid, instance->pid, job->profile);
    const pid_t pid = instance->pid;
    m_instances.emplace(instance->id, std::move(instance));

    ConduitDescriptors descriptors;
    descriptors.push_back(std::move(hostEnd));
    reply(*request,
        Value::dictionary({ { "status", int64_t(kJobManagerSuccess) }, { "pid", int64_t(pid) },
            { "identifier", job->bundleIdentifier } }),
        std::move(descriptors));
}

void JobServer::hostExited(pid_t pid, uint64_t generation)
{
    auto found = m_hosts.find(pid);
    if (found == m_hosts.end() || found->second->generation != generation)
        return;
    log().info("host %d exited; its %zu grants are gone", pid, found->second->grants.size());
    m_hosts.erase(found);
}

} // namespace om
