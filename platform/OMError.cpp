#include "platform/OMError.h"

#include <cstring>

namespace om {

OMError OMError::fromErrno(std::string_view call, int error)
{
    std::string text(call);
    text += ": ";
    text += errnoDescription(error);
    return OMError("POSIX", error, std::move(text));
}

std::string OMError::errnoDescription(int error)
{
    char buffer[128];
    // The GNU strerror_r: returns a static text for known errors, or writes into buffer.
    return ::strerror_r(error, buffer, sizeof buffer);
}

OMError OMError::platform(int64_t code, std::string description)
{
    return OMError("Platform", code, std::move(description));
}

std::string OMError::localizedDescription() const
{
    if (m_description)
        return *m_description;
    return m_domain + " error " + std::to_string(m_code);
}

} // namespace om
