// "lock" against the real daemon: what a hold hides from discovery and for how long, its change
// notifications as a listener on a private bus receives them, refusals, the release of a dead
// client's holds, and, with a real jobd, busy refusals and forced termination of running instances.
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <utility>

#include "Ombrel/OMDaemonClient.h"
#include "platform/Format.h"
#include "tests/e2e/JobdTestSupport.h"
#include "tests/support/ChangeCounter.h"
#include "tests/support/RegistrarDaemon.h"

namespace om::test {
namespace {

const std::string kNotes = RegistrarDaemon::samplesPath() + "/Notes.app";
const std::string kKeys = RegistrarDaemon::samplesPath() + "/Keys.app";
const std::string kPhotos = RegistrarDaemon::samplesPath() + "/Photos.app";
const std::string kShare = kNotes + "/PlugIns/Share.appex";
const std::string kKeyboard = kKeys + "/PlugIns/Keyboard.appex";
constexpr uint64_t kPlugInPaths = OMDaemonClient::OMLockFlagPlugInPaths;

Value lockRequest(const std::vector<std::string>& paths, uint64_t flags)
{
    return DictionaryBuilder(pathsRequest("lock", paths)).set("flags", Value::unsignedInteger(flags)).build();
}

Value releaseRequest(const std::vector<Uuid>& tokens)
{
    ArrayBuilder uuids;
    for (const Uuid& token : tokens)
        uuids.append(Value::uuid(token));
    return DictionaryBuilder(daemonRequest("lock")).set("uuids", uuids.build()).build();
}

// The daemon and a listener meet on a private message bus, so that only this test's
// notifications are counted.
class Holds : public ::testing::Test {
protected:
    void SetUp() override
    {
        m_changes = std::make_unique<ChangeCounter>(m_omd.state().root());
        ASSERT_EQ(m_changes->failure(), "");
        ASSERT_TRUE(m_omd.start({ m_changes->busSetting() }));
        ASSERT_EQ(codeOf(m_omd.add({ kShare, kKeyboard })), 0u);
        m_share = m_omd.uuidAt(kShare)->string();
        m_keyboard = m_omd.uuidAt(kKeyboard)->string();
    }

    std::set<std::string> visible() { return uuidsIn(m_omd.match(Value())); }

    size_t announced() { return m_changes->announcedSince(m_omd); }

