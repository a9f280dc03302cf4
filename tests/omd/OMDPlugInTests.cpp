// The daemon's plug-in record built from Registrar records made by hand: construction steps, the
// extra configuration checks, entitlements, the annotation key and the form's resource tokens.
#include <gtest/gtest.h>
#include <stdlib.h>

#include "omd/OMDPlugIn.h"
#include "platform/Log.h"
#include "tests/support/BundleFixture.h"

namespace om::test {
namespace {

// A plug-in inside an application, with a data container: everything the checks want.
RegistrarPlugInRecord::Facts goodFacts()
{
    RegistrarPlugInRecord::Facts facts;
    facts.uuid = Uuid::random();
    facts.bundlePath = "/Applications/Notes.app/PlugIns/Share.appex";
    facts.identifier = "com.example.notes.share";
    facts.originalIdentifier = "com.example.notes.share";
    facts.plugInDictionary = Value::dictionary({
        { "QSExtensionPointIdentifier", "com.orvex.share-services" },
        { "QSExtensionAttributes", Value::dictionary({ { "QSExtensionVersion", "1.2" } }) },
    });
    facts.infoDictionary = Value::dictionary({ { "QSExtension", facts.plugInDictionary } });
    facts.containingApp = std::make_shared<RegistrarAppRecord>(
        RegistrarAppRecord::Facts { "/Applications/Notes.app", "com.example.notes", "Notes" });
    facts.dataContainerPath = "/var/lib/omd/containers/com.example.notes.share";
    return facts;
}

std::shared_ptr<OMDPlugIn> build(RegistrarPlugInRecord::Facts facts)
{
    return OMDPlugIn::initWithRGData(std::make_shared<RegistrarPlugInRecord>(std::move(facts)));
}

RegistrarPlugInRecord::Facts withPlugInKey(RegistrarPlugInRecord::Facts facts, const std::string& key, Value value)
{
    facts.plugInDictionary = DictionaryBuilder(facts.plugInDictionary).set(key, std::move(value)).build();
    facts.infoDictionary = DictionaryBuilder(facts.infoDictionary).set("QSExtension", facts.plugInDictionary).build();
    return facts;
}

TEST(OMDPlugIn, TakesTheRegistrarsFacts)
{
    auto facts = goodFacts();
    facts.registrationDate = 1.9;
    facts.onSystemPartition = true;
    facts.entitlements = Value::dictionary({ { "a", true } });
    auto plugIn = build(facts);
    ASSERT_TRUE(plugIn);

    EXPECT_EQ(plugIn->uuid(), facts.uuid);
    EXPECT_EQ(plugIn->registrationUuid(), facts.uuid);
    EXPECT_EQ(plugIn->identifier(), "com.example.notes.share");
    EXPECT_EQ(plugIn->path(), *facts.bundlePath);
    EXPECT_EQ(plugIn->containingPath(), "/Applications/Notes.app");
    EXPECT_EQ(plugIn->lastModified(), 1);
    EXPECT_TRUE(plugIn->onSystemVolume());
    EXPECT_EQ(plugIn->version(), Value("1.2"));
    EXPECT_EQ(plugIn->plugInDictionary(), facts.plugInDictionary);
    EXPECT_EQ(plugIn->bundleInfoDictionary(), facts.infoDictionary);
    EXPECT_EQ(plugIn->entitlements(), facts.entitlements);
    EXPECT_EQ(plugIn->localizedContainingName(), "Notes");
}

TEST(OMDPlugIn, RegistrationDateIsTruncatedTowardZero)
{
    for (auto [date, expected] : { std::pair { 1.9, 1 }, { -1.9, -1 }, { 0.0, 0 }, { 1e12, INT32_MAX } }) {
        auto facts = goodFacts();
        facts.registrationDate = date;
        EXPECT_EQ(build(facts)->lastModified(), expected) << date;
    }
    EXPECT_EQ(build(goodFacts())->lastModified(), 0);
}

TEST(OMDPlugIn, HubProtocolVersionIsDeclaredOrFollowsTheStyle)
{
    auto declared = withPlugInKey(goodFacts(), "HubProtocolVersion", 3);
    declared.infoDictionary = DictionaryBuilder(declared.infoDictionary).set("Ombrel", true).build();
    EXPECT_EQ(build(declared)->hubProtocolVersion(), 3u);

    auto oldStyle = goodFacts();
    oldStyle.infoDictionary = DictionaryBuilder(oldStyle.infoDictionary).set("Ombrel", true).build();
    EXPECT_EQ(build(oldStyle)->hubProtocolVersion(), 1u);
    EXPECT_EQ(build(goodFacts())->hubProtocolVersion(), 2u);
}

TEST(OMDPlugIn, RefusesWhatItCannotUse)
{
    struct Case {
        const char* name;
        RegistrarPlugInRecord::Facts facts;
        const char* logged; // the check's message, or null when nothing is logged
    };
    auto noPath = goodFacts();
    noPath.bundlePath.reset();
    auto noContainer = goodFacts();
    noContainer.dataContainerPath.reset();
    auto looseOutsideSystem = withPlugInKey(goodFacts(), "QSExtensionProtocol", "#Data");
    looseOutsideSystem.containingApp.reset();
    looseOutsideSystem.bundlePath = "/Systemx/Library/Templates.bundle";
    auto principal = withPlugInKey(goodFacts(), "PrincipalClass", "Other");

    const Case cases[] = {
        { "no bundle path", noPath, nullptr },
        { "no container", noContainer, "this plug-in has no sandbox data container" },
        { "loose outside /System/", looseOutsideSystem, "plug-ins outside containing apps must be in /System" },
        { "principal class of an app extension", principal,
            "Application Extensions may not use the \"PrincipalClass\" key" },
    };
    for (const auto& test : cases) {
        Log::Capture log;
        EXPECT_FALSE(build(test.facts)) << test.name;
        const std::string expected = test.logged
            ? format("ignoring mis-configured plug-in at %@: %{public}@", *test.facts.bundlePath, test.logged)
            : std::string();
        const auto records = log.records();
        EXPECT_EQ(records.size(), test.logged ? 1u : 0u) << test.name;
        if (test.logged && !records.empty()) {
            EXPECT_EQ(records.front().message, expected) << test.name;
            EXPECT_EQ(records.front().level, LogLevel::Info) << test.name;
        }
    }
}

TEST(OMDPlugIn, DataPlugInNeedsNoContainerAndMayLiveLooseInSystem)
{
    auto facts = withPlugInKey(goodFacts(), "QSExtensionProtocol", "#Data");
    facts.dataContainerPath.reset();
    facts.containingApp.reset();
    facts.bundlePath = "/System/Library/Templates.bundle";
    auto plugIn = build(facts);
    ASSERT_TRUE(plugIn);
    EXPECT_TRUE(plugIn->isData());
    EXPECT_FALSE(plugIn->containingUrl());
}

TEST(OMDPlugIn, EntitlementsCountUnlessFalseOrZero)
{
    auto facts = goodFacts();
    facts.entitlements = Value::dictionary({ { "false", false }, { "zero", 0 }, { "true", true }, { "one", 1 },
        { "text", "" }, { "empty", Value::array({}) } });
    auto plugIn = build(facts);
    for (auto [key, held] : { std::pair { "missing", false }, { "false", false }, { "zero", false }, { "true", true },
             { "one", true }, { "text", true }, { "empty", true } })
        EXPECT_EQ(plugIn->hasEntitlement(key), held) << key;
    EXPECT_EQ(plugIn->valueForEntitlement("one"), Value(1));
}

TEST(OMDPlugIn, AnnotationKeyIsTheReplacedIdentifierOnlyWhenAString)
{
    for (auto [value, expected] :
        { std::pair { Value("com.example.old"), "com.example.old" }, { Value(true), "com.example.notes.share" },
            { Value::array({ "x" }), "com.example.notes.share" }, { Value(), "com.example.notes.share" } }) {
        auto facts = goodFacts();
        if (!value.isNone())
            facts.entitlements = Value::dictionary({ { "com.orvex.developer.replace-plugin", value } });
        EXPECT_EQ(build(facts)->annotationKey(), expected) << value.description();
    }
}

TEST(OMDPlugIn, PruningDropsOnlyUpperCaseDTKeys)
{
    Value info = Value::dictionary({ { "DTSDKName", 1 }, { "DT", 2 }, { "dtLower", 3 }, { "Dt", 4 }, { "ADT", 5 } });
    Value pruned = OMDPlugIn::prunedInfoDictionaryFor(info);
    EXPECT_EQ(pruned, Value::dictionary({ { "dtLower", 3 }, { "Dt", 4 }, { "ADT", 5 } }));
    EXPECT_EQ(info.count(), 5u);
}

TEST(OMDPlugIn, DisplayNamesComeFromTheRegistrarUntilSet)
{
    auto facts = goodFacts();
    facts.displayName = "Add to Notes";
    auto plugIn = build(facts);
    EXPECT_EQ(plugIn->localizedName(), "Add to Notes");
    EXPECT_FALSE(plugIn->localizedShortName());
    plugIn->setLocalizedShortName("Share");
    EXPECT_EQ(plugIn->localizedShortName(), "Share");
    plugIn->setLocalizedName("Renamed");
    EXPECT_EQ(plugIn->localizedName(), "Renamed");
}

class OMDPlugInForm : public ::testing::Test {
protected:
    void SetUp() override { ::setenv("SANDBOX_KEY", (m_fixture.root() + "/sandbox.key").c_str(), 1); }
    void TearDown() override { ::unsetenv("SANDBOX_KEY"); }
    BundleFixture m_fixture;
};

TEST_F(OMDPlugInForm, ExtensionsFollowTheKindAndTheSharedKey)
{
    const std::string appex = m_fixture.makeDirectory("Notes.app/PlugIns/Share.appex");
    const std::string bundle = m_fixture.makeDirectory("Notes.app/PlugIns/Templates.bundle");
    m_fixture.makeDirectory("Notes.app/PlugIns/Templates.bundle/Templates");
    auto augmented = [](RegistrarPlugInRecord::Facts facts, const std::string& path) {
        facts.bundlePath = path;
        auto plugIn = build(std::move(facts));
        DictionaryBuilder form;
        EXPECT_TRUE(plugIn);
        if (plugIn)
            plugIn->augmentForm(form);
        return form.build();
    };
    const auto dataPlugIn = withPlugInKey(goodFacts(), "QSExtensionProtocol", "#Data");

    // An app extension shares its whole bundle, whatever "Shared" says.
    Value extensions
        = augmented(withPlugInKey(goodFacts(), "Shared", Value::array({ "Templates" })), appex)["extensions"];
    EXPECT_EQ(extensions.count(), 1u);
    EXPECT_TRUE(extensions.contains(".")) << extensions.description();

    EXPECT_TRUE(
        augmented(withPlugInKey(dataPlugIn, "Shared", Value::array({ "Templates" })), bundle)["extensions"].contains(
            "Templates"));
    EXPECT_EQ(augmented(withPlugInKey(dataPlugIn, "Shared", Value::array({ "Missing", 3 })), bundle)["extensions"],
        Value::dictionary({}));
    EXPECT_FALSE(augmented(dataPlugIn, bundle).contains("extensions"));
}

} // namespace
} // namespace om::test
