#include <gtest/gtest.h>

#include <cctype>
#include <cmath>
#include <limits>
#include <string>
#include <vector>

#include "platform/ActivationRule.h"
#include "tests/support/BundleFixture.h"

using om::ActivationRule;
using om::TypeConformance;
using om::Value;

namespace {

// image/jpeg and image/png are kinds of image/x-raster, which is a kind of image/x-picture;
// image/gif is only an image/x-picture. image/pjpeg is an alias of image/jpeg.
class ActivationRuleTest : public ::testing::Test {
protected:
    ActivationRuleTest()
        : m_types(makeDatabase(m_fixture))
    {
    }

    static TypeConformance makeDatabase(om::test::BundleFixture& fixture)
    {
        fixture.writeFile("share/mime/subclasses",
            "image/jpeg image/x-raster\n"
            "image/png image/x-raster\n"
            "image/x-raster image/x-picture\n"
            "image/gif image/x-picture\n");
        fixture.writeFile("share/mime/aliases", "image/pjpeg image/jpeg\n");
        return TypeConformance::fromDirectories({ fixture.root() + "/share" });
    }

    static Value items(const std::vector<std::string>& types)
    {
        std::vector<Value> elements(types.begin(), types.end());
        return Value::dictionary({ { "types", Value::array(std::move(elements)) } });
    }

    bool evaluate(const Value& rule, const Value& description) const
    {
        return ActivationRule::evaluate(rule, description, m_types);
    }

    om::test::BundleFixture m_fixture;
    TypeConformance m_types;
};

struct Case {
    const char* name;
    Value rule;
    std::vector<std::string> items;
    bool accepted;
};

Value ruleOf(std::initializer_list<Value::Entry> entries)
{
    return Value::dictionary(entries);
}

// "application/octet-stream" spelled in the n-th of its many letter cases: distinct rule keys for
// one and the same type.
std::string octetStreamSpelling(size_t n)
{
    std::string type = "application/octet-stream";
    for (char& c : type) {
        if (std::isalpha(static_cast<unsigned char>(c))) {
            if (n & 1)
                c = char(std::toupper(static_cast<unsigned char>(c)));
            n >>= 1;
        }
    }
    return type;
}

} // namespace

TEST_F(ActivationRuleTest, CountsAndConformance)
{
    const Case cases[] = {
        { "one item of the type", ruleOf({ { "image/png", 1 } }), { "image/png" }, true },
        { "one item of a subtype", ruleOf({ { "image/x-picture", 1 } }), { "image/jpeg" }, true },
        { "a supertype item does not fit a subtype", ruleOf({ { "image/png", 1 } }), { "image/x-raster" }, false },
        { "2 accepted, 2 offered", ruleOf({ { "image/x-raster", 2 } }), { "image/png", "image/jpeg" }, true },
        { "2 accepted, 3 offered", ruleOf({ { "image/x-raster", 2 } }), { "image/png", "image/jpeg", "image/png" },
            false },
        { "no items", ruleOf({ { "image/png", 5 } }), {}, false },
        { "an unknown item type", ruleOf({ { "image/png", 5 } }), { "video/x-unknown" }, false },
        { "one item fits, the other does not", ruleOf({ { "image/x-raster", 5 } }), { "image/png", "image/gif" },
            false },
        { "an empty rule", ruleOf({}), { "image/png" }, false },
        { "octet-stream takes anything", ruleOf({ { "application/octet-stream", 3 } }),
            { "image/gif", "text/x-note", "video/x-unknown" }, true },
        { "octet-stream counts too", ruleOf({ { "application/octet-stream", 3 } }),
            { "image/gif", "text/x-note", "video/x-unknown", "image/png" }, false },
        { "text/plain takes text", ruleOf({ { "text/plain", 1 } }), { "text/x-note" }, true },
        { "case and aliases", ruleOf({ { "IMAGE/JPEG", 1 } }), { "Image/PJpeg" }, true },
        { "one rule type's room is not another's", ruleOf({ { "image/png", 1 }, { "image/gif", 1 } }),
            { "image/png", "image/png" }, false },
    };
    for (const auto& test : cases)
        EXPECT_EQ(evaluate(test.rule, items(test.items)), test.accepted) << test.name;
}

