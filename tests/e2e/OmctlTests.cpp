// The omctl binary as people and scripts run it: against the real daemon, against an in-process
// service that records exactly what omctl sent, and with hostile JSON.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cmath>
#include <condition_variable>
#include <deque>
#include <filesystem>
#include <fstream>
#include <limits>
#include <mutex>
#include <thread>

#include "platform/Conduit.h"
#include "platform/Registrar.h"
#include "platform/Vlist.h"
#include "tests/support/BundleFixture.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/RawConduitPeer.h"

extern char** environ;

using namespace om;
using om::test::DaemonProcess;

namespace {

constexpr auto kGenerous = std::chrono::seconds(60);

using Outcome = om::test::ChildProcess::Outcome;

// Runs omctl with CONDUIT_DIR set to conduitDirectory, feeding it input on standard input.
Outcome omctl(
    const std::vector<std::string>& arguments, const std::string& conduitDirectory, const std::string& input = {})
{
    std::vector<std::string> argv = { std::string(OM_BINARY_DIR) + "/tools/omctl/omctl" };
    argv.insert(argv.end(), arguments.begin(), arguments.end());
    return om::test::ChildProcess::capture(argv, { { "CONDUIT_DIR", conduitDirectory } }, input);
}

std::string temporaryDirectory()
{
    std::string pattern = (std::filesystem::temp_directory_path() / "omctl-XXXXXX").string();
    return ::mkdtemp(pattern.data()) ? pattern : std::string();
}

// Plays omd in the test process: records each request omctl sends and answers with a fixed reply.
// What the I/O thread's handlers touch is shared with them, so a connection that outlives the
// service (its peer has not closed yet) never reaches a destroyed object.
class RecordingService {
public:
    RecordingService(const std::string& name, Value reply)
        : m_shared(std::make_shared<Shared>())
    {
        m_shared->reply = std::move(reply);
        auto listener = ConduitListener::create(name, m_queue);
        if (!listener.ok()) {
            ADD_FAILURE() << listener.error().localizedDescription();
            return;
        }
        m_listener = listener.value();
        m_listener->setConnectionHandler([shared = m_shared](std::shared_ptr<ConduitConnection> connection) {
            std::weak_ptr<ConduitConnection> weak = connection;
            connection->setEventHandler([shared, weak](const ConduitEvent& event) {
                if (event.kind != ConduitEvent::Kind::Message || !event.expectsReply())
                    return;
                {
                    std::lock_guard lock(shared->mutex);
                    shared->requests.push_back(event.message);
                    shared->changed.notify_all();
                }
                if (auto strong = weak.lock())
                    strong->sendReply(event.requestId, shared->reply);
            });
            connection->resume();
        });
        m_listener->resume();
    }

    ~RecordingService()
    {
        if (m_listener)
            m_listener->cancel();
        m_queue->sync([] {});
    }

    // What omctl sent; none when it sent nothing.
    Value takeRequest()
    {
        std::unique_lock lock(m_shared->mutex);
        if (!m_shared->changed.wait_for(lock, kGenerous, [this] { return !m_shared->requests.empty(); }))
            return Value();
        Value request = m_shared->requests.front();
        m_shared->requests.pop_front();
        return request;
    }

private:
    struct Shared {
        Value reply;
        std::mutex mutex;
        std::condition_variable changed;
        std::deque<Value> requests;
    };
    std::shared_ptr<Shared> m_shared;
    std::shared_ptr<WorkQueue> m_queue = WorkQueue::create("recording-service");
    std::shared_ptr<ConduitListener> m_listener;
};

const Value kEcho = Value::dictionary({ { "errorcode", 0u } });

class OmctlTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        m_directory = temporaryDirectory();
        ASSERT_FALSE(m_directory.empty());
        ::setenv("CONDUIT_DIR", m_directory.c_str(), 1);
    }
    void TearDown() override
    {
        std::error_code ignored;
        std::filesystem::remove_all(m_directory, ignored);
    }

    // Runs "omctl --service fake raw <json>" against a recording service; the request it received.
    Value sentFor(const std::string& json)
    {
        RecordingService service("fake", kEcho);
        Outcome outcome = omctl({ "--service", "fake", "raw", json }, m_directory);
        EXPECT_EQ(outcome.status, 0) << outcome.err;
        return outcome.status == 0 ? service.takeRequest() : Value();
    }

    // Runs "omctl raw <json>" where nothing listens: a parse failure exits 2 before connecting.
    Outcome refused(const std::string& json) { return omctl({ "--service", "nobody", "raw", json }, m_directory); }

    std::string m_directory;
};

class OmctlDaemonTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        DaemonProcess::Options options;
        options.executable = om::test::builtDaemonPath();
        options.arguments = { "-S", "com.orvex.test.omctl" };
        m_daemon = std::make_unique<DaemonProcess>(options);
        ASSERT_TRUE(m_daemon->waitForSocket()) << m_daemon->stderrText();
    }

    Outcome run(std::vector<std::string> arguments, const std::string& input = {})
    {
        arguments.insert(arguments.begin(), { "--service", m_daemon->serviceName() });
        return omctl(arguments, m_daemon->conduitDirectory(), input);
    }

    std::unique_ptr<DaemonProcess> m_daemon;
};

std::string nested(size_t depth, const std::string& inner)
{
    return std::string(depth, '[') + inner + std::string(depth, ']');
}

} // namespace

TEST_F(OmctlDaemonTest, RawInlineJsonPrintsTheReplyAndExitsOneOnError)
{
    Outcome result = run({ "raw", R"({"request": "ping", "version": 3})" });

    EXPECT_EQ(result.status, 1);
    EXPECT_EQ(result.out, "errorcode: 4\nerror: unrecognized request\n");
    EXPECT_NE(result.err.find("omctl: unrecognized request (code 4)\n"), std::string::npos) << result.err;
}

TEST_F(OmctlDaemonTest, RawVlistFileIsSentAsWritten)
{
    std::string path = m_daemon->root() + "/request.vlist";
    std::ofstream(path) << Vlist::writeXml(Value::dictionary({ { "request", "ping" } }));
    Outcome result = run({ "raw", "--file", path });

    // No version: the daemon reads 0.
    EXPECT_EQ(result.status, 1);
    EXPECT_NE(result.err.find("omctl: unsupported protocol version 0 (current 3) (code 7)"), std::string::npos)
        << result.err;
}

TEST_F(OmctlDaemonTest, RawJsonFromStandardInput)
{
    Outcome result = run({ "--json", "raw", "-" }, R"({"version": 3})");

    EXPECT_EQ(result.status, 1);
    EXPECT_EQ(result.out, "{\n  \"errorcode\": 4,\n  \"error\": \"invalid request format (missing type)\"\n}\n");
}

TEST_F(OmctlDaemonTest, PingReportsTheDaemonAnswering)
{
    Outcome result = run({ "ping", "--count", "2" });

    EXPECT_EQ(result.status, 0) << result.err;
    std::string expected = "omd at " + m_daemon->socketPath() + " is answering (round trip ";
    EXPECT_EQ(result.out.find(expected), 0u) << result.out;
    EXPECT_NE(result.out.find(expected, 1), std::string::npos) << result.out;
}

TEST_F(OmctlDaemonTest, StoppedDaemonIsUnreachable)
{
    ASSERT_TRUE(m_daemon->stop().has_value());
    Outcome result = run({ "ping" });

    EXPECT_EQ(result.status, 3);
    EXPECT_NE(result.err.find("omctl: cannot reach omd at " + m_daemon->socketPath() + ": "), std::string::npos)
        << result.err;
}

TEST_F(OmctlTest, UnreachableServiceExitsThree)
{
    Outcome result = omctl({ "--service", "nobody", "raw", R"({"request": "match"})" }, m_directory);

    EXPECT_EQ(result.status, 3);
    EXPECT_NE(result.err.find("omctl: cannot reach omd at " + m_directory + "/nobody: "), std::string::npos)
        << result.err;
    // Said once: the client library's own log line about the broken connection stays off.
    EXPECT_EQ(std::count(result.err.begin(), result.err.end(), '\n'), 1) << result.err;
    EXPECT_TRUE(result.out.empty());
}

