// A whole value tree carried as one transport value: a data value holding the tree's CBOR bytes.
#pragma once

#include <optional>

#include "platform/Value.h"

namespace om {

class ConduitMessageEncoding {
public:
    static Value encode(const Value& tree);
    // None when message is not data or its bytes do not decode.
    static std::optional<Value> decode(const Value& message);
};

} // namespace om
