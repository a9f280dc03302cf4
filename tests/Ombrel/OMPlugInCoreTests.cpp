#include <gtest/gtest.h>

#include <algorithm>
#include <functional>
#include <latch>
#include <map>
#include <thread>
#include <unordered_set>

#include "Ombrel/OMBundle.h"
#include "Ombrel/OMPlugInCore.h"
#include "platform/Log.h"
#include "platform/Vlist.h"
#include "tests/support/BundleFixture.h"

using om::DictionaryBuilder;
using om::Log;
using om::LogLevel;
using om::OMBundle;
using om::OMPlugInCore;
using om::Uuid;
using om::Value;

namespace {

const std::string kAppex = "/Apps/Notes.app/PlugIns/Share.appex";
const std::string kPlugin = "/Apps/Notes.app/PlugIns/Share.plugin";

Value info(const Value& plugIn, std::vector<Value::Entry> extra = {})
{
    extra.insert(extra.begin(), { { "VBBundleIdentifier", "com.example.share" }, { "QSExtension", plugIn } });
    return Value::dictionary(std::move(extra));
}

Value complete(std::vector<Value::Entry> entries = {})
{
    entries.insert(entries.begin(),
        { { "QSExtensionPointIdentifier", "com.orvex.share" }, { "QSExtensionProtocol", "ShareProtocol" },
            { "QSExtensionAttributes", Value::dictionary({ { "QSExtensionVersion", "2.1" } }) } });
    return Value::dictionary(std::move(entries));
}

std::shared_ptr<OMPlugInCore> record(const std::string& path, const Value& bundleInfo, const Value& plugIn = Value(),
    std::optional<Uuid> uuid = std::nullopt)
{
    return OMPlugInCore::initWithName("com.example.share", OMBundle::fileURL(path), bundleInfo, plugIn, uuid);
}

// The one record with this message, of the "ops" log at level.
void expectLogged(const Log::Capture& capture, const std::string& message, LogLevel level)
{
    size_t found = 0;
    for (const auto& entry : capture.records()) {
        if (entry.message != message)
            continue;
        ++found;
        EXPECT_EQ(entry.category, "ops") << message;
        EXPECT_EQ(entry.level, level) << message;
    }
    EXPECT_EQ(found, 1u) << message;
}

// A record the way a subclass makes one: bare, with its own answers to the hooks.
class Derived : public OMPlugInCore {
public:
    Derived() = default;
    using OMPlugInCore::constructWithName;

    Value pluginKey(std::string_view key) const override
    {
        auto found = plugInAnswers.find(std::string(key));
        return found == plugInAnswers.end() ? OMPlugInCore::pluginKey(key) : found->second;
    }
    bool sdkOverridesKey(std::string_view key) const override
    {
        return key == wideOverride || OMPlugInCore::sdkOverridesKey(key);
    }
    Value sdkDictionaryNamed(std::string_view name) const override
    {
        lookups.emplace_back(name);
        return suppliedSdk.isNone() ? OMPlugInCore::sdkDictionaryNamed(name) : suppliedSdk;
    }

    std::map<std::string, Value> plugInAnswers;
    std::string wideOverride;
    Value suppliedSdk;
    mutable std::vector<std::string> lookups;
};

} // namespace