// Each item may go to any rule type it conforms to. Taking the items in order and each to the
// first rule type with room fails these, although an assignment exists (or, last, does not).
TEST_F(ActivationRuleTest, ItemsAreSharedOutExactlyNotGreedily)
{
    const Value rasterThenPng = ruleOf({ { "image/x-raster", 1 }, { "image/png", 1 } });
    const Value pictureRasterPng = ruleOf({ { "image/x-picture", 1 }, { "image/x-raster", 1 }, { "image/png", 1 } });
    const Case cases[] = {
        { "png first", rasterThenPng, { "image/png", "image/jpeg" }, true },
        { "jpeg first", rasterThenPng, { "image/jpeg", "image/png" }, true },
        { "a chain of three", pictureRasterPng, { "image/png", "image/jpeg", "image/gif" }, true },
        { "a chain of three, reversed", pictureRasterPng, { "image/gif", "image/jpeg", "image/png" }, true },
        { "no assignment exists", rasterThenPng, { "image/jpeg", "image/jpeg" }, false },
        { "too many for the chain", pictureRasterPng, { "image/gif", "image/gif" }, false },
    };
    for (const auto& test : cases)
        EXPECT_EQ(evaluate(test.rule, items(test.items)), test.accepted) << test.name;
}

TEST_F(ActivationRuleTest, WhatARuleValueAccepts)
{
    const double nan = std::numeric_limits<double>::quiet_NaN();
    const struct {
        const char* name;
        Value accepts;
        size_t mostAccepted; // of up to 3 items
    } cases[] = {
        { "2", Value(2), 2 },
        { "0", Value(0), 0 },
        { "-1", Value(-1), 0 },
        { "UINT64_MAX", Value(std::numeric_limits<uint64_t>::max()), 3 },
        { "1.9 is truncated", Value(1.9), 1 },
        { "2.0", Value(2.0), 2 },
        { "0.5", Value(0.5), 0 },
        { "NaN", Value(nan), 0 },
        { "1e300", Value(1e300), 3 },
        { "the string 2", Value("2"), 0 },
        { "true", Value(true), 0 },
        { "an array", Value::array({ 2 }), 0 },
    };
    for (const auto& test : cases) {
        const Value rule = Value::dictionary({ { "image/png", test.accepts } });
        for (size_t count = 1; count <= 3; ++count) {
            EXPECT_EQ(evaluate(rule, items(std::vector<std::string>(count, "image/png"))), count <= test.mostAccepted)
                << test.name << " with " << count << " items";
        }
    }
}

TEST_F(ActivationRuleTest, MalformedInputIsNo)
{
    const Value rule = Value::dictionary({ { "application/octet-stream", 10 } });
    const struct {
        const char* name;
        Value rule;
        Value items;
    } cases[] = {
        { "rule is none", Value(), items({ "image/png" }) },
        { "rule is an array", Value::array({ "image/png" }), items({ "image/png" }) },
        { "items are none", rule, Value() },
        { "no types key", rule, Value::dictionary({ { "kinds", Value::array({ "image/png" }) } }) },
        { "types is a string", rule, Value::dictionary({ { "types", "image/png" } }) },
        { "a type is a number", rule, Value::dictionary({ { "types", Value::array({ "image/png", 7 }) } }) },
        { "a type is no type", rule, items({ "image/png", "not-a-type" }) },
        { "a type is too long", rule, items({ "image/" + std::string(250, 'x') }) },
    };
    for (const auto& test : cases)
        EXPECT_FALSE(evaluate(test.rule, test.items)) << test.name;
    EXPECT_TRUE(evaluate(rule, Value::dictionary({ { "types", Value::array({ "image/png" }) }, { "extra", 1 } })));
}

TEST_F(ActivationRuleTest, ItemsAndRuleTypesAreBounded)
{
    const Value roomy = Value::dictionary({ { "image/png", 5000 } });
    EXPECT_TRUE(evaluate(roomy, items(std::vector<std::string>(ActivationRule::kMaxItems, "image/png"))));
    EXPECT_FALSE(evaluate(roomy, items(std::vector<std::string>(ActivationRule::kMaxItems + 1, "image/png"))));

    std::vector<Value::Entry> entries { { "image/png", 1 } };
    while (entries.size() < ActivationRule::kMaxRuleTypes)
        entries.emplace_back("video/x-filler-" + std::to_string(entries.size()), 1);
    EXPECT_TRUE(evaluate(Value::dictionary(entries), items({ "image/png" })));
    entries.emplace_back("video/x-one-too-many", 1);
    EXPECT_FALSE(evaluate(Value::dictionary(entries), items({ "image/png" })));
}

// The densest problem the bounds admit: every item fits every rule type, each of which takes one.
// Then one of those rule types is replaced by one that fits no item: there is room for every item
// and every item fits somewhere, so only the assignment itself can say no.
TEST_F(ActivationRuleTest, TheLargestDenseProblemIsDecided)
{
    std::vector<std::string> types;
    std::vector<Value::Entry> entries;
    for (size_t i = 0; i < ActivationRule::kMaxItems; ++i) {
        types.push_back("x-item/t" + std::to_string(i));
        entries.emplace_back(octetStreamSpelling(i), 1);
    }
    EXPECT_TRUE(evaluate(Value::dictionary(entries), items(types)));
    entries.back() = { "image/png", 1 };
    EXPECT_FALSE(evaluate(Value::dictionary(entries), items(types)));
}
