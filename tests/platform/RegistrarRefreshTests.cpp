#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>

#include "platform/Log.h"
#include "tests/platform/RegistrarTestSupport.h"
#include "tests/support/ChildProcess.h"

using om::DictionaryBuilder;
using om::Value;

namespace {

namespace fs = std::filesystem;

const std::string kEntitle = std::string(OM_SOURCE_DIR) + "/scripts/entitle";
const std::string kPeer = std::string(OM_BINARY_DIR) + "/tests/om_test_peer";

class RegistrarRefresh : public om::test::RegistrarTest { };

TEST_F(RegistrarRefresh, UnchangedBundleIsANoOp)
{
    std::string path = bundle("a.appex", plugIn("com.orvex.a", "p"));
    auto first = registered(path);
    workspace()->waitForNotifications();
    auto observer = observe();
    const std::string database = contentsOf(configuration().databasePath + "-wal");

    auto again = registered(path + "/");
    workspace()->waitForNotifications();
    EXPECT_EQ(again, first) << "the very record comes back";
    EXPECT_EQ(observer->transcript(), "");
    EXPECT_EQ(contentsOf(configuration().databasePath + "-wal"), database) << "nothing was written";
}

TEST_F(RegistrarRefresh, ChangedBundleIsUninstalledThenInstalledWithItsUuid)
{
    std::string path = bundle("a.appex", plugIn("com.orvex.a", "p"));
    auto first = registered(path);
    workspace()->waitForNotifications();
    auto observer = observe();
    bool oldStillRegistered = false;
    observer->onUninstall = [&](const om::RegistrarPlugInRecords& records) {
        oldStillRegistered = workspace()->plugInWithUuid(records[0]->uuid()) == first;
    };

    bundle("a.appex", plugIn("com.orvex.a", "p", Value::dictionary({ { "Changed", true } })));
    auto second = registered(path);
    workspace()->waitForNotifications();
    ASSERT_TRUE(first && second);
    EXPECT_EQ(second->uuid(), first->uuid());
    EXPECT_TRUE(second->plugInDictionary()["Changed"] == Value(true));
    EXPECT_GE(*second->registrationDate(), *first->registrationDate());
    EXPECT_EQ(observer->transcript(), "-com.orvex.a +com.orvex.a");
    EXPECT_TRUE(oldStillRegistered);
    EXPECT_EQ(observer->events()[0].records[0], first);
    EXPECT_EQ(observer->events()[1].records[0], second);
    EXPECT_EQ(workspace()->plugInAtPath(path), second);
    EXPECT_EQ(workspace()->plugInCount(), 1u);
}

TEST_F(RegistrarRefresh, ChangedIdentifierIsANewRegistration)
{
    std::string path = bundle("a.appex", plugIn("com.orvex.a", "p"));
    auto first = registered(path);
    workspace()->waitForNotifications();
    auto observer = observe();

    bundle("a.appex", plugIn("com.orvex.renamed", "p"));
    auto second = registered(path);
    workspace()->waitForNotifications();
    ASSERT_TRUE(first && second);
    EXPECT_NE(second->uuid(), first->uuid());
    EXPECT_EQ(observer->transcript(), "-com.orvex.a +com.orvex.renamed");
    EXPECT_FALSE(workspace()->plugInWithUuid(first->uuid()));
    EXPECT_EQ(workspace()->plugInWithUuid(second->uuid()), second);
}

TEST_F(RegistrarRefresh, UnregisteringFindsThePathAsGivenOrCanonical)
{
    std::string path = bundle("dir/a.appex", plugIn("com.orvex.a", "p"));
    fs::create_symlink(m_bundles.root() + "/dir", m_bundles.root() + "/link");
    ASSERT_TRUE(registered(m_bundles.root() + "/link/a.appex"));
    EXPECT_TRUE(workspace()->plugInAtPath(path));

    // Through the link (canonical form) even after the bundle has gone from the disk.
    fs::remove_all(path);
    ASSERT_TRUE(workspace()->unregisterPlugIn(m_bundles.root() + "/link/a.appex/").ok());
    EXPECT_FALSE(workspace()->plugInAtPath(path));
    auto again = workspace()->unregisterPlugIn(path);
    ASSERT_FALSE(again.ok());
    EXPECT_EQ(again.error().code(), om::kRegistrarErrorNotRegistered);
}

TEST_F(RegistrarRefresh, BatchRegistrationAnswersEachPathInOrder)
{
    std::string a = bundle("a.appex", plugIn("com.orvex.a", "p"));
    std::string b = bundle("b.appex", plugIn("com.orvex.b", "p"));
    auto observer = observe();
    auto results = workspace()->registerPlugIns({ a, m_bundles.root() + "/missing.appex", b, a + "/" });
    ASSERT_EQ(results.size(), 4u);
    EXPECT_TRUE(results[0].ok());
    EXPECT_FALSE(results[1].ok());
    EXPECT_TRUE(results[2].ok());
    EXPECT_FALSE(results[3].ok()) << "one path twice in one batch";
    workspace()->waitForNotifications();
    ASSERT_EQ(observer->events().size(), 1u) << "one commit, one notification";
    EXPECT_EQ(observer->transcript(), "+com.orvex.a +com.orvex.b");
    EXPECT_LT(results[0].value()->sequence(), results[2].value()->sequence());

    // Plug-ins of one application share its record, within a batch and after it.
    std::string app = m_bundles.makeApp("Notes", "com.orvex.notes");
    auto inApp = workspace()->registerPlugIns({ bundle("Notes.app/PlugIns/c.appex", plugIn("com.orvex.c", "p")),
        bundle("Notes.app/PlugIns/d.appex", plugIn("com.orvex.d", "p")) });
    ASSERT_TRUE(inApp[0].ok() && inApp[1].ok());
    EXPECT_EQ(inApp[0].value()->containingApp(), inApp[1].value()->containingApp());
    auto later = registered(bundle("Notes.app/PlugIns/e.appex", plugIn("com.orvex.e", "p")));
    ASSERT_TRUE(later);
    EXPECT_EQ(later->containingApp(), inApp[0].value()->containingApp());
    EXPECT_EQ(workspace()->applicationAtPath(app), later->containingApp());
}

class RegistrarEntitlements : public om::test::RegistrarTest {
protected:
    // A plug-in whose executable is a real ELF file carrying entitlements.
    std::string entitledPlugIn(const std::string& name, const Value& entitlements)
    {
        std::string path = bundle(name + ".appex",
            DictionaryBuilder(plugIn("com.orvex." + name, "p")).set("VBBundleExecutable", "tool").build());
        fs::remove(path + "/tool");
        fs::copy_file(kPeer, path + "/tool");
        ::chmod((path + "/tool").c_str(), 0755);
        EXPECT_EQ(om::test::ChildProcess::run({ kEntitle, path + "/tool",
                      m_bundles.writeFile(name + ".entitlements", om::Vlist::writeXml(entitlements)) }),
            0);
        return path;
    }
};

TEST_F(RegistrarEntitlements, CountOnlyFromAnExecutableNobodyElseMayWrite)
{
    const Value granted = Value::dictionary({ { "com.orvex.developer.auto-elect-plugin", true } });
    auto trusted = registered(entitledPlugIn("trusted", granted));
    ASSERT_TRUE(trusted);
    EXPECT_EQ(trusted->entitlements(), granted);

    om::Log::Capture capture;
    for (mode_t mode : { 0775, 0757 }) {
        std::string path = entitledPlugIn("writable" + std::to_string(mode), granted);
        ::chmod((path + "/tool").c_str(), mode);
        auto record = registered(path);
        ASSERT_TRUE(record);
        EXPECT_TRUE(record->entitlements().isNone()) << std::oct << mode;
    }
    auto records = capture.records();
    EXPECT_EQ(std::count_if(records.begin(), records.end(),
                  [](const auto& record) { return record.message.find("may not grant") != std::string::npos; }),
        2);
}

TEST_F(RegistrarEntitlements, OwnerOtherThanRootOrUsGrantsNothing)
{
    if (::geteuid() != 0)
        GTEST_SKIP() << "only root can give a file away";
    std::string path = entitledPlugIn("foreign", Value::dictionary({ { "e", true } }));
    ASSERT_EQ(::chown((path + "/tool").c_str(), 65534, 65534), 0);
    auto record = registered(path);
    ASSERT_TRUE(record);
    EXPECT_TRUE(record->entitlements().isNone());
}

TEST_F(RegistrarEntitlements, MissingOrDamagedExecutableGrantsNothingAndIsLogged)
{
    om::Log::Capture capture;
    std::string missing = bundle(
        "missing.appex", DictionaryBuilder(plugIn("com.orvex.missing", "p")).set("VBBundleExecutable", "tool").build());
    fs::remove(missing + "/tool");
    std::string damaged = entitledPlugIn("damaged", Value::dictionary({ { "e", true } }));
    ASSERT_EQ(om::test::ChildProcess::run({ kEntitle, damaged + "/tool",
                  m_bundles.writeFile("bad.vlist", "<vlist version=\"1\"><dict><key>a</key></dict></vlist>") }),
        0);

    for (const std::string& path : { missing, damaged }) {
        auto record = registered(path);
        ASSERT_TRUE(record);
        EXPECT_TRUE(record->entitlements().isNone());
    }
    EXPECT_TRUE(capture.waitUntil([](const std::vector<om::Log::Record>& records) {
        return std::count_if(records.begin(), records.end(), [](const om::Log::Record& record) {
            return record.category == "registrar" && record.message.find("no entitlements") != std::string::npos;
        }) >= 2;
    }));
}

TEST_F(RegistrarEntitlements, ChangedEntitlementsAreAChange)
{
    std::string path = entitledPlugIn("grown", Value::dictionary({ { "first", true } }));
    auto first = registered(path);
    workspace()->waitForNotifications();
    auto observer = observe();
    ASSERT_EQ(
        om::test::ChildProcess::run({ kEntitle, path + "/tool",
            m_bundles.writeFile("second.vlist", om::Vlist::writeXml(Value::dictionary({ { "second", true } }))) }),
        0);
    auto second = registered(path);
    workspace()->waitForNotifications();
    ASSERT_TRUE(first && second);
    EXPECT_EQ(second->entitlements(), Value::dictionary({ { "second", true } }));
    EXPECT_EQ(second->uuid(), first->uuid());
    EXPECT_EQ(observer->transcript(), "-com.orvex.grown +com.orvex.grown");
}

} // namespace
