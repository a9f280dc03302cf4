// Attribute matching against one hand-made plug-in record: every operator with the nearest pair
// on both sides of its boundary, the true and false patterns over every kind of value, the special
// keys, the election text, type conformance over the machine's real type database, activation rules,
// and the order in which a dictionary's keys are tried.
#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <memory>
#include <string>
#include <vector>

#include "Ombrel/OMBundle.h"
#include "Ombrel/OMMatcher.h"
#include "Ombrel/OMPlugInCore.h"
#include "platform/Format.h"
#include "platform/Log.h"

namespace om::test {
namespace {

const Uuid kUuid = *Uuid::parse("0A1B2C3D-4E5F-6071-8293-A4B5C6D7E8F9");

Value attributes()
{
    return Value::dictionary({
        { "QSExtensionVersion", "2.10" },
        { "Kind", "photo" },
        { "Letter", "a" },
        { "Digit", "0" },
        { "Last", "z" },
        { "EmptyText", "" },
        { "Tags", Value::array({ "a", "b" }) },
        { "NoTags", Value::array({}) },
        { "Mixed", Value::array({ Value(5), "m" }) },
        { "Count", Value(5) },
        { "Zero", Value(0) },
        { "ZeroReal", Value(0.0) },
        { "No", Value(false) },
        { "Yes", Value(true) },
        { "Nested", Value::dictionary({ { "inner", "x" } }) },
        { "When", Value::date(1000) },
        { "Blob", Value::data(std::vector<uint8_t> { '5' }) },
        { "MimeType", "image/svg+xml" },
        { "QSExtensionActivationRule", Value::dictionary({ { "image/png", 1 }, { "text/plain", 2 } }) },
    });
}

std::shared_ptr<OMPlugInCore> makeRecord()
{
    const Value plugIn = Value::dictionary({
        { "QSExtensionPointIdentifier", "com.orvex.share" },
        { "QSExtensionAttributes", attributes() },
    });
    const Value info = Value::dictionary({
        { "VBBundleIdentifier", "com.example.share" },
        { "InfoOnly", "from-info" },
        { "Kind", "info-kind" },
        { "QSExtension", plugIn },
    });
    auto record = OMPlugInCore::initWithName(
        "com.example.share", OMBundle::fileURL("/Apps/Notes.app/PlugIns/Share.appex"), info, Value(), kUuid);
    if (!record)
        return nullptr;
    record->setContainingUrl(OMBundle::fileURL("/Apps/Notes.app"));
    record->setEntitlements(Value::dictionary({
        { "com.example.allowed", true },
        { "com.example.off", false },
        { "com.example.tier", "gold" },
    }));
    return record;
}

struct Case {
    const char* key;
    Value pattern;
    bool matches;
};

class OMMatcherTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        m_record = makeRecord();
        ASSERT_TRUE(m_record);
    }

    OMMatcher matcher() const
    {
        return OMMatcher([this](const OMPlugInCore&) { return m_annotation; });
    }

    void expectCases(const std::vector<Case>& cases, const OMPlugInCore& record) const
    {
        const OMMatcher evaluator = matcher();
        for (const auto& test : cases) {
            EXPECT_EQ(evaluator.matchKey(record, test.key, test.pattern), test.matches)
                << test.key << " against " << test.pattern.description();
            // The whole-dictionary form of one key answers the same.
            EXPECT_EQ(evaluator.match(record, Value::dictionary({ { test.key, test.pattern } })), test.matches)
                << test.key << " against " << test.pattern.description();
        }
    }
    void expectCases(const std::vector<Case>& cases) const { expectCases(cases, *m_record); }

    std::shared_ptr<OMPlugInCore> m_record;
    Value m_annotation;
};

