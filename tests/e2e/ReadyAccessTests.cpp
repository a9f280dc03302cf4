// "access" and "ready" against the real daemon, and for readying a real jobd on the daemon's own
// CONDUIT_DIR: read tokens for bundles, which plug-ins a host may be readied for, what the job
// manager receives (one grant per plug-in, the sandbox profile a keyboard's consent decides), and
// that the host can then launch what it was readied for.
#include <gtest/gtest.h>
#include <stdlib.h>

#include <map>
#include <memory>

#include "platform/Consent.h"
#include "platform/Format.h"
#include "platform/JobManager.h"
#include "platform/Sandbox.h"
#include "tests/e2e/JobdTestSupport.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/RegistrarDaemon.h"

namespace om::test {
namespace {

constexpr const char* kPoint = "com.example.point";
constexpr const char* kKeyboardPoint = "com.orvex.keyboard-service";
constexpr const char* kHostIdentifier = "com.example.host";

class ReadyAccess : public ::testing::Test {
protected:
    void SetUp() override
    {
        // A daemon that jobd lets record grants: root and the manager entitlement.
        const std::string omd = m_omd.copyProgram(builtDaemonPath(), m_omd.state().root() + "/bin/omd",
            Value::dictionary({ { kJobManagerEntitlement, true } }));
        m_omd.setExecutable(omd);
        ASSERT_TRUE(m_omd.start({ { "JOBD_SERVICE_NAME", kJobManagerServiceName } }));
        BundleFixture& bundles = m_omd.state();
        m_app = bundles.makeBundle("Host.app", BundleFixture::appInfo(kHostIdentifier, "Host"));
        plugIn("a", kPoint);
        plugIn("b", kPoint);
        plugIn("data", kPoint, Value(), { { "QSExtensionProtocol", "#Data" } });
        plugIn("guarded", kPoint, Value(), { { "QSExtensionHostEntitlement", "com.example.guard" } });
        plugIn("keyboard-open", kKeyboardPoint, Value::dictionary({ { "RequestsOpenAccess", true } }));
        plugIn("keyboard-closed", kKeyboardPoint);
        plugIn("declared", kPoint, Value(), {},
            Value::dictionary(
                { { "EnvironmentVariables", Value::dictionary({ { "HOME", "/declared" }, { "EXTRA", "x" } }) },
                    { "_SandboxProfile", "keyboard" }, { "_OmitSandboxParameters", false }, { "Custom", "kept" } }));
        // The instance program answers once launched, so a launch can be seen to work.
        m_omd.copyProgram(toolPath("jobd_test_instance"), m_paths["a"] + "/Run");
        m_uuids = m_omd.addNamed(m_paths);
        ASSERT_EQ(m_uuids.size(), m_paths.size());
        // Tokens are checked here under the daemon's key.
        ::setenv("SANDBOX_KEY", (m_omd.daemon().root() + "/sandbox.key").c_str(), 1);
    }

    // service: the bundle's declared "ConduitService", when not none.
    void plugIn(const std::string& name, const char* point, const Value& attributes = Value(),
        const std::vector<Value::Entry>& keys = {}, const Value& service = Value())
    {
        DictionaryBuilder info(BundleFixture::plugInInfo("com.example." + name, "Run", point, attributes));
        if (!service.isNone())
            info.set("ConduitService", service);
        DictionaryBuilder extension(info.get("QSExtension"));
        for (const auto& [key, value] : keys)
            extension.set(key, value);
        info.set("QSExtension", extension.build());
        m_paths[name] = m_omd.state().makeBundle("Host.app/PlugIns/" + name + ".appex", info.build());
    }

    Value request(const char* name, const std::vector<std::string>& plugIns)
    {
        ArrayBuilder uuids;
        for (const auto& plugIn : plugIns)
            uuids.append(plugIn == "unknown" ? Value::uuid(Uuid::random()) : Value::uuid(m_uuids.at(plugIn)));
        return m_omd.call(DictionaryBuilder(daemonRequest(name))
                              .set("uuids", uuids.build())
                              .set("flags", Value::unsignedInteger(uint64_t { 0 }))
                              .build());
    }

