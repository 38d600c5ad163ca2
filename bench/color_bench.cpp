// Spectrum to CIELAB: the object path (LABVector), the batch path
// (nxbase::ColorBatch) and, in the same process, two yardsticks: the plain
// scalar loop a careful programmer writes first, and the same formula as a
// loop written for the compiler to vectorise (color_baseline.cpp, -O3
// -march=native -ffast-math with vector cbrtf), the fair peer of the
// hand-vectorised batch. Cache-resident runs use 4096 spectra (576 KiB);
// DRAM-resident runs use at least four times the last-level cache, measured
// at run time, next to a streaming read of the same bytes (the memory
// bandwidth bound). After the runs the program prints each rate as a ratio
// to its same-run baseline.
#include <benchmark/benchmark.h>

#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <map>
#include <thread>
#include <random>
#include <string>
#include <vector>

#include "color_baseline.h"
#include "nxbase/colorbatch.h"
#include "nxbase/colorvector.h"

namespace {

constexpr int kSamples = 36;
constexpr int kCacheSpectra = 4096;  // 576 KiB of spectra: cache-resident

// The last-level cache in bytes (32 MiB when the system does not say).
// The kernel's figure first: in virtual machines sysconf may report the sum
// over all cache instances of the host.
std::size_t LastLevelCache() {
    long bytes = 0;
    std::ifstream size("/sys/devices/system/cpu/cpu0/cache/index3/size");
    std::string text;
    if (size >> text && !text.empty()) {
        bytes = std::atol(text.c_str());
        if (text.back() == 'K') bytes <<= 10;
        if (text.back() == 'M') bytes <<= 20;
    }
    if (bytes <= 0) bytes = sysconf(_SC_LEVEL3_CACHE_SIZE);
    return bytes > 0 ? static_cast<std::size_t>(bytes) : std::size_t{32} << 20;
}

// Spectra filling at least four times the last-level cache (and 1 million).
int DramSpectra() {
    const std::size_t bytes = 4 * LastLevelCache();
    const std::size_t count = std::max<std::size_t>(1 << 20, bytes / (kSamples * sizeof(float)) + 1);
    return static_cast<int>((count + 7) / 8 * 8);
}

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

void LabScalarLoop(benchmark::State& state) {
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

void LabVectorisedLoop(benchmark::State& state) {
    const int count = static_cast<int>(state.range(0));
    const std::vector<float>& spectra = Spectra(count);
    const nxbase::ColorBatch batch;
    const nxbase::BatchWeights& w = batch.Weights();
    std::vector<float> lab(3 * static_cast<std::size_t>(count));
    for (auto _ : state) {
        colorbench::VectorisedLab(&w.weights[0][0], w.sums, spectra.data(), count, lab.data());
        benchmark::DoNotOptimize(lab.data());
        benchmark::ClobberMemory();
    }
    state.SetItemsProcessed(state.iterations() * count);
}

void LabObjectPath(benchmark::State& state) {
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

void LabBatch(benchmark::State& state, unsigned threads) {
    const int count = static_cast<int>(state.range(0));
    const std::vector<float>& spectra = Spectra(count);
    const nxbase::ColorBatch batch;
    std::vector<float> lab(3 * static_cast<std::size_t>(count));
    for (auto _ : state) {
        if (threads == 1) {
            batch.ToLab(spectra.data(), count, lab.data());
        } else {
            batch.ToLabParallel(spectra.data(), count, lab.data(), threads);
        }
        benchmark::DoNotOptimize(lab.data());
        benchmark::ClobberMemory();
    }
    state.SetItemsProcessed(state.iterations() * count);
}

void XyzBatch(benchmark::State& state) {
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

// Reading the spectra once, on one or two threads: the rate (in spectra per
// second) that memory bandwidth allows.
void ReadBandwidth(benchmark::State& state, unsigned threads) {
    const int count = static_cast<int>(state.range(0));
    const std::vector<float>& spectra = Spectra(count);
    const std::size_t floats = spectra.size();
    for (auto _ : state) {
        float sums[2] = {};
        if (threads == 1) {
            sums[0] = colorbench::StreamingSum(spectra.data(), floats);
        } else {
            const std::size_t half = floats / 2;
            std::thread other([&] { sums[1] = colorbench::StreamingSum(spectra.data() + half, floats - half); });
            sums[0] = colorbench::StreamingSum(spectra.data(), half);
            other.join();
        }
        benchmark::DoNotOptimize(sums);
    }
    state.SetItemsProcessed(state.iterations() * count);
}

// Keeps each run's rate for the summary (the last repetition's, or the
// median when repetitions are aggregated).
class RateReporter : public benchmark::ConsoleReporter {
public:
    void ReportRuns(const std::vector<Run>& runs) override {
        for (const Run& run : runs) {
            if (run.error_occurred) continue;
            if (run.run_type == Run::RT_Aggregate && run.aggregate_name != "median") continue;
            const auto it = run.counters.find("items_per_second");
            if (it != run.counters.end()) amRates[run.run_name.function_name] = it->second.value;
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

void PrintRatio(const RateReporter& reporter, const char* what, const std::string& name,
                const std::string& baseline) {
    const double rate = reporter.Rate(name);
    const double base = reporter.Rate(baseline);
    if (rate <= 0.0 || base <= 0.0) return;
    std::printf("%-58s %8.2f M/s  x%5.2f  %s\n", what, rate / 1e6, rate / base, baseline.c_str());
}

}  // namespace

int main(int argc, char** argv) {
    benchmark::Initialize(&argc, argv);
    if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
    const int dram = DramSpectra();
    using benchmark::RegisterBenchmark;
    RegisterBenchmark("Lab_ScalarLoop_CacheResident", LabScalarLoop)->Arg(kCacheSpectra);
    RegisterBenchmark("Lab_VectorisedLoop_CacheResident", LabVectorisedLoop)->Arg(kCacheSpectra);
    RegisterBenchmark("Lab_ObjectPath_CacheResident", LabObjectPath)->Arg(kCacheSpectra);
    RegisterBenchmark("Lab_Batch_CacheResident", LabBatch, 1u)->Arg(kCacheSpectra);
    RegisterBenchmark("Xyz_Batch_CacheResident", XyzBatch)->Arg(kCacheSpectra);
    RegisterBenchmark("Lab_VectorisedLoop_DramResident", LabVectorisedLoop)->Arg(dram)->UseRealTime();
    RegisterBenchmark("Lab_Batch_DramResident", LabBatch, 1u)->Arg(dram)->UseRealTime();
    RegisterBenchmark("Read_OneThread_DramResident", ReadBandwidth, 1u)->Arg(dram)->UseRealTime();
    RegisterBenchmark("Lab_BatchTwoThreads_DramResident", LabBatch, 2u)->Arg(dram)->UseRealTime();
    RegisterBenchmark("Read_TwoThreads_DramResident", ReadBandwidth, 2u)->Arg(dram)->UseRealTime();
    RateReporter reporter;
    benchmark::RunSpecifiedBenchmarks(&reporter);
    std::printf("\nSpectrum to Lab: rates and ratios to same-run baselines (DRAM-resident: %d spectra, "
                "%.0f MiB; last-level cache %zu MiB)\n",
                dram, dram * 144.0 / (1 << 20), LastLevelCache() >> 20);
    PrintRatio(reporter, "vectorised plain loop, cache-resident", "Lab_VectorisedLoop_CacheResident",
               "Lab_ScalarLoop_CacheResident");
    PrintRatio(reporter, "LABVector object path, cache-resident", "Lab_ObjectPath_CacheResident",
               "Lab_ScalarLoop_CacheResident");
    PrintRatio(reporter, "ColorBatch::ToLab, cache-resident", "Lab_Batch_CacheResident",
               "Lab_VectorisedLoop_CacheResident");
    PrintRatio(reporter, "ColorBatch::ToXYZ, cache-resident", "Xyz_Batch_CacheResident",
               "Lab_Batch_CacheResident");
    PrintRatio(reporter, "ColorBatch::ToLab, DRAM-resident", "Lab_Batch_DramResident",
               "Lab_VectorisedLoop_DramResident");
    PrintRatio(reporter, "ColorBatch::ToLab, DRAM-resident, of the bandwidth bound", "Lab_Batch_DramResident",
               "Read_OneThread_DramResident");
    PrintRatio(reporter, "ColorBatch::ToLabParallel(2), DRAM-resident", "Lab_BatchTwoThreads_DramResident",
               "Lab_Batch_DramResident");
    PrintRatio(reporter, "ColorBatch::ToLabParallel(2), of the two-thread bound",
               "Lab_BatchTwoThreads_DramResident", "Read_TwoThreads_DramResident");
    benchmark::Shutdown();
    return 0;
}
