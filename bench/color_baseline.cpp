// The fair peer of the batch kernel: the same spectrum-to-Lab formula as a
// plain loop written for the compiler to vectorise (built with -O3
// -march=native -ffast-math, cbrtf from glibc's vector maths library).
#include "color_baseline.h"

#include <algorithm>
#include <cmath>

namespace colorbench {

void VectorisedLab(const float* w, const float* sums, const float* spectra, std::size_t count, float* lab) {
    constexpr std::size_t kBlock = 256;
    constexpr int kSamples = 36;
    const float scale[3] = {100.0f / sums[1] / (100.0f * sums[0] / sums[1]), 1.0f / sums[1],
                            100.0f / sums[1] / (100.0f * sums[2] / sums[1])};
    float t[3][kBlock];
    for (std::size_t first = 0; first < count; first += kBlock) {
        const std::size_t n = std::min(kBlock, count - first);
        for (std::size_t s = 0; s < n; ++s) {
            const float* r = spectra + (first + s) * kSamples;
            for (int c = 0; c < 3; ++c) {
                float sum = 0.0f;
                for (int k = 0; k < kSamples; ++k) sum += w[c * kSamples + k] * r[k];
                t[c][s] = sum * scale[c];
            }
        }
        float* out = lab + 3 * first;
#pragma omp simd
        for (std::size_t s = 0; s < n; ++s) {
            float f[3];
            for (int c = 0; c < 3; ++c) {
                f[c] = t[c][s] > 0.008856f ? cbrtf(t[c][s]) : 7.787f * t[c][s] + 16.0f / 116.0f;
            }
            out[3 * s] = 116.0f * f[1] - 16.0f;
            out[3 * s + 1] = 500.0f * (f[0] - f[1]);
            out[3 * s + 2] = 200.0f * (f[1] - f[2]);
        }
    }
}

float StreamingSum(const float* data, std::size_t count) {
    float lanes[16] = {};
    std::size_t i = 0;
    for (; i + 16 <= count; i += 16) {
#pragma omp simd
        for (int l = 0; l < 16; ++l) lanes[l] += data[i + l];
    }
    float sum = 0.0f;
    for (; i < count; ++i) sum += data[i];
    for (float v : lanes) sum += v;
    return sum;
}

}  // namespace colorbench
