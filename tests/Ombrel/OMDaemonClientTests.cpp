#include <gtest/gtest.h>
#include <stdlib.h>

#include <chrono>
#include <condition_variable>
#include <deque>
#include <filesystem>
#include <future>
#include <limits>
#include <mutex>

#include "Ombrel/OMDaemonClient.h"
#include "Ombrel/OMMakeError.h"
#include "platform/Cbor.h"
#include "platform/Conduit.h"
#include "platform/Log.h"

using namespace om;

namespace {

constexpr auto kGenerous = std::chrono::seconds(30);

// A stand-in for omd inside the test process: a listener on a private CONDUIT_DIR that records
// every request and answers it with whatever the test chose (or keeps it unanswered).
class FakeDaemon {
public:
    explicit FakeDaemon(const std::string& service)
    {
        auto listener = ConduitListener::create(service, m_queue);
        if (!listener.ok()) {
            ADD_FAILURE() << "cannot listen: " << listener.error().localizedDescription();
            return;
        }
        m_listener = listener.value();
        m_listener->setConnectionHandler([this](std::shared_ptr<ConduitConnection> connection) {
            std::weak_ptr<ConduitConnection> weak = connection;
            connection->setEventHandler([this, weak](const ConduitEvent& event) {
                if (event.kind == ConduitEvent::Kind::Message && event.expectsReply())
                    received(weak.lock(), event);
            });
            {
                std::lock_guard lock(m_mutex);
                m_connections.push_back(connection);
            }
            connection->resume();
        });
        m_listener->resume();
    }

    ~FakeDaemon()
    {
        if (m_listener)
            m_listener->cancel();
        closeConnections();
        // Flush what the listener queue still holds before our members go.
        m_queue->sync([] {});
    }

    // Answer of each request; none keeps the request unanswered.
    void setReply(Value reply)
    {
        std::lock_guard lock(m_mutex);
        m_reply = std::move(reply);
    }

    // The next request received, in arrival order; none when nothing came within the timeout.
    Value nextRequest()
    {
        std::unique_lock lock(m_mutex);
        if (!m_changed.wait_for(lock, kGenerous, [this] { return !m_requests.empty(); }))
            return Value();
        Value request = m_requests.front();
        m_requests.pop_front();
        return request;
    }

    size_t pendingRequests()
    {
        std::lock_guard lock(m_mutex);
        return m_requests.size();
    }

    void closeConnections()
    {
        std::vector<std::shared_ptr<ConduitConnection>> connections;
        {
            std::lock_guard lock(m_mutex);
            connections.swap(m_connections);
        }
        for (auto& connection : connections)
            connection->cancel();
    }

private:
    void received(const std::shared_ptr<ConduitConnection>& connection, const ConduitEvent& event)
    {
        Value reply;
        {
            std::lock_guard lock(m_mutex);
            m_requests.push_back(event.message);
            reply = m_reply;
            m_changed.notify_all();
        }
        if (connection && !reply.isNone())
            connection->sendReply(event.requestId, reply);
    }