    // Lines the daemon logged for the requests answered so far that start with prefix and end
    // with suffix.
    size_t loggedLines(const std::string& prefix, const std::string& suffix = {})
    {
        m_omd.readLogSoFar();
        size_t count = 0;
        for (const auto& line : m_omd.daemon().lines())
            count += line.message.starts_with(prefix) && line.message.ends_with(suffix) ? 1 : 0;
        return count;
    }
    // The start of the line that logs each grant asked of the job manager for this process.
    static std::string allowing() { return "allowing host " + std::to_string(::getpid()) + " "; }
    std::string label(const std::string& name) const
    {
        return "com.example." + name + "(" + m_uuids.at(name).string() + ")";
    }

    RegistrarDaemon m_omd;
    std::string m_app;
    std::map<std::string, std::string> m_paths;
    std::map<std::string, Uuid> m_uuids;
};

TEST_F(ReadyAccess, AccessGivesOneVerifiableTokenPerListedPlugInInOrder)
{
    struct Case {
        std::vector<std::string> plugIns;
        uint64_t code;
        std::string error;
    };
    const Case cases[] = {
        { { "b", "a", "b" }, 0, "" },
        { {}, 0, "" },
        // No access rule applies: a plug-in the host could never be readied for is readable.
        { { "guarded", "data" }, 0, "" },
        { { "a", "unknown" }, 4, "no such plugin (uuid not found)" },
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(::testing::PrintToString(c.plugIns));
        const Value reply = request("access", c.plugIns);
        EXPECT_EQ(codeOf(reply), c.code);
        EXPECT_EQ(errorOf(reply), c.error);
        if (c.code != 0) {
            EXPECT_FALSE(reply.contains("extensions"));
            continue;
        }
        const Value& tokens = reply["extensions"];
        ASSERT_TRUE(tokens.isArray());
        ASSERT_EQ(tokens.count(), c.plugIns.size());
        for (size_t i = 0; i < c.plugIns.size(); ++i) {
            auto granted = Sandbox::verify(*tokens.at(i).asString());
            ASSERT_TRUE(granted.ok()) << granted.error().localizedDescription();
            EXPECT_EQ(*granted, m_paths[c.plugIns[i]]);
        }
    }
}

TEST_F(ReadyAccess, ReadyRefusesOrFailsAsAWholeWithoutAJobManager)
{
    struct Case {
        std::vector<std::string> plugIns;
        uint64_t code;
        std::string error;
        size_t allowed; // grants attempted with the job manager
    };
    const Case cases[] = {
        // Data plug-ins are neither refused nor readied: nothing reaches the job manager.
        { { "data" }, 0, "", 0 },
        { {}, 0, "", 0 },
        // The refusal is decided before anything is enabled, so "a" is not either.
        { { "a", "guarded" }, 11,
            "access to plugin com.example.guarded denied: the host does not have the \"com.example.guard\" "
            "entitlement",
            0 },
        { { "a", "unknown" }, 4, "no such plugin (uuid not found)", 0 },
        // Each plug-in is tried even after one failed; the first failure is the answer.
        { { "a", "b", "a" }, 4, "unable to enable plug-in " + label("a"), 2 },
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(::testing::PrintToString(c.plugIns));
        const size_t before = loggedLines(allowing());
        const Value reply = request("ready", c.plugIns);
        EXPECT_EQ(codeOf(reply), c.code);
        EXPECT_EQ(errorOf(reply), c.error);
        EXPECT_EQ(loggedLines(allowing()) - before, c.allowed);
    }
    EXPECT_EQ(
        loggedLines(format("jobd error %d trying to allow %d ", int(kJobManagerUnreachable), int(::getpid()))), 2u);
    EXPECT_EQ(loggedLines("denied access to " + std::to_string(::getpid()) + " for plugin com.example.guarded("), 1u);
}

TEST_F(ReadyAccess, AKeyboardGetsTheFullPlugInSandboxOnlyWithOpenAccessAndConsent)
{
    struct Case {
        const char* plugIn;
        const char* consentService; // granted to the containing application; none when null
        bool granted;
        const char* profile;
    };
    const Case cases[] = {
        { "keyboard-open", nullptr, false, "keyboard" },
        { "keyboard-open", Consent::kKeyboardNetworkService, false, "keyboard" },
        { "keyboard-open", "com.orvex.consent.camera", true, "keyboard" },
        { "keyboard-open", Consent::kKeyboardNetworkService, true, "plugin" },
        { "keyboard-closed", Consent::kKeyboardNetworkService, true, "keyboard" },
        { "a", nullptr, false, "plugin" },
    };
    const std::string consentPath = m_omd.daemon().root() + "/consent.db";
    for (const auto& c : cases) {
        SCOPED_TRACE(std::string(c.plugIn) + " " + (c.consentService ? c.consentService : "-"));
        std::filesystem::remove(consentPath);
        if (c.consentService) {
            auto consent = Consent::open(consentPath, Consent::Access::ReadWrite);
            ASSERT_TRUE(consent.ok()) << consent.error().localizedDescription();
            ASSERT_TRUE((*consent)->set(kHostIdentifier, c.consentService, c.granted).ok());
        }
        const std::string prefix = "assigning plug-in com.example." + std::string(c.plugIn) + "(";
        const std::string suffix = " " + m_uuids.at(c.plugIn).string() + " to " + c.profile + " sandbox";
        const size_t before = loggedLines(prefix, suffix);
        request("ready", { c.plugIn });
        EXPECT_EQ(loggedLines(prefix, suffix), before + 1);
    }
}

TEST_F(ReadyAccess, TheOverlayKeepsTheDeclaredServiceUnderTheDaemonsEnvironmentAndProfile)
{
    const auto registrar = m_omd.registrar();
    ASSERT_TRUE(registrar);
    // The overlay the daemon should send: declared keys keep their places, and declared variables
    // come after the daemon's unless they replace one of them.
    auto overlay = [&](const std::string& name, const Value& home, const std::vector<Value::Entry>& variables,
                       const std::vector<Value::Entry>& declared) {
        const auto container = registrar->plugInAtPath(m_paths[name])->dataContainerPath();
        EXPECT_TRUE(container);
        const std::string path = container.value_or("");
        DictionaryBuilder environment;
        environment.set("HOME", home.isNone() ? Value(path) : home)
            .set("VBFIXED_USER_HOME", path)
            .set("TMPDIR", path + "/tmp");
        for (const auto& [key, value] : variables)
            environment.set(key, value);
        DictionaryBuilder service;
        service.set("EnvironmentVariables", environment.build())
            .set("_SandboxProfile", "plugin")
            .set("_OmitSandboxParameters", true);
        for (const auto& [key, value] : declared)
            service.set(key, value);
        return Value::dictionary({ { "ConduitService", service.build() }, { "VBBundlePackageType", "CND!" } });
    };
    struct Case {
        const char* plugIn;
        Value expected;
    };
    const Case cases[] = {
        { "a", overlay("a", Value(), {}, {}) },
        // The declared HOME wins, the declared profile and flag are replaced, the rest passes.
        { "declared", overlay("declared", "/declared", { { "EXTRA", "x" } }, { { "Custom", "kept" } }) },
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.plugIn);
        const size_t before = loggedLines("activation overlay=");
        request("ready", { c.plugIn });
        ASSERT_EQ(loggedLines("activation overlay="), before + 1);
        std::string logged;
        for (const auto& line : m_omd.daemon().lines())
            logged = line.message.starts_with("activation overlay=") ? line.message : logged;
        EXPECT_EQ(logged, "activation overlay=" + c.expected.description());
    }
}

TEST_F(ReadyAccess, OmctlPrintsTokensAndRecordsTheConsentOmdThenReads)
{
    const std::string consentPath = m_omd.daemon().root() + "/consent.db";
    auto omctl = [&](std::vector<std::string> arguments) {
        arguments.insert(arguments.begin(), RegistrarDaemon::omctlPath());
        return ChildProcess::capture(
            arguments, { { "CONDUIT_DIR", m_omd.daemon().conduitDirectory() }, { "CONSENT_DB", consentPath } });
    };
    const auto access = omctl({ "access", m_uuids["b"].string(), m_uuids["a"].string() });
    ASSERT_EQ(access.status, 0) << access.err;
    std::vector<std::string> granted;
    for (size_t start = 0, end; (end = access.out.find('\n', start)) != std::string::npos; start = end + 1) {
        auto path = Sandbox::verify(access.out.substr(start, end - start));
        granted.push_back(path.ok() ? *path : "");
    }
    EXPECT_EQ(granted, (std::vector<std::string> { m_paths["b"], m_paths["a"] }));

    const std::string service = Consent::kKeyboardNetworkService;
    struct Step {
        std::vector<std::string> arguments;
        int status;
        std::string out;
    };
    const Step steps[] = {
        { { "consent", "list", kHostIdentifier }, 0, "" },
        { { "consent", "grant", kHostIdentifier, "com.orvex.consent.camera" }, 0,
            "granted com.orvex.consent.camera to com.example.host\n" },
        { { "consent", "revoke", kHostIdentifier, service }, 0, "revoked " + service + " to com.example.host\n" },
        { { "consent", "grant", kHostIdentifier, service }, 0, "granted " + service + " to com.example.host\n" },
        { { "consent", "list", kHostIdentifier }, 0, "com.orvex.consent.camera granted\n" + service + " granted\n" },
        { { "consent", "list", kHostIdentifier, service }, 0, service + " granted\n" },
        { { "consent", "grant", kHostIdentifier }, 2, "" },
        { { "consent", "allow", kHostIdentifier, service }, 2, "" },
        { { "access", "not-a-uuid" }, 2, "" },
    };
    for (const auto& step : steps) {
        SCOPED_TRACE(::testing::PrintToString(step.arguments));
        const auto outcome = omctl(step.arguments);
        EXPECT_EQ(outcome.status, step.status) << outcome.err;
        EXPECT_EQ(outcome.out, step.out);
    }
    request("ready", { "keyboard-open" });
    EXPECT_EQ(loggedLines("assigning plug-in com.example.keyboard-open(",
                  " " + m_uuids["keyboard-open"].string() + " to plugin sandbox"),
        1u);
}

class ReadyWithJobd : public ReadyAccess {
protected:
    void SetUp() override
    {
        ASSERT_TRUE(sandboxAvailable());
        ReadyAccess::SetUp();
        if (HasFatalFailure())
            return;
        m_jobd = std::make_unique<DaemonProcess>(jobdOptions(
            kJobManagerServiceName, m_omd.daemon().root() + "/sandbox.key", "5000", m_omd.daemon().conduitDirectory()));
        ASSERT_TRUE(m_jobd->waitForSocket());
        // This process is the host: it launches what the daemon readied it for.
        ::setenv("CONDUIT_DIR", m_omd.daemon().conduitDirectory().c_str(), 1);
        JobManagerSetServiceName(kJobManagerServiceName);
    }
    void TearDown() override { JobManagerSetServiceName(""); }