TEST_F(OMMatcherTest, EachOperatorAcrossItsBoundary)
{
    // The version "2.10": digit runs compare by value, so 2.9 < 2.10 < 2.11.
    expectCases({
        { "QSExtensionVersion", "=2.10", true },
        { "QSExtensionVersion", "=2.9", false },
        { "QSExtensionVersion", "=2.010", true }, // leading zeros do not count
        { "QSExtensionVersion", "<>2.9", true },
        { "QSExtensionVersion", "<>2.10", false },
        { "QSExtensionVersion", "<=2.10", true },
        { "QSExtensionVersion", "<=2.9", false },
        { "QSExtensionVersion", ">=2.10", true },
        { "QSExtensionVersion", ">=2.11", false },
        { "QSExtensionVersion", "<2.11", true },
        { "QSExtensionVersion", "<2.10", false },
        { "QSExtensionVersion", ">2.9", true },
        { "QSExtensionVersion", ">2.10", false },
        { "QSExtensionVersion", "2.10", true }, // no operator: equality
        { "QSExtensionVersion", "2.1", false },
        { "QSExtensionVersion", "=2.10.0", false }, // the shorter text orders first
        { "QSExtensionVersion", "<2.10.0", true },
        { "Kind", "=Photo", false }, // case-sensitive, no wildcard or prefix forms
        { "Kind", "=phot", false },
        { "Kind", "=*", false },
        { "Kind", "photo", true },
    });
}

TEST_F(OMMatcherTest, TwoCharacterOperatorsAreNeverReadAsOneCharacterOnes)
{
    // Each pattern answers differently when misread as the one-character operator followed by an
    // operand that begins with the second character.
    expectCases({
        { "Letter", "<=a", true }, // "a" < "=a" is false
        { "Digit", ">=0", true }, // "0" > "=0" is false
        { "Last", "<>y", true }, // "z" < ">y" is false
    });
}

TEST_F(OMMatcherTest, OperatorWithEmptyOperandComparesWithTheEmptyText)
{
    expectCases({
        { "EmptyText", "<=", true },
        { "Kind", "<=", false },
        { "EmptyText", "=", true },
        { "Kind", "=", false },
        { "Kind", ">", true },
        { "EmptyText", "", true },
        { "Kind", "", false },
    });
}

TEST_F(OMMatcherTest, TrueAndFalsePatternsOverEveryKindOfValue)
{
    const Value truePatterns[] = { Value(true), Value(1), Value(1u), Value(1.0) };
    const Value falsePatterns[] = { Value(false), Value(0), Value(0u), Value(0.0) };
    struct Row {
        const char* key;
        bool isTrue; // what a true pattern answers; a false pattern answers the opposite
    };
    const Row rows[] = {
        { "Kind", true },
        { "Digit", true }, // the text "0" is not the number 0
        { "EmptyText", true },
        { "Count", true },
        { "Zero", false },
        { "ZeroReal", false },
        { "No", false },
        { "Yes", true },
        { "Tags", true },
        { "NoTags", true },
        { "Nested", true },
        { "When", true },
        { "Blob", true },
        { "Missing", false },
    };
    std::vector<Case> cases;
    for (const auto& row : rows) {
        for (const auto& pattern : truePatterns)
            cases.push_back({ row.key, pattern, row.isTrue });
        for (const auto& pattern : falsePatterns)
            cases.push_back({ row.key, pattern, !row.isTrue });
    }
    expectCases(cases);
}

TEST_F(OMMatcherTest, OperatorPatternsOverEveryKindOfValue)
{
    expectCases({
        { "Count", "5", false }, // numbers are tested only with the true and false patterns
        { "Count", "=5", false },
        { "Zero", "0", false },
        { "Digit", "0", true },
        { "Digit", "=0", true },
        { "Yes", "1", false },
        { "Tags", "=b", true }, // any element may match
        { "Tags", "=c", false },
        { "Tags", Value::array({ "=x", "=a" }), true },
        { "NoTags", "=", false },
        { "NoTags", "<>a", false },
        { "Mixed", "=m", true }, // elements that are no text are passed over
        { "Mixed", "5", false },
        { "Nested", "=x", false },
        { "When", "=1000", false },
        { "Blob", "5", false },
        { "Missing", "=", false },
        { "Missing", "<>x", false },
        { "Missing", Value::dictionary({ { "types", Value::array({ "image/png" }) } }), false },
    });
}