TEST_F(OmctlTest, UsageErrorsExitTwo)
{
    const std::vector<std::vector<std::string>> cases = {
        {},
        { "frobnicate" },
        { "--bogus", "ping" },
        { "--service" },
        { "--service=" },
        { "raw" },
        { "raw", "{}", "{}" },
        { "raw", "--file" },
        { "raw", "--file", m_directory + "/missing.vlist" },
        { "raw", "--file", "x", "{}" },
        { "raw", "--bogus" },
        { "raw", "[1, 2]" },
        { "ping", "--count", "0" },
        { "ping", "--count", "10001" },
        { "ping", "--count", "3x" },
        { "ping", "extra" },
    };
    for (const auto& arguments : cases) {
        Outcome result = omctl(arguments, m_directory);
        std::string shown;
        for (const auto& argument : arguments)
            shown += " " + argument;
        EXPECT_EQ(result.status, 2) << "omctl" << shown << "\n" << result.err;
        EXPECT_TRUE(result.err.starts_with("omctl: ")) << "omctl" << shown << "\n" << result.err;
    }
}

TEST_F(OmctlTest, HelpExitsZeroAndListsOnlyTheAvailableCommands)
{
    Outcome main = omctl({ "--help" }, m_directory);
    Outcome raw = omctl({ "raw", "--help" }, m_directory);

    EXPECT_EQ(main.status, 0);
    EXPECT_NE(main.out.find("  raw "), std::string::npos);
    EXPECT_NE(main.out.find("  ping "), std::string::npos);
    EXPECT_EQ(raw.status, 0);
    EXPECT_TRUE(raw.out.starts_with("usage: omctl [--service NAME] [--json] raw")) << raw.out;
}

TEST_F(OmctlTest, JsonKindsMapOntoTheValueTree)
{
    Value request = sentFor(R"({"request": "x", "i": -5, "big": 9223372036854775807,
        "u": 9223372036854775808, "max": 18446744073709551615, "min": -9223372036854775808,
        "r": 1.5, "e": 1e3, "b": true, "f": false, "s": "caf\u00e9 \ud83d\ude00\n\"",
        "a": [1, "two", [], {}], "id": {"$uuid": "6ba7b810-9dad-11d1-80b4-00c04fd430c8"},
        "d": {"$data": "AAEC/w=="}, "t": {"$date": "2026-11-22T10:00:00Z"}, "t2": {"$date": 86400.5},
        "n": {"$real": "-inf"}, "forced": {"$real": 2}, "plain": {"$other": 1}})");

    Value expected = Value::dictionary({
        { "request", "x" },
        { "i", -5 },
        { "big", std::numeric_limits<int64_t>::max() },
        { "u", uint64_t { 9223372036854775808u } },
        { "max", std::numeric_limits<uint64_t>::max() },
        { "min", std::numeric_limits<int64_t>::min() },
        { "r", 1.5 },
        { "e", 1000.0 },
        { "b", true },
        { "f", false },
        { "s", "caf\xC3\xA9 \xF0\x9F\x98\x80\n\"" },
        { "a", Value::array({ 1, "two", Value::array({}), Value::dictionary({}) }) },
        { "id", Value::uuid(*Uuid::parse("6BA7B810-9DAD-11D1-80B4-00C04FD430C8")) },
        { "d", Value::data(std::vector<uint8_t> { 0, 1, 2, 255 }) },
        { "t", Value::date(1795341600) },
        { "t2", Value::date(86400.5) },
        { "n", -std::numeric_limits<double>::infinity() },
        { "forced", 2.0 },
        { "plain", Value::dictionary({ { "$other", 1 } }) },
    });
    EXPECT_EQ(request, expected) << request.description();
    std::vector<std::string> keys;
    for (const auto& entry : request.entries())
        keys.push_back(entry.first);
    std::vector<std::string> expectedKeys;
    for (const auto& entry : expected.entries())
        expectedKeys.push_back(entry.first);
    EXPECT_EQ(keys, expectedKeys);
    EXPECT_EQ(request["u"].type(), Value::Type::Unsigned);
    EXPECT_EQ(request["e"].type(), Value::Type::Real);
    EXPECT_EQ(request["forced"].type(), Value::Type::Real);
    EXPECT_EQ(request["t"].type(), Value::Type::Date);
}

