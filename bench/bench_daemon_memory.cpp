// Resident memory the real omd holds for clients that misbehave, as ratios to the bound that is
// meant to cap it, and what stays resident after they have gone.
//
// Non-reading client: one connection sends "ping" requests and never reads the replies, until the
// daemon disconnects it for exceeding CONDUIT_MAX_PENDING. A second connection makes a round trip
// after every batch, so that the daemon answers as fast as requests arrive and the client is cut
// off for its unread output, not for requests waiting. Counters: the growth of the daemon's VmRSS
// at its peak as a ratio to the bound (1.0: the queued replies cost exactly what the bound
// allows) and the growth that stays once the client is gone.
//
// Large frames: four clients at once each send one request of almost 16 MiB and read the answer,
// then leave. Counters: the peak growth, and what stays resident afterwards, in MiB.
//
// Compare builds by running both against the same bench binary: OMD_BINARY=/path/to/omd.
#include <benchmark/benchmark.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include "bench/BenchDaemon.h"

namespace {

using namespace om::bench;

constexpr const char* kServiceName = "com.orvex.bench.memory";
constexpr size_t kMiB = size_t(1) << 20;
constexpr size_t kRequestsPerBatch = 2000;

void pause(long milliseconds)
{
    timespec interval = { milliseconds / 1000, (milliseconds % 1000) * 1'000'000 };
    ::nanosleep(&interval, nullptr);
}

double mebibytes(double bytes)
{
    return bytes / double(kMiB);
}

// A private directory with its daemon, removed afterwards.
struct Scratch {
    std::string root;
    std::unique_ptr<BenchDaemon> daemon;

