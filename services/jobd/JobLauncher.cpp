#include "services/jobd/JobLauncher.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <sstream>

namespace om {

namespace {

struct Exec {
    std::vector<std::string> storage;
    std::vector<char*> argv;
    std::vector<char*> envp;
};

// The forked child: async-signal-safe calls only, then exec or _exit.
[[noreturn]] void runChild(const Exec& exec, pid_t parent, int devNull, int instanceSocket, int instanceFd)
{
    // Instances live no longer than jobd: their bwrap takes SIGKILL when jobd goes.
    if (::prctl(PR_SET_PDEATHSIG, SIGKILL) < 0 || ::getppid() != parent)
        ::_exit(126);
    if (::dup2(devNull, STDIN_FILENO) < 0)
        ::_exit(126);
    if (instanceSocket == instanceFd) {
        if (::fcntl(instanceFd, F_SETFD, 0) < 0)
            ::_exit(126);
    } else if (::dup2(instanceSocket, instanceFd) < 0) {
        ::_exit(126);
    }
    sigset_t none;
    sigemptyset(&none);
    // NOLINTNEXTLINE(concurrency-mt-unsafe): the forked child has one thread.
    ::sigprocmask(SIG_SETMASK, &none, nullptr); // jobd blocks SIGTERM; the job must not inherit it
    ::execve(exec.argv[0], exec.argv.data(), exec.envp.data());
    ::_exit(127);
}

} // namespace

std::string JobLauncher::bwrapPath()
{
    // NOLINTBEGIN(concurrency-mt-unsafe): jobd never changes its environment.
    if (const char* configured = std::getenv("JOBD_BWRAP"); configured && *configured)
        return configured;
    if (const char* path = std::getenv("PATH")) {
        std::stringstream directories(path);
        std::string directory;
        while (std::getline(directories, directory, ':')) {
            const std::string candidate = (directory.empty() ? "." : directory) + "/bwrap";
            if (::access(candidate.c_str(), X_OK) == 0)
                return candidate;
        }
    }
    // NOLINTEND(concurrency-mt-unsafe)
    return "/usr/bin/bwrap";
}

Result<JobLauncher::Child> JobLauncher::spawn(const std::string& bwrap, const std::vector<std::string>& arguments,
    const std::map<std::string, std::string>& environment, const UniqueFd& instanceSocket, int instanceFd)
{
    Exec exec;
    exec.storage.reserve(arguments.size() + environment.size() + 1);
    exec.storage.push_back(bwrap);
    exec.storage.insert(exec.storage.end(), arguments.begin(), arguments.end());
    const size_t argumentCount = exec.storage.size();
    for (const auto& [name, value] : environment)
        exec.storage.push_back(name + "=" + value);
    for (size_t i = 0; i < exec.storage.size(); ++i)
        (i < argumentCount ? exec.argv : exec.envp).push_back(exec.storage[i].data());
    exec.argv.push_back(nullptr);
    exec.envp.push_back(nullptr);

    UniqueFd devNull(::open("/dev/null", O_RDONLY | O_CLOEXEC));
    if (!devNull.valid())
        return OMError::fromErrno("open /dev/null", errno);
    const pid_t parent = ::getpid();
    const pid_t pid = ::fork();
    if (pid < 0)
        return OMError::fromErrno("fork", errno);
    if (pid == 0)
        runChild(exec, parent, devNull.get(), instanceSocket.get(), instanceFd);
    // Only we can reap the child, so its pid cannot name another process before this.
    UniqueFd pidfd(int(::syscall(SYS_pidfd_open, pid, 0)));
    if (!pidfd.valid()) {
        const int error = errno;
        ::kill(pid, SIGKILL);
        int status;
        ::waitpid(pid, &status, 0);
        return OMError::fromErrno("pidfd_open", error);
    }
    return Child { pid, std::move(pidfd) };
}

} // namespace om
