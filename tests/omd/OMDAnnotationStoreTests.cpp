// The annotation store on real files: what loads and what resets (and how the bad file is kept),
// the merge of a change into an entry, the file's exact form and mode, a save that fails, and the
// migration of the shared table on a multi-user device (a daemon run as another user).
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <memory>
#include <string>
#include <vector>

#include "Ombrel/OMBundle.h"
#include "omd/OMDAnnotationStore.h"
#include "omd/OMDPlugIn.h"
#include "platform/Format.h"
#include "platform/Log.h"
#include "platform/Vlist.h"
#include "tests/support/BundleFixture.h"
#include "tests/support/DaemonProcess.h"

namespace om::test {
namespace {

namespace fs = std::filesystem;

constexpr std::string_view kResetPrefix = "unable to load annotation database:";
constexpr std::string_view kResetSuffix = " (resetting)";

std::string readBytes(const std::string& path)
{
    std::ifstream in(path, std::ios::binary);
    return { std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>() };
}

Value table(std::vector<Value::Entry> entries)
{
    return Value::dictionary({ { "version", Value(16) }, { "data", Value::dictionary(std::move(entries)) } });
}

Value election(int number)
{
    return Value::dictionary({ { "election", number } });
}

std::vector<Log::Record> recordsAt(const Log::Capture& log, LogLevel level)
{
    std::vector<Log::Record> found;
    for (const auto& record : log.records()) {
        if (record.level == level && record.subsystem == "com.orvex.Ombrel")
            found.push_back(record);
    }
    return found;
}

// The names in directory that are copies of an unreadable database.
std::vector<std::string> keptCopies(const std::string& directory)
{
    std::vector<std::string> names;
    for (const auto& entry : fs::directory_iterator(directory)) {
        const std::string name = entry.path().filename();
        if (name.find(".unreadable-") != std::string::npos)
            names.push_back(entry.path());
    }
    return names;
}

std::shared_ptr<OMDPlugIn> plugIn(const std::string& identifier, const Value& entitlements = Value())
{
    RegistrarPlugInRecord::Facts facts;
    facts.uuid = Uuid::random();
    facts.bundlePath = "/Applications/Notes.app/PlugIns/" + identifier + ".appex";
    facts.identifier = identifier;
    facts.originalIdentifier = identifier;
    facts.plugInDictionary = Value::dictionary({
        { "QSExtensionPointIdentifier", "com.orvex.share-services" },
        { "QSExtensionAttributes", Value::dictionary({ { "QSExtensionVersion", "1" } }) },
    });
    facts.infoDictionary = Value::dictionary({ { "QSExtension", facts.plugInDictionary } });
    facts.containingApp = std::make_shared<RegistrarAppRecord>(
        RegistrarAppRecord::Facts { "/Applications/Notes.app", "com.example.notes", "Notes" });
    facts.dataContainerPath = "/var/lib/omd/containers/" + identifier;
    facts.entitlements = entitlements;
    return OMDPlugIn::initWithRGData(std::make_shared<RegistrarPlugInRecord>(std::move(facts)));
}

class OMDAnnotationStoreTest : public ::testing::Test {
protected:
    std::string path() const { return m_files.root() + "/db/annotations"; }
    std::string directory() const { return m_files.root() + "/db"; }

    void write(std::string_view contents) const { BundleFixture::writeFileAt(path(), contents, 0600); }

    std::shared_ptr<OMDAnnotationStore> open() const { return OMDAnnotationStore::initWithDatabase(path()); }

    // The file as any vlist reader sees it.
    Value onDisk() const
    {
        auto parsed = Vlist::readFile(path());
        EXPECT_TRUE(parsed.ok()) << (parsed.ok() ? "" : parsed.error().localizedDescription());
        return parsed.ok() ? *parsed : Value();
    }

