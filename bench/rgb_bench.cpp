// Screen colours: Lab to display RGB by the formula path (object and batch)
// and through the ICC engine with LittleCMS's own sRGB profile, and spectra to
// display RGB. Items per second are values converted. Baselines in the same
// run: the textbook Lab -> XYZ -> sRGB formula as a plain scalar loop (peer of
// the formula path) and a bare LittleCMS transform between the same profiles
// on the same doubles (peer of the ICC path).
#include <benchmark/benchmark.h>
#include <lcms2.h>

#include <algorithm>
#include <cmath>
#include <map>
#include <random>
#include <vector>

#include "interleaved.h"
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
        previous_ =
            nxbase::SetICCSettingsReader([this](const std::string& key, const std::string& def) {
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

void BM_LabToRgbFormulaBatch(benchmark::State& state) {
    std::vector<float> lab = RandomLab(), rgb(lab.size());
    for (auto _ : state) {
        nxbase::LabToScreenRGB(lab.data(), rgb.data(), kValues);
        benchmark::DoNotOptimize(rgb.data());
    }
    state.SetItemsProcessed(static_cast<int64_t>(state.iterations() * kValues));
}

// The textbook formula (D65 white, IEC 61966-2-1 matrix and curve), scalar.
void BM_LabToRgb_PlainFormulaLoop_Baseline(benchmark::State& state) {
    std::vector<float> lab = RandomLab(), rgb(lab.size());
    auto inverse = [](float f) {
        return f > 6.0f / 29.0f ? f * f * f : 3.0f * 0.042806183f * (f - 4.0f / 29.0f);
    };
    auto curve = [](float v) {
        v = std::min(1.0f, std::max(0.0f, v));
        return 100.0f * (v <= 0.0031308f ? 12.92f * v : 1.055f * std::pow(v, 1.0f / 2.4f) - 0.055f);
    };
    for (auto _ : state) {
        for (std::size_t i = 0; i < kValues; ++i) {
            const float fy = (lab[3 * i] + 16.0f) / 116.0f;
            const float x = 0.95047f * inverse(fy + lab[3 * i + 1] / 500.0f);
            const float y = inverse(fy);
            const float z = 1.08883f * inverse(fy - lab[3 * i + 2] / 200.0f);
            rgb[3 * i] = curve(3.2404542f * x - 1.5371385f * y - 0.4985314f * z);
            rgb[3 * i + 1] = curve(-0.9692660f * x + 1.8760108f * y + 0.0415560f * z);
            rgb[3 * i + 2] = curve(0.0556434f * x - 0.2040259f * y + 1.0572252f * z);
        }
        benchmark::DoNotOptimize(rgb.data());
    }
    state.SetItemsProcessed(static_cast<int64_t>(state.iterations() * kValues));
}

// LittleCMS alone: Lab (D50) doubles to sRGB doubles, the ICC path's work.
void BM_LabToRgb_BareLittleCms_Baseline(benchmark::State& state) {
    std::vector<float> labF = RandomLab();
    std::vector<double> lab(labF.begin(), labF.end()), rgb(lab.size());
    cmsHPROFILE labProfile = cmsCreateLab4Profile(nullptr);
    cmsHPROFILE srgb = cmsCreate_sRGBProfile();
    cmsHTRANSFORM transform =
        cmsCreateTransform(labProfile, TYPE_Lab_DBL, srgb, TYPE_RGB_DBL, INTENT_PERCEPTUAL, 0);
    for (auto _ : state) {
        cmsDoTransform(transform, lab.data(), rgb.data(), kValues);
        benchmark::DoNotOptimize(rgb.data());
    }
    cmsDeleteTransform(transform);
    cmsCloseProfile(srgb);
    cmsCloseProfile(labProfile);
    state.SetItemsProcessed(static_cast<int64_t>(state.iterations() * kValues));
}

void BM_LabToRgbIccObject(benchmark::State& state) {
    ScopedSrgbEngine engine;
    std::vector<float> lab = RandomLab();
    for (auto _ : state) {
        for (std::size_t i = 0; i < kValues; ++i) {
            RGBVector rgb(
                LABVector(lab[3 * i], lab[3 * i + 1], lab[3 * i + 2], MeasuringCondition()));
            benchmark::DoNotOptimize(rgb);
        }
    }
    state.SetItemsProcessed(static_cast<int64_t>(state.iterations() * kValues));
}

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

}  // namespace

int main(int argc, char** argv) {
    const std::vector<nxbench::Pair> pairs = {
        {"LabToRgbFormulaObject_vs_PlainFormulaLoop", BM_LabToRgb_PlainFormulaLoop_Baseline,
         BM_LabToRgbFormulaObject, false},
        {"LabToRgbFormulaBatch_vs_PlainFormulaLoop", BM_LabToRgb_PlainFormulaLoop_Baseline,
         BM_LabToRgbFormulaBatch, false},
        {"LabToRgbIccObject_vs_BareLittleCms", BM_LabToRgb_BareLittleCms_Baseline,
         BM_LabToRgbIccObject, false},
        {"LabToRgbIccBatch_vs_BareLittleCms", BM_LabToRgb_BareLittleCms_Baseline,
         BM_LabToRgbIccBatch, false},
        {"SpectrumToRgb_vs_LabToRgbFormulaBatch", BM_LabToRgbFormulaBatch, BM_SpectrumToRgb, false},
    };
    return nxbench::RunPairs(argc, argv, pairs, "batch of colours");
}
