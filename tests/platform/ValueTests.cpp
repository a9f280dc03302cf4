#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <unordered_set>

#include "platform/Value.h"

using om::ArrayBuilder;
using om::DictionaryBuilder;
using om::Uuid;
using om::Value;

TEST(Value, NumbersCompareAcrossKinds)
{
    EXPECT_EQ(Value(1), Value(true));
    EXPECT_EQ(Value(0), Value(false));
    EXPECT_EQ(Value(1u), Value(1));
    EXPECT_EQ(Value(1.0), Value(1));
    EXPECT_EQ(Value(1.0), Value(true));
    EXPECT_NE(Value(2), Value(true));
    EXPECT_NE(Value(1.5), Value(1));
    EXPECT_NE(Value(-1), Value(std::numeric_limits<uint64_t>::max()));
    EXPECT_EQ(Value(std::numeric_limits<uint64_t>::max()), Value(std::numeric_limits<uint64_t>::max()));
    EXPECT_NE(Value(std::numeric_limits<int64_t>::min()), Value(uint64_t(1) << 63));
    EXPECT_NE(Value("1"), Value(1));
    EXPECT_TRUE(Value(false).numericallyEquals(0));
    EXPECT_TRUE(Value(0u).numericallyEquals(0));
    EXPECT_FALSE(Value("0").numericallyEquals(0));
}

TEST(Value, EqualNumbersHashAlike)
{
    EXPECT_EQ(Value(1).hash(), Value(true).hash());
    EXPECT_EQ(Value(1).hash(), Value(1.0).hash());
    EXPECT_EQ(Value(7u).hash(), Value(7).hash());
    EXPECT_EQ(Value(-3).hash(), Value(-3.0).hash());
}

TEST(Value, NanEqualsItselfSoRoundTripsCompare)
{
    EXPECT_EQ(Value(std::nan("")), Value(std::nan("")));
    EXPECT_NE(Value(std::nan("")), Value(0.0));
    EXPECT_EQ(Value::date(std::nan("")), Value::date(std::nan("")));
    EXPECT_NE(Value::date(std::nan("")), Value::date(0));
    EXPECT_NE(Value::date(0), Value(0.0));
}

TEST(Value, IntegerReadsRespectRange)
{
    Value big(std::numeric_limits<uint64_t>::max());
    EXPECT_EQ(big.type(), Value::Type::Unsigned);
    EXPECT_FALSE(big.asInt64());
    EXPECT_EQ(*big.asUInt64(), std::numeric_limits<uint64_t>::max());
    EXPECT_FALSE(Value(-1).asUInt64());
    EXPECT_EQ(*Value(uint64_t(5)).asInt64(), 5);
    EXPECT_FALSE(Value(true).asInt64());
    EXPECT_FALSE(Value("5").asInt64());
}

TEST(Value, DictionaryKeepsInsertionOrder)
{
    Value d = Value::dictionary({ { "zeta", 1 }, { "alpha", 2 }, { "mid", 3 } });
    ASSERT_EQ(d.count(), 3u);
    EXPECT_EQ(d.entries()[0].first, "zeta");
    EXPECT_EQ(d.entries()[1].first, "alpha");
    EXPECT_EQ(d.entries()[2].first, "mid");
    EXPECT_EQ(d["alpha"], Value(2));
    EXPECT_TRUE(d["missing"].isNone());
}

TEST(Value, RepeatedKeyKeepsFirstPositionAndLastValue)
{
    for (size_t filler : { 0u, 20u }) { // small (linear) and large (indexed) dictionaries
        std::vector<Value::Entry> entries { { "a", 1 }, { "b", 2 } };
        for (size_t i = 0; i < filler; ++i)
            entries.emplace_back("k" + std::to_string(i), Value(int(i)));
        entries.emplace_back("a", 9);
        Value d = Value::dictionary(std::move(entries));
        EXPECT_EQ(d.count(), 2 + filler);
        EXPECT_EQ(d.entries()[0].first, "a");
        EXPECT_EQ(d["a"], Value(9));
    }
}

