// Round trip of a request omd answers without handler work ("ping": an unrecognised name), measured
// against a raw Unix-socket echo of the same frame in the same run. Each client thread has its own
// connection and runs a synchronous request/reply loop over raw frames, so that no queue hop of the
// client library hides the transport; one more case goes through OMDaemonClient.
//
// The daemon is the real omd binary: $OMD_BINARY, else <build>/omd/omd next to <build>/bench/. It
// runs on a private CONDUIT_DIR and dies with the benchmark. Echo and daemon batches alternate
// inside every case, so that load from elsewhere on the machine hits both alike. The counters are
// ratios to the echo: p50 and p99 latency (lower is better) and throughput (higher is better).
// The raw cases also time an echo that answers from one serial work queue, as omd answers from its
// "service" queue: the floor for any design that hands every request to another thread.
#include <benchmark/benchmark.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <latch>
#include <map>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "Ombrel/OMDaemonClient.h"
#include "bench/BenchDaemon.h"

namespace {

using namespace om::bench;
using Clock = std::chrono::steady_clock;

constexpr const char* kServiceName = "com.orvex.bench.roundtrip";
constexpr size_t kRequestsPerBatch = 4000;

// The baseline: one thread per connection that reads a frame and writes it straight back. With a
// hop queue, the write happens on that one serial queue instead, as the daemon answers from its
// "service" queue: the difference to the plain echo is what one queue hop costs.
class EchoServer {
public:
    EchoServer(std::string path, std::shared_ptr<om::WorkQueue> hop)
        : m_path(std::move(path))
        , m_hop(std::move(hop))
    {
        m_listener = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_un address = {};
        address.sun_family = AF_UNIX;
        std::strncpy(address.sun_path, m_path.c_str(), sizeof address.sun_path - 1);
        if (::bind(m_listener, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0
            || ::listen(m_listener, 64) != 0)
            std::fprintf(stderr, "echo server: cannot listen at %s: %s\n", m_path.c_str(), std::strerror(errno));
        m_acceptor = std::thread([this] { acceptLoop(); });
    }

    ~EchoServer()
    {
        ::shutdown(m_listener, SHUT_RDWR);
        m_acceptor.join();
        ::close(m_listener);
        std::lock_guard lock(m_mutex);
        for (auto& connection : m_connections)
            connection.join();
    }

    const std::string& path() const { return m_path; }

private:
    void acceptLoop()
    {
        for (;;) {
            int fd = ::accept4(m_listener, nullptr, nullptr, SOCK_CLOEXEC);
            if (fd < 0) {
                if (errno == EINTR)
                    continue;
                return;
            }
            std::lock_guard lock(m_mutex);
            m_connections.emplace_back([fd, hop = m_hop] {
                std::vector<uint8_t> frame;
                while (readFrame(fd, frame)) {
                    if (!hop) {
                        if (!writeAll(fd, frame.data(), frame.size()))
                            break;
                        continue;
                    }
                    hop->async([fd, reply = std::move(frame)] { (void)writeAll(fd, reply.data(), reply.size()); });
                }
                if (hop)
                    hop->sync([] {}); // the last write is done with fd
                ::close(fd);
            });
        }
    }

    std::string m_path;
    std::shared_ptr<om::WorkQueue> m_hop;
    int m_listener = -1;
    std::thread m_acceptor;
    std::mutex m_mutex;
    std::vector<std::thread> m_connections;
};

struct Batch {
    std::vector<double> micros; // one sample per round trip
    double wallSeconds = 0;
    bool failed = false;
};

// Figures of one benchmark case for one side: every sample of its batches, and each batch's rate.
struct Side {
    std::vector<double> micros;
    std::vector<double> rates;
    double wallSeconds = 0;

