// Facts about a peer process, taken from the kernel, never from what the peer says.
//
// An AuditToken is captured when a connection is accepted: pid, uid and gid from SO_PEERCRED and a
// pidfd from SO_PEERPIDFD (or pidfd_open as a fallback on kernels without it). Everything later
// asked about the process is checked against the pidfd, so a pid that was reused by another
// process is never trusted.
#pragma once

#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>

#include "platform/Result.h"
#include "platform/UniqueFd.h"

namespace om {

struct AuditToken {
    pid_t pid = -1;
    uid_t uid = static_cast<uid_t>(-1);
    gid_t gid = static_cast<gid_t>(-1);
    std::shared_ptr<const UniqueFd> pidfd; // may be empty when the kernel gave none
};

class Process {
public:
    // The peer of a connected Unix socket. Fails with EMFILE or ENFILE when the process has no
    // descriptor left for the pidfd: a peer that cannot be pinned down is not to be served.
    static Result<AuditToken> peerOf(int socketFd);
    // A token for a process named by pid alone, with a pidfd opened now. Whether the pid still
    // names the process the caller means is for the caller to tell (see startTime).
    static Result<AuditToken> forPid(pid_t pid);
    // When the process started, in clock ticks since boot (/proc/<pid>/stat): with the pid, what
    // tells one process from a later one that reused its pid. Verified against the pidfd.
    static Result<uint64_t> startTime(const AuditToken& token);
    // The parent of pid (/proc/<pid>/stat), as this process's pid namespace numbers it; none when
    // pid is gone. Unverified: only a snapshot.
    static std::optional<pid_t> parentOf(pid_t pid);
    // The token of this process (for tests and for the daemon's own identity).
    static AuditToken self();

    // /proc/<pid>/exe, verified: fails when the process is gone or the pid was reused.
    static Result<std::string> executablePath(const AuditToken& token);
    // Opens the executable read-only through /proc/<pid>/exe (works even when the file was
    // replaced on disk), verified against the pidfd like executablePath.
    static Result<UniqueFd> openExecutable(const AuditToken& token);
    // True when the process's user or mount namespace differs from ours, or it runs under a
    // seccomp filter.
    static bool isSandboxed(const AuditToken& token);
    // Whether the process behind the token is still the one it was.
    static bool isAlive(const AuditToken& token);
};

} // namespace om
