// Conversion between value trees and transport values. The transport carries Value itself, so
// the conversion only checks that the tree is something the wire can carry (no none inside, depth
// within the CBOR limit) and shares it.
#pragma once

#include <optional>

#include "platform/Value.h"

namespace om {

class ValueTreeConversion {
public:
    static std::optional<Value> toConduit(const Value& tree);
    static std::optional<Value> fromConduit(const Value& message);
};

} // namespace om
