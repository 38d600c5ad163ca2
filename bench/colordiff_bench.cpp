// Colour beyond the 36-point grid, each against its peer in the same run:
// - CIEDE2000 of 10 million Lab pairs: the library's batch against LittleCMS's
//   cmsCIE2000DeltaE called in a loop over the same pairs (both scalar double
//   precision code; the pairs, 240 MB, stream from memory in both);
// - resampling plus Lab of 1 million 5 nm spectra (71 values each) against
//   Lab of the same spectra already on the 10 nm grid: the price of reading
//   another instrument's grid.
// Each pair runs in interleaved rounds; the ratios are printed at the end.
#include <benchmark/benchmark.h>
#include <lcms2.h>

#include <cmath>
#include <cstdio>
#include <random>
#include <vector>

#include "interleaved.h"
#include "nxbase/colorbatch.h"
#include "nxbase/colordiff.h"
#include "nxbase/meascond.h"
#include "nxbase/resample.h"

namespace {

constexpr std::size_t kPairs = 10'000'000;
constexpr std::size_t kSpectra = 1'000'000;
constexpr int kFineBands = 71;  // 380..730 nm at 5 nm

std::vector<float> RandomLab(std::size_t count, unsigned seed, const std::vector<float>* near) {
    std::vector<float> lab(3 * count);
    std::mt19937 random(seed);
    std::uniform_real_distribution<float> L(0.0f, 100.0f), ab(-100.0f, 100.0f), d(-3.0f, 3.0f);
    for (std::size_t i = 0; i < count; ++i) {
        for (int c = 0; c < 3; ++c) {
            lab[3 * i + c] =
                near ? (*near)[3 * i + c] + d(random) : (c == 0 ? L(random) : ab(random));
        }
    }
    return lab;
}

const std::vector<float>& References() {
    static const std::vector<float> lab = RandomLab(kPairs, 1, nullptr);
    return lab;
}
const std::vector<float>& Samples() {
    static const std::vector<float> lab = RandomLab(kPairs, 2, &References());
    return lab;
}

void BM_Ciede2000_10MPairs_Library(benchmark::State& state) {
    const auto& r = References();
    const auto& s = Samples();
    std::vector<float> out(kPairs);
    for (auto _ : state) {
        nxbase::DeltaE2000Batch(r.data(), s.data(), kPairs, out.data());
        benchmark::DoNotOptimize(out.data());
    }
    state.SetItemsProcessed(static_cast<std::int64_t>(state.iterations() * kPairs));
}

void BM_Ciede2000_10MPairs_LittleCms(benchmark::State& state) {
    const auto& r = References();
    const auto& s = Samples();
    std::vector<float> out(kPairs);
    for (auto _ : state) {
        for (std::size_t i = 0; i < kPairs; ++i) {
            const cmsCIELab a{r[3 * i], r[3 * i + 1], r[3 * i + 2]};
            const cmsCIELab b{s[3 * i], s[3 * i + 1], s[3 * i + 2]};
            out[i] = static_cast<float>(cmsCIE2000DeltaE(&a, &b, 1.0, 1.0, 1.0));
        }
        benchmark::DoNotOptimize(out.data());
    }
    state.SetItemsProcessed(static_cast<std::int64_t>(state.iterations() * kPairs));
}

// Smooth random spectra on the 5 nm grid, and the same at its 10 nm points.
struct SpectraSets {
    std::vector<float> fine;
    std::vector<float> standard;
};

const SpectraSets& Sets() {
    static const SpectraSets sets = [] {
        SpectraSets s;
        s.fine.resize(kSpectra * kFineBands);
        s.standard.resize(kSpectra * 36);
        std::mt19937 random(5);
        std::uniform_real_distribution<float> unit(0.0f, 1.0f);
        for (std::size_t i = 0; i < kSpectra; ++i) {
            float v = unit(random);
            for (int k = 0; k < kFineBands; ++k) {
                v = std::fmin(1.0f, std::fmax(0.0f, v + (unit(random) - 0.5f) * 0.05f));
                s.fine[i * kFineBands + k] = v;
                if (k % 2 == 0) s.standard[i * 36 + k / 2] = v;
            }
        }
        return s;
    }();
    return sets;
}

const nxbase::ColorBatch& Batch() {
    static const nxbase::ColorBatch batch(MeasuringCondition{});
    return batch;
}

void BM_Lab_1MSpectra_TenNanometre(benchmark::State& state) {
    const auto& sets = Sets();
    std::vector<float> lab(3 * kSpectra);
    for (auto _ : state) {
        Batch().ToLab(sets.standard.data(), kSpectra, lab.data());
        benchmark::DoNotOptimize(lab.data());
    }
    state.SetItemsProcessed(static_cast<std::int64_t>(state.iterations() * kSpectra));
}

void BM_ResampleAndLab_1MSpectra_FiveNanometre(benchmark::State& state) {
    const auto& sets = Sets();
    std::vector<double> grid;
    for (int k = 0; k < kFineBands; ++k) grid.push_back(380.0 + 5.0 * k);
    const nxbase::SpectralResampler resampler(grid);
    // Resampled in blocks that stay in cache, then the batch Lab.
    constexpr std::size_t kBlock = 4096;
    std::vector<float> block(kBlock * 36);
    std::vector<float> lab(3 * kSpectra);
    for (auto _ : state) {
        for (std::size_t first = 0; first < kSpectra; first += kBlock) {
            const std::size_t n = std::min(kBlock, kSpectra - first);
            resampler.ResampleMany(sets.fine.data() + first * kFineBands, n, block.data());
            Batch().ToLab(block.data(), n, lab.data() + 3 * first);
        }
        benchmark::DoNotOptimize(lab.data());
    }
    state.SetItemsProcessed(static_cast<std::int64_t>(state.iterations() * kSpectra));
}

BENCHMARK(BM_Ciede2000_10MPairs_LittleCms)->Unit(benchmark::kMillisecond)->UseRealTime();
BENCHMARK(BM_ResampleAndLab_1MSpectra_FiveNanometre)->Unit(benchmark::kMillisecond)->UseRealTime();

}  // namespace

int main(int argc, char** argv) {
    const std::vector<nxbench::Pair> pairs = {
        {"Ciede2000_Library_vs_LittleCms_10MPairs", BM_Ciede2000_10MPairs_LittleCms,
         BM_Ciede2000_10MPairs_Library, false},
        {"ResampleAndLab_FiveNanometre_vs_Lab_TenNanometre_1MSpectra",
         BM_Lab_1MSpectra_TenNanometre, BM_ResampleAndLab_1MSpectra_FiveNanometre, false},
    };
    return nxbench::RunPairs(argc, argv, pairs, "pass over the data");
}
