// omctl's JSON: every kind onto the value tree and back, the marker forms, the limits in pairs, and
// hostile text.
#include <gtest/gtest.h>

#include <cmath>
#include <limits>

#include "tools/omctl/OmctlJson.h"

using namespace om;

namespace {

std::string nested(size_t depth, const std::string& inner, char open = '[', char close = ']')
{
    return std::string(depth, open) + inner + std::string(depth, close);
}

std::string describe(const Result<Value>& result)
{
    return result.ok() ? result.value().description() : result.error().localizedDescription();
}

const Uuid kUuid = *Uuid::parse("6BA7B810-9DAD-11D1-80B4-00C04FD430C8");

} // namespace

TEST(OmctlJson, EachKindParsesOntoTheValueTree)
{
    struct Case {
        const char* json;
        Value expected;
        Value::Type type;
    };
    const Case cases[] = {
        { "-5", -5, Value::Type::Integer },
        { "0", 0, Value::Type::Integer },
        { "-0", 0, Value::Type::Integer },
        { "9223372036854775807", std::numeric_limits<int64_t>::max(), Value::Type::Integer },
        { "9223372036854775808", uint64_t { 9223372036854775808u }, Value::Type::Unsigned },
        { "18446744073709551615", std::numeric_limits<uint64_t>::max(), Value::Type::Unsigned },
        { "-9223372036854775808", std::numeric_limits<int64_t>::min(), Value::Type::Integer },
        { "1.5", 1.5, Value::Type::Real },
        { "1e3", 1000.0, Value::Type::Real },
        { "2.0", 2.0, Value::Type::Real },
        { "true", true, Value::Type::Boolean },
        { "false", false, Value::Type::Boolean },
        { R"("caf\u00e9 \ud83d\ude00\n\"\/")", "caf\xC3\xA9 \xF0\x9F\x98\x80\n\"/", Value::Type::String },
        { "\"caf\xC3\xA9\"", "caf\xC3\xA9", Value::Type::String },
        { R"("\u0000")", std::string(1, '\0'), Value::Type::String },
        { R"([1, "two", [], {}])", Value::array({ 1, "two", Value::array({}), Value::dictionary({}) }),
            Value::Type::Array },
        { R"({"$uuid": "6ba7b810-9dad-11d1-80b4-00c04fd430c8"})", Value::uuid(kUuid), Value::Type::Uuid },
        { R"({"$data": "AAEC/w=="})", Value::data(std::vector<uint8_t> { 0, 1, 2, 255 }), Value::Type::Data },
        { R"({"$data": " AA EC /w "})", Value::data(std::vector<uint8_t> { 0, 1, 2, 255 }), Value::Type::Data },
        { R"({"$data": ""})", Value::data(std::vector<uint8_t> {}), Value::Type::Data },
        { R"({"$date": "2026-11-22T10:00:00Z"})", Value::date(1795341600), Value::Type::Date },
        { R"({"$date": 86400.5})", Value::date(86400.5), Value::Type::Date },
        { R"({"$date": -1})", Value::date(-1), Value::Type::Date },
        { R"({"$real": "-inf"})", -std::numeric_limits<double>::infinity(), Value::Type::Real },
        { R"({"$real": "inf"})", std::numeric_limits<double>::infinity(), Value::Type::Real },
        { R"({"$real": 2})", 2.0, Value::Type::Real },
        // Not markers: an unknown one, and a marker key among others, are ordinary dictionaries.
        { R"({"$other": 1})", Value::dictionary({ { "$other", 1 } }), Value::Type::Dictionary },
        { R"({"$uuid": "x", "y": 1})", Value::dictionary({ { "$uuid", "x" }, { "y", 1 } }), Value::Type::Dictionary },
        { R"({"a": {"$uuid": "6BA7B810-9DAD-11D1-80B4-00C04FD430C8"}})",
            Value::dictionary({ { "a", Value::uuid(kUuid) } }), Value::Type::Dictionary },
        { " \t\r\n 7 \n", 7, Value::Type::Integer },
    };
    for (const auto& test : cases) {
        Result<Value> parsed = OmctlJson::parse(test.json);
        ASSERT_TRUE(parsed.ok()) << test.json << ": " << describe(parsed);
        EXPECT_EQ(parsed.value(), test.expected) << test.json << " gave " << describe(parsed);
        EXPECT_EQ(parsed->type(), test.type) << test.json;
    }
    Result<Value> nan = OmctlJson::parse(R"({"$real": "nan"})");
    ASSERT_TRUE(nan.ok());
    EXPECT_TRUE(nan->isReal() && std::isnan(*nan->asDouble()));
}

