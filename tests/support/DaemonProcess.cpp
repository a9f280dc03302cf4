#include "tests/support/DaemonProcess.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <sys/prctl.h>
#include <sys/ptrace.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>

extern char** environ;

namespace om::test {

namespace {

using Clock = std::chrono::steady_clock;

constexpr const char* kDefaultServiceName = "com.orvex.ombrel.omd";
constexpr const char* kSetpriv = "/usr/bin/setpriv";

int remainingMilliseconds(Clock::time_point deadline)
{
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
    return static_cast<int>(std::clamp<long long>(left, 0, INT_MAX));
}

// The identity of the socket file at path; none when there is none.
std::optional<std::pair<dev_t, ino_t>> socketIdentity(const std::string& path)
{
    struct stat info;
    if (::stat(path.c_str(), &info) != 0 || !S_ISSOCK(info.st_mode))
        return std::nullopt;
    return std::pair { info.st_dev, info.st_ino };
}

std::string makeTemporaryRoot()
{
    std::string pattern = std::filesystem::temp_directory_path() / "omd-e2e-XXXXXX";
    if (!::mkdtemp(pattern.data()))
        return {};
    return pattern;
}

// The service name the daemon will use: the last "-S" wins, as in the daemon.
std::string serviceNameOf(const std::vector<std::string>& arguments)
{
    std::string name = kDefaultServiceName;
    for (size_t i = 0; i + 1 < arguments.size(); ++i) {
        if (arguments[i] == "-S")
            name = arguments[i + 1];
    }
    return name;
}

// Prepared before fork: the child only rearranges descriptors and execs.
struct LaunchPlan {
    std::string path;
    std::vector<std::string> argumentStorage;
    std::vector<std::string> environmentStorage;
    std::vector<char*> argv;
    std::vector<char*> envp;
    int nullFd = -1;
    int stderrFd = -1;
    std::optional<rlimit> descriptorLimit;

