// Colorimetry: cost of reaching a pair's weights (the provider's cache) and of
// summing one spectrum against them, each next to its plain peer in the same
// run: a std::map look-up of the same (illuminant, observer) pair, and three
// scalar 36-term dot products.
#include <benchmark/benchmark.h>

#include <algorithm>
#include <map>
#include <string>

#include "interleaved.h"
#include "nxbase/cmetry.h"

namespace {

void BM_ProviderFilterLookup(benchmark::State& state) {
    klume::cmetry::CMetryFilter::Find("D50", "2");
    for (auto _ : state) {
        benchmark::DoNotOptimize(klume::cmetry::CMetryFilter::Find("D50", "2"));
    }
}

void BM_PairMapLookup_Baseline(benchmark::State& state) {
    std::map<std::pair<std::string, std::string>, int> pairs;
    for (const char* illuminant :
         {"A", "C", "D50", "D55", "D65", "D75", "E", "FL2", "FL7", "FL11"}) {
        for (const char* observer : {"2", "10"}) pairs[{illuminant, observer}] = 1;
    }
    for (auto _ : state) {
        benchmark::DoNotOptimize(pairs.find({"D50", "2"}));
    }
}

void BM_CMetryFilterConstruction(benchmark::State& state) {
    const Lichtart illuminant{IllumClass(ILLUM_D50, 0)};
    const Observer observer{ObserverClass(OBSERVER_2DEG)};
    for (auto _ : state) {
        const CMetryFilter filter(illuminant, observer);
        benchmark::DoNotOptimize(filter.GetWeights(0));
    }
}

void BM_WeightComputation(benchmark::State& state) {
    const auto illuminant = klume::cmetry::IlluminantRepository::Get("FL4");
    const auto observer = klume::cmetry::ObserverRepository::Get("10");
    for (auto _ : state) {
        benchmark::DoNotOptimize(klume::cmetry::ComputeWeights(*illuminant, *observer));
    }
}

void BM_Tristimulus(benchmark::State& state) {
    const CMetryFilter& filter = *CMetry::Instance()->GetLXYZFilter();
    ReflectanceSpectrum spectrum(0.5f, PhysicalConditions());
    for (int i = 0; i < Spectrum::kSize; ++i) spectrum[i] = 0.02f * static_cast<float>(i);
    float sums[3];
    for (auto _ : state) {
        benchmark::DoNotOptimize(spectrum.GetData());
        filter.Tristimulus(spectrum.GetData(), sums);
        benchmark::DoNotOptimize(sums);
    }
    state.SetItemsProcessed(state.iterations());
}

void BM_PlainDotProducts_Baseline(benchmark::State& state) {
    const CMetryFilter& filter = *CMetry::Instance()->GetLXYZFilter();
    float weights[3][36];
    for (unsigned short c = 0; c < 3; ++c)
        std::copy(filter.GetWeights(c), filter.GetWeights(c) + 36, weights[c]);
    float spectrum[36];
    for (int i = 0; i < 36; ++i) spectrum[i] = 0.02f * static_cast<float>(i);
    float sums[3];
    for (auto _ : state) {
        benchmark::DoNotOptimize(spectrum);
        for (int c = 0; c < 3; ++c) {
            float sum = 0.0f;
            for (int i = 0; i < 36; ++i) sum += weights[c][i] * spectrum[i];
            sums[c] = sum;
        }
        benchmark::DoNotOptimize(sums);
    }
    state.SetItemsProcessed(state.iterations());
}

}  // namespace
int main(int argc, char** argv) {
    const std::vector<nxbench::Pair> pairs = {
        {"ProviderFilterLookup_vs_PairMapLookup", BM_PairMapLookup_Baseline,
         BM_ProviderFilterLookup, false},
        {"CMetryFilterConstruction_vs_ProviderFilterLookup", BM_ProviderFilterLookup,
         BM_CMetryFilterConstruction, false},
        {"WeightComputation_vs_ProviderFilterLookup", BM_ProviderFilterLookup, BM_WeightComputation,
         false},
        {"Tristimulus_vs_PlainDotProducts", BM_PlainDotProducts_Baseline, BM_Tristimulus, false},
    };
    return nxbench::RunPairs(argc, argv, pairs, "call");
}