    BundleFixture m_files;
};

TEST_F(OMDAnnotationStoreTest, MissingFileIsSilentEmptyAndNotWritten)
{
    fs::create_directories(directory());
    Log::Capture log;
    auto store = open();
    ASSERT_TRUE(store);
    EXPECT_EQ(store->annotations(), Value::dictionary({}));
    EXPECT_EQ(store->annotationsURL(), OMBundle::fileURL(path()));
    EXPECT_TRUE(recordsAt(log, LogLevel::Error).empty());
    EXPECT_EQ(log.count("migrating shared annotations"), 0u);
    EXPECT_FALSE(fs::exists(path()));
    EXPECT_TRUE(fs::is_empty(directory()));
}

TEST_F(OMDAnnotationStoreTest, CurrentVersionLoadsInEitherForm)
{
    const Value expected = table({ { "com.example.a", election(1) },
        { "com.example.b", Value::dictionary({ { "extension", Value::dictionary({ { "k", "v" } }) } }) } });
    for (bool binary : { false, true }) {
        if (binary) {
            const auto bytes = Vlist::writeBinary(expected);
            write(std::string(bytes.begin(), bytes.end()));
        } else {
            write(Vlist::writeXml(expected));
        }
        Log::Capture log;
        auto store = open();
        EXPECT_EQ(store->annotations(), expected["data"]) << binary;
        EXPECT_EQ(store->annotationForIdentifier("com.example.a"), election(1));
        EXPECT_TRUE(store->annotationForIdentifier("com.example.c").isNone());
        EXPECT_TRUE(recordsAt(log, LogLevel::Error).empty());
    }
}

TEST_F(OMDAnnotationStoreTest, OddButReadableTablesLoad)
{
    struct Case {
        const char* name;
        Value root;
        Value annotations;
    };
    const Case cases[] = {
        { "no data", Value::dictionary({ { "version", 16 } }), Value::dictionary({}) },
        { "data not a dictionary", Value::dictionary({ { "version", 16 }, { "data", "x" } }), Value::dictionary({}) },
        { "a real version", Value::dictionary({ { "version", 16.0 }, { "data", Value::dictionary({}) } }),
            Value::dictionary({}) },
        { "entries that are no dictionary are dropped",
            Value::dictionary({ { "version", 16 },
                { "data", Value::dictionary({ { "a", "text" }, { "b", election(2) }, { "c", Value::array({}) } }) } }),
            Value::dictionary({ { "b", election(2) } }) },
        { "extra root keys", Value::dictionary({ { "version", 16 }, { "data", Value::dictionary({}) }, { "x", 1 } }),
            Value::dictionary({}) },
    };
    for (const auto& test : cases) {
        write(Vlist::writeXml(test.root));
        Log::Capture log;
        auto store = open();
        EXPECT_EQ(store->annotations(), test.annotations) << test.name;
        EXPECT_TRUE(recordsAt(log, LogLevel::Error).empty()) << test.name;
    }
}

// Unreadable, damaged or of another version: logged, empty, and kept under a second name before
// the first save replaces it.
TEST_F(OMDAnnotationStoreTest, BadFileResetsAndIsKeptAtTheFirstSave)
{
    struct Case {
        const char* name;
        std::string contents;
        const char* errorText; // in the logged error, or null
    };
    const auto binary15
        = Vlist::writeBinary(Value::dictionary({ { "version", 15 }, { "data", Value::dictionary({}) } }));
    const Case cases[] = {
        { "version 15",
            Vlist::writeXml(
                Value::dictionary({ { "version", 15 }, { "data", Value::dictionary({ { "old", election(1) } }) } })),
            "found database version 15 needed version 16" },
        { "binary version 15", std::string(binary15.begin(), binary15.end()),
            "found database version 15 needed version 16" },
        { "no version", Vlist::writeXml(Value::dictionary({ { "data", Value::dictionary({}) } })),
            "found database version 0 needed version 16" },
        { "version as text", Vlist::writeXml(Value::dictionary({ { "version", "16" } })),
            "found database version 0 needed version 16" },
        { "version out of range", Vlist::writeXml(Value::dictionary({ { "version", 1e300 } })),
            "found database version -1 needed version 16" },
        { "not a vlist", "annotations\n", nullptr },
        { "truncated", Vlist::writeXml(table({ { "a", election(1) } })).substr(0, 60), nullptr },
        { "empty", "", nullptr },
        { "root is an array", Vlist::writeXml(Value::array({ Value(16) })), nullptr },
    };
    for (const auto& test : cases) {
        SCOPED_TRACE(test.name);
        fs::remove_all(directory());
        write(test.contents);

        Log::Capture log;
        auto store = open();
        EXPECT_EQ(store->annotations(), Value::dictionary({}));
        auto errors = recordsAt(log, LogLevel::Error);
        ASSERT_EQ(errors.size(), 1u);
        const std::string& message = errors[0].message;
        EXPECT_EQ(errors[0].category, "ops");
        EXPECT_TRUE(message.starts_with(std::string(kResetPrefix) + OMBundle::fileURL(path()) + " error:")) << message;
        EXPECT_TRUE(message.ends_with(kResetSuffix)) << message;
        if (test.errorText) {
            EXPECT_NE(message.find(test.errorText), std::string::npos) << message;
        }

        // Nothing is written, and nothing kept, before a change.
        EXPECT_EQ(readBytes(path()), test.contents);
        EXPECT_TRUE(keptCopies(directory()).empty());

        log.clear();
        store->setAnnotationForKey(election(1), "com.example.a");
        auto kept = keptCopies(directory());
        ASSERT_EQ(kept.size(), 1u);
        EXPECT_EQ(readBytes(kept[0]), test.contents);
        EXPECT_TRUE(kept[0].starts_with(path() + ".unreadable-")) << kept[0];
        EXPECT_EQ(log.count(format("kept the unreadable annotation database as %{public}@", kept[0])), 1u);
        EXPECT_EQ(log.records().size(), 1u);
        EXPECT_EQ(onDisk(), table({ { "com.example.a", election(1) } }));

        // Only the first save keeps a copy.
        store->setAnnotationForKey(election(2), "com.example.a");
        EXPECT_EQ(keptCopies(directory()).size(), 1u);
        EXPECT_EQ(log.records().size(), 1u);
    }
}

TEST_F(OMDAnnotationStoreTest, ChangeMergesShallowlyAndEveryChangeIsSaved)
{
    fs::create_directories(directory());
    auto store = open();
    const Value x = Value::dictionary({ { "x", 1 } });
    const Value y = Value::dictionary({ { "y", 2 } });
    struct Step {
        const char* name;
        Value change; // none removes the entry
        Value entry; // the entry afterwards, none when there is none
    };
    const Step steps[] = {
        { "first change makes the entry", Value::dictionary({ { "election", 0 }, { "extension", x } }),
            Value::dictionary({ { "election", 0 }, { "extension", x } }) },
        { "election alone keeps the extension", election(1),
            Value::dictionary({ { "election", 1 }, { "extension", x } }) },
        { "extension alone replaces it whole", Value::dictionary({ { "extension", y } }),
            Value::dictionary({ { "election", 1 }, { "extension", y } }) },
        { "other keys are stored too", Value::dictionary({ { "note", "n" } }),
            Value::dictionary({ { "election", 1 }, { "extension", y }, { "note", "n" } }) },
        { "an empty change changes nothing", Value::dictionary({}),
            Value::dictionary({ { "election", 1 }, { "extension", y }, { "note", "n" } }) },
        { "any number is an election", Value::dictionary({ { "election", 2.5 } }),
            Value::dictionary({ { "election", 2.5 }, { "extension", y }, { "note", "n" } }) },
        { "none removes the entry", Value(), Value() },
        { "an empty change makes an empty entry", Value::dictionary({}), Value::dictionary({}) },
    };
    for (const auto& step : steps) {
        store->setAnnotationForKey(step.change, "com.example.a");
        EXPECT_EQ(store->annotationForIdentifier("com.example.a"), step.entry) << step.name;
        // Saved at once: a store made afresh reads the same.
        EXPECT_EQ(open()->annotationForIdentifier("com.example.a"), step.entry) << step.name;
    }

    // Saved even when nothing changed.
    fs::remove(path());
    store->setAnnotationForKey(Value::dictionary({}), "com.example.a");
    EXPECT_TRUE(fs::exists(path()));
    fs::remove(path());
    store->setAnnotationForKey(Value(), "com.example.never");
    EXPECT_TRUE(fs::exists(path()));
}

TEST_F(OMDAnnotationStoreTest, RelativePathNamesAFileUnderTheWorkingDirectory)
{
    fs::create_directories(directory());
    const std::string relative = fs::relative(path(), fs::current_path());
    ASSERT_FALSE(relative.starts_with('/'));
    auto store = OMDAnnotationStore::initWithDatabase(relative);
    EXPECT_EQ(store->annotationsURL(), OMBundle::fileURL(path()));
    Log::Capture log;
    store->setAnnotationForKey(election(1), "com.example.a");
    EXPECT_TRUE(recordsAt(log, LogLevel::Error).empty());
    EXPECT_EQ(onDisk(), table({ { "com.example.a", election(1) } }));
}

TEST_F(OMDAnnotationStoreTest, PlugInsThatReplaceTheSameIdentifierShareAnEntry)
{
    fs::create_directories(directory());
    auto store = open();
    const Value replacing = Value::dictionary({ { "com.orvex.developer.replace-plugin", "com.example.old" } });
    auto older = plugIn("com.example.old");
    auto newer = plugIn("com.example.new", replacing);
    auto other = plugIn("com.example.other", replacing);
    auto listed = plugIn("com.example.listed",
        Value::dictionary({ { "com.orvex.developer.replace-plugin", Value::array({ "com.example.old" }) } }));
    ASSERT_TRUE(older && newer && other && listed);

    store->setAnnotation(election(1), *newer);
    EXPECT_EQ(store->annotationForPlugIn(*older), election(1));
    EXPECT_EQ(store->annotationForPlugIn(*other), election(1));
    EXPECT_EQ(store->annotationForIdentifier("com.example.old"), election(1));
    EXPECT_TRUE(store->annotationForIdentifier("com.example.new").isNone());
    // Only a text names the entry; any other value leaves the plug-in its own.
    EXPECT_TRUE(store->annotationForPlugIn(*listed).isNone());

    store->setAnnotation(Value(), *older);
    EXPECT_TRUE(store->annotationForPlugIn(*newer).isNone());
}

TEST_F(OMDAnnotationStoreTest, FileIsTheXmlTableOwnerOnly)
{
    fs::create_directories(directory());
    const Value extension = Value::dictionary({ { "when", Value::date(1.5e9) }, { "list", Value::array({ 1, "t" }) },
        { "blob", Value::data(std::vector<uint8_t> { 0, 255 }) } });
    auto store = open();
    store->setAnnotationForKey(Value::dictionary({ { "election", 1 }, { "extension", extension } }), "com.example.b");
    store->setAnnotationForKey(election(3), "com.example.a");

    const std::string bytes = readBytes(path());
    EXPECT_TRUE(bytes.starts_with("<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<vlist version=\"1\">")) << bytes;
    const Value root = onDisk();
    ASSERT_TRUE(root.isDictionary());
    ASSERT_EQ(root.count(), 2u);
    EXPECT_EQ(root.entries()[0].first, "version");
    EXPECT_EQ(root.entries()[1].first, "data");
    EXPECT_EQ(root["version"].type(), Value::Type::Integer);
    EXPECT_EQ(root,
        table({ { "com.example.a", election(3) },
            { "com.example.b", Value::dictionary({ { "election", 1 }, { "extension", extension } }) } }));

    struct stat info { };
    ASSERT_EQ(::stat(path().c_str(), &info), 0);
    EXPECT_EQ(info.st_mode & 07777, 0600u);
    // Nothing but the database is left in its directory.
    EXPECT_EQ(std::distance(fs::directory_iterator(directory()), fs::directory_iterator()), 1);
}

// The directory of the file is replaced by a regular file after the load: no save can succeed,
// whoever runs the test.
TEST_F(OMDAnnotationStoreTest, FailedSaveKeepsTheOldFileAndTheChangeInMemory)
{
    const std::string original = Vlist::writeXml(table({ { "com.example.a", election(1) } }));
    write(original);
    auto store = open();
    const std::string aside = m_files.root() + "/db-aside";
    fs::rename(directory(), aside);
    BundleFixture::writeFileAt(directory(), "in the way");

    Log::Capture log;
    store->setAnnotationForKey(election(2), "com.example.b");
    auto errors = recordsAt(log, LogLevel::Error);
    ASSERT_EQ(errors.size(), 1u);
    const std::string prefix = format("unable to save annotations:%{public}@ error:", OMBundle::fileURL(path()));
    EXPECT_TRUE(errors[0].message.starts_with(prefix)) << errors[0].message;
    EXPECT_EQ(errors[0].category, "ops");
    EXPECT_EQ(store->annotationForIdentifier("com.example.b"), election(2));

    fs::remove(directory());
    fs::rename(aside, directory());
    EXPECT_EQ(readBytes(path()), original);
    EXPECT_EQ(std::distance(fs::directory_iterator(directory()), fs::directory_iterator()), 1);

    // The next successful save carries the change that could not be saved.
    store->setAnnotationForKey(election(3), "com.example.c");
    EXPECT_EQ(onDisk(),
        table(
            { { "com.example.a", election(1) }, { "com.example.b", election(2) }, { "com.example.c", election(3) } }));
}

TEST_F(OMDAnnotationStoreTest, SingleUserDeviceUsesTheGlobalFileAndMigratesNothing)
{
    if (::geteuid() != 0)
        GTEST_SKIP() << "a single-user device is a daemon running as root";
    const std::string global = m_files.root() + "/global/Annotations";
    BundleFixture::writeFileAt(global, Vlist::writeXml(table({ { "com.example.g", election(1) } })));
    ::setenv("OMD_GLOBAL_ANNOTATIONS", global.c_str(), 1);
    fs::create_directories(directory());

    Log::Capture log;
    EXPECT_EQ(OMDAnnotationStore::globalURL(), OMBundle::fileURL(global));
    auto byDefault = OMDAnnotationStore::initWithDatabase(std::nullopt);
    EXPECT_EQ(byDefault->annotationsURL(), OMBundle::fileURL(global));
    EXPECT_EQ(byDefault->annotationForIdentifier("com.example.g"), election(1));
    // A store of its own file does not look at the global one, not even when its file is missing.
    auto own = open();
    EXPECT_EQ(own->annotations(), Value::dictionary({}));
    EXPECT_EQ(log.count("migrating shared annotations"), 0u);
    EXPECT_FALSE(fs::exists(path()));
    ::unsetenv("OMD_GLOBAL_ANNOTATIONS");
}

// Multi-user mode is a daemon that does not run as root: the migration runs in a real omd started
// as another user, on files prepared here.
class AnnotationMigration : public ::testing::Test {
protected:
    static constexpr uid_t kUser = 65534;

