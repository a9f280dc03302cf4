#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "platform/Log.h"
#include "platform/RegistrarBundleReader.h"
#include "tests/platform/RegistrarTestSupport.h"

using om::DictionaryBuilder;
using om::RegistrarPlugInRecord;
using om::RegistrarScope;
using om::Value;

namespace {

namespace fs = std::filesystem;

// Nested arrays, depth containers deep: [[...[]...]].
Value nested(unsigned depth)
{
    Value value = Value::array({});
    for (unsigned level = 1; level < depth; ++level)
        value = Value::array({ value });
    return value;
}

class RegistrarRefusal : public om::test::RegistrarTest { };

TEST_F(RegistrarRefusal, BundlesThatAreNoPlugInChangeNothing)
{
    const Value good = plugIn("com.orvex.good", "com.orvex.share");
    ASSERT_TRUE(registered(bundle("good.appex", good)));
    workspace()->waitForNotifications();
    auto observer = observe();
    auto withExtra = [&](std::string_view key, const Value& value) {
        return DictionaryBuilder(good).set(std::string(key), value).build();
    };
    auto withoutKeys = [&](std::initializer_list<std::string_view> keys) {
        DictionaryBuilder info(good);
        for (auto key : keys)
            info.remove(key);
        return info.build();
    };

    const struct {
        const char* name;
        std::function<std::string()> make;
        const char* because; // a fragment of the error's description
    } cases[] = {
        { "missing Info.vlist", [&] { return m_bundles.makeDirectory("empty.appex"); }, "no readable Info.vlist" },
        { "Info.vlist is a directory",
            [&] {
                m_bundles.makeDirectory("dir.appex/Info.vlist");
                return m_bundles.root() + "/dir.appex";
            },
            "not a regular file" },
        { "Info.vlist does not parse",
            [&] {
                m_bundles.writeFile("garbage.appex/Info.vlist", "<vlist version=\"1\"><dict><key>a");
                return m_bundles.root() + "/garbage.appex";
            },
            "does not parse" },
        { "Info.vlist is an array", [&] { return bundle("array.appex", Value::array({ good })); }, "not a dictionary" },
        { "a 10 MB string", [&] { return bundle("huge.appex", withExtra("Padding", std::string(10u << 20, 'x'))); },
            "larger than 1048576 bytes" },
        { "nesting 33 levels deep", [&] { return bundle("deep.appex", withExtra("Deep", nested(32))); },
            "deeper than 32 levels" },
        { "neither QSExtension nor Ombrel", [&] { return bundle("none.appex", withoutKeys({ "QSExtension" })); },
            "neither a QSExtension dictionary nor an Ombrel key" },
        { "QSExtension is a string",
            [&] { return bundle("string.appex", withExtra("QSExtension", "com.orvex.share")); },
            "neither a QSExtension dictionary nor an Ombrel key" },
        { "no identifier", [&] { return bundle("anonymous.appex", withoutKeys({ "VBBundleIdentifier" })); },
            "neither a QSExtensionIdentifier nor a VBBundleIdentifier" },
        { "identifiers of the wrong type",
            [&] {
                Value extension = Value::dictionary({ { "QSExtensionIdentifier", 7 } });
                return bundle("typed.appex",
                    DictionaryBuilder(withExtra("QSExtension", extension))
                        .set("VBBundleIdentifier", Value::array({ "com.orvex.x" }))
                        .build());
            },
            "neither a QSExtensionIdentifier nor a VBBundleIdentifier" },
        { "a symbolic link loop",
            [&] {
                fs::create_symlink(m_bundles.root() + "/loop-b", m_bundles.root() + "/loop-a");
                fs::create_symlink(m_bundles.root() + "/loop-a", m_bundles.root() + "/loop-b");
                return m_bundles.root() + "/loop-a";
            },
            "realpath" },
        { "a relative path", [&] { return std::string("good.appex"); }, "relative" },
        { "a path over 1024 bytes", [&] { return "/" + std::string(1024, 'p'); }, "longer than 1024 bytes" },
        { "a path that does not exist", [&] { return m_bundles.root() + "/gone.appex"; }, "realpath" },
        { "an empty path", [&] { return std::string(); }, "not a bundle path" },
    };
    for (const auto& test : cases) {
        SCOPED_TRACE(test.name);
        auto result = workspace()->registerPlugIn(test.make());
        ASSERT_FALSE(result.ok());
        EXPECT_NE(result.error().localizedDescription().find(test.because), std::string::npos)
            << result.error().localizedDescription();
        EXPECT_EQ(workspace()->plugInCount(), 1u);
    }
    workspace()->waitForNotifications();
    EXPECT_EQ(observer->transcript(), "");
    EXPECT_EQ(open(om::RegistrarWorkspace::Access::ReadOnly)->plugInCount(), 1u);
}

TEST_F(RegistrarRefusal, BoundsAreAcceptedUpToTheirLimit)
{
    const Value good = plugIn("com.orvex.edge", "com.orvex.share");
    // The whole Info dictionary counts as one level.
    EXPECT_TRUE(registered(bundle("deep.appex", DictionaryBuilder(good).set("Deep", nested(31)).build())));

    std::string path = bundle("big.appex", DictionaryBuilder(good).set("Padding", std::string(1000, 'x')).build());
    const size_t overhead = fs::file_size(path + "/Info.vlist") - 1000;
    const size_t limit = om::RegistrarBundleReader::kMaxInfoBytes;
    bundle("big.appex", DictionaryBuilder(good).set("Padding", std::string(limit - overhead, 'x')).build());
    ASSERT_EQ(fs::file_size(path + "/Info.vlist"), limit);
    EXPECT_TRUE(registered(path));
    bundle("big.appex", DictionaryBuilder(good).set("Padding", std::string(limit - overhead + 1, 'x')).build());
    EXPECT_FALSE(workspace()->registerPlugIn(path).ok());

    EXPECT_TRUE(registered("/" + m_bundles.root().substr(1) + "/deep.appex/"));
}

TEST_F(RegistrarRefusal, ReadOnlyWorkspaceRegistersNothing)
{
    ASSERT_TRUE(registered(bundle("a.appex", plugIn("com.orvex.a", "com.orvex.share"))));
    auto reader = open(om::RegistrarWorkspace::Access::ReadOnly);
    auto result = reader->registerPlugIn(bundle("b.appex", plugIn("com.orvex.b", "com.orvex.share")));
    ASSERT_FALSE(result.ok());
    EXPECT_EQ(result.error().code(), om::kRegistrarErrorReadOnly);
    EXPECT_EQ(reader->unregisterPlugIn(m_bundles.root() + "/a.appex").error().code(), om::kRegistrarErrorReadOnly);
    EXPECT_EQ(workspace()->plugInCount(), 1u);
}

class RegistrarRecordFacts : public om::test::RegistrarTest { };

TEST_F(RegistrarRecordFacts, NamesAndIdentifiersFallBackInOrder)
{
    const struct {
        const char* name;
        Value extension; // QSExtension keys
        Value extra; // top-level keys
        const char* identifier;
        const char* originalIdentifier;
        const char* displayName;
        const char* shortDisplayName;
    } cases[] = {
        { "plug-in identifier first", Value::dictionary({ { "QSExtensionIdentifier", "com.orvex.ext" } }),
            Value::dictionary({ { "VBBundleDisplayName", "Display" }, { "VBBundleName", "Name" } }), "com.orvex.ext",
            "com.orvex.bundle", "Display", "Name" },
        { "bundle identifier when the plug-in's is no string", Value::dictionary({ { "QSExtensionIdentifier", 5 } }),
            Value::dictionary({ { "VBBundleName", "Name" } }), "com.orvex.bundle", "com.orvex.bundle", "Name", "Name" },
        { "directory name when no name is a string", Value::dictionary({}),
            Value::dictionary({ { "VBBundleDisplayName", 1 }, { "VBBundleName", false } }), "com.orvex.bundle",
            "com.orvex.bundle", "Sharer", "Sharer" },
    };
    for (const auto& test : cases) {
        SCOPED_TRACE(test.name);
        auto record = registered(bundle("cases/" + std::string(test.name) + "/Sharer.appex",
            plugIn("com.orvex.bundle", "com.orvex.share", test.extension, test.extra)));
        ASSERT_TRUE(record);
        EXPECT_EQ(record->identifier(), test.identifier);
        EXPECT_EQ(record->originalIdentifier(), test.originalIdentifier);
        EXPECT_EQ(record->bundleIdentifier(), "com.orvex.bundle");
        EXPECT_EQ(record->bundleVersion(), "1");
        EXPECT_EQ(record->displayName(), test.displayName);
        EXPECT_EQ(record->shortDisplayName(), test.shortDisplayName);
        EXPECT_FALSE(record->onSystemPartition());
        EXPECT_FALSE(record->uuid().isNil());
        EXPECT_GT(record->registrationDate().value_or(0), 1.7e9);
    }
}

TEST_F(RegistrarRecordFacts, CanonicalFormAlwaysHasAttributesWithAVersion)
{
    const struct {
        const char* name;
        Value info;
        Value attributes;
    } cases[] = {
        { "short version string",
            plugIn("com.orvex.a", "p", Value::dictionary({}),
                Value::dictionary({ { "VBBundleShortVersionString", "2.5" } })),
            Value::dictionary({ { "QSExtensionVersion", "2.5" } }) },
        { "declared version kept",
            plugIn("com.orvex.b", "p",
                Value::dictionary(
                    { { "QSExtensionAttributes", Value::dictionary({ { "QSExtensionVersion", "3" } }) } })),
            Value::dictionary({ { "QSExtensionVersion", "3" } }) },
        { "attributes of the wrong type",
            DictionaryBuilder(plugIn("com.orvex.c", "p", Value::dictionary({ { "QSExtensionAttributes", "x" } })))
                .remove("VBBundleShortVersionString")
                .build(),
            Value::dictionary({ { "QSExtensionVersion", "1" } }) },
        { "short version of the wrong type",
            plugIn(
                "com.orvex.d", "p", Value::dictionary({}), Value::dictionary({ { "VBBundleShortVersionString", 2 } })),
            Value::dictionary({ { "QSExtensionVersion", "1" } }) },
    };
    for (const auto& test : cases) {
        SCOPED_TRACE(test.name);
        auto facts = om::RegistrarBundleReader::plugInFacts("/b/x.appex", test.info, Value(), {});
        ASSERT_TRUE(facts.ok());
        EXPECT_EQ(facts->plugInDictionary["QSExtensionAttributes"], test.attributes);
        EXPECT_EQ(facts->infoDictionary["QSExtension"], facts->plugInDictionary);
    }
}

TEST_F(RegistrarRecordFacts, SystemPartitionIsThePathPrefixWithItsSlash)
{
    const Value info = plugIn("com.orvex.a", "p");
    for (auto [path, onSystem] : { std::pair { "/System/Library/a.appex", true }, std::pair { "/System/a.appex", true },
             std::pair { "/SystemExtras/a.appex", false }, std::pair { "/system/a.appex", false },
             std::pair { "/opt/System/a.appex", false } }) {
        auto facts = om::RegistrarBundleReader::plugInFacts(path, info, Value(), {});
        ASSERT_TRUE(facts.ok());
        EXPECT_EQ(facts->onSystemPartition, onSystem) << path;
    }
}

TEST_F(RegistrarRecordFacts, OldStylePlugInsReadTheirOmbrelKey)
{
    Value base = om::test::BundleFixture::appInfo("com.orvex.old", "");
    Value declared = DictionaryBuilder(base)
                         .set("Ombrel", Value::dictionary({ { "QSExtensionPointIdentifier", "com.orvex.old-point" } }))
                         .build();
    auto facts = om::RegistrarBundleReader::plugInFacts("/b/old.bundle", declared, Value(), {});
    ASSERT_TRUE(facts.ok());
    EXPECT_EQ(facts->plugInDictionary["QSExtensionPointIdentifier"], Value("com.orvex.old-point"));
    EXPECT_EQ(facts->plugInDictionary["QSExtensionAttributes"]["QSExtensionVersion"], Value("1.0"));
    EXPECT_FALSE(facts->infoDictionary.contains("QSExtension"));

    auto flag = om::RegistrarBundleReader::plugInFacts(
        "/b/old.bundle", DictionaryBuilder(base).set("Ombrel", true).build(), Value(), {});
    ASSERT_TRUE(flag.ok());
    EXPECT_EQ(flag->plugInDictionary,
        Value::dictionary({ { "QSExtensionAttributes", Value::dictionary({ { "QSExtensionVersion", "1.0" } }) } }));
}

TEST_F(RegistrarRecordFacts, SdkEntryCompletesTheDeclarations)
{
    writeSdkEntry("com.orvex.share",
        Value::dictionary({ { "SdkOnlyKey", "from the SDK" },
            { "QSExtension",
                Value::dictionary({ { "CleanTimeout", 5 }, { "Shared", Value::array({ "a", "b" }) },
                    { "QSExtensionAttributes", Value::dictionary({ { "FromSdk", 1 }, { "Mine", "sdk" } }) } }) } }));
    Value extension = Value::dictionary({ { "CleanTimeout", 99 }, { "Shared", Value::array({ "b", "c" }) },
        { "QSExtensionAttributes", Value::dictionary({ { "Mine", "plug-in" } }) } });
    auto record = registered(bundle("share.appex", plugIn("com.orvex.sharer", "com.orvex.share", extension)));
    ASSERT_TRUE(record);

    EXPECT_EQ(record->lookup("SdkOnlyKey", RegistrarScope::Info), Value("from the SDK"));
    EXPECT_EQ(record->lookup("CleanTimeout", RegistrarScope::PlugIn), Value(5));
    EXPECT_EQ(record->lookup("Shared", RegistrarScope::PlugIn), Value::array({ "b", "c", "a" }));
    EXPECT_EQ(record->lookup("FromSdk", RegistrarScope::Attributes), Value(1));
    EXPECT_EQ(record->lookup("Mine", RegistrarScope::Attributes), Value("plug-in"));
    EXPECT_EQ(record->lookup("QSExtensionVersion", RegistrarScope::Attributes), Value("1.0"));
    EXPECT_EQ(record->lookup("QSExtension", RegistrarScope::Info), record->plugInDictionary());

    // An entry is read once and kept until the caches are dropped.
    writeSdkEntry("com.orvex.share", Value::dictionary({ { "SdkOnlyKey", "changed" } }));
    EXPECT_EQ(workspace()->sdkEntry("com.orvex.share")["SdkOnlyKey"], Value("from the SDK"));
    workspace()->dropCaches();
    EXPECT_EQ(workspace()->sdkEntry("com.orvex.share")["SdkOnlyKey"], Value("changed"));
    EXPECT_TRUE(workspace()->sdkEntry("com.orvex.unknown").isNone());
}

TEST_F(RegistrarRecordFacts, AttributesLookupFallsBackToTheExtensionPoint)
{
    auto plain = registered(bundle("plain.appex", plugIn("com.orvex.plain", "com.orvex.share")));
    auto own = registered(bundle("own.appex",
        plugIn("com.orvex.own", "com.orvex.share",
            Value::dictionary({ { "QSExtensionAttributes",
                Value::dictionary({ { "QSExtensionPointIdentifier", "com.orvex.other" } }) } }))));
    ASSERT_TRUE(plain && own);
    EXPECT_EQ(plain->lookup("QSExtensionPointIdentifier", RegistrarScope::Attributes), Value("com.orvex.share"));
    EXPECT_EQ(own->lookup("QSExtensionPointIdentifier", RegistrarScope::Attributes), Value("com.orvex.other"));
    // The fallback is for that one key only.
    EXPECT_TRUE(plain->lookup("VBBundleIdentifier", RegistrarScope::Attributes).isNone());
    EXPECT_EQ(plain->lookup("VBBundleIdentifier", RegistrarScope::Info), Value("com.orvex.plain"));
    EXPECT_TRUE(plain->lookup("VBBundleIdentifier", RegistrarScope::PlugIn).isNone());
}

TEST_F(RegistrarRecordFacts, DataContainersAreMadeForPlugInsThatKeepData)
{
    const struct {
        const char* name;
        const char* identifier;
        Value extension;
        bool container;
    } cases[] = {
        { "an ordinary plug-in", "com.orvex.keeps", Value::dictionary({}), true },
        { "a data plug-in", "com.orvex.data", Value::dictionary({ { "QSExtensionProtocol", "#Data" } }), false },
        { "a protocol that only starts like data", "com.orvex.data2",
            Value::dictionary({ { "QSExtensionProtocol", "#DataX" } }), true },
        { "an identifier that climbs", "..", Value::dictionary({}), false },
        { "an identifier with a slash", "com/orvex", Value::dictionary({}), false },
    };
    for (const auto& test : cases) {
        SCOPED_TRACE(test.name);
        auto record = registered(bundle("containers/" + std::string(test.name) + ".appex",
            plugIn("com.orvex.bundle", "p",
                DictionaryBuilder(test.extension).set("QSExtensionIdentifier", test.identifier).build())));
        ASSERT_TRUE(record);
        EXPECT_EQ(record->dataContainerPath().has_value(), test.container);
        if (!test.container)
            continue;
        EXPECT_EQ(*record->dataContainerPath(), configuration().containersDirectory + "/" + test.identifier);
        struct stat status;
        ASSERT_EQ(::stat(record->dataContainerPath()->c_str(), &status), 0);
        EXPECT_TRUE(S_ISDIR(status.st_mode));
        EXPECT_EQ(status.st_mode & 0777, 0700u);
    }
    EXPECT_FALSE(fs::exists(configuration().containersDirectory + "/com.orvex.data"));
}

TEST_F(RegistrarRecordFacts, AContainerThatCannotBeMadeStillRegisters)
{
    m_bundles.writeFile("containers", "a file where the directory should be");
    auto record = registered(bundle("a.appex", plugIn("com.orvex.a", "p")));
    ASSERT_TRUE(record);
    EXPECT_FALSE(record->dataContainerPath());
}

class RegistrarContainingApp : public om::test::RegistrarTest { };

TEST_F(RegistrarContainingApp, NearestAppWithAnInfoFileContainsThePlugIn)
{
    std::string app = m_bundles.makeApp("Notes", "com.orvex.notes");
    m_bundles.makeDirectory("Notes.app/Inner.app/PlugIns"); // an ".app" without Info.vlist
    auto inner = registered(bundle("Notes.app/Inner.app/PlugIns/b.appex", plugIn("com.orvex.notes.b", "p")));
    auto direct = registered(bundle("Notes.app/PlugIns/a.appex", plugIn("com.orvex.notes.a", "p")));
    auto loose = registered(bundle("loose.appex", plugIn("com.orvex.loose", "p")));
    ASSERT_TRUE(inner && direct && loose);

    ASSERT_TRUE(direct->containingApp());
    EXPECT_EQ(direct->containingApp()->path(), app);
    EXPECT_EQ(direct->containingApp()->bundleIdentifier(), "com.orvex.notes");
    EXPECT_EQ(direct->containingApp()->displayName(), "Notes");
    ASSERT_TRUE(inner->containingApp());
    EXPECT_EQ(inner->containingApp()->path(), app);
    EXPECT_FALSE(loose->containingApp());

    auto plugIns = workspace()->plugInsOfApplication(app + "/");
    ASSERT_EQ(plugIns.size(), 2u);
    EXPECT_EQ(plugIns[0], inner); // path order: "Inner.app/..." sorts before "PlugIns/..."
    EXPECT_EQ(plugIns[1], direct);
    EXPECT_EQ(workspace()->applicationAtPath(app)->path(), app);
    EXPECT_TRUE(workspace()->plugInsOfApplication(m_bundles.root() + "/Unknown.app").empty());
    ASSERT_EQ(workspace()->allApplications().size(), 1u);

    ASSERT_TRUE(workspace()->unregisterPlugIn(*inner->bundlePath()).ok());
    ASSERT_TRUE(workspace()->unregisterPlugIn(*direct->bundlePath()).ok());
    EXPECT_FALSE(workspace()->applicationAtPath(app));
    EXPECT_TRUE(workspace()->allApplications().empty());
}

TEST_F(RegistrarContainingApp, PlaceholderFollowsTheDisk)
{
    std::string app = m_bundles.makeApp("Mail", "com.orvex.mail");
    auto record = registered(bundle("Mail.app/PlugIns/a.appex", plugIn("com.orvex.mail.a", "p")));
    ASSERT_TRUE(record && record->containingApp());
    auto application = record->containingApp();
    const std::string info = contentsOf(app + "/Info.vlist");

    EXPECT_FALSE(application->isPlaceholder());
    fs::rename(app + "/Mail", app + "/Mail.moved");
    EXPECT_TRUE(application->isPlaceholder()) << "the executable is missing";
    fs::rename(app + "/Mail.moved", app + "/Mail");
    EXPECT_FALSE(application->isPlaceholder());
    fs::remove(app + "/Info.vlist");
    EXPECT_TRUE(application->isPlaceholder()) << "Info.vlist is missing";
    m_bundles.writeFileAt(app + "/Info.vlist", "not a vlist");
    EXPECT_TRUE(application->isPlaceholder()) << "Info.vlist does not parse";
    m_bundles.makeBundle("Mail.app", om::test::BundleFixture::appInfo("com.orvex.mail", ""));
    EXPECT_TRUE(application->isPlaceholder()) << "no VBBundleExecutable";
    m_bundles.makeBundle("Mail.app", om::test::BundleFixture::appInfo("com.orvex.mail", "../escape"));
    EXPECT_TRUE(application->isPlaceholder()) << "an executable outside the bundle";
    m_bundles.writeFileAt(app + "/Info.vlist", info);
    EXPECT_FALSE(application->isPlaceholder());
}

TEST_F(RegistrarContainingApp, AppBeingInstalledIsNamedAfterItsDirectory)
{
    std::string app = m_bundles.makeApp("Photos", "com.orvex.photos");
    auto first = registered(bundle("Photos.app/PlugIns/a.appex", plugIn("com.orvex.photos.a", "p")));
    ASSERT_TRUE(first);
    m_bundles.writeFileAt(app + "/Info.vlist", "half written");
    auto second = registered(bundle("Photos.app/PlugIns/b.appex", plugIn("com.orvex.photos.b", "p")));
    ASSERT_TRUE(second && second->containingApp());
    EXPECT_EQ(second->containingApp()->path(), app);
    EXPECT_EQ(second->containingApp()->displayName(), "Photos");
    EXPECT_FALSE(second->containingApp()->bundleIdentifier());
    EXPECT_TRUE(second->containingApp()->isPlaceholder());
}

} // namespace
