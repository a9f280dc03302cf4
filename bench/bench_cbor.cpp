// CBOR codec throughput against a memcpy of the same bytes, and the production codec (libcbor's
// streaming decoder and cbor_encode_* functions) against hand-written equivalents of each.
#include <benchmark/benchmark.h>

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "bench/BenchRatios.h"
#include "bench/BenchValues.h"
#include "platform/Cbor.h"
#include "platform/CborDecoder.h"

namespace om::bench {
namespace {

// The hand-written decoder Cbor::decode (libcbor's streaming decoder) was measured against: one
// recursive pass with the same rules, limits and error texts, so that the comparison measures only
// the way the bytes are walked.
class DirectDecoder {
public:
    static Result<Value> decode(std::span<const uint8_t> bytes);

private:
    struct Head {
        uint8_t major;
        uint8_t info;
        uint64_t argument;
    };

    explicit DirectDecoder(std::span<const uint8_t> bytes)
        : m_bytes(bytes)
    {
    }

    bool decodeItem(Value& out, unsigned depth);
    bool decodeArray(Value& out, const Head& head, size_t start, unsigned depth);
    bool decodeMap(Value& out, const Head& head, size_t start, unsigned depth);
    bool decodeKey(std::string& key);
    bool decodeTag(Value& out, const Head& head, size_t start, unsigned depth);
    bool decodeSimple(Value& out, const Head& head, size_t start);
    bool readHead(Head& head);
    bool chargeContainer(uint64_t count, uint64_t itemsPerEntry, const char* what, size_t start);
    bool readText(uint64_t length, std::string& text, size_t start);
    bool reportDuplicateKey(const std::string& key, size_t firstKeyOffset);

    bool fail(PlatformErrorCode code, std::string what, size_t offset);
    size_t remaining() const { return m_bytes.size() - m_position; }