    std::unique_ptr<DaemonProcess> m_jobd;
};

TEST_F(ReadyWithJobd, TheHostCanLaunchWhatItWasReadiedForWithItsContainerAsHome)
{
    const std::string executable = m_paths["a"] + "/Run";
    EXPECT_FALSE(JobManagerLaunch(executable).ok());

    const Value reply = request("ready", { "a", "data", "a" });
    EXPECT_EQ(codeOf(reply), 0u) << errorOf(reply);
    EXPECT_EQ(loggedLines(allowing()), 1u);

    auto launched = JobManagerLaunch(executable);
    ASSERT_TRUE(launched.ok()) << launched.error().localizedDescription() << m_jobd->stderrText();
    HostedInstance instance(std::move(launched).releaseValue());
    const Value ping = instance.ask(Value::dictionary({ { "op", "ping" } }));
    const auto container = m_omd.registrar()->plugInAtPath(m_paths["a"])->dataContainerPath();
    ASSERT_TRUE(container);
    EXPECT_EQ(ping["home"], Value::string(*container));
}

TEST_F(ReadyWithJobd, OmctlLaunchReadiesItselfAndTalksToTheInstance)
{
    struct Case {
        std::vector<std::string> arguments;
        int status;
        std::string out; // the start of standard output
    };
    const Case cases[] = {
        { { "launch", m_uuids.at("a").string() }, 0, "launched " },
        // A plug-in the host is refused: omd's code and message, nothing launched.
        { { "launch", m_uuids.at("guarded").string() }, 1, "" },
        { { "launch" }, 2, "" },
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(::testing::PrintToString(c.arguments));
        std::vector<std::string> arguments = c.arguments;
        arguments.insert(arguments.begin(), RegistrarDaemon::omctlPath());
        const auto outcome = ChildProcess::capture(arguments,
            { { "CONDUIT_DIR", m_omd.daemon().conduitDirectory() }, { "JOBD_SERVICE_NAME", kJobManagerServiceName } });
        EXPECT_EQ(outcome.status, c.status) << outcome.err;
        EXPECT_TRUE(outcome.out.starts_with(c.out)) << outcome.out;
        if (c.status == 0) {
            EXPECT_NE(outcome.out.find("home"), std::string::npos) << outcome.out;
        }
    }
}

} // namespace
} // namespace om::test
