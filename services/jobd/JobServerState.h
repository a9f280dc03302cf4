// The records behind JobServer, shared by its source files; nothing else includes it.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <vector>

#include "platform/Process.h"
#include "services/jobd/JobServer.h"

namespace om {

struct JobServer::Client {
    std::shared_ptr<ConduitConnection> connection;
    AuditToken token;
    bool manager = false; // carries the manager entitlement, as root or jobd's own user
    bool mayList = false; // manager, root or jobd's own user
    std::atomic<size_t> inFlight { 0 }; // requests delivered and not yet answered
};

struct JobServer::Request {
    std::shared_ptr<Client> client;
    Value message;
    uint64_t id = 0; // 0: a message, which gets no reply
    bool answered = false;
};

// A host process that holds grants, pinned by its pidfd and start time.
struct JobServer::Host {
    AuditToken token;
    uint64_t startTime = 0;
    uint64_t generation = 0; // tells this record from a later one for the same pid
    uint64_t watchKey = 0;
    std::vector<std::shared_ptr<const JobSpec>> grants;
};

// One running instance: the bwrap process jobd started, and what runs inside it.
struct JobServer::Instance {
    uint64_t id = 0;
    pid_t pid = -1;
    UniqueFd pidfd;
    uint64_t watchKey = 0;
    pid_t hostPid = -1;
    std::shared_ptr<const JobSpec> job;
    const Client* busyOwner = nullptr; // the connection that declared the instance busy
    bool terminating = false;
    std::vector<std::function<void()>> whenGone;
};

} // namespace om