    std::span<const uint8_t> m_bytes;
    size_t m_position = 0;
    // Charged exactly as in CborDecoder.
    uint64_t m_pendingItems = 0;
    // Offsets of the keys of the open maps, innermost last; read again only to name a duplicate.
    std::vector<size_t> m_keyOffsets;
    std::optional<OMError> m_error;
};

constexpr uint8_t kMajorUnsigned = 0;
constexpr uint8_t kMajorNegative = 1;
constexpr uint8_t kMajorBytes = 2;
constexpr uint8_t kMajorText = 3;
constexpr uint8_t kMajorArray = 4;
constexpr uint8_t kMajorMap = 5;
constexpr uint8_t kMajorTag = 6;
constexpr uint8_t kInfoIndefinite = 31;

constexpr uint64_t kTagDate = 1;
constexpr uint64_t kTagUuid = 37;

// A key is quoted in errors, but only so much of it: the text comes from the peer.
constexpr size_t kQuotedKeyLimit = 64;

double halfToDouble(uint16_t half)
{
    const int exponent = (half >> 10) & 0x1f;
    const int mantissa = half & 0x3ff;
    double magnitude;
    if (exponent == 0)
        magnitude = std::ldexp(mantissa, -24);
    else if (exponent != 31)
        magnitude = std::ldexp(mantissa + 1024, exponent - 25);
    else
        magnitude = mantissa == 0 ? std::numeric_limits<double>::infinity() : std::numeric_limits<double>::quiet_NaN();
    return (half & 0x8000) ? -magnitude : magnitude;
}

const char* majorName(uint8_t major)
{
    switch (major) {
    case kMajorBytes:
        return "byte string";
    case kMajorText:
        return "text string";
    case kMajorArray:
        return "array";
    default:
        return "map";
    }
}

std::string quotedKey(const std::string& key)
{
    if (key.size() <= kQuotedKeyLimit)
        return '"' + key + '"';
    size_t cut = kQuotedKeyLimit;
    while (cut > 0 && (static_cast<uint8_t>(key[cut]) & 0xc0) == 0x80)
        --cut; // never split a UTF-8 sequence
    return '"' + key.substr(0, cut) + "\"...";
}

Result<Value> DirectDecoder::decode(std::span<const uint8_t> bytes)
{
    DirectDecoder decoder(bytes);
    Value value;
    if (!decoder.decodeItem(value, 0))
        return std::move(*decoder.m_error);
    if (decoder.m_position != bytes.size()) {
        decoder.fail(kPlatformErrorMalformed, "trailing bytes after the item", decoder.m_position);
        return std::move(*decoder.m_error);
    }
    return value;
}

bool DirectDecoder::fail(PlatformErrorCode code, std::string what, size_t offset)
{
    what += " at byte ";
    what += std::to_string(offset);
    m_error = OMError::platform(code, std::move(what));
    return false;
}

bool DirectDecoder::readHead(Head& head)
{
    const size_t start = m_position;
    if (m_position >= m_bytes.size())
        return fail(kPlatformErrorMalformed, "unexpected end of input", start);
    const uint8_t initial = m_bytes[m_position++];
    head.major = initial >> 5;
    head.info = initial & 0x1f;
    if (head.info < 24 || head.info == kInfoIndefinite) {
        head.argument = head.info < 24 ? head.info : 0;
        return true;
    }
    if (head.info > 27)
        return fail(kPlatformErrorMalformed, "reserved additional information " + std::to_string(head.info), start);
    const size_t width = size_t { 1 } << (head.info - 24);
    if (remaining() < width)
        return fail(kPlatformErrorMalformed, "truncated item header", start);
    uint64_t argument = 0;
    for (size_t i = 0; i < width; ++i)
        argument = (argument << 8) | m_bytes[m_position + i];
    m_position += width;
    head.argument = argument;
    return true;
}

bool DirectDecoder::decodeItem(Value& out, unsigned depth)
{
    const size_t start = m_position;
    Head head;
    if (!readHead(head))
        return false;
    if (head.info == kInfoIndefinite && head.major != 7) {
        if (head.major >= kMajorBytes && head.major <= kMajorMap)
            return fail(kPlatformErrorMalformed, std::string("indefinite-length ") + majorName(head.major), start);
        return fail(kPlatformErrorMalformed, "reserved additional information 31", start);
    }
    switch (head.major) {
    case kMajorUnsigned:
        if (head.argument <= static_cast<uint64_t>(std::numeric_limits<int64_t>::max()))
            out = Value::integer(static_cast<int64_t>(head.argument));
        else
            out = Value::unsignedInteger(head.argument);
        return true;
    case kMajorNegative:
        if (head.argument > static_cast<uint64_t>(std::numeric_limits<int64_t>::max()))
            return fail(kPlatformErrorLimit, "negative integer below the 64-bit range", start);
        out = Value::integer(-1 - static_cast<int64_t>(head.argument));
        return true;
    case kMajorBytes:
        if (head.argument > remaining())
            return fail(kPlatformErrorMalformed,
                "byte string of " + std::to_string(head.argument) + " bytes past the end of the input", start);
        out = Value::data(m_bytes.subspan(m_position, head.argument));
        m_position += head.argument;
        return true;
    case kMajorText: {
        std::string text;
        if (!readText(head.argument, text, start))
            return false;
        out = Value::string(std::move(text));
        return true;
    }
    case kMajorArray:
        return decodeArray(out, head, start, depth);
    case kMajorMap:
        return decodeMap(out, head, start, depth);
    case kMajorTag:
        return decodeTag(out, head, start, depth);
    default:
        return decodeSimple(out, head, start);
    }
}

bool DirectDecoder::chargeContainer(uint64_t count, uint64_t itemsPerEntry, const char* what, size_t start)
{
    const uint64_t left = remaining();
    if (count > left / itemsPerEntry || m_pendingItems + count * itemsPerEntry > left) {
        return fail(kPlatformErrorMalformed,
            std::string(what) + " of " + std::to_string(count) + (itemsPerEntry == 1 ? " elements" : " entries")
                + " longer than the " + std::to_string(left) + " bytes remaining",
            start);
    }
    m_pendingItems += count * itemsPerEntry;
    return true;
}

bool DirectDecoder::decodeArray(Value& out, const Head& head, size_t start, unsigned depth)
{
    if (depth >= Cbor::kMaxDepth)
        return fail(kPlatformErrorLimit, "nesting deeper than " + std::to_string(Cbor::kMaxDepth) + " levels", start);
    if (!chargeContainer(head.argument, 1, "array", start))
        return false;
    std::vector<Value> elements;
    elements.reserve(head.argument);
    for (uint64_t i = 0; i < head.argument; ++i) {
        --m_pendingItems;
        if (!decodeItem(elements.emplace_back(), depth + 1))
            return false;
    }
    out = Value::array(std::move(elements));
    return true;
}

bool DirectDecoder::decodeMap(Value& out, const Head& head, size_t start, unsigned depth)
{
    if (depth >= Cbor::kMaxDepth)
        return fail(kPlatformErrorLimit, "nesting deeper than " + std::to_string(Cbor::kMaxDepth) + " levels", start);
    if (!chargeContainer(head.argument, 2, "map", start))
        return false;
    const size_t firstKey = m_keyOffsets.size();
    std::vector<Value::Entry> entries;
    entries.reserve(head.argument);
    for (uint64_t i = 0; i < head.argument; ++i) {
        auto& entry = entries.emplace_back();
        --m_pendingItems;
        m_keyOffsets.push_back(m_position);
        if (!decodeKey(entry.first))
            return false;
        --m_pendingItems;
        if (!decodeItem(entry.second, depth + 1))
            return false;
    }
    std::string duplicate;
    auto dictionary = Value::uniqueDictionary(std::move(entries), &duplicate);
    if (!dictionary)
        return reportDuplicateKey(duplicate, firstKey);
    m_keyOffsets.resize(firstKey);
    out = std::move(*dictionary);
    return true;
}

bool DirectDecoder::decodeKey(std::string& key)
{
    const size_t start = m_position;
    Head head;
    if (!readHead(head))
        return false;
    if (head.major != kMajorText)
        return fail(kPlatformErrorMalformed, "non-text map key", start);
    if (head.info == kInfoIndefinite)
        return fail(kPlatformErrorMalformed, "indefinite-length text string", start);
    return readText(head.argument, key, start);
}

bool DirectDecoder::readText(uint64_t length, std::string& text, size_t start)
{
    if (length > remaining())
        return fail(kPlatformErrorMalformed,
            "text string of " + std::to_string(length) + " bytes past the end of the input", start);
    auto bytes = m_bytes.subspan(m_position, length);
    if (auto bad = CborDecoder::invalidUtf8Offset(bytes))
        return fail(kPlatformErrorMalformed, "invalid UTF-8", m_position + *bad);
    text.assign(reinterpret_cast<const char*>(bytes.data()), bytes.size());
    m_position += length;
    return true;
}

// The map was read in full before the repeat showed; its key offsets find the second occurrence.
bool DirectDecoder::reportDuplicateKey(const std::string& key, size_t firstKey)
{
    bool seen = false;
    for (size_t i = firstKey; i < m_keyOffsets.size(); ++i) {
        m_position = m_keyOffsets[i];
        Head head;
        if (!readHead(head))
            break;
        std::string_view text(reinterpret_cast<const char*>(m_bytes.data() + m_position), head.argument);
        if (text != key)
            continue;
        if (seen)
            return fail(kPlatformErrorMalformed, "duplicate map key " + quotedKey(key), m_keyOffsets[i]);
        seen = true;
    }
    return fail(kPlatformErrorMalformed, "duplicate map key " + quotedKey(key), m_keyOffsets[firstKey]);
}

bool DirectDecoder::decodeTag(Value& out, const Head& head, size_t start, unsigned depth)
{
    if (head.argument == kTagDate) {
        if (m_position >= m_bytes.size())
            return fail(kPlatformErrorMalformed, "unexpected end of input", m_position);
        const uint8_t major = m_bytes[m_position] >> 5;
        const uint8_t info = m_bytes[m_position] & 0x1f;
        const bool number
            = major == kMajorUnsigned || major == kMajorNegative || (major == 7 && info >= 25 && info <= 27);
        if (!number)
            return fail(kPlatformErrorMalformed, "date (tag 1) over something other than a number", start);
        Value seconds;
        if (!decodeItem(seconds, depth))
            return false;
        out = Value::date(*seconds.asDouble());
        return true;
    }
    if (head.argument == kTagUuid) {
        Head inner;
        if (!readHead(inner))
            return false;
        if (inner.major != kMajorBytes || inner.info == kInfoIndefinite)
            return fail(kPlatformErrorMalformed, "UUID (tag 37) over something other than a byte string", start);
        if (inner.argument != 16)
            return fail(kPlatformErrorMalformed,
                "UUID (tag 37) of " + std::to_string(inner.argument) + " bytes instead of 16", start);
        if (remaining() < 16)
            return fail(kPlatformErrorMalformed, "byte string of 16 bytes past the end of the input", start);
        Uuid::Bytes bytes;
        std::memcpy(bytes.data(), m_bytes.data() + m_position, bytes.size());
        m_position += bytes.size();
        out = Value::uuid(Uuid(bytes));
        return true;
    }
    return fail(kPlatformErrorMalformed, "unsupported tag " + std::to_string(head.argument), start);
}

bool DirectDecoder::decodeSimple(Value& out, const Head& head, size_t start)
{
    switch (head.info) {
    case 20:
    case 21:
        out = Value::boolean(head.info == 21);
        return true;
    case 22:
        return fail(kPlatformErrorMalformed, "null", start);
    case 23:
        return fail(kPlatformErrorMalformed, "undefined", start);
    case 25:
        out = Value::real(halfToDouble(static_cast<uint16_t>(head.argument)));
        return true;
    case 26: {
        const uint32_t bits = static_cast<uint32_t>(head.argument);
        float single;
        std::memcpy(&single, &bits, sizeof single);
        out = Value::real(single);
        return true;
    }
    case 27: {
        double real;
        std::memcpy(&real, &head.argument, sizeof real);
        out = Value::real(real);
        return true;
    }
    case kInfoIndefinite:
        return fail(kPlatformErrorMalformed, "unexpected break", start);
    default:
        return fail(kPlatformErrorMalformed, "unsupported simple value " + std::to_string(head.argument), start);
    }
}

// The encoder Cbor::encode (libcbor's cbor_encode_* functions) was measured against: the same
// geometrically grown buffer, with heads written here instead of by the library.
class DirectEncoder {
public:
    static std::vector<uint8_t> encode(const Value& value)
    {
        std::vector<uint8_t> out;
        DirectEncoder encoder(out);
        encoder.value(value);
        out.resize(encoder.m_used);
        return out;
    }

private:
    explicit DirectEncoder(std::vector<uint8_t>& out)
        : m_out(out)
    {
    }