    std::shared_ptr<WorkQueue> m_queue = WorkQueue::create("fake-omd");
    std::shared_ptr<ConduitListener> m_listener;
    std::mutex m_mutex;
    std::condition_variable m_changed;
    std::deque<Value> m_requests;
    std::vector<std::shared_ptr<ConduitConnection>> m_connections;
    Value m_reply = Value::dictionary({});
};

// Blocks until the block given to start is called, for at most the generous timeout.
Result<Value> await(const std::function<void(OMDaemonClient::ReplyBlock)>& start)
{
    auto promise = std::make_shared<std::promise<Result<Value>>>();
    auto future = promise->get_future();
    start([promise](const Result<Value>& reply) { promise->set_value(reply); });
    if (future.wait_for(kGenerous) != std::future_status::ready)
        return OMError("test", -1, "no reply within the timeout");
    return future.get();
}

std::vector<std::string> keysOf(const Value& dictionary)
{
    std::vector<std::string> keys;
    for (const auto& entry : dictionary.entries())
        keys.push_back(entry.first);
    return keys;
}

const Uuid kFirst = *Uuid::parse("6BA7B810-9DAD-11D1-80B4-00C04FD430C8");
const Uuid kSecond = *Uuid::parse("00000000-0000-0000-0000-000000000001");
const Uuid kThird = *Uuid::parse("FFFFFFFF-FFFF-FFFF-FFFF-FFFFFFFFFFFF");

class OMDaemonClientTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        std::string pattern = (std::filesystem::temp_directory_path() / "omclient-XXXXXX").string();
        ASSERT_NE(::mkdtemp(pattern.data()), nullptr);
        m_directory = pattern;
        ::setenv("CONDUIT_DIR", m_directory.c_str(), 1);
        m_service = std::string("com.orvex.test.") + ::testing::UnitTest::GetInstance()->current_test_info()->name();
        m_daemon = std::make_unique<FakeDaemon>(m_service);
        m_client = OMDaemonClient::initWithServiceName(m_service.c_str());
    }

    void TearDown() override
    {
        m_client.reset();
        m_daemon.reset();
        std::error_code ignored;
        std::filesystem::remove_all(m_directory, ignored);
    }

    // Sends through start, then answers the request the daemon received.
    Value sent(const std::function<void(OMDaemonClient::ReplyBlock)>& start)
    {
        Result<Value> reply = await(start);
        EXPECT_TRUE(reply.ok()) << reply.error().localizedDescription();
        return m_daemon->nextRequest();
    }

    std::string m_directory;
    std::string m_service;
    std::unique_ptr<FakeDaemon> m_daemon;
    std::shared_ptr<OMDaemonClient> m_client;
};

} // namespace

TEST_F(OMDaemonClientTest, AddPlugInsSendsTheEnvelopeAndThePathsInOrder)
{
    Value paths = Value::array({ "/Applications/B.app/PlugIns/b.appex", "/a" });
    Value request = sent([&](auto reply) { m_client->addPlugIns(paths, reply); });

    EXPECT_EQ(request, Value::dictionary({ { "request", "add" }, { "version", 3u }, { "paths", paths } }));
    EXPECT_EQ(keysOf(request), (std::vector<std::string> { "request", "version", "paths" }));
}

TEST_F(OMDaemonClientTest, RemovePlugInsSendsPaths)
{
    Value paths = Value::array({ "/x.appex" });
    Value request = sent([&](auto reply) { m_client->removePlugIns(paths, reply); });

    EXPECT_EQ(request, Value::dictionary({ { "request", "remove" }, { "version", 3u }, { "paths", paths } }));
}

TEST_F(OMDaemonClientTest, EmptyPathListStillTravelsAsAnArray)
{
    Value request = sent([&](auto reply) { m_client->addPlugIns(Value::array({}), reply); });

    ASSERT_TRUE(request["paths"].isArray());
    EXPECT_EQ(request["paths"].count(), 0u);
}

// A flags value above INT64_MAX survives only when it is written as an unsigned integer.
TEST_F(OMDaemonClientTest, BulkSendsFlagsAsUnsigned64Bit)
{
    Value request = sent([&](auto reply) { m_client->bulkPlugins(std::numeric_limits<uint64_t>::max(), reply); });

    EXPECT_EQ(keysOf(request), (std::vector<std::string> { "request", "version", "flags" }));
    EXPECT_EQ(*request.stringFor("request"), "bulk");
    EXPECT_EQ(request["flags"].type(), Value::Type::Unsigned);
    EXPECT_EQ(request["flags"].asUInt64(), std::numeric_limits<uint64_t>::max());
}

TEST_F(OMDaemonClientTest, ReadySendsFlagsAndUuidValuesInTheGivenOrder)
{
    Value request = sent([&](auto reply) { m_client->readyPlugIns({ kThird, kFirst, kThird }, 5, reply); });

    EXPECT_EQ(request,
        Value::dictionary({ { "request", "ready" }, { "version", 3u }, { "flags", 5u },
            { "uuids", Value::array({ Value::uuid(kThird), Value::uuid(kFirst), Value::uuid(kThird) }) } }));
    EXPECT_EQ(keysOf(request), (std::vector<std::string> { "request", "version", "flags", "uuids" }));
    for (const Value& uuid : request["uuids"].elements())
        EXPECT_EQ(uuid.type(), Value::Type::Uuid);
}