    std::unique_ptr<ChangeCounter> m_changes;
    RegistrarDaemon m_omd;
    std::string m_share;
    std::string m_keyboard;
};

TEST_F(Holds, AHoldHidesItsPlugInsUntilReleasedWithOneNotificationPerChange)
{
    struct Row {
        const char* name;
        std::vector<std::string> paths;
        uint64_t flags;
        std::set<std::string> hidden;
    };
    const std::vector<Row> rows {
        { "one plug-in by its path", { kShare }, kPlugInPaths, { m_share } },
        { "two plug-ins by their paths", { kShare, kKeyboard }, kPlugInPaths, { m_share, m_keyboard } },
        { "an application's plug-ins", { kNotes }, 0, { m_share } },
        { "two applications", { kNotes, kKeys }, 0, { m_share, m_keyboard } },
        { "an application with none registered", { kPhotos }, 0, {} },
        { "no paths", {}, 0, {} },
        { "no paths, plug-in flag", {}, kPlugInPaths, {} },
    };
    const std::set<std::string> all { m_share, m_keyboard };
    ASSERT_EQ(visible(), all);
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        const Value reply = m_omd.call(lockRequest(row.paths, row.flags));
        ASSERT_EQ(codeOf(reply), 0u) << errorOf(reply);
        const auto token = reply["uuids"].asUuid();
        ASSERT_TRUE(token) << reply.description();
        EXPECT_TRUE(m_omd.daemon().waitForMessage(format("hold request granted uuid:%s", token->string())));
        std::set<std::string> shown = all;
        for (const auto& uuid : row.hidden)
            shown.erase(uuid);
        EXPECT_EQ(visible(), shown);
        EXPECT_EQ(announced(), 1u);

        EXPECT_EQ(codeOf(m_omd.call(releaseRequest({ *token }))), 0u);
        EXPECT_EQ(visible(), all);
        EXPECT_EQ(announced(), 1u);
        EXPECT_EQ(
            m_omd.daemon().countMessages(format("releasing plug-in hold %s at client's request", token->string())), 1u);
    }
}

TEST_F(Holds, ReleasesOfUnknownTokensAndNonUuidsSucceedAndChangeNothing)
{
    const Value held = m_omd.call(lockRequest({ kShare }, kPlugInPaths));
    const Uuid token = *held["uuids"].asUuid();
    EXPECT_EQ(announced(), 1u);
    const Value strays = DictionaryBuilder(daemonRequest("lock"))
                             .set("uuids", Value::array({ Value::string(token.string()), Value::integer(7) }))
                             .build();
    for (const Value& request : { releaseRequest({ Uuid::random() }), releaseRequest({}), strays }) {
        SCOPED_TRACE(request.description());
        const Value reply = m_omd.call(request);
        EXPECT_EQ(codeOf(reply), 0u);
        EXPECT_TRUE(reply["uuids"].isNone());
    }
    EXPECT_FALSE(visible().contains(m_share));
    EXPECT_EQ(announced(), 0u);
    // One request may release several holds, and a token twice.
    const Uuid second = *m_omd.call(lockRequest({ kKeyboard }, kPlugInPaths))["uuids"].asUuid();
    EXPECT_EQ(codeOf(m_omd.call(releaseRequest({ token, second, token }))), 0u);
    EXPECT_EQ(visible(), (std::set<std::string> { m_share, m_keyboard }));
    EXPECT_EQ(announced(), 3u);
}

TEST_F(Holds, RefusalsCarryTheirCodeAndTextAndHoldNothing)
{
    const std::string canonicalNotes = std::filesystem::canonical(kNotes).string();
    const std::string missing = kNotes + "/PlugIns/Gone.appex";
    struct Row {
        const char* name;
        Value request;
        uint64_t code;
        std::string error;
    };
    const std::vector<Row> rows {
        { "path that does not exist", lockRequest({ kShare, missing }, kPlugInPaths), 9,
            format("invalid path: %s", missing) },
        { "missing application", lockRequest({ missing }, 0), 9, format("invalid path: %s", missing) },
        { "an application named as a plug-in", lockRequest({ kShare, kNotes }, kPlugInPaths), 9,
            format("no plug-in at path:%s", canonicalNotes) },
        { "relative path", lockRequest({ "Notes.app" }, 0), 9, "absolute path required: Notes.app" },
        { "no paths",
            DictionaryBuilder(daemonRequest("lock")).set("flags", Value::unsignedInteger(uint64_t { 0 })).build(), 4,
            "invalid request format" },
        { "uuids not an array, no paths",
            DictionaryBuilder(daemonRequest("lock")).set("uuids", Value::uuid(Uuid::random())).build(), 4,
            "invalid request format" },
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        const Value reply = m_omd.call(row.request);
        EXPECT_EQ(codeOf(reply), row.code);
        EXPECT_EQ(errorOf(reply), row.error);
        EXPECT_TRUE(reply["uuids"].isNone());
    }
    EXPECT_EQ(visible(), (std::set<std::string> { m_share, m_keyboard }));
    EXPECT_EQ(announced(), 0u);
}

TEST_F(Holds, ADeadClientsHoldsAreReleasedEachWithItsLogLineAndNotification)
{
    std::vector<Uuid> tokens;
    {
        auto client = DaemonPeer::connect(m_omd.daemon());
        ASSERT_TRUE(client);
        for (const auto& paths : std::vector<std::vector<std::string>> { { kShare }, { kKeyboard }, {} }) {
            auto reply = client->call(lockRequest(paths, kPlugInPaths));
            ASSERT_TRUE(reply);
            tokens.push_back(*(*reply)["uuids"].asUuid());
        }
        EXPECT_TRUE(visible().empty());
        EXPECT_EQ(announced(), 3u);
    } // the connection closes: the daemon sees the client die
    for (const Uuid& token : tokens) {
        EXPECT_TRUE(m_omd.daemon().waitForMessage(
            format("releasing plug-in hold %s for dead client pid %d", token.string(), ::getpid())));
    }
    EXPECT_EQ(visible(), (std::set<std::string> { m_share, m_keyboard }));
    EXPECT_EQ(announced(), 3u);
}

TEST_F(Holds, ARestartedDaemonHasNoHolds)
{
    ASSERT_EQ(codeOf(m_omd.call(lockRequest({ kNotes, kKeys }, 0))), 0u);
    ASSERT_TRUE(visible().empty());
    ASSERT_TRUE(m_omd.start());
    EXPECT_EQ(visible(), (std::set<std::string> { m_share, m_keyboard }));
}

// omd, entitled to manage jobd, on jobd's Conduit directory, with one registered plug-in whose
// bundle holds jobd's test instance program.
class HoldsWithJobd : public JobdTest {
protected:
    static constexpr const char* kIdentifier = "com.example.worker.task";

    // The instance may outlive SIGTERM; jobd's grace before SIGKILL only makes the test slower.
    std::string killGraceMs() const override { return "1000"; }

