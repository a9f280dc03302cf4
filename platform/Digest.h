// Message digests and authentication codes, through OpenSSL's libcrypto.
#pragma once

#include <array>
#include <cstdint>
#include <span>

namespace om {

class Digest {
public:
    using Sha1 = std::array<uint8_t, 20>;
    using Sha256 = std::array<uint8_t, 32>;

    static Sha1 sha1(std::span<const uint8_t> bytes);
    static Sha256 hmacSha256(std::span<const uint8_t> key, std::span<const uint8_t> bytes);
    // Compares in time that depends only on the length, so that a mismatch tells nothing about
    // where it is.
    static bool equalInConstantTime(std::span<const uint8_t> a, std::span<const uint8_t> b);
};

} // namespace om