TEST(Value, UniqueDictionaryNamesTheRepeatedKey)
{
    std::string duplicate;
    EXPECT_FALSE(Value::uniqueDictionary({ { "x", 1 }, { "y", 2 }, { "x", 3 } }, &duplicate));
    EXPECT_EQ(duplicate, "x");

    std::vector<Value::Entry> many;
    for (int i = 0; i < 50; ++i)
        many.emplace_back("k" + std::to_string(i), i);
    many.emplace_back("k7", 0);
    many.emplace_back("k3", 0);
    EXPECT_FALSE(Value::uniqueDictionary(many, &duplicate));
    EXPECT_EQ(duplicate, "k7");
    many.resize(50);
    auto unique = Value::uniqueDictionary(many);
    ASSERT_TRUE(unique);
    EXPECT_EQ((*unique)["k49"], Value(49));
    EXPECT_TRUE((*unique)["k50"].isNone());
}

TEST(Value, LargeDictionaryLookupFindsEveryKey)
{
    std::vector<Value::Entry> entries;
    for (int i = 999; i >= 0; --i)
        entries.emplace_back("com.example.plugin" + std::to_string(i), i);
    Value d = Value::dictionary(std::move(entries));
    for (int i = 0; i < 1000; ++i)
        ASSERT_EQ(d["com.example.plugin" + std::to_string(i)], Value(i)) << i;
    EXPECT_TRUE(d["com.example.plugin1000"].isNone());
    EXPECT_TRUE(d[""].isNone());
}

TEST(Value, DictionariesCompareAsMaps)
{
    EXPECT_EQ(Value::dictionary({ { "a", 1 }, { "b", 2 } }), Value::dictionary({ { "b", 2 }, { "a", true } }));
    EXPECT_NE(Value::dictionary({ { "a", 1 } }), Value::dictionary({ { "a", 1 }, { "b", 2 } }));
    EXPECT_NE(Value::dictionary({ { "a", 1 }, { "b", 2 } }), Value::dictionary({ { "a", 1 }, { "c", 2 } }));
    EXPECT_EQ(
        Value::dictionary({ { "a", 1 }, { "b", 2 } }).hash(), Value::dictionary({ { "b", 2 }, { "a", 1 } }).hash());
    EXPECT_NE(Value::array({ 1, 2 }), Value::array({ 2, 1 }));
}

TEST(Value, CopiesShareAndBuildersDoNotDisturbTheOriginal)
{
    Value original = Value::dictionary({ { "inner", Value::array({ "x" }) }, { "n", 1 } });
    Value copy = original;
    Value changed = DictionaryBuilder(original).set("n", 2).set("added", "y").remove("inner").build();
    EXPECT_EQ(original["n"], Value(1));
    EXPECT_EQ(copy, original);
    EXPECT_EQ(changed["n"], Value(2));
    EXPECT_TRUE(changed["inner"].isNone());
    EXPECT_EQ(changed.entries()[0].first, "n");
    EXPECT_EQ(changed.entries()[1].first, "added");
    // A none value removes the key instead of storing none.
    Value removed = DictionaryBuilder(original).set("n", Value()).build();
    EXPECT_FALSE(removed.contains("n"));

    Value appended = ArrayBuilder(original["inner"]).append("z").build();
    EXPECT_EQ(original["inner"].count(), 1u);
    EXPECT_EQ(appended, Value::array({ "x", "z" }));
}

TEST(Value, WrongKindReadsGiveNone)
{
    Value s("text");
    EXPECT_TRUE(s["key"].isNone());
    EXPECT_TRUE(s.at(0).isNone());
    EXPECT_TRUE(s.elements().empty());
    EXPECT_EQ(s.count(), 0u);
    EXPECT_EQ(s.asData(), nullptr);
    EXPECT_TRUE(Value::array({ 1 }).at(1).isNone());
}

