// Internal: the fine-grid kernels, one table of them per instruction set,
// each built in a file of its own with that set's flags (see CMakeLists.txt);
// finegrid.cpp picks one. The kernels themselves are in an unnamed namespace,
// so that every file compiles its own copy for its own set.
#ifndef NXBASE_SOURCE_COLORIMETRY_FINEGRID_SUM_H_
#define NXBASE_SOURCE_COLORIMETRY_FINEGRID_SUM_H_

#include <cstddef>
#include <cstdint>
#include <cstring>

#include "nxbase/cielab.h"

namespace nxbase::finegrid {

// XYZ (three doubles per spectrum) of `count` spectra of `n` values; the
// weights run on with zeros to a multiple of kLanes values.
using SumFunction = void (*)(const double* w0, const double* w1, const double* w2, std::size_t n,
                             const float* spectra, std::size_t count, double* xyz);
// CIELAB's f of `count` values in place, eight at a time; the same bits as
// cielab::F of each.
using FFunction = void (*)(double* values, std::size_t count);

struct Kernels {
    SumFunction sum;
    FFunction f;
};

Kernels BaselineKernels();
// finegrid_avx2.cpp (x86-64-v3) and finegrid_avx512.cpp (AVX-512 F, DQ,
// VL): built on x86-64 with GCC only.
Kernels Avx2Kernels();
Kernels Avx512Kernels();

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

// kLanes partial sums per channel, as two vectors of eight (GCC's generic
// vectors: two AVX-512 registers, four AVX2 ones or eight SSE2 ones).
typedef double Eight __attribute__((vector_size(64)));
typedef std::uint64_t EightBits __attribute__((vector_size(64)));
typedef float EightFloats __attribute__((vector_size(32)));
using Lanes = Eight[3][2];

// Vectors go by reference: passed by value, their ABI would depend on the
// instruction set of the file.
inline void Widen(const float* values, Eight& wide) {
    EightFloats narrow;
    std::memcpy(&narrow, values, sizeof narrow);
    wide = __builtin_convertvector(narrow, Eight);
}

inline void AddProducts(Eight& lane, const double* weights, const Eight& values) {
    Eight wide;
    std::memcpy(&wide, weights, sizeof wide);
    lane += wide * values;
}

// One step: kLanes values of a spectrum into the lanes of the three sums.
inline void AddLanes(Lanes& lane, const double* w0, const double* w1, const double* w2,
                     const float* values) {
    for (int half = 0; half < 2; ++half) {
        Eight r;
        Widen(values + 8 * half, r);
        AddProducts(lane[0][half], w0 + 8 * half, r);
        AddProducts(lane[1][half], w1 + 8 * half, r);
        AddProducts(lane[2][half], w2 + 8 * half, r);
    }
}

// The lanes' sum, halving them pairwise in a fixed order.
inline double Reduced(const Eight (&lane)[2]) {
    const Eight half = lane[0] + lane[1];
    double quarter[4], eighth[2];
    for (int l = 0; l < 4; ++l) quarter[l] = half[l] + half[l + 4];
    for (int l = 0; l < 2; ++l) eighth[l] = quarter[l] + quarter[l + 2];
    return eighth[0] + eighth[1];
}

// The last n % kLanes values of a spectrum of n >= kLanes values are summed
// as the last kLanes of it, whose first ones weigh nothing here: the step
// reads no byte beyond the spectrum and copies nothing. (An infinite value
// among those first ones makes the sums NaN instead of infinite: either way
// not a colour.)
struct Tail {
    Tail(const double* w0, const double* w1, const double* w2, std::size_t n) {
        const std::size_t from = n / kLanes * kLanes, start = n - kLanes;
        const double* weights[3] = {w0, w1, w2};
        for (int c = 0; c < 3; ++c) {
            for (std::size_t l = 0; l < kLanes; ++l)
                row[c][l] = start + l >= from ? weights[c][start + l] : 0.0;
        }
    }
    double row[3][kLanes];
};

// Makes the instantiations of the header's templates this file's own: a
// copy built for one instruction set must never be the one the others call.
struct ThisFile {};

inline void FOfValues(double* values, std::size_t count) {
    std::size_t i = 0;
    for (; i + 8 <= count; i += 8) {
        Eight t;
        std::memcpy(&t, values + i, sizeof t);
        cielab::TakeFOfLanes<Eight, EightBits, ThisFile>(t);
        std::memcpy(values + i, &t, sizeof t);
    }
    for (; i < count; ++i) cielab::TakeFOfLanes<double, std::uint64_t, ThisFile>(values[i]);
}

// The weights hold zeros after the n-th value up to a multiple of kLanes, so
// that a spectrum shorter than kLanes can be summed from a padded copy.
inline void SumSpectra(const double* w0, const double* w1, const double* w2, std::size_t n,
                       const float* spectra, std::size_t count, double* xyz) {
    const std::size_t whole = n / kLanes * kLanes;
    const bool overlap = n >= kLanes && whole < n;
    const Tail tail(w0, w1, w2, overlap ? n : kLanes);
    for (std::size_t i = 0; i < count; ++i, spectra += n, xyz += 3) {
        const char* ahead = reinterpret_cast<const char*>(spectra) + kPrefetchBytes;
        for (std::size_t line = 0; line < n * sizeof(float); line += 64)
            __builtin_prefetch(ahead + line, 0, 3);
        Lanes lane = {};
        for (std::size_t k = 0; k < whole; k += kLanes)
            AddLanes(lane, w0 + k, w1 + k, w2 + k, spectra + k);
        if (overlap) {
            AddLanes(lane, tail.row[0], tail.row[1], tail.row[2], spectra + n - kLanes);
        } else if (whole < n) {
            float rest[kLanes] = {};
            for (std::size_t l = 0; whole + l < n; ++l) rest[l] = spectra[whole + l];
            AddLanes(lane, w0 + whole, w1 + whole, w2 + whole, rest);
        }
        for (int c = 0; c < 3; ++c) xyz[c] = Reduced(lane[c]);
    }
}

inline Kernels TheseKernels() {
    return {&SumSpectra, &FOfValues};
}

}  // namespace
}  // namespace nxbase::finegrid

#endif  // NXBASE_SOURCE_COLORIMETRY_FINEGRID_SUM_H_