    uint8_t* room(size_t length)
    {
        if (m_out.size() - m_used < length)
            m_out.resize(std::max({ m_out.size() * 2, m_used + length, size_t { 256 } }));
        return m_out.data() + m_used;
    }

    void head(uint8_t major, uint64_t argument)
    {
        uint8_t* p = room(9);
        const uint8_t initial = static_cast<uint8_t>(major << 5);
        if (argument < 24) {
            *p = initial | static_cast<uint8_t>(argument);
            ++m_used;
            return;
        }
        const size_t width = argument <= 0xff ? 1 : argument <= 0xffff ? 2 : argument <= 0xffffffff ? 4 : 8;
        *p++ = initial | static_cast<uint8_t>(width == 1 ? 24 : width == 2 ? 25 : width == 4 ? 26 : 27);
        for (size_t i = width; i-- > 0;)
            *p++ = static_cast<uint8_t>(argument >> (8 * i));
        m_used += 1 + width;
    }

    void real(double value)
    {
        uint64_t bits;
        std::memcpy(&bits, &value, sizeof bits);
        uint8_t* p = room(9);
        *p++ = 0xfb;
        for (size_t i = 8; i-- > 0;)
            *p++ = static_cast<uint8_t>(bits >> (8 * i));
        m_used += 9;
    }