TEST_F(OmctlTest, JsonOutputReadsBackAsTheSameReply)
{
    Value reply = Value::dictionary({
        { "errorcode", 0u },
        { "uuids", Value::uuid(*Uuid::parse("00000000-0000-0000-0000-0000000000FF")) },
        { "blob", Value::data(std::vector<uint8_t> { 0xDE, 0xAD, 0xBE }) },
        { "when", Value::date(1.25) },
        { "beyondCalendars", Value::date(1e300) },
        { "nan", std::numeric_limits<double>::quiet_NaN() },
        { "whole", 3.0 },
        { "tiny", 5e-324 },
        { "negative", std::numeric_limits<int64_t>::min() },
        { "huge", std::numeric_limits<uint64_t>::max() },
        { "text", "tab\tquote\"back\\slash\x01\x7F end \xE2\x82\xAC" },
        { "nested", Value::array({ Value::array({}), Value::dictionary({ { "k", Value::array({ true }) } }) }) },
    });
    Outcome printed;
    {
        RecordingService service("fake", reply);
        printed = omctl({ "--json", "--service", "fake", "raw", R"({"request": "x"})" }, m_directory);
    }
    ASSERT_EQ(printed.status, 0) << printed.err;

    RecordingService echo("fake", kEcho);
    Outcome fed = omctl({ "--service", "fake", "raw", "-" }, m_directory, printed.out);
    ASSERT_EQ(fed.status, 0) << fed.err << printed.out;
    Value readBack = echo.takeRequest();
    // NaN equals nothing, itself included; compare it on its own.
    EXPECT_TRUE(std::isnan(*readBack["nan"].asDouble()));
    EXPECT_EQ(DictionaryBuilder(readBack).remove("nan").build(), DictionaryBuilder(reply).remove("nan").build())
        << printed.out;
    EXPECT_EQ(readBack["whole"].type(), Value::Type::Real);
    EXPECT_EQ(readBack["huge"].type(), Value::Type::Unsigned);
}

TEST_F(OmctlTest, HumanOutputIsAnIndentedOutline)
{
    Value reply = Value::dictionary({
        { "matches",
            Value::array({ Value::dictionary({ { "identifier", "com.a" }, { "tags", Value::array({}) } }), "x" }) },
        { "empty", Value::dictionary({}) },
        { "padded", " a " },
        { "blob", Value::data(std::vector<uint8_t> { 0x0A, 0xFF }) },
    });
    RecordingService service("fake", reply);
    Outcome printed = omctl({ "--service", "fake", "raw", R"({"request": "x"})" }, m_directory);

    EXPECT_EQ(printed.status, 0) << printed.err;
    EXPECT_EQ(printed.out,
        "matches:\n"
        "  [0]\n"
        "    identifier: com.a\n"
        "    tags: []\n"
        "  [1] x\n"
        "empty: {}\n"
        "padded: \" a \"\n"
        "blob: <2 bytes: 0aff>\n");
}

TEST_F(OmctlTest, HostileNestingFailsCleanly)
{
    // Through standard input: a single argument of this size would not even reach exec.
    Outcome result = omctl({ "--service", "nobody", "raw", "-" }, m_directory, nested(100000, ""));

    EXPECT_EQ(result.status, 2);
    EXPECT_NE(result.err.find("nesting deeper"), std::string::npos) << result.err;
}

// The parser's own cases are unit tests (tests/omctl); here, that a refusal is a usage error that
// names the JSON and sends nothing.
TEST_F(OmctlTest, MalformedJsonIsAUsageError)
{
    for (const std::string json :
        { R"({"n": 18446744073709551616})", R"({"a": 1, "a": 2})", "{\"s\": \"\xC3\x28\"}", R"({"n": null})", "" }) {
        Outcome result = refused(json);
        EXPECT_EQ(result.status, 2) << json << "\n" << result.err;
        EXPECT_NE(result.err.find("omctl: raw: JSON request: "), std::string::npos) << json << "\n" << result.err;
    }
}

