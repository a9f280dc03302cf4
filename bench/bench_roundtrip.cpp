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
#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <time.h>
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
#include "platform/Cbor.h"

extern char** environ;

namespace {

using Clock = std::chrono::steady_clock;

constexpr const char* kServiceName = "com.orvex.bench.roundtrip";
constexpr size_t kRequestsPerBatch = 4000;
constexpr size_t kHeaderSize = 13;

bool writeAll(int fd, const uint8_t* bytes, size_t size)
{
    while (size > 0) {
        ssize_t count = ::write(fd, bytes, size);
        if (count < 0 && errno == EINTR)
            continue;
        if (count <= 0)
            return false;
        bytes += count;
        size -= static_cast<size_t>(count);
    }
    return true;
}

bool readAll(int fd, uint8_t* bytes, size_t size)
{
    while (size > 0) {
        ssize_t count = ::read(fd, bytes, size);
        if (count < 0 && errno == EINTR)
            continue;
        if (count <= 0)
            return false;
        bytes += count;
        size -= static_cast<size_t>(count);
    }
    return true;
}

uint32_t lengthOf(const uint8_t* header)
{
    return static_cast<uint32_t>(header[0]) | static_cast<uint32_t>(header[1]) << 8
        | static_cast<uint32_t>(header[2]) << 16 | static_cast<uint32_t>(header[3]) << 24;
}

// Reads one whole frame into buffer (header included).
bool readFrame(int fd, std::vector<uint8_t>& buffer)
{
    buffer.resize(kHeaderSize);
    if (!readAll(fd, buffer.data(), kHeaderSize))
        return false;
    uint32_t length = lengthOf(buffer.data());
    if (length < 9 || length > 9 + (16u << 20))
        return false;
    buffer.resize(4 + length);
    return readAll(fd, buffer.data() + kHeaderSize, length - 9);
}

int connectTo(const std::string& path)
{
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
    if (fd >= 0 && ::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0)
        return fd;
    if (fd >= 0)
        ::close(fd);
    return -1;
}

// A request frame for "ping", version 3; the id is patched per request.
std::vector<uint8_t> pingFrame()
{
    auto payload = om::Cbor::encode(om::Value::dictionary({ { "request", "ping" }, { "version", 3u } }));
    uint32_t length = static_cast<uint32_t>(9 + payload.size());
    std::vector<uint8_t> frame = { static_cast<uint8_t>(length), static_cast<uint8_t>(length >> 8),
        static_cast<uint8_t>(length >> 16), static_cast<uint8_t>(length >> 24), 2 };
    frame.resize(kHeaderSize, 0);
    frame.insert(frame.end(), payload.begin(), payload.end());
    return frame;
}

void setId(std::vector<uint8_t>& frame, uint64_t id)
{
    for (int i = 0; i < 8; ++i)
        frame[5 + static_cast<size_t>(i)] = static_cast<uint8_t>(id >> (8 * i));
}

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

std::string daemonBinary()
{
    if (const char* path = ::getenv("OMD_BINARY"))
        return path;
    std::error_code error;
    auto self = std::filesystem::read_symlink("/proc/self/exe", error);
    return (self.parent_path().parent_path() / "omd" / "omd").string();
}

// The real daemon on a private directory, asked to stop when the benchmark ends (and killed by
// the kernel should the benchmark die first).
class Daemon {
public:
    explicit Daemon(const std::string& root)
    {
        std::string conduit = root + "/conduit";
        std::filesystem::create_directories(conduit);
        m_socketPath = conduit + "/" + kServiceName;

        std::vector<std::string> settings = {
            "CONDUIT_DIR=" + conduit,
            "HOME=" + root + "/home",
            "XDG_RUNTIME_DIR=" + root + "/runtime",
            "XDG_DATA_HOME=" + root + "/data",
            "XDG_CONFIG_HOME=" + root + "/config",
            "REGISTRAR_DB=" + root + "/registrar.db",
            "REGISTRAR_SDK_DIR=" + root + "/sdk",
            "REGISTRAR_CONTAINERS=" + root + "/containers",
            "CONSENT_DB=" + root + "/consent.db",
            "PREFS_DIR=" + root + "/prefs",
            "SANDBOX_KEY=" + root + "/sandbox.key",
        };
        for (char** entry = environ; *entry; ++entry) {
            std::string_view name(*entry);
            name = name.substr(0, name.find('='));
            bool ours = std::any_of(settings.begin(), settings.end(),
                [&](const std::string& setting) { return setting.starts_with(std::string(name) + "="); });
            if (!ours)
                settings.emplace_back(*entry);
        }
        std::string binary = daemonBinary();
        std::vector<std::string> arguments = { binary, "-S", kServiceName };
        std::vector<char*> argv, envp;
        for (auto& argument : arguments)
            argv.push_back(argument.data());
        argv.push_back(nullptr);
        for (auto& setting : settings)
            envp.push_back(setting.data());
        envp.push_back(nullptr);
        std::string logPath = root + "/omd.log";
        int log = ::open(logPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);

        m_pid = ::fork();
        if (m_pid == 0)
            runChild(argv.data(), envp.data(), log);
        if (log >= 0)
            ::close(log);
        if (m_pid < 0 || !waitForSocket())
            std::fprintf(stderr, "cannot start %s (see %s)\n", binary.c_str(), logPath.c_str());
    }

    ~Daemon()
    {
        if (m_pid <= 0)
            return;
        ::kill(m_pid, SIGTERM);
        int status;
        ::waitpid(m_pid, &status, 0);
    }

    const std::string& socketPath() const { return m_socketPath; }
    bool running() const { return m_running; }

private:
    [[noreturn]] static void runChild(char** argv, char** envp, int log)
    {
        ::prctl(PR_SET_PDEATHSIG, SIGKILL);
        if (log >= 0) {
            ::dup2(log, 1);
            ::dup2(log, 2);
        }
        ::execve(argv[0], argv, envp);
        ::_exit(127);
    }

    // Polls: a benchmark may wait, and the daemon gives no other sign of readiness.
    bool waitForSocket()
    {
        for (int attempt = 0; attempt < 1000; ++attempt) {
            int fd = connectTo(m_socketPath);
            if (fd >= 0) {
                ::close(fd);
                m_running = true;
                return true;
            }
            int status;
            if (::waitpid(m_pid, &status, WNOHANG) == m_pid) {
                m_pid = -1;
                return false;
            }
            timespec pause = { 0, 10'000'000 };
            ::nanosleep(&pause, nullptr);
        }
        return false;
    }

    std::string m_socketPath;
    pid_t m_pid = -1;
    bool m_running = false;
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
            setId(connection->request, id);
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
    std::unique_ptr<Daemon> daemon;
    std::map<std::string, std::string> summary;

    Environment()
    {
        std::string pattern = (std::filesystem::temp_directory_path() / "omd-bench-XXXXXX").string();
        root = ::mkdtemp(pattern.data()) ? pattern : std::string("/tmp");
        ::setenv("CONDUIT_DIR", (root + "/conduit").c_str(), 1);
        echo = std::make_unique<EchoServer>(root + "/echo.sock", nullptr);
        hopEcho = std::make_unique<EchoServer>(
            root + "/hop-echo.sock", om::WorkQueue::create("echo-hop", om::QualityOfService::UserInitiated));
        daemon = std::make_unique<Daemon>(root);
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
