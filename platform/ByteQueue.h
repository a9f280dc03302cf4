// A first-in first-out run of bytes in one contiguous allocation: appended at the back, consumed
// from the front. It holds bytes that wait for a socket: a connection's unsent output, a frame
// still arriving.
//
// Capacity is what the queue really holds in memory, so a limit on it is a limit on the memory:
// append() refuses bytes that would need an allocation above its limit. Growth doubles, up to the
// limit, through realloc, which moves a large allocation by remapping its pages instead of
// copying them into a second one. The consumed front is reclaimed by moving what remains down
// only when the consumed part is at least as large, or when the allocation must grow anyway, so
// each byte is moved a bounded number of times. Once the queue empties, an allocation larger
// than the retained capacity is given back.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>

namespace om {

class ByteQueue {
public:
    // Never allocates here; an empty queue keeps at most retainedCapacity bytes.
    explicit ByteQueue(size_t retainedCapacity);
    ~ByteQueue();
    ByteQueue(ByteQueue&& other) noexcept;
    ByteQueue& operator=(ByteQueue&& other) noexcept;
    ByteQueue(const ByteQueue&) = delete;
    ByteQueue& operator=(const ByteQueue&) = delete;

    // The unconsumed bytes; valid until the next append, consume or clear.
    const uint8_t* data() const { return m_data + m_start; }
    size_t size() const { return m_size; }
    bool empty() const { return m_size == 0; }
    // Bytes allocated.
    size_t capacity() const { return m_capacity; }

    // Adds bytes at the back. False, changing nothing, when holding them would need an allocation
    // larger than limit (or the allocation fails).
    [[nodiscard]] bool append(std::span<const uint8_t> bytes, size_t limit = SIZE_MAX);
    // Drops count bytes (at most size()) from the front.
    void consume(size_t count);
    // Drops every byte and gives the allocation back.
    void clear();

private:
    bool makeRoom(size_t needed, size_t limit);
    void moveToFront();

    uint8_t* m_data = nullptr;
    size_t m_start = 0; // consumed bytes at the front of the allocation
    size_t m_size = 0;
    size_t m_capacity = 0;
    size_t m_retainedCapacity;
};

} // namespace om
