#include <gtest/gtest.h>

#include "platform/DictionaryMerge.h"

using om::DictionaryMerge;
using om::Value;

namespace {

Value names(std::initializer_list<Value> elements)
{
    return Value::array(elements);
}

} // namespace

TEST(DictionaryMerge, RulesApplyAtEveryLevelByKeyName)
{
    const Value sdk = Value::dictionary({
        { "CleanTimeout", 30 },
        { "OnlyInSdk", "sdk" },
        { "Both", "sdk" },
        { "QSExtension",
            Value::dictionary({
                { "CleanTimeout", Value::dictionary({ { "seconds", 30 } }) },
                { "QSExtensionAttributes", Value::dictionary({ { "Kept", "sdk" }, { "Added", "sdk" } }) },
                { "Shared", names({ "a", "c" }) },
            }) },
    });
    const Value plugIn = Value::dictionary({
        { "CleanTimeout", 10 },
        { "Both", "plug-in" },
        { "OnlyInPlugIn", "plug-in" },
        { "QSExtension",
            Value::dictionary({
                { "CleanTimeout", 10 },
                { "QSExtensionAttributes", Value::dictionary({ { "Kept", "plug-in" } }) },
                { "Shared", names({ "a", "b" }) },
            }) },
    });

    const Value merged = DictionaryMerge::mergeDictionary(sdk, plugIn);

    EXPECT_EQ(merged["CleanTimeout"], Value(30));
    EXPECT_EQ(merged["OnlyInSdk"], Value("sdk"));
    EXPECT_EQ(merged["Both"], Value("plug-in"));
    EXPECT_EQ(merged["OnlyInPlugIn"], Value("plug-in"));
    const Value& extension = merged["QSExtension"];
    // The override is tested before the dictionary rule, so a dictionary value still wins whole.
    EXPECT_EQ(extension["CleanTimeout"], Value::dictionary({ { "seconds", 30 } }));
    EXPECT_EQ(extension["QSExtensionAttributes"], Value::dictionary({ { "Kept", "plug-in" }, { "Added", "sdk" } }));
    EXPECT_EQ(extension["Shared"], names({ "a", "b", "c" }));
}

TEST(DictionaryMerge, LeavesBothSidesUnchangedAndSharesWhatItKeeps)
{
    const Value attributes = Value::dictionary({ { "QSExtensionVersion", "2" } });
    const Value plugIn = Value::dictionary({ { "QSExtensionAttributes", attributes }, { "Big", names({ "x" }) } });
    const Value sdk = Value::dictionary({ { "Extra", 1 } });

    const Value merged = DictionaryMerge::mergeDictionary(sdk, plugIn);

    EXPECT_EQ(plugIn.count(), 2u);
    EXPECT_EQ(sdk.count(), 1u);
    EXPECT_EQ(merged.count(), 3u);
    EXPECT_EQ(merged["Big"].elements().data(), plugIn["Big"].elements().data());
}

TEST(DictionaryMerge, OddShapesKeepThePlugInsValue)
{
    struct Case {
        const char* name;
        Value sdk;
        Value plugIn;
        Value expected;
    };
    const Case cases[] = {
        { "shared string joins a list", Value("c"), names({ "a" }), names({ "a", "c" }) },
        { "shared string on both sides", Value("a"), Value("a"), names({ "a" }) },
        { "shared number stays", names({ "a" }), Value(3), Value(3) },
        { "shared duplicates collapse", names({ "a", "a" }), names({ "b", "b" }), names({ "b", "a" }) },
    };
    for (const auto& test : cases)
        EXPECT_EQ(DictionaryMerge::mergeSharedResources(test.sdk, test.plugIn), test.expected) << test.name;

    // A dictionary in the SDK where the plug-in holds something else: the plug-in's value stays.
    const Value merged = DictionaryMerge::mergeDictionary(
        Value::dictionary({ { "Key", Value::dictionary({ { "a", 1 } }) } }), Value::dictionary({ { "Key", "text" } }));
    EXPECT_EQ(merged["Key"], Value("text"));
}

TEST(DictionaryMerge, AWiderOverridePredicateReplacesMoreKeys)
{
    const Value merged = DictionaryMerge::mergeDictionary(Value::dictionary({ { "A", 1 }, { "CleanTimeout", 5 } }),
        Value::dictionary({ { "A", 2 }, { "CleanTimeout", 9 } }), [](std::string_view key) { return key == "A"; });
    EXPECT_EQ(merged["A"], Value(1));
    EXPECT_EQ(merged["CleanTimeout"], Value(9));
}
