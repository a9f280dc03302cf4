#include "platform/CborDecoder.h"

#include <cbor.h>

#include <cstring>
#include <limits>
#include <tuple>
#include <utility>

#include "platform/Cbor.h"

namespace om {

namespace {

constexpr uint8_t kMajorBytes = 2;
constexpr uint8_t kMajorText = 3;
constexpr uint8_t kMajorSimple = 7;
constexpr uint64_t kTagDate = 1;
constexpr uint64_t kTagUuid = 37;
constexpr uint64_t kInt64Max = static_cast<uint64_t>(std::numeric_limits<int64_t>::max());

// A key is quoted in errors, but only so much of it: the text comes from the peer.
constexpr size_t kQuotedKeyLimit = 64;

// Bytes after the initial byte that carry the head's argument.
size_t argumentWidth(uint8_t info)
{
    return info >= 24 && info <= 27 ? size_t { 1 } << (info - 24) : 0;
}

std::string counted(uint64_t count, const char* one, const char* many)
{
    return std::to_string(count) + " " + (count == 1 ? one : many);
}

std::string quoted(std::string_view key)
{
    if (key.size() <= kQuotedKeyLimit)
        return '"' + std::string(key) + '"';
    size_t cut = kQuotedKeyLimit;
    while (cut > 0 && (static_cast<uint8_t>(key[cut]) & 0xc0) == 0x80)
        --cut; // never split a UTF-8 sequence
    return '"' + std::string(key.substr(0, cut)) + "\"...";
}

} // namespace

struct CborDecoder::Callbacks {
    static CborDecoder& self(void* context) { return *static_cast<CborDecoder*>(context); }

    static void uint8(void* c, uint8_t v) { self(c).onUnsigned(v); }
    static void uint16(void* c, uint16_t v) { self(c).onUnsigned(v); }
    static void uint32(void* c, uint32_t v) { self(c).onUnsigned(v); }
    static void uint64(void* c, uint64_t v) { self(c).onUnsigned(v); }
    static void negint8(void* c, uint8_t v) { self(c).onNegative(v); }
    static void negint16(void* c, uint16_t v) { self(c).onNegative(v); }
    static void negint32(void* c, uint32_t v) { self(c).onNegative(v); }
    static void negint64(void* c, uint64_t v) { self(c).onNegative(v); }
    static void bytes(void* c, cbor_data data, size_t length) { self(c).onBytes(data, length); }
    static void text(void* c, cbor_data data, size_t length) { self(c).onText(data, length); }
    static void array(void* c, size_t count) { self(c).onContainer(count, false); }
    static void map(void* c, size_t count) { self(c).onContainer(count, true); }
    static void tag(void* c, uint64_t tag) { self(c).onTag(tag); }
    static void single(void* c, float v) { self(c).onReal(v); }
    static void real(void* c, double v) { self(c).onReal(v); }
    static void boolean(void* c, bool v) { self(c).onBoolean(v); }
    // libcbor reports the start of an indefinite length, never its items, through these.
    static void indefiniteBytes(void* c) { self(c).refuse(kPlatformErrorMalformed, "indefinite-length byte string"); }
    static void indefiniteText(void* c) { self(c).refuse(kPlatformErrorMalformed, "indefinite-length text string"); }
    static void indefiniteArray(void* c) { self(c).refuse(kPlatformErrorMalformed, "indefinite-length array"); }
    static void indefiniteMap(void* c) { self(c).refuse(kPlatformErrorMalformed, "indefinite-length map"); }
    static void brk(void* c) { self(c).refuse(kPlatformErrorMalformed, "unexpected break"); }
    static void null(void* c) { self(c).refuse(kPlatformErrorMalformed, "null"); }
    static void undefined(void* c) { self(c).refuse(kPlatformErrorMalformed, "undefined"); }