    void bytes(uint8_t major, const void* data, size_t length)
    {
        head(major, length);
        if (length == 0)
            return;
        std::memcpy(room(length), data, length);
        m_used += length;
    }

    void value(const Value& value)
    {
        switch (value.type()) {
        case Value::Type::None:
            std::abort();
        case Value::Type::Dictionary:
            head(5, value.count());
            for (const auto& [key, element] : value.entries()) {
                bytes(3, key.data(), key.size());
                this->value(element);
            }
            return;
        case Value::Type::Array:
            head(4, value.count());
            for (const auto& element : value.elements())
                this->value(element);
            return;
        case Value::Type::String:
            bytes(3, value.asString()->data(), value.asString()->size());
            return;
        case Value::Type::Integer: {
            const int64_t integer = *value.asInt64();
            if (integer >= 0)
                head(0, static_cast<uint64_t>(integer));
            else
                head(1, static_cast<uint64_t>(-1 - integer));
            return;
        }
        case Value::Type::Unsigned:
            head(0, *value.asUInt64());
            return;
        case Value::Type::Real:
            real(*value.asDouble());
            return;
        case Value::Type::Boolean:
            head(7, *value.asBool() ? 21 : 20);
            return;
        case Value::Type::Data:
            bytes(2, value.asData()->data(), value.asData()->size());
            return;
        case Value::Type::Date:
            head(6, 1);
            real(*value.asDate());
            return;
        case Value::Type::Uuid:
            head(6, 37);
            bytes(2, value.asUuid()->bytes().data(), 16);
            return;
        }
    }