TEST(OMPlugInCoreSetup, RefusalsAreLoggedAsTheyShouldBe)
{
    const std::string url = OMBundle::fileURL(kAppex);
    const struct {
        const char* name;
        std::optional<std::string> identifier;
        std::optional<std::string> url;
        Value bundleInfo;
        std::string message; // empty: refused silently
        LogLevel level;
    } cases[] = {
        { "no url", "com.example.share", std::nullopt, info(complete()), "", LogLevel::Info },
        { "no name", std::nullopt, url, info(complete()), "missing identifier in plug-in at " + kAppex,
            LogLevel::Error },
        { "no QSExtension", "com.example.share", url, Value::dictionary({ { "VBBundleIdentifier", "x" } }),
            "malformed plug-in dictionary in plug-in com.example.share at " + url
                + ": {\"VBBundleIdentifier\" = \"x\"}",
            LogLevel::Default },
        { "QSExtension an array", "com.example.share", url, info(Value::array({ "a" })),
            "malformed plug-in dictionary in plug-in com.example.share at " + url
                + ": {\"VBBundleIdentifier\" = \"com.example.share\"; \"QSExtension\" = (\"a\")}",
            LogLevel::Default },
        { "QSExtension a string", "com.example.share", url, info("a"),
            "malformed plug-in dictionary in plug-in com.example.share at " + url
                + ": {\"VBBundleIdentifier\" = \"com.example.share\"; \"QSExtension\" = \"a\"}",
            LogLevel::Default },
        { "info not a dictionary", "com.example.share", url, Value::array({ 1 }),
            "malformed plug-in dictionary in plug-in com.example.share at " + url + ": (1)", LogLevel::Default },
    };
    for (const auto& test : cases) {
        Log::Capture capture;
        EXPECT_FALSE(OMPlugInCore::initWithName(test.identifier, test.url, test.bundleInfo, complete(), std::nullopt))
            << test.name;
        if (test.message.empty())
            EXPECT_TRUE(capture.records().empty()) << test.name;
        else
            expectLogged(capture, test.message, test.level);
    }
}

TEST(OMPlugInCoreSetup, InfoDictionaryDecidesAndInfoArgumentIsThePlugInDictionaryOnlyWithoutOne)
{
    const Value bundleInfo = info(complete(), { { "Multiple", true } });
    const Value other = Value::dictionary({ { "Other", 1 } });
    Log::Capture capture;

    auto withInfo = record(kAppex, bundleInfo, other);
    auto withoutInfo = record(kAppex, Value(), other);
    auto bare = record(kPlugin, Value());

    ASSERT_TRUE(withInfo && withoutInfo && bare);
    EXPECT_EQ(withInfo->bundleInfoDictionary(), bundleInfo);
    EXPECT_EQ(withInfo->plugInDictionary(), complete());
    EXPECT_TRUE(withoutInfo->bundleInfoDictionary().isNone());
    EXPECT_EQ(withoutInfo->plugInDictionary(), other);
    EXPECT_TRUE(bare->plugInDictionary().isNone());
    EXPECT_TRUE(bare->attributes().isNone());
    EXPECT_TRUE(bare->version().isNone());
    EXPECT_TRUE(bare->protocolSpec().isNone());
    EXPECT_EQ(bare->diagnose()->description(), "missing \"QSExtensionProtocol\" key in Info.vlist or SDK");
    // "Multiple" only at the top level is nobody's concern; inside the plug-in dictionary it is logged.
    EXPECT_TRUE(capture.records().empty());
    EXPECT_TRUE(record(kAppex, info(complete({ { "Multiple", true } }))));
    expectLogged(capture, "multiplexed plug-ins (Multiple key) obsolete and ignored", LogLevel::Default);

    // A refused dictionary still replaces the info dictionary, and only that.
    const Value noExtension = Value::dictionary({ { "VBBundleIdentifier", "y" } });
    EXPECT_FALSE(withInfo->setDictionaries(noExtension));
    EXPECT_FALSE(withInfo->setDictionaries(Value("not a dictionary")));
    EXPECT_EQ(withInfo->bundleInfoDictionary(), noExtension);
    EXPECT_EQ(withInfo->plugInDictionary(), complete());
}

TEST(OMPlugInCoreSetup, SetsOnlyIdentityAndDictionaries)
{
    const auto given = Uuid::parse("0f3e9a4c-2b1d-4c5e-8f70-112233445566");
    auto first = record(kAppex, info(complete()), Value(), given);
    auto second = record(kAppex, info(complete()));
    auto third = record(kAppex, info(complete()));

    EXPECT_EQ(first->uuid(), given);
    ASSERT_TRUE(second->uuid() && third->uuid());
    EXPECT_FALSE(*second == *third);
    EXPECT_EQ(first->identifier(), "com.example.share");
    EXPECT_EQ(first->url(), "file://" + kAppex);
    EXPECT_FALSE(first->originalIdentifier() || first->containingUrl() || first->localizedName());
    EXPECT_FALSE(first->cdhash() || first->requirement() || first->onSystemVolume());
    EXPECT_TRUE(first->entitlements().isNone() && first->annotations().isNone());
    EXPECT_EQ(first->hubProtocolVersion(), 0u);
    EXPECT_EQ(first->lastModified(), 0);
}

