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

extern char** environ;

namespace om::test {

namespace {

constexpr auto kGenerous = std::chrono::seconds(60);

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
    std::vector<std::string> environmentStorage;
    for (const auto& [name, value] : settings)
        environmentStorage.push_back(name + "=" + value);
    for (char** entry = environ; *entry; ++entry) {
        const std::string_view text(*entry);
        const auto name = text.substr(0, text.find('='));
        if (std::none_of(settings.begin(), settings.end(), [&](const auto& s) { return s.first == name; }))
            environmentStorage.emplace_back(*entry);
    }
    std::vector<char*> argv, envp;
    for (auto& argument : argumentStorage)
        argv.push_back(argument.data());
    argv.push_back(nullptr);
    for (auto& entry : environmentStorage)
        envp.push_back(entry.data());
    envp.push_back(nullptr);

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

} // namespace om::test
