// The fair peer of the batch kernel: the same spectrum-to-Lab formula as a
// plain loop written for the compiler to vectorise (built with -O3
// -march=native -ffast-math, cbrtf from glibc's vector maths library).
#include "color_baseline.h"

#include <algorithm>
#include <cmath>

namespace colorbench {

void VectorisedLab(const float* w, const float* sums, const float* spectra, std::size_t count,
                   float* lab) {
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

// 64 bytes per step in 16-lane sums, so that the loop is bound by reading,
// each line fetched 64 spectra ahead as the batch kernel fetches them: on
// these machines the hardware prefetcher alone leaves a fifth of the
// bandwidth unused.
template <class T>
T SumOnce(const T* data, std::size_t count) {
    constexpr int kLanes = 64 / sizeof(T);
    constexpr std::size_t kAhead = 64 * 36;
    T lanes[kLanes] = {};
    std::size_t i = 0;
    for (; i + kLanes <= count; i += kLanes) {
        __builtin_prefetch(data + i + kAhead, 0, 3);
#pragma omp simd
        for (int l = 0; l < kLanes; ++l) lanes[l] += data[i + l];
    }
    T sum = 0;
    for (; i < count; ++i) sum += data[i];
    for (T v : lanes) sum += v;
    return sum;
}

float StreamingSum(const float* data, std::size_t count) {
    return SumOnce(data, count);
}

double StreamingSum(const double* data, std::size_t count) {
    return SumOnce(data, count);
}

}  // namespace colorbench
