// The jobd end-to-end fixture: a real jobd on a private CONDUIT_DIR running real bwrap, bundles
// holding the instance test program, an entitled copy of the test client (the manager), and a
// host side that talks to launched instances.
#pragma once

#include <gtest/gtest.h>
#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/Conduit.h"
#include "platform/JobManager.h"
#include "platform/Process.h"
#include "platform/Vlist.h"
#include "tests/platform/ConduitTestSupport.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/DaemonProcess.h"

namespace om::test {

inline constexpr const char* kJobdTestService = "com.orvex.jobd.test";

inline std::string toolPath(const std::string& name)
{
    return std::string(OM_BINARY_DIR) + "/tests/" + name;
}

// Whether bubblewrap can make the namespaces every profile asks for on this machine; the reason
// when it cannot. Sandbox tests call it first and fail loudly rather than pass without a sandbox.
inline ::testing::AssertionResult sandboxAvailable()
{
    auto outcome = ChildProcess::capture({ "/usr/bin/bwrap", "--unshare-user", "--unshare-pid", "--unshare-net",
        "--unshare-ipc", "--unshare-uts", "--ro-bind", "/", "/", "true" });
    if (outcome.status == 0)
        return ::testing::AssertionSuccess();
    return ::testing::AssertionFailure() << "bubblewrap cannot create the sandbox's namespaces on this machine "
                                            "(user namespaces forbidden?); the sandbox tests cannot run: "
                                         << outcome.err;
}

// A launched instance seen from its host: requests go over the connection jobd handed over.
class HostedInstance {
public:
    explicit HostedInstance(JobLaunch launch)
        : m_pid(launch.pid)
        , m_connection(ConduitConnection::adoptSocket(std::move(launch.connection), nullptr))
    {
        m_connection->setEventHandler([](const ConduitEvent&) {});
        m_connection->resume();
    }
    ~HostedInstance() { m_connection->cancel(); }
    HostedInstance(const HostedInstance&) = delete;
    HostedInstance& operator=(const HostedInstance&) = delete;

    pid_t pid() const { return m_pid; }
    Value ask(const Value& request)
    {
        Mailbox<Result<Value>> outcome;
        m_connection->sendWithReply(request, nullptr, [&outcome](Result<Value> reply) { outcome.push(reply); });
        auto reply = outcome.pop();
        return reply && reply->ok() ? reply->value() : Value();
    }
    bool canRead(const std::string& path)
    {
        return ask(Value::dictionary({ { "op", "read" }, { "path", path } }))["ok"].asBool().value_or(false);
    }

private:
    pid_t m_pid;
    std::shared_ptr<ConduitConnection> m_connection;
};

// The built jobd serving service, its tokens checked under key; on conduitDirectory when given
// (omd's, say), else on a directory of its own.
inline DaemonProcess::Options jobdOptions(const std::string& service, const std::string& key,
    const std::string& killGraceMs, std::optional<std::string> conduitDirectory = std::nullopt)
{
    DaemonProcess::Options options;
    options.executable = std::string(OM_BINARY_DIR) + "/services/jobd/jobd";
    options.arguments = { "-S", service };
    options.conduitDirectory = std::move(conduitDirectory);
    options.privateDatabase = false;
    options.environment = { { "JOBD_PROFILES_DIR", std::string(OM_SOURCE_DIR) + "/services/jobd/profiles" },
        { "JOBD_KILL_GRACE_MS", killGraceMs }, { "SANDBOX_KEY", key } };
    return options;
}

class JobdTest : public ::testing::Test {
protected:
    virtual std::string killGraceMs() const { return "30000"; }

