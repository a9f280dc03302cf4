#include "tests/platform/PrivateBus.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <vector>

#include "platform/Storage.h"
#include "platform/UniqueFd.h"

extern char** environ;

namespace om::test {

namespace {

constexpr int kAddressFd = 3;
constexpr auto kStartTimeout = std::chrono::seconds(60);

// The executable's path, found before fork so that the child only execs.
std::string findExecutable(const std::string& name)
{
    const std::string path = Storage::environment("PATH").value_or("/usr/bin:/bin");
    for (size_t start = 0; start <= path.size();) {
        const size_t colon = std::min(path.find(':', start), path.size());
        const std::string candidate = path.substr(start, colon - start) + "/" + name;
        if (::access(candidate.c_str(), X_OK) == 0)
            return candidate;
        start = colon + 1;
    }
    return {};
}

struct LaunchPlan {
    std::string executable;
    std::vector<std::string> argumentStorage;
    std::vector<char*> argv;
    int nullFd = -1;
    int addressFd = -1;
};

[[noreturn]] void runChild(const LaunchPlan& plan) noexcept
{
    if (::dup2(plan.nullFd, STDIN_FILENO) < 0 || ::dup2(plan.nullFd, STDOUT_FILENO) < 0)
        ::_exit(127);
    // dup2 onto itself would keep close-on-exec; clear it by hand in that case.
    if (plan.addressFd == kAddressFd ? ::fcntl(kAddressFd, F_SETFD, 0) < 0 : ::dup2(plan.addressFd, kAddressFd) < 0)
        ::_exit(127);
    (void)::prctl(PR_SET_PDEATHSIG, SIGKILL); // a bus never outlives a test binary that crashed
    ::execve(plan.executable.c_str(), plan.argv.data(), environ);
    ::_exit(127);
}

// Reads the first line the bus prints on the address descriptor; empty when it exits first or
// says nothing in time.
std::string readAddress(int fd)
{
    std::string text;
    const auto deadline = std::chrono::steady_clock::now() + kStartTimeout;
    while (text.find('\n') == std::string::npos) {
        const auto left
            = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
        pollfd readable { fd, POLLIN, 0 };
        const int ready = ::poll(&readable, 1, int(std::max<int64_t>(left.count(), 0)));
        if (ready < 0 && errno == EINTR)
            continue;
        if (ready <= 0)
            return {};
        char buffer[512];
        const ssize_t count = ::read(fd, buffer, sizeof buffer);
        if (count <= 0)
            return {};
        text.append(buffer, size_t(count));
    }
    return text.substr(0, text.find('\n'));
}

} // namespace

PrivateBus::PrivateBus()
{
    std::string pattern = Storage::environment("TMPDIR").value_or("/tmp") + "/omtest-bus.XXXXXX";
    if (!::mkdtemp(pattern.data()))
        return;
    m_root = pattern;

    LaunchPlan plan;
    plan.executable = findExecutable("dbus-daemon");
    if (plan.executable.empty())
        return;
    plan.argumentStorage = { "dbus-daemon", "--session", "--nofork", "--address=unix:path=" + m_root + "/bus",
        "--print-address=" + std::to_string(kAddressFd) };
    for (auto& argument : plan.argumentStorage)
        plan.argv.push_back(argument.data());
    plan.argv.push_back(nullptr);
    UniqueFd null(::open("/dev/null", O_RDWR | O_CLOEXEC));
    int fds[2];
    if (!null.valid() || ::pipe2(fds, O_CLOEXEC) < 0)
        return;
    UniqueFd readEnd(fds[0]);
    UniqueFd writeEnd(fds[1]);
    plan.nullFd = null.get();
    plan.addressFd = writeEnd.get();

    m_pid = ::fork();
    if (m_pid == 0)
        runChild(plan);
    if (m_pid < 0)
        return;
    writeEnd.reset(); // so that a bus that dies before printing closes the pipe
    m_address = readAddress(readEnd.get());
}

PrivateBus::~PrivateBus()
{
    stop();
    std::error_code ignored;
    if (!m_root.empty())
        std::filesystem::remove_all(m_root, ignored);
}

void PrivateBus::stop()
{
    if (m_pid <= 0)
        return;
    ::kill(m_pid, SIGTERM);
    int status;
    while (::waitpid(m_pid, &status, 0) < 0 && errno == EINTR) { }
    m_pid = -1;
}

} // namespace om::test
