// Contender and baseline of a pair run in interleaved rounds in one program,
// so that drifts of the machine hit both; the summary is the ratio's
// min / median / max over the rounds.
#ifndef NXBASE_BENCH_INTERLEAVED_H_
#define NXBASE_BENCH_INTERLEAVED_H_

#include <benchmark/benchmark.h>

#include <algorithm>
#include <cstdio>
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
inline std::string RealTimeName(const std::string& registered) { return registered + "/real_time"; }

// Prints "<label> min / median / max" of the ratios; nothing when none was
// measured (a filtered run).
inline void PrintSpread(const std::string& label, std::vector<double> ratios) {
    if (ratios.empty()) return;
    std::sort(ratios.begin(), ratios.end());
    std::printf("  %-52s %.2f / %.2f / %.2f\n", label.c_str(), ratios.front(), ratios[ratios.size() / 2],
                ratios.back());
}

}  // namespace nxbench

#endif  // NXBASE_BENCH_INTERLEAVED_H_