TEST(OMPlugInCoreKinds, DerivedFromPathAndPlugInDictionary)
{
    const struct {
        std::string path;
        Value plugIn;
        Value protocol, principal;
        bool appExtension, hybrid, dedicated, data;
    } cases[] = {
        { kAppex, Value::dictionary({}), "QSObject", "QSObject", true, false, false, false },
        { kAppex, Value::dictionary({ { "QSExtensionProtocol", "P" }, { "PrincipalClass", "C" } }), "P", "C", true },
        { kPlugin, Value::dictionary({}), Value(), Value(), false },
        { "/Apps/Share.APPEX", Value::dictionary({}), Value(), Value(), false },
        { "/Apps/Share.appex.old", Value::dictionary({}), Value(), Value(), false },
        { kPlugin, Value::dictionary({ { "EmbeddedCode", false } }), Value(), Value(), false, true },
        { kPlugin, Value::dictionary({ { "Dedicated", false } }), Value(), Value(), false, false, false },
        { kPlugin, Value::dictionary({ { "Dedicated", 0 } }), Value(), Value(), false, false, false },
        { kPlugin, Value::dictionary({ { "Dedicated", true } }), Value(), Value(), false, false, true },
        { kPlugin, Value::dictionary({ { "Dedicated", 1 } }), Value(), Value(), false, false, true },
        { kPlugin, Value::dictionary({ { "Dedicated", "YES" } }), Value(), Value(), false, false, true },
        { kPlugin, Value::dictionary({ { "Dedicated", "no" } }), Value(), Value(), false, false, false },
        { kPlugin, Value::dictionary({ { "QSExtensionProtocol", "#Data" } }), "#Data", Value(), false, false, false,
            true },
        { kPlugin, Value::dictionary({ { "QSExtensionProtocol", "#data" } }), "#data", Value(), false },
        { kPlugin, Value::dictionary({ { "QSExtensionProtocol", "#Data " } }), "#Data ", Value(), false },
    };
    for (const auto& test : cases) {
        auto plugIn = record(test.path, Value(), test.plugIn);
        const std::string name = test.path + " " + test.plugIn.description();
        EXPECT_EQ(plugIn->protocolSpec(), test.protocol) << name;
        EXPECT_EQ(plugIn->principalSpec(), test.principal) << name;
        EXPECT_EQ(plugIn->isAppExtension(), test.appExtension) << name;
        EXPECT_EQ(plugIn->isHybrid(), test.hybrid) << name;
        EXPECT_EQ(plugIn->isDedicated(), test.dedicated) << name;
        EXPECT_EQ(plugIn->isData(), test.data) << name;
        EXPECT_FALSE(plugIn->isMultiplexed()) << name;
    }
}

TEST(OMPlugInCoreKinds, PropertiesReadThroughTheKeyLookups)
{
    auto plugIn = record(
        "/Apps/With Space.app/PlugIns/Share.plugin", Value(), complete({ { "EmbeddedProtocol", "Embedded" } }));
    plugIn->setContainingUrl(OMBundle::fileURL("/Apps/With Space.app"));
    plugIn->setLastModified(-2);

    EXPECT_EQ(plugIn->path(), "/Apps/With Space.app/PlugIns/Share.plugin");
    EXPECT_EQ(plugIn->containingPath(), "/Apps/With Space.app");
    EXPECT_EQ(plugIn->version(), Value("2.1"));
    EXPECT_EQ(plugIn->sdkSpec(), Value("com.orvex.share"));
    EXPECT_EQ(plugIn->embeddedProtocolSpec(), Value("Embedded"));
    EXPECT_FALSE(plugIn->embeddedCodePath());
    EXPECT_EQ(plugIn->timestamp().time_since_epoch().count(), -2);

    // A subclass constructs itself by the same steps, and its lookups decide every derived property.
    Derived derived;
    EXPECT_EQ(derived.diagnose()->description(),
        "missing identifier (no QSExtensionIdentifier, nor even VBBundleIdentifier)");
    ASSERT_TRUE(derived.constructWithName("com.example.d", OMBundle::fileURL(kPlugin), Value(), complete(), {}));
    EXPECT_EQ(derived.plugInDictionary(), complete());
    derived.plugInAnswers["QSExtensionProtocol"] = "#Data";
    derived.plugInAnswers["Dedicated"] = true;
    EXPECT_TRUE(derived.isData());
    EXPECT_TRUE(derived.isDedicated());
    EXPECT_EQ(derived.embeddedProtocolSpec(), Value("#Data"));
}