TEST(Value, DescriptionShowsEveryKind)
{
    Uuid u = *Uuid::parse("00112233-4455-6677-8899-aabbccddeeff");
    Value d = Value::dictionary({
        { "s", "a\"b" },
        { "i", -4 },
        { "u", std::numeric_limits<uint64_t>::max() },
        { "r", 2.5 },
        { "b", true },
        { "data", Value::data(std::vector<uint8_t> { 0x0a, 0xff }) },
        { "date", Value::date(1795341600) },
        { "uuid", Value::uuid(u) },
        { "list", Value::array({ 1, "x" }) },
        { "empty", Value::dictionary({}) },
    });
    EXPECT_EQ(d.description(),
        "{\"s\" = \"a\\\"b\"; \"i\" = -4; \"u\" = 18446744073709551615; \"r\" = 2.5; \"b\" = true; "
        "\"data\" = <0aff>; \"date\" = 2026-11-22T10:00:00Z; "
        "\"uuid\" = 00112233-4455-6677-8899-AABBCCDDEEFF; \"list\" = (1, \"x\"); \"empty\" = {}}");
    EXPECT_EQ(Value("plain").description(), "plain");
    EXPECT_EQ(Value().description(), "(none)");
}

TEST(Value, LongDataDescriptionIsCut)
{
    std::string text = Value::data(std::vector<uint8_t>(1000, 0x11)).description();
    EXPECT_LT(text.size(), 200u);
    EXPECT_NE(text.find("1000 bytes"), std::string::npos);
}

TEST(Value, DateTextShowsFractionOnlyWhenPresent)
{
    EXPECT_EQ(Value::dateText(0), "1970-01-01T00:00:00Z");
    EXPECT_EQ(Value::dateText(1795341600.25), "2026-11-22T10:00:00.25Z");
    EXPECT_EQ(Value::dateText(-1), "1969-12-31T23:59:59Z");
}

TEST(Uuid, ParsesEitherCaseAndPrintsUpperCase)
{
    auto lower = Uuid::parse("0a1b2c3d-4e5f-6071-8293-a4b5c6d7e8f9");
    auto upper = Uuid::parse("0A1B2C3D-4E5F-6071-8293-A4B5C6D7E8F9");
    ASSERT_TRUE(lower && upper);
    EXPECT_EQ(*lower, *upper);
    EXPECT_EQ(lower->string(), "0A1B2C3D-4E5F-6071-8293-A4B5C6D7E8F9");
    EXPECT_EQ(lower->bytes()[0], 0x0a);
    EXPECT_EQ(lower->bytes()[15], 0xf9);
}

TEST(Uuid, RefusesEverythingButTheCanonicalShape)
{
    for (const char* bad : { "", "0A1B2C3D4E5F607182 93A4B5C6D7E8F9", "0A1B2C3D-4E5F-6071-8293-A4B5C6D7E8F",
             "0A1B2C3D-4E5F-6071-8293-A4B5C6D7E8F90", "0A1B2C3D-4E5F-6071-8293_A4B5C6D7E8F9",
             "0A1B2C3D-4E5F-6071-8293-A4B5C6D7E8G9", "{A1B2C3D-4E5F-6071-8293-A4B5C6D7E8F9}",
             "0A1B2C3-D4E5F-6071-8293-A4B5C6D7E8F9", "0A1B2C3D-4E5F-6071-8293-A4B5C6D7E8F " }) {
        EXPECT_FALSE(Uuid::parse(bad)) << bad;
    }
}

TEST(Uuid, RandomIsVersionFourAndDistinct)
{
    std::unordered_set<Uuid> seen;
    for (int i = 0; i < 1000; ++i) {
        Uuid u = Uuid::random();
        EXPECT_EQ(u.bytes()[6] >> 4, 4);
        EXPECT_EQ(u.bytes()[8] >> 6, 2);
        EXPECT_TRUE(seen.insert(u).second);
        EXPECT_EQ(Uuid::parse(u.string()), u);
    }
    EXPECT_TRUE(Uuid().isNil());
}
