#include "platform/ByteQueue.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <utility>

namespace om {

namespace {

// Below this a doubling allocation is not worth its own realloc.
constexpr size_t kMinimumCapacity = 4096;

} // namespace

ByteQueue::ByteQueue(size_t retainedCapacity)
    : m_retainedCapacity(retainedCapacity)
{
}

ByteQueue::~ByteQueue()
{
    std::free(m_data);
}

ByteQueue::ByteQueue(ByteQueue&& other) noexcept
    : m_data(std::exchange(other.m_data, nullptr))
    , m_start(std::exchange(other.m_start, 0))
    , m_size(std::exchange(other.m_size, 0))
    , m_capacity(std::exchange(other.m_capacity, 0))
    , m_retainedCapacity(other.m_retainedCapacity)
{
}

ByteQueue& ByteQueue::operator=(ByteQueue&& other) noexcept
{
    if (this != &other) {
        std::free(m_data);
        m_data = std::exchange(other.m_data, nullptr);
        m_start = std::exchange(other.m_start, 0);
        m_size = std::exchange(other.m_size, 0);
        m_capacity = std::exchange(other.m_capacity, 0);
        m_retainedCapacity = other.m_retainedCapacity;
    }
    return *this;
}

bool ByteQueue::append(std::span<const uint8_t> bytes, size_t limit)
{
    if (bytes.empty())
        return true;
    if (bytes.size() > limit || m_size > limit - bytes.size())
        return false;
    const size_t needed = m_size + bytes.size();
    if (m_start + needed > m_capacity && !makeRoom(needed, limit))
        return false;
    std::memcpy(m_data + m_start + m_size, bytes.data(), bytes.size());
    m_size = needed;
    return true;
}

// Called when needed bytes do not fit behind m_start; needed <= limit.
bool ByteQueue::makeRoom(size_t needed, size_t limit)
{
    // Moving down costs at most what was consumed since the last move, so it is paid for.
    if (needed <= m_capacity && (m_start >= m_size || m_capacity >= limit)) {
        moveToFront();
        return true;
    }
    const size_t doubled = std::max(kMinimumCapacity, m_capacity * 2);
    const size_t capacity = std::max(needed, std::min(doubled, limit));
    // Moved first so that realloc carries only live bytes, and a remapped allocation none at all.
    moveToFront();
    auto* grown = static_cast<uint8_t*>(std::realloc(m_data, capacity));
    if (!grown)
        return false;
    m_data = grown;
    m_capacity = capacity;
    return true;
}

void ByteQueue::moveToFront()
{
    if (m_start == 0)
        return;
    if (m_size > 0)
        std::memmove(m_data, m_data + m_start, m_size);
    m_start = 0;
}

void ByteQueue::consume(size_t count)
{
    count = std::min(count, m_size);
    m_start += count;
    m_size -= count;
    if (m_size > 0)
        return;
    m_start = 0;
    if (m_capacity > m_retainedCapacity)
        clear();
}

void ByteQueue::clear()
{
    std::free(std::exchange(m_data, nullptr));
    m_start = m_size = m_capacity = 0;
}

} // namespace om
