#include <gtest/gtest.h>

#include <cstdint>
#include <limits>
#include <string>

#include "platform/Format.h"

using om::format;
using om::Value;

TEST(Format, PlainTextAndPercentEscape)
{
    EXPECT_EQ(format(""), "");
    EXPECT_EQ(format("no specifiers"), "no specifiers");
    EXPECT_EQ(format("100%%"), "100%");
    EXPECT_EQ(format("%%d", 5), "%d");
    EXPECT_EQ(format("%%%d", 5), "%5");
}

TEST(Format, IntegerSpecifiers)
{
    EXPECT_EQ(format("%d", -42), "-42");
    EXPECT_EQ(format("%u", 42u), "42");
    EXPECT_EQ(format("%ld", int64_t(-9000000000)), "-9000000000");
    EXPECT_EQ(format("%llu", uint64_t(18446744073709551615ull)), "18446744073709551615");
    EXPECT_EQ(format("%lx", 255ul), "ff");
    EXPECT_EQ(format("%X", 0xabcu), "ABC");
    EXPECT_EQ(format("%d", std::numeric_limits<int64_t>::min()), "-9223372036854775808");
    EXPECT_EQ(format("%d", true), "1");
    EXPECT_EQ(format("%d", short(-7)), "-7");
}

TEST(Format, DecimalPrintsTheTrueValueWhateverTheSignedness)
{
    EXPECT_EQ(format("%d", uint64_t(9223372036854775807ull)), "9223372036854775807");
    EXPECT_EQ(format("%d", uint64_t(9223372036854775808ull)), "9223372036854775808");
    EXPECT_EQ(format("%u", -1), "-1");
    EXPECT_EQ(format("%llu", int64_t(0)), "0");
}

// Every digit in both cases: an off-by-one in mapping digits to upper case shows first at F.
TEST(Format, HexDigitsInBothCases)
{
    struct Case {
        uint64_t value;
        const char* lower;
        const char* upper;
    };
    const Case cases[] = {
        { 0x0123456789abcdefull, "123456789abcdef", "123456789ABCDEF" },
        { 0xfedcba9876543210ull, "fedcba9876543210", "FEDCBA9876543210" },
        { 0xf, "f", "F" },
        { 0xa, "a", "A" },
        { 0x9, "9", "9" },
    };
    for (const auto& c : cases) {
        EXPECT_EQ(format("%lx", c.value), c.lower);
        EXPECT_EQ(format("%lX", c.value), c.upper);
    }
}

TEST(Format, HexPrintsSixtyFourBitTwosComplement)
{
    EXPECT_EQ(format("%lx", -1), "ffffffffffffffff");
    EXPECT_EQ(format("%x", 0), "0");
    EXPECT_EQ(format("%lx", std::numeric_limits<int64_t>::min()), "8000000000000000");
}

TEST(Format, TextSpecifiers)
{
    const char* cText = "c";
    std::string text = "std";
    std::string_view view = "view";
    EXPECT_EQ(format("[%s|%s|%s]", cText, text, view), "[c|std|view]");
    EXPECT_EQ(format("%{public}s!", "pub"), "pub!");
    EXPECT_EQ(format("%s", static_cast<const char*>(nullptr)), "(null)");
    EXPECT_EQ(format("%s", ""), "");
}

TEST(Format, TextWithEmbeddedNulIsKeptWhole)
{
    std::string withNul("a\0b", 3);
    EXPECT_EQ(format("%s", withNul), withNul);
}

TEST(Format, ObjectSpecifierDescribesTheValue)
{
    Value dictionary = Value::dictionary({ { "a", Value(1) } });
    EXPECT_EQ(format("%@", Value("bare")), "bare");
    EXPECT_EQ(format("%{public}@", dictionary), dictionary.description());
    EXPECT_EQ(format("%@", Value()), Value().description());
    // Text is an acceptable object: it prints as itself.
    EXPECT_EQ(format("%@", "text"), "text");
}

TEST(Format, PointerSpecifier)
{
    int local = 0;
    auto expected = "0x" + format("%lx", reinterpret_cast<uintptr_t>(&local));
    EXPECT_EQ(format("%p", static_cast<const void*>(&local)), expected);
    EXPECT_EQ(format("%p", static_cast<const void*>(nullptr)), "0x0");
}

TEST(Format, MissingArgumentsPrintMarker)
{
    EXPECT_EQ(format("%d"), "<?>");
    EXPECT_EQ(format("%s and %s", "one"), "one and <?>");
    EXPECT_EQ(format("%@ %p %u"), "<?> <?> <?>");
}

TEST(Format, MismatchedKindsPrintMarkerAndConsumeTheArgument)
{
    int local = 0;
    const void* pointer = &local;
    EXPECT_EQ(format("%d %s", "text", "next"), "<?> next");
    EXPECT_EQ(format("%s", 5), "<?>");
    EXPECT_EQ(format("%s", Value("object")), "<?>");
    EXPECT_EQ(format("%@", 5), "<?>");
    EXPECT_EQ(format("%p", 5), "<?>");
    EXPECT_EQ(format("%p", "text"), "<?>");
    EXPECT_EQ(format("%d", pointer), "<?>");
    EXPECT_EQ(format("%x", Value(5)), "<?>");
}

TEST(Format, ExtraArgumentsAreIgnored)
{
    EXPECT_EQ(format("%d", 1, 2, 3), "1");
    EXPECT_EQ(format("none", 1), "none");
}

TEST(Format, UnknownOrIncompleteSpecifiersPrintLiterally)
{
    EXPECT_EQ(format("50%"), "50%");
    EXPECT_EQ(format("%l"), "%l");
    EXPECT_EQ(format("%q", 1), "%q");
    EXPECT_EQ(format("%5d", 7), "%5d");
    EXPECT_EQ(format("%c", 65), "%c");
    EXPECT_EQ(format("%{private}s", "x"), "%{private}s");
    EXPECT_EQ(format("%{public}", "x"), "%{public}");
    // An unknown specifier consumes no argument.
    EXPECT_EQ(format("%y %d", 3), "%y 3");
}

TEST(Format, LengthModifiersDoNotChangeTheValue)
{
    EXPECT_EQ(format("%hd", 70000), "70000");
    EXPECT_EQ(format("%zu", size_t(12)), "12");
    EXPECT_EQ(format("%lld", -5ll), "-5");
    EXPECT_EQ(format("%{public}lu", 3ul), "3");
}

TEST(Format, ManyArgumentsInOrder)
{
    EXPECT_EQ(format("%s=%d (%@) %u%%", "count", -3, Value("v"), 4u), "count=-3 (v) 4%");
}