TEST_F(OmctlTest, InputPastTheSizeLimitIsRefused)
{
    std::string json = R"({"request": "x"})";
    json.resize((16u << 20) + 1, ' ');
    Outcome result = omctl({ "--service", "nobody", "raw", "-" }, m_directory, json);

    EXPECT_EQ(result.status, 2);
    EXPECT_NE(result.err.find("longer than"), std::string::npos) << result.err;
}

// "registrar dump" reads the Registrar's database itself, with no daemon anywhere.
class OmctlRegistrarDump : public OmctlTest {
protected:
    std::string database() const { return m_bundles.root() + "/registrar.db"; }
    Outcome dump(std::vector<std::string> extra = {})
    {
        std::vector<std::string> arguments = { "registrar", "dump", "--database", database() };
        arguments.insert(arguments.end(), extra.begin(), extra.end());
        return omctl(arguments, m_directory);
    }

    om::test::BundleFixture m_bundles;
};

TEST_F(OmctlRegistrarDump, ListsApplicationsWithTheirPlugInsThenLooseOnes)
{
    std::string app = m_bundles.makeApp("Notes", "com.orvex.notes");
    std::string inApp = m_bundles.makePlugIn(app, "Share", "com.orvex.notes.share", "com.orvex.share");
    std::string loose = m_bundles.makeBundle("Loose.appex",
        om::test::BundleFixture::plugInInfo(
            "com.orvex.loose", "", "com.orvex.widget", Value::dictionary({ { "QSExtensionVersion", "4.2" } })));
    std::string uuid;
    {
        RegistrarWorkspace::Configuration configuration { .databasePath = database(),
            .sdkDirectory = m_bundles.root() + "/sdk",
            .containersDirectory = m_bundles.root() + "/containers" };
        auto workspace = RegistrarWorkspace::open(configuration, RegistrarWorkspace::Access::ReadWrite);
        ASSERT_TRUE(workspace.ok());
        auto record = workspace.value()->registerPlugIn(inApp);
        ASSERT_TRUE(record.ok() && workspace.value()->registerPlugIn(loose).ok());
        uuid = record.value()->uuid().string();

        // Read while the writer still has the database open.
        Outcome json = dump({ "--json" });
        EXPECT_EQ(json.status, 0) << json.err;
        for (const std::string& expected :
            std::vector<std::string> { "\"path\": \"" + app + "\"", "\"identifier\": \"com.orvex.notes\"",
                "{\"$uuid\": \"" + uuid + "\"}", "\"identifier\": \"com.orvex.notes.share\"", "\"version\": \"1.0\"",
                "\"extensionPoint\": \"com.orvex.share\"", "\"path\": \"" + inApp + "\"",
                "\"container\": \"" + m_bundles.root() + "/containers/com.orvex.notes.share\"", "\"version\": \"4.2\"",
                "\"placeholder\": false" })
            EXPECT_NE(json.out.find(expected), std::string::npos) << expected << "\n" << json.out;
        EXPECT_LT(json.out.find("com.orvex.notes.share"), json.out.find("com.orvex.loose"));
    }
    Outcome human = dump();
    EXPECT_EQ(human.status, 0) << human.err;
    EXPECT_NE(human.out.find(uuid), std::string::npos) << human.out;
    EXPECT_NE(human.out.find("com.orvex.widget"), std::string::npos) << human.out;
}

TEST_F(OmctlRegistrarDump, MissingDatabaseIsAnErrorAndUsageMistakesAreTwo)
{
    Outcome missing = dump();
    EXPECT_EQ(missing.status, 1);
    EXPECT_NE(missing.err.find("omctl: registrar database " + database() + ": "), std::string::npos) << missing.err;
    EXPECT_FALSE(std::filesystem::exists(database()));

    for (const std::vector<std::string>& arguments : std::vector<std::vector<std::string>> { { "registrar" },
             { "registrar", "list" }, { "registrar", "dump", "--database" }, { "registrar", "dump", "extra" } }) {
        Outcome usage = omctl(arguments, m_directory);
        EXPECT_EQ(usage.status, 2) << usage.err;
        EXPECT_NE(usage.err.find("Try 'omctl --help'"), std::string::npos) << usage.err;
    }
}
