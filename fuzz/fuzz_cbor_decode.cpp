// Decodes arbitrary bytes. A refusal must name an offset inside the input; whatever decodes must
// re-encode to bytes that decode to the same value and encode to the same bytes again.
#include <cmath>
#include <cstdint>
#include <cstdlib>
#include <string>

#include "platform/Cbor.h"

namespace {

// NaN never equals itself, so trees holding one are compared by their encodings alone.
bool holdsNaN(const om::Value& value)
{
    if (value.isReal() || value.isDate())
        return std::isnan(value.isReal() ? *value.asDouble() : *value.asDate());
    for (const auto& element : value.elements()) {
        if (holdsNaN(element))
            return true;
    }
    for (const auto& entry : value.entries()) {
        if (holdsNaN(entry.second))
            return true;
    }
    return false;
}

void checkRefusal(const om::OMError& error, size_t size)
{
    const std::string& text = error.description().value();
    const size_t at = text.rfind(" at byte ");
    if (error.domain() != "Platform" || at == std::string::npos)
        std::abort();
    if (std::stoull(text.substr(at + 9)) > size)
        std::abort();
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    auto decoded = om::Cbor::decode({ data, size });
    if (!decoded.ok()) {
        checkRefusal(decoded.error(), size);
        return 0;
    }
    const auto encoded = om::Cbor::encode(*decoded);
    auto again = om::Cbor::decode(encoded);
    if (!again.ok())
        std::abort();
    if (om::Cbor::encode(*again) != encoded)
        std::abort();
    if (!holdsNaN(*decoded) && !(*again == *decoded))
        std::abort();
    return 0;
}
