// omd and a real jobd on one CONDUIT_DIR when either of them goes away: "ready" and "lock" while
// jobd is dead, and once it is back; a host that was readied and died; an instance that ignores
// SIGTERM under a terminating hold; and an omd restarted under a running instance.
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <unistd.h>

#include <functional>
#include <map>
#include <memory>

#include "Ombrel/OMDaemonClient.h"
#include "platform/Format.h"
#include "platform/JobManager.h"
#include "tests/e2e/JobdTestSupport.h"
#include "tests/support/RegistrarDaemon.h"

namespace om::test {
namespace {

constexpr const char* kPoint = "com.example.point";
constexpr const char* kKillGraceMs = "300";

class LaunchFaults : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_TRUE(sandboxAvailable());
        const std::string omd = m_omd.copyProgram(builtDaemonPath(), m_omd.state().root() + "/bin/omd",
            Value::dictionary({ { kJobManagerEntitlement, true } }));
        m_omd.setExecutable(omd);
        // The Conduit directory and the sandbox key outlive any one omd: jobd stays in there.
        m_omd.setConduitDirectory(m_omd.state().root() + "/conduit");
        ASSERT_TRUE(startOmd());
        m_app = m_omd.state().makeBundle("Host.app", BundleFixture::appInfo("com.example.host", "Host"));
        plugIn("a");
        plugIn("b");
        // Declared variables reach the instance: this one outlives SIGTERM.
        plugIn("stubborn", Value::dictionary({ { "JOBD_TEST_IGNORE_TERM", "1" } }));
        m_uuids = m_omd.addNamed(m_paths);
        ASSERT_EQ(m_uuids.size(), m_paths.size());
        ::setenv("SANDBOX_KEY", sandboxKey().c_str(), 1);
        // This process is the host: it launches what omd readied it for.
        ::setenv("CONDUIT_DIR", m_omd.daemon().conduitDirectory().c_str(), 1);
        JobManagerSetServiceName(kJobManagerServiceName);
        ASSERT_TRUE(startJobd());
    }
    void TearDown() override { JobManagerSetServiceName(""); }

    bool startOmd()
    {
        return m_omd.start({ { "JOBD_SERVICE_NAME", kJobManagerServiceName }, { "SANDBOX_KEY", sandboxKey() } });
    }
    std::string sandboxKey() { return m_omd.state().root() + "/sandbox.key"; }

    // A plug-in of Host.app whose executable is jobd's instance test program.
    void plugIn(const std::string& name, const Value& environment = Value())
    {
        DictionaryBuilder info(BundleFixture::plugInInfo("com.example." + name, "Run", kPoint));
        if (!environment.isNone())
            info.set("ConduitService", Value::dictionary({ { "EnvironmentVariables", environment } }));
        m_paths[name] = m_omd.state().makeBundle("Host.app/PlugIns/" + name + ".appex", info.build());
        m_omd.copyProgram(toolPath("jobd_test_instance"), executable(name));
    }
    std::string executable(const std::string& name) const { return m_paths.at(name) + "/Run"; }

    // jobd on omd's Conduit directory, (re)started; the previous one, if any, is gone by then.
    bool startJobd()
    {
        m_jobd = std::make_unique<DaemonProcess>(
            jobdOptions(kJobManagerServiceName, sandboxKey(), kKillGraceMs, m_omd.daemon().conduitDirectory()));
        return m_jobd->waitForSocket();
    }
    // jobd dies without a chance to clean up: its socket file stays behind.
    void killJobd()
    {
        m_jobd->sendSignal(SIGKILL);
        ASSERT_TRUE(m_jobd->waitForExit());
    }
    void restartJobd() { ASSERT_TRUE(startJobd()) << m_jobd->stderrText(); }

    Value ready(const std::vector<std::string>& plugIns) { return m_omd.call(request("ready", plugIns)); }
    Value request(const char* name, const std::vector<std::string>& plugIns) const
    {
        ArrayBuilder uuids;
        for (const auto& plugIn : plugIns)
            uuids.append(Value::uuid(m_uuids.at(plugIn)));
        return DictionaryBuilder(daemonRequest(name))
            .set("uuids", uuids.build())
            .set("flags", Value::unsignedInteger(uint64_t { 0 }))
            .build();
    }
    Value lock(const std::vector<std::string>& paths, uint64_t flags)
    {
        return m_omd.call(
            DictionaryBuilder(pathsRequest("lock", paths)).set("flags", Value::unsignedInteger(flags)).build());
    }
    // Lines omd logged for the requests answered so far that start with prefix.
    size_t logged(const std::string& prefix)
    {
        m_omd.readLogSoFar();
        size_t count = 0;
        for (const auto& line : m_omd.daemon().lines())
            count += line.message.starts_with(prefix) ? 1 : 0;
        return count;
    }
    std::string label(const std::string& name) const
    {
        return "com.example." + name + "(" + m_uuids.at(name).string() + ")";
    }

