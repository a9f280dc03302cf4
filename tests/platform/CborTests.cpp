#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <limits>
#include <string>
#include <vector>

#include "bench/BenchValues.h"
#include "platform/Cbor.h"

namespace om {
namespace {

using Bytes = std::vector<uint8_t>;

Bytes operator+(Bytes a, const Bytes& b)
{
    a.insert(a.end(), b.begin(), b.end());
    return a;
}

Bytes repeated(const Bytes& unit, size_t times)
{
    Bytes out;
    for (size_t i = 0; i < times; ++i)
        out = out + unit;
    return out;
}

// depth arrays nested in one another, the innermost empty.
Bytes nestedArrays(size_t depth)
{
    return repeated({ 0x81 }, depth - 1) + Bytes { 0x80 };
}

// {"a": {"a": ... {}}}, depth maps deep.
Bytes nestedMaps(size_t depth)
{
    return repeated({ 0xa1, 0x61, 'a' }, depth - 1) + Bytes { 0xa0 };
}

Bytes textItem(const Bytes& utf8)
{
    return Bytes { static_cast<uint8_t>(0x60 + utf8.size()) } + utf8;
}

Value roundTrip(const Value& value)
{
    auto decoded = Cbor::decode(Cbor::encode(value));
    EXPECT_TRUE(decoded.ok()) << decoded.error().localizedDescription();
    return decoded.ok() ? *decoded : Value();
}

::testing::AssertionResult refused(const Bytes& input, int64_t code, const std::string& text)
{
    auto result = Cbor::decode(input);
    if (result.ok())
        return ::testing::AssertionFailure() << "decoded to " << result->description();
    const OMError& error = result.error();
    if (error.domain() != "Platform" || error.code() != code || error.description() != text) {
        return ::testing::AssertionFailure()
            << "refused with " << error.domain() << " " << error.code() << ": " << error.localizedDescription();
    }
    return ::testing::AssertionSuccess();
}

::testing::AssertionResult malformed(const Bytes& input, const std::string& text)
{
    return refused(input, kPlatformErrorMalformed, text);
}

TEST(Cbor, RoundTripsEveryKindKeepingItsType)
{
    Uuid::Bytes uuidBytes {};
    for (size_t i = 0; i < uuidBytes.size(); ++i)
        uuidBytes[i] = static_cast<uint8_t>(0xf0 - i);
    const Value original = Value::dictionary({
        { "dictionary", Value::dictionary({ { "inner", Value::integer(1) } }) },
        { "array", Value::array({ Value::integer(1), "two", Value::boolean(false) }) },
        { "string", "héllo" },
        { "integer", Value::integer(-42) },
        { "unsigned", Value::unsignedInteger(std::numeric_limits<uint64_t>::max()) },
        { "real", Value::real(2.5) },
        { "true", Value::boolean(true) },
        { "data", Value::data(Bytes { 0, 1, 0xff }) },
        { "date", Value::date(1700000000.5) },
        { "uuid", Value::uuid(Uuid(uuidBytes)) },
    });

    const Value decoded = roundTrip(original);

    EXPECT_EQ(decoded, original);
    ASSERT_EQ(decoded.count(), original.count());
    for (size_t i = 0; i < original.count(); ++i) {
        EXPECT_EQ(decoded.entries()[i].first, original.entries()[i].first);
        EXPECT_EQ(decoded.entries()[i].second.type(), original.entries()[i].second.type())
            << original.entries()[i].first;
    }
}

TEST(Cbor, EncodesTheDocumentedBytes)
{
    const Value value = Value::dictionary(
        { { "a", Value::integer(1) }, { "b", Value::array({ Value::boolean(true), Value::integer(-2) }) } });
    EXPECT_EQ(Cbor::encode(value), (Bytes { 0xa2, 0x61, 'a', 0x01, 0x61, 'b', 0x82, 0xf5, 0x21 }));
    EXPECT_EQ(Cbor::encode(Value::real(1.5)), (Bytes { 0xfb, 0x3f, 0xf8, 0, 0, 0, 0, 0, 0 }));
    EXPECT_EQ(Cbor::encode(Value::data(Bytes { 7 })), (Bytes { 0x41, 7 }));
    EXPECT_EQ(Cbor::encode(Value::date(0)), (Bytes { 0xc1, 0xfb, 0, 0, 0, 0, 0, 0, 0, 0 }));
    EXPECT_EQ(Cbor::encode(Value::uuid(Uuid())), Bytes({ 0xd8, 0x25, 0x50 }) + Bytes(16, 0));
}

TEST(Cbor, EncodesIntegersInTheShortestHeadAtEachBoundary)
{
    EXPECT_EQ(Cbor::encode(Value::integer(23)), (Bytes { 0x17 }));
    EXPECT_EQ(Cbor::encode(Value::integer(24)), (Bytes { 0x18, 24 }));
    EXPECT_EQ(Cbor::encode(Value::integer(255)), (Bytes { 0x18, 0xff }));
    EXPECT_EQ(Cbor::encode(Value::integer(256)), (Bytes { 0x19, 0x01, 0x00 }));
    EXPECT_EQ(Cbor::encode(Value::integer(65535)), (Bytes { 0x19, 0xff, 0xff }));
    EXPECT_EQ(Cbor::encode(Value::integer(65536)), (Bytes { 0x1a, 0, 1, 0, 0 }));
    EXPECT_EQ(Cbor::encode(Value::integer(int64_t { 4294967296 })), (Bytes { 0x1b, 0, 0, 0, 1, 0, 0, 0, 0 }));
    EXPECT_EQ(Cbor::encode(Value::integer(-1)), (Bytes { 0x20 }));
    EXPECT_EQ(Cbor::encode(Value::integer(-24)), (Bytes { 0x37 }));
    EXPECT_EQ(Cbor::encode(Value::integer(-25)), (Bytes { 0x38, 24 }));
    EXPECT_EQ(Cbor::encode(Value::unsignedInteger(5u)), (Bytes { 0x05 }));
}

TEST(Cbor, EncodeAppendsToWhatTheBufferHolds)
{
    Bytes out { 0xaa, 0xbb };
    Cbor::encode(Value::array({ "x" }), out);
    EXPECT_EQ(out, (Bytes { 0xaa, 0xbb, 0x81, 0x61, 'x' }));
}

TEST(Cbor, UnsignedBoundaryAtInt64Max)
{
    auto atMax = Cbor::decode(Bytes { 0x1b, 0x7f, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff });
    ASSERT_TRUE(atMax.ok());
    EXPECT_EQ(atMax->type(), Value::Type::Integer);
    EXPECT_EQ(atMax->asInt64(), std::numeric_limits<int64_t>::max());

    auto aboveMax = Cbor::decode(Bytes { 0x1b, 0x80, 0, 0, 0, 0, 0, 0, 0 });
    ASSERT_TRUE(aboveMax.ok());
    EXPECT_EQ(aboveMax->type(), Value::Type::Unsigned);
    EXPECT_EQ(aboveMax->asUInt64(), uint64_t { 1 } << 63);

    const Value largest = roundTrip(Value::unsignedInteger(std::numeric_limits<uint64_t>::max()));
    EXPECT_EQ(largest.type(), Value::Type::Unsigned);
    EXPECT_EQ(largest.asUInt64(), std::numeric_limits<uint64_t>::max());
}

TEST(Cbor, NegativeBoundaryAtInt64Min)
{
    const Value smallest = roundTrip(Value::integer(std::numeric_limits<int64_t>::min()));
    EXPECT_EQ(smallest.asInt64(), std::numeric_limits<int64_t>::min());
    EXPECT_EQ(Cbor::encode(smallest), (Bytes { 0x3b, 0x7f, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff }));

    EXPECT_TRUE(refused(
        { 0x3b, 0x80, 0, 0, 0, 0, 0, 0, 0 }, kPlatformErrorLimit, "negative integer below the 64-bit range at byte 0"));
    EXPECT_TRUE(refused({ 0x81, 0x3b, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff }, kPlatformErrorLimit,
        "negative integer below the 64-bit range at byte 1"));
}

TEST(Cbor, RealsKeepNegativeZeroNaNAndInfinities)
{
    const Value negativeZero = roundTrip(Value::real(-0.0));
    EXPECT_TRUE(negativeZero.isReal());
    EXPECT_TRUE(std::signbit(*negativeZero.asDouble()));
    EXPECT_EQ(*negativeZero.asDouble(), 0.0);

    const Value nan = roundTrip(Value::real(std::numeric_limits<double>::quiet_NaN()));
    EXPECT_TRUE(nan.isReal());
    EXPECT_TRUE(std::isnan(*nan.asDouble()));

    EXPECT_EQ(roundTrip(Value::real(-std::numeric_limits<double>::infinity())).asDouble(),
        -std::numeric_limits<double>::infinity());
    EXPECT_EQ(roundTrip(Value::real(std::numeric_limits<double>::denorm_min())).asDouble(),
        std::numeric_limits<double>::denorm_min());
}

TEST(Cbor, ReadsHalfAndSinglePrecisionReals)
{
    struct Case {
        Bytes bytes;
        double expected;
    };
    const Case cases[] = {
        { { 0xf9, 0x3c, 0x00 }, 1.0 },
        { { 0xf9, 0xc0, 0x00 }, -2.0 },
        { { 0xf9, 0x7b, 0xff }, 65504.0 },
        { { 0xf9, 0x00, 0x01 }, std::ldexp(1.0, -24) }, // smallest subnormal half
        { { 0xf9, 0x03, 0xff }, std::ldexp(1023.0, -24) }, // largest subnormal half
        { { 0xf9, 0x04, 0x00 }, std::ldexp(1.0, -14) }, // smallest normal half
        { { 0xf9, 0x7c, 0x00 }, std::numeric_limits<double>::infinity() },
        { { 0xf9, 0xfc, 0x00 }, -std::numeric_limits<double>::infinity() },
        { { 0xfa, 0x3f, 0xc0, 0x00, 0x00 }, 1.5 },
        { { 0xfa, 0x47, 0xc3, 0x50, 0x00 }, 100000.0 },
        { { 0xfa, 0x7f, 0x80, 0x00, 0x00 }, std::numeric_limits<double>::infinity() },
        { { 0xfb, 0x3f, 0xf1, 0x99, 0x99, 0x99, 0x99, 0x99, 0x9a }, 1.1 },
    };
    for (const auto& c : cases) {
        auto decoded = Cbor::decode(c.bytes);
        ASSERT_TRUE(decoded.ok()) << decoded.error().localizedDescription();
        EXPECT_TRUE(decoded->isReal());
        EXPECT_EQ(decoded->asDouble(), c.expected);
    }

    auto negativeZero = Cbor::decode(Bytes { 0xf9, 0x80, 0x00 });
    ASSERT_TRUE(negativeZero.ok());
    EXPECT_TRUE(std::signbit(*negativeZero->asDouble()));
    auto halfNaN = Cbor::decode(Bytes { 0xf9, 0x7e, 0x00 });
    ASSERT_TRUE(halfNaN.ok());
    EXPECT_TRUE(std::isnan(*halfNaN->asDouble()));
    auto singleNaN = Cbor::decode(Bytes { 0xfa, 0x7f, 0xc0, 0x00, 0x00 });
    ASSERT_TRUE(singleNaN.ok());
    EXPECT_TRUE(std::isnan(*singleNaN->asDouble()));
}

TEST(Cbor, AcceptsIntegersInLongerHeadsThanNeeded)
{
    auto padded = Cbor::decode(Bytes { 0x1b, 0, 0, 0, 0, 0, 0, 0, 5 });
    ASSERT_TRUE(padded.ok());
    EXPECT_EQ(padded->asInt64(), 5);
    auto paddedLength = Cbor::decode(Bytes { 0x78, 0x01, 'z' });
    ASSERT_TRUE(paddedLength.ok());
    EXPECT_EQ(*paddedLength->asString(), "z");
}

TEST(Cbor, RoundTripsEmptyContainersStringsAndData)
{
    for (const Value& value : { Value::array(std::vector<Value> {}), Value::dictionary(std::vector<Value::Entry> {}),
             Value::string(""), Value::data(Bytes {}) }) {
        const Value decoded = roundTrip(value);
        EXPECT_EQ(decoded.type(), value.type());
        EXPECT_EQ(decoded, value);
    }
    const Value nested = Value::array({ Value::array(std::vector<Value> {}),
        Value::dictionary(std::vector<Value::Entry> {}), Value::array({ Value::array(std::vector<Value> {}) }) });
    EXPECT_EQ(roundTrip(nested), nested);
}

TEST(Cbor, DatesAreTagOneOverAnyNumber)
{
    EXPECT_EQ(roundTrip(Value::date(-86400.25)).asDate(), -86400.25);

    auto overInteger = Cbor::decode(Bytes { 0xc1, 0x1a, 0x65, 0x53, 0xf1, 0x00 });
    ASSERT_TRUE(overInteger.ok());
    EXPECT_TRUE(overInteger->isDate());
    EXPECT_EQ(overInteger->asDate(), 1700000000.0);

    auto overNegative = Cbor::decode(Bytes { 0xc1, 0x20 });
    ASSERT_TRUE(overNegative.ok());
    EXPECT_EQ(overNegative->asDate(), -1.0);

    auto overHalf = Cbor::decode(Bytes { 0xc1, 0xf9, 0x3c, 0x00 });
    ASSERT_TRUE(overHalf.ok());
    EXPECT_EQ(overHalf->asDate(), 1.0);

    EXPECT_TRUE(malformed({ 0xc1, 0x61, '1' }, "date (tag 1) over something other than a number at byte 0"));
    EXPECT_TRUE(malformed({ 0x81, 0xc1, 0xf5 }, "date (tag 1) over something other than a number at byte 1"));
    EXPECT_TRUE(malformed({ 0xc1, 0x80 }, "date (tag 1) over something other than a number at byte 0"));
    EXPECT_TRUE(malformed({ 0xc1, 0xc1, 0x01 }, "date (tag 1) over something other than a number at byte 0"));
    EXPECT_TRUE(malformed({ 0xc1 }, "unexpected end of input at byte 1"));
}

TEST(Cbor, UuidsNeedExactlySixteenBytes)
{
    Uuid::Bytes raw {};
    for (size_t i = 0; i < raw.size(); ++i)
        raw[i] = static_cast<uint8_t>(i + 1);
    const Bytes body(raw.begin(), raw.end());

    auto sixteen = Cbor::decode(Bytes { 0xd8, 0x25, 0x50 } + body);
    ASSERT_TRUE(sixteen.ok()) << sixteen.error().localizedDescription();
    EXPECT_EQ(sixteen->asUuid(), Uuid(raw));

    EXPECT_TRUE(malformed(Bytes { 0xd8, 0x25, 0x4f } + Bytes(body.begin(), body.end() - 1),
        "UUID (tag 37) of 15 bytes instead of 16 at byte 0"));
    EXPECT_TRUE(malformed(
        Bytes { 0xd8, 0x25, 0x51 } + body + Bytes { 0x11 }, "UUID (tag 37) of 17 bytes instead of 16 at byte 0"));
    EXPECT_TRUE(malformed(
        Bytes { 0xd8, 0x25, 0x70 } + body, "UUID (tag 37) over something other than a byte string at byte 0"));
    EXPECT_TRUE(
        malformed({ 0x82, 0x00, 0xd8, 0x25, 0x10 }, "UUID (tag 37) over something other than a byte string at byte 2"));
}

TEST(Cbor, NestedDictionariesKeepInsertionOrder)
{
    // More than a handful of keys, in an order that is neither sorted nor reverse sorted.
    const std::vector<std::string> keys = { "m", "b", "zz", "a", "q", "c", "y", "d", "x", "e", "k" };
    std::vector<Value::Entry> inner;
    for (size_t i = 0; i < keys.size(); ++i)
        inner.emplace_back(keys[i], Value::integer(static_cast<int64_t>(i)));
    const Value original = Value::dictionary({ { "z", Value::dictionary(inner) }, { "a", Value::dictionary(inner) } });

    const Value decoded = roundTrip(original);

    ASSERT_EQ(decoded.count(), 2u);
    EXPECT_EQ(decoded.entries()[0].first, "z");
    EXPECT_EQ(decoded.entries()[1].first, "a");
    for (const auto& [name, dictionary] : decoded.entries()) {
        ASSERT_EQ(dictionary.count(), keys.size());
        for (size_t i = 0; i < keys.size(); ++i) {
            EXPECT_EQ(dictionary.entries()[i].first, keys[i]);
            EXPECT_EQ(dictionary[keys[i]].asInt64(), static_cast<int64_t>(i));
        }
    }
    EXPECT_EQ(Cbor::encode(decoded), Cbor::encode(original));
}

TEST(Cbor, RoundTripsTheBenchmarkFixtures)
{
    for (const Value& value :
        { bench::pluginInfoDictionary(), bench::annotationTable(300), bench::requestDictionary() }) {
        const Bytes encoded = Cbor::encode(value);
        const Value decoded = roundTrip(value);
        EXPECT_EQ(decoded, value);
        EXPECT_EQ(Cbor::encode(decoded), encoded);
    }
}

TEST(Cbor, DepthLimitCountsContainers)
{
    EXPECT_TRUE(Cbor::decode(nestedArrays(128)).ok());
    EXPECT_TRUE(refused(nestedArrays(129), kPlatformErrorLimit, "nesting deeper than 128 levels at byte 128"));

    EXPECT_TRUE(Cbor::decode(nestedMaps(128)).ok());
    EXPECT_TRUE(refused(nestedMaps(129), kPlatformErrorLimit, "nesting deeper than 128 levels at byte 384"));

    // A scalar inside the deepest container adds no level; a date's tag neither.
    EXPECT_TRUE(Cbor::decode(repeated({ 0x81 }, 128) + Bytes { 0x01 }).ok());
    EXPECT_TRUE(Cbor::decode(repeated({ 0x81 }, 128) + Bytes { 0xc1, 0x01 }).ok());
}

TEST(Cbor, EncodedDepthMatchesTheDecoderLimit)
{
    Value value = Value::integer(7);
    for (int i = 0; i < 128; ++i)
        value = Value::array({ value });
    EXPECT_TRUE(Cbor::decode(Cbor::encode(value)).ok());
    value = Value::array({ value });
    EXPECT_FALSE(Cbor::decode(Cbor::encode(value)).ok());
}

TEST(Cbor, MapKeysMustBeText)
{
    EXPECT_TRUE(malformed({ 0xa1, 0x01, 0x02 }, "non-text map key at byte 1"));
    EXPECT_TRUE(malformed({ 0xa1, 0x41, 'k', 0x02 }, "non-text map key at byte 1"));
    EXPECT_TRUE(malformed({ 0xa1, 0x80, 0x02 }, "non-text map key at byte 1"));
    EXPECT_TRUE(malformed({ 0xa1, 0xa0, 0x02 }, "non-text map key at byte 1"));
    EXPECT_TRUE(malformed({ 0xa1, 0xc1, 0x01, 0x02 }, "non-text map key at byte 1"));
    EXPECT_TRUE(malformed({ 0xa1, 0xf5, 0x02 }, "non-text map key at byte 1"));
    // The second key of a map, after a nested container has closed.
    EXPECT_TRUE(malformed({ 0xa2, 0x61, 'a', 0x81, 0x00, 0x02, 0x03 }, "non-text map key at byte 5"));
}

TEST(Cbor, DuplicateKeysAreRefusedAtTheirSecondOccurrence)
{
    // {"name": 1, "x": 2, "name": 3}
    EXPECT_TRUE(malformed({ 0xa3, 0x64, 'n', 'a', 'm', 'e', 0x01, 0x61, 'x', 0x02, 0x64, 'n', 'a', 'm', 'e', 0x03 },
        "duplicate map key \"name\" at byte 10"));

    // A dictionary large enough to be indexed, the repeat as its last key.
    Bytes large { 0xaa };
    for (char c = 'a'; c < 'j'; ++c)
        large = large + Bytes { 0x61, static_cast<uint8_t>(c), 0x00 };
    large = large + Bytes { 0x61, 'c', 0x00 };
    EXPECT_TRUE(malformed(large, "duplicate map key \"c\" at byte 28"));

    // Inside an array, in a nested map: the offset is the inner key's.
    EXPECT_TRUE(malformed({ 0x82, 0x00, 0xa2, 0x61, 'k', 0x00, 0x61, 'k', 0x01 }, "duplicate map key \"k\" at byte 6"));

    // The same key in two sibling maps is no repeat.
    EXPECT_TRUE(Cbor::decode(Bytes { 0x82, 0xa1, 0x61, 'k', 0x00, 0xa1, 0x61, 'k', 0x01 }).ok());
}

TEST(Cbor, DuplicateKeyQuotedOnlyInPart)
{
    const std::string key(100, 'k');
    Bytes entry = Bytes { 0x78, 100 } + Bytes(key.begin(), key.end()) + Bytes { 0x00 };
    auto result = Cbor::decode(Bytes { 0xa2 } + entry + entry);
    ASSERT_FALSE(result.ok());
    EXPECT_EQ(*result.error().description(), "duplicate map key \"" + std::string(64, 'k') + "\"... at byte 104");
}

TEST(Cbor, AcceptsWellFormedUtf8AtEveryBoundary)
{
    const Bytes valid[] = {
        {},
        { 0x7f },
        { 0xc2, 0x80 }, // U+0080, the smallest two-byte form
        { 0xdf, 0xbf }, // U+07FF
        { 0xe0, 0xa0, 0x80 }, // U+0800, the smallest three-byte form
        { 0xed, 0x9f, 0xbf }, // U+D7FF, just below the surrogates
        { 0xee, 0x80, 0x80 }, // U+E000, just above them
        { 0xef, 0xbf, 0xbf }, // U+FFFF
        { 0xf0, 0x90, 0x80, 0x80 }, // U+10000, the smallest four-byte form
        { 0xf4, 0x8f, 0xbf, 0xbf }, // U+10FFFF, the last code point
        { 'a', 'b', 'c', 'd', 'e', 'f', 'g', 'h', 0xc3, 0xa9, 'i', 'j', 'k', 'l', 'm', 'n', 'o', 'p' },
    };
    for (const auto& text : valid) {
        auto decoded = Cbor::decode(textItem(text));
        ASSERT_TRUE(decoded.ok()) << decoded.error().localizedDescription();
        EXPECT_EQ(*decoded->asString(), std::string(text.begin(), text.end()));
    }
}

TEST(Cbor, RefusesIllFormedUtf8NamingTheByte)
{
    struct Case {
        Bytes text;
        size_t bad; // index in text of the sequence that is refused
    };
    const Case cases[] = {
        { { 0xc0, 0x80 }, 0 }, // overlong NUL
        { { 0xc1, 0xbf }, 0 }, // overlong two-byte
        { { 0xe0, 0x9f, 0xbf }, 0 }, // overlong three-byte (U+07FF)
        { { 0xf0, 0x8f, 0xbf, 0xbf }, 0 }, // overlong four-byte (U+FFFF)
        { { 0xed, 0xa0, 0x80 }, 0 }, // U+D800, first surrogate
        { { 0xed, 0xbf, 0xbf }, 0 }, // U+DFFF, last surrogate
        { { 0xf4, 0x90, 0x80, 0x80 }, 0 }, // U+110000
        { { 0xf5, 0x80, 0x80, 0x80 }, 0 },
        { { 0xff }, 0 },
        { { 'a', 0x80 }, 1 }, // continuation without a lead
        { { 'a', 'b', 'c', 0xe2, 0x82 }, 3 }, // truncated at the end of the string
        { { 0xe2, 0x28, 0xa1 }, 0 }, // lead followed by ASCII
        { { 'a', 'b', 0xf0, 0x9f, 0x98 }, 2 },
        { { '1', '2', '3', '4', '5', '6', '7', '8', 0x80 }, 8 }, // just past a whole ASCII word
        { { '1', '2', '3', '4', '5', '6', '7', 0xc3, 0xa9, 0xc3 }, 9 },
    };
    for (const auto& c : cases) {
        EXPECT_TRUE(malformed(textItem(c.text), "invalid UTF-8 at byte " + std::to_string(1 + c.bad)))
            << "case at index " << c.bad << " of " << c.text.size() << " bytes";
    }
    // In a key, the offset counts from the start of the whole input.
    EXPECT_TRUE(malformed({ 0xa1, 0x62, 0xc3, 0x28, 0x01 }, "invalid UTF-8 at byte 2"));
}

TEST(Cbor, RefusesTagsOtherThanDateAndUuid)
{
    EXPECT_TRUE(malformed({ 0xc0, 0x60 }, "unsupported tag 0 at byte 0"));
    EXPECT_TRUE(malformed({ 0xc2, 0x41, 0x01 }, "unsupported tag 2 at byte 0"));
    EXPECT_TRUE(malformed({ 0xd8, 0x24, 0x60 }, "unsupported tag 36 at byte 0"));
    EXPECT_TRUE(malformed({ 0xd8, 0x26, 0x60 }, "unsupported tag 38 at byte 0"));
    EXPECT_TRUE(malformed({ 0xd9, 0xd9, 0xf7, 0x00 }, "unsupported tag 55799 at byte 0"));
    // Tag numbers are read in any head length.
    EXPECT_TRUE(Cbor::decode(Bytes { 0x81, 0xdb, 0, 0, 0, 0, 0, 0, 0, 1, 0x00 }).ok());
}

TEST(Cbor, RefusesNullUndefinedAndOtherSimpleValues)
{
    EXPECT_TRUE(malformed({ 0xf6 }, "null at byte 0"));
    EXPECT_TRUE(malformed({ 0xf7 }, "undefined at byte 0"));
    EXPECT_TRUE(malformed({ 0x82, 0x01, 0xf6 }, "null at byte 2"));
    EXPECT_TRUE(malformed({ 0xa1, 0x61, 'k', 0xf7 }, "undefined at byte 3"));
    EXPECT_TRUE(malformed({ 0xe0 }, "unsupported simple value 0 at byte 0"));
    EXPECT_TRUE(malformed({ 0xf3 }, "unsupported simple value 19 at byte 0"));
    EXPECT_TRUE(malformed({ 0xf8, 0x20 }, "unsupported simple value 32 at byte 0"));
    EXPECT_TRUE(malformed({ 0xf8, 0xff }, "unsupported simple value 255 at byte 0"));
    EXPECT_TRUE(malformed({ 0xfc }, "reserved additional information 28 at byte 0"));
    EXPECT_TRUE(malformed({ 0x1d }, "reserved additional information 29 at byte 0"));
    EXPECT_TRUE(malformed({ 0x5e }, "reserved additional information 30 at byte 0"));
    EXPECT_TRUE(malformed({ 0x1f }, "reserved additional information 31 at byte 0"));
    EXPECT_TRUE(malformed({ 0xdf, 0x00 }, "reserved additional information 31 at byte 0"));
    EXPECT_TRUE(malformed({ 0x81, 0xff }, "unexpected break at byte 1"));
}

TEST(Cbor, RefusesIndefiniteLengths)
{
    EXPECT_TRUE(malformed({ 0x5f, 0x41, 0x00, 0xff }, "indefinite-length byte string at byte 0"));
    EXPECT_TRUE(malformed({ 0x7f, 0x61, 'a', 0xff }, "indefinite-length text string at byte 0"));
    EXPECT_TRUE(malformed({ 0x9f, 0xff }, "indefinite-length array at byte 0"));
    EXPECT_TRUE(malformed({ 0xa1, 0x61, 'k', 0xbf, 0xff }, "indefinite-length map at byte 3"));
}

TEST(Cbor, RefusesTrailingBytes)
{
    EXPECT_TRUE(malformed({ 0x01, 0x01 }, "trailing bytes after the item at byte 1"));
    EXPECT_TRUE(malformed({ 0x80, 0x00 }, "trailing bytes after the item at byte 1"));
    EXPECT_TRUE(malformed({ 0xa1, 0x61, 'k', 0x00, 0xff }, "trailing bytes after the item at byte 4"));
}

TEST(Cbor, RefusesTruncatedInput)
{
    EXPECT_TRUE(malformed({}, "unexpected end of input at byte 0"));
    EXPECT_TRUE(malformed({ 0x19, 0x01 }, "truncated item head at byte 0"));
    EXPECT_TRUE(malformed({ 0xfb, 0x00, 0x00 }, "truncated item head at byte 0"));
    EXPECT_TRUE(malformed({ 0x81, 0xd8 }, "truncated item head at byte 1"));
    EXPECT_TRUE(malformed({ 0x63, 'a', 'b' }, "text string of 3 bytes past the end of the input at byte 0"));
    EXPECT_TRUE(malformed(
        { 0x82, 0x01, 0x59, 0x01, 0x00, 0x00 }, "byte string of 256 bytes past the end of the input at byte 2"));
    EXPECT_TRUE(malformed({ 0x82, 0x01 }, "array of 2 elements longer than the 1 byte remaining at byte 0"));
    EXPECT_TRUE(malformed({ 0x82, 0x01, 0x81 }, "array of 1 element longer than the 0 bytes remaining at byte 2"));
    EXPECT_TRUE(malformed({ 0xa1, 0x61, 'k' }, "unexpected end of input at byte 3"));
    EXPECT_TRUE(malformed({ 0xc1 }, "unexpected end of input at byte 1"));
}

TEST(Cbor, HugeLengthHeadersFailBeforeAnyAllocation)
{
    EXPECT_TRUE(malformed({ 0x9b, 0x10, 0, 0, 0, 0, 0, 0, 0 },
        "array of 1152921504606846976 elements longer than the 0 bytes remaining at byte 0"));
    EXPECT_TRUE(malformed({ 0xbb, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0x60, 0x00 },
        "map of 18446744073709551615 entries longer than the 2 bytes remaining at byte 0"));
    EXPECT_TRUE(malformed({ 0x5b, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff },
        "byte string of 18446744073709551615 bytes past the end of the input at byte 0"));
    EXPECT_TRUE(malformed({ 0x7b, 0x7f, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 'a' },
        "text string of 9223372036854775807 bytes past the end of the input at byte 0"));
    // A map needs two items per entry: 2 entries fit in 4 bytes, not in 3.
    EXPECT_TRUE(Cbor::decode(Bytes { 0xa2, 0x60, 0x00, 0x61, 'a', 0x00 }).ok());
    EXPECT_TRUE(malformed({ 0xa2, 0x60, 0x00, 0x60 }, "map of 2 entries longer than the 3 bytes remaining at byte 0"));
}

TEST(Cbor, ItemCountIsBoundedWhateverTheBytesAllow)
{
    // An array header and its elements: kMaxItems heads in all decode, one more is refused.
    auto arrayOfZeros = [](size_t elements) {
        Bytes bytes { 0x9a, uint8_t(elements >> 24), uint8_t(elements >> 16), uint8_t(elements >> 8),
            uint8_t(elements) };
        bytes.resize(bytes.size() + elements, 0x00);
        return bytes;
    };
    auto fits = Cbor::decode(arrayOfZeros(Cbor::kMaxItems - 1));
    ASSERT_TRUE(fits.ok()) << fits.error().localizedDescription();
    EXPECT_EQ(fits->count(), Cbor::kMaxItems - 1);
    auto over = Cbor::decode(arrayOfZeros(Cbor::kMaxItems));
    ASSERT_FALSE(over.ok());
    EXPECT_EQ(over.error().code(), om::kPlatformErrorLimit);
    EXPECT_NE(over.error().localizedDescription().find("more than 1048576 items"), std::string::npos);
}

TEST(Cbor, NestedCountsAreChargedAgainstTheSameBytes)
{
    // Each header alone fits in what follows it, but not together with the items already promised:
    // the outer array still needs one element after the inner one.
    EXPECT_TRUE(
        malformed({ 0x82, 0x82, 0x00, 0x00 }, "array of 2 elements longer than the 2 bytes remaining at byte 1"));

    // 100 arrays each claiming 200 elements, then 200 elements: refused at the second header, not
    // after reserving for a hundred times the input.
    const Bytes hostile = repeated({ 0x98, 200 }, 100) + Bytes(200, 0x00);
    EXPECT_TRUE(malformed(hostile, "array of 200 elements longer than the 396 bytes remaining at byte 2"));

    // A tag and its item are one element: [date, UUID, [0]] is charged three items, not five.
    EXPECT_TRUE(
        Cbor::decode(Bytes { 0x83, 0xc1, 0x00, 0xd8, 0x25, 0x50 } + Bytes(16, 0xab) + Bytes { 0x81, 0x00 }).ok());
}

TEST(CborDeathTest, EncodingNoneIsAProgrammingError)
{
    EXPECT_DEATH(Cbor::encode(Value()), "none value");
}

} // namespace
} // namespace om
