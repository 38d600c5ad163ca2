// Spectrum to CIELAB, each contender next to its baseline in interleaved
// rounds of one program:
// - cache-resident (4096 spectra, 576 KiB): the batch path (ColorBatch)
//   against the same formula as a loop written for the compiler to vectorise
//   (color_baseline.cpp, -O3 -march=native -ffast-math, vector cbrtf), its
//   fair peer; that loop and the LABVector object path against the plain
//   scalar loop a careful programmer writes first;
// - DRAM-resident (a fixed size beyond any cache of these machines): the
//   batch path against one read of the same bytes with the same software
//   prefetch (the memory-bandwidth bound), for float and double spectra, on
//   one thread and on two;
// - fine grids (FineGridTristimulus at 1 nm, 471 values, and 5 nm, 95
//   values, 360..830 nm): the same float bytes read as spectra of that
//   length, against the same read, on one thread and on two; the same
//   conversion of cache-resident spectra against that read (the arithmetic
//   alone against the bound); on a machine with AVX-512, also the AVX2
//   kernels (most desktops' widest) on one;
// - the batch with the kernels of narrower instruction sets than the
//   machine's (AVX2, baseline), DRAM-resident, on one thread;
// - two threads against one on calls of 32 768, 65 536 and 262 144 spectra
//   (the helper threads are kept between calls).
// One-thread cases run pinned to CPU 0, two-thread cases on CPUs 0 and 1.
#include <benchmark/benchmark.h>

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <map>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "color_baseline.h"
#include "interleaved.h"
#include "nxbase/colorbatch.h"
#include "nxbase/colorvector.h"
#include "nxbase/finegrid.h"
#include "nxbase/meascond.h"