    std::unique_ptr<HostedInstance> launch(const std::string& name)
    {
        auto launched = JobManagerLaunch(executable(name));
        EXPECT_TRUE(launched.ok()) << (launched.ok() ? "" : launched.error().localizedDescription())
                                   << m_jobd->stderrText();
        if (!launched.ok())
            return nullptr;
        auto instance = std::make_unique<HostedInstance>(std::move(launched).releaseValue());
        EXPECT_TRUE(instance->ask(Value::dictionary({ { "op", "ping" } })).isDictionary());
        return instance;
    }

    RegistrarDaemon m_omd;
    std::unique_ptr<DaemonProcess> m_jobd;
    std::string m_app;
    std::map<std::string, std::string> m_paths;
    std::map<std::string, Uuid> m_uuids;
};

TEST_F(LaunchFaults, ReadyFailsWhileJobdIsDeadAndWorksOnceItIsBackWithoutRestartingOmd)
{
    const std::string failed = format("jobd error %d trying to allow %d ", int(kJobManagerUnreachable), ::getpid());
    struct Step {
        const char* name;
        std::function<void()> before;
        uint64_t code;
        std::string error;
        size_t jobdErrors; // "jobd error" lines logged by then
    };
    const Step steps[] = {
        { "jobd running", nullptr, 0, "", 0 },
        { "jobd killed", [this] { killJobd(); }, 4, "unable to enable plug-in " + label("a"), 1 },
        { "jobd still dead", nullptr, 4, "unable to enable plug-in " + label("a"), 2 },
        { "jobd started again", [this] { restartJobd(); }, 0, "", 2 },
    };
    const pid_t omd = m_omd.daemon().pid();
    for (const Step& step : steps) {
        SCOPED_TRACE(step.name);
        if (step.before)
            step.before();
        const Value reply = ready({ "a" });
        EXPECT_EQ(codeOf(reply), step.code);
        EXPECT_EQ(errorOf(reply), step.error);
        EXPECT_EQ(logged(failed), step.jobdErrors);
        // What was readied can be launched, from the jobd that recorded it.
        if (step.code == 0)
            EXPECT_TRUE(launch("a"));
        else
            EXPECT_EQ(JobManagerLaunch(executable("a")).error().code(), kJobManagerUnreachable);
    }
    EXPECT_EQ(m_omd.daemon().pid(), omd);
    EXPECT_TRUE(m_omd.daemon().running());
}

TEST_F(LaunchFaults, ATerminatingHoldIsGrantedAndAnsweredWhileJobdIsDead)
{
    killJobd();
    struct Row {
        const char* name;
        std::vector<std::string> paths;
        uint64_t flags;
        std::vector<std::string> held;
    };
    const Row rows[] = {
        { "one plug-in", { m_paths["a"] }, OMDaemonClient::OMLockFlagPlugInPaths | OMDaemonClient::OMLockFlagTerminate,
            { "a" } },
        // The busy check asks jobd too: with no jobd nothing is busy.
        { "the application, checked", { m_app },
            OMDaemonClient::OMLockFlagCheckBusy | OMDaemonClient::OMLockFlagTerminate, { "a", "b", "stubborn" } },
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        const Value reply = lock(row.paths, row.flags);
        ASSERT_EQ(codeOf(reply), 0u) << errorOf(reply);
        const auto token = reply["uuids"].asUuid();
        ASSERT_TRUE(token) << reply.description();
        EXPECT_EQ(logged(format("forced termination complete; hold request granted uuid:%s", token->string())), 1u);
        EXPECT_EQ(logged(format("waiting for %zu termination replies", row.held.size())), 1u);
        for (const auto& name : row.held) {
            EXPECT_GE(logged(format("jobd error attempting to terminate plug-ins: error=%d for uuid=%s",
                          int(kJobManagerUnreachable), m_uuids[name].string())),
                1u)
                << name;
            // The hold is in force all the same.
            const Value refused = ready({ name });
            EXPECT_EQ(codeOf(refused), 11u);
            EXPECT_EQ(errorOf(refused), "access to plugin com.example." + name + " denied: the plug-in is on hold");
        }
        EXPECT_EQ(
            codeOf(m_omd.call(
                DictionaryBuilder(daemonRequest("lock")).set("uuids", Value::array({ Value::uuid(*token) })).build())),
            0u);
    }
}

