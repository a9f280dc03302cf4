// "add", "remove" and "bulk" against the real daemon with its real Registrar: the path walk's
// codes and texts, what a refusal leaves unchanged, durability across restarts and SIGKILL, the
// manager entitlement through an entitled copy of omctl, and many installers at once.
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <future>
#include <thread>

#include "Ombrel/OMDaemonClient.h"
#include "platform/Format.h"
#include "platform/Registrar.h"
#include "platform/Vlist.h"
#include "tests/support/BundleFixture.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/RegistrarDaemon.h"

namespace om::test {
namespace {

const std::string kSamples = std::string(OM_BINARY_DIR) + "/samples";
const std::string kShare = kSamples + "/Notes.app/PlugIns/Share.appex";
const std::string kTemplates = kSamples + "/Notes.app/PlugIns/Templates.bundle";
const std::string kFilters = kSamples + "/Photos.app/PlugIns/Filters.appex";

class Registration : public ::testing::Test {
protected:
    void SetUp() override { start(); }

    // The state lives in m_omd, so that a restarted daemon finds it again.
    void start()
    {
        ASSERT_TRUE(m_omd.start());
        m_daemon = &m_omd.daemon();
    }

    Value call(const Value& request) { return m_omd.call(request); }
    Value add(const std::vector<std::string>& paths) { return m_omd.add(paths); }
    std::shared_ptr<RegistrarWorkspace> registrar() { return m_omd.registrar(); }
    std::optional<Uuid> registeredUuid(const std::string& path) { return m_omd.uuidAt(path); }

    // An entitled copy of omctl: the daemon reads entitlements from the client's executable.
    std::string entitledOmctl(const Value& entitlements)
    {
        return m_omd.copyProgram(RegistrarDaemon::omctlPath(), m_omd.state().root() + "/omctl", entitlements);
    }

    ChildProcess::Outcome omctl(const std::string& program, const std::vector<std::string>& arguments)
    {
        std::vector<std::string> argv = { program };
        argv.insert(argv.end(), arguments.begin(), arguments.end());
        return m_omd.run(argv);
    }