TEST(OMPlugInCoreKinds, CanonicalFormAlwaysHoldsAVersion)
{
    const struct {
        const char* name;
        Value bundleInfo;
        Value expected;
    } cases[] = {
        { "declared", info(complete()), "2.1" },
        { "short version", info(Value::dictionary({}), { { "VBBundleShortVersionString", "3.0" } }), "3.0" },
        { "nothing", info(Value::dictionary({ { "QSExtensionAttributes", "not a dictionary" } })), "1" },
    };
    for (const auto& test : cases) {
        auto plugIn = record(kAppex, test.bundleInfo);
        const Value before = plugIn->plugInDictionary();
        plugIn->canonicalize();
        EXPECT_EQ(plugIn->attributes()["QSExtensionVersion"], test.expected) << test.name;
        EXPECT_EQ(plugIn->plugInDictionary().count(), std::max<size_t>(before.count(), 1)) << test.name;
    }
}

TEST(OMPlugInCoreKinds, ConfigurationStyleFollowsTheInfoDictionary)
{
    auto current = record(kAppex, info(complete(), { { "Ombrel", true } }));
    EXPECT_FALSE(current->oldStyle());
    current->setBundleInfoDictionary(Value::dictionary({ { "Ombrel", Value::dictionary({}) } }));
    EXPECT_TRUE(current->oldStyle());
}

TEST(OMPlugInCoreDeathTest, NeitherStyleIsAProgrammingError)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    auto neither = record(kAppex, Value(), complete());
    EXPECT_DEATH((void)neither->oldStyle(), "unknown plug-in configuration style");
    EXPECT_DEATH(neither->resolveSDK(), "cannot resolve SDK without materialized Info.vlist");
}

TEST(OMPlugInCoreDiagnose, FirstFailingCheckWins)
{
    const Value proxy = Value::dictionary({});
    const struct {
        std::string path;
        Value plugIn;
        const char* message; // nullptr: well-formed
    } cases[] = {
        { kPlugin, Value::dictionary({ { "PassProxy", proxy }, { "EmbeddedCode", "x" } }),
            "missing \"QSExtensionProtocol\" key in Info.vlist or SDK" },
        { kPlugin, Value::dictionary({ { "QSExtensionProtocol", "P" }, { "PassProxy", proxy } }),
            "missing \"QSExtensionAttributes\" key in Info.vlist or SDK" },
        { kAppex, complete({ { "PrincipalClass", "Other" }, { "PassProxy", proxy }, { "EmbeddedCode", "x" } }),
            "Application Extensions may not use the \"PrincipalClass\" key" },
        { kAppex, complete({ { "PrincipalClass", "QSObject" }, { "PassProxy", proxy }, { "EmbeddedCode", "x" } }),
            "the \"PassProxy\" key is not supported on this platform" },
        { kPlugin, complete({ { "PrincipalClass", "Other" }, { "EmbeddedCode", "x" } }),
            "hybrid plug-ins are not supported on this platform" },
        { kAppex, Value::dictionary({ { "QSExtensionAttributes", Value::dictionary({}) } }), nullptr },
        { kPlugin, complete({ { "PrincipalClass", "Other" } }), nullptr },
    };
    for (const auto& test : cases) {
        auto error = record(test.path, Value(), test.plugIn)->diagnose();
        if (!test.message) {
            EXPECT_FALSE(error) << test.plugIn.description();
            continue;
        }
        ASSERT_TRUE(error) << test.message;
        EXPECT_EQ(*error, om::OMError("Ombrel", 12, test.message));
    }
}