    void SetUp() override
    {
        if (::geteuid() != 0)
            GTEST_SKIP() << "needs root, to run the daemon as another user (multi-user mode)";
        fs::permissions(m_files.root(), fs::perms::owner_all | fs::perms::group_exec | fs::perms::others_exec);
        m_files.makeDirectory("data");
        m_files.makeDirectory("explicit");
        handOver();
        BundleFixture::writeFileAt(global(), Vlist::writeXml(globalTable()), 0644);
    }

    std::string global() const { return m_files.root() + "/global-annotations"; }
    std::string containerFile() const
    {
        return m_files.root() + "/data/omd/containers/com.orvex.omd/com.orvex.ombrel/Annotations";
    }
    static Value globalTable() { return table({ { "com.example.shared", election(1) } }); }

    // What the daemon's user must be able to change becomes that user's.
    void handOver() const
    {
        for (const char* name : { "/data", "/explicit" }) {
            const std::string top = m_files.root() + name;
            (void)::chown(top.c_str(), kUser, kUser);
            for (const auto& entry : fs::recursive_directory_iterator(top))
                (void)::chown(entry.path().c_str(), kUser, kUser);
        }
    }

    void place(const std::string& path, std::string_view contents) const
    {
        fs::create_directories(path.substr(0, path.rfind('/')));
        BundleFixture::writeFileAt(path, contents, 0600);
        handOver();
    }

