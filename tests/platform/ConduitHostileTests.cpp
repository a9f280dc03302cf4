#include <sys/socket.h>
#include <sys/un.h>

#include <algorithm>
#include <cstring>

#include "platform/Conduit.h"
#include "platform/Log.h"
#include "tests/platform/ConduitTestSupport.h"
#include "tests/support/RawConduitPeer.h"

namespace om::test {
namespace {

constexpr uint32_t kLargestLength = 9 + om::Conduit::kMaxPayload;

std::vector<uint8_t> concat(std::initializer_list<std::vector<uint8_t>> parts)
{
    std::vector<uint8_t> all;
    for (const auto& part : parts)
        all.insert(all.end(), part.begin(), part.end());
    return all;
}

std::vector<uint8_t> frame(uint8_t kind, uint64_t id, std::vector<uint8_t> payload)
{
    return RawConduitPeer::frame(kind, id, payload);
}

// CBOR of `depth` nested one-element arrays around the integer 1.
std::vector<uint8_t> nestedArrays(int depth)
{
    std::vector<uint8_t> bytes(size_t(depth), 0x81);
    bytes.push_back(0x01);
    return bytes;
}

struct HostileCase {
    const char* name;
    std::vector<uint8_t> bytes;
    bool endStream; // half-close after the bytes, as a peer that hangs up mid-frame
    const char* reason; // part of the logged protocol error
    int deliveredBefore = 0; // good frames ahead of the bad one, which are delivered
};

void PrintTo(const HostileCase& hostile, std::ostream* out)
{
    *out << hostile.name;
}

std::vector<HostileCase> hostileCases()
{
    return {
        { "TruncatedHeader", { 0x0d, 0x00, 0x00 }, true, "stream ended inside a frame header" },
        { "TruncatedBody", concat({ RawConduitPeer::header(20, 1, 0), { 0xa0 } }), true,
            "stream ended inside a frame (" },
        { "LengthEight", RawConduitPeer::header(8, 1, 0), false, "frame length 8 out of range" },
        { "LengthPastTheLimit", RawConduitPeer::header(kLargestLength + 1, 1, 0), false, "out of range" },
        { "KindZero", frame(0, 0, { 0xa0 }), false, "unknown frame kind 0" },
        { "KindFive", frame(5, 0, { 0xa0 }), false, "unknown frame kind 5" },
        { "MalformedCbor", frame(1, 0, { 0xa1, 0x61 }), false, "malformed payload" },
        { "TwoItems", frame(1, 0, { 0xa0, 0xa0 }), false, "malformed payload" },
        { "NestingTooDeep", frame(1, 0, nestedArrays(129)), false, "malformed payload" },
        { "DuplicateKey", frame(1, 0, { 0xa2, 0x61, 0x61, 0x01, 0x61, 0x61, 0x02 }), false, "malformed payload" },
        { "NonTextKey", frame(1, 0, { 0xa1, 0x01, 0x01 }), false, "malformed payload" },
        { "Null", frame(2, 1, { 0xf6 }), false, "malformed payload" },
        { "EmptyPayload", frame(1, 0, {}), false, "without a payload" },
        { "ReplyToNothing", frame(3, 7, { 0xa0 }), false, "reply to request 7, which is not outstanding" },
        { "RequestIdZero", frame(2, 0, { 0xa0 }), false, "request with id 0" },
        { "RequestIdRepeated", concat({ frame(2, 5, { 0xa0 }), frame(2, 5, { 0xa0 }) }), false,
            "request id 5 not above 5", 1 },
        { "RequestIdDecreasing", concat({ frame(2, 5, { 0xa0 }), frame(2, 4, { 0xa0 }) }), false,
            "request id 4 not above 5", 1 },
        { "MessageWithAnId", frame(1, 3, { 0xa0 }), false, "frame of kind 1 with id 3" },
        { "TerminationWithPayload", frame(4, 0, { 0xa0 }), false, "termination frame with a payload" },
        { "BadFrameAfterAGoodOne", concat({ frame(1, 0, { 0xa0 }), frame(9, 0, { 0xa0 }) }), false,
            "unknown frame kind 9", 1 },
    };
}

class ConduitHostile : public ConduitDirectoryTest, public ::testing::WithParamInterface<HostileCase> { };

bool loggedProtocolError(const Log::Capture& capture, const std::string& reason)
{
    const std::string pid = "pid " + std::to_string(::getpid());
    return capture.waitUntil([&](const std::vector<Log::Record>& records) {
        return std::any_of(records.begin(), records.end(), [&](const Log::Record& record) {
            return record.level == LogLevel::Error && record.message.find("protocol error") != std::string::npos
                && record.message.find(pid) != std::string::npos && record.message.find(reason) != std::string::npos;
        });
    });
}

// Events of one connection of the service up to its ConnectionInvalid; none if it never comes.
std::optional<std::vector<ConduitEvent>> eventsUntilInvalid(
    EchoService& service, const std::shared_ptr<ConduitConnection>& of)
{
    std::vector<ConduitEvent> events;
    for (;;) {
        auto received = service.events().pop();
        if (!received)
            return std::nullopt;
        if (received->connection != of)
            continue;
        if (received->event.kind == ConduitEvent::Kind::ConnectionInvalid)
            return events;
        events.push_back(received->event);
    }
}

TEST_P(ConduitHostile, ClosesOnlyTheOffendingConnection)
{
    const HostileCase& hostile = GetParam();
    Log::Capture capture;
    EchoService service("com.test.hostile");
    ASSERT_TRUE(service.start());
    TestClient healthy(service.name());
    ASSERT_TRUE(healthy.call(Value::dictionary({ { "before", true } })).ok());
    ASSERT_TRUE(service.accepted().pop());

    auto attacker = RawConduitPeer::connectToService(service.name());
    ASSERT_TRUE(attacker);
    auto attackerOnServer = service.accepted().pop();
    ASSERT_TRUE(attackerOnServer);
    ASSERT_TRUE(attacker->sendBytes(hostile.bytes));
    if (hostile.endStream)
        attacker->shutdownWrite();

    EXPECT_TRUE(attacker->waitForClose());
    auto delivered = eventsUntilInvalid(service, *attackerOnServer);
    ASSERT_TRUE(delivered) << "the offending connection never became invalid";
    EXPECT_EQ(delivered->size(), size_t(hostile.deliveredBefore)) << "something of the bad frame was delivered";
    EXPECT_TRUE(loggedProtocolError(capture, hostile.reason));

    EXPECT_TRUE(healthy.call(Value::dictionary({ { "after", true } })).ok());
    TestClient newcomer(service.name());
    EXPECT_TRUE(newcomer.call(Value::dictionary({})).ok());
}

INSTANTIATE_TEST_SUITE_P(Frames, ConduitHostile, ::testing::ValuesIn(hostileCases()),
    [](const auto& info) { return std::string(info.param.name); });

using ConduitBoundary = ConduitDirectoryTest;

TEST_F(ConduitBoundary, DeepestAcceptedNestingIsDelivered)
{
    EchoService service("com.test.deep");
    ASSERT_TRUE(service.start());
    auto peer = RawConduitPeer::connectToService(service.name());
    ASSERT_TRUE(peer);
    ASSERT_TRUE(peer->sendBytes(frame(1, 0, nestedArrays(128))));
    auto received = service.events().pop();
    ASSERT_TRUE(received);
    Value innermost = received->event.message;
    int depth = 0;
    while (innermost.isArray()) {
        innermost = innermost.at(0);
        ++depth;
    }
    EXPECT_EQ(depth, 128);
    EXPECT_EQ(innermost, Value(1));
}

TEST_F(ConduitBoundary, ShortestFrameIsAccepted)
{
    EchoService service("com.test.short");
    ASSERT_TRUE(service.start());
    auto peer = RawConduitPeer::connectToService(service.name());
    ASSERT_TRUE(peer);
    ASSERT_TRUE(peer->sendBytes(RawConduitPeer::header(9, RawConduitPeer::kTerminationImminent, 0)));
    auto received = service.events().pop();
    ASSERT_TRUE(received);
    EXPECT_EQ(received->event.kind, ConduitEvent::Kind::TerminationImminent);
}

TEST_F(ConduitBoundary, LongestFrameIsAccepted)
{
    EchoService service("com.test.long");
    ASSERT_TRUE(service.start());
    auto peer = RawConduitPeer::connectToService(service.name());
    ASSERT_TRUE(peer);
    // A byte string whose 5-byte CBOR head and contents fill the payload limit exactly.
    const uint32_t contents = om::Conduit::kMaxPayload - 5;
    std::vector<uint8_t> payload { 0x5a, uint8_t(contents >> 24), uint8_t(contents >> 16), uint8_t(contents >> 8),
        uint8_t(contents) };
    payload.resize(om::Conduit::kMaxPayload, 0x11);
    auto bytes = RawConduitPeer::frame(RawConduitPeer::kRequest, 1, payload);
    ASSERT_EQ(bytes.size(), size_t(4 + kLargestLength));
    ASSERT_TRUE(peer->sendBytes(bytes));
    auto received = service.events().pop();
    ASSERT_TRUE(received);
    ASSERT_TRUE(received->event.message.isData());
    EXPECT_EQ(received->event.message.asData()->size(), contents);
}

// A service that answers one request twice: the second answer is a reply to nothing, and the
// client drops the connection after delivering the first.
TEST_F(ConduitBoundary, ClientRefusesASecondReplyToOneRequest)
{
    Log::Capture capture;
    const std::string path = om::Conduit::socketPath("com.test.twice");
    UniqueFd listening(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address {};
    address.sun_family = AF_UNIX;
    std::strcpy(address.sun_path, path.c_str());
    ASSERT_EQ(::bind(listening.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    ASSERT_EQ(::listen(listening.get(), 1), 0);

    TestClient client("com.test.twice");
    Mailbox<Result<Value>> replies;
    client.connection->sendWithReply(
        Value::dictionary({ { "q", 1 } }), nullptr, [&replies](Result<Value> r) { replies.push(r); });
    client.connection->sendWithReply(
        Value::dictionary({ { "q", 2 } }), nullptr, [&replies](Result<Value> r) { replies.push(r); });

    auto service = RawConduitPeer::adopt(UniqueFd(::accept4(listening.get(), nullptr, nullptr, SOCK_CLOEXEC)));
    auto first = service.readFrame();
    ASSERT_TRUE(first);
    EXPECT_EQ(first->kind, RawConduitPeer::kRequest);
    auto second = service.readFrame();
    ASSERT_TRUE(second);
    EXPECT_GT(second->id, first->id) << "request ids must increase";
    ASSERT_TRUE(service.sendFrame(RawConduitPeer::kReply, first->id, Value::dictionary({ { "a", 1 } })));
    ASSERT_TRUE(service.sendFrame(RawConduitPeer::kReply, first->id, Value::dictionary({ { "a", 2 } })));

    auto answered = replies.pop();
    ASSERT_TRUE(answered && answered->ok());
    EXPECT_EQ(answered->value()["a"], Value(1));
    auto failed = replies.pop();
    ASSERT_TRUE(failed);
    ASSERT_FALSE(failed->ok());
    EXPECT_EQ(failed->error().code(), kConduitConnectionInvalid);
    EXPECT_EQ(client.events->pop()->kind, ConduitEvent::Kind::ConnectionInvalid);
    EXPECT_TRUE(service.waitForClose());
    EXPECT_TRUE(loggedProtocolError(capture, "which is not outstanding"));
}

} // namespace
} // namespace om::test