TEST(OMPlugInCoreIdentity, TheUuidAloneDecides)
{
    const auto shared = Uuid::random();
    auto first = record(kAppex, info(complete()), Value(), shared);
    auto second = OMPlugInCore::initWithName("com.example.other", OMBundle::fileURL(kPlugin), Value(), Value(), shared);
    auto third = record(kAppex, info(complete()));

    EXPECT_TRUE(*first == *second);
    EXPECT_EQ(first->hash(), second->hash());
    EXPECT_EQ(std::hash<OMPlugInCore>()(*first), first->hash());
    EXPECT_FALSE(first->isEqual(*third));
    std::unordered_set<std::shared_ptr<const OMPlugInCore>, OMPlugInCore::Hash, OMPlugInCore::Equal> set { first,
        second, third };
    EXPECT_EQ(set.size(), 2u);
}

class OMPlugInCoreSDK : public ::testing::Test {
protected:
    void SetUp() override { ::setenv("REGISTRAR_SDK_DIR", m_fixture.root().c_str(), 1); }
    void TearDown() override { ::unsetenv("REGISTRAR_SDK_DIR"); }

    void installSdk(const std::string& name, const Value& entry)
    {
        m_fixture.writeFile(name + ".vlist", om::Vlist::writeXml(entry));
    }

    om::test::BundleFixture m_fixture;
};

TEST_F(OMPlugInCoreSDK, EntryCompletesTheInfoDictionaryByTheMergeRules)
{
    const Value big = Value::array({ "kept", "whole" });
    const Value plugInInfo = info(Value::dictionary({ { "QSExtensionPointIdentifier", "com.orvex.share" },
                                      { "CleanTimeout", 10 }, { "Shared", Value::array({ "a", "b" }) }, { "Big", big },
                                      { "QSExtensionAttributes", Value::dictionary({ { "Kept", "plug-in" } }) } }),
        { { "VBBundleShortVersionString", "4.0" } });
    const Value sdk = Value::dictionary({ { "SdkOnly", "top" },
        { "QSExtension",
            Value::dictionary({ { "CleanTimeout", 30 }, { "Shared", Value::array({ "b", "c" }) },
                { "QSExtensionProtocol", "ShareProtocol" },
                { "QSExtensionAttributes", Value::dictionary({ { "Kept", "sdk" }, { "Added", "sdk" } }) } }) } });
    installSdk("com.orvex.share", sdk);
    auto plugIn = record(kAppex, plugInInfo);
    Log::Capture capture;

    plugIn->resolveSDK();

    EXPECT_TRUE(capture.records().empty());
    EXPECT_EQ(plugIn->infoKey("SdkOnly"), Value("top"));
    EXPECT_EQ(plugIn->pluginKey("CleanTimeout"), Value(30));
    EXPECT_EQ(plugIn->pluginKey("QSExtensionProtocol"), Value("ShareProtocol"));
    std::vector<std::string> shared;
    for (const Value& name : plugIn->pluginKey("Shared").elements())
        shared.push_back(*name.asString());
    std::sort(shared.begin(), shared.end());
    EXPECT_EQ(shared, (std::vector<std::string> { "a", "b", "c" }));
    EXPECT_EQ(plugIn->attributes(),
        Value::dictionary({ { "Kept", "plug-in" }, { "Added", "sdk" }, { "QSExtensionVersion", "4.0" } }));
    // The record's previous dictionaries are untouched, and what the merge kept is shared, not copied.
    EXPECT_EQ(plugInInfo["QSExtension"]["CleanTimeout"], Value(10));
    EXPECT_EQ(plugIn->pluginKey("Big").elements().data(), big.elements().data());
}

TEST_F(OMPlugInCoreSDK, WithoutAnEntryTheRecordIsStillCanonical)
{
    const struct {
        const char* name;
        Value extensionPoint;
        std::string message; // empty: nothing logged
        LogLevel level;
    } cases[] = {
        { "no extension point", Value(), "", LogLevel::Info },
        { "unregistered", "com.orvex.none", "plug-in sdk \"com.orvex.none\" not registered", LogLevel::Default },
        { "a path, not a name", "../escape", "plug-in sdk \"../escape\" not registered", LogLevel::Default },
    };
    for (const auto& test : cases) {
        DictionaryBuilder plugInDictionary;
        plugInDictionary.set("QSExtensionPointIdentifier", test.extensionPoint);
        auto plugIn = record(kAppex, info(plugInDictionary.build(), { { "VBBundleShortVersionString", "5" } }));
        Log::Capture capture;

        plugIn->resolveSDK();

        EXPECT_EQ(plugIn->version(), Value("5")) << test.name;
        if (test.message.empty())
            EXPECT_TRUE(capture.records().empty()) << test.name;
        else
            expectLogged(capture, test.message, test.level);
    }
}

