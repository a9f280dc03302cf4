// The server object: its queues, its place as the process-wide server and its own delegate, and
// the listening endpoint's refusal to share a live name.
#include <gtest/gtest.h>
#include <stdlib.h>

#include <filesystem>
#include <latch>

#include "omd/OMDatabase.h"
#include "tests/omd/InProcessServer.h"

namespace om::test {
namespace {

using OMDServerSetup = InProcessServer;

TEST_F(OMDServerSetup, QueuesHaveTheirLabelsAndClasses)
{
    EXPECT_EQ(m_server->conduitQueue()->label(), "conduit");
    EXPECT_EQ(m_server->conduitQueue()->qualityOfService(), QualityOfService::Default);
    EXPECT_EQ(m_server->mainQueue()->label(), "service");
    EXPECT_EQ(m_server->mainQueue()->qualityOfService(), QualityOfService::UserInitiated);
    EXPECT_EQ(m_server->syncQueue()->label(), "serverSync");
}

TEST_F(OMDServerSetup, IsTheProcessWideServerAndItsOwnDelegate)
{
    EXPECT_EQ(OMDServer::server(), m_server);
    EXPECT_EQ(m_server->delegate().get(), static_cast<OMDatabaseDelegate*>(m_server.get()));
    // main sets the limit only after construction.
    EXPECT_EQ(m_server->cacheLimit(), 0u);
    EXPECT_EQ(m_server->databasePath(), std::optional<std::string>(m_root + "/annotations.vlist"));
}

TEST_F(OMDServerSetup, SubmittedWorkRunsOnTheServiceQueueInOrder)
{
    std::vector<int> order;
    std::latch finished(1);
    for (int i = 0; i < 50; ++i) {
        m_server->submitWork([&, i] {
            m_server->mainQueue()->assertCurrent();
            order.push_back(i);
        });
    }
    m_server->submitWork([&] { finished.count_down(); });
    finished.wait();
    ASSERT_EQ(order.size(), 50u);
    EXPECT_TRUE(std::is_sorted(order.begin(), order.end()));
}

TEST_F(OMDServerSetup, SecondServerOnALiveNameIsRefused)
{
    EXPECT_EQ(OMDServer::initForService(m_serviceName, m_root + "/refused.vlist"), nullptr);
    // The refused one did not take over as the process-wide server.
    EXPECT_EQ(OMDServer::server(), m_server);
    // The first one still serves.
    auto client = connect();
    EXPECT_TRUE(client->call(request("still-here")));
}

TEST_F(OMDServerSetup, RemovalOfNothingCompletesWithoutWaitingForJobd)
{
    m_server->removedPlugIns({});
    EXPECT_TRUE(m_log.waitFor("removal complete for ()"));
    EXPECT_EQ(m_log.count("waiting for 0 termination replies"), 1u);
}

TEST_F(OMDServerSetup, NoConnectionIsAcceptedBeforeListeningStarts)
{
    auto quiet = OMDServer::initForService(m_serviceName + ".quiet", m_root + "/quiet.vlist");
    ASSERT_TRUE(quiet);
    InProcessClient early(m_serviceName + ".quiet");
    // Served by the first server, which listens: the quiet one has made no record meanwhile.
    auto client = connect();
    ASSERT_TRUE(client->call(request("barrier")));
    ASSERT_TRUE(waitForClients(1));
    quiet->startListening();
    // The waiting peer is accepted now.
    EXPECT_TRUE(early.call(request("accepted-late")));
    EXPECT_TRUE(waitForClients(2));
}

// Nothing may land outside the test's own directory, so every database gets a file in it.
class OMDatabaseFrame : public ::testing::Test {
protected:
    void SetUp() override
    {
        std::string pattern = std::filesystem::temp_directory_path() / "omd-database-XXXXXX";
        ASSERT_TRUE(::mkdtemp(pattern.data()));
        m_root = pattern;
        m_path = m_root + "/annotations.vlist";
        useFreshRegistrar(m_root);
    }
    void TearDown() override
    {
        std::error_code ignored;
        std::filesystem::remove_all(m_root, ignored);
    }

    std::string m_root;
    std::string m_path;
};

TEST_F(OMDatabaseFrame, FreshDatabaseIsEmptyWithNoDelegateAndNoLimit)
{
    auto database = OMDatabase::initWithDatabase(m_path);
    ASSERT_TRUE(database);
    EXPECT_EQ(database->cacheLimit(), 0u);
    EXPECT_EQ(database->delegate(), nullptr);
    EXPECT_EQ(database->cachedRecordCount(), 0u);
    EXPECT_EQ(database->databasePath(), std::optional<std::string>(m_path));
}

TEST_F(OMDatabaseFrame, HoldsItsDelegateWeakly)
{
    struct Recorder : OMDatabaseDelegate {
        void removedPlugIns(const RegistrarPlugInRecords&) override { }
    };
    auto database = OMDatabase::initWithDatabase(m_path);
    ASSERT_TRUE(database);
    auto delegate = std::make_shared<Recorder>();
    database->setDelegate(delegate);
    EXPECT_EQ(database->delegate(), delegate);
    delegate.reset();
    EXPECT_EQ(database->delegate(), nullptr);
}

} // namespace
} // namespace om::test