    void SetUp() override
    {
        ASSERT_TRUE(sandboxAvailable());
        char pattern[] = "/tmp/jobd-test-XXXXXX";
        ASSERT_NE(::mkdtemp(pattern), nullptr);
        m_dir = pattern;
        const std::string key = m_dir + "/sandbox.key";
        ::setenv("SANDBOX_KEY", key.c_str(), 1);
        m_jobd = std::make_unique<DaemonProcess>(jobdOptions(kJobdTestService, key, killGraceMs()));
        ASSERT_TRUE(m_jobd->waitForSocket());
        ::setenv("CONDUIT_DIR", m_jobd->conduitDirectory().c_str(), 1);
        JobManagerSetServiceName(kJobdTestService);
        ::setenv("JOBD_SERVICE_NAME", kJobdTestService, 1); // for the programs the tests run

        m_manager = m_dir + "/manager";
        std::filesystem::copy_file(toolPath("jobd_test_client"), m_manager);
        const std::string entitlements = m_dir + "/manager.vlist";
        std::ofstream(entitlements) << Vlist::writeXml(Value::dictionary({ { kJobManagerEntitlement, true } }));
        ASSERT_EQ(ChildProcess::run({ std::string(OM_SOURCE_DIR) + "/scripts/entitle", m_manager, entitlements }), 0);
    }

    void TearDown() override
    {
        JobManagerSetServiceName("");
        m_jobd.reset();
        std::error_code ignored;
        std::filesystem::remove_all(m_dir, ignored);
    }

    // A plug-in bundle <dir>/<name>.appex holding the instance program, and its data container.
    // Returns the executable's path.
    std::string makeBundle(const std::string& name, const std::string& identifier, const std::string& version = "1")
    {
        const std::string bundle = m_dir + "/" + name + ".appex";
        std::filesystem::create_directories(bundle);
        std::ofstream(bundle + "/Info.vlist") << Vlist::writeXml(Value::dictionary({
            { "VBBundleIdentifier", identifier },
            { "VBBundleVersion", version },
            { "VBBundleExecutable", "instance" },
        }));
        const std::string executable = bundle + "/instance";
        // A link, not a copy: many bundles cost nothing.
        std::filesystem::create_hard_link(toolPath("jobd_test_instance"), executable);
        std::filesystem::create_directories(container(identifier));
        return executable;
    }
    std::string container(const std::string& identifier) const { return m_dir + "/containers/" + identifier; }

    Value overlay(const std::string& identifier, const std::string& profile = "plugin",
        std::map<std::string, std::string> environment = {}, std::vector<std::string> tokens = {}) const
    {
        environment.try_emplace("HOME", container(identifier));
        std::vector<Value::Entry> variables;
        for (auto& [name, value] : environment)
            variables.emplace_back(name, value);
        std::vector<Value> extensions(tokens.begin(), tokens.end());
        return Value::dictionary({
            { "ConduitService",
                Value::dictionary(
                    { { "EnvironmentVariables", Value::dictionary(variables) }, { "_SandboxProfile", profile },
                        { "_OmitSandboxParameters", true }, { "_SandboxExtensions", Value::array(extensions) } }) },
            { "VBBundlePackageType", "CND!" },
        });
    }

    // JobManagerAddService made by the entitled manager program; extra arguments go after it.
    int addService(pid_t host, const std::string& executable, const Value& overlay,
        const std::vector<std::string>& extra = {}, const std::string& client = {})
    {
        const std::string file = m_dir + "/overlay-" + std::to_string(++m_overlays) + ".vlist";
        std::ofstream(file) << Vlist::writeXml(overlay);
        std::vector<std::string> arguments
            = { client.empty() ? m_manager : client, "add", std::to_string(host), executable, file };
        arguments.insert(arguments.end(), extra.begin(), extra.end());
        return ChildProcess::run(arguments);
    }
    int manage(const std::vector<std::string>& arguments)
    {
        std::vector<std::string> command = { m_manager };
        command.insert(command.end(), arguments.begin(), arguments.end());
        return ChildProcess::run(command);
    }

    // Adds a grant for this process and launches it.
    std::unique_ptr<HostedInstance> launchOwn(const std::string& executable, const Value& overlay)
    {
        EXPECT_EQ(addService(::getpid(), executable, overlay), 0);
        auto launched = JobManagerLaunch(executable);
        EXPECT_TRUE(launched.ok()) << (launched.ok() ? "" : launched.error().localizedDescription());
        if (!launched.ok())
            return nullptr;
        return std::make_unique<HostedInstance>(std::move(launched).releaseValue());
    }

    std::string m_dir;
    std::string m_manager;
    std::unique_ptr<DaemonProcess> m_jobd;
    int m_overlays = 0;
};

} // namespace om::test
