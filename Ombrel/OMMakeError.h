// Error values of the daemon's own domain, "Ombrel".
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "platform/Format.h"
#include "platform/OMError.h"

namespace om {

inline constexpr const char kOMErrorDomain[] = "Ombrel";

// An error without a description when message is absent.
OMError OMMakeError(int64_t code, std::optional<std::string> message = std::nullopt);
// A null message is treated as an absent one.
OMError OMMakeError(int64_t code, const char* message);

// The description is the formatted text; none when format is null.
template <typename... Args> OMError OMMakeErrorWithFormat(int64_t code, const char* format, const Args&... args)
{
    if (!format)
        return OMError(kOMErrorDomain, code);
    return OMError(kOMErrorDomain, code, om::format(format, args...));
}

} // namespace om