TEST_F(OMMatcherTest, PatternKinds)
{
    expectCases({
        { "Kind", Value::array({ "=1", "=photo" }), true }, { "Kind", Value::array({ "=1", "=2" }), false },
        { "Kind", Value::array({}), false },
        { "Kind", Value::array({ Value(5), "photo" }), true }, // elements that are no text never match
        { "Kind", Value::array({ Value(1) }), false },
        { "Kind", Value(2), false }, // a number other than 1 and 0 is no pattern
        { "Kind", Value(-1), false }, { "Kind", Value(0.5), false },
        { "Kind", Value::data(std::vector<uint8_t> { 'p' }), false }, { "Kind", Value::date(0), false },
        { "Kind", Value::uuid(kUuid), false },
        { "Kind", Value::dictionary({ { "types", Value::array({ "image/png" }) } }), false }, // no rule
    });
}

TEST_F(OMMatcherTest, AttributesComeBeforeTheInfoDictionary)
{
    expectCases({
        { "Kind", "=photo", true },
        { "Kind", "=info-kind", false },
        { "InfoOnly", "=from-info", true },
        { "VBBundleIdentifier", "=com.example.share", true },
    });
}

TEST_F(OMMatcherTest, SpecialKeys)
{
    expectCases({
        { "QSExtensionIdentifier", "=com.example.share", true },
        { "QSExtensionIdentifier", "=com.example.shar", false },
        { "com.orvex.uuid", "=0A1B2C3D-4E5F-6071-8293-A4B5C6D7E8F9", true },
        { "com.orvex.uuid", "=0a1b2c3d-4e5f-6071-8293-a4b5c6d7e8f9", false },
        { "QSExtensionContainingApp", "=/Apps/Notes.app", true },
        { "QSExtensionContainingApp", "=/Apps/Notes.app/", false }, { "QSExtensionContainingApp", Value(true), true },
        { "QSExtensionContainingApp", Value(false), false },
        { "QSExtensionPointIdentifier", "=com.orvex.share", false }, // only the attributes and info
    });
}

TEST_F(OMMatcherTest, WithoutContainingAppTheKeyFailsWhateverThePattern)
{
    m_record->setContainingUrl(std::nullopt);
    expectCases({
        { "QSExtensionContainingApp", Value(false), false },
        { "QSExtensionContainingApp", Value(0), false },
        { "QSExtensionContainingApp", Value(true), false },
        { "QSExtensionContainingApp", "<>x", false },
        { "QSExtensionContainingApp", "=", false },
    });
}

TEST_F(OMMatcherTest, SpecialKeyWithoutItsValueFallsBackToTheAttributes)
{
    auto record = makeRecord();
    ASSERT_TRUE(record);
    record->setIdentifier(std::nullopt);
    // Not an attribute either: absent.
    expectCases(
        {
            { "QSExtensionIdentifier", Value(false), true },
            { "QSExtensionIdentifier", "=com.example.share", false },
            { "VBBundleIdentifier", "=com.example.share", true },
        },
        *record);
}

TEST_F(OMMatcherTest, EntitlementKeysReadOnlyTheEntitlements)
{
    expectCases({
        { "ENTITLEMENT:com.example.tier", "=gold", true }, { "ENTITLEMENT:com.example.tier", "=Gold", false },
        { "ENTITLEMENT:com.example.allowed", Value(true), true },
        { "ENTITLEMENT:com.example.allowed", Value(false), false },
        { "ENTITLEMENT:com.example.off", Value(false), true }, { "ENTITLEMENT:com.example.off", Value(true), false },
        { "ENTITLEMENT:com.example.missing", Value(false), true },
        { "ENTITLEMENT:com.example.missing", Value(true), false },
        // An attribute of the same name is never consulted.
        { "ENTITLEMENT:Kind", Value(true), false }, { "ENTITLEMENT:Kind", "=photo", false },
        { "ENTITLEMENT:", Value(false), true },
        { "entitlement:com.example.tier", Value(true), false }, // the prefix is case-sensitive
    });
}

