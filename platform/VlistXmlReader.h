// Reads the XML form of a vlist into a Value. libxml2 checks well-formedness; this class walks the
// resulting tree and refuses, with the line, anything the vlist vocabulary does not allow.
//
// The document may carry a DOCTYPE, but no entity declaration: the parse stops at the first one,
// so external entities are never fetched and nested ones are never expanded. Whitespace between
// elements is ignored; inside <string> and <key> every character counts.
#pragma once

#include <cstdint>
#include <span>

#include "platform/Result.h"
#include "platform/Value.h"

namespace om {

class VlistXmlReader {
public:
    static Result<Value> parse(std::span<const uint8_t> bytes);
};

} // namespace om
