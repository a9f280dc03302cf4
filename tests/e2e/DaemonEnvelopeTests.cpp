// The request envelope against the real daemon: version and name rules, what is and is not
// answered, per-client request counting, and what the end of a client changes.
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>

#include "omd/OMDConduitClient.h"
#include "platform/Format.h"
#include "tests/support/DaemonProcess.h"

namespace om::test {
namespace {

class DaemonEnvelope : public ::testing::Test {
protected:
    void SetUp() override
    {
        DaemonProcess::Options options;
        options.executable = builtDaemonPath();
        m_daemon = std::make_unique<DaemonProcess>(options);
        ASSERT_TRUE(m_daemon->waitForSocket()) << m_daemon->stderrText();
    }

    std::optional<DaemonPeer> connect() { return DaemonPeer::connect(*m_daemon); }

    static uint64_t code(const Value& reply) { return reply["errorcode"].asUInt64().value_or(0); }
    static std::string text(const Value& reply)
    {
        auto* error = reply.stringFor("error");
        return error ? *error : "<none>";
    }
    static std::string ours(std::string_view format, std::string_view argument = {})
    {
        return argument.empty() ? om::format(format, ::getpid()) : om::format(format, ::getpid(), argument);
    }
    size_t requestsLogged(std::string_view name) const
    {
        return m_daemon->countMessages(ours("client %d requested %s", name));
    }
    static size_t clientsMade(const std::vector<DaemonLogLine>& lines)
    {
        return static_cast<size_t>(std::count_if(lines.begin(), lines.end(),
            [](const DaemonLogLine& line) { return line.message.starts_with(ours("new client %d ")); }));
    }

    // The record stops accepting work just after its "is dead" line, on the transport's one
    // thread; a connection that thread accepts afterwards proves that it has done so.
    bool waitUntilOurDeadClientStopsAcceptingWork()
    {
        if (!m_daemon->waitForMessage(ours("client %d is dead")))
            return false;
        size_t before = clientsMade(m_daemon->lines());
        auto late = connect();
        return late && m_daemon->waitForLines([&](const auto& lines) { return clientsMade(lines) > before; });
    }

