// Colorimetry: cost of reaching a pair's weights (the provider's cache) and of
// summing one spectrum against them.
#include <benchmark/benchmark.h>

#include "nxbase/cmetry.h"

namespace {

void BM_ProviderFilterLookup(benchmark::State& state) {
    klume::cmetry::CMetryFilter::Find("D50", "2");
    for (auto _ : state) {
        benchmark::DoNotOptimize(klume::cmetry::CMetryFilter::Find("D50", "2"));
    }
}
BENCHMARK(BM_ProviderFilterLookup);

void BM_CMetryFilterConstruction(benchmark::State& state) {
    const Lichtart illuminant{IllumClass(ILLUM_D50, 0)};
    const Observer observer{ObserverClass(OBSERVER_2DEG)};
    for (auto _ : state) {
        const CMetryFilter filter(illuminant, observer);
        benchmark::DoNotOptimize(filter.GetWeights(0));
    }
}
BENCHMARK(BM_CMetryFilterConstruction);

void BM_WeightComputation(benchmark::State& state) {
    const auto illuminant = klume::cmetry::IlluminantRepository::Get("FL4");
    const auto observer = klume::cmetry::ObserverRepository::Get("10");
    for (auto _ : state) {
        benchmark::DoNotOptimize(klume::cmetry::ComputeWeights(*illuminant, *observer));
    }
}
BENCHMARK(BM_WeightComputation);

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
BENCHMARK(BM_Tristimulus);

}  // namespace
BENCHMARK_MAIN();