    void add(const Batch& batch)
    {
        micros.insert(micros.end(), batch.micros.begin(), batch.micros.end());
        wallSeconds += batch.wallSeconds;
        rates.push_back(batch.wallSeconds > 0 ? static_cast<double>(batch.micros.size()) / batch.wallSeconds : 0);
    }
    double percentile(double p)
    {
        if (micros.empty())
            return 0;
        std::sort(micros.begin(), micros.end());
        auto index = static_cast<size_t>(p * static_cast<double>(micros.size() - 1) + 0.5);
        return micros[std::min(index, micros.size() - 1)];
    }
    double throughput() const { return wallSeconds > 0 ? static_cast<double>(micros.size()) / wallSeconds : 0; }
};

// Median over the alternations of this side's rate against the baseline's rate in the same
// alternation: one batch slowed by a neighbour on the machine then moves it little.
double throughputRatio(const Side& side, const Side& baseline)
{
    std::vector<double> ratios;
    for (size_t i = 0; i < std::min(side.rates.size(), baseline.rates.size()); ++i) {
        if (baseline.rates[i] > 0)
            ratios.push_back(side.rates[i] / baseline.rates[i]);
    }
    if (ratios.empty())
        return 0;
    std::sort(ratios.begin(), ratios.end());
    return ratios[ratios.size() / 2];
}

// Runs threads synchronous loops of round trips, each thread on its own connection; connecting is
// not timed. roundTrip is called with a thread's state and must return false on failure.
template <typename Connect, typename RoundTrip>
Batch runBatch(int threads, size_t requestsPerThread, Connect connect, RoundTrip roundTrip)
{
    Batch batch;
    std::vector<std::vector<double>> samples(static_cast<size_t>(threads));
    std::latch ready(threads + 1);
    std::latch go(1);
    std::atomic<bool> failed = false;
    std::vector<std::thread> workers;
    for (int t = 0; t < threads; ++t) {
        workers.emplace_back([&, t] {
            auto connection = connect();
            auto& mine = samples[static_cast<size_t>(t)];
            mine.reserve(requestsPerThread);
            ready.count_down();
            go.wait();
            for (size_t i = 0; i < requestsPerThread && connection; ++i) {
                auto start = Clock::now();
                if (!roundTrip(connection, i + 1)) {
                    failed = true;
                    break;
                }
                mine.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
            }
            if (!connection)
                failed = true;
        });
    }
    ready.arrive_and_wait();
    auto start = Clock::now();
    go.count_down();
    for (auto& worker : workers)
        worker.join();
    batch.wallSeconds = std::chrono::duration<double>(Clock::now() - start).count();
    for (auto& mine : samples)
        batch.micros.insert(batch.micros.end(), mine.begin(), mine.end());
    batch.failed = failed;
    return batch;
}

// A raw frame connection with its own request frame and reply buffer.
struct RawConnection {
    int fd = -1;
    std::vector<uint8_t> request = pingFrame();
    std::vector<uint8_t> reply;

    explicit operator bool() const { return fd >= 0; }
};

Batch rawBatch(const std::string& path, int threads)
{
    size_t perThread = kRequestsPerBatch / static_cast<size_t>(threads);
    std::vector<std::shared_ptr<RawConnection>> opened;
    std::mutex mutex;
    Batch batch = runBatch(
        threads, perThread,
        [&] {
            auto connection = std::make_shared<RawConnection>();
            connection->fd = connectTo(path);
            std::lock_guard lock(mutex);
            opened.push_back(connection);
            return connection;
        },
        [](std::shared_ptr<RawConnection>& connection, uint64_t id) {
            setFrameId(connection->request, id);
            return writeAll(connection->fd, connection->request.data(), connection->request.size())
                && readFrame(connection->fd, connection->reply);
        });
    for (auto& connection : opened) {
        if (connection->fd >= 0)
            ::close(connection->fd);
    }
    return batch;
}

Batch clientBatch(int threads)
{
    size_t perThread = kRequestsPerBatch / static_cast<size_t>(threads);
    om::Value request = om::Value::dictionary({ { "request", "ping" }, { "version", 3u } });
    return runBatch(
        threads, perThread,
        [] {
            auto client = om::OMDaemonClient::initWithServiceName(kServiceName);
            // Connecting happens with the first request; keep it out of the timed loop.
            bool reached = client->sendSync(client->request("ping").build()).ok();
            return reached ? client : nullptr;
        },
        [&request](std::shared_ptr<om::OMDaemonClient>& client, uint64_t) { return client->sendSync(request).ok(); });
}

struct Environment {
    std::string root;
    std::unique_ptr<EchoServer> echo;
    std::unique_ptr<EchoServer> hopEcho;
    std::unique_ptr<BenchDaemon> daemon;
    std::map<std::string, std::string> summary;

    Environment()
    {
        std::string pattern = (std::filesystem::temp_directory_path() / "omd-bench-XXXXXX").string();
        root = ::mkdtemp(pattern.data()) ? pattern : std::string("/tmp");
        ::setenv("CONDUIT_DIR", (root + "/conduit").c_str(), 1);
        echo = std::make_unique<EchoServer>(root + "/echo.sock", nullptr);
        hopEcho = std::make_unique<EchoServer>(
            root + "/hop-echo.sock", om::WorkQueue::create("echo-hop", om::QualityOfService::UserInitiated));
        daemon = std::make_unique<BenchDaemon>(root, kServiceName);
    }

