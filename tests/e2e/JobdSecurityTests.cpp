// jobd's refusals, each tried for real: launching without a grant or with another process's,
// granting without the entitlement, and reaching out of the sandbox (files, network, tokens).
#include <sys/socket.h>
#include <unistd.h>

#include <fstream>

#include "platform/Sandbox.h"
#include "tests/e2e/JobdTestSupport.h"

#include <netinet/in.h>

namespace om::test {
namespace {

class JobdGrants : public JobdTest { };

TEST_F(JobdGrants, GrantedHostLaunchesAndTalksToItsInstance)
{
    const auto executable = makeBundle("Echo", "com.example.echo");
    auto instance = launchOwn(executable, overlay("com.example.echo"));
    ASSERT_TRUE(instance);
    Value pong = instance->ask(Value::dictionary({ { "op", "ping" } }));
    EXPECT_EQ(pong["home"], Value(container("com.example.echo")));
    auto listed = JobManagerList();
    ASSERT_TRUE(listed.ok());
    ASSERT_EQ(listed->size(), 1u);
    EXPECT_EQ(listed->front().hostPid, ::getpid());
    EXPECT_EQ(listed->front().bundleIdentifier, "com.example.echo");
    EXPECT_EQ(listed->front().pid, instance->pid());
    EXPECT_EQ(listed->front().profile, "plugin");
    EXPECT_FALSE(listed->front().busy);
    // Launch by bundle identifier works as well as by path.
    auto second = JobManagerLaunch("com.example.echo");
    ASSERT_TRUE(second.ok());
}

TEST_F(JobdGrants, HostWithoutAGrantCannotLaunch)
{
    const auto executable = makeBundle("Echo", "com.example.echo");
    auto launched = JobManagerLaunch(executable);
    ASSERT_FALSE(launched.ok());
    EXPECT_EQ(launched.error().code(), kJobManagerNotPermitted);
}

TEST_F(JobdGrants, AnotherProcessCannotUseTheHostsGrant)
{
    const auto executable = makeBundle("Echo", "com.example.echo");
    ASSERT_EQ(addService(::getpid(), executable, overlay("com.example.echo")), 0);
    // The manager program is another process: our grant is not its grant.
    EXPECT_EQ(manage({ "launch", executable }), kJobManagerNotPermitted);
}

TEST_F(JobdGrants, GrantForAnotherProcessDoesNotServeUs)
{
    const auto executable = makeBundle("Echo", "com.example.echo");
    const pid_t other = ChildProcess::spawn({ "/usr/bin/tail", "-f", "/dev/null" });
    ASSERT_GT(other, 0);
    EXPECT_EQ(addService(other, executable, overlay("com.example.echo")), 0);
    auto launched = JobManagerLaunch(executable);
    ASSERT_FALSE(launched.ok());
    EXPECT_EQ(launched.error().code(), kJobManagerNotPermitted);
    ::kill(other, SIGKILL);
    (void)ChildProcess::exitStatusOf(other);
}

TEST_F(JobdGrants, PidThatNamesAnotherProcessIsRefused)
{
    const auto executable = makeBundle("Echo", "com.example.echo");
    auto started = Process::startTime(Process::self());
    ASSERT_TRUE(started.ok());
    // Our pid with a start time that is not ours: as if the host died and its pid was reused.
    EXPECT_EQ(addService(::getpid(), executable, overlay("com.example.echo"), { std::to_string(*started + 1) }),
        kJobManagerHostGone);
    EXPECT_EQ(addService(::getpid(), executable, overlay("com.example.echo"), { std::to_string(*started) }), 0);
}

TEST_F(JobdGrants, ClientWithoutTheEntitlementCannotManage)
{
    const auto executable = makeBundle("Echo", "com.example.echo");
    const auto plain = toolPath("jobd_test_client");
    EXPECT_EQ(addService(::getpid(), executable, overlay("com.example.echo"), {}, plain), kJobManagerNotPermitted);
    EXPECT_EQ(ChildProcess::run({ plain, "remove", "com.example.echo", "1" }), kJobManagerNotPermitted);
    EXPECT_EQ(ChildProcess::run({ plain, "busy", "com.example.echo" }), kJobManagerNotPermitted);
    EXPECT_FALSE(JobManagerLaunch(executable).ok());
}

struct BadOverlay {
    const char* name;
    Value overlay;
};

TEST_F(JobdGrants, MalformedOverlaysAreRefused)
{
    const auto executable = makeBundle("Echo", "com.example.echo");
    const std::vector<BadOverlay> cases = {
        { "NotADictionary", Value("overlay") },
        { "NoServiceDescription", Value::dictionary({ { "VBBundlePackageType", "CND!" } }) },
        { "UnknownProfile", overlay("com.example.echo", "no-such-profile") },
        { "ProfileNameClimbsOut", overlay("com.example.echo", "../plugin") },
        { "ForgedToken", overlay("com.example.echo", "plugin", {}, { "com.orvex.sandbox.read-only;1;00;/etc" }) },
    };
    for (const auto& bad : cases)
        EXPECT_EQ(addService(::getpid(), executable, bad.overlay), kJobManagerInvalid) << bad.name;
    EXPECT_EQ(addService(::getpid(), m_dir + "/nowhere", overlay("com.example.echo")), kJobManagerInvalid);
}

class JobdSandbox : public JobdTest { };

TEST_F(JobdSandbox, InstanceReadsOnlyItsBundleContainerAndGrantedPaths)
{
    const auto executable = makeBundle("Reader", "com.example.reader");
    std::filesystem::create_directories(m_dir + "/outside");
    const std::string granted = m_dir + "/outside/granted.txt";
    const std::string secret = m_dir + "/outside/secret.txt";
    const std::string ownFile = container("com.example.reader") + "/notes.txt";
    for (const auto& path : { granted, secret, ownFile })
        std::ofstream(path) << "text";
    auto token = Sandbox::issueFileExtension(Sandbox::kReadOnlyFileClass, granted, Sandbox::kCanonicalPath);
    ASSERT_TRUE(token.ok());
    auto instance = launchOwn(executable, overlay("com.example.reader", "plugin", {}, { *token }));
    ASSERT_TRUE(instance);

    struct Case {
        std::string path;
        bool readable;
    };
    const std::vector<Case> cases = {
        { m_dir + "/Reader.appex/Info.vlist", true },
        { ownFile, true },
        { granted, true },
        { secret, false }, // next to the granted file: the token names one path only
        { m_dir + "/sandbox.key", false },
        { m_manager, false },
        { "/root", false },
        { "/etc/shadow", false },
    };
    for (const auto& [path, readable] : cases)
        EXPECT_EQ(instance->canRead(path), readable) << path;
    // The container is the writable home; the bundle is not writable.
    EXPECT_EQ(instance->ask(Value::dictionary({ { "op", "write" }, { "path", ownFile + ".new" } }))["ok"], Value(true));
    EXPECT_EQ(instance->ask(Value::dictionary({ { "op", "write" }, { "path", m_dir + "/Reader.appex/new" } }))["ok"],
        Value(false));
}

// A TCP listener of the test's on the loopback; its port.
struct Listener {
    UniqueFd fd;
    int port = 0;
    Listener()
        : fd(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0))
    {
        sockaddr_in address {};
        address.sin_family = AF_INET;
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t length = sizeof address;
        if (::bind(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) == 0 && ::listen(fd.get(), 8) == 0
            && ::getsockname(fd.get(), reinterpret_cast<sockaddr*>(&address), &length) == 0)
            port = ntohs(address.sin_port);
    }
};

TEST_F(JobdSandbox, NetworkOnlyWhereTheProfileAllowsIt)
{
    Listener listener;
    ASSERT_GT(listener.port, 0);
    const std::vector<std::pair<std::string, bool>> profiles
        = { { "plugin", false }, { "keyboard", false }, { "glanced", false }, { "network-filter", true } };
    for (const auto& [profile, reaches] : profiles) {
        const std::string identifier = "com.example.net." + profile;
        const auto executable = makeBundle("Net-" + profile, identifier);
        auto instance = launchOwn(executable, overlay(identifier, profile));
        ASSERT_TRUE(instance);
        Value outcome = instance->ask(Value::dictionary({ { "op", "connect" }, { "port", listener.port } }));
        EXPECT_EQ(outcome["ok"], Value(reaches)) << profile;
    }
}

} // namespace
} // namespace om::test
