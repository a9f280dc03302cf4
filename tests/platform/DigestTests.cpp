#include <gtest/gtest.h>

#include <string>

#include "platform/Digest.h"

using om::Digest;

namespace {

std::span<const uint8_t> bytesOf(std::string_view text)
{
    return { reinterpret_cast<const uint8_t*>(text.data()), text.size() };
}

template <size_t N> std::string hexOf(const std::array<uint8_t, N>& bytes)
{
    std::string text;
    for (uint8_t byte : bytes) {
        text += "0123456789abcdef"[byte >> 4];
        text += "0123456789abcdef"[byte & 0xf];
    }
    return text;
}

} // namespace

// Published test vectors: FIPS 180 for SHA-1, RFC 4231 case 2 for HMAC-SHA256.
TEST(Digest, KnownAnswers)
{
    EXPECT_EQ(hexOf(Digest::sha1(bytesOf("abc"))), "a9993e364706816aba3e25717850c26c9cd0d89d");
    EXPECT_EQ(hexOf(Digest::sha1(bytesOf(""))), "da39a3ee5e6b4b0d3255bfef95601890afd80709");
    EXPECT_EQ(hexOf(Digest::hmacSha256(bytesOf("Jefe"), bytesOf("what do ya want for nothing?"))),
        "5bdcc146bf60754e6a042426089575c75a003f089d2739839dec58b964ec3843");
}

TEST(Digest, ConstantTimeComparisonNeedsEqualLengthAndBytes)
{
    EXPECT_TRUE(Digest::equalInConstantTime(bytesOf("abcd"), bytesOf("abcd")));
    EXPECT_TRUE(Digest::equalInConstantTime(bytesOf(""), bytesOf("")));
    EXPECT_FALSE(Digest::equalInConstantTime(bytesOf("abcd"), bytesOf("abce")));
    EXPECT_FALSE(Digest::equalInConstantTime(bytesOf("abcd"), bytesOf("abc")));
    EXPECT_FALSE(Digest::equalInConstantTime(bytesOf("abc"), bytesOf("abcd")));
}