    std::unique_ptr<DaemonProcess> m_daemon;
};

TEST_F(DaemonEnvelope, MissingVersionIsRefusedAsVersionZero)
{
    auto peer = connect();
    ASSERT_TRUE(peer);
    auto reply = peer->call(Value::dictionary({ { "request", "match" } }));
    ASSERT_TRUE(reply);
    EXPECT_EQ(code(*reply), 7u);
    EXPECT_EQ(text(*reply), "unsupported protocol version 0 (current 3)");
}

TEST_F(DaemonEnvelope, VersionsNextToTheSupportedOnesAreRefused)
{
    auto peer = connect();
    ASSERT_TRUE(peer);
    for (uint64_t version : { 1u, 4u }) {
        auto reply = peer->call(daemonRequest("refused", version));
        ASSERT_TRUE(reply) << version;
        EXPECT_EQ(code(*reply), 7u);
        EXPECT_EQ(text(*reply), format("unsupported protocol version %u (current 3)", version));
    }
    // Refused before anything is logged about the request itself.
    ASSERT_TRUE(peer->call(daemonRequest("barrier")));
    ASSERT_TRUE(m_daemon->waitForMessage(ours("client %d requested %s", "barrier")));
    EXPECT_EQ(requestsLogged("refused"), 0u);
}

TEST_F(DaemonEnvelope, VersionsTwoAndThreeAreDispatched)
{
    auto peer = connect();
    ASSERT_TRUE(peer);
    for (uint64_t version : { 2u, 3u }) {
        auto reply = peer->call(daemonRequest("outside-the-table", version));
        ASSERT_TRUE(reply) << version;
        EXPECT_EQ(code(*reply), 4u);
        EXPECT_EQ(text(*reply), "unrecognized request");
    }
}

TEST_F(DaemonEnvelope, MissingOrNonStringNameIsMissingType)
{
    auto peer = connect();
    ASSERT_TRUE(peer);
    for (Value name : { Value(), Value(1), Value::dictionary({ { "request", "match" } }), Value(true) }) {
        DictionaryBuilder request;
        request.set("version", Value(3u));
        request.set("request", name);
        auto reply = peer->call(request.build());
        ASSERT_TRUE(reply) << name.description();
        EXPECT_EQ(code(*reply), 4u);
        EXPECT_EQ(text(*reply), "invalid request format (missing type)");
    }
    // Logged before the name is examined; an absent name shows as null.
    EXPECT_TRUE(m_daemon->waitForMessageCount(ours("client %d requested (null)"), 4));
}

TEST_F(DaemonEnvelope, NameOutsideTheTableIsUnrecognized)
{
    auto peer = connect();
    ASSERT_TRUE(peer);
    for (const char* name : { "MATCH", "Lock", "match ", "matc", "", "bulk_annotate" }) {
        auto reply = peer->call(daemonRequest(name));
        ASSERT_TRUE(reply) << name;
        EXPECT_EQ(code(*reply), 4u) << name;
        EXPECT_EQ(text(*reply), "unrecognized request") << name;
    }
}

TEST_F(DaemonEnvelope, NewClientIsLoggedWithItsPidAndExecutable)
{
    auto peer = connect();
    ASSERT_TRUE(peer);
    ASSERT_TRUE(peer->call(daemonRequest("hello")));
    auto self = std::filesystem::read_symlink("/proc/self/exe").string();
    EXPECT_TRUE(m_daemon->waitForMessage(ours("new client %d %s", self)));
}

TEST_F(DaemonEnvelope, ThousandthRequestIsCountedOnce)
{
    auto peer = connect();
    ASSERT_TRUE(peer);
    auto send = [&](size_t count) {
        std::vector<uint64_t> ids;
        for (size_t i = 0; i < count; ++i)
            ids.push_back(peer->send(daemonRequest("count")));
        for (auto id : ids)
            ASSERT_TRUE(peer->replyTo(id));
    };
    auto usedLines = [&] {
        auto lines = m_daemon->lines();
        return static_cast<size_t>(std::count_if(lines.begin(), lines.end(),
            [&](const DaemonLogLine& line) { return line.message.starts_with(ours("client %d used ")); }));
    };

    // The count is logged before its request is, so once the n-th request's line is in, so is
    // any count line that came with it.
    send(999);
    ASSERT_TRUE(m_daemon->waitForMessageCount(ours("client %d requested %s", "count"), 999));
    EXPECT_EQ(usedLines(), 0u);

    send(1);
    ASSERT_TRUE(m_daemon->waitForMessageCount(ours("client %d requested %s", "count"), 1000));
    EXPECT_EQ(m_daemon->countMessages(format("client %d used %u requests so far", ::getpid(), 1000u)), 1u);
    EXPECT_EQ(usedLines(), 1u);

    send(1);
    ASSERT_TRUE(m_daemon->waitForMessageCount(ours("client %d requested %s", "count"), 1001));
    EXPECT_EQ(usedLines(), 1u);
}

TEST_F(DaemonEnvelope, CountIsPerClient)
{
    auto first = connect();
    ASSERT_TRUE(first);
    auto second = connect();
    ASSERT_TRUE(second);
    std::vector<uint64_t> firstIds, secondIds;
    for (int i = 0; i < 600; ++i) {
        firstIds.push_back(first->send(daemonRequest("count")));
        secondIds.push_back(second->send(daemonRequest("count")));
    }
    for (auto id : firstIds)
        ASSERT_TRUE(first->replyTo(id));
    for (auto id : secondIds)
        ASSERT_TRUE(second->replyTo(id));
    ASSERT_TRUE(m_daemon->waitForMessageCount(ours("client %d requested %s", "count"), 1200));
    // 1200 requests in all, but neither client reached 1000 of its own.
    auto lines = m_daemon->lines();
    EXPECT_EQ(std::count_if(lines.begin(), lines.end(),
                  [](const DaemonLogLine& line) { return line.message.starts_with(ours("client %d used ")); }),
        0);
}

TEST_F(DaemonEnvelope, NonDictionaryMessagesAreLoggedAndLeftUnanswered)
{
    auto peer = connect();
    ASSERT_TRUE(peer);
    peer->send(Value::array({ 1, 2 }));
    ASSERT_TRUE(peer->sendMessage(Value::string("text")));
    peer->send(Value(7));
    // The next frame to arrive answers the dictionary: the others got nothing.
    auto reply = peer->call(daemonRequest("after"));
    ASSERT_TRUE(reply);
    EXPECT_EQ(text(*reply), "unrecognized request");

    for (const char* described : { "(1, 2)", "text", "7" }) {
        ASSERT_TRUE(m_daemon->waitForMessage(format("unexpected message: %s from: %d", described, ::getpid())))
            << described;
    }
    auto lines = m_daemon->lines();
    auto logged = std::find_if(lines.begin(), lines.end(),
        [](const DaemonLogLine& line) { return line.message.starts_with("unexpected message: "); });
    EXPECT_EQ(logged->level, "error");
    EXPECT_EQ(m_daemon->countMessages(ours("client %d is dead")), 0u);
}

TEST_F(DaemonEnvelope, TerminationImminentFromAPeerChangesNothing)
{
    auto peer = connect();
    ASSERT_TRUE(peer);
    ASSERT_TRUE(peer->raw().sendBytes(RawConduitPeer::header(9, RawConduitPeer::kTerminationImminent, 0)));
    ASSERT_TRUE(m_daemon->waitForMessage(ours("client %d termination imminent")));
    auto reply = peer->call(daemonRequest("still-served"));
    ASSERT_TRUE(reply);
    EXPECT_EQ(text(*reply), "unrecognized request");
    EXPECT_EQ(m_daemon->countMessages(ours("client %d is dead")), 0u);
}

TEST_F(DaemonEnvelope, MessageAwaitingNoReplyIsDispatchedWithoutAnswer)
{
    auto peer = connect();
    ASSERT_TRUE(peer);
    ASSERT_TRUE(peer->sendMessage(daemonRequest("no-reply-wanted")));
    // Had the message been answered, that answer would be the next frame instead.
    auto reply = peer->call(daemonRequest("reply-wanted"));
    ASSERT_TRUE(reply);
    ASSERT_TRUE(m_daemon->waitForMessage(ours("client %d requested %s", "reply-wanted")));
    EXPECT_EQ(requestsLogged("no-reply-wanted"), 1u);
}

TEST_F(DaemonEnvelope, QueuedRequestsOfADeadClientAreDropped)
{
    auto witness = connect();
    ASSERT_TRUE(witness);
    ASSERT_TRUE(witness->call(daemonRequest("warm-up")));

    // With the service queue's thread stopped, everything the dying client sends stays queued.
    auto frozen = m_daemon->freezeThread("service");
    if (!frozen)
        GTEST_SKIP() << "cannot stop a thread of the daemon (no ptrace permission)";
    {
        auto dying = connect();
        ASSERT_TRUE(dying);
        for (int i = 0; i < 5; ++i)
            dying->send(daemonRequest("from-dead-client"));
        // A bad version is answered even for a dead client; that answer then has nowhere to go.
        dying->send(daemonRequest("bad-version", 1));
    }
    ASSERT_TRUE(waitUntilOurDeadClientStopsAcceptingWork());
    frozen.reset();

    auto reply = witness->call(daemonRequest("from-live-client"));
    ASSERT_TRUE(reply);
    ASSERT_TRUE(m_daemon->waitForMessage(ours("client %d requested %s", "from-live-client")));
    EXPECT_EQ(requestsLogged("from-dead-client"), 0u);
    EXPECT_TRUE(m_daemon->running());
}

TEST_F(DaemonEnvelope, ClientFarAheadOfItsRepliesLosesOnlyItsConnection)
{
    auto witness = connect();
    ASSERT_TRUE(witness);
    ASSERT_TRUE(witness->call(daemonRequest("warm-up")));

    auto frozen = m_daemon->freezeThread("service");
    if (!frozen)
        GTEST_SKIP() << "cannot stop a thread of the daemon (no ptrace permission)";
    auto flooding = connect();
    ASSERT_TRUE(flooding);
    // With the service queue stopped, exactly the bound waits; one more closes the connection.
    // Requests sent far past it still reach the daemon before the close, and change nothing.
    for (uint32_t i = 0; i < 3 * OMDConduitClient::kMaxWaitingRequests; ++i)
        flooding->send(daemonRequest("flood"));
    EXPECT_TRUE(flooding->raw().waitForClose());
    ASSERT_TRUE(m_daemon->waitForMessage(ours("client %d has 4096 requests waiting; closing its connection")));
    ASSERT_TRUE(waitUntilOurDeadClientStopsAcceptingWork());
    frozen.reset();

    auto reply = witness->call(daemonRequest("after-flood"));
    ASSERT_TRUE(reply);
    EXPECT_EQ(text(*reply), "unrecognized request");
    EXPECT_EQ(requestsLogged("flood"), 0u);
    EXPECT_EQ(m_daemon->countMessages(ours("client %d has 4096 requests waiting; closing its connection")), 1u)
        << "one line per reason per connection";
    EXPECT_TRUE(m_daemon->running());
}

TEST(DaemonClientIdentity, UnreadableExecutableLeavesThePathEmpty)
{
    if (::geteuid() != 0)
        GTEST_SKIP() << "needs root, to run the daemon as a user that cannot read our /proc entry";
    DaemonProcess::Options options;
    options.executable = builtDaemonPath();
    options.user = 65534;
    DaemonProcess daemon(options);
    ASSERT_TRUE(daemon.waitForSocket()) << daemon.stderrText();

    auto peer = DaemonPeer::connect(daemon);
    ASSERT_TRUE(peer);
    // The record is made all the same, and serves.
    auto reply = peer->call(daemonRequest("served"));
    ASSERT_TRUE(reply);
    EXPECT_EQ(*reply->stringFor("error"), "unrecognized request");
    EXPECT_TRUE(daemon.waitForMessage(format("new client %d ", ::getpid())));
}

} // namespace
} // namespace om::test
