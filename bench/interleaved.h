// Contender and baseline of a pair run in interleaved rounds in one program,
// so that drifts of the machine hit both; the summary is the ratio's
// min / median / max over the rounds.
#ifndef NXBASE_BENCH_INTERLEAVED_H_
#define NXBASE_BENCH_INTERLEAVED_H_

#include <benchmark/benchmark.h>
#include <sched.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <fstream>
#include <functional>
#include <map>
#include <string>
#include <vector>

namespace nxbench {

// Keeps every run's real time per iteration and item rate by name, and
// prints the runs as the console reporter does.
class RoundReporter : public benchmark::ConsoleReporter {
  public:
    void ReportRuns(const std::vector<Run>& runs) override {
        for (const Run& run : runs) {
            times_[run.benchmark_name()] = run.GetAdjustedRealTime();
            auto items = run.counters.find("items_per_second");
            if (items != run.counters.end()) rates_[run.benchmark_name()] = items->second;
        }
        ConsoleReporter::ReportRuns(runs);
    }
    double Time(const std::string& name) const { return Find(times_, name); }
    double Rate(const std::string& name) const { return Find(rates_, name); }

  private:
    static double Find(const std::map<std::string, double>& values, const std::string& name) {
        auto at = values.find(name);
        return at == values.end() ? 0.0 : at->second;
    }
    std::map<std::string, double> times_;
    std::map<std::string, double> rates_;
};

// "<pair>/<side>/<variant>/round:<n>", the name a run is registered under.
inline std::string RoundName(const std::string& pair, const char* side, const std::string& variant,
                             int round) {
    return pair + "/" + side + "/" + variant + "/round:" + std::to_string(round);
}

// As the library reports a run registered with UseRealTime().
inline std::string RealTimeName(const std::string& registered) {
    return registered + "/real_time";
}

// Prints "<label> min / median / max" of the ratios; nothing when none was
// measured (a filtered run).
inline void PrintSpread(const std::string& label, std::vector<double> ratios) {
    if (ratios.empty()) return;
    std::sort(ratios.begin(), ratios.end());
    std::printf("  %-52s %.2f / %.2f / %.2f\n", label.c_str(), ratios.front(),
                ratios[ratios.size() / 2], ratios.back());
}

// Pins the calling thread (and the threads it starts later) to CPUs
// first..first+count-1; count 0 lets it run anywhere.
inline void PinToCpus(int first, int count) {
    cpu_set_t set;
    CPU_ZERO(&set);
    const int last = count > 0 ? first + count : CPU_SETSIZE;
    for (int cpu = count > 0 ? first : 0; cpu < last; ++cpu) CPU_SET(cpu, &set);
    sched_setaffinity(0, sizeof set, &set);
}

// Pins to `cpu`, or lets the thread run anywhere for -1.
inline void PinTo(int cpu) {
    cpu >= 0 ? PinToCpus(cpu, 1) : PinToCpus(0, 0);
}

// A contender and its baseline, run one after the other in every round.
// The ratio is contender / baseline of items per second (rates) or of real
// time per iteration.
struct Pair {
    std::string name;
    std::function<void(benchmark::State&)> baseline;
    std::function<void(benchmark::State&)> contender;
    bool rates = true;
};

inline std::string PairRun(const Pair& pair, const char* side, int round) {
    return RoundName(pair.name, side, "run", round);
}

// Registers every pair once per round, rounds outermost, as real-time runs.
inline void RegisterRounds(const std::vector<Pair>& pairs, int rounds) {
    for (int round = 1; round <= rounds; ++round) {
        for (const Pair& pair : pairs) {
            benchmark::RegisterBenchmark(PairRun(pair, "baseline", round).c_str(), pair.baseline)
                ->UseRealTime();
            benchmark::RegisterBenchmark(PairRun(pair, "contender", round).c_str(), pair.contender)
                ->UseRealTime();
        }
    }
}

// The ratio of one pair in each round that measured both sides.
inline std::vector<double> PairRatios(const RoundReporter& reporter, const Pair& pair, int rounds) {
    std::vector<double> ratios;
    for (int round = 1; round <= rounds; ++round) {
        const std::string base = RealTimeName(PairRun(pair, "baseline", round));
        const std::string contender = RealTimeName(PairRun(pair, "contender", round));
        const double a = pair.rates ? reporter.Rate(contender) : reporter.Time(contender);
        const double b = pair.rates ? reporter.Rate(base) : reporter.Time(base);
        if (a > 0 && b > 0) ratios.push_back(a / b);
    }
    return ratios;
}

// The ratio of two pairs' contenders in each round (e.g. two threads
// against one), rates.
inline std::vector<double> ContenderRatios(const RoundReporter& reporter, const Pair& top,
                                           const Pair& bottom, int rounds) {
    std::vector<double> ratios;
    for (int round = 1; round <= rounds; ++round) {
        const double a = reporter.Rate(RealTimeName(PairRun(top, "contender", round)));
        const double b = reporter.Rate(RealTimeName(PairRun(bottom, "contender", round)));
        if (a > 0 && b > 0) ratios.push_back(a / b);
    }
    return ratios;
}

inline void PrintPairs(const RoundReporter& reporter, const std::vector<Pair>& pairs, int rounds) {
    for (const Pair& pair : pairs) PrintSpread(pair.name, PairRatios(reporter, pair, rounds));
}

// The whole program of a bench of one-thread pairs: runs every pair in
// `rounds` interleaved rounds on CPU 0 and prints each pair's ratio, real
// time contender / baseline (above 1: the contender takes longer), with
// `what` saying what one item is.
inline int RunPairs(int argc, char** argv, const std::vector<Pair>& pairs, const char* what,
                    int rounds = 5) {
    benchmark::Initialize(&argc, argv);
    if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
    PinTo(0);
    RegisterRounds(pairs, rounds);
    RoundReporter reporter;
    benchmark::RunSpecifiedBenchmarks(&reporter);
    std::printf(
        "\nRatios of real time per %s, contender / baseline, min / median / max over %d "
        "interleaved "
        "rounds; one thread, pinned to CPU 0:\n",
        what, rounds);
    PrintPairs(reporter, pairs, rounds);
    benchmark::Shutdown();
    return 0;
}

// Warns when fewer than `threads` CPUs look idle (one-minute load average
// above the CPU count less `threads`): a ratio of a many-thread run is then
// not what the machine can do.
inline void WarnIfBusy(unsigned threads) {
    std::ifstream file("/proc/loadavg");
    double load = 0;
    if (!(file >> load)) return;
    const long cpus = sysconf(_SC_NPROCESSORS_ONLN);
    if (load > static_cast<double>(cpus) - threads) {
        std::printf(
            "WARNING: load average %.2f on %ld CPUs: fewer than %u idle CPUs for the %u-thread "
            "cases; their ratios understate the machine\n",
            load, cpus, threads, threads);
    }
}

}  // namespace nxbench

#endif  // NXBASE_BENCH_INTERLEAVED_H_