    std::vector<uint8_t>& m_out;
    size_t m_used = 0;
};

struct Fixture {
    Value value;
    std::vector<uint8_t> encoded;
};

const Fixture& fixture(const char* name)
{
    static const std::map<std::string, Fixture> fixtures = [] {
        std::map<std::string, Fixture> all;
        for (auto& [fixtureName, value] : std::map<std::string, Value> { { "pluginInfo", pluginInfoDictionary() },
                 { "annotationTable", annotationTable() }, { "request", requestDictionary() } }) {
            auto encoded = Cbor::encode(value);
            // The alternatives must agree with the production codec, or the comparison means nothing.
            auto direct = DirectDecoder::decode(encoded);
            if (DirectEncoder::encode(value) != encoded || !direct.ok() || !(*direct == value)
                || !Cbor::decode(encoded).ok()) {
                std::fprintf(stderr, "codecs disagree on %s\n", fixtureName.c_str());
                std::abort();
            }
            all.emplace(fixtureName, Fixture { value, std::move(encoded) });
        }
        return all;
    }();
    return fixtures.at(name);
}

void setBytes(benchmark::State& state, size_t bytes)
{
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * bytes));
    state.counters["bytes"] = static_cast<double>(bytes);
}

void encodeBench(benchmark::State& state, const char* name)
{
    const auto& f = fixture(name);
    for (auto _ : state) {
        auto bytes = Cbor::encode(f.value);
        benchmark::DoNotOptimize(bytes.data());
    }
    setBytes(state, f.encoded.size());
}

