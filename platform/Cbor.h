// CBOR encoding of Value, as carried by the Conduit transport and the binary vlist form.
//
// Mapping: dictionary = map with text keys, array, text string, integers (major types 0 and 1),
// real (written as 64-bit float; 16/32/64-bit read), booleans (simple 20/21), data = byte string,
// date = tag 1 over seconds since 1970, UUID = tag 37 over exactly 16 bytes.
// The decoder accepts exactly one data item with definite lengths and refuses, with the byte
// offset in the error: nesting deeper than kMaxDepth, non-text map keys, duplicate keys, invalid
// UTF-8, tags other than 1 and 37, null, undefined, other simple values, and trailing bytes.
// Depth counts containers (a scalar alone is at depth 0, [1] at depth 1): 128 nested arrays
// decode, 129 do not.
#pragma once

#include <cstdint>
#include <span>
#include <vector>

#include "platform/Result.h"
#include "platform/Value.h"

namespace om {

class Cbor {
public:
    static constexpr unsigned kMaxDepth = 128;
    // Item heads (scalars, containers, tags) one decode accepts. A one-byte item becomes a Value
    // of some fifty bytes, so without this bound a 16 MiB frame of tiny items would cost the
    // receiver over a gigabyte; with it, about a hundred megabytes at worst.
    static constexpr size_t kMaxItems = size_t(1) << 20;

    // Appends the encoding of value to out. value and everything in it must not be none.
    static void encode(const Value& value, std::vector<uint8_t>& out);
    static std::vector<uint8_t> encode(const Value& value);

    // Decodes exactly one item spanning all of bytes.
    static Result<Value> decode(std::span<const uint8_t> bytes);
};

} // namespace om
