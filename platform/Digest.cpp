#include "platform/Digest.h"

#include "platform/Fatal.h"

#include <openssl/crypto.h>
#include <openssl/evp.h>
#include <openssl/hmac.h>

namespace om {

Digest::Sha1 Digest::sha1(std::span<const uint8_t> bytes)
{
    Sha1 digest {};
    unsigned length = 0;
    // Fails only when libcrypto cannot allocate a context; nothing sensible can follow that.
    if (!EVP_Digest(bytes.data(), bytes.size(), digest.data(), &length, EVP_sha1(), nullptr) || length != digest.size())
        internalInconsistency("EVP_Digest(SHA-1) failed");
    return digest;
}

Digest::Sha256 Digest::hmacSha256(std::span<const uint8_t> key, std::span<const uint8_t> bytes)
{
    Sha256 mac {};
    unsigned length = 0;
    if (!HMAC(EVP_sha256(), key.data(), static_cast<int>(key.size()), bytes.data(), bytes.size(), mac.data(), &length)
        || length != mac.size())
        internalInconsistency("HMAC(SHA-256) failed");
    return mac;
}

bool Digest::equalInConstantTime(std::span<const uint8_t> a, std::span<const uint8_t> b)
{
    return a.size() == b.size() && CRYPTO_memcmp(a.data(), b.data(), a.size()) == 0;
}

} // namespace om
