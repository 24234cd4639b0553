// Shared part of the in-process benchmarks (Google Benchmark): a console reporter that
// also keeps every repetition's real time per iteration, so that main can print the ratio
// of a library reader to its baseline measured in the same run, and the sandbox guard.
#ifndef KYTO_BENCH_RATIO_H
#define KYTO_BENCH_RATIO_H

#include <stdio.h>
#include <unistd.h>

#include <algorithm>
#include <map>
#include <string>
#include <vector>

#include <benchmark/benchmark.h>

namespace kytobench {

class RatioReporter : public benchmark::ConsoleReporter {
  public:
    RatioReporter() : ConsoleReporter(OO_Tabular) {}

    void ReportRuns(const std::vector<Run>& runs) override {
        ConsoleReporter::ReportRuns(runs);
        for (const Run& run : runs) {
            if (run.run_type == Run::RT_Iteration && !run.error_occurred) {
                real_[run.run_name.function_name].push_back(run.GetAdjustedRealTime());
                cpu_[run.run_name.function_name].push_back(run.GetAdjustedCPUTime());
            }
        }
    }

    // Median real (or CPU) time per iteration of the benchmark registered under name, in
    // its own time unit; negative when it did not run (filtered out or failed).
    double Median(const std::string& name) const { return MedianOf(real_, name); }
    double MedianCpu(const std::string& name) const { return MedianOf(cpu_, name); }

  private:
    using Times = std::map<std::string, std::vector<double>>;

    static double MedianOf(const Times& times, const std::string& name) {
        auto it = times.find(name);
        if (it == times.end() || it->second.empty())
            return -1.0;
        std::vector<double> v = it->second;
        std::sort(v.begin(), v.end());
        size_t n = v.size();
        return n % 2 ? v[n / 2] : (v[n / 2 - 1] + v[n / 2]) / 2.0;
    }

    Times real_;
    Times cpu_;
};

// The library works on the appliance's fixed paths: only ever inside the test sandbox.
inline bool InsideSandbox(const char* program) {
    if (access("/.kyto-sandbox", F_OK) == 0)
        return true;
    fprintf(stderr, "%s: run it through build-bench/tests/kyto-sandbox only\n", program);
    return false;
}

// Runs the registered benchmarks with the defaults of these programs (5 repetitions,
// interleaved at random so that a slow moment of the machine hits both sides of a
// ratio); arguments given on the command line come after the defaults and win.
inline void RunWithDefaults(int argc, char** argv, RatioReporter& reporter) {
    std::vector<std::string> store = {argv[0], "--benchmark_repetitions=5",
                                      "--benchmark_enable_random_interleaving=true"};
    for (int i = 1; i < argc; ++i)
        store.push_back(argv[i]);
    std::vector<char*> args;
    for (std::string& s : store)
        args.push_back(&s[0]);
    int count = static_cast<int>(args.size());
    args.push_back(nullptr);
    benchmark::Initialize(&count, args.data());
    benchmark::RunSpecifiedBenchmarks(&reporter);
    benchmark::Shutdown();
}

}  // namespace kytobench

#endif