TEST_F(OMPlugInCoreSDK, ExtensionPointThatIsNoStringLeavesTheRecordAlone)
{
    installSdk("42", Value::dictionary({ { "QSExtension", Value::dictionary({ { "Extra", 1 } }) } }));
    const Value plugInInfo = info(Value::dictionary({ { "QSExtensionPointIdentifier", 42 } }));
    auto plugIn = record(kAppex, plugInInfo);
    Log::Capture capture;

    plugIn->resolveSDK();

    expectLogged(capture, "invalid SDK key:42", LogLevel::Error);
    EXPECT_EQ(plugIn->bundleInfoDictionary(), plugInInfo);
    EXPECT_EQ(plugIn->plugInDictionary(), plugInInfo["QSExtension"]);
}

TEST_F(OMPlugInCoreSDK, SubclassSuppliesEntriesAndWidensOverrides)
{
    Derived derived;
    const Value bundleInfo = info(complete({ { "Shared", "solo" } }));
    ASSERT_TRUE(derived.constructWithName("com.example.d", OMBundle::fileURL(kAppex), bundleInfo, Value(), {}));
    derived.wideOverride = "QSExtensionAttributes";
    derived.suppliedSdk = Value::dictionary({ { "QSExtension",
        Value::dictionary({ { "Shared", Value::array({ "solo", "duo" }) },
            { "QSExtensionAttributes", Value::dictionary({ { "QSExtensionVersion", "9" } }) } }) } });

    derived.resolveSDK();

    EXPECT_EQ(derived.lookups, std::vector<std::string> { "com.orvex.share" });
    EXPECT_EQ(derived.attributes(), Value::dictionary({ { "QSExtensionVersion", "9" } }));
    // A single name counts as a list of one.
    EXPECT_EQ(derived.pluginKey("Shared"), Value::array({ "solo", "duo" }));
    EXPECT_EQ(
        OMPlugInCore::mergeSharedResources(Value::array({ "x", "x" }), Value::array({ "x" })), Value::array({ "x" }));
}

class OMPlugInCoreForm : public ::testing::Test {
protected:
    // A record every base value of which is present, its uuid read from lower-case text.
    std::shared_ptr<OMPlugInCore> exportable()
    {
        auto plugIn = record(kAppex, info(complete(), { { "VBBundleInfoVlistURL", "file:///x/Info.vlist" } }), Value(),
            Uuid::parse("0f3e9a4c-2b1d-4c5e-8f70-aabbccddeeff"));
        plugIn->setOriginalIdentifier("com.example.original");
        plugIn->setHubProtocolVersion(2);
        plugIn->setLastModified(1700000000);
        plugIn->setOnSystemVolume(true);
        return plugIn;
    }

    // exportable() with every optional value too.
    std::shared_ptr<OMPlugInCore> described()
    {
        auto plugIn = exportable();
        plugIn->setLocalizedShortName("Share");
        plugIn->setLocalizedName("Share It");
        plugIn->setLocalizedContainingName("Notes");
        plugIn->setContainingUrl(OMBundle::fileURL("/Apps/Notes.app"));
        plugIn->setEntitlements(Value::dictionary({ { "com.orvex.x", true } }));
        return plugIn;
    }

    static std::vector<std::string> keysOf(const Value& form)
    {
        std::vector<std::string> keys;
        for (const auto& [key, value] : form.entries())
            keys.push_back(key);
        return keys;
    }
};