    void SetUp() override
    {
        JobdTest::SetUp();
        if (HasFatalFailure())
            return;
        const std::string app = m_dir + "/Worker.app";
        m_plugIn = app + "/PlugIns/Task.appex";
        std::filesystem::create_directories(m_plugIn);
        std::ofstream(app + "/Info.vlist") << Vlist::writeXml(Value::dictionary({
            { "VBBundleIdentifier", "com.example.worker" },
            { "VBBundleVersion", "3" },
            { "VBBundleExecutable", "instance" },
        }));
        std::filesystem::create_hard_link(toolPath("jobd_test_instance"), app + "/instance");
        std::ofstream(m_plugIn + "/Info.vlist") << Vlist::writeXml(Value::dictionary({
            { "VBBundleIdentifier", kIdentifier },
            { "VBBundleVersion", "7" },
            { "VBBundleExecutable", "instance" },
            { "QSExtension", Value::dictionary({ { "QSExtensionPointIdentifier", "com.orvex.share-services" } }) },
        }));
        m_executable = m_plugIn + "/instance";
        std::filesystem::create_hard_link(toolPath("jobd_test_instance"), m_executable);
        std::filesystem::create_directories(container(kIdentifier));

        m_omd.setExecutable(m_omd.copyProgram(
            builtDaemonPath(), m_dir + "/bin/omd", Value::dictionary({ { kJobManagerEntitlement, true } })));
        m_omd.setConduitDirectory(m_jobd->conduitDirectory());
        ASSERT_TRUE(m_omd.start({ { "JOBD_SERVICE_NAME", kJobdTestService } }));
        ASSERT_EQ(codeOf(m_omd.add({ m_plugIn })), 0u);
        m_uuid = m_omd.uuidAt(m_plugIn)->string();
    }

    std::unique_ptr<HostedInstance> launch() { return launchOwn(m_executable, overlay(kIdentifier)); }

    bool running()
    {
        auto instances = JobManagerList();
        EXPECT_TRUE(instances.ok());
        return instances.ok() && std::any_of(instances->begin(), instances->end(), [](const JobInstanceInfo& instance) {
            return instance.bundleIdentifier == kIdentifier;
        });
    }

    RegistrarDaemon m_omd;
    std::string m_plugIn;
    std::string m_executable;
    std::string m_uuid;
};

TEST_F(HoldsWithJobd, TerminationAnswersOnlyOnceTheInstancesAreGone)
{
    struct Row {
        const char* name;
        bool launched;
        std::string jobdAnswer;
    };
    const std::vector<Row> rows {
        { "a running instance", true, format("one or more plug-ins have been terminated for uuid=%s", m_uuid) },
        { "nothing running", false, format("jobd reported no plug-ins on record for uuid=%s", m_uuid) },
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        auto instance = row.launched ? launch() : nullptr;
        ASSERT_EQ(running(), row.launched);
        const size_t before = m_omd.daemon().countMessages(row.jobdAnswer);
        const Value reply = m_omd.call(lockRequest({ m_plugIn }, kPlugInPaths | OMDaemonClient::OMLockFlagTerminate));
        ASSERT_EQ(codeOf(reply), 0u) << errorOf(reply);
        const auto token = reply["uuids"].asUuid();
        ASSERT_TRUE(token);
        // jobd answered before the reply left, and it answers once the instances have exited.
        EXPECT_FALSE(running());
        EXPECT_EQ(m_omd.daemon().countMessages(row.jobdAnswer), before + 1);
        EXPECT_TRUE(m_omd.daemon().waitForMessage(
            format("forced termination complete; hold request granted uuid:%s", token->string())));
        EXPECT_EQ(codeOf(m_omd.call(releaseRequest({ *token }))), 0u);
    }
    EXPECT_EQ(m_omd.daemon().countMessages(format("requesting termination for %s(7) jobd:7 %s", kIdentifier, m_uuid)),
        rows.size());
    EXPECT_EQ(m_omd.daemon().countMessages("waiting for 1 termination replies"), rows.size());
    EXPECT_EQ(m_omd.daemon().countMessages("awaiting termination reply #0"), rows.size());
    EXPECT_EQ(m_omd.daemon().countMessages("awaiting termination reply #1"), 0u);
    EXPECT_EQ(m_omd.daemon().countMessages("sending termination reply"), rows.size());
}

TEST_F(HoldsWithJobd, ABusyInstanceRefusesACheckedHoldAndAnIdleOneDoesNot)
{
    auto instance = launch();
    ASSERT_TRUE(instance);
    const uint64_t flags = kPlugInPaths | OMDaemonClient::OMLockFlagCheckBusy;
    struct Row {
        const char* declaration;
        uint64_t code;
        Value conflicts;
    };
    const std::vector<Row> rows {
        { "busy", 14, Value::array({ Value::dictionary({ { kJobManagerBundleIdentifierKey, kIdentifier } }) }) },
        { "idle", 0, Value() },
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.declaration);
        ASSERT_EQ(instance->ask(Value::dictionary({ { "op", row.declaration } }))["status"].asInt64(), 0);
        const Value reply = m_omd.call(lockRequest({ m_plugIn }, flags));
        EXPECT_EQ(codeOf(reply), row.code);
        EXPECT_EQ(reply["conflicts"], row.conflicts);
        EXPECT_EQ(reply["uuids"].isNone(), row.code != 0);
        if (row.code != 0) {
            EXPECT_EQ(errorOf(reply), "plug-ins are busy");
        }
    }
    // Without the flag a busy plug-in is held all the same.
    ASSERT_EQ(instance->ask(Value::dictionary({ { "op", "busy" } }))["status"].asInt64(), 0);
    EXPECT_EQ(codeOf(m_omd.call(lockRequest({ m_plugIn }, kPlugInPaths))), 0u);
    EXPECT_TRUE(running());
}

} // namespace
} // namespace om::test
