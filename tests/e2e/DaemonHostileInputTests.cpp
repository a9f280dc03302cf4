// Hostile bytes from one peer cost that peer its connection and nothing else: another client is
// served before and after, and the daemon stays up.
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <string>
#include <vector>

#include "platform/Conduit.h"
#include "platform/Format.h"
#include "tests/support/DaemonProcess.h"

namespace om::test {
namespace {

using Bytes = std::vector<uint8_t>;

Bytes concat(std::initializer_list<Bytes> parts)
{
    Bytes all;
    for (const auto& part : parts)
        all.insert(all.end(), part.begin(), part.end());
    return all;
}

Bytes text(std::string_view s)
{
    Bytes bytes(1 + s.size());
    bytes[0] = static_cast<uint8_t>(0x60 + s.size()); // short text strings only
    std::copy(s.begin(), s.end(), bytes.begin() + 1);
    return bytes;
}

// {"request": "deep", "version": 3, "deep": <arrays nested `arrays` deep around 1>}: the map is
// one level of nesting itself.
Bytes nestedRequest(size_t arrays)
{
    Bytes bytes = concat({ { 0xa3 }, text("request"), text("deep"), text("version"), { 0x03 }, text("deep") });
    bytes.insert(bytes.end(), arrays, 0x81);
    bytes.push_back(0x01);
    return bytes;
}

Bytes request(uint64_t id, const Bytes& payload)
{
    return RawConduitPeer::frame(RawConduitPeer::kRequest, id, payload);
}

struct HostileCase {
    const char* name;
    Bytes bytes;
    bool halfClose = false; // end the stream after the bytes (a truncated frame stays truncated)
};

std::vector<HostileCase> hostileCases()
{
    const Bytes goodMap = concat({ { 0xa2 }, text("request"), text("x"), text("version"), { 0x03 } });
    return {
        { "TruncatedHeader", { 0x20, 0x00, 0x00 }, true },
        { "TruncatedBody", Bytes(RawConduitPeer::header(40, RawConduitPeer::kRequest, 1)), true },
        { "LengthBelowTheMinimum", RawConduitPeer::header(8, RawConduitPeer::kRequest, 1) },
        { "LengthOverTheLimit", RawConduitPeer::header(9 + Conduit::kMaxPayload + 1, RawConduitPeer::kRequest, 1) },
        { "LengthAtMaximumOfUint32", RawConduitPeer::header(UINT32_MAX, RawConduitPeer::kRequest, 1) },
        { "UnknownKindZero", RawConduitPeer::frame(0, 0, goodMap) },
        { "UnknownKindFive", RawConduitPeer::frame(5, 0, goodMap) },
        { "RequestWithIdZero", request(0, goodMap) },
        // The first request is a plain number, which is never answered, whether or not it is delivered.
        { "RequestIdsNotRising", concat({ request(5, { 0x01 }), request(5, goodMap) }) },
        { "MessageWithAnId", RawConduitPeer::frame(RawConduitPeer::kMessage, 3, goodMap) },
        { "TerminationWithAPayload", RawConduitPeer::frame(RawConduitPeer::kTerminationImminent, 0, Bytes { 0x01 }) },
        { "RequestWithoutPayload", RawConduitPeer::header(9, RawConduitPeer::kRequest, 1) },
        { "ReplyToNothing", RawConduitPeer::frame(RawConduitPeer::kReply, 77, goodMap) },
        { "MalformedCbor", request(1, { 0xff }) },
        { "TruncatedCborMap", request(1, { 0xa2, 0x61, 'a' }) },
        { "TrailingBytesAfterTheItem", request(1, concat({ goodMap, { 0x01 } })) },
        { "IndefiniteLengthMap", request(1, concat({ { 0xbf }, text("request"), text("x"), { 0xff } })) },
        { "NestingDeeperThan128", request(1, nestedRequest(128)) },
        { "DuplicateKey", request(1, concat({ { 0xa2 }, text("request"), text("x"), text("request"), text("y") })) },
        { "NonTextKey", request(1, { 0xa1, 0x01, 0x02 }) },
        { "InvalidUtf8", request(1, { 0xa1, 0x61, 'a', 0x62, 0xc3, 0x28 }) },
        { "UnknownTag", request(1, { 0xd8, 0x20, 0x61, 'a' }) },
        { "NullValue", request(1, { 0xa1, 0x61, 'a', 0xf6 }) },
        { "UuidTagOverFifteenBytes", request(1, concat({ { 0xd8, 0x25, 0x4f }, Bytes(15, 0xab) })) },
        { "ByteStringLongerThanTheFrame", request(1, { 0x5a, 0xff, 0xff, 0xff, 0x00 }) },
    };
}

class DaemonHostileInput : public ::testing::TestWithParam<HostileCase> {
protected:
    void SetUp() override
    {
        DaemonProcess::Options options;
        options.executable = builtDaemonPath();
        m_daemon = std::make_unique<DaemonProcess>(options);
        ASSERT_TRUE(m_daemon->waitForSocket()) << m_daemon->stderrText();
    }

