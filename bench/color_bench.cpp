// Spectrum to CIELAB: the object path (LABVector from a ReflectanceSpectrum),
// the batch path (nxbase::ColorBatch) and, as the yardstick in the same
// process, a plain scalar loop of three 36-float dot products and three
// cbrtf calls. After the runs the program prints each path's rate against the
// yardstick and against the figures DESIGN.md quotes for this kind of machine.
#include <benchmark/benchmark.h>

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <map>
#include <random>
#include <string>
#include <vector>

#include "nxbase/colorbatch.h"
#include "nxbase/colorvector.h"

namespace {

constexpr int kSamples = 36;
constexpr int kCacheSpectra = 4096;       // 576 KiB of spectra: cache-resident
constexpr int kMemorySpectra = 1 << 18;   // 36 MiB: streams from memory

// Figures DESIGN.md gives for a 2-vCPU KVM machine (spectra per second).
constexpr double kColourScienceFastest = 5.7e6;
constexpr double kDesignCbrtfLoop = 13e6;
constexpr double kDesignVectorised = 90e6;
constexpr double kObjectBar = 5e6;
constexpr double kBatchBar = 30e6;

std::vector<float> MakeSpectra(int count) {
    std::vector<float> spectra(static_cast<std::size_t>(count) * kSamples);
    std::mt19937 random(7);
    std::uniform_real_distribution<float> unit(0.0f, 1.0f);
    for (int s = 0; s < count; ++s) {
        float v = unit(random);
        for (int k = 0; k < kSamples; ++k) {
            v = std::clamp(v + (unit(random) - 0.5f) * 0.1f, 0.0f, 1.0f);
            spectra[static_cast<std::size_t>(s) * kSamples + k] = v;
        }
    }
    return spectra;
}

const std::vector<float>& Spectra(int count) {
    static std::map<int, std::vector<float>> cache;
    auto it = cache.find(count);
    if (it == cache.end()) it = cache.emplace(count, MakeSpectra(count)).first;
    return it->second;
}

// The yardstick: what a careful programmer writes first.
void ScalarLab(const float* w, const float* sums, const float* spectra, int count, float* lab) {
    const float xn = 100.0f * sums[0] / sums[1];
    const float zn = 100.0f * sums[2] / sums[1];
    for (int s = 0; s < count; ++s) {
        const float* r = spectra + static_cast<std::size_t>(s) * kSamples;
        float x = 0.0f;
        float y = 0.0f;
        float z = 0.0f;
        for (int k = 0; k < kSamples; ++k) {
            x += w[k] * r[k];
            y += w[kSamples + k] * r[k];
            z += w[2 * kSamples + k] * r[k];
        }
        const float t[3] = {x / sums[1] * 100.0f / xn, y / sums[1], z / sums[1] * 100.0f / zn};
        float f[3];
        for (int i = 0; i < 3; ++i) {
            f[i] = t[i] > 0.008856f ? cbrtf(t[i]) : 7.787f * t[i] + 16.0f / 116.0f;
        }
        lab[3 * s] = 116.0f * f[1] - 16.0f;
        lab[3 * s + 1] = 500.0f * (f[0] - f[1]);
        lab[3 * s + 2] = 200.0f * (f[1] - f[2]);
    }
}

void BM_ScalarCbrtfLoop(benchmark::State& state) {
    const int count = static_cast<int>(state.range(0));
    const std::vector<float>& spectra = Spectra(count);
    const nxbase::ColorBatch batch;
    const nxbase::BatchWeights& w = batch.Weights();
    std::vector<float> lab(3 * static_cast<std::size_t>(count));
    for (auto _ : state) {
        ScalarLab(&w.weights[0][0], w.sums, spectra.data(), count, lab.data());
        benchmark::DoNotOptimize(lab.data());
        benchmark::ClobberMemory();
    }
    state.SetItemsProcessed(state.iterations() * count);
}
BENCHMARK(BM_ScalarCbrtfLoop)->Arg(kCacheSpectra)->Arg(kMemorySpectra);

void BM_LabObjectPath(benchmark::State& state) {
    const int count = static_cast<int>(state.range(0));
    const std::vector<float>& values = Spectra(count);
    std::vector<ReflectanceSpectrum> spectra;
    spectra.reserve(count);
    for (int s = 0; s < count; ++s) {
        spectra.emplace_back(&values[static_cast<std::size_t>(s) * kSamples], PhysicalConditions());
    }
    for (auto _ : state) {
        for (const ReflectanceSpectrum& spectrum : spectra) {
            const LABVector lab(spectrum);
            benchmark::DoNotOptimize(lab.getV()[0]);
        }
    }
    state.SetItemsProcessed(state.iterations() * count);
}
BENCHMARK(BM_LabObjectPath)->Arg(kCacheSpectra);

void BM_LabBatchPath(benchmark::State& state) {
    const int count = static_cast<int>(state.range(0));
    const std::vector<float>& spectra = Spectra(count);
    const nxbase::ColorBatch batch;
    std::vector<float> lab(3 * static_cast<std::size_t>(count));
    for (auto _ : state) {
        batch.ToLab(spectra.data(), count, lab.data());
        benchmark::DoNotOptimize(lab.data());
        benchmark::ClobberMemory();
    }
    state.SetItemsProcessed(state.iterations() * count);
}
BENCHMARK(BM_LabBatchPath)->Arg(kCacheSpectra)->Arg(kMemorySpectra);

// Both cores (wall-clock rate): what an application sees for a large scan.
void BM_LabBatchTwoThreads(benchmark::State& state) {
    const int count = static_cast<int>(state.range(0));
    const std::vector<float>& spectra = Spectra(count);
    const nxbase::ColorBatch batch;
    std::vector<float> lab(3 * static_cast<std::size_t>(count));
    for (auto _ : state) {
        batch.ToLabParallel(spectra.data(), count, lab.data(), 2);
        benchmark::DoNotOptimize(lab.data());
        benchmark::ClobberMemory();
    }
    state.SetItemsProcessed(state.iterations() * count);
}
BENCHMARK(BM_LabBatchTwoThreads)->Arg(kMemorySpectra)->UseRealTime();

void BM_XyzBatchPath(benchmark::State& state) {
    const int count = static_cast<int>(state.range(0));
    const std::vector<float>& spectra = Spectra(count);
    const nxbase::ColorBatch batch;
    std::vector<float> xyz(3 * static_cast<std::size_t>(count));
    for (auto _ : state) {
        batch.ToXYZ(spectra.data(), count, xyz.data());
        benchmark::DoNotOptimize(xyz.data());
        benchmark::ClobberMemory();
    }
    state.SetItemsProcessed(state.iterations() * count);
}
BENCHMARK(BM_XyzBatchPath)->Arg(kCacheSpectra);

// Keeps each run's rate for the summary.
class RateReporter : public benchmark::ConsoleReporter {
public:
    void ReportRuns(const std::vector<Run>& runs) override {
        for (const Run& run : runs) {
            if (run.run_type != Run::RT_Iteration || run.error_occurred) continue;
            const auto it = run.counters.find("items_per_second");
            if (it != run.counters.end()) amRates[run.benchmark_name()] = it->second.value;
        }
        ConsoleReporter::ReportRuns(runs);
    }
    double Rate(const std::string& asName) const {
        const auto it = amRates.find(asName);
        return it == amRates.end() ? 0.0 : it->second;
    }

private:
    std::map<std::string, double> amRates;
};

void PrintLine(const char* asPath, double axRate, double axYardstick, double axBar) {
    if (axRate <= 0.0) return;
    std::printf("%-34s %8.2f M/s  x%5.2f yardstick  x%5.2f colour-science  x%5.2f DESIGN cbrtf  "
                "x%5.2f DESIGN vectorised",
                asPath, axRate / 1e6, axYardstick > 0 ? axRate / axYardstick : 0.0,
                axRate / kColourScienceFastest, axRate / kDesignCbrtfLoop, axRate / kDesignVectorised);
    if (axBar > 0.0) std::printf("  bar %.0f M/s: %s", axBar / 1e6, axRate >= axBar ? "met" : "MISSED");
    std::printf("\n");
}

}  // namespace

