#include "platform/Process.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77
#endif

namespace om {

namespace {

constexpr size_t kPathBufferSize = 2048;

std::string procPath(pid_t pid, const char* entry)
{
    return "/proc/" + std::to_string(pid) + "/" + entry;
}

UniqueFd pidfdOpen(pid_t pid)
{
    // pidfd_open descriptors are close-on-exec from birth.
    return UniqueFd(int(::syscall(SYS_pidfd_open, pid, 0)));
}

// The process the token names still runs: its pidfd has not turned readable, which it does the
// moment the process exits (zombie or reaped). Without a pidfd there is no way to tell a reused
// pid apart, so only the existence of the pid can be checked.
bool stillRunning(const AuditToken& token)
{
    if (token.pid <= 0)
        return false;
    if (!token.pidfd || !token.pidfd->valid()) {
        struct stat info;
        return ::stat(procPath(token.pid, "").c_str(), &info) == 0;
    }
    pollfd entry { token.pidfd->get(), POLLIN, 0 };
    int result;
    do {
        result = ::poll(&entry, 1, 0);
    } while (result < 0 && errno == EINTR);
    return result == 0;
}

bool isDescriptorShortage(int error)
{
    return error == EMFILE || error == ENFILE;
}

OMError goneError(const AuditToken& token)
{
    return OMError::fromErrno("process " + std::to_string(token.pid), ESRCH);
}

struct NamespaceIds {
    bool known = false;
    dev_t userDevice = 0, mountDevice = 0;
    ino_t userInode = 0, mountInode = 0;
};

NamespaceIds namespacesOf(const std::string& procDirectory)
{
    struct stat user, mount;
    if (::stat((procDirectory + "ns/user").c_str(), &user) < 0
        || ::stat((procDirectory + "ns/mnt").c_str(), &mount) < 0)
        return {};
    return { true, user.st_dev, mount.st_dev, user.st_ino, mount.st_ino };
}

struct SeccompState {
    bool known = false;
    long mode = 0;
    long filters = 0;
};

SeccompState seccompOf(const std::string& procDirectory)
{
    FILE* file = std::fopen((procDirectory + "status").c_str(), "re");
    if (!file)
        return {};
    SeccompState state;
    char line[256];
    while (std::fgets(line, sizeof line, file)) {
        if (std::sscanf(line, "Seccomp: %ld", &state.mode) == 1)
            state.known = true;
        else
            (void)std::sscanf(line, "Seccomp_filters: %ld", &state.filters);
    }
    (void)std::fclose(file); // read-only: nothing to lose
    return state;
}

} // namespace

Result<AuditToken> Process::peerOf(int socketFd)
{
    ucred credentials {};
    socklen_t length = sizeof credentials;
    if (::getsockopt(socketFd, SOL_SOCKET, SO_PEERCRED, &credentials, &length) < 0)
        return OMError::fromErrno("getsockopt(SO_PEERCRED)", errno);
    if (credentials.pid <= 0)
        return OMError::platform(kPlatformErrorUnsupported, "peer has no process id");

    AuditToken token { credentials.pid, credentials.uid, credentials.gid, nullptr };
    int pidfd = -1;
    length = sizeof pidfd;
    if (::getsockopt(socketFd, SOL_SOCKET, SO_PEERPIDFD, &pidfd, &length) == 0 && pidfd >= 0) {
        token.pidfd = std::make_shared<const UniqueFd>(pidfd);
        return token;
    }
    // A kernel without pidfds leaves the token without one; a process out of descriptors must not.
    if (isDescriptorShortage(errno))
        return OMError::fromErrno("getsockopt(SO_PEERPIDFD)", errno);
    // Older kernels: a pidfd opened now may already name a successor if the peer died and its
    // pid was reused in between; the window is the time since connect, and the best we have.
    UniqueFd opened = pidfdOpen(credentials.pid);
    if (!opened.valid() && isDescriptorShortage(errno))
        return OMError::fromErrno("pidfd_open", errno);
    if (opened.valid())
        token.pidfd = std::make_shared<const UniqueFd>(std::move(opened));
    return token;
}

namespace {

// The fields of /proc/<pid>/stat after the command name, which is parenthesised and may itself
// hold spaces and parentheses: field 3 (state) is the first.
std::optional<std::vector<std::string>> statFields(pid_t pid)
{
    UniqueFd file(::open(procPath(pid, "stat").c_str(), O_RDONLY | O_CLOEXEC));
    if (!file.valid())
        return std::nullopt;
    char buffer[1024];
    const ssize_t length = ::read(file.get(), buffer, sizeof buffer - 1);
    if (length <= 0)
        return std::nullopt;
    const std::string text(buffer, size_t(length));
    const size_t close = text.rfind(')');
    if (close == std::string::npos)
        return std::nullopt;
    std::vector<std::string> fields;
    size_t at = close + 1;
    while (at < text.size()) {
        while (at < text.size() && text[at] == ' ')
            ++at;
        const size_t end = std::min(text.find(' ', at), text.size());
        if (end > at)
            fields.push_back(text.substr(at, end - at));
        at = end;
    }
    return fields;
}

constexpr size_t kParentField = 1; // field 4
constexpr size_t kStartTimeField = 19; // field 22

} // namespace

Result<AuditToken> Process::forPid(pid_t pid)
{
    if (pid <= 0)
        return OMError::fromErrno("process " + std::to_string(pid), ESRCH);
    UniqueFd pidfd = pidfdOpen(pid);
    if (!pidfd.valid())
        return OMError::fromErrno("pidfd_open " + std::to_string(pid), errno);
    struct stat info { };
    if (::stat(procPath(pid, "").c_str(), &info) < 0)
        return OMError::fromErrno("stat " + procPath(pid, ""), errno);
    return AuditToken { pid, info.st_uid, info.st_gid, std::make_shared<const UniqueFd>(std::move(pidfd)) };
}

Result<uint64_t> Process::startTime(const AuditToken& token)
{
    auto fields = statFields(token.pid);
    if (!fields || fields->size() <= kStartTimeField)
        return goneError(token);
    const uint64_t ticks = std::strtoull((*fields)[kStartTimeField].c_str(), nullptr, 10);
    // Checked after reading: if the process still runs now, the pid was its own when we read.
    if (!stillRunning(token))
        return goneError(token);
    return ticks;
}

std::optional<pid_t> Process::parentOf(pid_t pid)
{
    auto fields = statFields(pid);
    if (!fields || fields->size() <= kParentField)
        return std::nullopt;
    return pid_t(std::strtol((*fields)[kParentField].c_str(), nullptr, 10));
}

AuditToken Process::self()
{
    static std::once_flag once;
    static AuditToken token;
    std::call_once(once, [] {
        token.pid = ::getpid();
        token.uid = ::geteuid();
        token.gid = ::getegid();
        if (UniqueFd pidfd = pidfdOpen(token.pid); pidfd.valid())
            token.pidfd = std::make_shared<const UniqueFd>(std::move(pidfd));
    });
    return token;
}

Result<std::string> Process::executablePath(const AuditToken& token)
{
    if (token.pid <= 0)
        return goneError(token);
    char buffer[kPathBufferSize];
    const ssize_t length = ::readlink(procPath(token.pid, "exe").c_str(), buffer, sizeof buffer);
    if (length < 0)
        return OMError::fromErrno("readlink " + procPath(token.pid, "exe"), errno);
    if (size_t(length) == sizeof buffer)
        return OMError::fromErrno("readlink " + procPath(token.pid, "exe"), ENAMETOOLONG);
    // Checked after reading: if the process still runs now, the pid was its own when we read.
    if (!stillRunning(token))
        return goneError(token);
    return std::string(buffer, size_t(length));
}

Result<UniqueFd> Process::openExecutable(const AuditToken& token)
{
    if (token.pid <= 0)
        return goneError(token);
    UniqueFd file(::open(procPath(token.pid, "exe").c_str(), O_RDONLY | O_CLOEXEC));
    if (!file.valid())
        return OMError::fromErrno("open " + procPath(token.pid, "exe"), errno);
    if (!stillRunning(token))
        return goneError(token);
    return file;
}

bool Process::isSandboxed(const AuditToken& token)
{
    const std::string directory = procPath(token.pid, "");
    const NamespaceIds theirs = namespacesOf(directory);
    const SeccompState theirFilter = seccompOf(directory);
    // What cannot be read (the process is gone, or hidden from us) counts as sandboxed: the
    // answer only ever takes privileges away.
    if (!stillRunning(token) || !theirs.known || !theirFilter.known)
        return true;
    const NamespaceIds ours = namespacesOf("/proc/self/");
    if (theirs.userDevice != ours.userDevice || theirs.userInode != ours.userInode
        || theirs.mountDevice != ours.mountDevice || theirs.mountInode != ours.mountInode)
        return true;
    // A filter the whole system runs under (a container's, or one our own unit inherited) is not a
    // sandbox of this process: only a filter beyond ours is.
    const SeccompState ourFilter = seccompOf("/proc/self/");
    if (theirFilter.mode == 0)
        return false;
    return ourFilter.mode == 0 || theirFilter.filters > ourFilter.filters;
}

bool Process::isAlive(const AuditToken& token)
{
    return stillRunning(token);
}

} // namespace om
