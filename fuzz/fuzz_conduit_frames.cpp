// Feeds arbitrary byte streams, cut into arbitrary chunks, to the Conduit frame reader. Every frame
// it accepts must encode back to a frame that reads the same; nothing may crash or abort.
#include <cstddef>
#include <cstdint>
#include <cstdlib>

#include "platform/ConduitFrame.h"

using om::ConduitFrame;
using om::ConduitFrameReader;

namespace {

void checkRoundTrip(const ConduitFrame& frame)
{
    auto encoded = ConduitFrame::encode(frame.kind, frame.id, frame.payload);
    if (!encoded.ok())
        std::abort(); // whatever was accepted must be sendable
    ConduitFrameReader again;
    again.append(encoded.value());
    auto read = again.next();
    if (!read.ok() || !read.value() || read.value()->kind != frame.kind || read.value()->id != frame.id
        || !(read.value()->payload == frame.payload || frame.payload.isNone()))
        std::abort();
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    if (size == 0)
        return 0;
    // The first byte picks the chunk size, so that headers and payloads get split everywhere.
    const size_t chunk = size_t(data[0]) + 1;
    ++data;
    --size;
    ConduitFrameReader reader;
    for (size_t offset = 0; offset < size; offset += chunk) {
        reader.append({ data + offset, std::min(chunk, size - offset) });
        for (;;) {
            auto next = reader.next();
            if (!next.ok())
                return 0;
            if (!next.value())
                break;
            checkRoundTrip(*next.value());
        }
    }
    (void)reader.finish();
    return 0;
}
