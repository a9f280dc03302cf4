// Instances: stopping them ("remove"), reaping them, their busy assertions ("assert", "busy") and
// the list.
#include <dirent.h>
#include <signal.h>
#include <sys/syscall.h>
#include <sys/wait.h>

#include <cstdlib>
#include <deque>
#include <set>
#include <unordered_map>

#include "services/jobd/JobServer.h"
#include "services/jobd/JobServerState.h"

namespace om {

namespace {

// Longest parent chain walked from an assertion's peer to the instance it belongs to.
constexpr int kMaxAncestry = 32;
// Most bundle identifiers one busy query may name.
constexpr size_t kMaxBusyIdentifiers = 1024;

// Every process below root (not root itself), from a snapshot of /proc.
std::vector<pid_t> descendantsOf(pid_t root)
{
    std::unordered_multimap<pid_t, pid_t> children;
    if (DIR* proc = ::opendir("/proc")) {
        while (dirent* entry = ::readdir(proc)) {
            char* end = nullptr;
            const long pid = std::strtol(entry->d_name, &end, 10);
            if (*end != '\0' || pid <= 0)
                continue;
            if (auto parent = Process::parentOf(pid_t(pid)))
                children.emplace(*parent, pid_t(pid));
        }
        ::closedir(proc);
    }
    std::vector<pid_t> found;
    std::deque<pid_t> pending { root };
    while (!pending.empty()) {
        auto [begin, end] = children.equal_range(pending.front());
        pending.pop_front();
        for (auto it = begin; it != end; ++it) {
            found.push_back(it->second);
            pending.push_back(it->second);
        }
    }
    return found;
}

void signalAll(const std::vector<pid_t>& pids, int signal)
{
    for (pid_t pid : pids)
        ::kill(pid, signal);
}

} // namespace

void JobServer::removeService(const std::shared_ptr<Request>& request)
{
    if (!requireManager(*request))
        return;
    const auto* identifier = request->message.stringFor("identifier");
    const auto* version = request->message.stringFor("version");
    if (!identifier || !version)
        return reply(*request, kJobManagerInvalid, "\"remove\" needs identifier and version");
    const auto matches
        = [&](const JobSpec& job) { return job.bundleIdentifier == *identifier && job.version == *version; };
    // No host may start it again: what is being removed is being replaced or uninstalled.
    for (auto& [pid, host] : m_hosts)
        std::erase_if(host->grants, [&](const auto& grant) { return matches(*grant); });

    std::vector<Instance*> stopping;
    for (auto& [id, instance] : m_instances) {
        if (matches(*instance->job))
            stopping.push_back(instance.get());
    }
    if (stopping.empty()) {
        log().info("no instance of %s %s to stop", *identifier, *version);
        return reply(*request, kJobManagerNothingOnRecord);
    }
    log().notice("stopping %zu instances of %s %s", stopping.size(), *identifier, *version);
    auto remaining = std::make_shared<size_t>(stopping.size());
    for (Instance* instance : stopping) {
        instance->whenGone.push_back([request, remaining] {
            if (--*remaining == 0)
                reply(*request, kJobManagerSuccess);
        });
        if (!instance->terminating)
            terminate(*instance);
    }
}

// SIGTERM goes to what runs inside the sandbox, not to bwrap: bwrap would die of it and take the
// sandbox down with SIGKILL at once, leaving the instance no grace.
void JobServer::terminate(Instance& instance)
{
    instance.terminating = true;
    signalAll(descendantsOf(instance.pid), SIGTERM);
    std::weak_ptr<JobServer> weak = shared_from_this();
    m_watcher->after(killGrace(), [weak, id = instance.id] {
        if (auto self = weak.lock())
            self->killAfterGrace(id);
    });
}

void JobServer::killAfterGrace(uint64_t instanceId)
{
    auto found = m_instances.find(instanceId);
    if (found == m_instances.end())
        return;
    Instance& instance = *found->second;
    log().notice("instance %d of %s did not stop within %lld ms; killing it", instance.pid,
        instance.job->bundleIdentifier, static_cast<long long>(killGrace().count()));
    // Killing the sandbox's first process ends its whole pid namespace; bwrap follows once the
    // namespace is empty, so the instance is gone when bwrap is reaped.
    const auto inside = descendantsOf(instance.pid);
    if (inside.empty())
        (void)::syscall(SYS_pidfd_send_signal, instance.pidfd.get(), SIGKILL, nullptr, 0);
    else
        signalAll(inside, SIGKILL);
}

void JobServer::instanceExited(uint64_t instanceId)
{
    auto found = m_instances.find(instanceId);
    if (found == m_instances.end())
        return;
    auto instance = std::move(found->second);
    m_instances.erase(found);
    siginfo_t info {};
    if (::waitid(P_PIDFD, id_t(instance->pidfd.get()), &info, WEXITED) < 0)
        log().error("waitid for instance %d: %s", instance->pid, OMError::errnoDescription(errno));
    else if (info.si_code == CLD_EXITED)
        log().info(
            "instance %d of %s exited with status %d", instance->pid, instance->job->bundleIdentifier, info.si_status);
    else
        log().info(
            "instance %d of %s ended by signal %d", instance->pid, instance->job->bundleIdentifier, info.si_status);
    for (auto& done : instance->whenGone)
        done();
}

void JobServer::list(const std::shared_ptr<Request>& request)
{
    if (!request->client->mayList)
        return reply(*request, kJobManagerNotPermitted, "listing needs root, jobd's user or the manager entitlement");
    std::vector<Value> instances;
    for (const auto& [id, instance] : m_instances) {
        instances.push_back(Value::dictionary({
            { "host", int64_t(instance->hostPid) },
            { kJobManagerBundleIdentifierKey, instance->job->bundleIdentifier },
            { "pid", int64_t(instance->pid) },
            { "profile", instance->job->profile },
            { "busy", Value::boolean(instance->busyOwner != nullptr) },
        }));
    }
    reply(*request,
        Value::dictionary({ { "status", int64_t(kJobManagerSuccess) }, { "instances", Value::array(instances) } }));
}

// The instance a process belongs to: the one whose bwrap it descends from.
JobServer::Instance* JobServer::instanceOf(const AuditToken& peer)
{
    std::unordered_map<pid_t, Instance*> byPid;
    for (auto& [id, instance] : m_instances)
        byPid.emplace(instance->pid, instance.get());
    pid_t pid = peer.pid;
    Instance* found = nullptr;
    for (int step = 0; step < kMaxAncestry && pid > 1 && !found; ++step) {
        auto parent = Process::parentOf(pid);
        if (!parent)
            break;
        if (auto it = byPid.find(*parent); it != byPid.end())
            found = it->second;
        pid = *parent;
    }
    // The walk read a snapshot: it speaks for the peer only if the peer still runs now.
    return found && Process::isAlive(peer) ? found : nullptr;
}

void JobServer::assertBusy(const std::shared_ptr<Request>& request)
{
    const auto busy = request->message["busy"].asBool();
    if (!busy)
        return reply(*request, kJobManagerInvalid, "\"assert\" needs busy");
    Instance* instance = instanceOf(request->client->token);
    if (!instance) {
        log().error("pid %d is no instance of jobd; ignoring its assertion", request->client->token.pid);
        return reply(*request, kJobManagerNothingOnRecord, "not an instance launched by jobd");
    }
    instance->busyOwner = *busy ? request->client.get() : nullptr;
    log().info("instance %d of %s is %s", instance->pid, instance->job->bundleIdentifier, *busy ? "busy" : "idle");
    reply(*request, kJobManagerSuccess);
}

void JobServer::busy(const std::shared_ptr<Request>& request)
{
    if (!requireManager(*request))
        return;
    const Value& identifiers = request->message["identifiers"];
    if (!identifiers.isArray() || identifiers.elements().size() > kMaxBusyIdentifiers)
        return reply(*request, kJobManagerInvalid, "\"busy\" needs an array of at most 1024 identifiers");
    std::set<std::string, std::less<>> wanted;
    for (const auto& identifier : identifiers.elements()) {
        if (const auto* text = identifier.asString())
            wanted.insert(*text);
    }
    std::vector<Value> instances;
    for (const auto& [id, instance] : m_instances) {
        if (instance->busyOwner && wanted.contains(instance->job->bundleIdentifier))
            instances.push_back(Value::dictionary({ { kJobManagerBundleIdentifierKey, instance->job->bundleIdentifier },
                { "pid", int64_t(instance->pid) } }));
    }
    reply(*request,
        Value::dictionary({ { "status", int64_t(kJobManagerSuccess) }, { "instances", Value::array(instances) } }));
}

} // namespace om