    ~Environment()
    {
        if (!summary.empty()) {
            std::fprintf(stderr,
                "\nround trip against the echo baseline (p50, p99: lower is better; "
                "throughput: higher is better)\n");
            for (const auto& [name, line] : summary)
                std::fprintf(stderr, "  %-28s %s\n", name.c_str(), line.c_str());
        }
        daemon.reset();
        hopEcho.reset();
        echo.reset();
        std::error_code ignored;
        std::filesystem::remove_all(root, ignored);
    }
};

Environment& environment()
{
    static Environment shared;
    return shared;
}

void report(benchmark::State& state, const std::string& name, Side& echo, Side& daemon, Side* hopEcho = nullptr)
{
    double echoP50 = echo.percentile(0.50), echoP99 = echo.percentile(0.99);
    double p50 = daemon.percentile(0.50), p99 = daemon.percentile(0.99);
    state.counters["echo_p50_us"] = echoP50;
    state.counters["p50_us"] = p50;
    state.counters["p99_us"] = p99;
    state.counters["p50_ratio"] = echoP50 > 0 ? p50 / echoP50 : 0;
    state.counters["p99_ratio"] = echoP99 > 0 ? p99 / echoP99 : 0;
    state.counters["tput_ratio"] = throughputRatio(daemon, echo);
    state.counters["req_per_s"] = daemon.throughput();

    char line[512];
    int length = std::snprintf(line, sizeof line,
        "p50 %.2fx (%.1f vs %.1f us)  p99 %.2fx (%.1f vs %.1f us)  throughput %.2fx (%.0f vs %.0f/s overall)",
        p50 / echoP50, p50, echoP50, p99 / echoP99, p99, echoP99, throughputRatio(daemon, echo), daemon.throughput(),
        echo.throughput());
    if (hopEcho && length > 0) {
        double hopP50 = hopEcho->percentile(0.50);
        state.counters["hop_echo_p50_us"] = hopP50;
        state.counters["hop_echo_tput_ratio"] = throughputRatio(*hopEcho, echo);
        std::snprintf(line + length, sizeof line - static_cast<size_t>(length),
            "\n  %-28s echo with one queue hop: p50 %.2fx (%.1f us)  p99 %.2fx  throughput %.2fx", "", hopP50 / echoP50,
            hopP50, hopEcho->percentile(0.99) / echoP99, throughputRatio(*hopEcho, echo));
    }
    environment().summary[name] = line;
}

void BM_RawRoundTrip(benchmark::State& state)
{
    Environment& env = environment();
    if (!env.daemon->running()) {
        state.SkipWithError("omd is not running");
        return;
    }
    int threads = static_cast<int>(state.range(0));
    (void)rawBatch(env.daemon->socketPath(), threads); // warm-up: threads, caches, daemon queues
    Side echo, hopEcho, daemon;
    for (auto _ : state) {
        Batch echoBatch = rawBatch(env.echo->path(), threads);
        Batch hopBatch = rawBatch(env.hopEcho->path(), threads);
        Batch daemonBatch = rawBatch(env.daemon->socketPath(), threads);
        if (echoBatch.failed || hopBatch.failed || daemonBatch.failed) {
            state.SkipWithError("a round trip failed");
            return;
        }
        state.SetIterationTime(daemonBatch.wallSeconds);
        echo.add(echoBatch);
        hopEcho.add(hopBatch);
        daemon.add(daemonBatch);
    }
    state.SetItemsProcessed(static_cast<int64_t>(daemon.micros.size()));
    report(state, "raw frames, " + std::to_string(threads) + " thread(s)", echo, daemon, &hopEcho);
}
BENCHMARK(BM_RawRoundTrip)
    ->ArgName("threads")
    ->Arg(1)
    ->Arg(4)
    ->Arg(16)
    ->Iterations(9)
    ->UseManualTime()
    ->Unit(benchmark::kMillisecond);

void BM_ClientLibraryRoundTrip(benchmark::State& state)
{
    Environment& env = environment();
    if (!env.daemon->running()) {
        state.SkipWithError("omd is not running");
        return;
    }
    int threads = static_cast<int>(state.range(0));
    (void)clientBatch(threads);
    Side echo, daemon;
    for (auto _ : state) {
        Batch echoBatch = rawBatch(env.echo->path(), threads);
        Batch daemonBatch = clientBatch(threads);
        if (echoBatch.failed || daemonBatch.failed) {
            state.SkipWithError("a round trip failed");
            return;
        }
        state.SetIterationTime(daemonBatch.wallSeconds);
        echo.add(echoBatch);
        daemon.add(daemonBatch);
    }
    state.SetItemsProcessed(static_cast<int64_t>(daemon.micros.size()));
    report(state, "OMDaemonClient, " + std::to_string(threads) + " thread(s)", echo, daemon);
}
BENCHMARK(BM_ClientLibraryRoundTrip)
    ->ArgName("threads")
    ->Arg(1)
    ->Arg(4)
    ->Iterations(9)
    ->UseManualTime()
    ->Unit(benchmark::kMillisecond);

} // namespace
