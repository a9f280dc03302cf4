// vlist throughput in both forms, parse and write, on a plug-in's Info dictionary and on the
// annotation table the daemon persists. Bytes per second count the encoded form.
#include <benchmark/benchmark.h>

#include <span>
#include <string>
#include <vector>

#include "bench/BenchValues.h"
#include "platform/Vlist.h"

namespace om::bench {
namespace {

std::span<const uint8_t> bytesOf(const std::string& text)
{
    return { reinterpret_cast<const uint8_t*>(text.data()), text.size() };
}

void countBytes(benchmark::State& state, size_t perIteration)
{
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * perIteration));
}

void requireParses(benchmark::State& state, const Result<Value>& result)
{
    if (!result.ok())
        state.SkipWithError(result.error().localizedDescription().c_str());
}

void writeXml(benchmark::State& state, const Value& value)
{
    size_t size = 0;
    for (auto _ : state) {
        std::string xml = Vlist::writeXml(value);
        size = xml.size();
        benchmark::DoNotOptimize(xml.data());
    }
    countBytes(state, size);
}

void parseXml(benchmark::State& state, const Value& value)
{
    const std::string xml = Vlist::writeXml(value);
    requireParses(state, Vlist::parse(xml));
    for (auto _ : state) {
        auto parsed = Vlist::parse(bytesOf(xml));
        benchmark::DoNotOptimize(parsed);
    }
    countBytes(state, xml.size());
}

void writeBinary(benchmark::State& state, const Value& value)
{
    size_t size = 0;
    for (auto _ : state) {
        std::vector<uint8_t> bytes = Vlist::writeBinary(value);
        size = bytes.size();
        benchmark::DoNotOptimize(bytes.data());
    }
    countBytes(state, size);
}

void parseBinary(benchmark::State& state, const Value& value)
{
    const std::vector<uint8_t> bytes = Vlist::writeBinary(value);
    requireParses(state, Vlist::parse(bytes));
    for (auto _ : state) {
        auto parsed = Vlist::parse(bytes);
        benchmark::DoNotOptimize(parsed);
    }
    countBytes(state, bytes.size());
}

BENCHMARK_CAPTURE(writeXml, pluginInfo, pluginInfoDictionary());
BENCHMARK_CAPTURE(parseXml, pluginInfo, pluginInfoDictionary());
BENCHMARK_CAPTURE(writeBinary, pluginInfo, pluginInfoDictionary());
BENCHMARK_CAPTURE(parseBinary, pluginInfo, pluginInfoDictionary());
BENCHMARK_CAPTURE(writeXml, annotations1000, annotationTable(1000));
BENCHMARK_CAPTURE(parseXml, annotations1000, annotationTable(1000));
BENCHMARK_CAPTURE(writeBinary, annotations1000, annotationTable(1000));
BENCHMARK_CAPTURE(parseBinary, annotations1000, annotationTable(1000));

} // namespace
} // namespace om::bench
