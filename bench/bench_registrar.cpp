// The Registrar at scale: lookups by UUID and by path, and a query that selects 10 plug-ins by
// extension point, with 100,000 plug-ins registered against the same with 100 (each figure is a
// ratio between the two populations of this one run: the indexes must keep them near 1), and how
// much memory each registered plug-in costs.
//
// Each operation runs twice: over one working set of 100 plug-ins (10 extension points) that both
// populations share, which isolates how the indexes scale, and striding through the whole
// population, where the larger one also pays a cache miss per pointer it follows.
//
// Bundles are made on the fastest temporary directory at hand (/dev/shm when writable) and
// registered in batches, one commit per batch.
#include <benchmark/benchmark.h>
#include <malloc.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>

#include "bench/BenchPopulation.h"
#include "bench/BenchRatios.h"
#include "platform/Registrar.h"
#include "platform/RegistrarBundleReader.h"
#include "platform/Vlist.h"

namespace om::bench {
namespace {

namespace fs = std::filesystem;

constexpr size_t kSmall = 100;
constexpr size_t kLarge = 100'000;
constexpr size_t kPerExtensionPoint = BenchPopulation::kPerExtensionPoint;

size_t residentBytes()
{
    std::ifstream statm("/proc/self/statm");
    size_t pages = 0;
    size_t resident = 0;
    statm >> pages >> resident;
    return resident * size_t(::sysconf(_SC_PAGESIZE));
}

size_t heapInUse()
{
    return mallinfo2().uordblks;
}

struct Footprint {
    double residentPerPlugIn = 0;
    double heapPerPlugIn = 0;
    double declaredPerPlugIn = 0; // the Info.vlist bytes each plug-in declares
    double dictionariesPerPlugIn = 0; // its canonical dictionaries alone
    double reopenedPerPlugIn = 0; // the heap a workspace opened on the registrations takes
};
Footprint g_footprint;

// The population of benchmarks with count plug-ins, with the memory its registration took.
class Population : public BenchPopulation {
public:
    explicit Population(size_t count)
        : BenchPopulation(count)
    {
        ::malloc_trim(0);
        const size_t residentBefore = residentBytes();
        const size_t heapBefore = heapInUse();
        registerAll();
        ::malloc_trim(0);
        if (count != kLarge)
            return;
        g_footprint.residentPerPlugIn = double(residentBytes() - residentBefore) / double(count);
        g_footprint.heapPerPlugIn = double(heapInUse() - heapBefore) / double(count);
        g_footprint.declaredPerPlugIn = double(declaredBytes()) / double(count);
        g_footprint.dictionariesPerPlugIn = dictionaryBytes() / double(count);
        g_footprint.reopenedPerPlugIn = reopenedBytes(configuration()) / double(count);
    }

    // The heap of a second workspace opened on the same database: what a restarted daemon holds.
    static double reopenedBytes(const RegistrarWorkspace::Configuration& configuration)
    {
        ::malloc_trim(0);
        const size_t before = heapInUse();
        auto reopened = RegistrarWorkspace::open(configuration, RegistrarWorkspace::Access::ReadOnly);
        if (!reopened.ok())
            std::abort();
        ::malloc_trim(0);
        return double(heapInUse() - before);
    }

