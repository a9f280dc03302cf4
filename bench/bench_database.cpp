// The daemon's plug-in database at scale, and registration end to end.
//
// findPlugIn, cached and uncached (a cache limit of 0 builds the record at every lookup), with
// 100,000 plug-ins registered against the same with 100: the ratio between the two populations
// must stay near 1. "add" of one plug-in through the real daemon against a bare SQLite insert with
// the same durability (WAL, synchronous=FULL), in the same run. And the resident memory each
// registered plug-in costs a running daemon.
#include <benchmark/benchmark.h>
#include <malloc.h>
#include <unistd.h>

#include <cstdio>
#include <map>

#include "Ombrel/OMDaemonClient.h"
#include "bench/BenchDaemon.h"
#include "bench/BenchPopulation.h"
#include "bench/BenchRatios.h"
#include "omd/OMDPlugIn.h"
#include "omd/OMDatabase.h"
#include "platform/Vlist.h"

#include <sqlite3.h>

namespace om::bench {
namespace {

constexpr size_t kSmall = 100;
constexpr size_t kLarge = 100'000;
constexpr int64_t kWorkingSet = 0;
constexpr int64_t kWholePopulation = 1;
constexpr int64_t kAdds = 200;

struct Footprint {
    double daemonPerPlugIn = 0; // resident set of a daemon started on the registrations, per plug-in
    double recordPerPlugIn = 0; // heap of one cached daemon record beyond the Registrar's
};
Footprint g_footprint;

// A population with a database over its workspace.
class Database {
public:
    explicit Database(size_t count)
        : m_population(count)
    {
        m_population.registerAll();
        RegistrarWorkspace::setDefaultWorkspace(m_population.workspace());
        m_database = OMDatabase::initWithDatabase(m_population.root() + "/annotations.vlist");
        if (!m_database)
            std::abort();
    }
    BenchPopulation& population() { return m_population; }
    OMDatabase& database() { return *m_database; }

private:
    BenchPopulation m_population;
    std::shared_ptr<OMDatabase> m_database;
};

Database& databaseOf(size_t count)
{
    static std::map<size_t, std::unique_ptr<Database>> databases;
    auto& entry = databases[count];
    if (!entry)
        entry = std::make_unique<Database>(count);
    return *entry;
}

size_t spanOf(const benchmark::State& state, size_t count)
{
    return state.range(1) == kWorkingSet ? std::min(count, kSmall) : count;
}

void findPlugIn(benchmark::State& state, uint32_t cacheLimit)
{
    Database& database = databaseOf(size_t(state.range(0)));
    database.database().setCacheLimit(cacheLimit);
    const auto& uuids = database.population().uuids();
    const size_t span = spanOf(state, uuids.size());
    size_t index = 0;
    for (auto _ : state) {
        auto plugIn = database.database().findPlugIn(uuids[index]);
        if (!plugIn)
            state.SkipWithError("no record");
        benchmark::DoNotOptimize(plugIn);
        index = (index + 7919) % span;
    }
}

void findPlugInCached(benchmark::State& state)
{
    findPlugIn(state, 1'000'000);
}

void findPlugInUncached(benchmark::State& state)
{
    findPlugIn(state, 0);
}

BENCHMARK(findPlugInCached)->ArgsProduct({ { kSmall, kLarge }, { kWorkingSet, kWholePopulation } });
BENCHMARK(findPlugInUncached)->ArgsProduct({ { kSmall, kLarge }, { kWorkingSet, kWholePopulation } });

// "add" of one new plug-in at a time through the real daemon, the reply awaited. Both this and the
// bare insert below write to the disk temporary files go to: on memory, durability costs nothing
// and the comparison would measure something else.
void addEndToEnd(benchmark::State& state)
{
    BenchPopulation bundles(size_t(kAdds) + 8, BenchPopulation::Medium::Disk);
    BenchDaemon daemon(bundles.root(), "com.orvex.bench.add",
        { "REGISTRAR_DB=" + bundles.root() + "/daemon.db", "OMD_GLOBAL_ANNOTATIONS=" + bundles.root() + "/global" });
    ::setenv("CONDUIT_DIR", (bundles.root() + "/conduit").c_str(), 1);
    auto client = OMDaemonClient::initWithServiceName("com.orvex.bench.add");
    size_t next = 0;
    for (auto _ : state) {
        const Value paths = Value::array({ Value::string(bundles.paths()[next++]) });
        auto reply = client->waitForReply([&](auto block) { client->addPlugIns(paths, block); });
        if (OMDaemonClient::errorInReply(reply))
            state.SkipWithError("add failed");
    }
}

// The same durability in SQLite alone: one row of the same size, committed in WAL mode with a full
// sync, per iteration.
void sqliteInsert(benchmark::State& state)
{
    BenchPopulation bundles(1, BenchPopulation::Medium::Disk);
    sqlite3* db = nullptr;
    if (sqlite3_open((bundles.root() + "/bare.db").c_str(), &db) != SQLITE_OK)
        std::abort();
    sqlite3_exec(db,
        "PRAGMA journal_mode=WAL; PRAGMA synchronous=FULL;"
        "CREATE TABLE plugins(uuid BLOB PRIMARY KEY, path TEXT UNIQUE, info BLOB)",
        nullptr, nullptr, nullptr);
    sqlite3_stmt* insert = nullptr;
    sqlite3_prepare_v2(db, "INSERT INTO plugins VALUES(?, ?, ?)", -1, &insert, nullptr);
    auto info = Vlist::readFile(bundles.paths().front() + "/Info.vlist");
    const std::vector<uint8_t> blob = Vlist::writeBinary(info.value());
    size_t next = 0;
    for (auto _ : state) {
        const Uuid uuid = Uuid::random();
        const std::string path = bundles.paths().front() + std::to_string(next++);
        sqlite3_bind_blob(insert, 1, uuid.bytes().data(), 16, SQLITE_TRANSIENT);
        sqlite3_bind_text(insert, 2, path.c_str(), int(path.size()), SQLITE_TRANSIENT);
        sqlite3_bind_blob(insert, 3, blob.data(), int(blob.size()), SQLITE_TRANSIENT);
        if (sqlite3_step(insert) != SQLITE_DONE)
            state.SkipWithError("insert failed");
        sqlite3_reset(insert);
    }
    sqlite3_finalize(insert);
    sqlite3_close(db);
}

BENCHMARK(addEndToEnd)->Iterations(kAdds)->Repetitions(3)->UseRealTime();
BENCHMARK(sqliteInsert)->Iterations(kAdds)->Repetitions(3)->UseRealTime();

// Resident memory of a daemon started on the large population's registrations, against one
// started on none, per registered plug-in.
void daemonMemory(benchmark::State& state)
{
    Database& large = databaseOf(kLarge);
    BenchPopulation empty(1);
    for (auto _ : state) {
        BenchDaemon withNone(empty.root(), "com.orvex.bench.none",
            { "REGISTRAR_DB=" + empty.root() + "/none.db", "OMD_GLOBAL_ANNOTATIONS=" + empty.root() + "/global" });
        BenchDaemon withAll(large.population().root(), "com.orvex.bench.all",
            { "REGISTRAR_DB=" + large.population().configuration().databasePath,
                "OMD_GLOBAL_ANNOTATIONS=" + large.population().root() + "/global" });
        g_footprint.daemonPerPlugIn
            = (double(withAll.residentBytes()) - double(withNone.residentBytes())) / double(kLarge);
    }
}

BENCHMARK(daemonMemory)->Iterations(1);

// The heap each cached daemon record adds to its Registrar record: a database that has built and
// cached the record of every registered plug-in, against one that has built none.
void recordMemory(benchmark::State& state)
{
    BenchPopulation population(kLarge);
    population.registerAll();
    RegistrarWorkspace::setDefaultWorkspace(population.workspace());
    for (auto _ : state) {
        auto database = OMDatabase::initWithDatabase(population.root() + "/records.vlist");
        database->setCacheLimit(1'000'000);
        ::malloc_trim(0);
        const size_t before = mallinfo2().uordblks;
        for (const Uuid& uuid : population.uuids()) {
            if (!database->findPlugIn(uuid))
                state.SkipWithError("no record");
        }
        ::malloc_trim(0);
        g_footprint.recordPerPlugIn = (double(mallinfo2().uordblks) - double(before)) / double(kLarge);
    }
}

BENCHMARK(recordMemory)->Iterations(1);

class DatabaseRatios : public RatioReporter {
protected:
    void printRatios() override
    {
        std::printf("\nratios (CPU time per operation, median)\n");
        for (const char* name : { "findPlugInCached", "findPlugInUncached" }) {
            for (auto [access, label] : { std::pair { kWorkingSet, "shared working set" },
                     std::pair { kWholePopulation, "whole population" } }) {
                const std::string suffix = "/" + std::to_string(access);
                const double large = median(std::string(name) + "/" + std::to_string(kLarge) + suffix);
                const double small = median(std::string(name) + "/" + std::to_string(kSmall) + suffix);
                if (large > 0 && small > 0)
                    std::printf("  %-20s %zu over %zu, %-20s %6.2f\n", name, kLarge, kSmall, label, large / small);
            }
        }
        const double add = realMedian("addEndToEnd/iterations:200/repeats:3/real_time");
        const double insert = realMedian("sqliteInsert/iterations:200/repeats:3/real_time");
        if (add > 0 && insert > 0)
            std::printf("  %-20s over a bare durable SQLite insert            %6.2f\n", "add end to end", add / insert);
        if (g_footprint.daemonPerPlugIn > 0)
            std::printf("\ndaemon resident set per registered plug-in (%zu): %.0f bytes\n", kLarge,
                g_footprint.daemonPerPlugIn);
        if (g_footprint.recordPerPlugIn > 0)
            std::printf("heap of a cached daemon record per plug-in: %.0f bytes\n", g_footprint.recordPerPlugIn);
    }
};

} // namespace
} // namespace om::bench

int main(int argc, char** argv)
{
    return om::bench::runWithRatios<om::bench::DatabaseRatios>(argc, argv);
}