TEST(OmctlJson, ObjectsKeepTheirKeyOrder)
{
    Result<Value> parsed = OmctlJson::parse(R"({"z": 1, "a": 2, "m": {"y": 3, "b": 4}})");
    ASSERT_TRUE(parsed.ok());
    std::vector<std::string> keys;
    for (const auto& entry : parsed->entries())
        keys.push_back(entry.first);
    for (const auto& entry : (*parsed)["m"].entries())
        keys.push_back(entry.first);
    EXPECT_EQ(keys, (std::vector<std::string> { "z", "a", "m", "y", "b" }));
}

TEST(OmctlJson, HostileAndMalformedTextIsRefused)
{
    struct Case {
        std::string json;
        std::string message; // part of the error's text; empty: any
    };
    const Case cases[] = {
        { R"({"s": "\x41"})", "" }, // unknown escape
        { R"({"s": "\u12"})", "" }, // short \u
        { R"({"s": "\ud800"})", "surrogate" }, // lone high surrogate
        { R"({"s": "\udc00"})", "surrogate" }, // lone low surrogate
        { R"({"s": "\ud800\u0041"})", "surrogate" }, // high surrogate with a non-surrogate after it
        { R"({"s": "\ud800\ud800"})", "surrogate" }, // two high surrogates
        { "{\"s\": \"a\x01\"}", "control character" }, // raw control character
        { "{\"s\": \"\xC3\x28\"}", "invalid UTF-8 at offset 7" },
        { "{\"s\": \"\xED\xA0\x80\"}", "invalid UTF-8 at offset 7" }, // a surrogate encoded in UTF-8
        { "{\"s\": \"\xC0\xAF\"}", "invalid UTF-8" }, // overlong
        { "\xEF\xBB\xBF{}", "" }, // a byte-order mark is no JSON
        { R"({"s": "open)", "" },
        { R"({"n": 01})", "" }, // leading zero
        { R"({"n": -})", "" },
        { R"({"n": 1.})", "" },
        { R"({"n": .5})", "" },
        { R"({"n": 1e})", "" },
        { R"({"n": +1})", "" },
        { R"({"n": NaN})", "" },
        { R"({"n": null})", "null has no value-tree equivalent" },
        { "null", "null has no value-tree equivalent" },
        { R"({"n": 18446744073709551616})", "out of the 64-bit range" },
        { R"({"n": -9223372036854775809})", "out of the 64-bit range" },
        { R"({"n": 99999999999999999999999999999999})", "out of the 64-bit range" },
        { R"({"n": 1e400})", "" },
        { R"({"n": -1e400})", "" },
        { R"({"a": [1, 2,]})", "" },
        { R"({"a": 1,})", "" },
        { R"({"a": 1 "b": 2})", "" },
        { R"({"a": 1, "a": 2})", "repeated key \"a\"" },
        { R"({"o": {"k": 1, "j": 2, "k": 3}})", "repeated key \"k\"" },
        { R"({1: 2})", "" },
        { R"({"a": 1} trailing)", "" },
        { R"({"a": 1}{})", "" },
        { R"({"a": tru})", "" },
        { R"(// comment
            {})",
            "" },
        { R"({"id": {"$uuid": "not-a-uuid"}})", "\"$uuid\" needs" },
        { R"({"id": {"$uuid": 5}})", "\"$uuid\" needs" },
        { R"({"d": {"$data": "A*AA"}})", "\"$data\" needs" },
        { R"({"d": {"$data": "A=AA"}})", "\"$data\" needs" },
        { R"({"t": {"$date": "2026-02-30T00:00:00Z"}})", "\"$date\" needs" },
        { R"({"t": {"$date": "2026-11-22 10:00:00"}})", "\"$date\" needs" },
        { R"({"t": {"$date": true}})", "\"$date\" needs" },
        { R"({"r": {"$real": "infinity"}})", "\"$real\" needs" },
        { R"({"r": {"$real": [1]}})", "\"$real\" needs" },
        { "", "" },
        { "   ", "" },
        { "[", "" },
        { "]", "" },
    };
    for (const auto& test : cases) {
        Result<Value> parsed = OmctlJson::parse(test.json);
        ASSERT_FALSE(parsed.ok()) << test.json << " gave " << describe(parsed);
        EXPECT_EQ(parsed.error().code(), kPlatformErrorMalformed) << test.json;
        EXPECT_NE(parsed.error().localizedDescription().find(test.message), std::string::npos)
            << test.json << ": " << describe(parsed);
    }
}

