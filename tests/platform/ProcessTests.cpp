#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <memory>

#include "platform/Process.h"

namespace om {
namespace {

std::string ownExecutable()
{
    char buffer[PATH_MAX];
    const ssize_t length = ::readlink("/proc/self/exe", buffer, sizeof buffer);
    return length > 0 ? std::string(buffer, size_t(length)) : std::string();
}

AuditToken tokenOf(pid_t pid)
{
    AuditToken token;
    token.pid = pid;
    token.uid = ::geteuid();
    token.gid = ::getegid();
    const int pidfd = int(::syscall(SYS_pidfd_open, pid, 0));
    if (pidfd >= 0)
        token.pidfd = std::make_shared<const UniqueFd>(pidfd);
    return token;
}

// A forked child that waits for its pipe to close, then exits. The child only reads and _exits.
struct Child {
    pid_t pid = -1;
    UniqueFd release;

    static Child start()
    {
        int pipeFds[2];
        if (::pipe2(pipeFds, O_CLOEXEC) < 0)
            return {};
        const pid_t pid = ::fork();
        if (pid == 0) {
            ::close(pipeFds[1]);
            char byte;
            (void)!::read(pipeFds[0], &byte, 1);
            ::_exit(0);
        }
        ::close(pipeFds[0]);
        return Child { pid, UniqueFd(pipeFds[1]) };
    }
    void finish()
    {
        release.reset();
        int status;
        ::waitpid(pid, &status, 0);
    }
};

TEST(Process, PeerOfASocketPairIsThisProcess)
{
    int pair[2];
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair), 0);
    UniqueFd a(pair[0]), b(pair[1]);
    auto token = Process::peerOf(a.get());
    ASSERT_TRUE(token.ok()) << token.error().localizedDescription();
    EXPECT_EQ(token->pid, ::getpid());
    EXPECT_EQ(token->uid, ::geteuid());
    EXPECT_EQ(token->gid, ::getegid());
    ASSERT_TRUE(token->pidfd);
    ASSERT_TRUE(token->pidfd->valid());
    EXPECT_TRUE(::fcntl(token->pidfd->get(), F_GETFD) & FD_CLOEXEC);
    EXPECT_TRUE(Process::isAlive(*token));
}

TEST(Process, PeerOfSomethingThatIsNotASocketFails)
{
    int pipeFds[2];
    ASSERT_EQ(::pipe2(pipeFds, O_CLOEXEC), 0);
    UniqueFd a(pipeFds[0]), b(pipeFds[1]);
    auto token = Process::peerOf(a.get());
    ASSERT_FALSE(token.ok());
    EXPECT_NE(token.error().localizedDescription().find("SO_PEERCRED"), std::string::npos);
}

// Out of descriptors, a peer gets no token without its pidfd: it could not be told apart from a
// later process with its pid. In a child, whose descriptor table the test fills.
TEST(ProcessDeathTest, PeerWithoutRoomForItsPidfdIsRefused)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    auto withEveryDescriptorTaken = [] {
        int pair[2];
        if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) != 0)
            std::_Exit(2);
        const rlimit tight { 64, 64 };
        if (::setrlimit(RLIMIT_NOFILE, &tight) != 0)
            std::_Exit(3);
        while (::fcntl(pair[0], F_DUPFD_CLOEXEC, 0) >= 0) { }
        auto token = Process::peerOf(pair[0]);
        std::_Exit(!token.ok() && token.error().domain() == "POSIX" && token.error().code() == EMFILE ? 0 : 1);
    };
    EXPECT_EXIT(withEveryDescriptorTaken(), ::testing::ExitedWithCode(0), "");
}

TEST(Process, SelfRunsItsOwnExecutableUnsandboxed)
{
    const AuditToken self = Process::self();
    EXPECT_EQ(self.pid, ::getpid());
    auto path = Process::executablePath(self);
    ASSERT_TRUE(path.ok()) << path.error().localizedDescription();
    EXPECT_EQ(path.value(), ownExecutable());
    EXPECT_FALSE(Process::isSandboxed(self));
    EXPECT_TRUE(Process::isAlive(self));

    auto file = Process::openExecutable(self);
    ASSERT_TRUE(file.ok());
    char magic[4];
    ASSERT_EQ(::pread(file->get(), magic, sizeof magic, 0), ssize_t(sizeof magic));
    EXPECT_EQ(std::string(magic, 4),
        "\x7f"
        "ELF");
    EXPECT_TRUE(::fcntl(file->get(), F_GETFD) & FD_CLOEXEC);
}

TEST(Process, TokenWithoutPidfdStillAnswers)
{
    AuditToken bare { ::getpid(), ::geteuid(), ::getegid(), nullptr };
    EXPECT_TRUE(Process::isAlive(bare));
    auto path = Process::executablePath(bare);
    ASSERT_TRUE(path.ok());
    EXPECT_EQ(path.value(), ownExecutable());
}

TEST(Process, LiveChildIsAliveAndRunsOurExecutable)
{
    Child child = Child::start();
    ASSERT_GT(child.pid, 0);
    const AuditToken token = tokenOf(child.pid);
    EXPECT_TRUE(Process::isAlive(token));
    auto path = Process::executablePath(token);
    ASSERT_TRUE(path.ok()) << path.error().localizedDescription();
    EXPECT_EQ(path.value(), ownExecutable());
    EXPECT_FALSE(Process::isSandboxed(token));
    child.finish();
    EXPECT_FALSE(Process::isAlive(token));
}

TEST(Process, ExitedChildIsNotAliveEvenBeforeItIsReaped)
{
    Child child = Child::start();
    ASSERT_GT(child.pid, 0);
    const AuditToken token = tokenOf(child.pid);
    ASSERT_TRUE(token.pidfd);
    child.release.reset();
    // A pidfd turns readable when its process exits; the child is a zombie from then on.
    pollfd exited { token.pidfd->get(), POLLIN, 0 };
    ASSERT_EQ(::poll(&exited, 1, 30000), 1);
    EXPECT_FALSE(Process::isAlive(token));
    EXPECT_FALSE(Process::executablePath(token).ok());
    child.finish();
}

TEST(Process, ReapedChildHasNoExecutable)
{
    Child child = Child::start();
    ASSERT_GT(child.pid, 0);
    const AuditToken token = tokenOf(child.pid);
    child.finish();
    EXPECT_FALSE(Process::isAlive(token));
    EXPECT_FALSE(Process::executablePath(token).ok());
    EXPECT_FALSE(Process::openExecutable(token).ok());
    EXPECT_TRUE(Process::isSandboxed(token)) << "what cannot be inspected must not count as unconfined";
}

TEST(Process, ReusedPidIsNotTrusted)
{
    // The pid names a live process (this one) but the pidfd a process that is gone: exactly what
    // a recycled pid looks like.
    Child child = Child::start();
    ASSERT_GT(child.pid, 0);
    AuditToken token = tokenOf(child.pid);
    child.finish();
    token.pid = ::getpid();
    EXPECT_FALSE(Process::isAlive(token));
    EXPECT_FALSE(Process::executablePath(token).ok());
    EXPECT_FALSE(Process::openExecutable(token).ok());
}

} // namespace
} // namespace om
