// RawConduitPeer: a test peer that speaks raw Conduit frames over a Unix socket.
//
// For tests that must send what a well-behaved transport never would (bad lengths, unknown kinds,
// malformed CBOR, replies to nothing), or that must see exactly which frames a service writes.
// All I/O blocks, bounded by a generous timeout that only a failing test ever reaches.
//
//   auto peer = RawConduitPeer::connectToService("com.orvex.ombrel.omd");  // or connect(path)
//   ASSERT_TRUE(peer);
//   ASSERT_TRUE(peer->sendFrame(RawConduitPeer::kRequest, 1, request));
//   auto reply = peer->readFrame();             // none: closed, timed out, or not a frame
//   ASSERT_TRUE(reply);
//   EXPECT_EQ(reply->kind, RawConduitPeer::kReply);
//   EXPECT_EQ(reply->id, 1u);
//   EXPECT_EQ(reply->value["errorcode"], om::Value(4));
//
//   peer->sendBytes(RawConduitPeer::header(8, RawConduitPeer::kMessage, 0));  // length out of range
//   EXPECT_TRUE(peer->waitForClose());          // the service dropped us
#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "platform/UniqueFd.h"
#include "platform/Value.h"

class RawConduitPeer {
public:
    static constexpr uint8_t kMessage = 1;
    static constexpr uint8_t kRequest = 2;
    static constexpr uint8_t kReply = 3;
    static constexpr uint8_t kTerminationImminent = 4;
    static constexpr std::chrono::milliseconds kTimeout = std::chrono::seconds(30);

    struct Frame {
        uint8_t kind = 0;
        uint64_t id = 0;
        std::vector<uint8_t> payload; // the raw payload bytes
        om::Value value; // the decoded payload; none when empty or undecodable
    };

    // None when nothing accepts connections there.
    static std::optional<RawConduitPeer> connect(const std::string& socketPath);
    // Connects to $CONDUIT_DIR/<serviceName> (Conduit::socketPath).
    static std::optional<RawConduitPeer> connectToService(const std::string& serviceName);
    // Speaks over a socket the test made itself (e.g. one it accepted, to play a service).
    static RawConduitPeer adopt(om::UniqueFd socket) { return RawConduitPeer(std::move(socket)); }

    // False when the peer is gone.
    bool sendBytes(std::span<const uint8_t> bytes);
    // A well-formed frame; a none payload sends no payload bytes (as kind 4 wants).
    bool sendFrame(uint8_t kind, uint64_t id, const om::Value& payload);
    // Half-closes: the service sees the end of the stream, and we can still read what it sends.
    void shutdownWrite();

    // The next frame. None when the service closed the connection, when the timeout passed, or
    // when the bytes do not form a frame header.
    std::optional<Frame> readFrame(std::chrono::milliseconds timeout = kTimeout);
    // Discards whatever arrives until the service closes; false when the timeout passes first.
    bool waitForClose(std::chrono::milliseconds timeout = kTimeout);
    bool closed() const { return m_closed; }

    int fd() const { return m_socket.get(); }

    // Raw building blocks for hostile input.
    static std::vector<uint8_t> header(uint32_t length, uint8_t kind, uint64_t id);
    static std::vector<uint8_t> frame(uint8_t kind, uint64_t id, std::span<const uint8_t> payload);

private:
    explicit RawConduitPeer(om::UniqueFd socket)
        : m_socket(std::move(socket))
    {
    }
    // Reads more bytes into m_buffer; false on close or timeout.
    bool receive(std::chrono::steady_clock::time_point deadline);

    om::UniqueFd m_socket;
    std::vector<uint8_t> m_buffer;
    bool m_closed = false;
};