TEST_F(OMDaemonClientTest, AccessSendsFlagsAndUuids)
{
    Value request = sent([&](auto reply) { m_client->accessPlugIns({ kSecond }, 0, reply); });

    EXPECT_EQ(request,
        Value::dictionary({ { "request", "access" }, { "version", 3u }, { "flags", 0u },
            { "uuids", Value::array({ Value::uuid(kSecond) }) } }));
}

TEST_F(OMDaemonClientTest, MatchSendsTheRulesTreeWholeAndTheFlags)
{
    Value rules = Value::dictionary({
        { "QSExtensionPointName", "com.orvex.share" },
        { "attributes", Value::dictionary({ { "count", Value::integer(-2) }, { "when", Value::date(86400) } }) },
        { "blob", Value::data(std::vector<uint8_t> { 0, 1, 255 }) },
    });
    Value request = sent([&](auto reply) { m_client->matchPlugIns(rules, 0x209, reply); });

    EXPECT_EQ(request,
        Value::dictionary({ { "request", "match" }, { "version", 3u }, { "rules", rules }, { "flags", 0x209u } }));
    EXPECT_EQ(keysOf(request), (std::vector<std::string> { "request", "version", "rules", "flags" }));
    EXPECT_EQ(request["rules"]["attributes"]["when"].type(), Value::Type::Date);
}

TEST_F(OMDaemonClientTest, MatchWithoutRulesOmitsTheKey)
{
    Value request = sent([&](auto reply) { m_client->matchPlugIns(Value(), 0, reply); });

    EXPECT_EQ(keysOf(request), (std::vector<std::string> { "request", "version", "flags" }));
}

TEST_F(OMDaemonClientTest, AnnotateSendsUuidsAndAnnotations)
{
    Value annotations = Value::dictionary({ { "election", 1 }, { "extension", Value::dictionary({ { "k", "v" } }) } });
    Value request = sent([&](auto reply) { m_client->setPluginAnnotations({ kFirst, kSecond }, annotations, reply); });

    EXPECT_EQ(request,
        Value::dictionary({ { "request", "annotate" }, { "version", 3u },
            { "uuids", Value::array({ Value::uuid(kFirst), Value::uuid(kSecond) }) },
            { "annotations", annotations } }));
    EXPECT_EQ(keysOf(request), (std::vector<std::string> { "request", "version", "uuids", "annotations" }));
}

TEST_F(OMDaemonClientTest, BulkAnnotateSendsOnlyTheAnnotations)
{
    Value annotations = Value::dictionary({ { kFirst.string(), Value::dictionary({ { "enabled", true } }) } });
    Value request = sent([&](auto reply) { m_client->bulkSetPluginAnnotations(annotations, reply); });

    EXPECT_EQ(request,
        Value::dictionary({ { "request", "bulk-annotate" }, { "version", 3u }, { "annotations", annotations } }));
}

TEST_F(OMDaemonClientTest, HoldSendsLockWithPathsAndFlags)
{
    Value paths = Value::array({ "/Applications/A.app" });
    Value request = sent([&](auto reply) { m_client->holdPlugins(paths, 0x6, reply); });

    EXPECT_EQ(
        request, Value::dictionary({ { "request", "lock" }, { "version", 3u }, { "paths", paths }, { "flags", 6u } }));
    EXPECT_EQ(keysOf(request), (std::vector<std::string> { "request", "version", "paths", "flags" }));
}

TEST_F(OMDaemonClientTest, ReleaseHoldSendsOneTokenAndNoFlags)
{
    Value request = sent([&](auto reply) { m_client->releaseHold(kFirst, reply); });

    EXPECT_EQ(request,
        Value::dictionary(
            { { "request", "lock" }, { "version", 3u }, { "uuids", Value::array({ Value::uuid(kFirst) }) } }));
    EXPECT_FALSE(request.contains("flags"));
    EXPECT_FALSE(request.contains("paths"));
}

