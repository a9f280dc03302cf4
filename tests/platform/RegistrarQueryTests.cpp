#include "platform/RegistrarIndex.h"
#include "tests/platform/RegistrarTestSupport.h"

using om::DictionaryBuilder;
using om::RegistrarIndex;
using om::RegistrarPlugInRecords;
using om::Value;

namespace {

class RegistrarQuery : public om::test::RegistrarTest {
protected:
    void SetUp() override
    {
        // Registration order differs from name order on purpose.
        add("com.orvex.z", "com.a01");
        add("com.orvex.y", "com.a1");
        add("com.orvex.x", "com.b");
        add("com.orvex.w", "com.a1",
            Value::dictionary({ { "QSExtensionAttributes",
                Value::dictionary({ { "QSExtensionPointIdentifier", Value::array({ "com.c", "com.d", 7 }) } }) } }));
        add("com.orvex.v2", "com.b");
    }

    void add(const std::string& identifier, const std::string& point, const Value& extension = Value::dictionary({}))
    {
        registered(bundle(identifier + ".appex", plugIn(identifier, point, extension)));
    }

    std::string identifiersOf(const Value& rules, const om::RegistrarWorkspace::CandidateFilter& filter = {})
    {
        std::string text;
        for (const auto& record : workspace()->query(rules, filter))
            text += (text.empty() ? "" : " ") + record->identifier()->substr(10);
        return text;
    }
};

TEST_F(RegistrarQuery, ExtensionPointPatternsThatTheIndexAnswers)
{
    const struct {
        const char* name;
        Value pattern;
        const char* selected;
    } cases[] = {
        { "plain text, digit runs as numbers", "com.a1", "z y" },
        { "equals operator", "=com.a001", "z y" },
        { "array of both forms", Value::array({ "com.b", "=com.c" }), "x w v2" },
        { "an attribute's array value, each element", "com.d", "w" },
        { "the attribute's value hides the plug-in dictionary's", "=com.a1", "z y" },
        { "nothing registered", "com.none", "" },
        { "empty array selects nothing", Value::array({}), "" },
        { "equals with an operator-like operand", "=<com.b", "" },
    };
    for (const auto& test : cases) {
        SCOPED_TRACE(test.name);
        auto keys = RegistrarIndex::equalityKeys(test.pattern);
        EXPECT_TRUE(keys);
        EXPECT_EQ(identifiersOf(Value::dictionary({ { "QSExtensionPointIdentifier", test.pattern } })), test.selected);
    }
}

TEST_F(RegistrarQuery, PatternsTheIndexCannotAnswerLeaveEveryCandidate)
{
    const Value patterns[] = {
        "<>com.b",
        "<=com.b",
        ">=com.b",
        "<com.b",
        ">com.b",
        "?TY-CONFORMS:text/plain",
        "?whatever",
        1,
        true,
        false,
        Value::dictionary({ { "types", Value::array({ "text/plain" }) } }),
        Value::array({ "com.b", ">com.a" }),
        Value::array({ "com.b", 1 }),
    };
    for (const Value& pattern : patterns) {
        SCOPED_TRACE(pattern.description());
        EXPECT_FALSE(RegistrarIndex::equalityKeys(pattern));
        EXPECT_EQ(identifiersOf(Value::dictionary({ { "QSExtensionPointIdentifier", pattern } })), "z y x w v2");
    }
    EXPECT_EQ(identifiersOf(Value::dictionary({})), "z y x w v2");
    EXPECT_EQ(identifiersOf(Value()), "z y x w v2");
    EXPECT_EQ(identifiersOf(Value::dictionary({ { "SomeOtherKey", "com.b" } })), "z y x w v2")
        << "other keys are the caller's";
}

TEST_F(RegistrarQuery, IdentifierAndExtensionPointIntersect)
{
    EXPECT_EQ(identifiersOf(Value::dictionary({ { "QSExtensionIdentifier", "com.orvex.v02" } })), "v2");
    EXPECT_EQ(
        identifiersOf(Value::dictionary({ { "QSExtensionIdentifier", Value::array({ "com.orvex.x", "=com.orvex.y" }) },
            { "QSExtensionPointIdentifier", "com.b" } })),
        "x");
    EXPECT_EQ(identifiersOf(Value::dictionary(
                  { { "QSExtensionIdentifier", "com.orvex.z" }, { "QSExtensionPointIdentifier", "com.b" } })),
        "");
    // An operator on one key leaves the other key's narrowing in force.
    EXPECT_EQ(identifiersOf(Value::dictionary(
                  { { "QSExtensionIdentifier", ">com.orvex.a" }, { "QSExtensionPointIdentifier", "com.b" } })),
        "x v2");
}

TEST_F(RegistrarQuery, FilterSeesIdentifierAndEntitlementsAndMayDrop)
{
    std::vector<std::string> asked;
    std::vector<bool> entitlementsNone;
    auto selected = identifiersOf(Value::dictionary({ { "QSExtensionPointIdentifier", "com.a1" } }),
        [&](const std::string& identifier, const Value& entitlements) {
            asked.push_back(identifier);
            entitlementsNone.push_back(entitlements.isNone());
            return identifier != "com.orvex.z";
        });
    EXPECT_EQ(selected, "y");
    EXPECT_EQ(asked, (std::vector<std::string> { "com.orvex.z", "com.orvex.y" }));
    EXPECT_EQ(entitlementsNone, (std::vector<bool> { true, true }));
}

TEST_F(RegistrarQuery, UnregisteredAndReplacedRecordsLeaveTheIndexes)
{
    ASSERT_TRUE(workspace()->unregisterPlugIn(m_bundles.root() + "/com.orvex.y.appex").ok());
    EXPECT_EQ(identifiersOf(Value::dictionary({ { "QSExtensionPointIdentifier", "com.a1" } })), "z");
    // Moving a plug-in to another point moves it in the index, and to the end of the order.
    add("com.orvex.z", "com.b");
    EXPECT_EQ(identifiersOf(Value::dictionary({ { "QSExtensionPointIdentifier", "com.a1" } })), "");
    EXPECT_EQ(identifiersOf(Value::dictionary({ { "QSExtensionPointIdentifier", "com.b" } })), "x v2 z");
    EXPECT_EQ(identifiersOf(Value::dictionary({ { "QSExtensionIdentifier", "com.orvex.y" } })), "");
}

} // namespace
