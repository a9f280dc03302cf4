#include "omd/OMDPlugInSignature.h"

#include "platform/Digest.h"
#include "platform/Uuid.h"

namespace om {

std::shared_ptr<OMDPlugInSignature> OMDPlugInSignature::initWithURL(std::string_view, std::optional<OMError>*)
{
    // The SHA-1 of a fresh random UUID's canonical text (36 ASCII bytes).
    const std::string text = Uuid::random().string();
    const auto digest = Digest::sha1({ reinterpret_cast<const uint8_t*>(text.data()), text.size() });
    return std::shared_ptr<OMDPlugInSignature>(
        new OMDPlugInSignature(std::vector<uint8_t>(digest.begin(), digest.end()), "dummy requirement"));
}

} // namespace om
