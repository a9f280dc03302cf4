// Clients that exhaust what the daemon has: its descriptors, its outbound bound, its memory for
// large frames. Each costs the daemon a bounded amount and only for as long as it lasts, and the
// daemon goes on serving the others.
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <ostream>
#include <string>
#include <thread>
#include <vector>

#include "platform/Cbor.h"
#include "platform/Conduit.h"
#include "platform/Format.h"
#include "tests/support/DaemonProcess.h"

namespace om::test {
namespace {

using Bytes = std::vector<uint8_t>;

constexpr uint64_t kMiB = uint64_t(1) << 20;

// Under the sanitizers, memory is the sanitizer allocator's (quarantined, shadowed): the daemon's
// resident size then says nothing about what the daemon itself holds.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool kNativeAllocator = false;
#else
constexpr bool kNativeAllocator = true;
#endif

// The ASan+UBSan build's runtime checks a vtable by writing its memory into a pipe. A daemon out
// of descriptors cannot open one, and the check then reports a false error.
#if defined(__SANITIZE_ADDRESS__)
constexpr bool kRuntimeNeedsDescriptors = true;
#else
constexpr bool kRuntimeNeedsDescriptors = false;
#endif

std::unique_ptr<DaemonProcess> startDaemon(DaemonProcess::Options options)
{
    options.executable = builtDaemonPath();
    return std::make_unique<DaemonProcess>(std::move(options));
}

enum class Outcome { Served, Closed, LeftWaiting };

void PrintTo(Outcome outcome, std::ostream* out)
{
    *out << (outcome == Outcome::Served ? "served" : outcome == Outcome::Closed ? "closed" : "left waiting");
}

// What became of a peer that sent one request: a reply, or the end of the connection.
Outcome outcomeOf(RawConduitPeer& peer)
{
    auto frame = peer.readFrame();
    if (frame && frame->kind == RawConduitPeer::kReply)
        return Outcome::Served;
    return peer.closed() ? Outcome::Closed : Outcome::LeftWaiting;
}

// The request may not get through: a peer turned away can be closed before it is written.
std::optional<RawConduitPeer> connectAndAsk(const DaemonProcess& daemon)
{
    auto peer = RawConduitPeer::connect(daemon.socketPath());
    if (peer)
        (void)peer->sendFrame(RawConduitPeer::kRequest, 1, daemonRequest("ping"));
    return peer;
}

size_t linesContaining(const DaemonProcess& daemon, std::string_view text)
{
    auto lines = daemon.lines();
    return size_t(std::count_if(
        lines.begin(), lines.end(), [&](const auto& line) { return line.message.find(text) != std::string::npos; }));
}

// CPU time the daemon used while something ran, as a share of the wall-clock time it took.
template <typename Work> double cpuShareDuring(const DaemonProcess& daemon, Work work)
{
    const auto ticksBefore = daemon.cpuTicks();
    const auto start = std::chrono::steady_clock::now();
    work();
    const double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
    const auto ticksAfter = daemon.cpuTicks();
    if (!ticksBefore || !ticksAfter || seconds <= 0)
        return 1.0;
    return double(*ticksAfter - *ticksBefore) / double(::sysconf(_SC_CLK_TCK)) / seconds;
}

TEST(DaemonOutOfDescriptors, TurnsClientsAwayWithoutSpinningThenServesAgain)
{
    if (kRuntimeNeedsDescriptors)
        GTEST_SKIP() << "the sanitizer runtime cannot work without descriptors";
    DaemonProcess::Options options;
    options.descriptorLimit = 64; // soft and hard: the daemon cannot raise it
    auto daemon = startDaemon(options);
    ASSERT_TRUE(daemon->waitForSocket()) << daemon->stderrText();

    // More clients at once than the daemon has descriptors for: each is served or closed.
    std::vector<RawConduitPeer> asking;
    for (int i = 0; i < 60; ++i) {
        auto peer = connectAndAsk(*daemon);
        ASSERT_TRUE(peer);
        asking.push_back(std::move(*peer));
    }
    std::vector<RawConduitPeer> served;
    for (auto& peer : asking) {
        const Outcome outcome = outcomeOf(peer);
        ASSERT_NE(outcome, Outcome::LeftWaiting);
        if (outcome == Outcome::Served)
            served.push_back(std::move(peer));
    }
    ASSERT_GT(served.size(), 0u);

    // A served client's round trip means the daemon is at rest: done with turning peers away, and
    // with the descriptors it opens for a moment while it identifies a client.
    uint64_t lastId = 1;
    auto roundTrip = [&] {
        auto& peer = served.front();
        if (!peer.sendFrame(RawConduitPeer::kRequest, ++lastId, daemonRequest("ping")))
            return false;
        auto reply = peer.readFrame();
        return reply && reply->id == lastId;
    };
    // The burst may have run out only for a moment: more clients, one at a time, until even a
    // daemon at rest has no room for one.
    bool fullAtRest = false;
    for (int i = 0; i < 64 && !fullAtRest; ++i) {
        ASSERT_TRUE(roundTrip());
        auto peer = connectAndAsk(*daemon);
        ASSERT_TRUE(peer);
        const Outcome outcome = outcomeOf(*peer);
        ASSERT_NE(outcome, Outcome::LeftWaiting);
        if (outcome == Outcome::Served)
            served.push_back(std::move(*peer));
        fullAtRest = outcome == Outcome::Closed;
    }
    ASSERT_TRUE(fullAtRest) << "the daemon never ran out";

    // Still out of descriptors: clients that come now are closed, without a word in the log, and
    // the daemon idles meanwhile (it spun a whole core here once).
    const size_t episodeLines = linesContaining(*daemon, "turning new connections away");
    EXPECT_GE(episodeLines, 1u);
    const double share = cpuShareDuring(*daemon, [&] {
        for (int i = 0; i < 10; ++i) {
            ASSERT_TRUE(roundTrip());
            auto late = connectAndAsk(*daemon);
            ASSERT_TRUE(late);
            EXPECT_EQ(outcomeOf(*late), Outcome::Closed) << "late client " << i;
        }
    });
    EXPECT_LT(share, 0.25) << "CPU time per wall-clock time while out of descriptors";
    ASSERT_TRUE(roundTrip());
    EXPECT_EQ(linesContaining(*daemon, "turning new connections away"), episodeLines) << "one line per episode";
    EXPECT_LE(linesContaining(*daemon, "Too many open files"), episodeLines);
    EXPECT_LT(daemon->stderrText().size(), 256u * 1024) << "the log grows with clients, not with attempts";

    // Once clients leave, new ones are served again. A descriptor may still be on its way back
    // when one arrives; it is then closed, never left waiting.
    served.clear();
    bool servedAgain = false;
    for (int attempt = 0; attempt < 200 && !servedAgain; ++attempt) {
        auto peer = connectAndAsk(*daemon);
        ASSERT_TRUE(peer);
        const Outcome outcome = outcomeOf(*peer);
        ASSERT_NE(outcome, Outcome::LeftWaiting);
        servedAgain = outcome == Outcome::Served;
    }
    EXPECT_TRUE(servedAgain);
    const std::string recovered = "accepting connections on " + daemon->socketPath() + " again; ";
    EXPECT_TRUE(daemon->waitForLines([&](const std::vector<DaemonLogLine>& lines) {
        return std::any_of(
            lines.begin(), lines.end(), [&](const auto& line) { return line.message.starts_with(recovered); });
    }));
    EXPECT_TRUE(daemon->running());
}

// {"request": "ping", "version": 3} as a request frame with id.
Bytes pingFrame(uint64_t id)
{
    return RawConduitPeer::frame(RawConduitPeer::kRequest, id, Cbor::encode(daemonRequest("ping")));
}

TEST(DaemonOutboundBound, NonReadingClientCostsAboutTheBoundAndNothingOnceGone)
{
    if (!kNativeAllocator)
        GTEST_SKIP() << "resident memory is the sanitizer allocator's";
    constexpr uint64_t kBound = 8 * kMiB;
    constexpr uint64_t kSlack = 8 * kMiB; // the daemon's own churn while it answers 160,000 requests
    constexpr size_t kBatch = 1000;
    DaemonProcess::Options options;
    options.logLevel = "default"; // a debug line per request would be most of the test
    options.environment = { { "CONDUIT_MAX_PENDING", std::to_string(kBound) } };
    auto daemon = startDaemon(options);
    ASSERT_TRUE(daemon->waitForSocket()) << daemon->stderrText();

    auto bystander = DaemonPeer::connect(*daemon);
    ASSERT_TRUE(bystander);
    for (int i = 0; i < 200; ++i)
        ASSERT_TRUE(bystander->call(daemonRequest("ping")));
    const uint64_t before = daemon->residentBytes().value_or(0);

    auto silent = RawConduitPeer::connect(daemon->socketPath());
    ASSERT_TRUE(silent);
    int small = 4096;
    ASSERT_EQ(::setsockopt(silent->fd(), SOL_SOCKET, SO_RCVBUF, &small, sizeof small), 0);
    // Batches of requests, each followed by a bystander's round trip, so that the daemon answers
    // as fast as they come: the client is cut off for what it leaves unread, not for requests
    // waiting. A send fails once the daemon has closed the connection.
    uint64_t peak = before, id = 0;
    bool cutOff = false;
    for (uint64_t batch = 0; batch < 4 * kBound / 50 / kBatch && !cutOff; ++batch) {
        Bytes bytes;
        for (size_t i = 0; i < kBatch; ++i) {
            auto frame = pingFrame(++id);
            bytes.insert(bytes.end(), frame.begin(), frame.end());
        }
        cutOff = !silent->sendBytes(bytes);
        ASSERT_TRUE(bystander->call(daemonRequest("ping")));
        peak = std::max(peak, daemon->residentBytes().value_or(0));
    }
    ASSERT_TRUE(cutOff) << "never disconnected after " << id << " requests";

    const std::string reason = format("protocol error on connection to pid %d: peer stopped reading (", ::getpid());
    ASSERT_TRUE(daemon->waitForLines([&](const std::vector<DaemonLogLine>& lines) {
        return std::any_of(
            lines.begin(), lines.end(), [&](const auto& line) { return line.message.starts_with(reason); });
    }));
    unsigned long long pending = 0;
    for (const auto& line : daemon->lines()) {
        if (line.message.starts_with(reason))
            (void)std::sscanf(line.message.c_str() + reason.size(), "%llu", &pending);
    }
    EXPECT_GT(pending, kBound) << "disconnected before the bound";
    EXPECT_LE(pending, kBound + 64) << "disconnected by more than one reply past the bound";
    EXPECT_LE(peak - before, 2 * kBound + kSlack) << "resident growth while the client was connected";

    silent.reset();
    ASSERT_TRUE(bystander->call(daemonRequest("ping")));
    const uint64_t after = daemon->residentBytes().value_or(UINT64_MAX);
    EXPECT_LE(after, before + kBound / 2) << "resident growth after the client left";
    EXPECT_EQ(linesContaining(*daemon, "peer stopped reading"), 1u) << "one line per reason per connection";
}

TEST(DaemonLargeFrames, ConcurrentLargestRequestsLeaveNothingResident)
{
    if (!kNativeAllocator)
        GTEST_SKIP() << "resident memory is the sanitizer allocator's";
    constexpr int kClients = 4;
    DaemonProcess::Options options;
    options.logLevel = "default";
    auto daemon = startDaemon(options);
    ASSERT_TRUE(daemon->waitForSocket()) << daemon->stderrText();
    auto bystander = DaemonPeer::connect(*daemon);
    ASSERT_TRUE(bystander);
    ASSERT_TRUE(bystander->call(daemonRequest("ping")));
    const uint64_t before = daemon->residentBytes().value_or(0);

    // A payload just under the frame limit: the map's other entries and the heads take the rest.
    Value large = Value::dictionary({ { "request", Value::string("ping") }, { "version", Value(uint64_t(3)) },
        { "blob", Value::data(Bytes(Conduit::kMaxPayload - 64, 0x5a)) } });
    Bytes frame = RawConduitPeer::frame(RawConduitPeer::kRequest, 1, Cbor::encode(large));
    ASSERT_LE(frame.size(), 13 + Conduit::kMaxPayload);
    std::vector<Outcome> outcomes(kClients, Outcome::LeftWaiting);
    {
        std::vector<std::thread> clients;
        for (int c = 0; c < kClients; ++c) {
            clients.emplace_back([&, c] {
                auto peer = RawConduitPeer::connect(daemon->socketPath());
                if (peer && peer->sendBytes(frame))
                    outcomes[size_t(c)] = outcomeOf(*peer);
            });
        }
        for (auto& client : clients)
            client.join();
    }
    for (int c = 0; c < kClients; ++c)
        EXPECT_EQ(outcomes[size_t(c)], Outcome::Served) << "client " << c;

    ASSERT_TRUE(bystander->call(daemonRequest("ping")));
    const uint64_t after = daemon->residentBytes().value_or(UINT64_MAX);
    EXPECT_LE(after, before + 8 * kMiB) << "resident growth after " << kClients << " requests of 16 MiB";
}

} // namespace
} // namespace om::test