namespace {

constexpr int kSamples = 36;
constexpr std::size_t kCacheSpectra = 4096;
constexpr int kRounds = 7;

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

// 8 million spectra (1.15 GB as floats), or four times the last-level cache
// when that is more: beyond any cache of these machines, and the same size
// wherever the bench runs.
std::size_t DramSpectra() {
    const std::size_t fourCaches = 4 * LastLevelCache() / (kSamples * sizeof(float)) + 1;
    return (std::max<std::size_t>(8000000, fourCaches) + 15) / 16 * 16;
}

std::vector<float> MakeSpectra(std::size_t count) {
    std::vector<float> spectra(count * kSamples);
    std::mt19937 random(7);
    std::uniform_real_distribution<float> unit(0.0f, 1.0f);
    for (std::size_t s = 0; s < count; ++s) {
        float v = unit(random);
        for (int k = 0; k < kSamples; ++k) {
            v = std::clamp(v + (unit(random) - 0.5f) * 0.1f, 0.0f, 1.0f);
            spectra[s * kSamples + k] = v;
        }
    }
    return spectra;
}

template <class T>
const std::vector<T>& Spectra(std::size_t count) {
    static std::map<std::size_t, std::vector<T>> made;
    auto it = made.find(count);
    if (it == made.end()) {
        std::vector<float> floats = MakeSpectra(count);
        it = made.emplace(count, std::vector<T>(floats.begin(), floats.end())).first;
    }
    return it->second;
}

// Result arrays made and touched once, so that no run pays their page faults.
float* Results(std::size_t count) {
    static std::map<std::size_t, std::vector<float>> made;
    auto it = made.find(count);
    if (it == made.end()) it = made.emplace(count, std::vector<float>(3 * count, 0.0f)).first;
    return it->second.data();
}

const nxbase::ColorBatch& Batch() {
    static const nxbase::ColorBatch batch;
    return batch;
}

// Runs body() per iteration with the spectra count as the item count, on
// CPU 0 or, for two threads, on CPUs 0 and 1.
template <class Body>
void Timed(benchmark::State& state, std::size_t count, unsigned threads, Body body) {
    nxbench::PinToCpus(0, static_cast<int>(threads));
    for (auto _ : state) {
        body();
        benchmark::ClobberMemory();
    }
    state.SetItemsProcessed(static_cast<std::int64_t>(state.iterations() * count));
    nxbench::PinTo(-1);
}

// The yardstick: what a careful programmer writes first.
void ScalarLab(const float* w, const float* sums, const float* spectra, std::size_t count,
               float* lab) {
    const float xn = 100.0f * sums[0] / sums[1];
    const float zn = 100.0f * sums[2] / sums[1];
    for (std::size_t s = 0; s < count; ++s) {
        const float* r = spectra + s * kSamples;
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

void ScalarLoop(benchmark::State& state) {
    const float* spectra = Spectra<float>(kCacheSpectra).data();
    const nxbase::BatchWeights& w = Batch().Weights();
    float* lab = Results(kCacheSpectra);
    Timed(state, kCacheSpectra, 1,
          [&] { ScalarLab(&w.weights[0][0], w.sums, spectra, kCacheSpectra, lab); });
}

void VectorisedLoop(benchmark::State& state) {
    const float* spectra = Spectra<float>(kCacheSpectra).data();
    const nxbase::BatchWeights& w = Batch().Weights();
    float* lab = Results(kCacheSpectra);
    Timed(state, kCacheSpectra, 1, [&] {
        colorbench::VectorisedLab(&w.weights[0][0], w.sums, spectra, kCacheSpectra, lab);
    });
}

void ObjectPath(benchmark::State& state) {
    const std::vector<float>& values = Spectra<float>(kCacheSpectra);
    std::vector<ReflectanceSpectrum> spectra;
    spectra.reserve(kCacheSpectra);
    for (std::size_t s = 0; s < kCacheSpectra; ++s)
        spectra.emplace_back(&values[s * kSamples], PhysicalConditions());
    Timed(state, kCacheSpectra, 1, [&] {
        for (const ReflectanceSpectrum& spectrum : spectra) {
            const LABVector lab(spectrum);
            benchmark::DoNotOptimize(lab.getV()[0]);
        }
    });
}

template <class T>
void BatchLab(benchmark::State& state, std::size_t count, unsigned threads) {
    const T* spectra = Spectra<T>(count).data();
    float* lab = Results(count);
    Timed(state, count, threads, [&] {
        threads == 1 ? Batch().ToLab(spectra, count, lab)
                     : Batch().ToLabParallel(spectra, count, lab, threads);
    });
}

// One read of the spectra, split over the threads as the batch splits them.
template <class T>
void ReadOnce(benchmark::State& state, std::size_t count, unsigned threads) {
    const std::vector<T>& spectra = Spectra<T>(count);
    const std::size_t values = spectra.size();
    Timed(state, count, threads, [&] {
        double sums[2] = {};
        if (threads == 1) {
            sums[0] = colorbench::StreamingSum(spectra.data(), values);
        } else {
            const std::size_t half = values / 2;
            std::thread other(
                [&] { sums[1] = colorbench::StreamingSum(spectra.data() + half, values - half); });
            sums[0] = colorbench::StreamingSum(spectra.data(), half);
            other.join();
        }
        benchmark::DoNotOptimize(sums);
    });
}

// The batch with the kernels of a narrower instruction set than the
// machine's, on one thread: what machines without AVX-512 (AVX2) or without
// AVX2 (the baseline) run.
// With inCache, the batch converts cache-resident spectra: its arithmetic
// alone against the DRAM read.
nxbench::Pair NarrowerBatchPair(toolkit::VectorIsa isa, std::size_t count, bool inCache = false) {
    const std::string name =
        std::string("LabBatch") + (isa == toolkit::VectorIsa::kAvx2 ? "Avx2" : "Baseline") +
        "Kernels" + (inCache ? "CacheResident" : "") + "_vs_ReadOnce_DramResident_float_OneThread";
    return {name, [=](benchmark::State& s) { ReadOnce<float>(s, count, 1); },
            [=](benchmark::State& s) {
                nxbase::detail::UseBatchIsa(isa);
                BatchLab<float>(s, inCache ? kCacheSpectra : count, 1);
                nxbase::detail::UseBatchIsa(toolkit::MachineVectorIsa());
            }};
}

template <class T>
nxbench::Pair DramPair(const char* type, std::size_t count, unsigned threads) {
    const std::string name = std::string("LabBatch_vs_ReadOnce_DramResident_") + type + "_" +
                             (threads == 1 ? "OneThread" : "TwoThreads");
    return {name, [=](benchmark::State& s) { ReadOnce<T>(s, count, threads); },
            [=](benchmark::State& s) { BatchLab<T>(s, count, threads); }};
}

// Lab of the float bytes of `dram` 36-value spectra (DRAM-resident, or
// cache-resident for kCacheSpectra) read as spectra of a fine grid, with the
// kernels of `isa` (the machine's widest by default).
void FineGridLab(benchmark::State& state, double step, std::size_t dram, unsigned threads,
                 toolkit::VectorIsa isa) {
    std::vector<double> grid;
    for (double nm = 360.0; nm <= 830.0 + 1e-9; nm += step) grid.push_back(nm);
    static std::map<double, nxbase::FineGridTristimulus> made;
    auto it = made.find(step);
    if (it == made.end()) it = made.emplace(step, nxbase::FineGridTristimulus({}, grid)).first;
    const nxbase::FineGridTristimulus& fine = it->second;
    const std::size_t count = dram * kSamples / grid.size();
    const float* spectra = Spectra<float>(dram).data();
    float* lab = Results(count);
    nxbase::detail::UseFineGridIsa(isa);
    // Counted in the read's items (36 values' worth of bytes): the ratio is
    // one of bytes per second.
    Timed(state, dram, threads, [&] {
        threads == 1 ? fine.ToLab(spectra, count, lab)
                     : fine.ToLabParallel(spectra, count, lab, threads);
    });
    nxbase::detail::UseFineGridIsa(toolkit::MachineVectorIsa());
}

// The conversion of cache-resident spectra against the DRAM read: the
// arithmetic alone against the bound, the most the DRAM case could reach.
nxbench::Pair FineInCachePair(double step, std::size_t dram) {
    const std::string name = std::string("FineGridLabCacheResident_vs_ReadOnce_DramResident_") +
                             (step == 1.0 ? "1nm" : "5nm") + "_OneThread";
    const toolkit::VectorIsa isa = toolkit::MachineVectorIsa();
    return {name, [=](benchmark::State& s) { ReadOnce<float>(s, dram, 1); },
            [=](benchmark::State& s) { FineGridLab(s, step, kCacheSpectra, 1, isa); }};
}

nxbench::Pair FinePair(double step, std::size_t dram, unsigned threads,
                       toolkit::VectorIsa isa = toolkit::MachineVectorIsa()) {
    const bool narrower = isa != toolkit::MachineVectorIsa();  // AVX2, the one measured
    const std::string name = std::string(narrower ? "FineGridLabAvx2Kernels" : "FineGridLab") +
                             "_vs_ReadOnce_DramResident_" + (step == 1.0 ? "1nm_" : "5nm_") +
                             (threads == 1 ? "OneThread" : "TwoThreads");
    return {name, [=](benchmark::State& s) { ReadOnce<float>(s, dram, threads); },
            [=](benchmark::State& s) { FineGridLab(s, step, dram, threads, isa); }};
}

// A second thread on a call of `count` spectra, against one thread: what
// the kept helper threads gain on the sizes applications convert at once.
nxbench::Pair ThreadGainPair(std::size_t count) {
    return {"LabBatch_TwoThreads_vs_OneThread_" + std::to_string(count) + "Spectra",
            [=](benchmark::State& s) { BatchLab<float>(s, count, 1); },
            [=](benchmark::State& s) { BatchLab<float>(s, count, 2); }};
}

}  // namespace

int main(int argc, char** argv) {
    benchmark::Initialize(&argc, argv);
    if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
    const std::size_t dram = DramSpectra();
    auto batchInCache = [](benchmark::State& s) { BatchLab<float>(s, kCacheSpectra, 1); };
    std::vector<nxbench::Pair> pairs = {
        {"LabBatch_vs_VectorisedLoop_CacheResident", VectorisedLoop, batchInCache},
        {"LabVectorisedLoop_vs_ScalarLoop_CacheResident", ScalarLoop, VectorisedLoop},
        {"LabObjectPath_vs_ScalarLoop_CacheResident", ScalarLoop, ObjectPath},
        DramPair<float>("float", dram, 1),
        DramPair<float>("float", dram, 2),
        DramPair<double>("double", dram, 1),
        DramPair<double>("double", dram, 2),
        FinePair(1.0, dram, 1),
        FinePair(1.0, dram, 2),
        FinePair(5.0, dram, 1),
        FinePair(5.0, dram, 2),
        FineInCachePair(1.0, dram),
        FineInCachePair(5.0, dram),
        ThreadGainPair(32768),
        ThreadGainPair(65536),
        ThreadGainPair(262144),
    };
    // On a machine with AVX-512, what the AVX2 kernels (the widest of most
    // desktops) reach on the same core.
    if (toolkit::MachineVectorIsa() == toolkit::VectorIsa::kAvx512) {
        for (double step : {1.0, 5.0})
            pairs.push_back(FinePair(step, dram, 1, toolkit::VectorIsa::kAvx2));
        pairs.push_back(NarrowerBatchPair(toolkit::VectorIsa::kAvx2, dram));
        pairs.push_back(NarrowerBatchPair(toolkit::VectorIsa::kAvx2, dram, true));
    }
    if (toolkit::MachineVectorIsa() != toolkit::VectorIsa::kBaseline)
        pairs.push_back(NarrowerBatchPair(toolkit::VectorIsa::kBaseline, dram));
    std::printf(
        "DRAM-resident: %zu spectra (%.0f MiB as float, %.0f MiB as double; last-level cache %zu "
        "MiB)\n",
        dram, dram * 144.0 / (1 << 20), dram * 288.0 / (1 << 20), LastLevelCache() >> 20);
    nxbench::WarnIfBusy(2);
    // The arrays are made and read once before the rounds: the first pass
    // over fresh memory runs at a fraction of the later ones.
    benchmark::DoNotOptimize(
        colorbench::StreamingSum(Spectra<float>(dram).data(), dram * kSamples));
    benchmark::DoNotOptimize(
        colorbench::StreamingSum(Spectra<double>(dram).data(), dram * kSamples));
    Batch().ToLab(Spectra<float>(dram).data(), dram, Results(dram));
    nxbench::RegisterRounds(pairs, kRounds);
    nxbench::RoundReporter reporter;
    benchmark::RunSpecifiedBenchmarks(&reporter);
    std::printf(
        "\nRatios of spectra per second, contender / baseline, min / median / max over %d "
        "interleaved "
        "rounds; one-thread cases on CPU 0, two-thread cases on CPUs 0 and 1 (one thread each):\n",
        kRounds);
    nxbench::PrintPairs(reporter, pairs, kRounds);
    for (int type = 0; type < 2; ++type) {
        nxbench::PrintSpread(
            std::string("LabBatch_TwoThreads_vs_OneThread_DramResident_") +
                (type ? "double" : "float"),
            nxbench::ContenderRatios(reporter, pairs[4 + 2 * type], pairs[3 + 2 * type], kRounds));
    }
    benchmark::Shutdown();
    return 0;
}
