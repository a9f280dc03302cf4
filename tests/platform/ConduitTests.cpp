#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>

#include <atomic>
#include <cstring>
#include <fstream>
#include <thread>

#include "platform/Conduit.h"
#include "platform/ConduitMessageEncoding.h"
#include "platform/Log.h"
#include "platform/ValueTreeConversion.h"
#include "tests/platform/ConduitTestSupport.h"
#include "tests/support/RawConduitPeer.h"

namespace om::test {
namespace {

using Conduit = ConduitDirectoryTest;

// Signals a mailbox when destroyed: tells a test that a context or a handler was released.
struct ReleaseSignal {
    explicit ReleaseSignal(std::shared_ptr<Mailbox<bool>> released)
        : m_released(std::move(released))
    {
    }
    ~ReleaseSignal() { m_released->push(true); }
    std::shared_ptr<Mailbox<bool>> m_released;
};

bool isTransportInvalid(const Result<Value>& result)
{
    return !result.ok()
        && result.error() == OMError(kConduitErrorDomain, kConduitConnectionInvalid, "Connection invalid");
}

TEST_F(Conduit, ConcurrentRequestsEachGetTheirOwnReply)
{
    EchoService service("com.test.echo");
    ASSERT_TRUE(service.start());
    TestClient client(service.name());

    constexpr int kThreads = 4;
    constexpr int kPerThread = 250;
    auto replyQueue = WorkQueue::create("test.replies");
    Mailbox<bool> outcomes;
    std::vector<std::thread> senders;
    for (int t = 0; t < kThreads; ++t) {
        senders.emplace_back([&, t] {
            for (int i = 0; i < kPerThread; ++i) {
                const int n = t * kPerThread + i;
                // Half the replies come on a queue, half on the I/O thread.
                auto queue = n % 2 ? replyQueue : nullptr;
                client.connection->sendWithReply(
                    Value::dictionary({ { "n", n } }), queue, [&outcomes, n](Result<Value> reply) {
                        outcomes.push(reply.ok() && reply.value()["echo"]["n"] == Value(n));
                    });
            }
        });
    }
    for (auto& sender : senders)
        sender.join();
    int matched = 0;
    for (int i = 0; i < kThreads * kPerThread; ++i) {
        auto outcome = outcomes.pop();
        ASSERT_TRUE(outcome) << "reply " << i << " never came";
        matched += *outcome ? 1 : 0;
    }
    EXPECT_EQ(matched, kThreads * kPerThread);
}

TEST_F(Conduit, EventsArriveInOrderAndInvalidComesOnceAndLast)
{
    auto peerQueue = WorkQueue::create("test.peer");
    EchoService service("com.test.order", peerQueue);
    ASSERT_TRUE(service.start());
    TestClient client(service.name());

    constexpr int kMessages = 500;
    for (int i = 0; i < kMessages; ++i)
        client.connection->send(Value::dictionary({ { "seq", i } }));
    ASSERT_TRUE(client.call(Value::dictionary({ { "last", true } })).ok());
    client.connection->cancel();

    std::vector<ConduitEvent> seen;
    for (;;) {
        auto received = service.events().pop();
        ASSERT_TRUE(received);
        seen.push_back(received->event);
        if (received->event.kind == ConduitEvent::Kind::ConnectionInvalid)
            break;
    }
    ASSERT_EQ(seen.size(), size_t(kMessages + 2));
    for (int i = 0; i < kMessages; ++i) {
        EXPECT_EQ(seen[i].message["seq"], Value(i));
        EXPECT_FALSE(seen[i].expectsReply());
    }
    EXPECT_TRUE(seen[kMessages].expectsReply());
    // Nothing follows the invalid event: everything queued before this barrier has run.
    peerQueue->sync([] {});
    EXPECT_EQ(service.events().size(), 0u);
    EXPECT_EQ(client.events->pop()->kind, ConduitEvent::Kind::ConnectionInvalid);
    EXPECT_EQ(client.events->size(), 0u);
}

TEST_F(Conduit, HandlerIsReleasedAfterTheInvalidEvent)
{
    EchoService service("com.test.release");
    ASSERT_TRUE(service.start());
    auto released = std::make_shared<Mailbox<bool>>();
    auto invalid = std::make_shared<Mailbox<bool>>();
    auto connection = ConduitConnection::connectToService(service.name(), WorkQueue::create("test.client"));
    auto signal = std::make_shared<ReleaseSignal>(released);
    connection->setEventHandler([signal, invalid](const ConduitEvent& event) {
        if (event.kind == ConduitEvent::Kind::ConnectionInvalid)
            invalid->push(true);
    });
    signal.reset();
    connection->resume();
    connection->cancel();
    ASSERT_TRUE(invalid->pop());
    EXPECT_TRUE(released->pop()) << "the handler outlived its connection's last event";
}

TEST_F(Conduit, OutstandingRequestsFailWhenThePeerCloses)
{
    // The service closes each connection on its first request instead of answering.
    EchoService service("com.test.closer", nullptr,
        [](const std::shared_ptr<ConduitConnection>& connection, const ConduitEvent&) { connection->cancel(); });
    ASSERT_TRUE(service.start());
    TestClient client(service.name());
    auto replyQueue = WorkQueue::create("test.replies");
    Mailbox<bool> failures;
    for (int i = 0; i < 3; ++i) {
        client.connection->sendWithReply(
            Value::dictionary({ { "n", i } }), replyQueue, [&failures, replyQueue](Result<Value> result) {
                failures.push(isTransportInvalid(result) && replyQueue->isCurrent());
            });
    }
    for (int i = 0; i < 3; ++i) {
        auto failure = failures.pop();
        ASSERT_TRUE(failure);
        EXPECT_TRUE(*failure) << "request " << i << " did not fail with the transport error on its queue";
    }
    EXPECT_EQ(client.events->pop()->kind, ConduitEvent::Kind::ConnectionInvalid);
}

TEST_F(Conduit, RequestOnAnInvalidConnectionFailsOnItsQueue)
{
    TestClient client("com.test.nobody-home");
    EXPECT_EQ(client.events->pop()->kind, ConduitEvent::Kind::ConnectionInvalid);
    auto queue = WorkQueue::create("test.replies");
    Mailbox<bool> failure;
    client.connection->sendWithReply(Value::dictionary({}), queue,
        [&failure, queue](Result<Value> result) { failure.push(isTransportInvalid(result) && queue->isCurrent()); });
    EXPECT_TRUE(failure.pop().value_or(false));
    client.connection->send(Value::dictionary({})); // dropped, no crash
    client.connection->sendReply(7, Value::dictionary({})); // dropped, no crash
    EXPECT_EQ(client.events->size(), 0u);
}

TEST_F(Conduit, MissingServiceBecomesInvalidOnlyOnceResumed)
{
    auto connection = ConduitConnection::connectToService("com.test.missing", nullptr);
    Mailbox<ConduitEvent> events;
    connection->setEventHandler([&events](const ConduitEvent& event) { events.push(event); });
    Mailbox<bool> failure;
    // Sent before resume: fails all the same.
    connection->sendWithReply(
        Value::dictionary({}), nullptr, [&failure](Result<Value> r) { failure.push(isTransportInvalid(r)); });
    EXPECT_TRUE(failure.pop().value_or(false));
    EXPECT_EQ(events.size(), 0u);
    connection->resume();
    EXPECT_EQ(events.pop()->kind, ConduitEvent::Kind::ConnectionInvalid);
    EXPECT_EQ(connection->pid(), -1);
}

TEST_F(Conduit, InvalidServiceNamesAreRefused)
{
    for (const char* name : { "", ".", "..", "a/b", "../escape" }) {
        auto listener = ConduitListener::create(name, nullptr);
        EXPECT_FALSE(listener.ok()) << name;
        TestClient client(name);
        EXPECT_EQ(client.events->pop()->kind, ConduitEvent::Kind::ConnectionInvalid) << name;
    }
}

TEST_F(Conduit, StaleSocketIsReplaced)
{
    const std::string path = om::Conduit::socketPath("com.test.stale");
    {
        // A listener that died without cleaning up leaves a socket that refuses connections.
        UniqueFd dead(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
        sockaddr_un address {};
        address.sun_family = AF_UNIX;
        std::strcpy(address.sun_path, path.c_str());
        ASSERT_EQ(::bind(dead.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    }
    EchoService service("com.test.stale");
    ASSERT_TRUE(service.start());
    TestClient client(service.name());
    EXPECT_TRUE(client.call(Value::dictionary({ { "hello", 1 } })).ok());
}

TEST_F(Conduit, SecondLiveListenerIsRefusedUntilTheFirstGoes)
{
    auto first = ConduitListener::create("com.test.owned", nullptr);
    ASSERT_TRUE(first.ok());
    // Not resumed yet, and still the owner: the name is taken from bind() on.
    auto second = ConduitListener::create("com.test.owned", nullptr);
    ASSERT_FALSE(second.ok());
    EXPECT_NE(second.error().localizedDescription().find(om::Conduit::socketPath("com.test.owned")), std::string::npos)
        << second.error().localizedDescription();

    first.value().reset(); // unlinks its socket
    auto third = ConduitListener::create("com.test.owned", nullptr);
    EXPECT_TRUE(third.ok());
}

TEST_F(Conduit, SomethingElseAtTheSocketPathIsLeftAlone)
{
    const std::string path = om::Conduit::socketPath("com.test.file");
    std::ofstream(path) << "not a socket";
    auto listener = ConduitListener::create("com.test.file", nullptr);
    EXPECT_FALSE(listener.ok());
    struct stat info;
    ASSERT_EQ(::stat(path.c_str(), &info), 0);
    EXPECT_TRUE(S_ISREG(info.st_mode));
}

TEST_F(Conduit, ListenerMakesItsDirectoryAndAnOpenSocket)
{
    const std::string nested = directory() + "/deeper/still";
    ::setenv("CONDUIT_DIR", nested.c_str(), 1);
    auto listener = ConduitListener::create("com.test.modes", nullptr);
    ASSERT_TRUE(listener.ok()) << listener.error().localizedDescription();
    EXPECT_EQ(listener.value()->socketPath(), nested + "/com.test.modes");
    struct stat info;
    ASSERT_EQ(::stat(nested.c_str(), &info), 0);
    EXPECT_EQ(
        info.st_mode & 07777, 0755u & ~[] {
            mode_t m = ::umask(0);
            ::umask(m);
            return m;
        }());
    ASSERT_EQ(::stat(listener.value()->socketPath().c_str(), &info), 0);
    EXPECT_TRUE(S_ISSOCK(info.st_mode));
    EXPECT_EQ(info.st_mode & 0777, 0666u);
}

TEST_F(Conduit, BothEndsKnowTheirPeerFromTheKernel)
{
    EchoService service("com.test.identity");
    ASSERT_TRUE(service.start());
    TestClient client(service.name());
    auto accepted = service.accepted().pop();
    ASSERT_TRUE(accepted);
    EXPECT_EQ((*accepted)->pid(), ::getpid());
    EXPECT_EQ((*accepted)->auditToken().uid, ::geteuid());
    ASSERT_TRUE((*accepted)->auditToken().pidfd);
    EXPECT_TRUE((*accepted)->auditToken().pidfd->valid());
    EXPECT_EQ(client.connection->pid(), ::getpid());
}

TEST_F(Conduit, NonDictionaryPayloadsAreDeliveredAsMessages)
{
    EchoService service("com.test.shapes");
    ASSERT_TRUE(service.start());
    auto peer = RawConduitPeer::connectToService(service.name());
    ASSERT_TRUE(peer);
    ASSERT_TRUE(peer->sendFrame(RawConduitPeer::kMessage, 0, Value::array({ 1, 2 })));
    ASSERT_TRUE(peer->sendFrame(RawConduitPeer::kRequest, 1, Value("text")));

    auto first = service.events().pop();
    ASSERT_TRUE(first);
    EXPECT_EQ(first->event.message, Value::array({ 1, 2 }));
    EXPECT_FALSE(first->event.expectsReply());
    auto second = service.events().pop();
    ASSERT_TRUE(second);
    EXPECT_EQ(second->event.message, Value("text"));
    EXPECT_EQ(second->event.requestId, 1u);
    auto reply = peer->readFrame();
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->kind, RawConduitPeer::kReply);
    EXPECT_EQ(reply->id, 1u);
}

TEST_F(Conduit, TerminationImminentIsAnEventAndChangesNothingElse)
{
    EchoService service("com.test.dying");
    ASSERT_TRUE(service.start());
    auto peer = RawConduitPeer::connectToService(service.name());
    ASSERT_TRUE(peer);
    ASSERT_TRUE(peer->sendFrame(RawConduitPeer::kTerminationImminent, 0, Value()));
    auto event = service.events().pop();
    ASSERT_TRUE(event);
    EXPECT_EQ(event->event.kind, ConduitEvent::Kind::TerminationImminent);

    ASSERT_TRUE(peer->sendFrame(RawConduitPeer::kRequest, 1, Value::dictionary({ { "still", "here" } })));
    auto reply = peer->readFrame();
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->value["echo"]["still"], Value("here"));
}

TEST_F(Conduit, ContextLivesExactlyAsLongAsTheConnection)
{
    auto released = std::make_shared<Mailbox<bool>>();
    {
        auto connection = ConduitConnection::connectToService("com.test.unresumed", nullptr);
        connection->setContext(std::make_shared<ReleaseSignal>(released));
        EXPECT_NE(connection->context(), nullptr);
        EXPECT_EQ(released->size(), 0u);
    }
    EXPECT_EQ(released->size(), 1u) << "an unresumed connection released its context late";

    EchoService service("com.test.context");
    ASSERT_TRUE(service.start());
    auto client = std::make_unique<TestClient>(service.name());
    client->connection->setContext(std::make_shared<ReleaseSignal>(released));
    ASSERT_TRUE(client->call(Value::dictionary({})).ok());
    client->connection->cancel();
    EXPECT_EQ(client->events->pop()->kind, ConduitEvent::Kind::ConnectionInvalid);
    EXPECT_EQ(released->size(), 1u);
    client.reset(); // the last reference outside the transport
    EXPECT_TRUE(released->pop());
    EXPECT_TRUE(released->pop());
}

// The daemon's pattern: the handler owns the record that owns the only reference to the
// connection, and drops it when the connection ends.
void expectHandlerMayDropTheLastReference(std::shared_ptr<WorkQueue> peerQueue)
{
    auto released = std::make_shared<Mailbox<bool>>();
    auto listenerQueue = WorkQueue::create("test.listener");
    auto listener = ConduitListener::create("com.test.selfdrop", listenerQueue);
    ASSERT_TRUE(listener.ok());
    listener.value()->setConnectionHandler([released, peerQueue](std::shared_ptr<ConduitConnection> connection) {
        struct Record {
            std::shared_ptr<ConduitConnection> connection;
        };
        auto record = std::make_shared<Record>(Record { connection });
        connection->setContext(std::make_shared<ReleaseSignal>(released));
        connection->setTargetQueue(peerQueue);
        connection->setEventHandler([record](const ConduitEvent& event) {
            if (event.expectsReply())
                record->connection->sendReply(event.requestId, Value::dictionary({}));
            if (event.kind == ConduitEvent::Kind::ConnectionInvalid)
                record->connection.reset(); // from here on only the transport's own reference remains
        });
        connection->resume();
    });
    listener.value()->resume();
    {
        TestClient client("com.test.selfdrop");
        ASSERT_TRUE(client.call(Value::dictionary({ { "x", 1 } })).ok());
    } // the client closes; the peer connection ends
    EXPECT_TRUE(released->pop()) << "the peer connection was never destroyed";
}

TEST_F(Conduit, HandlerMayDropTheLastReferenceOnTheIoThread)
{
    expectHandlerMayDropTheLastReference(nullptr);
}

TEST_F(Conduit, HandlerMayDropTheLastReferenceOnAQueue)
{
    expectHandlerMayDropTheLastReference(WorkQueue::create("test.peer"));
}

TEST_F(Conduit, PeerThatStopsReadingIsDisconnectedAlone)
{
    struct PendingLimit {
        PendingLimit() { om::Conduit::setMaxPendingBytesForTesting(256 * 1024); }
        ~PendingLimit() { om::Conduit::setMaxPendingBytesForTesting(size_t(64) << 20); }
    } limit;
    Log::Capture capture;
    const Value blob = Value::data(std::vector<uint8_t>(64 * 1024, 0x5a));
    EchoService service("com.test.slow", nullptr,
        [blob](const std::shared_ptr<ConduitConnection>& connection, const ConduitEvent& event) {
            connection->sendReply(event.requestId, Value::dictionary({ { "blob", blob } }));
        });
    ASSERT_TRUE(service.start());
    TestClient healthy(service.name());
    ASSERT_TRUE(healthy.call(Value::dictionary({})).ok());

    auto sleeper = RawConduitPeer::connectToService(service.name());
    ASSERT_TRUE(sleeper);
    // Sending stops making sense once the service has dropped us, which may come early.
    ASSERT_TRUE(sleeper->sendFrame(RawConduitPeer::kRequest, 1, Value::dictionary({})));
    for (uint64_t id = 2; id <= 64 && sleeper->sendFrame(RawConduitPeer::kRequest, id, Value::dictionary({})); ++id) { }
    // The sleeper reads nothing until the service has given up on it.
    EXPECT_TRUE(capture.waitUntil([](const std::vector<Log::Record>& records) {
        return std::any_of(records.begin(), records.end(), [](const Log::Record& record) {
            return record.message.find("peer stopped reading") != std::string::npos
                && record.message.find("pid " + std::to_string(::getpid())) != std::string::npos;
        });
    }));
    EXPECT_TRUE(sleeper->waitForClose());
    auto reply = healthy.call(Value::dictionary({}));
    ASSERT_TRUE(reply.ok());
    EXPECT_EQ(*reply.value()["blob"].asData(), *blob.asData());
}

TEST_F(Conduit, UnsendableValuesAreRefusedAtTheSender)
{
    EchoService service("com.test.unsendable");
    ASSERT_TRUE(service.start());
    TestClient client(service.name());
    Value deep = Value(1);
    for (int i = 0; i < 129; ++i)
        deep = Value::array({ deep });
    auto refused = client.call(deep);
    ASSERT_FALSE(refused.ok());
    EXPECT_NE(refused.error().domain(), kConduitErrorDomain);
    // The connection is untouched by the refusal.
    EXPECT_TRUE(client.call(Value::dictionary({ { "fine", true } })).ok());
}

// SIGTERM: every peer hears "termination imminent", and the process exits with 0 only once the
// last KeepAlive closes. Runs in a fresh child process, since it ends by exit().
void runTerminationScenario()
{
    om::Conduit::exitOnTermination();
    static const std::string directory = std::getenv("CONDUIT_DIR");
    std::atexit([] {
        std::error_code ignored;
        std::filesystem::remove_all(directory, ignored);
    });
    EchoService service("com.test.term");
    if (!service.start())
        std::_Exit(3);
    auto peer = RawConduitPeer::connectToService(service.name());
    if (!peer || !peer->sendFrame(RawConduitPeer::kRequest, 1, Value::dictionary({})) || !peer->readFrame())
        std::_Exit(4);
    auto* keepAlive = new ConduitConnection::KeepAlive;
    ::kill(::getpid(), SIGTERM);
    auto frame = peer->readFrame();
    if (!frame || frame->kind != RawConduitPeer::kTerminationImminent || !frame->payload.empty())
        std::_Exit(5);
    std::fprintf(stderr, "peer heard termination imminent\n");
    delete keepAlive; // the I/O thread exits now
    for (;;)
        ::pause();
}

TEST_F(Conduit, SigtermTellsPeersThenExitsOnceKeepAlivesClose)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_EXIT(runTerminationScenario(), ::testing::ExitedWithCode(0), "peer heard termination imminent");
}

TEST(ValueTreeConversion, SharesWhatCanTravelAndRefusesTheRest)
{
    Value nested = Value(1);
    for (int i = 0; i < 127; ++i)
        nested = Value::array({ nested });
    const Value at128 = Value::dictionary({ { "k", nested } });
    EXPECT_EQ(ValueTreeConversion::toConduit(at128), at128);
    EXPECT_EQ(ValueTreeConversion::fromConduit(at128), at128);
    const Value at129 = Value::array({ at128 });
    EXPECT_FALSE(ValueTreeConversion::toConduit(at129));
    EXPECT_FALSE(ValueTreeConversion::fromConduit(at129));

    EXPECT_FALSE(ValueTreeConversion::toConduit(Value()));
    EXPECT_FALSE(ValueTreeConversion::toConduit(Value::array({ 1, Value() })));
    EXPECT_FALSE(ValueTreeConversion::toConduit(Value::dictionary({ { "a", Value::array({ Value() }) } })));
    EXPECT_FALSE(ValueTreeConversion::toConduit(Value::string("bad \xff utf-8")));
    EXPECT_FALSE(ValueTreeConversion::toConduit(Value::dictionary({ { "\xc0\x80", 1 } })));
    EXPECT_TRUE(ValueTreeConversion::toConduit(Value::dictionary({ { "caf\xc3\xa9", Value::uuid(Uuid()) } })));
}

TEST(ConduitMessageEncoding, CarriesATreeAsOneDataValue)
{
    const Value tree
        = Value::dictionary({ { "a", Value::array({ 1, "two", 3.5, true }) }, { "d", Value::date(86400) } });
    const Value encoded = ConduitMessageEncoding::encode(tree);
    ASSERT_TRUE(encoded.isData());
    EXPECT_EQ(ConduitMessageEncoding::decode(encoded), tree);
    EXPECT_FALSE(ConduitMessageEncoding::decode(tree));
    EXPECT_FALSE(ConduitMessageEncoding::decode(Value::data(std::vector<uint8_t> { 0xa1, 0x61 })));
    EXPECT_FALSE(ConduitMessageEncoding::decode(ConduitMessageEncoding::encode(Value::array({ Value() }))));
}

} // namespace
} // namespace om::test