// The top-level container is the first level; both kinds of container count.
TEST(OmctlJson, NestingAtTheLimitIsAcceptedAndOneDeeperRefused)
{
    for (auto [open, close, inner] : { std::tuple('[', ']', "1"), std::tuple('{', '}', "") }) {
        auto text = [&](size_t depth) {
            if (open == '[')
                return nested(depth, inner, open, close);
            std::string json;
            for (size_t i = 0; i + 1 < depth; ++i)
                json += "{\"k\": ";
            return json + "{}" + std::string(depth - 1, '}');
        };
        Result<Value> deepest = OmctlJson::parse(text(OmctlJson::kMaxDepth));
        ASSERT_TRUE(deepest.ok()) << open << " " << describe(deepest);
        size_t depth = 0;
        for (Value level = *deepest; level.isArray() || level.isDictionary();
             level = level.isArray() ? level.at(0) : level["k"])
            ++depth;
        EXPECT_EQ(depth, OmctlJson::kMaxDepth) << open;

        Result<Value> deeper = OmctlJson::parse(text(OmctlJson::kMaxDepth + 1));
        ASSERT_FALSE(deeper.ok()) << open;
        EXPECT_EQ(deeper.error().code(), kPlatformErrorLimit);
        EXPECT_EQ(deeper.error().localizedDescription(), "nesting deeper than 128 levels");
    }
}

TEST(OmctlJson, HostileNestingFailsWithoutDescending)
{
    // Far past any stack: only refusing before the next level keeps this from crashing.
    std::string objects;
    for (size_t i = 0; i < 200000; ++i)
        objects += "{\"a\": ";
    for (const std::string& json : { nested(1000000, ""), objects, std::string(1000000, '[') + "{\"a\": " }) {
        Result<Value> parsed = OmctlJson::parse(json);
        ASSERT_FALSE(parsed.ok()) << json.substr(0, 16);
        EXPECT_EQ(parsed.error().code(), kPlatformErrorLimit) << json.substr(0, 16);
    }
}

TEST(OmctlJson, InputAtTheSizeLimitIsReadAndOneByteMoreRefused)
{
    std::string json = R"({"request": "x"})";
    json.resize(OmctlJson::kMaxInputBytes, ' ');
    Result<Value> atLimit = OmctlJson::parse(json);
    ASSERT_TRUE(atLimit.ok()) << describe(atLimit);
    EXPECT_EQ(*atLimit->stringFor("request"), "x");

    json += ' ';
    Result<Value> over = OmctlJson::parse(json);
    ASSERT_FALSE(over.ok());
    EXPECT_EQ(over.error().code(), kPlatformErrorLimit);
    EXPECT_NE(over.error().localizedDescription().find("longer than 16777216 bytes"), std::string::npos);
}

