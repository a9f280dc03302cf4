// Discovery and annotations through the real daemon, as ratios taken in one run.
//
// "match" with a rule on the extension point that selects 10 plug-ins, with 100,000 plug-ins
// registered against 1,000: the ratio must stay near 1. "match" answering with 1,000 plug-ins
// against a Conduit service in this process that answers with a reply of the same bytes: what
// discovery adds to the transport. "annotate" of one election against the bare atomic write of the
// same file (write, fsync, rename, fsync of the directory), with 1 and with 10,000 annotations
// stored: how the whole-file save grows.
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <unistd.h>

#include <cstdio>
#include <fstream>
#include <map>
#include <sstream>

#include "Ombrel/OMDaemonClient.h"
#include "bench/BenchDaemon.h"
#include "bench/BenchPopulation.h"
#include "bench/BenchRatios.h"
#include "platform/Conduit.h"
#include "platform/ConduitMessageEncoding.h"
#include "platform/Vlist.h"

namespace om::bench {
namespace {

constexpr size_t kSmall = 1'000;
constexpr size_t kLarge = 100'000;
constexpr size_t kPointsAsked = 100;

// A registered population with the real daemon serving it under its own name.
class Served {
public:
    Served(size_t count, BenchPopulation::Medium medium, const std::string& name, const Value& annotations = Value())
        : m_population(count, medium)
    {
        m_population.registerAll();
        const std::string annotationPath = m_population.root() + "/global-annotations";
        if (!annotations.isNone())
            std::ofstream(annotationPath) << Vlist::writeXml(annotations);
        m_daemon = std::make_unique<BenchDaemon>(m_population.root(), name,
            std::vector<std::string> { "REGISTRAR_DB=" + m_population.configuration().databasePath,
                "OMD_GLOBAL_ANNOTATIONS=" + annotationPath });
        ::setenv("CONDUIT_DIR", (m_population.root() + "/conduit").c_str(), 1);
        m_client = OMDaemonClient::initWithServiceName(name.c_str());
    }

    BenchPopulation& population() { return m_population; }
    OMDaemonClient& client() { return *m_client; }
    std::string annotationPath() const { return m_population.root() + "/global-annotations"; }

