#include "tests/support/RawConduitPeer.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cerrno>
#include <cstring>

#include "platform/Cbor.h"
#include "platform/Conduit.h"

namespace {

constexpr size_t kHeaderSize = 13;

void putLe(std::vector<uint8_t>& out, uint64_t value, size_t size)
{
    for (size_t i = 0; i < size; ++i, value >>= 8)
        out.push_back(uint8_t(value & 0xff));
}

uint64_t getLe(const uint8_t* bytes, size_t size)
{
    uint64_t value = 0;
    for (size_t i = size; i-- > 0;)
        value = value << 8 | bytes[i];
    return value;
}

} // namespace

std::optional<RawConduitPeer> RawConduitPeer::connect(const std::string& socketPath)
{
    sockaddr_un address {};
    address.sun_family = AF_UNIX;
    if (socketPath.size() >= sizeof address.sun_path)
        return std::nullopt;
    std::memcpy(address.sun_path, socketPath.c_str(), socketPath.size() + 1);
    om::UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (!socket.valid() || ::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) < 0)
        return std::nullopt;
    return RawConduitPeer(std::move(socket));
}

std::optional<RawConduitPeer> RawConduitPeer::connectToService(const std::string& serviceName)
{
    return connect(om::Conduit::socketPath(serviceName));
}

bool RawConduitPeer::sendBytes(std::span<const uint8_t> bytes)
{
    size_t sent = 0;
    while (sent < bytes.size()) {
        const ssize_t count = ::send(m_socket.get(), bytes.data() + sent, bytes.size() - sent, MSG_NOSIGNAL);
        if (count < 0 && errno == EINTR)
            continue;
        if (count <= 0)
            return false;
        sent += size_t(count);
    }
    return true;
}

bool RawConduitPeer::sendFrame(uint8_t kind, uint64_t id, const om::Value& payload)
{
    std::vector<uint8_t> bytes;
    if (!payload.isNone())
        bytes = om::Cbor::encode(payload);
    return sendBytes(frame(kind, id, bytes));
}

void RawConduitPeer::shutdownWrite()
{
    ::shutdown(m_socket.get(), SHUT_WR);
}

bool RawConduitPeer::receive(std::chrono::steady_clock::time_point deadline)
{
    if (m_closed)
        return false;
    for (;;) {
        const auto left
            = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
        if (left.count() <= 0)
            return false;
        pollfd entry { m_socket.get(), POLLIN, 0 };
        const int ready = ::poll(&entry, 1, int(left.count()));
        if (ready < 0 && errno == EINTR)
            continue;
        if (ready <= 0)
            return false;
        uint8_t chunk[65536];
        const ssize_t count = ::recv(m_socket.get(), chunk, sizeof chunk, 0);
        if (count < 0 && errno == EINTR)
            continue;
        if (count <= 0) {
            m_closed = true;
            return false;
        }
        m_buffer.insert(m_buffer.end(), chunk, chunk + count);
        return true;
    }
}

std::optional<RawConduitPeer::Frame> RawConduitPeer::readFrame(std::chrono::milliseconds timeout)
{
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    for (;;) {
        if (m_buffer.size() >= 4) {
            const uint64_t length = getLe(m_buffer.data(), 4);
            if (length < kHeaderSize - 4)
                return std::nullopt;
            if (m_buffer.size() >= 4 + length) {
                Frame frame;
                frame.kind = m_buffer[4];
                frame.id = getLe(m_buffer.data() + 5, 8);
                frame.payload.assign(m_buffer.begin() + kHeaderSize, m_buffer.begin() + ptrdiff_t(4 + length));
                m_buffer.erase(m_buffer.begin(), m_buffer.begin() + ptrdiff_t(4 + length));
                if (!frame.payload.empty()) {
                    if (auto decoded = om::Cbor::decode(frame.payload); decoded.ok())
                        frame.value = std::move(decoded).releaseValue();
                }
                return frame;
            }
        }
        if (!receive(deadline))
            return std::nullopt;
    }
}

bool RawConduitPeer::waitForClose(std::chrono::milliseconds timeout)
{
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    while (!m_closed) {
        m_buffer.clear();
        if (!receive(deadline) && !m_closed)
            return false;
    }
    return true;
}

std::vector<uint8_t> RawConduitPeer::header(uint32_t length, uint8_t kind, uint64_t id)
{
    std::vector<uint8_t> bytes;
    putLe(bytes, length, 4);
    bytes.push_back(kind);
    putLe(bytes, id, 8);
    return bytes;
}

std::vector<uint8_t> RawConduitPeer::frame(uint8_t kind, uint64_t id, std::span<const uint8_t> payload)
{
    auto bytes = header(uint32_t(kHeaderSize - 4 + payload.size()), kind, id);
    bytes.insert(bytes.end(), payload.begin(), payload.end());
    return bytes;
}
