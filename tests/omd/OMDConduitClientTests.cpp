// The client record: what it learns about its peer, how it reads entitlements, how it describes
// itself, and what the end of its connection changes.
#include <gtest/gtest.h>

#include <filesystem>

#include "Ombrel/OMBundle.h"
#include "omd/OMDConduitClient.h"
#include "tests/omd/InProcessServer.h"

namespace om::test {
namespace {

class OMDConduitClientRecord : public InProcessRecord {
protected:
    // Work on the transport's thread is serial: once a connection made now has its record, every
    // earlier event (a close, the release of a closed connection) has been handled.
    void drainTransport()
    {
        size_t before = 0;
        for (const auto& record : m_log.records())
            before += record.message.starts_with(format("new client %d ", ::getpid()));
        auto probe = connect();
        ASSERT_TRUE(waitForClients(before + 1));
    }
};

TEST_F(OMDConduitClientRecord, IdentifiesThePeerByItsProcess)
{
    EXPECT_EQ(m_record->pid(), ::getpid());
    ASSERT_TRUE(m_record->path());
    EXPECT_EQ(*m_record->path(), std::filesystem::read_symlink("/proc/self/exe").string());
    // The test binary lies in no bundle: its reader answers nothing.
    ASSERT_TRUE(m_record->bundle());
    EXPECT_FALSE(m_record->bundle()->bundleIdentifier());
    EXPECT_TRUE(m_record->acceptWork());
    EXPECT_EQ(m_log.count(format("new client %d %s", ::getpid(), *m_record->path())), 1u);
}

TEST_F(OMDConduitClientRecord, DescriptionWhileConnected)
{
    auto connection = m_record->connection();
    ASSERT_TRUE(connection);
    auto expected = format("<OMDConduitClient %p con=%s pid=%d path=%s>", static_cast<const void*>(m_record.get()),
        connection->description(), ::getpid(), *m_record->path());
    EXPECT_EQ(m_record->description(), expected);
}

TEST_F(OMDConduitClientRecord, DeadStopsWorkButKeepsTheRecord)
{
    m_peer.reset();
    ASSERT_TRUE(m_log.waitFor(format("client %d is dead", ::getpid())));
    drainTransport();
    EXPECT_FALSE(m_record->acceptWork());
    // Nothing but the record itself is left of the connection.
    EXPECT_EQ(m_record->connection(), nullptr);
    EXPECT_EQ(m_record->description(),
        format("<OMDConduitClient %p NO CONNECTION>", static_cast<const void*>(m_record.get())));
    EXPECT_EQ(m_record->pid(), ::getpid());
}

TEST_F(OMDConduitClientRecord, NonDictionaryMessageIsLoggedAndLeftUnanswered)
{
    std::future<Result<Value>> unanswered;
    auto transaction = nextTransaction(unanswered); // an array, kept unanswered by the record
    m_peer->send(Value::string("text"));
    ASSERT_TRUE(m_log.waitFor(format("unexpected message: text from: %d", ::getpid())));
    ASSERT_TRUE(m_log.waitFor(format("unexpected message: (\"anything\") from: %d", ::getpid())));
    EXPECT_TRUE(m_record->acceptWork());
    EXPECT_EQ(m_record->requestCount(), 0u);
    // The connection is still up: an answer made now still reaches the peer, as the only one.
    transaction->done();
    ASSERT_EQ(unanswered.wait_for(kReplyTimeout), std::future_status::ready);
    EXPECT_TRUE(unanswered.get().ok());
}

TEST(OMDConduitClientEntitlement, HeldUnlessAbsentFalseOrZero)
{
    EXPECT_FALSE(OMDConduitClient::entitlementHeld(Value()));
    EXPECT_FALSE(OMDConduitClient::entitlementHeld(Value(false)));
    EXPECT_FALSE(OMDConduitClient::entitlementHeld(Value(0)));
    EXPECT_FALSE(OMDConduitClient::entitlementHeld(Value(0u)));
    EXPECT_FALSE(OMDConduitClient::entitlementHeld(Value(0.0)));
    EXPECT_FALSE(OMDConduitClient::entitlementHeld(Value(-0.0)));

    EXPECT_TRUE(OMDConduitClient::entitlementHeld(Value(true)));
    EXPECT_TRUE(OMDConduitClient::entitlementHeld(Value(1)));
    EXPECT_TRUE(OMDConduitClient::entitlementHeld(Value(-1)));
    EXPECT_TRUE(OMDConduitClient::entitlementHeld(Value(0.5)));
    EXPECT_TRUE(OMDConduitClient::entitlementHeld(Value(UINT64_MAX)));
    // Any string counts, even one that reads as false.
    EXPECT_TRUE(OMDConduitClient::entitlementHeld(Value("")));
    EXPECT_TRUE(OMDConduitClient::entitlementHeld(Value("0")));
    EXPECT_TRUE(OMDConduitClient::entitlementHeld(Value("false")));
    EXPECT_TRUE(OMDConduitClient::entitlementHeld(Value::array({})));
    EXPECT_TRUE(OMDConduitClient::entitlementHeld(Value::dictionary({})));
    EXPECT_TRUE(OMDConduitClient::entitlementHeld(Value::data(std::vector<uint8_t> { 0 })));
}

} // namespace
} // namespace om::test