TEST_F(OMMatcherTest, ElectionText)
{
    struct Row {
        Value annotation;
        const char* text;
    };
    const Row rows[] = {
        { Value(), "0" },
        { Value::dictionary({}), "0" },
        { Value::dictionary({ { "extension", Value::dictionary({}) } }), "0" },
        { Value::dictionary({ { "election", 1 } }), "1" },
        { Value::dictionary({ { "election", 2 } }), "2" },
        { Value::dictionary({ { "election", 255 } }), "255" },
        { Value::dictionary({ { "election", 256 } }), "0" }, // bits 8 to 15 are cleared
        { Value::dictionary({ { "election", 257 } }), "1" },
        { Value::dictionary({ { "election", 0xffff } }), "255" },
        { Value::dictionary({ { "election", 0x10000 } }), "65536" }, // bit 16 stays
        { Value::dictionary({ { "election", 0x10101 } }), "65537" },
        { Value::dictionary({ { "election", int64_t(0x100000001) } }), "1" }, // taken as 32 bits
        { Value::dictionary({ { "election", -1 } }), "-65281" },
        { Value::dictionary({ { "election", std::numeric_limits<uint64_t>::max() } }), "-65281" },
        { Value::dictionary({ { "election", true } }), "1" },
        { Value::dictionary({ { "election", false } }), "0" },
        { Value::dictionary({ { "election", 2.9 } }), "2" },
        { Value::dictionary({ { "election", -2.9 } }), "-65282" }, // -2, with bits 8 to 15 cleared
        { Value::dictionary({ { "election", std::nan("") } }), "0" },
        { Value::dictionary({ { "election", "1" } }), "0" }, // not a number
        { Value("election"), "0" },
    };
    for (const auto& row : rows)
        EXPECT_EQ(OMMatcher::electionText(row.annotation), row.text) << row.annotation.description();
}

TEST_F(OMMatcherTest, ElectionIsMatchedAsText)
{
    expectCases({
        { "QSUserElection", "0", true }, // never elected
        { "QSUserElection", "=0", true },
        { "QSUserElection", "=1", false },
        { "QSUserElection", Value(true), true }, // the text "0" is present and not the number 0
        { "QSUserElection", Value(false), false },
    });
    m_annotation = Value::dictionary({ { "election", 257 } });
    expectCases({
        { "QSUserElection", "=1", true },
        { "QSUserElection", "=257", false },
        { "QSUserElection", Value::array({ "=2", "=1" }), true },
        { "QSUserElection", ">0", true },
        { "QSUserElection", ">1", false },
    });
    m_annotation = Value::dictionary({ { "election", 1.0 } });
    expectCases({ { "QSUserElection", "=1", true }, { "QSUserElection", "=1.0", false } });
}

TEST_F(OMMatcherTest, ElectionWithoutALookupIsZero)
{
    const OMMatcher withoutLookup(nullptr);
    EXPECT_TRUE(withoutLookup.matchKey(*m_record, "QSUserElection", "=0"));
    EXPECT_FALSE(withoutLookup.matchKey(*m_record, "QSUserElection", "=1"));
}

TEST_F(OMMatcherTest, TypeConformanceFollowsTheTypeDatabase)
{
    // image/svg+xml is a subclass of application/xml; text/xml is an alias of application/xml.
    expectCases({
        { "MimeType", "?TY-CONFORMS:application/xml", true },
        { "MimeType", "?TY-CONFORMS:APPLICATION/XML", true },
        { "MimeType", "?TY-CONFORMS:text/xml", true },
        { "MimeType", "?TY-CONFORMS:application/octet-stream", true },
        { "MimeType", "?TY-CONFORMS:image/png", false },
        { "MimeType", "?TY-CONFORMS:", false },
        { "MimeType", "?TY-IS:image/svg+xml", true },
        { "MimeType", "?TY-IS:application/xml", false }, // the other way round
        { "Kind", "?TY-IS:image/svg+xml", false }, // "photo" is no type
        { "Tags", "?TY-CONFORMS:text/plain", false },
        { "MimeType", Value::array({ "?TY-CONFORMS:image/png", "?TY-CONFORMS:application/xml" }), true },
    });
}

