// What the annotation file holds when the real daemon dies: killed (through a preloaded shim) at
// each step of a save, the file is the previous table or the new one, never a mix, a fragment or
// nothing; and an election the daemon has acknowledged survives SIGKILL right after the reply.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>

#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/ConduitMessageEncoding.h"
#include "platform/Format.h"
#include "platform/Vlist.h"
#include "tests/support/BundleFixture.h"
#include "tests/support/DaemonProcess.h"

namespace om::test {
namespace {

namespace fs = std::filesystem;

const std::string kSamples = std::string(OM_BINARY_DIR) + "/samples";
const std::string kShare = kSamples + "/Notes.app/PlugIns/Share.appex";
const std::string kShim = std::string(OM_BINARY_DIR) + "/tests/om_crash_shim.so";
constexpr const char* kShareIdentifier = "com.example.notes.share";

Value annotateRequest(const std::string& uuid, const Value& annotations)
{
    return DictionaryBuilder(daemonRequest("annotate"))
        .set("uuids", Value::array({ Value::uuid(*Uuid::parse(uuid)) }))
        .set("annotations", annotations)
        .build();
}

Value tableWith(const Value& entry)
{
    return Value::dictionary(
        { { "version", Value(16) }, { "data", Value::dictionary({ { kShareIdentifier, entry } }) } });
}

class AnnotationDurability : public ::testing::Test {
protected:
    // Its own directory, so that the shim's path fragment names nothing else the daemon writes.
    std::string directory() const { return m_state.root() + "/annotations-db"; }
    std::string database() const { return directory() + "/annotations.vlist"; }

    void start(std::vector<std::pair<std::string, std::string>> extra = {})
    {
        m_peer.reset();
        DaemonProcess::Options options;
        options.executable = builtDaemonPath();
        options.privateDatabase = false;
        options.arguments = { "-d", database() };
        options.environment = {
            { "REGISTRAR_DB", m_state.root() + "/registrar.db" },
            { "REGISTRAR_CONTAINERS", m_state.root() + "/containers" },
            { "REGISTRAR_SDK_DIR", kSamples + "/SDKs" },
        };
        options.environment.insert(options.environment.end(), extra.begin(), extra.end());
        m_daemon = std::make_unique<DaemonProcess>(options);
        ASSERT_TRUE(m_daemon->waitForSocket()) << m_daemon->stderrText();
        auto peer = DaemonPeer::connect(*m_daemon);
        ASSERT_TRUE(peer);
        m_peer.emplace(std::move(*peer));
    }

    // Registers the sample plug-in (again: its UUID stays) and returns its UUID.
    std::string addShare()
    {
        auto added = m_peer->call(
            DictionaryBuilder(daemonRequest("add")).set("paths", Value::array({ Value(kShare.c_str()) })).build());
        EXPECT_TRUE(added && !added->contains("error")) << (added ? added->description() : m_daemon->stderrText());
        const Value found = match(Value::dictionary({ { "QSExtensionIdentifier", kShareIdentifier } }));
        EXPECT_EQ(found.count(), 1u) << found.description();
        const std::string* uuid = found.count() == 1 ? found.elements()[0].stringFor("uuid") : nullptr;
        return uuid ? *uuid : std::string();
    }

    // The forms a "match" with these rules returns.
    Value match(const Value& rules)
    {
        auto reply = m_peer->call(DictionaryBuilder(daemonRequest("match")).set("rules", rules).build());
        EXPECT_TRUE(reply) << m_daemon->stderrText();
        if (!reply)
            return Value::array({});
        auto forms = ConduitMessageEncoding::decode((*reply)["matches"]);
        EXPECT_TRUE(forms) << reply->description();
        return forms ? *forms : Value::array({});
    }

    void annotate(const std::string& uuid, const Value& annotations)
    {
        auto reply = m_peer->call(annotateRequest(uuid, annotations));
        ASSERT_TRUE(reply) << m_daemon->stderrText();
        EXPECT_FALSE(reply->contains("error")) << reply->description();
    }

    // The sample's annotation as discovery reports it from a daemon started afresh on the state.
    Value annotationAfterRestart()
    {
        start();
        const Value found = match(Value::dictionary({ { "QSExtensionIdentifier", kShareIdentifier } }));
        return found.count() == 1 ? found.elements()[0]["annotations"] : Value();
    }

    BundleFixture m_state;
    std::unique_ptr<DaemonProcess> m_daemon;
    std::optional<DaemonPeer> m_peer;
};

TEST_F(AnnotationDurability, CrashAtEachStepOfASaveLeavesTheOldOrTheNewTable)
{
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
    GTEST_SKIP() << "a preloaded shim cannot come before the sanitizer runtime; the default build runs this test";
#endif
    if (!fs::exists(kShim))
        GTEST_SKIP() << "no crash shim in this build (" << kShim << ")";
    struct Step {
        const char* name;
        bool renamed; // the new table has its name by the time the daemon dies
    };
    const Step steps[] = {
        { "write-half", false },
        { "before-fsync", false },
        { "after-fsync", false },
        { "before-rename", false },
        { "after-rename", true },
        { "after-dir-fsync", true },
    };
    const Value previous = Value::dictionary({ { "election", 1 } });
    const Value next = Value::dictionary({ { "election", 2 }, { "extension", Value::dictionary({ { "k", "v" } }) } });
    for (const auto& step : steps) {
        SCOPED_TRACE(step.name);
        fs::remove_all(directory());
        fs::create_directories(directory());

        start();
        const std::string uuid = addShare();
        ASSERT_FALSE(uuid.empty());
        annotate(uuid, previous);
        ASSERT_TRUE(m_daemon->stop());
        ASSERT_EQ(*Vlist::readFile(database()), tableWith(previous));

        start({ { "LD_PRELOAD", kShim }, { "OMTEST_CRASH_FILE", directory() }, { "OMTEST_CRASH_STEP", step.name } });
        EXPECT_FALSE(m_peer->call(annotateRequest(uuid, next))) << "the daemon answered instead of dying";
        auto status = m_daemon->waitForExit();
        ASSERT_TRUE(status);
        ASSERT_TRUE(WIFSIGNALED(*status) && WTERMSIG(*status) == SIGKILL) << "status " << *status;

        auto onDisk = Vlist::readFile(database());
        ASSERT_TRUE(onDisk.ok()) << onDisk.error().localizedDescription();
        EXPECT_EQ(*onDisk, tableWith(step.renamed ? next : previous));
        EXPECT_EQ(annotationAfterRestart(), step.renamed ? next : previous);
    }
}

TEST_F(AnnotationDurability, AcknowledgedElectionSurvivesSigkill)
{
    fs::create_directories(directory()); // the daemon makes no directory for an explicit file
    start();
    const std::string uuid = addShare();
    ASSERT_FALSE(uuid.empty());
    annotate(uuid, Value::dictionary({ { "election", 1 } }));
    m_daemon->sendSignal(SIGKILL);
    auto status = m_daemon->waitForExit();
    ASSERT_TRUE(status);
    ASSERT_TRUE(WIFSIGNALED(*status));

    start();
    const Value elected = match(Value::dictionary({ { "QSUserElection", "=1" } }));
    ASSERT_EQ(elected.count(), 1u) << elected.description();
    EXPECT_EQ(*elected.elements()[0].stringFor("uuid"), uuid);
    EXPECT_EQ(elected.elements()[0]["annotations"], Value::dictionary({ { "election", 1 } }));
    EXPECT_EQ(match(Value::dictionary({ { "QSUserElection", "=0" } })).count(), 0u);
}

} // namespace
} // namespace om::test