TEST_F(OMDaemonClientTest, RequestBuilderUsesTheProtocolVersion)
{
    EXPECT_EQ(m_client->protocolVersion(), 3);
    m_client->setProtocolVersion(2);
    Value request = sent([&](auto reply) { m_client->bulkPlugins(0, reply); });

    EXPECT_EQ(request["version"], Value(2u));
    // On the wire a small unsigned reads back as signed; the kind is visible only before sending.
    EXPECT_EQ(m_client->request("x").build()["version"].type(), Value::Type::Unsigned);
}

TEST_F(OMDaemonClientTest, SetUuidsReplacesAnEarlierListInPlace)
{
    auto request = m_client->request("ready", Value::array({ "/p" }));
    OMDaemonClient::set(request, { kFirst, kSecond });
    OMDaemonClient::set(request, { kThird });
    Value built = request.build();

    EXPECT_EQ(keysOf(built), (std::vector<std::string> { "request", "version", "paths", "uuids" }));
    EXPECT_EQ(built["uuids"], Value::array({ Value::uuid(kThird) }));
}

TEST_F(OMDaemonClientTest, ReplyArrivesUnchangedOnTheReplyQueue)
{
    Value answer = Value::dictionary({ { "uuids", Value::uuid(kFirst) }, { "extensions", Value::array({ "token" }) } });
    m_daemon->setReply(answer);
    bool onReplyQueue = false;
    Result<Value> reply = await([&](auto block) {
        m_client->releaseHold(kFirst, [&, block](const Result<Value>& result) {
            onReplyQueue = m_client->replyQueue()->isCurrent();
            block(result);
        });
    });

    ASSERT_TRUE(reply.ok());
    EXPECT_EQ(reply.value(), answer);
    EXPECT_TRUE(onReplyQueue);
    EXPECT_EQ(m_client->replyQueue()->label(), "omd_client");
}

TEST_F(OMDaemonClientTest, RepliesReachTheirBlocksInRequestOrder)
{
    // Shared with the blocks: the last one may still be unwinding when the test has returned.
    struct Seen {
        std::mutex mutex;
        std::vector<int> order;
        std::promise<std::vector<int>> done;
    };
    auto seen = std::make_shared<Seen>();
    for (int i = 0; i < 5; ++i) {
        m_client->bulkPlugins(static_cast<uint64_t>(i), [seen, i](const Result<Value>&) {
            std::lock_guard lock(seen->mutex);
            seen->order.push_back(i);
            if (seen->order.size() == 5)
                seen->done.set_value(seen->order);
        });
    }

    auto future = seen->done.get_future();
    ASSERT_EQ(future.wait_for(kGenerous), std::future_status::ready);
    EXPECT_EQ(future.get(), (std::vector<int> { 0, 1, 2, 3, 4 }));
}

TEST_F(OMDaemonClientTest, RequestsAndRepliesAreTracedInTheTrafficCategory)
{
    Log::Capture capture;
    m_daemon->setReply(Value::dictionary({ { "errorcode", 4u }, { "error", "unrecognized request" } }));
    (void)sent([&](auto reply) { m_client->bulkPlugins(0, reply); });

    auto records = capture.records();
    auto traced = [&](std::string_view prefix) {
        return std::count_if(records.begin(), records.end(), [&](const Log::Record& record) {
            return record.category == "traffic" && record.subsystem == "com.orvex.Ombrel"
                && record.level == LogLevel::Debug && record.message.starts_with(prefix);
        });
    };
    EXPECT_EQ(traced("request: {"), 1);
    EXPECT_EQ(traced("reply: {"), 1);
}

TEST_F(OMDaemonClientTest, ClosedConnectionGivesTransportErrorAndCodeFour)
{
    ASSERT_TRUE(sent([&](auto reply) { m_client->bulkPlugins(0, reply); }).isDictionary());
    m_daemon->closeConnections();

    Result<Value> reply = await([&](auto block) { m_client->bulkPlugins(0, block); });
    ASSERT_FALSE(reply.ok());
    EXPECT_EQ(reply.error().domain(), kConduitErrorDomain);
    auto error = OMDaemonClient::errorInReply(reply);
    ASSERT_TRUE(error.has_value());
    EXPECT_EQ(error->domain(), kOMErrorDomain);
    EXPECT_EQ(error->code(), 4);
    EXPECT_EQ(error->description(), reply.error().localizedDescription());
}

