// The database's record cache and lookups over a real Registrar: one record per UUID, the
// all-or-nothing purge at its limit, records that cannot be built, lookups by path and by
// application, and what an uninstall does to the cache and in which order.
#include <gtest/gtest.h>

#include <filesystem>
#include <mutex>

#include "Ombrel/OMBundle.h"
#include "omd/OMDPlugIn.h"
#include "omd/OMDatabase.h"
#include "tests/omd/InProcessServer.h"
#include "tests/support/BundleFixture.h"

namespace om::test {
namespace {

class OMDatabaseCache : public ::testing::Test {
protected:
    void SetUp() override
    {
        m_registrar = useFreshRegistrar(m_state.root());
        m_database = OMDatabase::initWithDatabase(m_state.root() + "/annotations.vlist");
        ASSERT_TRUE(m_database);
        m_app = m_bundles.makeApp("Host", "com.example.host");
    }

    // A registered plug-in of the test's application; its UUID.
    Uuid registered(const std::string& name)
    {
        const std::string path = m_bundles.makePlugIn(m_app, name, "com.example.host." + name, "com.example.point");
        auto record = m_registrar->registerPlugIn(path);
        EXPECT_TRUE(record.ok()) << record.error().localizedDescription();
        return record.ok() ? record.value()->uuid() : Uuid();
    }