    void seal()
    {
        for (auto& argument : argumentStorage)
            argv.push_back(argument.data());
        argv.push_back(nullptr);
        for (auto& entry : environmentStorage)
            envp.push_back(entry.data());
        envp.push_back(nullptr);
    }
};

[[noreturn]] void runChild(const LaunchPlan& plan) noexcept
{
    if (::dup2(plan.nullFd, STDIN_FILENO) < 0 || ::dup2(plan.nullFd, STDOUT_FILENO) < 0
        || ::dup2(plan.stderrFd, STDERR_FILENO) < 0)
        ::_exit(127);
    // A daemon never outlives a test binary that crashed.
    (void)::prctl(PR_SET_PDEATHSIG, SIGKILL);
    sigset_t none;
    ::sigemptyset(&none);
    (void)::sigprocmask(SIG_SETMASK, &none, nullptr);
    ::signal(SIGPIPE, SIG_DFL);
    ::signal(SIGTERM, SIG_DFL);
    if (plan.descriptorLimit && ::setrlimit(RLIMIT_NOFILE, &*plan.descriptorLimit) != 0)
        ::_exit(127);
    ::execve(plan.path.c_str(), plan.argv.data(), plan.envp.data());
    ::_exit(127);
}

std::vector<std::string> environmentFor(
    const DaemonProcess::Options& options, const std::string& root, const std::string& conduitDirectory)
{
    std::vector<std::pair<std::string, std::string>> settings = {
        { "CONDUIT_DIR", conduitDirectory },
        { "HOME", root + "/home" },
        { "XDG_RUNTIME_DIR", root + "/runtime" },
        { "XDG_DATA_HOME", root + "/data" },
        { "XDG_CONFIG_HOME", root + "/config" },
        { "REGISTRAR_DB", root + "/registrar.db" },
        { "REGISTRAR_SDK_DIR", root + "/sdk" },
        { "REGISTRAR_CONTAINERS", root + "/containers" },
        { "CONSENT_DB", root + "/consent.db" },
        { "PREFS_DIR", root + "/prefs" },
        { "SANDBOX_KEY", root + "/sandbox.key" },
        { "OMD_GLOBAL_ANNOTATIONS", root + "/global-annotations" },
    };
    // The log lines are read from standard error, so they must not go to a journal instead.
    settings.emplace_back("EVLOG_STDERR", "1");
    if (!options.logLevel.empty())
        settings.emplace_back("EVLOG_LEVEL", options.logLevel);
    settings.insert(settings.end(), options.environment.begin(), options.environment.end());

    auto overridden = [&](std::string_view entry) {
        auto name = entry.substr(0, entry.find('='));
        if (name == "EVLOG_LEVEL")
            return true; // the daemon's threshold is ours to choose, set or not
        return std::any_of(settings.begin(), settings.end(), [&](const auto& s) { return s.first == name; });
    };
    std::vector<std::string> environment;
    for (char** entry = environ; *entry; ++entry) {
        if (!overridden(*entry))
            environment.emplace_back(*entry);
    }
    // Later settings of a name win, like the options' own overrides.
    for (size_t i = 0; i < settings.size(); ++i) {
        bool later = std::any_of(settings.begin() + static_cast<long>(i) + 1, settings.end(),
            [&](const auto& s) { return s.first == settings[i].first; });
        if (!later)
            environment.push_back(settings[i].first + "=" + settings[i].second);
    }
    return environment;
}

} // namespace

DaemonLogLine DaemonLogLine::parse(std::string_view line)
{
    DaemonLogLine parsed;
    parsed.raw = std::string(line);
    parsed.message = parsed.raw;

    // "<time> <program>[<pid>] [<subsystem>:<category> ]<level>: <message>"
    auto bracket = line.find("] ");
    if (bracket == std::string_view::npos)
        return parsed;
    auto rest = line.substr(bracket + 2);
    auto colon = rest.find(": ");
    if (colon == std::string_view::npos)
        return parsed;
    auto head = rest.substr(0, colon);
    std::string_view level = head;
    std::string_view subsystem;
    std::string_view category;
    if (auto space = head.find(' '); space != std::string_view::npos) {
        auto pair = head.substr(0, space);
        level = head.substr(space + 1);
        auto separator = pair.find(':');
        if (separator == std::string_view::npos)
            return parsed;
        subsystem = pair.substr(0, separator);
        category = pair.substr(separator + 1);
    }
    if (level != "debug" && level != "info" && level != "notice" && level != "error")
        return parsed;
    parsed.level = std::string(level);
    parsed.subsystem = std::string(subsystem);
    parsed.category = std::string(category);
    parsed.message = std::string(rest.substr(colon + 2));
    return parsed;
}

DaemonProcess::DaemonProcess(Options options)
    : m_root(makeTemporaryRoot())
    , m_serviceName(serviceNameOf(options.arguments))
{
    m_conduitDirectory = options.conduitDirectory.value_or(m_root + "/conduit");
    std::filesystem::create_directories(m_conduitDirectory);
    // A predecessor that died without cleaning up left its socket in a shared directory.
    m_staleSocket = socketIdentity(socketPath());
    if (options.user) {
        // The daemon must be able to make its socket and files in its own directories.
        uid_t user = *options.user;
        (void)::chown(m_root.c_str(), user, user);
        (void)::chown(m_conduitDirectory.c_str(), user, user);
    }

    LaunchPlan plan;
    if (options.user) {
        plan.path = kSetpriv;
        plan.argumentStorage = { "setpriv", "--reuid=" + std::to_string(*options.user),
            "--regid=" + std::to_string(*options.user), "--clear-groups", options.executable };
    } else {
        plan.path = options.executable;
        plan.argumentStorage = { std::filesystem::path(options.executable).filename() };
    }
    if (options.privateDatabase) {
        plan.argumentStorage.emplace_back("-d");
        plan.argumentStorage.push_back(m_root + "/annotations.vlist");
    }
    plan.argumentStorage.insert(plan.argumentStorage.end(), options.arguments.begin(), options.arguments.end());
    plan.environmentStorage = environmentFor(options, m_root, m_conduitDirectory);
    if (options.descriptorLimit)
        plan.descriptorLimit = rlimit { rlim_t(*options.descriptorLimit), rlim_t(*options.descriptorLimit) };
    plan.seal();

    UniqueFd null(::open("/dev/null", O_RDWR | O_CLOEXEC));
    int pipeFds[2];
    if (::pipe2(pipeFds, O_CLOEXEC) != 0)
        return;
    m_stderr.reset(pipeFds[0]);
    UniqueFd writeEnd(pipeFds[1]);
    plan.nullFd = null.get();
    plan.stderrFd = writeEnd.get();
    m_stopReader.reset(::eventfd(0, EFD_CLOEXEC));

    m_pid = ::fork();
    if (m_pid == 0)
        runChild(plan);
    if (m_pid < 0)
        return;
    m_pidfd.reset(static_cast<int>(::syscall(SYS_pidfd_open, m_pid, 0)));
    writeEnd.reset();
    m_reader = std::thread([this] { readStderr(); });
}

DaemonProcess::~DaemonProcess()
{
    if (m_pid > 0 && running()) {
        ::kill(m_pid, SIGKILL);
        int status;
        while (::waitpid(m_pid, &status, 0) < 0 && errno == EINTR) { }
    }
    if (m_reader.joinable()) {
        uint64_t one = 1;
        (void)::write(m_stopReader.get(), &one, sizeof one);
        m_reader.join();
    }
    std::error_code ignored;
    if (!m_root.empty())
        std::filesystem::remove_all(m_root, ignored);
}

void DaemonProcess::readStderr()
{
    std::array<char, 65536> buffer;
    for (;;) {
        std::array<pollfd, 2> fds { { { m_stderr.get(), POLLIN, 0 }, { m_stopReader.get(), POLLIN, 0 } } };
        if (::poll(fds.data(), fds.size(), -1) < 0) {
            if (errno == EINTR)
                continue;
            break;
        }
        if (fds[1].revents)
            break;
        ssize_t count = ::read(m_stderr.get(), buffer.data(), buffer.size());
        if (count < 0 && errno == EINTR)
            continue;
        if (count <= 0)
            break;
        std::lock_guard lock(m_mutex);
        m_stderrText.append(buffer.data(), static_cast<size_t>(count));
        m_partialLine.append(buffer.data(), static_cast<size_t>(count));
        size_t newline;
        while ((newline = m_partialLine.find('\n')) != std::string::npos) {
            m_lines.push_back(DaemonLogLine::parse(std::string_view(m_partialLine).substr(0, newline)));
            m_partialLine.erase(0, newline + 1);
        }
        m_changed.notify_all();
    }
    std::lock_guard lock(m_mutex);
    if (!m_partialLine.empty())
        m_lines.push_back(DaemonLogLine::parse(m_partialLine));
    m_stderrClosed = true;
    m_changed.notify_all();
}

bool DaemonProcess::waitForSocket(std::chrono::milliseconds timeout)
{
    auto deadline = Clock::now() + timeout;
    UniqueFd watch(::inotify_init1(IN_CLOEXEC | IN_NONBLOCK));
    if (!watch.valid() || ::inotify_add_watch(watch.get(), m_conduitDirectory.c_str(), IN_CREATE | IN_MOVED_TO) < 0)
        return false;
    // The watch exists before this check, so a socket made after it is never missed. A socket left
    // by a predecessor is not this process's.
    const auto ours = [&] {
        const auto identity = socketIdentity(socketPath());
        return identity && identity != m_staleSocket;
    };
    while (!ours()) {
        std::array<pollfd, 2> fds { { { watch.get(), POLLIN, 0 }, { m_pidfd.get(), POLLIN, 0 } } };
        int ready = ::poll(fds.data(), fds.size(), remainingMilliseconds(deadline));
        if (ready < 0 && errno == EINTR)
            continue;
        if (ready <= 0)
            return false;
        if (fds[1].revents)
            return ours();
        std::array<char, 4096> events;
        while (::read(watch.get(), events.data(), events.size()) > 0) { }
    }
    // The listener renames its socket into place only once it listens, so the file's existence
    // means connections are accepted.
    return true;
}

std::vector<DaemonLogLine> DaemonProcess::lines() const
{
    std::lock_guard lock(m_mutex);
    return m_lines;
}

std::string DaemonProcess::stderrText() const
{
    std::lock_guard lock(m_mutex);
    return m_stderrText;
}

size_t DaemonProcess::countMessages(std::string_view message) const
{
    std::lock_guard lock(m_mutex);
    return static_cast<size_t>(
        std::count_if(m_lines.begin(), m_lines.end(), [&](const auto& line) { return line.message == message; }));
}

bool DaemonProcess::waitForLines(
    const std::function<bool(const std::vector<DaemonLogLine>&)>& predicate, std::chrono::milliseconds timeout)
{
    std::unique_lock lock(m_mutex);
    m_changed.wait_for(lock, timeout, [&] { return predicate(m_lines) || m_stderrClosed; });
    return predicate(m_lines);
}

bool DaemonProcess::waitForMessage(std::string_view message, std::chrono::milliseconds timeout)
{
    return waitForMessageCount(message, 1, timeout);
}

bool DaemonProcess::waitForMessageCount(std::string_view message, size_t count, std::chrono::milliseconds timeout)
{
    return waitForLines(
        [&](const std::vector<DaemonLogLine>& lines) {
            return static_cast<size_t>(std::count_if(lines.begin(), lines.end(), [&](const auto& line) {
                return line.message == message;
            })) >= count;
        },
        timeout);
}

bool DaemonProcess::waitForStderrClosed(std::chrono::milliseconds timeout)
{
    std::unique_lock lock(m_mutex);
    return m_changed.wait_for(lock, timeout, [&] { return m_stderrClosed; });
}

std::optional<uint64_t> DaemonProcess::cpuTicks() const
{
    std::ifstream file("/proc/" + std::to_string(m_pid) + "/stat");
    std::string stat;
    if (!std::getline(file, stat))
        return std::nullopt;
    // The command name may hold spaces and parentheses: the fields start after the last ')'.
    // From there, utime and stime are the 12th and 13th.
    std::istringstream fields(stat.substr(stat.rfind(')') + 1));
    std::string field;
    uint64_t user = 0, system = 0;
    for (int index = 1; index <= 13 && fields >> field; ++index) {
        if (index == 12)
            user = std::stoull(field);
        if (index == 13)
            system = std::stoull(field);
    }
    if (!fields)
        return std::nullopt;
    return user + system;
}

std::optional<uint64_t> DaemonProcess::residentBytes() const
{
    std::ifstream file("/proc/" + std::to_string(m_pid) + "/status");
    std::string line;
    while (std::getline(file, line)) {
        if (line.starts_with("VmRSS:"))
            return std::stoull(line.substr(6)) * 1024;
    }
    return std::nullopt;
}

void DaemonProcess::sendSignal(int signal)
{
    if (running() && m_pid > 0)
        ::kill(m_pid, signal);
}

std::optional<int> DaemonProcess::stop(std::chrono::milliseconds timeout)
{
    if (running() && m_pid > 0)
        ::kill(m_pid, SIGTERM);
    return waitForExit(timeout);
}

std::optional<int> DaemonProcess::waitForExit(std::chrono::milliseconds timeout)
{
    if (!running() || m_pid <= 0)
        return m_status;
    auto deadline = Clock::now() + timeout;
    for (;;) {
        pollfd fd { m_pidfd.get(), POLLIN, 0 };
        int ready = ::poll(&fd, 1, remainingMilliseconds(deadline));
        if (ready < 0 && errno == EINTR)
            continue;
        if (ready <= 0)
            return std::nullopt;
        break;
    }
    int status;
    while (::waitpid(m_pid, &status, 0) < 0) {
        if (errno != EINTR)
            return std::nullopt;
    }
    m_status = status;
    return m_status;
}

std::unique_ptr<DaemonProcess::FrozenThread> DaemonProcess::freezeThread(std::string_view name)
{
    std::string tasks = "/proc/" + std::to_string(m_pid) + "/task";
    std::error_code error;
    for (const auto& entry : std::filesystem::directory_iterator(tasks, error)) {
        std::ifstream commFile(entry.path() / "comm");
        std::string comm;
        std::getline(commFile, comm);
        if (comm != name)
            continue;
        auto tid = static_cast<pid_t>(std::stol(entry.path().filename()));
        if (::ptrace(PTRACE_SEIZE, tid, nullptr, nullptr) != 0)
            return nullptr;
        // Interrupt until the thread is caught waiting for work rather than in the middle of it.
        for (int attempt = 0; attempt < 100000; ++attempt) {
            int status;
            if (::ptrace(PTRACE_INTERRUPT, tid, nullptr, nullptr) != 0 || ::waitpid(tid, &status, __WALL) != tid
                || !WIFSTOPPED(status))
                break;
            std::ifstream syscallFile(entry.path() / "syscall");
            long number = -1;
            syscallFile >> number;
            if (number == SYS_futex)
                return std::unique_ptr<FrozenThread>(new FrozenThread(tid));
            if (::ptrace(PTRACE_CONT, tid, nullptr, nullptr) != 0)
                break;
        }
        (void)::ptrace(PTRACE_DETACH, tid, nullptr, nullptr);
        return nullptr;
    }
    return nullptr;
}

DaemonProcess::FrozenThread::~FrozenThread()
{
    (void)::ptrace(PTRACE_DETACH, m_tid, nullptr, nullptr);
}

std::optional<DaemonPeer> DaemonPeer::connect(const DaemonProcess& daemon)
{
    auto peer = RawConduitPeer::connect(daemon.socketPath());
    if (!peer)
        return std::nullopt;
    return DaemonPeer(std::move(*peer));
}

uint64_t DaemonPeer::send(const Value& request)
{
    m_peer.sendFrame(RawConduitPeer::kRequest, ++m_lastId, request);
    return m_lastId;
}

bool DaemonPeer::sendMessage(const Value& message)
{
    return m_peer.sendFrame(RawConduitPeer::kMessage, 0, message);
}

std::optional<Value> DaemonPeer::replyTo(uint64_t id)
{
    auto frame = m_peer.readFrame(kDaemonTimeout);
    if (!frame || frame->kind != RawConduitPeer::kReply || frame->id != id)
        return std::nullopt;
    return frame->value;
}

Value daemonRequest(std::string_view name, uint64_t version)
{
    return Value::dictionary({ { "request", Value::string(std::string(name)) }, { "version", Value(version) } });
}

} // namespace om::test
