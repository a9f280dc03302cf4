#include "platform/ConduitFrame.h"

#include <algorithm>
#include <cstdint>

#include "platform/Cbor.h"
#include "platform/CborDecoder.h"
#include "platform/Conduit.h"

namespace om {

namespace {

constexpr size_t kLengthSize = 4;
constexpr size_t kKindOffset = 4;
constexpr size_t kIdOffset = 5;
constexpr uint64_t kMaxLength = ConduitFrame::kMinLength + uint64_t(Conduit::kMaxPayload);

uint32_t readLe32(const uint8_t* bytes)
{
    return uint32_t(bytes[0]) | uint32_t(bytes[1]) << 8 | uint32_t(bytes[2]) << 16 | uint32_t(bytes[3]) << 24;
}

uint64_t readLe64(const uint8_t* bytes)
{
    uint64_t value = 0;
    for (int i = 7; i >= 0; --i)
        value = value << 8 | bytes[i];
    return value;
}

void writeLe(uint8_t* out, uint64_t value, size_t size)
{
    for (size_t i = 0; i < size; ++i, value >>= 8)
        out[i] = uint8_t(value & 0xff);
}

constexpr uint8_t kKindMask = 0x0f;
constexpr unsigned kDescriptorShift = 4;
constexpr uint8_t kDescriptorMask = 0x70;

uint8_t descriptorsOf(uint8_t kindByte)
{
    return uint8_t((kindByte & kDescriptorMask) >> kDescriptorShift);
}

bool isKnownKind(uint8_t kind)
{
    return kind >= uint8_t(ConduitFrame::Kind::Message) && kind <= uint8_t(ConduitFrame::Kind::TerminationImminent);
}

std::optional<std::string> checkCarriable(const Value& value, unsigned depth)
{
    switch (value.type()) {
    case Value::Type::None:
        return std::string("a none value");
    case Value::Type::String: {
        const auto& text = *value.asString();
        if (CborDecoder::invalidUtf8Offset({ reinterpret_cast<const uint8_t*>(text.data()), text.size() }))
            return std::string("text that is not UTF-8");
        return std::nullopt;
    }
    case Value::Type::Array:
    case Value::Type::Dictionary:
        break;
    default:
        return std::nullopt;
    }
    if (depth >= Cbor::kMaxDepth)
        return "nesting deeper than " + std::to_string(Cbor::kMaxDepth) + " levels";
    for (const auto& element : value.elements()) {
        if (auto problem = checkCarriable(element, depth + 1))
            return problem;
    }
    for (const auto& [key, element] : value.entries()) {
        if (CborDecoder::invalidUtf8Offset({ reinterpret_cast<const uint8_t*>(key.data()), key.size() }))
            return std::string("a key that is not UTF-8");
        if (auto problem = checkCarriable(element, depth + 1))
            return problem;
    }
    return std::nullopt;
}

} // namespace

std::optional<std::string> ConduitFrame::whyNotCarriable(const Value& value)
{
    return checkCarriable(value, 0);
}

Result<std::vector<uint8_t>> ConduitFrame::encode(Kind kind, uint64_t id, const Value& payload, size_t descriptorCount)
{
    if (descriptorCount > Conduit::kMaxDescriptors || (descriptorCount > 0 && kind == Kind::TerminationImminent))
        return OMError::platform(
            kPlatformErrorLimit, std::to_string(descriptorCount) + " descriptors cannot travel with one frame");
    std::vector<uint8_t> frame(kHeaderSize);
    if (kind != Kind::TerminationImminent) {
        if (auto problem = whyNotCarriable(payload))
            return OMError::platform(kPlatformErrorUnsupported, "message holds " + *problem);
        Cbor::encode(payload, frame);
    }
    const size_t payloadSize = frame.size() - kHeaderSize;
    if (payloadSize > Conduit::kMaxPayload)
        return OMError::platform(
            kPlatformErrorLimit, "message of " + std::to_string(payloadSize) + " bytes exceeds the frame limit");
    writeLe(frame.data(), kMinLength + payloadSize, kLengthSize);
    frame[kKindOffset] = uint8_t(uint8_t(kind) | descriptorCount << kDescriptorShift);
    writeLe(frame.data() + kIdOffset, id, 8);
    return frame;
}

void ConduitFrame::setId(std::vector<uint8_t>& frame, uint64_t id)
{
    writeLe(frame.data() + kIdOffset, id, 8);
}

void ConduitFrameReader::append(std::span<const uint8_t> bytes)
{
    if (m_error || bytes.empty())
        return;
    // Growth stops at the end of the frame in progress, so that a frame of 16 MiB holds 16 MiB
    // and not the next power of two. The buffer never holds a whole frame here (drained ones are
    // consumed), so this only caps doubling; it never refuses.
    size_t limit = m_buffer.size() + bytes.size();
    if (m_buffer.size() >= kLengthSize)
        limit = std::max<size_t>(limit, kLengthSize + readLe32(m_buffer.data()));
    else
        limit = SIZE_MAX;
    if (!m_buffer.append(bytes, limit))
        (void)fail("out of memory for a frame of " + std::to_string(limit) + " bytes");
}

// Judges the header of the frame in progress with whatever part of it has arrived, so that a bad
// length or kind is refused before the body is waited for.
std::optional<OMError> ConduitFrameReader::checkHeader() const
{
    const size_t available = buffered();
    const uint8_t* header = m_buffer.data();
    if (available < kLengthSize)
        return std::nullopt;
    const uint32_t length = readLe32(header);
    if (length < ConduitFrame::kMinLength || length > kMaxLength)
        return OMError::platform(kPlatformErrorLimit, "frame length " + std::to_string(length) + " out of range");
    if (available <= kKindOffset)
        return std::nullopt;
    const uint8_t kindByte = header[kKindOffset];
    const uint8_t kind = kindByte & kKindMask;
    if (!isKnownKind(kind) || (kindByte & ~(kKindMask | kDescriptorMask)) != 0)
        return OMError::platform(kPlatformErrorMalformed, "unknown frame kind " + std::to_string(kindByte));
    const auto frameKind = ConduitFrame::Kind(kind);
    const uint8_t descriptors = descriptorsOf(kindByte);
    if (descriptors > Conduit::kMaxDescriptors)
        return OMError::platform(kPlatformErrorLimit, "frame declares " + std::to_string(descriptors) + " descriptors");
    if (descriptors > 0 && frameKind == ConduitFrame::Kind::TerminationImminent)
        return OMError::platform(kPlatformErrorMalformed, "termination frame with descriptors");
    if (frameKind == ConduitFrame::Kind::TerminationImminent && length != ConduitFrame::kMinLength)
        return OMError::platform(kPlatformErrorMalformed, "termination frame with a payload");
    if (frameKind != ConduitFrame::Kind::TerminationImminent && length == ConduitFrame::kMinLength)
        return OMError::platform(
            kPlatformErrorMalformed, "frame of kind " + std::to_string(kind) + " without a payload");
    if (available < ConduitFrame::kHeaderSize)
        return std::nullopt;
    const uint64_t id = readLe64(header + kIdOffset);
    switch (frameKind) {
    case ConduitFrame::Kind::Request:
        if (id == 0)
            return OMError::platform(kPlatformErrorMalformed, "request with id 0");
        if (id <= m_lastRequestId)
            return OMError::platform(kPlatformErrorMalformed,
                "request id " + std::to_string(id) + " not above " + std::to_string(m_lastRequestId));
        break;
    case ConduitFrame::Kind::Reply:
        break; // whether it answers anything is the connection's to say
    case ConduitFrame::Kind::Message:
    case ConduitFrame::Kind::TerminationImminent:
        if (id != 0)
            return OMError::platform(
                kPlatformErrorMalformed, "frame of kind " + std::to_string(kind) + " with id " + std::to_string(id));
        break;
    }
    return std::nullopt;
}

Result<std::optional<ConduitFrame>> ConduitFrameReader::next()
{
    if (m_error)
        return *m_error;
    if (auto problem = checkHeader())
        return fail(problem->localizedDescription());
    if (buffered() < ConduitFrame::kHeaderSize)
        return std::optional<ConduitFrame>();
    const uint8_t* header = m_buffer.data();
    const uint32_t length = readLe32(header);
    if (buffered() < kLengthSize + length)
        return std::optional<ConduitFrame>();

    ConduitFrame frame;
    frame.kind = ConduitFrame::Kind(header[kKindOffset] & kKindMask);
    frame.descriptorCount = descriptorsOf(header[kKindOffset]);
    frame.id = readLe64(header + kIdOffset);
    if (frame.kind == ConduitFrame::Kind::Request)
        m_lastRequestId = frame.id;
    if (frame.kind != ConduitFrame::Kind::TerminationImminent) {
        // Decoded in place: the frame's bytes are consumed only afterwards.
        auto decoded = Cbor::decode(
            std::span<const uint8_t>(header + ConduitFrame::kHeaderSize, length - ConduitFrame::kMinLength));
        if (!decoded.ok())
            return fail("malformed payload: " + decoded.error().localizedDescription());
        frame.payload = std::move(decoded).releaseValue();
    }
    m_buffer.consume(kLengthSize + length);
    return std::optional<ConduitFrame>(std::move(frame));
}

std::optional<uint8_t> ConduitFrameReader::descriptorsInProgress() const
{
    if (buffered() <= kKindOffset)
        return std::nullopt;
    return descriptorsOf(m_buffer.data()[kKindOffset]);
}

std::optional<OMError> ConduitFrameReader::finish() const
{
    if (m_error || buffered() == 0)
        return std::nullopt;
    if (buffered() < ConduitFrame::kHeaderSize)
        return OMError::platform(
            kPlatformErrorMalformed, "stream ended inside a frame header (" + std::to_string(buffered()) + " bytes)");
    return OMError::platform(kPlatformErrorMalformed,
        "stream ended inside a frame (" + std::to_string(buffered()) + " of "
            + std::to_string(kLengthSize + readLe32(m_buffer.data())) + " bytes)");
}

OMError ConduitFrameReader::fail(std::string what)
{
    m_error = OMError::platform(kPlatformErrorMalformed, std::move(what));
    m_buffer.clear();
    return *m_error;
}

} // namespace om
