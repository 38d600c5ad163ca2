// Internal: the fine-grid sum, one entry point per instruction set, each
// built in a file of its own with that set's flags (see CMakeLists.txt);
// finegrid.cpp picks one. The kernel itself is in an unnamed namespace, so
// that every file compiles its own copy for its own set.
#ifndef NXBASE_SOURCE_COLORIMETRY_FINEGRID_SUM_H_
#define NXBASE_SOURCE_COLORIMETRY_FINEGRID_SUM_H_

#include <cstddef>

namespace nxbase::finegrid {

// XYZ (three doubles per spectrum) of `count` spectra of `n` values; the
// weights run on with zeros to a multiple of kLanes values.
using SumFunction = void (*)(const double* w0, const double* w1, const double* w2, std::size_t n,
                             const float* spectra, std::size_t count, double* xyz);

void SumBaseline(const double* w0, const double* w1, const double* w2, std::size_t n,
                 const float* spectra, std::size_t count, double* xyz);
// finegrid_avx2.cpp (x86-64-v3) and finegrid_avx512.cpp (AVX-512 F, DQ,
// VL): built on x86-64 with GCC only.
void SumAvx2(const double* w0, const double* w1, const double* w2, std::size_t n,
             const float* spectra, std::size_t count, double* xyz);
void SumAvx512(const double* w0, const double* w1, const double* w2, std::size_t n,
               const float* spectra, std::size_t count, double* xyz);

namespace {

// Partial sums per channel kept apart: independent chains that the compiler
// holds in vector registers (two AVX-512 registers, or four AVX2 ones, per
// channel), enough of them that the multiplies and adds, not their latency,
// set the pace. Their order of additions is fixed and the files are built
// without fused multiply-adds, so every instruction set gives the same bits.
constexpr std::size_t kLanes = 16;
// How far ahead of the spectrum being summed the following ones are fetched,
// as the batch kernels fetch: the hardware's stream prefetcher alone leaves
// compute and memory taking turns (a third of the read's rate at 1 nm).
constexpr std::size_t kPrefetchBytes = 9 * 1024;

// One step: kLanes values of a spectrum into the lanes of the three sums.
inline void AddLanes(double (&lane)[3][kLanes], const double* w0, const double* w1,
                     const double* w2, const float* values) {
    for (std::size_t l = 0; l < kLanes; ++l) {
        const double r = values[l];
        lane[0][l] += w0[l] * r;
        lane[1][l] += w1[l] * r;
        lane[2][l] += w2[l] * r;
    }
}

// The weights hold zeros after the n-th value up to a multiple of kLanes, so
// that the last step reads whole rows of them; the spectrum's last values
// are copied into a row padded with zeros.
inline void SumSpectra(const double* w0, const double* w1, const double* w2, std::size_t n,
                       const float* spectra, std::size_t count, double* xyz) {
    for (std::size_t i = 0; i < count; ++i, spectra += n, xyz += 3) {
        const char* ahead = reinterpret_cast<const char*>(spectra) + kPrefetchBytes;
        for (std::size_t line = 0; line < n * sizeof(float); line += 64)
            __builtin_prefetch(ahead + line, 0, 3);
        double lane[3][kLanes] = {};
        std::size_t k = 0;
        for (; k + kLanes <= n; k += kLanes) AddLanes(lane, w0 + k, w1 + k, w2 + k, spectra + k);
        if (k < n) {
            float rest[kLanes] = {};
            for (std::size_t l = 0; k + l < n; ++l) rest[l] = spectra[k + l];
            AddLanes(lane, w0 + k, w1 + k, w2 + k, rest);
        }
        // Halving the lanes pairwise, in a fixed order.
        for (int c = 0; c < 3; ++c) {
            double half[kLanes / 2], quarter[kLanes / 4], eighth[kLanes / 8];
            for (std::size_t l = 0; l < kLanes / 2; ++l)
                half[l] = lane[c][l] + lane[c][l + kLanes / 2];
            for (std::size_t l = 0; l < kLanes / 4; ++l)
                quarter[l] = half[l] + half[l + kLanes / 4];
            for (std::size_t l = 0; l < kLanes / 8; ++l)
                eighth[l] = quarter[l] + quarter[l + kLanes / 8];
            xyz[c] = eighth[0] + eighth[1];
        }
    }
}

}  // namespace
}  // namespace nxbase::finegrid

#endif  // NXBASE_SOURCE_COLORIMETRY_FINEGRID_SUM_H_
