// A console reporter that keeps each benchmark's CPU time per operation, so that a program can
// print, after the table, the ratios its question rests on, all from the one run; and the main()
// that runs a program's benchmarks through such a reporter.
#pragma once

#include <benchmark/benchmark.h>

#include <algorithm>
#include <map>
#include <string>
#include <vector>

namespace om::bench {

class RatioReporter : public benchmark::ConsoleReporter {
public:
    void ReportRuns(const std::vector<Run>& runs) override
    {
        for (const auto& run : runs) {
            if (run.run_type == Run::RT_Iteration && run.iterations > 0) {
                m_seconds[run.run_name.str()].push_back(run.cpu_accumulated_time / static_cast<double>(run.iterations));
                m_realSeconds[run.run_name.str()].push_back(
                    run.real_accumulated_time / static_cast<double>(run.iterations));
            } else if (run.run_type == Run::RT_Aggregate && run.aggregate_name == "median")
                m_medians[run.run_name.str()] = run.GetAdjustedCPUTime() * 1e-9; // aggregates only
        }
        ConsoleReporter::ReportRuns(runs);
    }

    void Finalize() override
    {
        printRatios();
        ConsoleReporter::Finalize();
    }

protected:
    virtual void printRatios() = 0;

    // Wall-clock seconds per operation, median of the repetitions: for work that waits (on the
    // disk, on another process) rather than computes. 0 when it did not run.
    double realMedian(const std::string& name)
    {
        auto it = m_realSeconds.find(name);
        if (it == m_realSeconds.end())
            return 0;
        auto& samples = it->second;
        std::sort(samples.begin(), samples.end());
        return samples[samples.size() / 2];
    }

    // CPU seconds per operation of the named benchmark, median of its repetitions; 0 when it did
    // not run.
    double median(const std::string& name)
    {
        auto it = m_seconds.find(name);
        if (it == m_seconds.end()) {
            auto median = m_medians.find(name);
            return median == m_medians.end() ? 0 : median->second;
        }
        auto& samples = it->second;
        std::sort(samples.begin(), samples.end());
        return samples[samples.size() / 2];
    }

private:
    std::map<std::string, std::vector<double>> m_seconds;
    std::map<std::string, std::vector<double>> m_realSeconds;
    std::map<std::string, double> m_medians; // when only aggregates were reported
};

template <typename Reporter> int runWithRatios(int argc, char** argv)
{
    benchmark::Initialize(&argc, argv);
    if (benchmark::ReportUnrecognizedArguments(argc, argv))
        return 1;
    Reporter reporter;
    benchmark::RunSpecifiedBenchmarks(&reporter);
    benchmark::Shutdown();
    return 0;
}

} // namespace om::bench