TEST_F(OMDaemonClientTest, NothingIsRetriedAfterTheConnectionFailed)
{
    // One round trip first, so that the daemon side has accepted the connection it then closes.
    ASSERT_TRUE(sent([&](auto reply) { m_client->bulkPlugins(0, reply); }).isDictionary());
    Log::Capture capture;
    m_daemon->closeConnections();
    // Only once the client has seen the loss can no request slip out before it.
    ASSERT_TRUE(capture.waitFor("Communications error: Connection invalid"));
    Result<Value> first = await([&](auto block) { m_client->bulkPlugins(1, block); });
    Result<Value> second = await([&](auto block) { m_client->bulkPlugins(2, block); });

    // The listener is still there, but the client never connects again.
    EXPECT_FALSE(first.ok());
    EXPECT_FALSE(second.ok());
    EXPECT_EQ(m_daemon->pendingRequests(), 0u);
}

TEST_F(OMDaemonClientTest, ConnectionLossIsLoggedAsCommunicationsError)
{
    Log::Capture capture;
    ASSERT_TRUE(sent([&](auto reply) { m_client->bulkPlugins(0, reply); }).isDictionary());
    m_daemon->closeConnections();

    ASSERT_TRUE(capture.waitUntil([](const std::vector<Log::Record>& records) {
        return std::any_of(records.begin(), records.end(), [](const Log::Record& record) {
            return record.category == "ops" && record.level == LogLevel::Error
                && record.message.starts_with("Communications error: ");
        });
    }));
}

TEST_F(OMDaemonClientTest, DestroyingTheClientCompletesOutstandingRequestsWithTransportError)
{
    m_daemon->setReply(Value());
    auto promise = std::make_shared<std::promise<Result<Value>>>();
    auto future = promise->get_future();
    m_client->bulkPlugins(0, [promise](const Result<Value>& reply) { promise->set_value(reply); });
    ASSERT_TRUE(m_daemon->nextRequest().isDictionary());

    m_client.reset();

    ASSERT_EQ(future.wait_for(kGenerous), std::future_status::ready);
    Result<Value> reply = future.get();
    EXPECT_FALSE(reply.ok());
}

TEST_F(OMDaemonClientTest, UnreachableServiceGivesTransportError)
{
    auto lonely = OMDaemonClient::initWithServiceName("com.orvex.test.nobody-listens");
    Result<Value> reply = await([&](auto block) { lonely->bulkPlugins(0, block); });

    ASSERT_FALSE(reply.ok());
    EXPECT_EQ(OMDaemonClient::errorInReply(reply)->code(), 4);
}

TEST_F(OMDaemonClientTest, SendSyncReturnsTheReply)
{
    m_daemon->setReply(Value::dictionary({ { "errorcode", 4u }, { "error", "unrecognized request" } }));
    Result<Value> reply = m_client->sendSync(m_client->request("ping").build());

    ASSERT_TRUE(reply.ok());
    EXPECT_EQ(*reply->stringFor("error"), "unrecognized request");
    EXPECT_EQ(m_daemon->nextRequest(), Value::dictionary({ { "request", "ping" }, { "version", 3u } }));
}

TEST_F(OMDaemonClientTest, SendSyncOnTheReplyQueueIsAProgrammingError)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(m_client->replyQueue()->sync([&] { (void)m_client->sendSync(m_client->request("ping").build()); }),
        "must not run on work queue \"omd_client\"");
}

TEST(OMDaemonClientErrorInReply, SuccessReplyHasNoError)
{
    EXPECT_FALSE(OMDaemonClient::errorInReply(Value::dictionary({})).has_value());
    EXPECT_FALSE(OMDaemonClient::errorInReply(Value::dictionary({ { "errorcode", 0u } })).has_value());
    EXPECT_FALSE(OMDaemonClient::errorInReply(Value::dictionary({ { "uuids", Value::uuid(kFirst) } })).has_value());
}

