#include <atomic>
#include <thread>

#include "tests/platform/RegistrarTestSupport.h"

using om::RegistrarPlugInRecords;
using om::Value;

namespace {

class RegistrarNotification : public om::test::RegistrarTest { };

TEST_F(RegistrarNotification, InstallsArriveInOrderAfterTheirCommit)
{
    auto observer = observe();
    std::vector<bool> foundWhenHeard;
    observer->onInstall = [&](const RegistrarPlugInRecords& records) {
        for (const auto& record : records)
            foundWhenHeard.push_back(workspace()->plugInWithUuid(record->uuid()) == record);
    };
    for (const char* name : { "a", "b", "c", "d" })
        registered(bundle(std::string(name) + ".appex", plugIn(std::string("com.orvex.") + name, "p")));
    workspace()->waitForNotifications();
    EXPECT_EQ(observer->transcript(), "+com.orvex.a +com.orvex.b +com.orvex.c +com.orvex.d");
    EXPECT_EQ(foundWhenHeard, std::vector<bool>(4, true));
}

TEST_F(RegistrarNotification, UninstallIsHeardWhileStillRegisteredAndGoneAfter)
{
    std::string path = bundle("a.appex", plugIn("com.orvex.a", "p"));
    auto record = registered(path);
    workspace()->waitForNotifications();
    auto observer = observe();
    bool byUuid = false;
    bool byPath = false;
    observer->onUninstall = [&](const RegistrarPlugInRecords& records) {
        byUuid = workspace()->plugInWithUuid(records[0]->uuid()) == record;
        byPath = workspace()->plugInAtPath(path) == record;
    };
    ASSERT_TRUE(workspace()->unregisterPlugIn(path).ok());
    EXPECT_TRUE(byUuid);
    EXPECT_TRUE(byPath);
    EXPECT_FALSE(workspace()->plugInWithUuid(record->uuid()));
    EXPECT_FALSE(workspace()->plugInAtPath(path));
    EXPECT_EQ(observer->transcript(), "-com.orvex.a");
    EXPECT_EQ(open(om::RegistrarWorkspace::Access::ReadOnly)->plugInCount(), 0u);
}

TEST_F(RegistrarNotification, EveryObserverReturnsBeforeTheRegistrationGoes)
{
    std::string path = bundle("a.appex", plugIn("com.orvex.a", "p"));
    registered(path);
    workspace()->waitForNotifications();
    auto first = observe();
    auto second = observe();
    std::atomic<int> returned = 0;
    first->onUninstall = [&](const RegistrarPlugInRecords&) { ++returned; };
    second->onUninstall = [&](const RegistrarPlugInRecords&) { ++returned; };
    ASSERT_TRUE(workspace()->unregisterPlugIn(path).ok());
    EXPECT_EQ(returned, 2);
}

TEST_F(RegistrarNotification, ObserverMayChangeTheRegistryFromItsNotification)
{
    std::string a = bundle("a.appex", plugIn("com.orvex.a", "p"));
    std::string b = bundle("b.appex", plugIn("com.orvex.b", "p"));
    auto observer = observe();
    // Installing a takes it straight out again; uninstalling it takes b along.
    observer->onInstall = [&](const RegistrarPlugInRecords& records) {
        if (records[0]->identifier() == "com.orvex.a") {
            EXPECT_TRUE(workspace()->unregisterPlugIn(a).ok());
        }
    };
    observer->onUninstall = [&](const RegistrarPlugInRecords& records) {
        if (records[0]->identifier() == "com.orvex.a") {
            EXPECT_TRUE(workspace()->unregisterPlugIn(b).ok());
        }
    };
    registered(b);
    registered(a);
    workspace()->waitForNotifications();
    EXPECT_EQ(observer->transcript(), "+com.orvex.b +com.orvex.a -com.orvex.a -com.orvex.b");
    EXPECT_EQ(workspace()->plugInCount(), 0u);
}

TEST_F(RegistrarNotification, UninstallFromAnotherThreadWaitsForTheObserver)
{
    std::string path = bundle("a.appex", plugIn("com.orvex.a", "p"));
    registered(path);
    workspace()->waitForNotifications();
    auto observer = observe();
    std::mutex mutex;
    std::condition_variable changed;
    bool entered = false;
    bool release = false;
    observer->onUninstall = [&](const RegistrarPlugInRecords&) {
        std::unique_lock lock(mutex);
        entered = true;
        changed.notify_all();
        changed.wait(lock, [&] { return release; });
    };
    std::atomic<bool> done = false;
    std::thread remover([&] {
        EXPECT_TRUE(workspace()->unregisterPlugIn(path).ok());
        done = true;
    });
    {
        std::unique_lock lock(mutex);
        changed.wait(lock, [&] { return entered; });
    }
    // The observer is parked: lookups still answer, and the registration is still there.
    EXPECT_TRUE(workspace()->plugInAtPath(path));
    EXPECT_EQ(workspace()->query(Value::dictionary({}), {}).size(), 1u);
    EXPECT_FALSE(done);
    {
        std::lock_guard lock(mutex);
        release = true;
    }
    changed.notify_all();
    remover.join();
    EXPECT_TRUE(done);
    EXPECT_FALSE(workspace()->plugInAtPath(path));
}

TEST_F(RegistrarNotification, DroppedObserverHearsNothingMore)
{
    auto observer = observe();
    std::weak_ptr<om::test::RecordingObserver> weak = observer;
    m_observers.clear();
    observer.reset();
    EXPECT_TRUE(weak.expired());
    auto kept = observe();
    registered(bundle("a.appex", plugIn("com.orvex.a", "p")));
    workspace()->waitForNotifications();
    EXPECT_EQ(kept->transcript(), "+com.orvex.a");
}

class RegistrarConcurrency : public om::test::RegistrarTest { };

TEST_F(RegistrarConcurrency, LookupsRunWhileManyThreadsRegister)
{
    constexpr int kWriters = 4;
    constexpr int kPerWriter = 12;
    std::vector<std::vector<std::string>> paths(kWriters);
    for (int writer = 0; writer < kWriters; ++writer) {
        for (int i = 0; i < kPerWriter; ++i) {
            std::string name = "w" + std::to_string(writer) + "-" + std::to_string(i);
            paths[writer].push_back(
                bundle(name + ".appex", plugIn("com.orvex." + name, "com.orvex.point" + std::to_string(i % 3))));
        }
    }
    auto space = workspace();
    auto observer = observe();
    std::atomic<int> writing = kWriters;
    std::vector<std::thread> threads;
    for (int writer = 0; writer < kWriters; ++writer) {
        threads.emplace_back([&, writer] {
            for (size_t i = 0; i < paths[writer].size(); ++i) {
                EXPECT_TRUE(space->registerPlugIn(paths[writer][i]).ok());
                if (i % 4 == 3) {
                    EXPECT_TRUE(space->unregisterPlugIn(paths[writer][i]).ok());
                }
            }
            --writing;
        });
    }
    for (int reader = 0; reader < 4; ++reader) {
        threads.emplace_back([&] {
            size_t last = 0;
            while (writing > 0) {
                for (const auto& record : space->allPlugIns()) {
                    EXPECT_TRUE(record->identifier());
                    (void)space->plugInWithUuid(record->uuid());
                    (void)space->plugInAtPath(*record->bundlePath());
                }
                auto selected
                    = space->query(Value::dictionary({ { "QSExtensionPointIdentifier", "com.orvex.point1" } }),
                        [](const std::string& identifier, const Value&) { return !identifier.empty(); });
                for (size_t i = 1; i < selected.size(); ++i)
                    EXPECT_LT(selected[i - 1]->sequence(), selected[i]->sequence());
                last = space->plugInCount();
            }
            (void)last;
        });
    }
    for (auto& thread : threads)
        thread.join();
    space->waitForNotifications();

    EXPECT_EQ(space->plugInCount(), size_t(kWriters * kPerWriter * 3 / 4));
    EXPECT_EQ(open(om::RegistrarWorkspace::Access::ReadOnly)->plugInCount(), space->plugInCount());
    size_t installs = 0;
    size_t uninstalls = 0;
    for (const auto& event : observer->events())
        (event.kind == '+' ? installs : uninstalls) += event.records.size();
    EXPECT_EQ(installs, size_t(kWriters * kPerWriter));
    EXPECT_EQ(uninstalls, size_t(kWriters * kPerWriter / 4));
}

} // namespace
