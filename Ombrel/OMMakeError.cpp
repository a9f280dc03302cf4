#include "Ombrel/OMMakeError.h"

namespace om {

OMError OMMakeError(int64_t code, std::optional<std::string> message)
{
    return OMError(kOMErrorDomain, code, std::move(message));
}

OMError OMMakeError(int64_t code, const char* message)
{
    if (!message)
        return OMError(kOMErrorDomain, code);
    return OMError(kOMErrorDomain, code, std::string(message));
}

} // namespace om