TEST(OMDaemonClientErrorInReply, CodeAndTextAreTakenAsTheyCame)
{
    auto error
        = OMDaemonClient::errorInReply(Value::dictionary({ { "errorcode", 9u }, { "error", "no plugin at /x" } }));

    ASSERT_TRUE(error.has_value());
    EXPECT_EQ(*error, OMError("Ombrel", 9, "no plugin at /x"));
}

TEST(OMDaemonClientErrorInReply, CodeWithoutTextGetsTheGenericMessage)
{
    auto error = OMDaemonClient::errorInReply(Value::dictionary({ { "errorcode", 14u } }));

    ASSERT_TRUE(error.has_value());
    EXPECT_EQ(*error, OMError("Ombrel", 14, "unknown error returned by Ombrel subsystem"));
}

TEST(OMDaemonClientErrorInReply, NegativeCodeWidenedOnTheWireComesBackNegative)
{
    auto widened = OMDaemonClient::errorInReply(
        Value::dictionary({ { "errorcode", static_cast<uint64_t>(int64_t { -3 }) }, { "error", "x" } }));
    auto signedForm = OMDaemonClient::errorInReply(Value::dictionary({ { "errorcode", -3 }, { "error", "x" } }));

    ASSERT_TRUE(widened && signedForm);
    EXPECT_EQ(widened->code(), -3);
    EXPECT_EQ(signedForm->code(), -3);
}

TEST(OMDaemonClientErrorInReply, TransportErrorBecomesCodeFourWithItsDescription)
{
    auto error
        = OMDaemonClient::errorInReply(OMError(kConduitErrorDomain, kConduitConnectionInvalid, "Connection invalid"));

    ASSERT_TRUE(error.has_value());
    EXPECT_EQ(*error, OMError("Ombrel", 4, "Connection invalid"));
}

TEST(OMDaemonClientErrorInReplyDeathTest, TextWithoutCodeIsAProtocolViolation)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH((void)OMDaemonClient::errorInReply(Value::dictionary({ { "errorcode", 0u }, { "error", "boom" } })),
        "omd reported error without a code: boom");
    EXPECT_DEATH((void)OMDaemonClient::errorInReply(Value::dictionary({ { "error", "bang" } })),
        "omd reported error without a code: bang");
}

TEST(OMDaemonClientConversion, OnlyVersionThreeHasAnEncoding)
{
    Value tree = Value::array({ Value::dictionary({ { "identifier", "a" } }) });

    EXPECT_FALSE(OMDaemonClient::convertToConduit(tree, 2).has_value());
    EXPECT_FALSE(OMDaemonClient::convertToConduit(tree, 4).has_value());
    EXPECT_FALSE(OMDaemonClient::convertToConduit(tree, 0).has_value());
    EXPECT_TRUE(OMDaemonClient::convertToConduit(tree, 3).has_value());
}

TEST(OMDaemonClientConversion, VersionThreeIsOneDataValueThatDecodesBack)
{
    Value tree = Value::array({
        Value::dictionary(
            { { "identifier", "a" }, { "uuid", Value::uuid(kFirst) }, { "lastmodified", Value::date(1.5) } }),
        Value::dictionary({ { "version", std::numeric_limits<uint64_t>::max() }, { "systemResident", true } }),
    });
    auto encoded = OMDaemonClient::convertToConduit(tree, 3);
    ASSERT_TRUE(encoded.has_value());
    ASSERT_TRUE(encoded->isData());
    EXPECT_EQ(*encoded->asData(), Cbor::encode(tree));

    auto client = OMDaemonClient::initWithServiceName("com.orvex.test.conversion");
    auto decoded = client->convertFromConduit(*encoded);
    ASSERT_TRUE(decoded.has_value());
    EXPECT_EQ(*decoded, tree);

    EXPECT_FALSE(client->convertFromConduit(Value::string("not data")).has_value());
    client->setProtocolVersion(2);
    EXPECT_FALSE(client->convertFromConduit(*encoded).has_value());
}
