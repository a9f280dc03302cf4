// Dispatch of requests through a server in this process: the order of the envelope checks, their
// codes and texts, and how fail() and done() shape the one reply.
#include <gtest/gtest.h>

#include <future>
#include <latch>

#include "Ombrel/OMMakeError.h"
#include "omd/OMDConduitClient.h"
#include "omd/Transaction.h"
#include "tests/omd/InProcessServer.h"

namespace om::test {
namespace {

class TransactionDispatch : public InProcessServer {
protected:
    void TearDown() override
    {
        m_client.reset();
        InProcessServer::TearDown();
    }

    Value call(const Value& message)
    {
        if (!m_client)
            m_client = connect();
        auto reply = m_client->call(message);
        EXPECT_TRUE(reply.has_value()) << "no reply to " << message.description();
        return reply.value_or(Value());
    }

    static uint64_t code(const Value& reply) { return reply["errorcode"].asUInt64().value_or(0); }
    static std::string text(const Value& reply)
    {
        auto* error = reply.stringFor("error");
        return error ? *error : "<none>";
    }

    std::unique_ptr<InProcessClient> m_client;
};

TEST_F(TransactionDispatch, RefusedVersionIsReportedByItsLowThirtyTwoBitsAsSigned)
{
    // 2^32 + 3 is not version 3, though its low half reads as 3.
    auto reply = call(request("x", (uint64_t(1) << 32) + 3));
    EXPECT_EQ(code(reply), 7u);
    EXPECT_EQ(text(reply), "unsupported protocol version 3 (current 3)");

    reply = call(request("x", 0xffffffffu));
    EXPECT_EQ(text(reply), "unsupported protocol version -1 (current 3)");
}

TEST_F(TransactionDispatch, VersionOfAnotherKindReadsAsZero)
{
    for (Value version : { Value("3"), Value(-3), Value(3.0) }) {
        auto reply = call(Value::dictionary({ { "request", "x" }, { "version", version } }));
        EXPECT_EQ(text(reply), "unsupported protocol version 0 (current 3)") << version.description();
    }
}

TEST_F(TransactionDispatch, SignedVersionThreeIsAccepted)
{
    // Integers compare by value whatever their wire kind.
    auto reply = call(Value::dictionary({ { "request", "x" }, { "version", Value::integer(3) } }));
    EXPECT_EQ(text(reply), "unrecognized request");
}

TEST_F(TransactionDispatch, VersionIsCheckedBeforeTheName)
{
    auto reply = call(Value::dictionary({ { "version", Value(9u) } }));
    EXPECT_EQ(code(reply), 7u);
}

TEST_F(TransactionDispatch, RepliesComeInRequestOrderAcrossClients)
{
    auto first = connect();
    auto second = connect();
    for (int round = 0; round < 20; ++round) {
        auto name = "order-" + std::to_string(round);
        first->sendWithoutWaiting(request(name));
        second->sendWithoutWaiting(request(name));
    }
    ASSERT_TRUE(first->call(request("order-end")));
    ASSERT_TRUE(second->call(request("order-end")));
    // Each client's requests run in the order they were sent, on the one service queue.
    std::vector<std::string> seen;
    for (const auto& record : m_log.records()) {
        if (record.message.starts_with(requested("order-")))
            seen.push_back(record.message.substr(requested("order-").size()));
    }
    size_t position = 0;
    for (int round = 0; round < 20; ++round) {
        auto it = std::find(seen.begin() + static_cast<long>(position), seen.end(), std::to_string(round));
        ASSERT_NE(it, seen.end()) << round;
        position = static_cast<size_t>(it - seen.begin());
    }
}

TEST_F(TransactionDispatch, RequestsOfADeadClientStillQueuedAreDropped)
{
    auto dying = connect();
    auto witness = connect();
    ASSERT_TRUE(waitForClients(2));

    // Hold the service queue so that the dying client's requests wait behind it.
    std::latch release(1);
    m_server->submitWork([&] { release.wait(); });
    for (int i = 0; i < 5; ++i)
        dying->sendWithoutWaiting(request("from-dead-client"));
    dying->close();
    ASSERT_TRUE(m_log.waitFor(format("client %d is dead", ::getpid())));
    // The record stops accepting work right after that line, on the transport's thread; a
    // connection accepted after it proves it has returned.
    auto late = connect();
    ASSERT_TRUE(waitForClients(3));
    release.count_down();

    auto reply = witness->call(request("from-live-client"));
    ASSERT_TRUE(reply);
    EXPECT_EQ(m_log.count(requested("from-dead-client")), 0u);
    EXPECT_EQ(m_log.count(requested("from-live-client")), 1u);
}

// Answers a real peer through each of Transaction's reply paths.
class TransactionReply : public InProcessRecord {
protected:
    Value answer(const std::function<void(Transaction&)>& how)
    {
        std::future<Result<Value>> reply;
        auto transaction = nextTransaction(reply);
        how(*transaction);
        transaction.reset();
        EXPECT_EQ(reply.wait_for(kReplyTimeout), std::future_status::ready);
        auto result = reply.get();
        EXPECT_TRUE(result.ok());
        return result.ok() ? result.value() : Value();
    }
};

TEST_F(TransactionReply, SuccessCarriesNoErrorCode)
{
    auto reply = answer([](Transaction& transaction) {
        transaction.reply().set("uuids", Value::uuid(Uuid::random()));
        transaction.done();
    });
    EXPECT_FALSE(reply.contains("errorcode"));
    EXPECT_FALSE(reply.contains("error"));
    EXPECT_TRUE(reply["uuids"].isUuid());
}

TEST_F(TransactionReply, FailureKeepsKeysTheHandlerAlreadySet)
{
    auto reply = answer([](Transaction& transaction) {
        transaction.reply().set("conflicts", Value::array({ Value::dictionary({ { "pid", 12 } }) }));
        transaction.fail(14, "plug-ins are busy");
    });
    EXPECT_EQ(reply["errorcode"], Value(14u));
    EXPECT_EQ(*reply.stringFor("error"), "plug-ins are busy");
    EXPECT_EQ(reply["conflicts"].count(), 1u);
}

TEST_F(TransactionReply, ErrorCodeIsTheSignedCodeWidened)
{
    auto reply = answer([](Transaction& transaction) { transaction.fail(-1, "negative"); });
    EXPECT_EQ(reply["errorcode"].asUInt64(), std::optional<uint64_t>(UINT64_MAX));
    EXPECT_TRUE(reply["errorcode"].isInteger());
}

TEST_F(TransactionReply, AbsentMessageLeavesErrorUnset)
{
    auto reply = answer([](Transaction& transaction) { transaction.fail(4, std::nullopt); });
    EXPECT_EQ(reply["errorcode"], Value(4u));
    EXPECT_FALSE(reply.contains("error"));
}

TEST_F(TransactionReply, OwnDomainErrorKeepsItsOwnCodeAndText)
{
    auto reply = answer([](Transaction& transaction) {
        transaction.fail(99, OMMakeErrorWithFormat(2, "no plug-in with the requested uuid"));
    });
    EXPECT_EQ(reply["errorcode"], Value(2u));
    EXPECT_EQ(*reply.stringFor("error"), "no plug-in with the requested uuid");
}

TEST_F(TransactionReply, OwnDomainErrorWithoutDescriptionSendsNoText)
{
    auto reply = answer([](Transaction& transaction) { transaction.fail(99, OMMakeError(12)); });
    EXPECT_EQ(reply["errorcode"], Value(12u));
    EXPECT_FALSE(reply.contains("error"));
}

TEST_F(TransactionReply, ForeignErrorTakesTheGivenCodeAndItsLocalizedText)
{
    auto reply = answer([](Transaction& transaction) { transaction.fail(4, OMError::fromErrno("open", ENOENT)); });
    EXPECT_EQ(reply["errorcode"], Value(4u));
    EXPECT_EQ(*reply.stringFor("error"), OMError::fromErrno("open", ENOENT).localizedDescription());

    reply = answer([](Transaction& transaction) { transaction.fail(9, OMError("Elsewhere", 3)); });
    EXPECT_EQ(reply["errorcode"], Value(9u));
    EXPECT_EQ(*reply.stringFor("error"), OMError("Elsewhere", 3).localizedDescription());
}

TEST_F(TransactionReply, ReplyFromAnotherQueueReachesThePeer)
{
    auto elsewhere = WorkQueue::create("elsewhere");
    auto reply = answer([&](Transaction& transaction) {
        elsewhere->async([keep = transaction.shared_from_this()] { keep->fail(14, "later"); });
    });
    EXPECT_EQ(*reply.stringFor("error"), "later");
}

TEST_F(TransactionReply, ReplyAfterThePeerIsGoneIsDropped)
{
    std::future<Result<Value>> reply;
    auto transaction = nextTransaction(reply);
    m_peer.reset();
    ASSERT_TRUE(m_log.waitFor(format("client %d is dead", ::getpid())));
    transaction->fail(4, "too late");
    EXPECT_TRUE(transaction->replied());
    // The peer saw its connection end instead of a reply.
    ASSERT_EQ(reply.wait_for(kReplyTimeout), std::future_status::ready);
    EXPECT_FALSE(reply.get().ok());
}

TEST(TransactionGetters, ArrayAndDictionaryOnlyWhenOfThatKind)
{
    auto message = Value::dictionary({ { "paths", Value::array({ "/a" }) },
        { "rules", Value::dictionary({ { "k", "v" } }) }, { "flags", Value(1u) } });
    EXPECT_EQ(conduit_dictionary_get_array(message, "paths"), std::optional<Value>(Value::array({ "/a" })));
    EXPECT_FALSE(conduit_dictionary_get_array(message, "rules"));
    EXPECT_FALSE(conduit_dictionary_get_array(message, "missing"));
    EXPECT_TRUE(conduit_dictionary_get_dictionary(message, "rules"));
    EXPECT_FALSE(conduit_dictionary_get_dictionary(message, "paths"));
    EXPECT_FALSE(conduit_dictionary_get_dictionary(message, "flags"));
    EXPECT_FALSE(conduit_dictionary_get_array(Value("not a dictionary"), "paths"));
}

} // namespace
} // namespace om::test