TEST_F(OMMatcherTest, UnrecognizedOperatorIsLoggedAndNeverMatches)
{
    for (const char* pattern : { "?MATCH:image/svg+xml", "?", "?ty-conforms:application/xml", "?TY-CONFORMS" }) {
        Log::Capture log;
        EXPECT_FALSE(matcher().matchKey(*m_record, "MimeType", pattern)) << pattern;
        const auto records = log.records();
        ASSERT_EQ(records.size(), 1u) << pattern;
        EXPECT_EQ(records[0].message, format("unrecognized match operator:%@", pattern));
        EXPECT_EQ(records[0].subsystem, "com.orvex.Ombrel");
        EXPECT_EQ(records[0].category, "ops");
        EXPECT_EQ(records[0].level, LogLevel::Info);
    }
}

TEST_F(OMMatcherTest, ItemDescriptionIsTestedAgainstTheActivationRule)
{
    auto items = [](std::vector<Value> types) {
        return Value::dictionary({ { "types", Value::array(std::move(types)) } });
    };
    expectCases({
        { "QSExtensionActivationRule", items({ "image/png" }), true },
        { "QSExtensionActivationRule", items({ "image/png", "image/png" }), false }, // one image at most
        { "QSExtensionActivationRule", items({ "text/x-csrc", "text/plain" }), true }, // a subclass counts
        { "QSExtensionActivationRule", items({ "text/plain", "text/plain", "text/plain" }), false },
        { "QSExtensionActivationRule", items({ "application/pdf" }), false },
        { "QSExtensionActivationRule", items({}), false },
        { "QSExtensionActivationRule", Value::dictionary({}), false },
        { "Kind", items({ "image/png" }), false }, // a text is no rule
        { "Nested", items({ "image/png" }), false },
    });

    Log::Capture log;
    const Value pattern = items({ "image/png" });
    EXPECT_TRUE(matcher().matchKey(*m_record, "QSExtensionActivationRule", pattern));
    const auto records = log.records();
    ASSERT_EQ(records.size(), 1u);
    EXPECT_EQ(records[0].message,
        format("evaluating QSExtension filter: %@ value: %@", pattern, attributes()["QSExtensionActivationRule"]));
    EXPECT_EQ(records[0].category, "extension");
    EXPECT_EQ(records[0].level, LogLevel::Debug);
}

TEST_F(OMMatcherTest, DictionaryMatchesWhenEveryKeyDoesAndStopsAtTheFirstThatDoesNot)
{
    const OMMatcher evaluator = matcher();
    EXPECT_TRUE(evaluator.match(*m_record, Value()));
    EXPECT_TRUE(evaluator.match(*m_record, Value::dictionary({})));
    EXPECT_TRUE(evaluator.match(*m_record, Value::dictionary({ { "Kind", "photo" }, { "Tags", "=a" } })));
    EXPECT_FALSE(evaluator.match(*m_record, Value::dictionary({ { "Kind", "photo" }, { "Tags", "=c" } })));

    // The unrecognized operator's log line shows whether its key was reached.
    Log::Capture log;
    EXPECT_FALSE(evaluator.match(*m_record, Value::dictionary({ { "Kind", "=nope" }, { "MimeType", "?X" } })));
    EXPECT_EQ(log.count("unrecognized match operator:?X"), 0u);
    EXPECT_FALSE(evaluator.match(*m_record, Value::dictionary({ { "Kind", "=photo" }, { "MimeType", "?X" } })));
    EXPECT_EQ(log.count("unrecognized match operator:?X"), 1u);
}

} // namespace
} // namespace om::test