int main(int argc, char** argv) {
    benchmark::Initialize(&argc, argv);
    if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
    RateReporter reporter;
    benchmark::RunSpecifiedBenchmarks(&reporter);
    const std::string cache = "/" + std::to_string(kCacheSpectra);
    const std::string memory = "/" + std::to_string(kMemorySpectra);
    const double yardstick = reporter.Rate("BM_ScalarCbrtfLoop" + cache);
    const double yardstickMemory = reporter.Rate("BM_ScalarCbrtfLoop" + memory);
    std::printf("\nSpectrum to Lab, one core (yardstick: scalar cbrtf loop in this run)\n");
    PrintLine("scalar cbrtf loop (yardstick)", yardstick, yardstick, 0.0);
    PrintLine("LABVector object path", reporter.Rate("BM_LabObjectPath" + cache), yardstick, kObjectBar);
    PrintLine("ColorBatch::ToLab, in cache", reporter.Rate("BM_LabBatchPath" + cache), yardstick,
              kBatchBar);
    PrintLine("ColorBatch::ToLab, from memory", reporter.Rate("BM_LabBatchPath" + memory),
              yardstickMemory, kBatchBar);
    PrintLine("ColorBatch::ToLabParallel, 2 threads", 
              reporter.Rate("BM_LabBatchTwoThreads" + memory + "/real_time"), yardstickMemory, 0.0);
    PrintLine("ColorBatch::ToXYZ, in cache", reporter.Rate("BM_XyzBatchPath" + cache), yardstick, 0.0);
    benchmark::Shutdown();
    return 0;
}
