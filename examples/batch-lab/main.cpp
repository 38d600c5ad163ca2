// Spectra to CIELAB in one call per array, and a CIEDE2000 comparison of a
// sample against a reference, under D65 and the 10 degree observer.
//
//   batch-lab REFERENCE SAMPLE   two spectra files (CSV or CGATS, any grid)
//   batch-lab                    built-in spectra: a ramp of greys and the
//                                same greys measured a little warmer
#include <nxbase/colorbatch.h>
#include <nxbase/colordiff.h>
#include <nxbase/meascond.h>
#include <nxbase/spectrafile.h>

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <string>
#include <vector>

namespace {

// Reads a file onto the 36-point grid; false (with the reason printed) when it cannot.
bool Read(const char* path, nxbase::SpectraTable& table) {
    std::string error;
    if (!nxbase::ReadSpectralFile(path, {}, &table, &error)) {
        std::fprintf(stderr, "%s: %s\n", path, error.c_str());
        return false;
    }
    return true;
}

// Eight greys from 5 % to 90 %, the sample's rising by up to 2 % towards red.
void BuiltIn(nxbase::SpectraTable& reference, nxbase::SpectraTable& sample) {
    for (int patch = 0; patch < 8; ++patch) {
        nxbase::SpectrumRow grey;
        grey.id = "grey " + std::to_string(patch + 1);
        nxbase::SpectrumRow warmer = grey;
        const float level = 0.05f + 0.85f * patch / 7.0f;
        for (int k = 0; k < nxbase::kSpectrumSize; ++k) {
            grey.values[k] = level;
            warmer.values[k] = level * (1.0f + 0.02f * k / (nxbase::kSpectrumSize - 1));
        }
        reference.rows.push_back(grey);
        sample.rows.push_back(warmer);
    }
}

}  // namespace

int main(int argc, char** argv) {
    nxbase::SpectraTable reference;
    nxbase::SpectraTable sample;
    if (argc == 3) {
        if (!Read(argv[1], reference) || !Read(argv[2], sample)) return 1;
    } else if (argc == 1) {
        BuiltIn(reference, sample);
    } else {
        std::fprintf(stderr, "usage: %s [REFERENCE SAMPLE]\n", argv[0]);
        return 2;
    }
    const std::size_t count = std::min(reference.rows.size(), sample.rows.size());
    reference.rows.resize(count);
    sample.rows.resize(count);

    // The condition names the illuminant and the observer; the batch holds
    // their weight tables (make it once, use it for many spectra).
    const MeasuringCondition condition(IllumClass("D65"), ObserverClass(OBSERVER_10DEG),
                                       PhysicalConditions());
    const nxbase::ColorBatch batch(condition);
    const std::vector<float> labReference = batch.ToLab(reference);
    const std::vector<float> labSample = batch.ToLab(sample);
    std::vector<float> deltaE(count);
    nxbase::DeltaE2000Batch(labReference.data(), labSample.data(), count, deltaE.data());

    std::printf("%-24s %8s %8s %8s   %8s %8s %8s   %6s\n", "patch", "L*", "a*", "b*", "L*", "a*",
                "b*", "dE00");
    for (std::size_t i = 0; i < count; ++i) {
        const float* r = &labReference[3 * i];
        const float* s = &labSample[3 * i];
        std::printf("%-24s %8.2f %8.2f %8.2f   %8.2f %8.2f %8.2f   %6.2f\n",
                    reference.rows[i].id.c_str(), r[0], r[1], r[2], s[0], s[1], s[2], deltaE[i]);
    }
    const auto worst = std::max_element(deltaE.begin(), deltaE.end());
    if (worst != deltaE.end()) {
        std::printf("largest dE00 %.2f (%s)\n", *worst,
                    reference.rows[worst - deltaE.begin()].id.c_str());
    }
    return 0;
}