    RegistrarDaemon m_omd;
    BundleFixture m_bundles;
    DaemonProcess* m_daemon = nullptr;
};

TEST_F(Registration, PathWalkAnswersEachBadElementWithItsCodeAndText)
{
    const std::string missing = m_bundles.root() + "/Missing.appex";
    const std::string loop = m_bundles.root() + "/loop";
    std::filesystem::create_symlink(loop, loop);
    const std::string longPath = "/" + std::string(1100, 'a');
    struct Case {
        const char* name;
        Value request;
        uint64_t code;
        std::string text;
    };
    const Case cases[] = {
        { "no paths", daemonRequest("add"), 4, "invalid request format" },
        { "paths not an array", DictionaryBuilder(daemonRequest("add")).set("paths", kShare).build(), 4,
            "invalid request format" },
        { "element not a string",
            DictionaryBuilder(daemonRequest("add")).set("paths", Value::array({ Value(7) })).build(), 4,
            "invalid request format" },
        { "relative path", pathsRequest("add", { "samples/Notes.app" }), 9,
            "absolute path required: samples/Notes.app" },
        { "empty path", pathsRequest("add", { "" }), 9, "absolute path required: " },
        { "missing bundle", pathsRequest("add", { missing }), 9, "invalid plugin path: " + missing },
        { "symbolic link loop", pathsRequest("add", { loop }), 9, "invalid plugin path: " + loop },
        { "path over 1024 bytes", pathsRequest("add", { longPath }), 9, "invalid plugin path: " + longPath },
        { "an app is no plug-in", pathsRequest("add", { kSamples + "/Notes.app" }), 2,
            "unable to register plug-in at " + kSamples + "/Notes.app" },
        { "remove without paths", daemonRequest("remove"), 4, "invalid request format" },
        { "remove of a relative path", pathsRequest("remove", { "x" }), 9, "absolute path required: x" },
    };
    for (const auto& test : cases) {
        Value reply = call(test.request);
        EXPECT_EQ(codeOf(reply), test.code) << test.name;
        EXPECT_EQ(errorOf(reply), test.text) << test.name;
    }
    EXPECT_EQ(registrar()->plugInCount(), 0u);
}

TEST_F(Registration, EmptyListsAndBulkSucceedAndChangeNothing)
{
    for (Value request : { pathsRequest("add", {}), pathsRequest("remove", {}), daemonRequest("bulk"),
             DictionaryBuilder(daemonRequest("bulk")).set("flags", Value(0xffu)).build() }) {
        Value reply = call(request);
        EXPECT_EQ(reply, Value::dictionary({})) << request.description();
    }
    EXPECT_TRUE(m_daemon->waitForMessage("bulk options 0x0 not supported"));
    EXPECT_TRUE(m_daemon->waitForMessage("bulk options 0xff not supported"));
    EXPECT_EQ(registrar()->plugInCount(), 0u);
}

TEST_F(Registration, WalkStopsAtTheFirstBadPathAndKeepsWhatCameBefore)
{
    const std::string missing = m_bundles.root() + "/Gone.appex";
    Value reply = add({ kShare, missing, kTemplates });

    EXPECT_EQ(codeOf(reply), 9u);
    EXPECT_EQ(errorOf(reply), "invalid plugin path: " + missing);
    EXPECT_TRUE(registeredUuid(kShare));
    EXPECT_FALSE(registeredUuid(kTemplates));
}

TEST_F(Registration, SymbolicLinkIsRegisteredUnderItsCanonicalPath)
{
    const std::string link = m_bundles.root() + "/Share.appex";
    std::filesystem::create_symlink(kShare, link);

    EXPECT_EQ(codeOf(add({ link })), 0u);
    EXPECT_TRUE(registeredUuid(kShare));
    EXPECT_FALSE(registeredUuid(link));
    EXPECT_TRUE(m_daemon->waitForMessage(format("plug-in INSTALLED:%@ %@(%@) %{public}@ %@", "com.example.notes.share",
        "com.example.notes.share", "12", Value::uuid(*registeredUuid(kShare)), kShare)));
}

// Bundles that are no plug-in, or that a hostile installer wrote, are refused one by one while the
// daemon keeps serving, and what was registered before stays exactly as it was.
TEST_F(Registration, HostileBundlesAreRefusedAndLoseNothing)
{
    ASSERT_EQ(codeOf(add({ kShare })), 0u);
    const auto before = registeredUuid(kShare);

    Value deep = Value::dictionary({ { "leaf", 1 } });
    for (int level = 0; level < 100; ++level)
        deep = Value::dictionary({ { "d", deep } });
    const std::vector<std::pair<std::string, Value>> hostile = {
        { "NoExtension.appex", BundleFixture::appInfo("com.hostile.none", "x") },
        { "Typed.appex", Value::dictionary({ { "VBBundleIdentifier", 7 }, { "QSExtension", "text" } }) },
        { "NoIdentifier.appex", Value::dictionary({ { "QSExtension", Value::dictionary({}) } }) },
        { "Huge.appex",
            BundleFixture::plugInInfo(
                "com.hostile.huge", "x", "p", Value::dictionary({ { "Big", std::string(10 << 20, 'x') } })) },
        { "Deep.appex", BundleFixture::plugInInfo("com.hostile.deep", "x", "p", Value::dictionary({ { "D", deep } })) },
    };
    for (const auto& [name, info] : hostile) {
        const std::string path = m_bundles.makeBundle(name, info);
        Value reply = add({ path });
        EXPECT_EQ(codeOf(reply), 2u) << name;
        EXPECT_EQ(errorOf(reply), "unable to register plug-in at " + path) << name;
        EXPECT_EQ(codeOf(call(daemonRequest("bulk"))), 0u) << "not serving after " << name;
    }
    const std::string damaged = m_bundles.makeDirectory("Damaged.appex");
    m_bundles.writeFile("Damaged.appex/Info.vlist", "<vlist version=\"1\"><dict><key>");
    EXPECT_EQ(codeOf(add({ damaged })), 2u);

    EXPECT_EQ(registrar()->plugInCount(), 1u);
    EXPECT_EQ(registeredUuid(kShare), before);
}

TEST_F(Registration, RegistrationsSurviveARestartAndSigkillRightAfterTheReply)
{
    ASSERT_EQ(codeOf(add({ kShare })), 0u);
    ASSERT_TRUE(m_daemon->stop());
    start();
    ASSERT_EQ(codeOf(add({ kTemplates })), 0u);
    m_daemon->sendSignal(SIGKILL);
    ASSERT_TRUE(m_daemon->waitForExit());

    EXPECT_TRUE(registeredUuid(kShare));
    EXPECT_TRUE(registeredUuid(kTemplates));
    auto uuid = registeredUuid(kShare);
    start();
    ASSERT_EQ(codeOf(add({ kShare })), 0u);
    EXPECT_EQ(registeredUuid(kShare), uuid) << "registering again keeps the UUID";
}

TEST_F(Registration, RemoveNeedsTheManagerEntitlement)
{
    ASSERT_EQ(codeOf(add({ kShare })), 0u);

    Value reply = call(pathsRequest("remove", { kShare }));
    EXPECT_EQ(codeOf(reply), 11u);
    EXPECT_EQ(errorOf(reply), "caller lacks entitlement for this operation");
    EXPECT_TRUE(m_daemon->waitForMessage(
        format("refused request from pid=%d to remove plug-in at %@ - client lacks required entitlement", ::getpid(),
            kShare)));
    EXPECT_TRUE(registeredUuid(kShare));

    const std::string manager = entitledOmctl(Value::dictionary({ { "com.orvex.private.ombrel.manager", true } }));
    ChildProcess::Outcome removed = omctl(manager, { "remove", kShare });
    EXPECT_EQ(removed.status, 0) << removed.err;
    EXPECT_EQ(removed.out, "removed " + kShare + "\n");
    EXPECT_FALSE(registeredUuid(kShare));

    ChildProcess::Outcome again = omctl(manager, { "remove", kShare });
    EXPECT_EQ(again.status, 1);
    EXPECT_EQ(again.err, "omctl: no plugin at " + kShare + " (code 9)\n");

    const std::string refused = entitledOmctl(Value::dictionary({ { "com.orvex.private.ombrel.manager", false } }));
    EXPECT_EQ(omctl(refused, { "remove", kTemplates }).status, 1);
}

TEST_F(Registration, ABundleDeletedFromDiskCanStillBeRemoved)
{
    const std::string plugIn = m_bundles.makeBundle(
        "Host.app/PlugIns/Gone.appex", BundleFixture::plugInInfo("com.example.gone", "Gone", "com.example.point"));
    m_bundles.makeBundle("Host.app", BundleFixture::appInfo("com.example.host", "Host"));
    ASSERT_EQ(codeOf(add({ plugIn })), 0u);
    const auto uuid = registeredUuid(plugIn);
    ASSERT_TRUE(uuid);
    std::filesystem::remove_all(plugIn);

    const std::string manager = entitledOmctl(Value::dictionary({ { "com.orvex.private.ombrel.manager", "yes" } }));
    ChildProcess::Outcome removed = omctl(manager, { "--json", "remove", plugIn });
    EXPECT_EQ(removed.status, 0) << removed.err;
    EXPECT_FALSE(registeredUuid(plugIn));
    EXPECT_TRUE(m_daemon->waitForMessage(format("plug-in UNINSTALLED:%@ %@(%@) %{public}@ %@", "com.example.gone",
        "com.example.gone", "1", Value::uuid(*uuid), plugIn)));
}

TEST_F(Registration, ManyInstallersAtOnceAreAllRegistered)
{
    constexpr int kInstallers = 8;
    constexpr int kEach = 6;
    ::setenv("CONDUIT_DIR", m_daemon->conduitDirectory().c_str(), 1);
    std::vector<std::vector<std::string>> batches(kInstallers);
    for (int installer = 0; installer < kInstallers; ++installer) {
        const std::string app = format("App%d.app", installer);
        m_bundles.makeBundle(app, BundleFixture::appInfo(format("com.example.app%d", installer), "App"));
        for (int i = 0; i < kEach; ++i) {
            batches[installer].push_back(m_bundles.makeBundle(format("%s/PlugIns/P%d.appex", app, i),
                BundleFixture::plugInInfo(format("com.example.app%d.p%d", installer, i), "P", "com.example.point")));
        }
    }
    std::vector<std::future<std::optional<OMError>>> results;
    for (const auto& batch : batches) {
        results.push_back(std::async(std::launch::async, [&, batch] {
            auto client = OMDaemonClient::initWithServiceName(m_daemon->serviceName().c_str());
            ArrayBuilder list;
            for (const auto& path : batch)
                list.append(Value::string(path));
            const Value paths = list.build();
            return OMDaemonClient::errorInReply(
                client->waitForReply([&](auto block) { client->addPlugIns(paths, block); }));
        }));
    }
    for (auto& result : results) {
        auto error = result.get();
        EXPECT_FALSE(error) << error->localizedDescription();
    }
    auto workspace = registrar();
    EXPECT_EQ(workspace->plugInCount(), size_t(kInstallers * kEach));
    for (const auto& batch : batches)
        EXPECT_EQ(
            workspace->plugInsOfApplication(std::filesystem::path(batch.front()).parent_path().parent_path().string())
                .size(),
            size_t(kEach));
}

} // namespace
} // namespace om::test
