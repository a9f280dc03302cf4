// The decoder behind Cbor::decode: libcbor's streaming decoder reports one item head at a time and
// this class assembles the Value on an explicit stack, checking the mapping's rules and limits as
// each head arrives, so that nothing is built from an input that is then refused.
//
// Depth counts containers: a scalar alone is at depth 0, [1] at depth 1, [[1]] at depth 2; a
// container that would sit deeper than Cbor::kMaxDepth is refused.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "platform/OMError.h"
#include "platform/Result.h"
#include "platform/Value.h"

namespace om {

class CborDecoder {
public:
    static Result<Value> decode(std::span<const uint8_t> bytes);

    // Offset of the first byte of the first ill-formed UTF-8 sequence in text (overlong forms,
    // surrogates, code points past U+10FFFF and truncated sequences are ill-formed), or none.
    static std::optional<size_t> invalidUtf8Offset(std::span<const uint8_t> text);

private:
    struct Callbacks; // the libcbor callback table, which forwards to the members below
    friend struct Callbacks;

    struct Frame {
        bool isMap;
        uint64_t left; // items still to come; a map's keys and values count separately
        size_t firstKey; // this map's first entry in m_keys
        std::vector<Value> elements;
        std::vector<Value::Entry> entries;
    };

    struct Key {
        size_t offset;
        std::string_view text; // into the input
    };

    explicit CborDecoder(std::span<const uint8_t> bytes)
        : m_bytes(bytes)
    {
    }

    Result<Value> run();
    void refuseHead(size_t offset);
    void refuseTruncated(size_t offset);

    void beginItem();
    bool expectingKey() const { return !m_stack.empty() && m_stack.back().isMap && m_stack.back().left % 2 == 0; }
    void onUnsigned(uint64_t value);
    void onNegative(uint64_t value);
    void onBytes(const uint8_t* data, size_t length);
    void onText(const uint8_t* data, size_t length);
    void onContainer(uint64_t count, bool isMap);
    void onTag(uint64_t tag);
    void onReal(double value);
    void onBoolean(bool value);
    void refuse(PlatformErrorCode code, std::string what);

    void emit(Value value);
    bool applyTag(Value& value);
    void attach(Value value);
    bool close(Value& value);

    void fail(PlatformErrorCode code, std::string what, size_t offset);

    std::span<const uint8_t> m_bytes;
    size_t m_itemStart = 0; // offset of the head being reported
    // Items announced by open containers and not yet started. Each needs at least one more byte,
    // so a header whose count would push this past the bytes remaining is refused before any
    // memory is reserved for it, however deeply such headers are nested.
    uint64_t m_pendingItems = 0;
    size_t m_heads = 0; // item heads read so far, against Cbor::kMaxItems
    uint64_t m_tag = 0; // the tag waiting for its item, 0 when none
    size_t m_tagStart = 0;
    std::vector<Frame> m_stack;
    std::vector<Key> m_keys; // keys of the open maps, innermost last; to name a duplicate
    Value m_root;
    bool m_done = false;
    std::optional<OMError> m_error;
};

} // namespace om
