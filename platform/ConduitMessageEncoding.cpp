#include "platform/ConduitMessageEncoding.h"

#include "platform/Cbor.h"
#include "platform/ConduitFrame.h"

namespace om {

Value ConduitMessageEncoding::encode(const Value& tree)
{
    // A tree that cannot be encoded (a none inside) becomes empty data, which decode() refuses.
    if (ConduitFrame::whyNotCarriable(tree))
        return Value::data(std::vector<uint8_t>());
    return Value::data(Cbor::encode(tree));
}

std::optional<Value> ConduitMessageEncoding::decode(const Value& message)
{
    const auto* bytes = message.asData();
    if (!bytes)
        return std::nullopt;
    auto decoded = Cbor::decode(*bytes);
    if (!decoded.ok())
        return std::nullopt;
    return std::move(decoded).releaseValue();
}

} // namespace om
