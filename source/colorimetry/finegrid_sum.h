// Internal: the fine-grid sum, one entry point per instruction set, each
// built in a file of its own with that set's flags (see CMakeLists.txt);
// finegrid.cpp picks one. The kernel itself is in an unnamed namespace, so
// that every file compiles its own copy for its own set.
#ifndef NXBASE_SOURCE_COLORIMETRY_FINEGRID_SUM_H_
#define NXBASE_SOURCE_COLORIMETRY_FINEGRID_SUM_H_

#include <cstddef>

namespace nxbase::finegrid {

// XYZ (three doubles per spectrum) of `count` spectra of `n` values.
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
// holds in vector registers. Their order of additions is fixed and the files
// are built without fused multiply-adds, so every instruction set gives the
// same bits.
constexpr std::size_t kLanes = 8;
// How far ahead of the spectrum being summed the following ones are fetched,
// as the batch kernels fetch: the hardware's stream prefetcher alone leaves
// compute and memory taking turns (a third of the read's rate at 1 nm).
constexpr std::size_t kPrefetchBytes = 9 * 1024;

inline void SumSpectra(const double* w0, const double* w1, const double* w2, std::size_t n,
                       const float* spectra, std::size_t count, double* xyz) {
    for (std::size_t i = 0; i < count; ++i, spectra += n, xyz += 3) {
        const char* ahead = reinterpret_cast<const char*>(spectra) + kPrefetchBytes;
        for (std::size_t line = 0; line < n * sizeof(float); line += 64)
            __builtin_prefetch(ahead + line, 0, 3);
        double lane[3][kLanes] = {};
        std::size_t k = 0;
        for (; k + kLanes <= n; k += kLanes) {
            for (std::size_t l = 0; l < kLanes; ++l) {
                const double r = spectra[k + l];
                lane[0][l] += w0[k + l] * r;
                lane[1][l] += w1[k + l] * r;
                lane[2][l] += w2[k + l] * r;
            }
        }
        for (std::size_t l = 0; k < n; ++k, ++l) {
            const double r = spectra[k];
            lane[0][l] += w0[k] * r;
            lane[1][l] += w1[k] * r;
            lane[2][l] += w2[k] * r;
        }
        for (int c = 0; c < 3; ++c) {
            const double* p = lane[c];
            xyz[c] = ((p[0] + p[4]) + (p[1] + p[5])) + ((p[2] + p[6]) + (p[3] + p[7]));
        }
    }
}

}  // namespace
}  // namespace nxbase::finegrid

#endif  // NXBASE_SOURCE_COLORIMETRY_FINEGRID_SUM_H_