    static const cbor_callbacks table;
};

const cbor_callbacks CborDecoder::Callbacks::table = {
    .uint8 = uint8,
    .uint16 = uint16,
    .uint32 = uint32,
    .uint64 = uint64,
    .negint64 = negint64,
    .negint32 = negint32,
    .negint16 = negint16,
    .negint8 = negint8,
    .byte_string_start = indefiniteBytes,
    .byte_string = bytes,
    .string = text,
    .string_start = indefiniteText,
    .indef_array_start = indefiniteArray,
    .array_start = array,
    .indef_map_start = indefiniteMap,
    .map_start = map,
    .tag = tag,
    .float2 = single,
    .float4 = single,
    .float8 = real,
    .undefined = undefined,
    .null = null,
    .boolean = boolean,
    .indef_break = brk,
};

Result<Value> CborDecoder::decode(std::span<const uint8_t> bytes)
{
    return CborDecoder(bytes).run();
}

// Each cbor_stream_decode call reads one head (a string with its bytes) and makes at most one
// callback, so every error below is about the head at m_itemStart.
Result<Value> CborDecoder::run()
{
    size_t offset = 0;
    while (!m_done && !m_error) {
        if (offset == m_bytes.size()) {
            fail(kPlatformErrorMalformed, "unexpected end of input", offset);
            break;
        }
        m_itemStart = offset;
        if (++m_heads > Cbor::kMaxItems) {
            fail(kPlatformErrorLimit, "more than " + std::to_string(Cbor::kMaxItems) + " items", offset);
            break;
        }
        const auto result
            = cbor_stream_decode(m_bytes.data() + offset, m_bytes.size() - offset, &Callbacks::table, this);
        if (result.status == CBOR_DECODER_NEDATA)
            refuseTruncated(offset);
        else if (result.status == CBOR_DECODER_ERROR)
            refuseHead(offset);
        else
            offset += result.read;
    }
    if (!m_error && offset != m_bytes.size())
        fail(kPlatformErrorMalformed, "trailing bytes after the item", offset);
    if (m_error)
        return std::move(*m_error);
    return std::move(m_root);
}

void CborDecoder::refuseTruncated(size_t offset)
{
    const uint8_t major = m_bytes[offset] >> 5;
    const size_t width = argumentWidth(m_bytes[offset] & 0x1f);
    if (m_bytes.size() - offset <= width || (major != kMajorBytes && major != kMajorText))
        return fail(kPlatformErrorMalformed, "truncated item head", offset);
    uint64_t length = m_bytes[offset] & 0x1f;
    if (width > 0) {
        length = 0;
        for (size_t i = 1; i <= width; ++i)
            length = (length << 8) | m_bytes[offset + i];
    }
    fail(kPlatformErrorMalformed,
        std::string(major == kMajorBytes ? "byte" : "text") + " string of " + counted(length, "byte", "bytes")
            + " past the end of the input",
        offset);
}

// libcbor says only "error"; the initial byte says which rule was broken.
void CborDecoder::refuseHead(size_t offset)
{
    const uint8_t major = m_bytes[offset] >> 5;
    const uint8_t info = m_bytes[offset] & 0x1f;
    if (major == kMajorSimple && info < 20)
        return fail(kPlatformErrorMalformed, "unsupported simple value " + std::to_string(info), offset);
    if (major == kMajorSimple && info == 24) {
        std::string what = "unsupported simple value";
        if (offset + 1 < m_bytes.size())
            what += " " + std::to_string(m_bytes[offset + 1]);
        return fail(kPlatformErrorMalformed, std::move(what), offset);
    }
    if (info >= 28)
        return fail(kPlatformErrorMalformed, "reserved additional information " + std::to_string(info), offset);
    fail(kPlatformErrorMalformed, "malformed item", offset);
}

void CborDecoder::fail(PlatformErrorCode code, std::string what, size_t offset)
{
    if (m_error)
        return;
    what += " at byte ";
    what += std::to_string(offset);
    m_error = OMError::platform(code, std::move(what));
}

void CborDecoder::refuse(PlatformErrorCode code, std::string what)
{
    fail(code, std::move(what), m_itemStart);
}

// A tag and the item it encloses are one item of the parent.
void CborDecoder::beginItem()
{
    if (m_tag == 0 && !m_stack.empty())
        --m_pendingItems;
}

void CborDecoder::onUnsigned(uint64_t value)
{
    beginItem();
    if (value <= kInt64Max)
        emit(Value::integer(static_cast<int64_t>(value)));
    else
        emit(Value::unsignedInteger(value));
}

void CborDecoder::onNegative(uint64_t value)
{
    beginItem();
    if (value > kInt64Max)
        return refuse(kPlatformErrorLimit, "negative integer below the 64-bit range");
    emit(Value::integer(-1 - static_cast<int64_t>(value)));
}

void CborDecoder::onReal(double value)
{
    beginItem();
    emit(Value::real(value));
}

void CborDecoder::onBoolean(bool value)
{
    beginItem();
    emit(Value::boolean(value));
}

void CborDecoder::onBytes(const uint8_t* data, size_t length)
{
    beginItem();
    if (m_tag == kTagUuid) {
        if (length != Uuid::Bytes().size()) {
            return fail(kPlatformErrorMalformed, "UUID (tag 37) of " + std::to_string(length) + " bytes instead of 16",
                m_tagStart);
        }
        Uuid::Bytes bytes;
        std::memcpy(bytes.data(), data, bytes.size());
        m_tag = 0;
        return emit(Value::uuid(Uuid(bytes)));
    }
    emit(Value::data(std::span<const uint8_t>(data, length)));
}

void CborDecoder::onText(const uint8_t* data, size_t length)
{
    beginItem();
    if (auto bad = invalidUtf8Offset({ data, length }))
        return fail(kPlatformErrorMalformed, "invalid UTF-8", static_cast<size_t>(data - m_bytes.data()) + *bad);
    const auto* characters = reinterpret_cast<const char*>(data);
    if (m_tag == 0 && expectingKey()) {
        Frame& top = m_stack.back();
        m_keys.push_back(Key { m_itemStart, std::string_view(characters, length) });
        top.entries.emplace_back(
            std::piecewise_construct, std::forward_as_tuple(characters, length), std::forward_as_tuple());
        --top.left;
        return;
    }
    emit(Value::string(std::string(characters, length)));
}

void CborDecoder::onContainer(uint64_t count, bool isMap)
{
    beginItem();
    if (m_tag != 0)
        return emit(Value()); // refused by the tag check, as any other wrong enclosed item
    if (expectingKey())
        return refuse(kPlatformErrorMalformed, "non-text map key");
    if (m_stack.size() >= Cbor::kMaxDepth)
        return refuse(kPlatformErrorLimit, "nesting deeper than " + std::to_string(Cbor::kMaxDepth) + " levels");
    const uint64_t itemsPerEntry = isMap ? 2 : 1;
    const uint64_t left = m_bytes.size() - m_itemStart - 1 - argumentWidth(m_bytes[m_itemStart] & 0x1f);
    if (count > left / itemsPerEntry || m_pendingItems + count * itemsPerEntry > left) {
        return refuse(kPlatformErrorMalformed,
            std::string(isMap ? "map of " : "array of ")
                + (isMap ? counted(count, "entry", "entries") : counted(count, "element", "elements"))
                + " longer than the " + counted(left, "byte", "bytes") + " remaining");
    }
    if (count == 0)
        return attach(isMap ? Value::dictionary(std::vector<Value::Entry> {}) : Value::array(std::vector<Value> {}));
    m_pendingItems += count * itemsPerEntry;
    Frame& frame = m_stack.emplace_back(Frame { isMap, count * itemsPerEntry, m_keys.size(), {}, {} });
    if (isMap)
        frame.entries.reserve(count);
    else
        frame.elements.reserve(count);
}

void CborDecoder::onTag(uint64_t tag)
{
    beginItem();
    if (m_tag != 0)
        return emit(Value()); // a tag over a tag: refused by the outer tag's check
    if (expectingKey())
        return refuse(kPlatformErrorMalformed, "non-text map key");
    if (tag != kTagDate && tag != kTagUuid)
        return refuse(kPlatformErrorMalformed, "unsupported tag " + std::to_string(tag));
    m_tag = tag;
    m_tagStart = m_itemStart;
}

void CborDecoder::emit(Value value)
{
    if (m_tag != 0 && !applyTag(value))
        return;
    if (expectingKey())
        return refuse(kPlatformErrorMalformed, "non-text map key");
    attach(std::move(value));
}

bool CborDecoder::applyTag(Value& value)
{
    const bool number = value.type() == Value::Type::Integer || value.type() == Value::Type::Unsigned
        || value.type() == Value::Type::Real;
    if (m_tag == kTagDate && number) {
        value = Value::date(*value.asDouble());
        m_tag = 0;
        return true;
    }
    fail(kPlatformErrorMalformed,
        m_tag == kTagDate ? "date (tag 1) over something other than a number"
                          : "UUID (tag 37) over something other than a byte string",
        m_tagStart);
    return false;
}

// Appends a finished item to the innermost container, closing every container it completes.
void CborDecoder::attach(Value value)
{
    for (;;) {
        if (m_stack.empty()) {
            m_root = std::move(value);
            m_done = true;
            return;
        }
        Frame& top = m_stack.back();
        if (top.isMap)
            top.entries.back().second = std::move(value);
        else
            top.elements.push_back(std::move(value));
        if (--top.left > 0 || !close(value))
            return;
    }
}

bool CborDecoder::close(Value& value)
{
    Frame& top = m_stack.back();
    if (!top.isMap) {
        value = Value::array(std::move(top.elements));
        m_stack.pop_back();
        return true;
    }
    std::string duplicate;
    auto dictionary = Value::uniqueDictionary(std::move(top.entries), &duplicate);
    if (!dictionary) {
        // The repeat is reported at its second occurrence.
        size_t seen = 0;
        for (size_t i = top.firstKey; i < m_keys.size(); ++i) {
            if (m_keys[i].text == duplicate && ++seen == 2) {
                fail(kPlatformErrorMalformed, "duplicate map key " + quoted(duplicate), m_keys[i].offset);
                break;
            }
        }
        fail(kPlatformErrorMalformed, "duplicate map key " + quoted(duplicate), m_keys[top.firstKey].offset);
        return false;
    }
    m_keys.resize(top.firstKey);
    value = std::move(*dictionary);
    m_stack.pop_back();
    return true;
}

std::optional<size_t> CborDecoder::invalidUtf8Offset(std::span<const uint8_t> text)
{
    const uint8_t* p = text.data();
    const size_t n = text.size();
    size_t i = 0;
    for (;;) {
        // Keys and most strings are ASCII: skip it a word at a time.
        for (uint64_t word; n - i >= sizeof word; i += sizeof word) {
            std::memcpy(&word, p + i, sizeof word);
            if (word & 0x8080808080808080ull)
                break;
        }
        while (i < n && p[i] < 0x80)
            ++i;
        if (i == n)
            return std::nullopt;
        // The second byte's range is what rules out overlong forms, surrogates and code points
        // past U+10FFFF.
        const uint8_t lead = p[i];
        size_t length;
        uint8_t low = 0x80;
        uint8_t high = 0xbf;
        if (lead >= 0xc2 && lead <= 0xdf) {
            length = 2;
        } else if (lead >= 0xe0 && lead <= 0xef) {
            length = 3;
            if (lead == 0xe0)
                low = 0xa0;
            else if (lead == 0xed)
                high = 0x9f;
        } else if (lead >= 0xf0 && lead <= 0xf4) {
            length = 4;
            if (lead == 0xf0)
                low = 0x90;
            else if (lead == 0xf4)
                high = 0x8f;
        } else {
            return i;
        }
        if (n - i < length || p[i + 1] < low || p[i + 1] > high)
            return i;
        for (size_t k = 2; k < length; ++k) {
            if ((p[i + k] & 0xc0) != 0x80)
                return i;
        }
        i += length;
    }
}

} // namespace om
