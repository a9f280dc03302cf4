// One Conduit frame, and the incremental reader that cuts a byte stream into checked frames.
//
// Wire form: a little-endian u32 length L of the rest (9 <= L <= 9 + Conduit::kMaxPayload), a kind
// byte, a little-endian u64 id and L - 9 bytes of payload: one CBOR item for kinds 1-3, nothing for
// kind 4. The reader checks every header field as soon as its bytes are in, and holds only the
// bytes that actually arrived, so a header that claims 16 MiB costs nothing until 16 MiB come.
//
// Descriptors: the kind byte's bits 4-6 count the descriptors that travel with a frame of kind 1-3
// (at most Conduit::kMaxDescriptors); the low four bits are the kind. The descriptors themselves
// travel out of band, as SCM_RIGHTS on the sendmsg that writes the frame's first byte.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "platform/ByteQueue.h"
#include "platform/Result.h"
#include "platform/Value.h"

namespace om {

struct ConduitFrame {
    enum class Kind : uint8_t { Message = 1, Request = 2, Reply = 3, TerminationImminent = 4 };

    static constexpr size_t kHeaderSize = 13;
    // Length field value of a frame without payload: the kind byte and the id.
    static constexpr uint32_t kMinLength = 9;

    Kind kind = Kind::Message;
    uint64_t id = 0;
    Value payload; // none for TerminationImminent
    uint8_t descriptorCount = 0; // descriptors the frame declares (kinds 1-3)

    // Header plus the CBOR encoding of payload (nothing for TerminationImminent). Fails when the
    // payload cannot travel: none inside, nesting deeper than the decoder accepts, or too large.
    static Result<std::vector<uint8_t>> encode(
        Kind kind, uint64_t id, const Value& payload, size_t descriptorCount = 0);
    // Rewrites the id of an encoded frame (requests get theirs only when they are queued).
    static void setId(std::vector<uint8_t>& frame, uint64_t id);
    // Why value cannot travel (a none inside, more than Cbor::kMaxDepth nested containers, text
    // that is not UTF-8), or none when it can.
    static std::optional<std::string> whyNotCarriable(const Value& value);
};

class ConduitFrameReader {
public:
    // A buffer that once held a large frame is given back when it empties, so that one big
    // message does not pin its size for the life of the connection.
    static constexpr size_t kRetainedCapacity = 1u << 20;

    // Adds bytes as they arrived from the socket.
    void append(std::span<const uint8_t> bytes);

    // The next complete frame; none while more bytes are needed. An error is a protocol
    // violation: the stream is unusable from there on and every later call repeats the error.
    Result<std::optional<ConduitFrame>> next();

    // At end of stream: an error when a frame was cut short.
    std::optional<OMError> finish() const;

    // The descriptor count the frame in progress declares; none before its kind byte is in.
    std::optional<uint8_t> descriptorsInProgress() const;

    // Bytes held for frames not yet complete.
    size_t buffered() const { return m_buffer.size(); }

private:
    std::optional<OMError> checkHeader() const;
    OMError fail(std::string what);

    // Starts with the first unconsumed frame.
    ByteQueue m_buffer { kRetainedCapacity };
    uint64_t m_lastRequestId = 0; // request ids must increase per connection
    std::optional<OMError> m_error;
};

} // namespace om
