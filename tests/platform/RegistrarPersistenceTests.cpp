#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>

#include "platform/Log.h"
#include "platform/UniqueFd.h"
#include "tests/platform/RegistrarTestSupport.h"

#include <sqlite3.h>

using om::RegistrarWorkspace;
using om::Value;

namespace {

namespace fs = std::filesystem;

class RegistrarPersistence : public om::test::RegistrarTest {
protected:
    void runSql(const std::string& sql)
    {
        sqlite3* database = nullptr;
        ASSERT_EQ(sqlite3_open(configuration().databasePath.c_str(), &database), SQLITE_OK);
        EXPECT_EQ(sqlite3_exec(database, sql.c_str(), nullptr, nullptr, nullptr), SQLITE_OK)
            << sqlite3_errmsg(database);
        sqlite3_close(database);
    }

    // Opening must fail, say why with the file's name, log it once, and leave every byte as it was.
    void expectRefusedUntouched(const std::string& because)
    {
        const std::string path = configuration().databasePath;
        const std::string before = contentsOf(path);
        om::Log::Capture capture;
        auto opened = RegistrarWorkspace::open(configuration(), RegistrarWorkspace::Access::ReadWrite);
        ASSERT_FALSE(opened.ok());
        const std::string description = opened.error().localizedDescription();
        EXPECT_NE(description.find(path), std::string::npos) << description;
        EXPECT_NE(description.find(because), std::string::npos) << description;
        EXPECT_EQ(opened.error().code(), om::kRegistrarErrorDatabase);
        auto records = capture.records();
        EXPECT_EQ(std::count_if(records.begin(), records.end(),
                      [](const auto& record) { return record.level == om::LogLevel::Error; }),
            1);
        EXPECT_EQ(contentsOf(path), before);
        EXPECT_FALSE(RegistrarWorkspace::open(configuration(), RegistrarWorkspace::Access::ReadOnly).ok());
        EXPECT_EQ(contentsOf(path), before);
    }
};

TEST_F(RegistrarPersistence, ReopenedWorkspaceHoldsTheSameRecords)
{
    std::string app = m_bundles.makeApp("Notes", "com.orvex.notes");
    registered(bundle("Notes.app/PlugIns/b.appex", plugIn("com.orvex.b", "p")));
    registered(
        bundle("a.appex", plugIn("com.orvex.a", "p", Value::dictionary({ { "QSExtensionProtocol", "#Data" } }))));
    registered(bundle("Notes.app/PlugIns/c.appex", plugIn("com.orvex.c", "p")));
    auto before = workspace()->allPlugIns();
    m_workspace.reset();

    auto reopened = open();
    auto after = reopened->allPlugIns();
    ASSERT_EQ(after.size(), before.size());
    for (size_t i = 0; i < before.size(); ++i) {
        SCOPED_TRACE(*before[i]->identifier());
        EXPECT_EQ(after[i]->uuid(), before[i]->uuid());
        EXPECT_EQ(after[i]->bundlePath(), before[i]->bundlePath());
        EXPECT_EQ(after[i]->identifier(), before[i]->identifier());
        EXPECT_EQ(after[i]->registrationDate(), before[i]->registrationDate());
        EXPECT_EQ(after[i]->dataContainerPath(), before[i]->dataContainerPath());
        EXPECT_EQ(after[i]->infoDictionary(), before[i]->infoDictionary());
        EXPECT_EQ(after[i]->entitlements(), before[i]->entitlements());
        EXPECT_EQ(after[i]->sequence(), before[i]->sequence());
        EXPECT_EQ(bool(after[i]->containingApp()), bool(before[i]->containingApp()));
    }
    EXPECT_EQ(reopened->plugInsOfApplication(app).size(), 2u);
    EXPECT_EQ(after[0]->containingApp(), after[2]->containingApp()) << "one record per application";

    // Registrations made after a reopen still come last.
    auto later = reopened->registerPlugIn(bundle("d.appex", plugIn("com.orvex.d", "p")));
    ASSERT_TRUE(later.ok());
    EXPECT_GT(later.value()->sequence(), after.back()->sequence());
}

TEST_F(RegistrarPersistence, SdkEntryChangedWhileClosedIsMergedAtOpen)
{
    registered(bundle("a.appex", plugIn("com.orvex.a", "com.orvex.share")));
    m_workspace.reset();
    writeSdkEntry("com.orvex.share", Value::dictionary({ { "Added", "later" } }));
    auto reopened = open();
    ASSERT_EQ(reopened->plugInCount(), 1u);
    EXPECT_EQ(reopened->allPlugIns()[0]->lookup("Added", om::RegistrarScope::Info), Value("later"));
}

TEST_F(RegistrarPersistence, RegistrationSurvivesKillRightAfterItReturns)
{
    std::string path = bundle("a.appex", plugIn("com.orvex.durable", "p"));
    int report[2];
    int hold[2];
    ASSERT_EQ(::pipe2(report, O_CLOEXEC), 0);
    ASSERT_EQ(::pipe2(hold, O_CLOEXEC), 0);
    // No workspace (and so no thread) exists in this process yet: the child may use the library.
    pid_t child = ::fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        ::close(report[0]);
        ::close(hold[1]);
        auto opened = RegistrarWorkspace::open(configuration(), RegistrarWorkspace::Access::ReadWrite);
        auto record = opened.ok() ? opened.value()->registerPlugIn(path) : opened.error();
        if (!record.ok())
            ::_exit(1);
        (void)!::write(report[1], record.value()->uuid().bytes().data(), 16);
        char byte;
        (void)!::read(hold[0], &byte, 1); // killed while waiting here
        ::_exit(2);
    }
    ::close(report[1]);
    ::close(hold[0]);
    om::Uuid::Bytes uuid {};
    pollfd readable { .fd = report[0], .events = POLLIN, .revents = 0 };
    ASSERT_EQ(::poll(&readable, 1, 60'000), 1);
    ASSERT_EQ(::read(report[0], uuid.data(), uuid.size()), 16);
    ::kill(child, SIGKILL);
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_TRUE(WIFSIGNALED(status));
    ::close(report[0]);
    ::close(hold[1]);

    auto record = workspace()->plugInWithUuid(om::Uuid(uuid));
    ASSERT_TRUE(record);
    EXPECT_EQ(record->bundlePath(), path);
}

TEST_F(RegistrarPersistence, RegistrationThatNoLongerDecodesIsLeftOutUntilRegisteredAgain)
{
    std::string b = bundle("b.appex", plugIn("com.orvex.b", "p"));
    registered(bundle("a.appex", plugIn("com.orvex.a", "p")));
    registered(b);
    registered(bundle("c.appex", plugIn("com.orvex.c", "p")));
    m_workspace.reset();
    runSql("UPDATE registrations SET info = x'766c73743100ff' WHERE identifier = 'com.orvex.b'");

    om::Log::Capture capture;
    EXPECT_EQ(workspace()->plugInCount(), 2u);
    EXPECT_TRUE(capture.waitFor(
        "registrar database " + configuration().databasePath + ": registration 2 does not decode; left out"));
    auto again = workspace()->registerPlugIn(b);
    ASSERT_TRUE(again.ok()) << again.error().localizedDescription();
    EXPECT_GT(again.value()->sequence(), 3u) << "above the row that was left out";
    m_workspace.reset();

    auto reopened = open();
    ASSERT_EQ(reopened->plugInCount(), 3u);
    EXPECT_EQ(reopened->allPlugIns().back()->identifier(), "com.orvex.b");
}

TEST_F(RegistrarPersistence, DamagedDatabaseIsRefusedUntouched)
{
    for (char name : { 'a', 'b', 'c', 'd', 'e', 'f' })
        registered(bundle(std::string(1, name) + ".appex", plugIn(std::string("com.orvex.") + name, "p")));
    m_workspace.reset(); // the last connection folds the log back into the file
    ASSERT_FALSE(fs::exists(configuration().databasePath + "-wal"));

    // Scribble over the second page, the registrations table's root.
    {
        om::UniqueFd file(::open(configuration().databasePath.c_str(), O_WRONLY | O_CLOEXEC));
        const std::string garbage(512, '\xA5');
        ASSERT_EQ(::pwrite(file.get(), garbage.data(), garbage.size(), 4096), ssize_t(garbage.size()));
    }
    expectRefusedUntouched("damaged");
}

TEST_F(RegistrarPersistence, FileThatIsNoDatabaseIsRefusedUntouched)
{
    m_bundles.writeFile("state/registrar.db", std::string(8192, 'x'));
    expectRefusedUntouched("not a database");
}

TEST_F(RegistrarPersistence, NewerSchemaIsRefusedUntouched)
{
    registered(bundle("a.appex", plugIn("com.orvex.a", "p")));
    m_workspace.reset();
    runSql("PRAGMA user_version = 99");
    expectRefusedUntouched("schema version 99 is newer");
}

TEST_F(RegistrarPersistence, SomebodyElsesDatabaseIsRefusedUntouched)
{
    m_bundles.makeDirectory("state");
    runSql("CREATE TABLE notes (text TEXT)");
    expectRefusedUntouched("not a Registrar database");
}

TEST_F(RegistrarPersistence, ReadOnlyOpenNeitherCreatesNorWrites)
{
    auto missing = RegistrarWorkspace::open(configuration(), RegistrarWorkspace::Access::ReadOnly);
    ASSERT_FALSE(missing.ok());
    EXPECT_NE(missing.error().localizedDescription().find("No such file"), std::string::npos);
    EXPECT_FALSE(fs::exists(configuration().databasePath));
    EXPECT_FALSE(fs::exists(fs::path(configuration().databasePath).parent_path()));
}

TEST_F(RegistrarPersistence, ReadOnlyOpenSeesWhatTheWriterCommitted)
{
    auto first = registered(bundle("a.appex", plugIn("com.orvex.a", "p")));
    auto reader = open(RegistrarWorkspace::Access::ReadOnly);
    ASSERT_TRUE(reader && first);
    ASSERT_EQ(reader->plugInCount(), 1u);
    EXPECT_EQ(reader->allPlugIns()[0]->uuid(), first->uuid());

    // The writer goes on while the reader holds the file open.
    auto second = registered(bundle("b.appex", plugIn("com.orvex.b", "p")));
    ASSERT_TRUE(second);
    auto laterReader = open(RegistrarWorkspace::Access::ReadOnly);
    EXPECT_EQ(laterReader->plugInCount(), 2u);
    EXPECT_EQ(reader->plugInCount(), 1u) << "a read-only workspace is a snapshot of its open";
}

} // namespace

namespace {

TEST_F(RegistrarPersistence, DefaultWorkspaceOpensFromTheEnvironmentOnce)
{
    const auto wanted = configuration();
    ::setenv("REGISTRAR_DB", wanted.databasePath.c_str(), 1);
    ::setenv("REGISTRAR_SDK_DIR", wanted.sdkDirectory.c_str(), 1);
    ::setenv("REGISTRAR_CONTAINERS", wanted.containersDirectory.c_str(), 1);
    const auto fromEnvironment = RegistrarWorkspace::Configuration::fromEnvironment();
    EXPECT_EQ(fromEnvironment.databasePath, wanted.databasePath);
    EXPECT_EQ(fromEnvironment.sdkDirectory, wanted.sdkDirectory);
    EXPECT_EQ(fromEnvironment.containersDirectory, wanted.containersDirectory);

    RegistrarWorkspace::setDefaultWorkspace(nullptr);
    auto first = RegistrarWorkspace::defaultWorkspace();
    auto second = RegistrarWorkspace::defaultWorkspace();
    ASSERT_TRUE(first.ok() && second.ok());
    EXPECT_EQ(first.value(), second.value());
    EXPECT_EQ(first.value()->configuration().databasePath, wanted.databasePath);
    EXPECT_TRUE(fs::exists(wanted.databasePath));

    auto own = open();
    RegistrarWorkspace::setDefaultWorkspace(own);
    EXPECT_EQ(RegistrarWorkspace::defaultWorkspace().value(), own);
    RegistrarWorkspace::setDefaultWorkspace(nullptr);
    for (const char* name : { "REGISTRAR_DB", "REGISTRAR_SDK_DIR", "REGISTRAR_CONTAINERS" })
        ::unsetenv(name);

    // Without settings: a system instance's locations for root, the user's data home otherwise.
    const char* dataHome = std::getenv("XDG_DATA_HOME");
    const std::string savedDataHome = dataHome ? dataHome : "";
    ::setenv("XDG_DATA_HOME", m_bundles.root().c_str(), 1);
    const auto defaults = RegistrarWorkspace::Configuration::fromEnvironment();
    const bool root = ::geteuid() == 0;
    EXPECT_EQ(defaults.databasePath, root ? "/var/lib/omd/registrar.db" : m_bundles.root() + "/omd/registrar.db");
    EXPECT_EQ(defaults.containersDirectory, root ? "/var/lib/omd/containers" : m_bundles.root() + "/omd/containers");
    EXPECT_EQ(defaults.sdkDirectory, "/usr/share/omd/sdk");
    if (dataHome)
        ::setenv("XDG_DATA_HOME", savedDataHome.c_str(), 1);
    else
        ::unsetenv("XDG_DATA_HOME");
}

} // namespace
