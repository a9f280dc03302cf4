// An error value: a domain, a signed code and an optional description. Errors travel as values;
// nothing in this project throws across a module boundary.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace om {

class OMError {
public:
    OMError(std::string domain, int64_t code, std::optional<std::string> description = std::nullopt)
        : m_domain(std::move(domain))
        , m_code(code)
        , m_description(std::move(description))
    {
    }

    // "<call>: <strerror>" in the POSIX domain, with errno as the code.
    static OMError fromErrno(std::string_view call, int error);
    // strerror's text, from any thread.
    static std::string errnoDescription(int error);
    // For failures of the platform layer itself (decoders, parsers): domain "Platform".
    static OMError platform(int64_t code, std::string description);

    const std::string& domain() const { return m_domain; }
    int64_t code() const { return m_code; }
    const std::optional<std::string>& description() const { return m_description; }

    // The description when there is one, otherwise "<domain> error <code>".
    std::string localizedDescription() const;

    bool operator==(const OMError&) const = default;

private:
    std::string m_domain;
    int64_t m_code;
    std::optional<std::string> m_description;
};

// Codes of the "Platform" domain.
enum PlatformErrorCode : int64_t {
    kPlatformErrorMalformed = 1, // bytes that do not decode (CBOR, vlist, UUID text)
    kPlatformErrorLimit = 2, // a size or depth limit was exceeded
    kPlatformErrorUnsupported = 3,
};

} // namespace om