    // The heap that the dictionaries of every record would take on their own: its canonical info and
    // plug-in dictionaries, sharing values with each other as records do.
    double dictionaryBytes() const
    {
        std::vector<Value> kept;
        kept.reserve(paths().size() * 2); // the vector itself is not counted
        const size_t before = heapInUse();
        for (const std::string& path : paths()) {
            auto info = RegistrarBundleReader::readInfo(path);
            auto facts = RegistrarBundleReader::plugInFacts(path, info.value(), Value(), {});
            kept.push_back(facts->infoDictionary);
            kept.push_back(facts->plugInDictionary);
        }
        return double(heapInUse() - before);
    }
};

Population& population(size_t count)
{
    static std::map<size_t, std::unique_ptr<Population>> populations;
    auto& entry = populations[count];
    if (!entry)
        entry = std::make_unique<Population>(count);
    return *entry;
}

constexpr int64_t kWorkingSet = 0;
constexpr int64_t kWholePopulation = 1;

// A fixed stride through the first `span` entries (the working set, or all of them), so that
// consecutive lookups touch unrelated entries.
size_t next(size_t index, size_t span)
{
    return (index + 7919) % span;
}

size_t spanOf(const benchmark::State& state, size_t count)
{
    return state.range(1) == kWorkingSet ? std::min(count, kSmall) : count;
}

// Looks keys up with lookup, striding through those the benchmark's access reaches.
template <typename Key, typename Lookup>
void lookUpEach(benchmark::State& state, const std::vector<Key>& keys, const Lookup& lookup)
{
    const size_t span = spanOf(state, keys.size());
    size_t index = 0;
    for (auto _ : state) {
        benchmark::DoNotOptimize(lookup(keys[index]));
        index = next(index, span);
    }
}

void lookupByUuid(benchmark::State& state)
{
    Population& plugIns = population(size_t(state.range(0)));
    lookUpEach(state, plugIns.uuids(), [&](const Uuid& uuid) { return plugIns.workspace()->plugInWithUuid(uuid); });
}

void lookupByPath(benchmark::State& state)
{
    Population& plugIns = population(size_t(state.range(0)));
    lookUpEach(
        state, plugIns.paths(), [&](const std::string& path) { return plugIns.workspace()->plugInAtPath(path); });
}

void queryByExtensionPoint(benchmark::State& state)
{
    Population& plugIns = population(size_t(state.range(0)));
    const size_t points = spanOf(state, plugIns.paths().size()) / kPerExtensionPoint;
    std::vector<Value> rules;
    for (size_t point = 0; point < points; ++point)
        rules.push_back(Value::dictionary(
            { { "QSExtensionPointIdentifier", Value(Population::pointOf(point * kPerExtensionPoint)) } }));
    const RegistrarWorkspace::CandidateFilter keepAll = [](const std::string&, const Value&) { return true; };
    size_t index = 0;
    for (auto _ : state) {
        auto selected = plugIns.workspace()->query(rules[index], keepAll);
        if (selected.size() != kPerExtensionPoint)
            state.SkipWithError("the query did not select 10 plug-ins");
        benchmark::DoNotOptimize(selected);
        index = next(index, rules.size());
    }
}

BENCHMARK(lookupByUuid)->ArgsProduct({ { kSmall, kLarge }, { kWorkingSet, kWholePopulation } });
BENCHMARK(lookupByPath)->ArgsProduct({ { kSmall, kLarge }, { kWorkingSet, kWholePopulation } });
BENCHMARK(queryByExtensionPoint)->ArgsProduct({ { kSmall, kLarge }, { kWorkingSet, kWholePopulation } });

// Prints, after the table, each operation's cost at 100,000 plug-ins over its cost at 100, and the
// memory each plug-in took.
class ScaleRatios : public RatioReporter {
protected:
    void printRatios() override
    {
        std::printf(
            "\nratios, %zu plug-ins over %zu (CPU time per operation, median of the repetitions)\n", kLarge, kSmall);
        for (const char* name : { "lookupByUuid", "lookupByPath", "queryByExtensionPoint" }) {
            for (auto [access, label] : { std::pair { kWorkingSet, "shared working set" },
                     std::pair { kWholePopulation, "whole population" } }) {
                const std::string suffix = "/" + std::to_string(access);
                const double large = median(std::string(name) + "/" + std::to_string(kLarge) + suffix);
                const double small = median(std::string(name) + "/" + std::to_string(kSmall) + suffix);
                if (large > 0 && small > 0)
                    std::printf("  %-24s %-20s %6.2f\n", name, label, large / small);
            }
        }
        if (g_footprint.heapPerPlugIn > 0) {
            std::printf("\nmemory per registered plug-in, over %zu registrations\n", kLarge);
            std::printf("  %-40s %8.0f bytes\n", "resident set growth", g_footprint.residentPerPlugIn);
            std::printf("  %-40s %8.0f bytes\n", "heap in use", g_footprint.heapPerPlugIn);
            std::printf("  %-40s %8.0f bytes\n", "heap of a workspace reopened on them", g_footprint.reopenedPerPlugIn);
            std::printf("  %-40s %8.0f bytes\n", "its dictionaries alone", g_footprint.dictionariesPerPlugIn);
            std::printf("  %-40s %8.0f bytes\n", "reopened heap beyond the dictionaries",
                g_footprint.reopenedPerPlugIn - g_footprint.dictionariesPerPlugIn);
            std::printf("  %-40s %8.0f bytes\n", "its Info.vlist (XML, for scale)", g_footprint.declaredPerPlugIn);
        }
    }
};

} // namespace
} // namespace om::bench

int main(int argc, char** argv)
{
    return om::bench::runWithRatios<om::bench::ScaleRatios>(argc, argv);
}