TEST(OmctlJson, WrittenValuesReadBackAsTheSameTree)
{
    const Value cases[] = {
        Value::uuid(*Uuid::parse("00000000-0000-0000-0000-0000000000FF")),
        Value::data(std::vector<uint8_t> { 0xDE, 0xAD, 0xBE }),
        Value::data(std::vector<uint8_t> {}),
        Value::date(1.25),
        Value::date(1e300), // past every calendar
        Value::date(-62135596800.0),
        Value::real(std::numeric_limits<double>::infinity()),
        Value::real(-std::numeric_limits<double>::infinity()),
        Value::real(3.0),
        Value::real(-0.5),
        Value::real(5e-324),
        Value::real(1.7976931348623157e308),
        Value::real(0.1),
        std::numeric_limits<int64_t>::min(),
        std::numeric_limits<int64_t>::max(),
        std::numeric_limits<uint64_t>::max(),
        true,
        "tab\tquote\"back\\slash\x01\x7F\b\f end \xE2\x82\xAC \xF0\x9F\x98\x80",
        "",
        Value::array({ Value::array({}), Value::dictionary({ { "k", Value::array({ true }) } }) }),
        Value::dictionary({ { "z", 1 }, { "a", Value::dictionary({ { "$not-a-marker", 2 } }) } }),
    };
    for (const Value& value : cases) {
        for (auto layout : { OmctlJson::Layout::Indented, OmctlJson::Layout::OneLine }) {
            const std::string text = OmctlJson::write(value, layout);
            Result<Value> readBack = OmctlJson::parse(text);
            ASSERT_TRUE(readBack.ok()) << text << ": " << describe(readBack);
            EXPECT_EQ(readBack.value(), value) << text;
            EXPECT_EQ(readBack->type(), value.type()) << text;
            if (layout == OmctlJson::Layout::OneLine) {
                EXPECT_EQ(text.find('\n'), std::string::npos) << text;
            }
        }
    }
    const std::string nan = OmctlJson::write(Value::real(std::numeric_limits<double>::quiet_NaN()));
    EXPECT_EQ(nan, R"({"$real": "nan"})");
    EXPECT_TRUE(std::isnan(*OmctlJson::parse(nan)->asDouble()));
}

TEST(OmctlJson, LayoutIndentsContainersAndKeepsMarkersOnOneLine)
{
    Value value = Value::dictionary({
        { "errorcode", 0u },
        { "uuids", Value::array({ Value::uuid(kUuid) }) },
        { "empty", Value::dictionary({}) },
        { "none", Value::array({}) },
        { "when", Value::date(0) },
        { "ratio", 0.5 },
    });
    EXPECT_EQ(OmctlJson::write(value),
        "{\n"
        "  \"errorcode\": 0,\n"
        "  \"uuids\": [\n"
        "    {\"$uuid\": \"6BA7B810-9DAD-11D1-80B4-00C04FD430C8\"}\n"
        "  ],\n"
        "  \"empty\": {},\n"
        "  \"none\": [],\n"
        "  \"when\": {\"$date\": \"1970-01-01T00:00:00Z\"},\n"
        "  \"ratio\": 0.5\n"
        "}");
    EXPECT_EQ(OmctlJson::write(value, OmctlJson::Layout::OneLine),
        "{\"errorcode\": 0, \"uuids\": [{\"$uuid\": \"6BA7B810-9DAD-11D1-80B4-00C04FD430C8\"}], \"empty\": {}, "
        "\"none\": [], \"when\": {\"$date\": \"1970-01-01T00:00:00Z\"}, \"ratio\": 0.5}");
    EXPECT_EQ(OmctlJson::write(Value()), "null");
    EXPECT_EQ(OmctlJson::write("\x01\x1F"), "\"\\u0001\\u001f\"");
}

// Text from elsewhere (a vlist file, another encoder) need not be UTF-8; writing it must not throw.
TEST(OmctlJson, BytesThatAreNotUtf8AreWrittenAsReplacementCharacters)
{
    EXPECT_EQ(OmctlJson::write(std::string("a\xFF"
                                           "b")),
        "\"a\xEF\xBF\xBD"
        "b\"");
}