    BundleFixture m_state;
    BundleFixture m_bundles;
    std::string m_app;
    std::shared_ptr<RegistrarWorkspace> m_registrar;
    std::shared_ptr<OMDatabase> m_database;
    Log::Capture m_log;
};

TEST_F(OMDatabaseCache, OneRecordPerUuid)
{
    const Uuid uuid = registered("A");
    auto first = m_database->findPlugIn(uuid);
    ASSERT_TRUE(first);
    EXPECT_EQ(m_database->findPlugIn(uuid), first);
    EXPECT_EQ(m_database->plugInForProxy(m_registrar->plugInWithUuid(uuid)), first);
    EXPECT_EQ(m_database->cachedRecordCount(), 1u);
}

TEST_F(OMDatabaseCache, PurgeEmptiesTheWholeCacheOncePastTheLimit)
{
    struct Case {
        uint32_t limit;
        std::vector<size_t> countsAfterEach;
        const char* purge; // the purge line expected, or null
    };
    for (const Case& test : { Case { 2, { 1, 2, 3, 1 }, "purging cache for 3 > 2" },
             Case { 0, { 1, 1, 1, 1 }, "purging cache for 1 > 0" } }) {
        SetUp();
        m_database->setCacheLimit(test.limit);
        std::vector<Uuid> uuids;
        for (int i = 0; i < 4; ++i)
            uuids.push_back(registered(format("P%u-%d", test.limit, i)));
        for (size_t i = 0; i < uuids.size(); ++i) {
            ASSERT_TRUE(m_database->findPlugIn(uuids[i]));
            EXPECT_EQ(m_database->cachedRecordCount(), test.countsAfterEach[i]) << "limit " << test.limit;
        }
        EXPECT_GE(m_log.count(test.purge), 1u);
        // The record created last survives every purge.
        auto last = m_database->findPlugIn(uuids.back());
        EXPECT_EQ(m_database->findPlugIn(uuids.back()), last);
        m_log.clear();
    }
}

TEST_F(OMDatabaseCache, ARecordThatCannotBeBuiltIsTriedAgainAndNeverCached)
{
    // A plug-in outside any application and outside /System/ is refused at every lookup.
    const std::string loose = m_bundles.makeBundle(
        "Loose.appex", BundleFixture::plugInInfo("com.example.loose", "Loose", "com.example.point"));
    auto record = m_registrar->registerPlugIn(loose);
    ASSERT_TRUE(record.ok());

    EXPECT_FALSE(m_database->findPlugIn(record.value()->uuid()));
    EXPECT_FALSE(m_database->findPlugIn(record.value()->uuid()));
    EXPECT_EQ(m_database->cachedRecordCount(), 0u);
    EXPECT_EQ(m_log.count(format("ignoring mis-configured plug-in at %@: %{public}@", loose,
                  "plug-ins outside containing apps must be in /System")),
        2u);
}

TEST_F(OMDatabaseCache, LookupsByPathAndApplicationAskTheRegistrar)
{
    const Uuid a = registered("A");
    const Uuid b = registered("B");
    auto cached = m_database->findPlugIn(a);

    EXPECT_EQ(m_database->findPlugInAtPath(OMBundle::fileURL(m_app + "/PlugIns/A.appex")), cached);
    const std::string unknown = m_bundles.root() + "/Unknown.appex";
    EXPECT_FALSE(m_database->findPlugInAtPath(OMBundle::fileURL(unknown)));
    EXPECT_EQ(m_log.count(format("Registrar cannot find plug-in at path:%@", unknown)), 1u);
    EXPECT_FALSE(m_database->findPlugIn(Uuid::random()));

    auto within = m_database->plugInsWithinApplication(OMBundle::fileURL(m_app));
    ASSERT_TRUE(within);
    ASSERT_EQ(within->size(), 2u);
    EXPECT_EQ((*within)[0], cached);
    EXPECT_EQ((*within)[1]->registrationUuid(), b);
    EXPECT_FALSE(m_database->plugInsWithinApplication(OMBundle::fileURL(m_bundles.root() + "/Other.app")));
}

TEST_F(OMDatabaseCache, UninstallDropsRecordsBeforeTheDelegateHearsOfThem)
{
    struct Delegate : OMDatabaseDelegate {
        std::weak_ptr<OMDatabase> database;
        std::mutex mutex;
        std::vector<std::string> heard;
        size_t cachedWhenHeard = 99;
        void removedPlugIns(const RegistrarPlugInRecords& records) override
        {
            std::lock_guard lock(mutex);
            for (const auto& record : records)
                heard.push_back(*record->identifier());
            cachedWhenHeard = database.lock()->cachedRecordCount();
        }
    };
    auto delegate = std::make_shared<Delegate>();
    delegate->database = m_database;
    m_database->setDelegate(delegate);
    const Uuid cached = registered("Cached");
    registered("Uncached");
    ASSERT_TRUE(m_database->findPlugIn(cached));

    ASSERT_TRUE(m_registrar->unregisterPlugIn(m_app + "/PlugIns/Cached.appex").ok());
    ASSERT_TRUE(m_registrar->unregisterPlugIn(m_app + "/PlugIns/Uncached.appex").ok());
    m_registrar->waitForNotifications();

    std::lock_guard lock(delegate->mutex);
    EXPECT_EQ(delegate->heard, (std::vector<std::string> { "com.example.host.Cached", "com.example.host.Uncached" }));
    EXPECT_EQ(delegate->cachedWhenHeard, 0u);
    EXPECT_EQ(m_log.count(format("plug-in UNINSTALLED:%@ %@(%@) %{public}@ %@", "com.example.host.Cached",
                  "com.example.host.Cached", "1", Value::uuid(cached), m_app + "/PlugIns/Cached.appex")),
        1u);
}

// The UUID walker of "ready", "access" and "annotate": its refusals in order, and the handler
// called for each plug-in in the request's order.
class UuidListWalk : public InProcessRecord {
protected:
    std::optional<Value> walk(const Value& uuids, std::vector<Uuid>& handled)
    {
        std::future<Result<Value>> reply;
        auto transaction = nextTransaction(reply);
        DictionaryBuilder request(daemonRequest("ready"));
        if (!uuids.isNone())
            request.set("uuids", uuids);
        auto walker = std::make_shared<Transaction>(
            ConduitEvent { ConduitEvent::Kind::Message, request.build(), transaction->requestId() }, m_record);
        if (walker->processUuidList([&](const std::shared_ptr<OMDPlugIn>& plugIn) {
                handled.push_back(plugIn->registrationUuid());
                return true;
            }))
            walker->done();
        if (reply.wait_for(kReplyTimeout) != std::future_status::ready)
            return std::nullopt;
        auto result = reply.get();
        return result.ok() ? std::optional<Value>(result.value()) : std::nullopt;
    }
    static Value daemonRequest(std::string_view name) { return request(name); }
};

TEST_F(UuidListWalk, RefusesBadListsAndWalksGoodOnesInOrder)
{
    BundleFixture bundles;
    const std::string app = bundles.makeApp("Host", "com.example.host");
    std::vector<Uuid> known;
    for (const char* name : { "A", "B" }) {
        auto record = m_registrar->registerPlugIn(
            bundles.makePlugIn(app, name, std::string("com.example.") + name, "com.example.point"));
        ASSERT_TRUE(record.ok());
        known.push_back(record.value()->uuid());
    }
    struct Case {
        const char* name;
        Value uuids;
        const char* error; // null: success
        size_t handled;
    };
    const Case cases[] = {
        { "absent", Value(), "invalid request format (uuid)", 0 },
        { "not an array", Value::uuid(known[0]), "invalid request format (uuid)", 0 },
        { "a string element", Value::array({ Value::uuid(known[0]), Value(known[1].string()) }),
            "invalid request (bad uuid array)", 1 },
        { "an unknown uuid", Value::array({ Value::uuid(known[1]), Value::uuid(Uuid::random()) }),
            "no such plugin (uuid not found)", 1 },
        { "empty", Value::array({}), nullptr, 0 },
        { "both, reversed", Value::array({ Value::uuid(known[1]), Value::uuid(known[0]) }), nullptr, 2 },
    };
    for (const auto& test : cases) {
        std::vector<Uuid> handled;
        auto reply = walk(test.uuids, handled);
        ASSERT_TRUE(reply) << test.name;
        EXPECT_EQ(handled.size(), test.handled) << test.name;
        if (test.error) {
            EXPECT_EQ((*reply)["errorcode"].asUInt64(), 4u) << test.name;
            EXPECT_EQ(*reply->stringFor("error"), test.error) << test.name;
        } else {
            EXPECT_EQ(*reply, Value::dictionary({})) << test.name;
        }
        if (test.handled == 2) {
            EXPECT_EQ(handled, (std::vector<Uuid> { known[1], known[0] }));
        }
    }
}

} // namespace
} // namespace om::test