TEST_F(LaunchFaults, AReadiedHostThatDiedLeavesNoGrantBehind)
{
    // Another process is readied through omd and exits; its grant goes with it.
    const std::string client = m_omd.copyProgram(RegistrarDaemon::testClientPath(), m_omd.state().root() + "/host");
    EXPECT_EQ(codeOf(m_omd.callFrom(client, request("ready", { "a" }))), 0u);
    m_omd.readLogSoFar();
    pid_t host = -1;
    for (const auto& line : m_omd.daemon().lines()) {
        if (line.message.starts_with("allowing host ")
            && !line.message.starts_with(format("allowing host %d ", ::getpid())))
            host = pid_t(std::atoi(line.message.c_str() + std::string("allowing host ").size()));
    }
    ASSERT_GT(host, 0);
    ASSERT_TRUE(m_jobd->waitForMessage(format("host %d exited; its 1 grants are gone", host)));
    // Neither a new process nor this one (never readied) can launch the plug-in.
    EXPECT_EQ(
        ChildProcess::run({ toolPath("jobd_test_client"), "launch", executable("a") }), int(kJobManagerNotPermitted));
    EXPECT_EQ(JobManagerLaunch(executable("a")).error().code(), kJobManagerNotPermitted);
}

TEST_F(LaunchFaults, AnInstanceIgnoringSIGTERMIsKilledWhenItsApplicationIsHeldWithTermination)
{
    ASSERT_EQ(codeOf(ready({ "stubborn", "a" })), 0u);
    auto stubborn = launch("stubborn");
    auto polite = launch("a");
    ASSERT_TRUE(stubborn && polite);

    const Value reply = lock({ m_app }, OMDaemonClient::OMLockFlagTerminate);
    ASSERT_EQ(codeOf(reply), 0u) << errorOf(reply);
    // The reply waited for both: the stubborn one by SIGKILL after the grace, the other by SIGTERM.
    const auto killed = [&](const char* name, const HostedInstance& instance) {
        return format(
            "instance %d of com.example.%s did not stop within %s ms; killing it", instance.pid(), name, kKillGraceMs);
    };
    // Whether the polite one stops within the grace depends on the machine's load, so only the
    // stubborn one is sure to be killed.
    EXPECT_TRUE(m_jobd->waitForMessage(killed("stubborn", *stubborn)));
    for (const char* name : { "stubborn", "a" })
        EXPECT_EQ(logged(format("one or more plug-ins have been terminated for uuid=%s", m_uuids[name].string())), 1u)
            << name;
    EXPECT_EQ(logged(format("jobd reported no plug-ins on record for uuid=%s", m_uuids["b"].string())), 1u);
    auto listed = JobManagerList();
    ASSERT_TRUE(listed.ok());
    EXPECT_TRUE(listed->empty());
}

TEST_F(LaunchFaults, AnOmdRestartedUnderARunningInstanceStillStopsItAndReadiesAgain)
{
    ASSERT_EQ(codeOf(ready({ "a" })), 0u);
    auto instance = launch("a");
    ASSERT_TRUE(instance);
    ASSERT_EQ(codeOf(lock({ m_paths["b"] }, OMDaemonClient::OMLockFlagPlugInPaths)), 0u);
    ASSERT_EQ(codeOf(ready({ "b" })), 11u);
    // omd dies outright, with a hold on "b"; jobd and its instance carry on.
    m_omd.daemon().sendSignal(SIGKILL);
    ASSERT_TRUE(m_omd.daemon().waitForExit());
    EXPECT_TRUE(instance->ask(Value::dictionary({ { "op", "ping" } })).isDictionary());
    ASSERT_TRUE(startOmd());

    // The hold died with the omd that granted it.
    EXPECT_EQ(codeOf(ready({ "b" })), 0u);
    EXPECT_TRUE(launch("b"));
    const Value reply
        = lock({ m_paths["a"] }, OMDaemonClient::OMLockFlagPlugInPaths | OMDaemonClient::OMLockFlagTerminate);
    ASSERT_EQ(codeOf(reply), 0u) << errorOf(reply);
    EXPECT_EQ(logged(format("one or more plug-ins have been terminated for uuid=%s", m_uuids["a"].string())), 1u);
    EXPECT_FALSE(instance->ask(Value::dictionary({ { "op", "ping" } })).isDictionary());
    EXPECT_EQ(codeOf(ready({ "a" })), 11u);
}

} // namespace
} // namespace om::test