    std::unique_ptr<DaemonProcess> m_daemon;
};

TEST_P(DaemonHostileInput, ClosesOnlyTheOffendersConnection)
{
    auto bystander = DaemonPeer::connect(*m_daemon);
    ASSERT_TRUE(bystander);
    ASSERT_TRUE(bystander->call(daemonRequest("before")));

    auto offender = RawConduitPeer::connect(m_daemon->socketPath());
    ASSERT_TRUE(offender);
    ASSERT_TRUE(offender->sendBytes(GetParam().bytes));
    if (GetParam().halfClose)
        offender->shutdownWrite();
    // Nothing comes back but the end of the connection: no reply, no error frame.
    auto frame = offender->readFrame();
    EXPECT_FALSE(frame) << "kind " << int(frame->kind);
    EXPECT_TRUE(offender->closed());

    auto reply = bystander->call(daemonRequest("after"));
    ASSERT_TRUE(reply);
    EXPECT_EQ(*reply->stringFor("error"), "unrecognized request");
    EXPECT_TRUE(m_daemon->running());
    // Nothing of it got as far as a request.
    EXPECT_EQ(m_daemon->countMessages(format("client %d requested x", ::getpid())), 0u);
    EXPECT_EQ(m_daemon->countMessages(format("client %d requested deep", ::getpid())), 0u);
}

INSTANTIATE_TEST_SUITE_P(Frames, DaemonHostileInput, ::testing::ValuesIn(hostileCases()),
    [](const ::testing::TestParamInfo<HostileCase>& info) { return info.param.name; });

class DaemonNesting : public DaemonHostileInput { };

TEST_F(DaemonNesting, RequestNested128DeepIsServed)
{
    auto peer = RawConduitPeer::connect(m_daemon->socketPath());
    ASSERT_TRUE(peer);
    ASSERT_TRUE(peer->sendBytes(request(1, nestedRequest(127))));
    auto reply = peer->readFrame();
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->kind, RawConduitPeer::kReply);
    EXPECT_EQ(reply->id, 1u);
    EXPECT_EQ(*reply->value.stringFor("error"), "unrecognized request");
}

TEST_F(DaemonNesting, OffendersOnManyConnectionsLeaveTheDaemonServing)
{
    auto bystander = DaemonPeer::connect(*m_daemon);
    ASSERT_TRUE(bystander);
    for (const auto& hostile : hostileCases()) {
        auto offender = RawConduitPeer::connect(m_daemon->socketPath());
        ASSERT_TRUE(offender) << hostile.name;
        ASSERT_TRUE(offender->sendBytes(hostile.bytes));
        if (hostile.halfClose)
            offender->shutdownWrite();
        EXPECT_TRUE(offender->waitForClose()) << hostile.name;
        ASSERT_TRUE(bystander->call(daemonRequest(hostile.name))) << hostile.name;
    }
}

} // namespace
} // namespace om::test