void encodeDirectBench(benchmark::State& state, const char* name)
{
    const auto& f = fixture(name);
    for (auto _ : state) {
        auto bytes = DirectEncoder::encode(f.value);
        benchmark::DoNotOptimize(bytes.data());
    }
    setBytes(state, f.encoded.size());
}

void decodeBench(benchmark::State& state, const char* name)
{
    const auto& f = fixture(name);
    for (auto _ : state) {
        auto value = Cbor::decode(f.encoded);
        benchmark::DoNotOptimize(&value);
    }
    setBytes(state, f.encoded.size());
}

void decodeDirectBench(benchmark::State& state, const char* name)
{
    const auto& f = fixture(name);
    for (auto _ : state) {
        auto value = DirectDecoder::decode(f.encoded);
        benchmark::DoNotOptimize(&value);
    }
    setBytes(state, f.encoded.size());
}

// The floor: copying the encoded bytes into a fresh buffer, as a decoder's output at least costs.
void memcpyBench(benchmark::State& state, const char* name)
{
    const auto& f = fixture(name);
    for (auto _ : state) {
        std::vector<uint8_t> copy(f.encoded.size());
        std::memcpy(copy.data(), f.encoded.data(), f.encoded.size());
        benchmark::DoNotOptimize(copy.data());
        benchmark::ClobberMemory();
    }
    setBytes(state, f.encoded.size());
}

BENCHMARK_CAPTURE(memcpyBench, pluginInfo, "pluginInfo");
BENCHMARK_CAPTURE(encodeBench, pluginInfo, "pluginInfo");
BENCHMARK_CAPTURE(encodeDirectBench, pluginInfo, "pluginInfo");
BENCHMARK_CAPTURE(decodeBench, pluginInfo, "pluginInfo");
BENCHMARK_CAPTURE(decodeDirectBench, pluginInfo, "pluginInfo");
BENCHMARK_CAPTURE(memcpyBench, annotationTable, "annotationTable");
BENCHMARK_CAPTURE(encodeBench, annotationTable, "annotationTable");
BENCHMARK_CAPTURE(encodeDirectBench, annotationTable, "annotationTable");
BENCHMARK_CAPTURE(decodeBench, annotationTable, "annotationTable");
BENCHMARK_CAPTURE(decodeDirectBench, annotationTable, "annotationTable");
BENCHMARK_CAPTURE(memcpyBench, request, "request");
BENCHMARK_CAPTURE(encodeBench, request, "request");
BENCHMARK_CAPTURE(encodeDirectBench, request, "request");
BENCHMARK_CAPTURE(decodeBench, request, "request");
BENCHMARK_CAPTURE(decodeDirectBench, request, "request");

// Prints, after the table, the ratios the codec choice rests on (all from this one run).
class CodecRatios : public RatioReporter {
protected:
    void printRatios() override
    {
        std::printf("\nratios (CPU time per operation, median of the repetitions)\n");
        for (const char* name : { "pluginInfo", "annotationTable", "request" }) {
            ratio(std::string("decode/memcpy ") + name, "decodeBench", "memcpyBench", name);
            ratio(std::string("encode/memcpy ") + name, "encodeBench", "memcpyBench", name);
            ratio(std::string("libcbor streaming decode / direct decode ") + name, "decodeBench", "decodeDirectBench",
                name);
            ratio(std::string("libcbor encode / direct encode ") + name, "encodeBench", "encodeDirectBench", name);
        }
    }

private:
    void ratio(const std::string& label, const char* numerator, const char* denominator, const char* fixtureName)
    {
        const double n = median(std::string(numerator) + "/" + fixtureName);
        const double d = median(std::string(denominator) + "/" + fixtureName);
        if (n > 0 && d > 0)
            std::printf("  %-60s %6.2f\n", label.c_str(), n / d);
    }
};

} // namespace
} // namespace om::bench

int main(int argc, char** argv)
{
    return om::bench::runWithRatios<om::bench::CodecRatios>(argc, argv);
}