    Result<Value> match(const Value& rules)
    {
        return m_client->waitForReply([&](auto block) { m_client->matchPlugIns(rules, 0, block); });
    }

private:
    BenchPopulation m_population;
    std::unique_ptr<BenchDaemon> m_daemon;
    std::shared_ptr<OMDaemonClient> m_client;
};

Served& servedOf(size_t count)
{
    static std::map<size_t, std::unique_ptr<Served>> served;
    auto& entry = served[count];
    if (!entry)
        entry = std::make_unique<Served>(
            count, BenchPopulation::Medium::Memory, "com.orvex.bench.match" + std::to_string(count));
    return *entry;
}

size_t matchCount(const Result<Value>& reply)
{
    if (!reply.ok())
        return 0;
    auto matches = ConduitMessageEncoding::decode(reply.value()["matches"]);
    return matches ? matches->elements().size() : 0;
}

Value pointRule(size_t point)
{
    return Value::dictionary({ { "QSExtensionPointIdentifier",
        Value(BenchPopulation::pointOf(point * BenchPopulation::kPerExtensionPoint)) } });
}

void matchTen(benchmark::State& state)
{
    Served& served = servedOf(size_t(state.range(0)));
    for (size_t point = 0; point < kPointsAsked; ++point) { // every record of the working set built once
        if (matchCount(served.match(pointRule(point))) != BenchPopulation::kPerExtensionPoint)
            return state.SkipWithError("a rule did not select 10 plug-ins");
    }
    size_t point = 0;
    for (auto _ : state) {
        benchmark::DoNotOptimize(served.match(pointRule(point)));
        point = (point + 1) % kPointsAsked;
    }
}
BENCHMARK(matchTen)->Arg(kSmall)->Arg(kLarge)->Repetitions(3)->UseRealTime();

// The reply "match" gives for every plug-in of the small population, kept for the echo below.
Value g_thousandReply;

void matchThousand(benchmark::State& state)
{
    Served& served = servedOf(kSmall);
    auto reply = served.match(Value());
    if (matchCount(reply) != kSmall)
        return state.SkipWithError("match did not return every plug-in");
    g_thousandReply = reply.value();
    for (auto _ : state)
        benchmark::DoNotOptimize(served.match(Value()));
}
BENCHMARK(matchThousand)->Repetitions(3)->UseRealTime();

// A Conduit service in this process that answers every request with the same reply at once.
class ReplyService {
public:
    ReplyService(const std::string& name, Value reply)
        : m_queue(WorkQueue::create("bench.reply"))
    {
        auto listener = ConduitListener::create(name, m_queue);
        if (!listener.ok())
            std::abort();
        m_listener = listener.value();
        m_listener->setConnectionHandler([this, reply](std::shared_ptr<ConduitConnection> connection) {
            std::weak_ptr<ConduitConnection> weak = connection;
            connection->setEventHandler([weak, reply](const ConduitEvent& event) {
                if (auto peer = weak.lock(); peer && event.expectsReply())
                    peer->sendReply(event.requestId, reply);
            });
            connection->resume();
            m_connections.push_back(std::move(connection));
        });
        m_listener->resume();
    }
    ~ReplyService() { m_listener->cancel(); }

private:
    std::shared_ptr<WorkQueue> m_queue;
    std::shared_ptr<ConduitListener> m_listener;
    std::vector<std::shared_ptr<ConduitConnection>> m_connections;
};

void echoThousand(benchmark::State& state)
{
    if (g_thousandReply.isNone())
        return state.SkipWithError("run matchThousand first");
    servedOf(kSmall); // the same CONDUIT_DIR
    ReplyService service("com.orvex.bench.echo", g_thousandReply);
    auto client = OMDaemonClient::initWithServiceName("com.orvex.bench.echo");
    const Value request = client->request("match").build();
    for (auto _ : state)
        benchmark::DoNotOptimize(client->sendSync(request));
}
BENCHMARK(echoThousand)->Repetitions(3)->UseRealTime();

// An annotation database holding count entries, the first for the plug-in the benchmark elects.
Value annotationsFor(const std::string& first, size_t count)
{
    std::vector<Value::Entry> data;
    data.emplace_back(first, Value::dictionary({ { "election", 0 } }));
    for (size_t i = 1; i < count; ++i)
        data.emplace_back("com.orvex.bench.other" + std::to_string(i),
            Value::dictionary({ { "election", 1 },
                { "extension", Value::dictionary({ { "colour", "blue" }, { "rank", int64_t(i) } }) } }));
    return Value::dictionary({ { "version", 16 }, { "data", Value::dictionary(std::move(data)) } });
}

std::map<int64_t, std::string> g_savedFiles; // annotation count -> the file as the daemon saved it

void annotate(benchmark::State& state)
{
    const size_t count = size_t(state.range(0));
    Served served(1, BenchPopulation::Medium::Disk, "com.orvex.bench.annotate" + std::to_string(count),
        annotationsFor("com.orvex.bench.plugin0", count));
    const Uuid uuid = served.population().uuids().front();
    int64_t election = 0;
    for (auto _ : state) {
        const Value change = Value::dictionary({ { "election", ++election % 2 } });
        auto reply = served.client().waitForReply(
            [&](auto block) { served.client().setPluginAnnotations({ uuid }, change, block); });
        if (OMDaemonClient::errorInReply(reply))
            return state.SkipWithError("annotate failed");
    }
    std::ifstream file(served.annotationPath());
    std::stringstream bytes;
    bytes << file.rdbuf();
    g_savedFiles[state.range(0)] = bytes.str();
    state.counters["file_bytes"] = double(g_savedFiles[state.range(0)].size());
}
BENCHMARK(annotate)->Arg(1)->Arg(10'000)->Iterations(100)->Repetitions(3)->UseRealTime();

// The save alone: the same bytes written as a whole file, durably, on the same disk.
void bareAtomicWrite(benchmark::State& state)
{
    const std::string& bytes = g_savedFiles[state.range(0)];
    if (bytes.empty())
        return state.SkipWithError("run annotate first");
    BenchPopulation place(1, BenchPopulation::Medium::Disk);
    const std::string path = place.root() + "/annotations.vlist";
    const std::string temporary = path + ".tmp";
    for (auto _ : state) {
        const int fd = ::open(temporary.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
        const int directory = ::open(place.root().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
        const bool written = fd >= 0 && directory >= 0
            && writeAll(fd, reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size()) && ::fsync(fd) == 0
            && ::rename(temporary.c_str(), path.c_str()) == 0 && ::fsync(directory) == 0;
        ::close(fd);
        ::close(directory);
        if (!written)
            return state.SkipWithError("write failed");
    }
}
BENCHMARK(bareAtomicWrite)->Arg(1)->Arg(10'000)->Iterations(100)->Repetitions(3)->UseRealTime();

class DiscoveryRatios : public RatioReporter {
protected:
    void printRatios() override
    {
        std::printf("\nratios (wall-clock time per operation, median of the repetitions)\n");
        const auto ratio = [&](const std::string& top, const std::string& bottom) {
            const double a = realMedian(top), b = realMedian(bottom);
            return a > 0 && b > 0 ? a / b : 0.0;
        };
        std::printf("  match selecting 10, %zu over %zu plug-ins:      %6.2f\n", kLarge, kSmall,
            ratio("matchTen/100000/repeats:3/real_time", "matchTen/1000/repeats:3/real_time"));
        std::printf("  match returning %zu against the same reply echoed: %6.2f\n", kSmall,
            ratio("matchThousand/repeats:3/real_time", "echoThousand/repeats:3/real_time"));
        for (const char* count : { "1", "10000" }) {
            std::printf("  annotate against a bare atomic write, %5s stored:  %6.2f\n", count,
                ratio(std::string("annotate/") + count + "/iterations:100/repeats:3/real_time",
                    std::string("bareAtomicWrite/") + count + "/iterations:100/repeats:3/real_time"));
        }
        std::printf("  annotate, 10000 stored against 1 stored:           %6.2f\n",
            ratio(
                "annotate/10000/iterations:100/repeats:3/real_time", "annotate/1/iterations:100/repeats:3/real_time"));
    }
};

} // namespace
} // namespace om::bench

int main(int argc, char** argv)
{
    return om::bench::runWithRatios<om::bench::DiscoveryRatios>(argc, argv);
}
