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
    size_t closed = 0;
    for (auto& peer : asking) {
        const Outcome outcome = outcomeOf(peer);
        ASSERT_NE(outcome, Outcome::LeftWaiting);
        if (outcome == Outcome::Served)
            served.push_back(std::move(peer));
        else
            ++closed;
    }
    ASSERT_GT(closed, 0u) << "the daemon never ran out";
    ASSERT_GT(served.size(), 0u);

    // Still out of descriptors: clients that come now are closed, and the daemon idles meanwhile
    // (it spun a whole core here once). A served client's round trip before each late one
    // means the daemon has finished turning peers away, so the late client meets a listener at
    // rest rather than one still draining its backlog.
    uint64_t lastId = 1;
    auto roundTrip = [&] {
        auto& peer = served.front();
        if (!peer.sendFrame(RawConduitPeer::kRequest, ++lastId, daemonRequest("ping")))
            return false;
        auto reply = peer.readFrame();
        return reply && reply->id == lastId;
    };
    const double share = cpuShareDuring(*daemon, [&] {
        for (int i = 0; i < 10; ++i) {
            ASSERT_TRUE(roundTrip());
            auto late = connectAndAsk(*daemon);
            ASSERT_TRUE(late);
            EXPECT_EQ(outcomeOf(*late), Outcome::Closed) << "late client " << i;
        }
    });
    EXPECT_LT(share, 0.25) << "CPU time per wall-clock time while out of descriptors";
    EXPECT_EQ(linesContaining(*daemon, "turning new connections away"), 1u) << "one line per episode";
    EXPECT_LE(linesContaining(*daemon, "Too many open files"), 1u);
    EXPECT_LT(daemon->stderrText().size(), 256u * 1024) << "the log grows with clients, not with attempts";

    // Once clients leave, new ones are served again. A descriptor may still be on its way back
    // when one arrives; it is then closed, never left waiting.
    served.clear();
    bool servedAgain = false;
    for (int attempt = 0; attempt < 50 && !servedAgain; ++attempt) {
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

} // namespace
} // namespace om::test
