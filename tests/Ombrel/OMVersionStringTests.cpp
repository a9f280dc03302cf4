#include <gtest/gtest.h>

#include <algorithm>
#include <random>

#include "Ombrel/OMVersionString.h"

using om::compareVersionString;

namespace {

// Checks both directions, so that an asymmetric comparison cannot pass.
void expectOrder(std::string_view lower, std::string_view higher)
{
    EXPECT_EQ(compareVersionString(lower, higher), -1) << '"' << lower << "\" < \"" << higher << '"';
    EXPECT_EQ(compareVersionString(higher, lower), 1) << '"' << higher << "\" > \"" << lower << '"';
}

void expectEquivalent(std::string_view a, std::string_view b)
{
    EXPECT_EQ(compareVersionString(a, b), 0) << '"' << a << "\" == \"" << b << '"';
    EXPECT_EQ(compareVersionString(b, a), 0) << '"' << b << "\" == \"" << a << '"';
}

} // namespace

TEST(CompareVersionString, EmptyTexts)
{
    expectEquivalent("", "");
    expectOrder("", "1");
    expectOrder("", "a");
    expectOrder("", "0");
}

TEST(CompareVersionString, DigitRunsCompareByValue)
{
    expectOrder("9", "10");
    expectOrder("2.9", "2.10");
    expectOrder("1.2.3", "1.2.12");
    expectOrder("1.99.0", "1.100");
    expectEquivalent("10", "10");
    expectOrder("0", "1");
}

TEST(CompareVersionString, LeadingZerosDoNotCountSoTheTextsAreEquivalent)
{
    expectEquivalent("01", "1");
    expectEquivalent("1.01", "1.1");
    expectEquivalent("000", "0");
    expectEquivalent("0", "00");
    expectOrder("1.01", "1.2");
    expectOrder("007", "10");
}

TEST(CompareVersionString, RunsLongerThanSixtyFourBitsCompareWithoutOverflow)
{
    expectOrder("18446744073709551615", "18446744073709551616");
    expectOrder("99999999999999999999999999", "100000000000000000000000000");
    expectOrder("1.123456789012345678901234567890", "1.123456789012345678901234567891");
    expectEquivalent("0000000000000000000000000000042", "42");
}

TEST(CompareVersionString, OtherCharactersCompareOneByOneCaseSensitively)
{
    expectOrder("1.0a", "1.0b");
    expectOrder("A", "a");
    expectOrder("Z", "a");
    expectOrder("1.0-beta", "1.0.0");
    expectEquivalent("1.0b", "1.0b");
}

TEST(CompareVersionString, DigitAgainstNonDigitComparesTheCharacters)
{
    expectOrder("1.0", "1a0"); // '.' < 'a'
    expectOrder("1.5", "1.a"); // '5' < 'a'
    expectOrder("1.-", "1.5"); // '-' < '5'
    expectOrder("1.0", "1.0a");
}

TEST(CompareVersionString, PrefixOrdersFirst)
{
    expectOrder("1", "1.0");
    expectOrder("1.0", "1.0.0");
    expectOrder("1.", "1.0");
}

TEST(CompareVersionString, BytesAboveAsciiCompareUnsigned)
{
    expectOrder("1.z", "1.\xc3\xa9");
}

TEST(CompareVersionString, SortsConsistently)
{
    const std::vector<std::string> ordered = { "", "0.9", "0.10", "1", "1.0", "1.0.1", "1.0a", "1.0b", "1.2", "1.10",
        "1.10.0", "2", "10", "10.0", "A", "a" };
    auto shuffled = ordered;
    std::mt19937 random(7);
    for (int round = 0; round < 20; ++round) {
        std::shuffle(shuffled.begin(), shuffled.end(), random);
        std::sort(shuffled.begin(), shuffled.end(),
            [](const std::string& a, const std::string& b) { return compareVersionString(a, b) < 0; });
        ASSERT_EQ(shuffled, ordered);
    }
}

// Indexes look texts up by their equivalence key instead of comparing: every pair over a small
// alphabet (digits, zeros, letters, dots) must agree with the comparison both ways.
TEST(CompareVersionString, EquivalenceKeyAgreesWithTheComparison)
{
    const std::string alphabet = "001a.9";
    std::vector<std::string> texts = { "" };
    for (size_t length = 1; length <= 4; ++length) {
        const size_t before = texts.size();
        for (size_t i = 0; i < before; ++i) {
            if (texts[i].size() + 1 != length)
                continue;
            for (char c : alphabet)
                texts.push_back(texts[i] + c);
        }
    }
    for (const auto& a : texts) {
        for (const auto& b : texts) {
            const bool equivalent = compareVersionString(a, b) == 0;
            ASSERT_EQ(om::VersionString::equivalenceKey(a) == om::VersionString::equivalenceKey(b), equivalent)
                << '"' << a << "\" vs \"" << b << '"';
        }
    }
    EXPECT_EQ(om::VersionString::equivalenceKey("com.a007.x00"), "com.a7.x0");
}
