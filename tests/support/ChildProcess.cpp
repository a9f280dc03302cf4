#include "tests/support/ChildProcess.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <string_view>
#include <utility>

extern char** environ;

namespace om::test {

namespace {

constexpr auto kGenerous = std::chrono::seconds(60);

// NAME=VALUE entries: the settings, then the test's own environment less what they override.
std::vector<std::string> environmentWith(const std::vector<std::pair<std::string, std::string>>& settings)
{
    std::vector<std::string> entries;
    for (const auto& [name, value] : settings)
        entries.push_back(name + "=" + value);
    for (char** entry = environ; *entry; ++entry) {
        const std::string_view text(*entry);
        const auto name = text.substr(0, text.find('='));
        if (std::none_of(settings.begin(), settings.end(), [&](const auto& s) { return s.first == name; }))
            entries.emplace_back(*entry);
    }
    return entries;
}

std::vector<char*> pointers(std::vector<std::string>& strings)
{
    std::vector<char*> list;
    for (auto& text : strings)
        list.push_back(text.data());
    list.push_back(nullptr);
    return list;
}

} // namespace

pid_t ChildProcess::spawn(const std::vector<std::string>& arguments)
{
    std::vector<char*> argv;
    for (const auto& argument : arguments)
        argv.push_back(const_cast<char*>(argument.c_str()));
    argv.push_back(nullptr);
    pid_t pid;
    return ::posix_spawn(&pid, argv[0], nullptr, nullptr, argv.data(), environ) == 0 ? pid : -1;
}

int ChildProcess::exitStatusOf(pid_t pid)
{
    int status = 0;
    while (::waitpid(pid, &status, 0) < 0) {
        if (errno != EINTR)
            return -1;
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

int ChildProcess::run(const std::vector<std::string>& arguments)
{
    pid_t pid = spawn(arguments);
    return pid < 0 ? -1 : exitStatusOf(pid);
}

ChildProcess::Outcome ChildProcess::capture(const std::vector<std::string>& arguments,
    const std::vector<std::pair<std::string, std::string>>& settings, const std::string& input)
{
    std::vector<std::string> argumentStorage = arguments;
    std::vector<std::string> environmentStorage = environmentWith(settings);
    std::vector<char*> argv = pointers(argumentStorage);
    std::vector<char*> envp = pointers(environmentStorage);

    int in[2], out[2], err[2];
    if (::pipe2(in, O_CLOEXEC) || ::pipe2(out, O_CLOEXEC) || ::pipe2(err, O_CLOEXEC)) {
        ADD_FAILURE() << "pipe2 failed";
        return {};
    }
    pid_t pid = ::fork();
    if (pid == 0) {
        ::dup2(in[0], 0);
        ::dup2(out[1], 1);
        ::dup2(err[1], 2);
        ::execve(argv[0], argv.data(), envp.data());
        ::_exit(127);
    }
    ::close(in[0]);
    ::close(out[1]);
    ::close(err[1]);
    ::fcntl(in[1], F_SETFL, O_NONBLOCK);

    Outcome run;
    size_t written = 0;
    int inFd = in[1];
    if (input.empty()) {
        ::close(inFd);
        inFd = -1;
    }
    std::string* sinks[] = { &run.out, &run.err };
    int open[] = { out[0], err[0] };
    auto deadline = std::chrono::steady_clock::now() + kGenerous;
    while (open[0] >= 0 || open[1] >= 0) {
        pollfd fds[3] = { { open[0], POLLIN, 0 }, { open[1], POLLIN, 0 }, { inFd, POLLOUT, 0 } };
        auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
        if (left.count() <= 0 || ::poll(fds, 3, static_cast<int>(left.count())) <= 0) {
            ADD_FAILURE() << argumentStorage.front() << " did not finish in time";
            ::kill(pid, SIGKILL);
            break;
        }
        for (int i = 0; i < 2; ++i) {
            if (open[i] < 0 || !fds[i].revents)
                continue;
            char buffer[65536];
            ssize_t count = ::read(open[i], buffer, sizeof buffer);
            if (count <= 0) {
                ::close(open[i]);
                open[i] = -1;
            } else {
                sinks[i]->append(buffer, static_cast<size_t>(count));
            }
        }
        if (inFd >= 0 && fds[2].revents) {
            ssize_t count = ::write(inFd, input.data() + written, input.size() - written);
            if (count > 0)
                written += static_cast<size_t>(count);
            if (count < 0 || written == input.size()) {
                ::close(inFd);
                inFd = -1;
            }
        }
    }
    for (int fd : { open[0], open[1], inFd }) {
        if (fd >= 0)
            ::close(fd);
    }
    int status = 0;
    ::waitpid(pid, &status, 0);
    run.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    return run;
}

ChildProcess::Running::Running(
    const std::vector<std::string>& arguments, const std::vector<std::pair<std::string, std::string>>& settings)
{
    std::vector<std::string> argumentStorage = arguments;
    std::vector<std::string> environmentStorage = environmentWith(settings);
    std::vector<char*> argv = pointers(argumentStorage);
    std::vector<char*> envp = pointers(environmentStorage);
    int out[2], err[2];
    if (::pipe2(out, O_CLOEXEC) || ::pipe2(err, O_CLOEXEC)) {
        ADD_FAILURE() << "pipe2 failed";
        return;
    }
    m_pid = ::fork();
    if (m_pid == 0) {
        ::dup2(out[1], 1);
        ::dup2(err[1], 2);
        int null = ::open("/dev/null", O_RDONLY);
        ::dup2(null, 0);
        ::execve(argv[0], argv.data(), envp.data());
        ::_exit(127);
    }
    ::close(out[1]);
    ::close(err[1]);
    m_fds[0] = out[0];
    m_fds[1] = err[0];
}

ChildProcess::Running::~Running()
{
    if (m_pid > 0) {
        ::kill(m_pid, SIGKILL);
        ::waitpid(m_pid, nullptr, 0);
    }
    for (int fd : m_fds) {
        if (fd >= 0)
            ::close(fd);
    }
}

std::optional<std::string> ChildProcess::Running::readLine(Stream stream)
{
    const auto index = static_cast<size_t>(stream);
    std::string& pending = m_pending[index];
    const auto deadline = std::chrono::steady_clock::now() + kGenerous;
    for (;;) {
        if (auto newline = pending.find('\n'); newline != std::string::npos) {
            std::string line = pending.substr(0, newline);
            pending.erase(0, newline + 1);
            return line;
        }
        if (m_fds[index] < 0)
            return std::nullopt;
        const auto left
            = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
        pollfd fd { m_fds[index], POLLIN, 0 };
        if (left.count() <= 0 || ::poll(&fd, 1, static_cast<int>(left.count())) <= 0)
            return std::nullopt;
        char buffer[4096];
        const ssize_t count = ::read(m_fds[index], buffer, sizeof buffer);
        if (count <= 0) {
            ::close(m_fds[index]);
            m_fds[index] = -1;
        } else {
            pending.append(buffer, static_cast<size_t>(count));
        }
    }
}

void ChildProcess::Running::signal(int number)
{
    if (m_pid > 0)
        ::kill(m_pid, number);
}

int ChildProcess::Running::wait()
{
    if (m_pid <= 0)
        return -1;
    // The end of its standard error is the event to wait on; waitpid itself has no timeout.
    while (readLine(Stream::Err)) { }
    const pid_t pid = std::exchange(m_pid, -1);
    int status = 0;
    if (m_fds[1] >= 0) {
        ::kill(pid, SIGKILL); // it kept its standard error open past the generous time
    }
    ::waitpid(pid, &status, 0);
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

} // namespace om::test
