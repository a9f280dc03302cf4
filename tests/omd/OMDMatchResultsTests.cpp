// Duplicate resolution and overrides of a "match" reply, over hand-made forms.
#include <gtest/gtest.h>

#include "omd/OMDMatchResults.h"
#include "platform/Log.h"

using om::DictionaryBuilder;
using om::OMDMatchResults;
using om::Value;

namespace {

struct Form {
    const char* uuid;
    const char* identifier;
    const char* version;
    bool systemResident = false;
    int64_t lastModified = 0;
    const char* replaces = nullptr; // the identifier its replacement entitlement names
};

Value formOf(const Form& form)
{
    DictionaryBuilder builder;
    builder.set("uuid", Value::string(form.uuid));
    builder.set("identifier", Value::string(form.identifier));
    builder.set("version", Value::string(form.version));
    builder.set("systemResident", Value::boolean(form.systemResident));
    builder.set("lastmodified", Value::integer(form.lastModified));
    return builder.build();
}

// Admits and appends each form in order, as the request does; returns the UUIDs handed out.
std::vector<std::string> resolve(uint64_t flags, const std::vector<Form>& forms)
{
    OMDMatchResults results(flags);
    for (const Form& form : forms) {
        const Value value = formOf(form);
        if (results.admit(value))
            results.append(DictionaryBuilder(value), form.replaces ? Value::string(form.replaces) : Value());
    }
    std::vector<std::string> uuids;
    const Value matches = results.finish();
    for (const Value& form : matches.elements())
        uuids.emplace_back(*form["uuid"].asString());
    return uuids;
}

struct Row {
    const char* name;
    uint64_t flags;
    std::vector<Form> forms;
    std::vector<std::string> kept;
};

class DuplicateResolution : public ::testing::TestWithParam<Row> { };

TEST_P(DuplicateResolution, KeepsWhatTheTableSays)
{
    EXPECT_EQ(resolve(GetParam().flags, GetParam().forms), GetParam().kept);
}

constexpr uint64_t kAll = OMDMatchResults::kDiscoverAllVersions;
constexpr uint64_t kSame = OMDMatchResults::kDiscoverSameVersions;

INSTANTIATE_TEST_SUITE_P(Rows, DuplicateResolution,
    ::testing::Values(
        // One per identifier: the newer version, compared by numeric runs (1.10 after 1.9).
        Row { "NewerReplaces", 0, { { "a", "x", "1.9" }, { "b", "x", "1.10" } }, { "b" } },
        Row { "OlderDropped", 0, { { "a", "x", "1.10" }, { "b", "x", "1.9" } }, { "a" } },
        Row { "OtherIdentifiersPassedOver", 0, { { "a", "x", "1" }, { "b", "y", "1" } }, { "a", "b" } },
        // Equal versions: the system volume wins over a rival outside it whatever the times...
        Row { "SystemSecondWinsAgainstLaterTime", 0, { { "a", "x", "1", false, 500 }, { "b", "x", "1", true, 1 } },
            { "b" } },
        // ...while a non-system plug-in examined second needs a strictly later time.
        Row { "LaterTimeBeatsSystem", 0, { { "a", "x", "1", true, 100 }, { "b", "x", "1", false, 101 } }, { "b" } },
        Row { "EqualTimeKeepsSystem", 0, { { "a", "x", "1", true, 100 }, { "b", "x", "1", false, 100 } }, { "a" } },
        Row { "TieKeepsFirst", 0, { { "a", "x", "1", false, 7 }, { "b", "x", "1", false, 7 } }, { "a" } },
        Row { "BothSystemLaterWins", 0, { { "a", "x", "1", true, 7 }, { "b", "x", "1", true, 8 } }, { "b" } },
        Row {
            "NegativeTimesCompareSigned", 0, { { "a", "x", "1", false, -5 }, { "b", "x", "1", false, -6 } }, { "a" } },
        // Every version: different versions all stay, equal ones only with the second flag.
        Row { "AllVersionsKeepsBoth", kAll, { { "a", "x", "1.9" }, { "b", "x", "1.10" } }, { "a", "b" } },
        Row { "AllVersionsEqualResolved", kAll, { { "a", "x", "2", false, 1 }, { "b", "x", "2", false, 2 } }, { "b" } },
        Row { "AllVersionsEqualTieKeepsFirst", kAll, { { "a", "x", "2" }, { "b", "x", "2" } }, { "a" } },
        Row { "AllAndSameVersionsKeepsEqual", kAll | kSame, { { "a", "x", "2" }, { "b", "x", "2" } }, { "a", "b" } },
        Row { "SameVersionsAloneIsIgnored", kSame, { { "a", "x", "2" }, { "b", "x", "2" } }, { "a" } },
        // With every version, a later equal version is resolved against the first equal form
        // only; the forms of other versions stay.
        Row { "AllVersionsExaminesFurtherForms", kAll,
            { { "a", "x", "1" }, { "b", "x", "2", false, 1 }, { "c", "x", "2", false, 5 } }, { "a", "c" } },
        // A removed form is no rival any more.
        Row { "RemovedFormIsNoRival", 0, { { "a", "x", "1" }, { "b", "x", "2" }, { "c", "x", "1.5" } }, { "b" } }),
    [](const auto& info) { return std::string(info.param.name); });

TEST(MatchOverrides, ReplacingFormAndReplacedFormNameEachOther)
{
    om::Log::Capture capture;
    OMDMatchResults results(0);
    const Value replaced = formOf({ "B-uuid", "com.example.b", "1" });
    const Value replacing = formOf({ "A-uuid", "com.example.a", "1" });
    ASSERT_TRUE(results.admit(replaced));
    results.append(DictionaryBuilder(replaced), Value());
    ASSERT_TRUE(results.admit(replacing));
    results.append(DictionaryBuilder(replacing),
        Value::array({ Value::integer(3), Value::string("com.example.b"), Value::string("com.example.none") }));

    const Value matches = results.finish();
    ASSERT_EQ(matches.elements().size(), 2u);
    EXPECT_EQ(*matches.elements()[0]["overrider"].asString(), "A-uuid");
    EXPECT_EQ(*matches.elements()[1]["overriding"].asString(), "com.example.b");
    EXPECT_TRUE(matches.elements()[1]["overrider"].isNone());
    EXPECT_EQ(capture.count("plug-in A-uuid overrides B-uuid"), 1u);
}

TEST(MatchOverrides, LaterReplacementOfOneIdentifierWinsAndOtherTypesRegisterNothing)
{
    OMDMatchResults results(0);
    const std::vector<std::pair<Form, Value>> forms {
        { { "T", "target", "1" }, Value() },
        { { "P", "first", "1" }, Value::string("target") },
        { { "Q", "second", "1" }, Value::string("target") },
        { { "R", "third", "1" }, Value::dictionary({ { "target", Value::boolean(true) } }) },
    };
    for (const auto& [form, replaced] : forms) {
        const Value value = formOf(form);
        ASSERT_TRUE(results.admit(value));
        results.append(DictionaryBuilder(value), replaced);
    }
    const Value matches = results.finish();
    EXPECT_EQ(*matches.elements()[0]["overrider"].asString(), "Q");
    EXPECT_TRUE(matches.elements()[1]["overriding"].isNone());
    EXPECT_EQ(*matches.elements()[2]["overriding"].asString(), "target");
    EXPECT_TRUE(matches.elements()[3]["overriding"].isNone());
}

TEST(MatchOverrides, AReplacementTakenOutByDuplicateResolutionStillNamesItsTarget)
{
    // The replacing plug-in is superseded by a newer version of itself that replaces nothing;
    // the target still records the first one as its overrider.
    OMDMatchResults results(0);
    for (const Form& form : std::vector<Form> {
             { "T", "target", "1" }, { "A1", "replacer", "1", false, 0, "target" }, { "A2", "replacer", "2" } }) {
        const Value value = formOf(form);
        ASSERT_TRUE(results.admit(value));
        results.append(DictionaryBuilder(value), form.replaces ? Value::string(form.replaces) : Value());
    }
    const Value matches = results.finish();
    ASSERT_EQ(matches.elements().size(), 2u);
    EXPECT_EQ(*matches.elements()[0]["overrider"].asString(), "A1");
    EXPECT_EQ(*matches.elements()[1]["uuid"].asString(), "A2");
}

} // namespace