TEST_F(OMPlugInCoreForm, ExportWritesTheBaseKeysInOrder)
{
    auto plugIn = exportable();
    std::optional<om::OMError> error;

    const Value form = plugIn->exportForm(&error);

    EXPECT_FALSE(error);
    EXPECT_EQ(keysOf(form),
        (std::vector<std::string> { "hubProtocolVersion", "path", "systemResident", "identifier", "original-identifier",
            "version", "bundleInfo", "info", "uuid", "lastmodified", "annotations" }));
    EXPECT_EQ(form["hubProtocolVersion"], Value(2u));
    EXPECT_EQ(form["path"], Value(kAppex));
    EXPECT_EQ(form["systemResident"], Value(true));
    EXPECT_EQ(form["original-identifier"], Value("com.example.original"));
    EXPECT_EQ(form["version"], Value("2.1"));
    EXPECT_FALSE(form["bundleInfo"].contains("VBBundleInfoVlistURL"));
    EXPECT_TRUE(plugIn->bundleInfoDictionary().contains("VBBundleInfoVlistURL"));
    EXPECT_EQ(form["info"], plugIn->plugInDictionary());
    EXPECT_EQ(form["uuid"], Value("0F3E9A4C-2B1D-4C5E-8F70-AABBCCDDEEFF"));
    EXPECT_EQ(form["lastmodified"], Value(1700000000));
    EXPECT_EQ(form["annotations"], Value::dictionary({}));
}

TEST_F(OMPlugInCoreForm, OptionalKeysFollowInTheirOrder)
{
    const Value form = described()->exportForm();

    const auto keys = keysOf(form);
    ASSERT_EQ(keys.size(), 16u);
    EXPECT_EQ(std::vector<std::string>(keys.begin() + 11, keys.end()),
        (std::vector<std::string> { "entitlements", "containingPath", "localizedContainingDisplayName",
            "localizedDisplayName", "localizedShortName" }));
    EXPECT_EQ(form["containingPath"], Value("/Apps/Notes.app"));
}

TEST_F(OMPlugInCoreForm, RecordMissingABaseValueIsNotExported)
{
    const struct {
        const char* name;
        std::function<void(OMPlugInCore&)> change;
    } cases[] = {
        { "original identifier", [](OMPlugInCore& r) { r.setOriginalIdentifier(std::nullopt); } },
        { "version", [](OMPlugInCore& r) { r.setPlugInDictionary(Value::dictionary({})); } },
        { "plug-in dictionary", [](OMPlugInCore& r) { r.setPlugInDictionary(Value()); } },
        { "info dictionary", [](OMPlugInCore& r) { r.setBundleInfoDictionary(Value()); } },
        { "url", [](OMPlugInCore& r) { r.setUrl("http://example.com/Share.appex"); } },
        { "uuid", [](OMPlugInCore& r) { r.setUuid(std::nullopt); } },
    };
    for (const auto& test : cases) {
        auto plugIn = exportable();
        test.change(*plugIn);
        std::optional<om::OMError> error;
        EXPECT_TRUE(plugIn->exportForm(&error).isNone()) << test.name;
        EXPECT_FALSE(error) << test.name;
    }
}

TEST_F(OMPlugInCoreForm, ReadingBackGivesTheSameRecord)
{
    auto plugIn = described();
    plugIn->setAnnotation("election", 1);
    // What travels under "info" is not what the reader takes.
    plugIn->setPlugInDictionary(complete({ { "OnlyInInfo", true } }));
    DictionaryBuilder form(plugIn->exportForm());
    form.set("hash", Value::data(std::vector<uint8_t>(20, 7)));
    form.set("requirement", "anything");

    auto read = OMPlugInCore::initWithForm(form.build());

    ASSERT_TRUE(read);
    EXPECT_TRUE(*read == *plugIn);
    EXPECT_EQ(read->identifier(), plugIn->identifier());
    EXPECT_EQ(read->path(), plugIn->path());
    EXPECT_EQ(read->version(), plugIn->version());
    EXPECT_EQ(read->originalIdentifier(), plugIn->originalIdentifier());
    EXPECT_EQ(read->hubProtocolVersion(), 2u);
    EXPECT_EQ(read->lastModified(), 1700000000);
    EXPECT_TRUE(read->onSystemVolume());
    EXPECT_EQ(read->localizedName(), "Share It");
    EXPECT_EQ(read->localizedShortName(), "Share");
    EXPECT_EQ(read->localizedContainingName(), "Notes");
    EXPECT_EQ(read->containingUrl(), plugIn->containingUrl());
    EXPECT_EQ(read->entitlements(), plugIn->entitlements());
    EXPECT_EQ(read->annotations(), Value::dictionary({ { "election", 1 } }));
    EXPECT_EQ(read->plugInDictionary(), complete());
    EXPECT_EQ(read->cdhash(), std::vector<uint8_t>(20, 7));
    EXPECT_EQ(read->requirement(), "anything");
}

