// jobd under faults: hosts and instances that die or refuse to, children to reap, floods, busy
// assertions, and clients whose jobd is not there.
#include <dirent.h>
#include <signal.h>
#include <unistd.h>

#include <fstream>

#include "platform/Assertions.h"
#include "tests/e2e/JobdTestSupport.h"

namespace om::test {
namespace {

// Zombie children of pid, from /proc.
size_t zombieChildren(pid_t pid)
{
    size_t zombies = 0;
    for (const auto& entry : std::filesystem::directory_iterator("/proc")) {
        std::ifstream stat(entry.path() / "stat");
        std::string line;
        if (!std::getline(stat, line))
            continue;
        const size_t close = line.rfind(')');
        if (close == std::string::npos || close + 4 >= line.size())
            continue;
        std::istringstream fields(line.substr(close + 2));
        char state = 0;
        pid_t parent = 0;
        fields >> state >> parent;
        zombies += parent == pid && state == 'Z' ? 1 : 0;
    }
    return zombies;
}

class JobdFaults : public JobdTest {
protected:
    std::string killGraceMs() const override { return "300"; }
};

TEST_F(JobdFaults, GrantsDieWithTheirHost)
{
    const auto executable = makeBundle("Echo", "com.example.echo");
    const pid_t host = ChildProcess::spawn({ "/usr/bin/tail", "-f", "/dev/null" });
    ASSERT_GT(host, 0);
    ASSERT_EQ(addService(host, executable, overlay("com.example.echo")), 0);
    ::kill(host, SIGKILL);
    (void)ChildProcess::exitStatusOf(host);
    EXPECT_TRUE(m_jobd->waitForMessage("host " + std::to_string(host) + " exited; its 1 grants are gone"));
}

TEST_F(JobdFaults, InstanceIgnoringSIGTERMIsKilledAfterTheGracePeriod)
{
    const auto executable = makeBundle("Stubborn", "com.example.stubborn", "7");
    auto instance
        = launchOwn(executable, overlay("com.example.stubborn", "plugin", { { "JOBD_TEST_IGNORE_TERM", "1" } }));
    ASSERT_TRUE(instance);
    ASSERT_TRUE(instance->ask(Value::dictionary({ { "op", "ping" } })).isDictionary()); // it runs
    EXPECT_EQ(manage({ "remove", "com.example.stubborn", "7" }), kJobManagerSuccess);
    // The answer came once the instance was gone, and only by SIGKILL.
    EXPECT_EQ(m_jobd->countMessages("instance " + std::to_string(instance->pid())
                  + " of com.example.stubborn did not stop within 300 ms; killing it"),
        1u);
    auto listed = JobManagerList();
    ASSERT_TRUE(listed.ok());
    EXPECT_TRUE(listed->empty());
    EXPECT_EQ(zombieChildren(m_jobd->pid()), 0u);
    // Removal also took the grant: the host cannot start it again.
    EXPECT_EQ(JobManagerLaunch(executable).error().code(), kJobManagerNotPermitted);
}

TEST_F(JobdFaults, RemoveAnswersByWhatRan)
{
    const auto executable = makeBundle("Echo", "com.example.echo", "2");
    EXPECT_EQ(manage({ "remove", "com.example.echo", "2" }), kJobManagerNothingOnRecord);
    auto first = launchOwn(executable, overlay("com.example.echo"));
    auto second = launchOwn(executable, overlay("com.example.echo"));
    ASSERT_TRUE(first && second);
    ASSERT_TRUE(first->ask(Value::dictionary({ { "op", "ping" } })).isDictionary());
    ASSERT_TRUE(second->ask(Value::dictionary({ { "op", "ping" } })).isDictionary());
    EXPECT_EQ(manage({ "remove", "com.example.echo", "1" }), kJobManagerNothingOnRecord); // another version
    EXPECT_EQ(manage({ "remove", "com.example.echo", "2" }), kJobManagerSuccess);
    EXPECT_EQ(m_jobd->countMessages("instance " + std::to_string(first->pid())
                  + " of com.example.echo did not stop within 300 ms; killing it"),
        0u);
    EXPECT_EQ(zombieChildren(m_jobd->pid()), 0u);
}

TEST_F(JobdFaults, InstanceThatExitsIsReaped)
{
    const auto executable = makeBundle("Quitter", "com.example.quitter");
    auto instance = launchOwn(executable, overlay("com.example.quitter"));
    ASSERT_TRUE(instance);
    instance->ask(Value::dictionary({ { "op", "exit" }, { "status", 7 } }));
    ASSERT_TRUE(m_jobd->waitForMessage(
        "instance " + std::to_string(instance->pid()) + " of com.example.quitter exited with status 7"));
    EXPECT_EQ(zombieChildren(m_jobd->pid()), 0u);
}

TEST_F(JobdFaults, GrantsPerHostAreBounded)
{
    const auto executable = makeBundle("Flood", "com.example.flood");
    const std::string bundle = m_dir + "/Flood.appex";
    // The same executable again replaces its grant; it never adds one.
    for (int i = 0; i < 3; ++i)
        ASSERT_EQ(addService(::getpid(), executable, overlay("com.example.flood")), 0);
    for (size_t i = 1; i < 64; ++i) {
        const std::string link = bundle + "/../Flood" + std::to_string(i) + ".appex";
        std::filesystem::create_directories(link);
        std::filesystem::copy_file(bundle + "/Info.vlist", link + "/Info.vlist");
        std::filesystem::create_hard_link(executable, link + "/instance");
        ASSERT_EQ(addService(::getpid(), link + "/instance", overlay("com.example.flood")), 0) << i;
    }
    const std::string last = m_dir + "/Flood64.appex";
    std::filesystem::create_directories(last);
    std::filesystem::copy_file(bundle + "/Info.vlist", last + "/Info.vlist");
    std::filesystem::create_hard_link(executable, last + "/instance");
    EXPECT_EQ(addService(::getpid(), last + "/instance", overlay("com.example.flood")), kJobManagerLimit);
    EXPECT_TRUE(m_jobd->waitForMessage(
        "host " + std::to_string(::getpid()) + " already holds 64 grants; refusing " + last + "/instance"));
    // The grants it holds still work.
    EXPECT_TRUE(JobManagerLaunch(executable).ok());
}

TEST_F(JobdFaults, BusyInstancesAreReportedUntilIdleOrGone)
{
    const auto executable = makeBundle("Worker", "com.example.worker");
    auto instance = launchOwn(executable, overlay("com.example.worker"));
    ASSERT_TRUE(instance);
    const auto busyCount = [&] {
        return ChildProcess::capture({ m_manager, "busy", "com.example.worker", "com.example.other" }).out;
    };
    EXPECT_EQ(busyCount(), "0\n");
    EXPECT_EQ(instance->ask(Value::dictionary({ { "op", "busy" } }))["status"], Value(0));
    EXPECT_EQ(busyCount(), "1\n");
    EXPECT_EQ(ChildProcess::capture({ m_manager, "busy", "com.example.other" }).out, "0\n");
    auto listed = JobManagerList();
    ASSERT_TRUE(listed.ok() && listed->size() == 1);
    EXPECT_TRUE(listed->front().busy);
    EXPECT_EQ(instance->ask(Value::dictionary({ { "op", "idle" } }))["status"], Value(0));
    EXPECT_EQ(busyCount(), "0\n");
    // A process that jobd did not launch cannot declare anything.
    auto outsider = Assertions::create();
    auto declared = outsider->declareBusy();
    ASSERT_FALSE(declared.ok());
    EXPECT_EQ(declared.error().code(), kJobManagerNothingOnRecord);
}

TEST_F(JobdFaults, JobdThatIsNotRunningFailsAtOnce)
{
    JobManagerSetServiceName("com.orvex.jobd.absent");
    EXPECT_EQ(JobManagerAddService(::getpid(), "/bin/true", Value::dictionary({})), kJobManagerUnreachable);
    EXPECT_EQ(JobManagerRemoveService("com.example.echo", "1"), kJobManagerUnreachable);
    auto listed = JobManagerList();
    ASSERT_FALSE(listed.ok());
    EXPECT_EQ(listed.error().code(), kJobManagerUnreachable);
    Mailbox<int> completion;
    JobManagerRemoveService(
        "com.example.echo", "1", WorkQueue::create("test.killer"), [&](int status) { completion.push(status); });
    EXPECT_EQ(completion.pop(), std::optional<int>(kJobManagerUnreachable));
}

} // namespace
} // namespace om::test
