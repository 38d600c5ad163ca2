// Screen colours: Lab to display RGB by the formula path (object and batch)
// and through the ICC engine with LittleCMS's own sRGB profile, and spectra to
// display RGB. Items per second are values converted.
#include <benchmark/benchmark.h>
#include <lcms2.h>

#include <map>
#include <random>
#include <vector>

#include "nxbase/colorconverter.h"
#include "nxbase/iccprofile.h"
#include "test_util.h"

namespace {

constexpr std::size_t kValues = 4096;

std::vector<float> RandomLab() {
    std::mt19937 random(7);
    std::uniform_real_distribution<float> l(0, 100), ab(-80, 80);
    std::vector<float> lab(3 * kValues);
    for (std::size_t i = 0; i < kValues; ++i) {
        lab[3 * i] = l(random);
        lab[3 * i + 1] = ab(random);
        lab[3 * i + 2] = ab(random);
    }
    return lab;
}

// Switches the ICC engine on with LittleCMS's sRGB profile for a scope.
class ScopedSrgbEngine {
  public:
    ScopedSrgbEngine() {
        path_ = dir_.File("srgb.icc");
        cmsHPROFILE p = cmsCreate_sRGBProfile();
        cmsSaveProfileToFile(p, path_.c_str());
        cmsCloseProfile(p);
        previous_ = nxbase::SetICCSettingsReader([this](const std::string& key, const std::string& def) {
            if (key == ICCEngine::kEnableKey) return std::string("1");
            if (key == ICCEngine::kPathKey) return path_;
            return def;
        });
        ICCEngine::CreateICCEngine();
    }
    ~ScopedSrgbEngine() {
        nxbase::SetICCSettingsReader(previous_);
        ICCEngine::CreateICCEngine();
    }

  private:
    nxtest::TempDir dir_;
    std::string path_;
    nxbase::SettingsReader previous_;
};

void BM_LabToRgbFormulaObject(benchmark::State& state) {
    std::vector<float> lab = RandomLab();
    std::vector<LABVector> values;
    for (std::size_t i = 0; i < kValues; ++i)
        values.emplace_back(lab[3 * i], lab[3 * i + 1], lab[3 * i + 2], MeasuringCondition());
    ICCEngine::Instance();
    for (auto _ : state) {
        for (const auto& v : values) {
            RGBVector rgb(v);
            benchmark::DoNotOptimize(rgb);
        }
    }
    state.SetItemsProcessed(static_cast<int64_t>(state.iterations() * kValues));
}
BENCHMARK(BM_LabToRgbFormulaObject);

void BM_LabToRgbFormulaBatch(benchmark::State& state) {
    std::vector<float> lab = RandomLab(), rgb(lab.size());
    for (auto _ : state) {
        nxbase::LabToScreenRGB(lab.data(), rgb.data(), kValues);
        benchmark::DoNotOptimize(rgb.data());
    }
    state.SetItemsProcessed(static_cast<int64_t>(state.iterations() * kValues));
}
BENCHMARK(BM_LabToRgbFormulaBatch);

void BM_LabToRgbIccObject(benchmark::State& state) {
    ScopedSrgbEngine engine;
    std::vector<float> lab = RandomLab();
    for (auto _ : state) {
        for (std::size_t i = 0; i < kValues; ++i) {
            RGBVector rgb(LABVector(lab[3 * i], lab[3 * i + 1], lab[3 * i + 2], MeasuringCondition()));
            benchmark::DoNotOptimize(rgb);
        }
    }
    state.SetItemsProcessed(static_cast<int64_t>(state.iterations() * kValues));
}
BENCHMARK(BM_LabToRgbIccObject);

void BM_LabToRgbIccBatch(benchmark::State& state) {
    ScopedSrgbEngine engine;
    std::vector<float> labF = RandomLab();
    std::vector<double> lab(labF.begin(), labF.end()), rgb(lab.size());
    for (auto _ : state) {
        ICCEngine::Instance()->LabToRGB(lab.data(), rgb.data(), kValues);
        benchmark::DoNotOptimize(rgb.data());
    }
    state.SetItemsProcessed(static_cast<int64_t>(state.iterations() * kValues));
}
BENCHMARK(BM_LabToRgbIccBatch);

void BM_SpectrumToRgb(benchmark::State& state) {
    std::mt19937 random(11);
    std::uniform_real_distribution<float> r(0, 1);
    std::vector<ReflectanceSpectrum> spectra;
    for (int n = 0; n < 256; ++n) {
        std::vector<float> v(36);
        for (auto& x : v) x = r(random);
        spectra.emplace_back(v, PhysicalConditions());
    }
    ICCEngine::Instance();
    for (auto _ : state) {
        for (const auto& s : spectra) {
            RGBVector rgb(s);
            benchmark::DoNotOptimize(rgb);
        }
    }
    state.SetItemsProcessed(static_cast<int64_t>(state.iterations() * spectra.size()));
}
BENCHMARK(BM_SpectrumToRgb);

}  // namespace

BENCHMARK_MAIN();