TEST_F(OMPlugInCoreForm, ReaderDefaultsAndUuids)
{
    const Value minimal = Value::dictionary({ { "path", kAppex }, { "identifier", "com.example.share" } });
    auto read = OMPlugInCore::initWithForm(minimal);
    ASSERT_TRUE(read);
    EXPECT_EQ(read->hubProtocolVersion(), 1u);
    EXPECT_EQ(read->lastModified(), 0);
    EXPECT_FALSE(read->onSystemVolume() || read->localizedName() || read->containingUrl());
    EXPECT_TRUE(read->bundleInfoDictionary().isNone() && read->plugInDictionary().isNone());
    EXPECT_TRUE(read->annotations().isNone());

    auto exporter = exportable();
    const Value form = exporter->exportForm();
    for (const Value& uuid : { Value("not a uuid"), Value(7), Value() }) {
        DictionaryBuilder changed(form);
        changed.set("uuid", uuid);
        auto other = OMPlugInCore::initWithForm(changed.build());
        ASSERT_TRUE(other && other->uuid()) << uuid.description();
        EXPECT_FALSE(*other == *exporter) << uuid.description();
    }
    DictionaryBuilder native(form);
    native.set("uuid", Value::uuid(*exporter->uuid()));
    EXPECT_TRUE(*OMPlugInCore::initWithForm(native.build()) == *exporter);
}

TEST_F(OMPlugInCoreForm, FormsThatNameNoPlugInAreRefused)
{
    const Value form = exportable()->exportForm();
    const struct {
        const char* name;
        const char* key;
        Value value;
        std::string message;
    } cases[] = {
        { "no path", "path", Value(), "" },
        { "path not a string", "path", 7, "" },
        { "no identifier", "identifier", Value(), "missing identifier in plug-in at " + kAppex },
        { "bundleInfo an array", "bundleInfo", Value::array({}),
            "malformed plug-in dictionary in plug-in com.example.share at file://" + kAppex + ": ()" },
    };
    for (const auto& test : cases) {
        DictionaryBuilder changed(form);
        changed.set(test.key, test.value);
        Log::Capture capture;
        EXPECT_FALSE(OMPlugInCore::initWithForm(changed.build())) << test.name;
        if (test.message.empty())
            EXPECT_TRUE(capture.records().empty()) << test.name;
        else
            EXPECT_EQ(capture.count(test.message), 1u) << test.name;
    }
}

TEST_F(OMPlugInCoreForm, AnnotationsAreReplacedWhole)
{
    auto plugIn = exportable();
    plugIn->setAnnotation("gone", "x");
    plugIn->setAnnotation("election", 1);
    const Value held = plugIn->annotations();

    plugIn->setAnnotation("gone", Value());
    plugIn->setAnnotation("election", 2);

    EXPECT_EQ(plugIn->annotations(), Value::dictionary({ { "election", 2 } }));
    EXPECT_EQ(held, Value::dictionary({ { "gone", "x" }, { "election", 1 } }));
    plugIn->updateFromForm(Value::dictionary({ { "annotations", Value::dictionary({ { "other", true } }) } }));
    EXPECT_EQ(plugIn->annotations(), Value::dictionary({ { "other", true } }));
    plugIn->updateFromForm(Value::dictionary({}));
    EXPECT_TRUE(plugIn->annotations().isNone());
    EXPECT_EQ(plugIn->identifier(), "com.example.share");
    plugIn->setAnnotation("absent", Value());
    EXPECT_EQ(plugIn->annotations(), Value::dictionary({}));
}

TEST_F(OMPlugInCoreForm, ConcurrentAnnotationChangesAreNotLost)
{
    auto plugIn = exportable();
    constexpr int kThreads = 4;
    constexpr int kEach = 200;
    std::latch start(kThreads);
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([&, t] {
            start.arrive_and_wait();
            for (int i = 0; i < kEach; ++i)
                plugIn->setAnnotation(std::to_string(t) + "." + std::to_string(i), i);
        });
    }
    for (auto& thread : threads)
        thread.join();
    EXPECT_EQ(plugIn->annotations().count(), size_t(kThreads * kEach));
}
