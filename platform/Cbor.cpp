#include "platform/Cbor.h"

#include <cbor.h>

#include <algorithm>
#include <cstring>

#include "platform/CborDecoder.h"
#include "platform/Fatal.h"

namespace om {

namespace {

constexpr uint64_t kTagDate = 1;
constexpr uint64_t kTagUuid = 37;
constexpr size_t kLongestHead = 9;
constexpr size_t kFirstGrowth = 256;

// Writes through libcbor's cbor_encode_* functions into out, which grows geometrically ahead of
// the write position and is cut to the bytes written when the writer goes away.
class Writer {
public:
    explicit Writer(std::vector<uint8_t>& out)
        : m_out(out)
        , m_used(out.size())
    {
    }
    ~Writer() { m_out.resize(m_used); }
    Writer(const Writer&) = delete;
    Writer& operator=(const Writer&) = delete;

    template <typename Argument> void head(size_t (*encodeHead)(Argument, unsigned char*, size_t), Argument argument)
    {
        m_used += encodeHead(argument, room(kLongestHead), kLongestHead);
    }

    void bytes(const void* data, size_t length)
    {
        if (length == 0)
            return;
        std::memcpy(room(length), data, length);
        m_used += length;
    }

    void text(const std::string& text)
    {
        head<size_t>(cbor_encode_string_start, text.size());
        bytes(text.data(), text.size());
    }

    void value(const Value& value);

private:
    uint8_t* room(size_t length)
    {
        if (m_out.size() - m_used < length)
            m_out.resize(std::max({ m_out.size() * 2, m_used + length, kFirstGrowth }));
        return m_out.data() + m_used;
    }

    std::vector<uint8_t>& m_out;
    size_t m_used;
};

void Writer::value(const Value& value)
{
    switch (value.type()) {
    case Value::Type::None:
        internalInconsistency("a none value cannot be encoded");
    case Value::Type::Dictionary:
        head<size_t>(cbor_encode_map_start, value.count());
        for (const auto& [key, element] : value.entries()) {
            text(key);
            this->value(element);
        }
        return;
    case Value::Type::Array:
        head<size_t>(cbor_encode_array_start, value.count());
        for (const auto& element : value.elements())
            this->value(element);
        return;
    case Value::Type::String:
        text(*value.asString());
        return;
    case Value::Type::Integer: {
        const int64_t integer = *value.asInt64();
        if (integer >= 0)
            head<uint64_t>(cbor_encode_uint, static_cast<uint64_t>(integer));
        else
            head<uint64_t>(cbor_encode_negint, static_cast<uint64_t>(-1 - integer));
        return;
    }
    case Value::Type::Unsigned:
        head<uint64_t>(cbor_encode_uint, *value.asUInt64());
        return;
    case Value::Type::Real:
        head<double>(cbor_encode_double, *value.asDouble());
        return;
    case Value::Type::Boolean:
        head<bool>(cbor_encode_bool, *value.asBool());
        return;
    case Value::Type::Data: {
        const auto& data = *value.asData();
        head<size_t>(cbor_encode_bytestring_start, data.size());
        bytes(data.data(), data.size());
        return;
    }
    case Value::Type::Date:
        head<uint64_t>(cbor_encode_tag, kTagDate);
        head<double>(cbor_encode_double, *value.asDate());
        return;
    case Value::Type::Uuid: {
        const auto uuid = value.asUuid()->bytes();
        head<uint64_t>(cbor_encode_tag, kTagUuid);
        head<size_t>(cbor_encode_bytestring_start, uuid.size());
        bytes(uuid.data(), uuid.size());
        return;
    }
    }
}

} // namespace

void Cbor::encode(const Value& value, std::vector<uint8_t>& out)
{
    Writer(out).value(value);
}

std::vector<uint8_t> Cbor::encode(const Value& value)
{
    std::vector<uint8_t> out;
    Writer(out).value(value);
    return out;
}

Result<Value> Cbor::decode(std::span<const uint8_t> bytes)
{
    return CborDecoder::decode(bytes);
}

} // namespace om