    explicit Scratch(std::vector<std::string> settings)
    {
        std::string pattern = (std::filesystem::temp_directory_path() / "omd-bench-XXXXXX").string();
        root = ::mkdtemp(pattern.data()) ? pattern : std::string("/tmp");
        daemon = std::make_unique<BenchDaemon>(root, kServiceName, std::move(settings));
    }
    ~Scratch()
    {
        daemon.reset();
        std::error_code ignored;
        std::filesystem::remove_all(root, ignored);
    }
};

// One synchronous "ping" on its own connection.
class Pacer {
public:
    explicit Pacer(const std::string& path)
        : m_fd(connectTo(path))
    {
    }
    ~Pacer()
    {
        if (m_fd >= 0)
            ::close(m_fd);
    }
    bool roundTrip()
    {
        setFrameId(m_request, ++m_lastId);
        return m_fd >= 0 && writeAll(m_fd, m_request.data(), m_request.size()) && readFrame(m_fd, m_reply);
    }

private:
    int m_fd;
    uint64_t m_lastId = 0;
    std::vector<uint8_t> m_request = pingFrame();
    std::vector<uint8_t> m_reply;
};

// The lowest VmRSS over a second after the load is gone: what the daemon keeps.
size_t settledResident(const BenchDaemon& daemon, Pacer& pacer)
{
    size_t lowest = SIZE_MAX;
    for (int sample = 0; sample < 20; ++sample) {
        (void)pacer.roundTrip();
        lowest = std::min(lowest, daemon.residentBytes());
        pause(50);
    }
    return lowest;
}

// Sends batches until the daemon closes the connection; false if it never does.
bool floodUntilDisconnected(int fd, Pacer& pacer, const BenchDaemon& daemon, size_t limit, size_t& peak, size_t& sent)
{
    std::vector<uint8_t> ping = pingFrame();
    std::vector<uint8_t> batch;
    uint64_t id = 0;
    while (sent < limit) {
        batch.clear();
        for (size_t i = 0; i < kRequestsPerBatch; ++i) {
            setFrameId(ping, ++id);
            batch.insert(batch.end(), ping.begin(), ping.end());
        }
        for (size_t offset = 0; offset < batch.size();) {
            ssize_t count = ::send(fd, batch.data() + offset, batch.size() - offset, MSG_NOSIGNAL);
            if (count < 0 && errno == EINTR)
                continue;
            if (count <= 0)
                return true;
            offset += size_t(count);
        }
        sent += kRequestsPerBatch;
        if (!pacer.roundTrip())
            return false;
        peak = std::max(peak, daemon.residentBytes());
    }
    return false;
}

void BM_NonReadingClient(benchmark::State& state)
{
    const size_t bound = size_t(state.range(0)) * kMiB;
    Scratch scratch({ "CONDUIT_MAX_PENDING=" + std::to_string(bound) });
    BenchDaemon& daemon = *scratch.daemon;
    if (!daemon.running()) {
        state.SkipWithError("omd is not running");
        return;
    }
    Pacer pacer(daemon.socketPath());
    for (int i = 0; i < 1000; ++i)
        (void)pacer.roundTrip();
    const size_t before = settledResident(daemon, pacer);

    size_t peak = before, sent = 0;
    bool disconnected = false;
    for (auto _ : state) {
        int fd = connectTo(daemon.socketPath());
        int small = 4096;
        (void)::setsockopt(fd, SOL_SOCKET, SO_RCVBUF, &small, sizeof small);
        // Replies are about 50 bytes: four times the bound in requests is plenty.
        disconnected = floodUntilDisconnected(fd, pacer, daemon, 4 * bound / 50, peak, sent);
        ::close(fd);
    }
    const size_t after = settledResident(daemon, pacer);
    if (!disconnected) {
        state.SkipWithError("the non-reading client was never disconnected");
        return;
    }
    const double growth = double(peak) - double(before);
    state.counters["bound_MiB"] = mebibytes(double(bound));
    state.counters["peak_growth_MiB"] = mebibytes(growth);
    state.counters["growth_per_bound"] = growth / double(bound);
    state.counters["left_after_MiB"] = mebibytes(double(after) - double(before));
    state.counters["requests"] = double(sent);
    std::fprintf(stderr,
        "non-reading client, bound %zu MiB: peak growth %.1f MiB (%.2fx the bound), %.1f MiB left after\n",
        bound / kMiB, mebibytes(growth), growth / double(bound), mebibytes(double(after) - double(before)));
}
BENCHMARK(BM_NonReadingClient)->ArgName("bound_MiB")->Arg(8)->Arg(64)->Iterations(1)->Unit(benchmark::kSecond);

// A request of almost the largest frame: "ping" with a byte string that fills the payload.
std::vector<uint8_t> largeRequest()
{
    std::vector<uint8_t> blob((16 * kMiB) - 64, 0x5a);
    return requestFrame(om::Value::dictionary(
        { { "request", "ping" }, { "version", 3u }, { "blob", om::Value::data(std::move(blob)) } }));
}

void BM_LargeFrames(benchmark::State& state)
{
    constexpr int kClients = 4;
    Scratch scratch({});
    BenchDaemon& daemon = *scratch.daemon;
    if (!daemon.running()) {
        state.SkipWithError("omd is not running");
        return;
    }
    Pacer pacer(daemon.socketPath());
    const size_t before = settledResident(daemon, pacer);
    std::vector<uint8_t> request = largeRequest();
    setFrameId(request, 1);

    size_t peak = before;
    std::atomic<int> failures = 0;
    for (auto _ : state) {
        std::atomic<int> running = kClients;
        std::vector<std::thread> clients;
        for (int c = 0; c < kClients; ++c) {
            clients.emplace_back([&] {
                int fd = connectTo(daemon.socketPath());
                std::vector<uint8_t> reply;
                if (fd < 0 || !writeAll(fd, request.data(), request.size()) || !readFrame(fd, reply))
                    ++failures;
                if (fd >= 0)
                    ::close(fd);
                --running;
            });
        }
        while (running.load() > 0) {
            peak = std::max(peak, daemon.residentBytes());
            pause(2);
        }
        for (auto& client : clients)
            client.join();
    }
    const size_t after = settledResident(daemon, pacer);
    if (failures.load() > 0) {
        state.SkipWithError("a large request failed");
        return;
    }
    state.counters["peak_growth_MiB"] = mebibytes(double(peak) - double(before));
    state.counters["left_after_MiB"] = mebibytes(double(after) - double(before));
    std::fprintf(stderr, "%d concurrent 16 MiB requests: peak growth %.1f MiB, %.1f MiB left after\n", kClients,
        mebibytes(double(peak) - double(before)), mebibytes(double(after) - double(before)));
}
BENCHMARK(BM_LargeFrames)->Iterations(3)->Unit(benchmark::kSecond);

} // namespace