    // Runs the daemon until it serves, so that construction (and any migration) has finished.
    std::unique_ptr<DaemonProcess> run(std::vector<std::string> arguments)
    {
        DaemonProcess::Options options;
        options.executable = builtDaemonPath();
        options.user = kUser;
        options.privateDatabase = false;
        options.arguments = std::move(arguments);
        options.environment = { { "XDG_DATA_HOME", m_files.root() + "/data" }, { "OMD_GLOBAL_ANNOTATIONS", global() } };
        auto daemon = std::make_unique<DaemonProcess>(options);
        EXPECT_TRUE(daemon->waitForSocket()) << daemon->stderrText();
        // Construction logs before the daemon listens: once a client's line is read, so are those.
        auto peer = DaemonPeer::connect(*daemon);
        EXPECT_TRUE(peer && peer->call(daemonRequest("settle")));
        const std::string client = format("new client %d ", ::getpid());
        EXPECT_TRUE(daemon->waitForLines([&](const auto& lines) {
            return std::any_of(lines.begin(), lines.end(),
                [&](const DaemonLogLine& line) { return line.message.starts_with(client); });
        })) << daemon->stderrText();
        return daemon;
    }

    BundleFixture m_files;
};

TEST_F(AnnotationMigration, MissingPerUserFileTakesTheSharedTable)
{
    auto daemon = run({});
    EXPECT_EQ(daemon->countMessages("migrating shared annotations"), 1u) << daemon->stderrText();
    auto migrated = Vlist::readFile(containerFile());
    ASSERT_TRUE(migrated.ok()) << daemon->stderrText();
    EXPECT_EQ(*migrated, globalTable());
    EXPECT_EQ(*Vlist::readFile(global()), globalTable());
    EXPECT_EQ(fs::status(containerFile().substr(0, containerFile().rfind('/'))).permissions() & fs::perms::all,
        fs::perms::owner_all);
}

TEST_F(AnnotationMigration, ExplicitFileMigratesToo)
{
    const std::string file = m_files.root() + "/explicit/db";
    auto daemon = run({ "-d", file });
    EXPECT_EQ(daemon->countMessages("migrating shared annotations"), 1u) << daemon->stderrText();
    auto migrated = Vlist::readFile(file);
    ASSERT_TRUE(migrated.ok());
    EXPECT_EQ(*migrated, globalTable());
    EXPECT_FALSE(fs::exists(containerFile()));
}

TEST_F(AnnotationMigration, DamagedPerUserFileIsKeptAndReplacedByTheSharedTable)
{
    place(containerFile(), Vlist::writeXml(Value::dictionary({ { "version", 15 } })));
    auto daemon = run({});
    EXPECT_TRUE(daemon->waitForLines([](const auto& lines) {
        return std::any_of(lines.begin(), lines.end(), [](const DaemonLogLine& line) {
            return line.message.starts_with(kResetPrefix) && line.message.ends_with(kResetSuffix);
        });
    }));
    EXPECT_EQ(daemon->countMessages("migrating shared annotations"), 1u);
    EXPECT_EQ(*Vlist::readFile(containerFile()), globalTable());
    const std::string directory = containerFile().substr(0, containerFile().rfind('/'));
    auto kept = keptCopies(directory);
    ASSERT_EQ(kept.size(), 1u);
    EXPECT_EQ(*Vlist::readFile(kept[0]), Value::dictionary({ { "version", 15 } }));
}

TEST_F(AnnotationMigration, NothingToMigrateWritesNothing)
{
    // A readable per-user file is never replaced; a missing or bad shared file gives nothing.
    place(containerFile(), Vlist::writeXml(table({ { "com.example.mine", election(2) } })));
    {
        auto daemon = run({});
        EXPECT_EQ(daemon->countMessages("migrating shared annotations"), 0u);
        EXPECT_EQ(*Vlist::readFile(containerFile()), table({ { "com.example.mine", election(2) } }));
    }
    fs::remove(containerFile());
    for (const char* shared : { "", "<vlist" }) {
        if (*shared)
            BundleFixture::writeFileAt(global(), shared, 0644);
        else
            fs::remove(global());
        auto daemon = run({});
        EXPECT_EQ(daemon->countMessages("migrating shared annotations"), 0u) << shared;
        EXPECT_FALSE(fs::exists(containerFile())) << shared;
    }
}

TEST_F(AnnotationMigration, MigratedTableThatCannotBeSavedIsUsedInMemory)
{
    const std::string file = m_files.root() + "/explicit/missing-directory/db";
    auto daemon = run({ "-d", file });
    ASSERT_TRUE(daemon->waitForLines([&](const auto& lines) {
        return std::any_of(lines.begin(), lines.end(), [&](const DaemonLogLine& line) {
            return line.level == "error"
                && line.message.starts_with(
                    format("unable to save migrated annotations to %{public}@ error:", OMBundle::fileURL(file)));
        });
    })) << daemon->stderrText();
    EXPECT_EQ(daemon->countMessages("migrating shared annotations"), 1u);
    EXPECT_FALSE(fs::exists(file));
}

} // namespace
} // namespace om::test
