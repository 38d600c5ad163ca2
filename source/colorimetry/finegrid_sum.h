// Internal: the fine-grid kernels, one table of them per instruction set,
// each built in a file of its own with that set's flags (see CMakeLists.txt);
// finegrid.cpp picks one. The kernels themselves are in an unnamed namespace,
// so that every file compiles its own copy for its own set.
#ifndef NXBASE_SOURCE_COLORIMETRY_FINEGRID_SUM_H_
#define NXBASE_SOURCE_COLORIMETRY_FINEGRID_SUM_H_

#include <cstddef>
#include <cstdint>
#include <cstring>
#if defined(__AVX__)
#include <immintrin.h>
#endif

#include "nxbase/cielab.h"

namespace nxbase::finegrid {

// XYZ (three doubles per spectrum) of `count` spectra of `n` values; the
// weights run on with zeros to a multiple of kLanes values.
using SumFunction = void (*)(const double* w0, const double* w1, const double* w2, std::size_t n,
                             const float* spectra, std::size_t count, double* xyz);
// CIELAB of `count` XYZ triples in place, relative to a white of positive
// finite components (three doubles); a triple whose ratio to the white is
// not finite in some component (a value not finite, or too large) becomes
// NaN. The same bits for a colour alone as among many.
using LabFunction = void (*)(double* xyz, std::size_t count, const double* white);

// XYZ of `count` spectra, or their CIELAB when `white` is given (as for
// LabFunction), narrowed to float: three floats per spectrum into `out`,
// each the bits SumFunction and LabFunction give it.
using ConvertFunction = void (*)(const double* w0, const double* w1, const double* w2,
                                 std::size_t n, const float* spectra, std::size_t count,
                                 const double* white, float* out);

struct Kernels {
    SumFunction sum;
    LabFunction lab;
    ConvertFunction convert;
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
// set the pace. Their order of additions is fixed; the AVX2 and AVX-512
// files fuse each multiply with its add (a quarter faster), so their last
// bits differ from the baseline's (relative 1e-16, hardly ever a float's),
// and agree with each other; one spectrum and many give the same bits.
constexpr std::size_t kLanes = 16;
// How far ahead of the spectrum being summed the following ones are fetched,
// as the batch kernels fetch: the hardware's stream prefetcher alone leaves
// compute and memory taking turns (a third of the read's rate at 1 nm).
constexpr std::size_t kPrefetchBytes = 9 * 1024;

// Vectors of the registers' own width: two, four or eight doubles. (GCC's
// generic vectors wider than the registers live in memory: every operation
// then loads and stores them, slower than scalar code.) Vectors go by
// reference: passed by value, their ABI would depend on the instruction set
// of the file.
#if defined(__AVX512F__)
constexpr std::size_t kWidth = 8;
#elif defined(__AVX__)
constexpr std::size_t kWidth = 4;
#else
constexpr std::size_t kWidth = 2;
#endif
typedef double Vec __attribute__((vector_size(8 * kWidth)));
typedef std::uint64_t VecBits __attribute__((vector_size(8 * kWidth)));
// The vectors a channel's kLanes partial sums take.
constexpr std::size_t kParts = kLanes / kWidth;

// kLanes partial sums per channel, lane l in element l % kWidth of part
// l / kWidth. Arrays indexed only by constants after unrolling: the compiler
// keeps them in registers.
struct Lanes {
    Vec x[kParts]{}, y[kParts]{}, z[kParts]{};
};

inline void Widen(const float* values, Vec& wide) {
#if defined(__AVX512F__)
    // (The masked form: the unmasked one warns of an undefined operand.)
    wide = reinterpret_cast<Vec>(_mm512_maskz_cvtps_pd(0xFF, _mm256_loadu_ps(values)));
#elif defined(__AVX__)
    wide = reinterpret_cast<Vec>(_mm256_cvtps_pd(_mm_loadu_ps(values)));
#else
    for (std::size_t e = 0; e < kWidth; ++e) wide[e] = values[e];
#endif
}

// The weights of one step, kLanes per channel.
struct Weights {
    Vec x[kParts], y[kParts], z[kParts];
};

inline void LoadWeights(Weights& w, const double* w0, const double* w1, const double* w2) {
#pragma GCC unroll 8
    for (std::size_t p = 0; p < kParts; ++p) {
        std::memcpy(&w.x[p], w0 + p * kWidth, sizeof(Vec));
        std::memcpy(&w.y[p], w1 + p * kWidth, sizeof(Vec));
        std::memcpy(&w.z[p], w2 + p * kWidth, sizeof(Vec));
    }
}

// One step: kLanes values of a spectrum into the lanes of the three sums.
inline void AddLanes(Lanes& lane, const Weights& w, const float* values) {
#pragma GCC unroll 8
    for (std::size_t p = 0; p < kParts; ++p) {
        Vec v;
        Widen(values + p * kWidth, v);
        lane.x[p] += w.x[p] * v;
        lane.y[p] += w.y[p] * v;
        lane.z[p] += w.z[p] * v;
    }
}

inline void AddLanes(Lanes& lane, const double* w0, const double* w1, const double* w2,
                     const float* values) {
    Weights w;
    LoadWeights(w, w0, w1, w2);
    AddLanes(lane, w, values);
}

// The lanes' sum, halving them pairwise in a fixed order: lane i with lane
// i + 8, then i with i + 4, i + 2 and i + 1, whatever the width (so that
// AVX2 and AVX-512 give the same bits): whole parts first, then the halves
// of the last vector.
typedef double Four __attribute__((vector_size(32)));
typedef double Two __attribute__((vector_size(16)));
inline double Reduced(const Vec (&lanes)[kParts]) {
    Vec parts[kParts];
#pragma GCC unroll 8
    for (std::size_t p = 0; p < kParts; ++p) parts[p] = lanes[p];
#pragma GCC unroll 8
    for (std::size_t half = kParts / 2; half >= 1; half /= 2) {
#pragma GCC unroll 8
        for (std::size_t p = 0; p < half; ++p) parts[p] += parts[p + half];
    }
    const Vec& v = parts[0];
#if defined(__AVX512F__)
    const Four quarter =
        __builtin_shufflevector(v, v, 0, 1, 2, 3) + __builtin_shufflevector(v, v, 4, 5, 6, 7);
    const Two pair = __builtin_shufflevector(quarter, quarter, 0, 1) +
                     __builtin_shufflevector(quarter, quarter, 2, 3);
#elif defined(__AVX__)
    const Two pair = __builtin_shufflevector(v, v, 0, 1) + __builtin_shufflevector(v, v, 2, 3);
#else
    const Two& pair = v;
#endif
    return pair[0] + pair[1];
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

inline void StoreSums(const Lanes& lane, double* xyz) {
    xyz[0] = Reduced(lane.x);
    xyz[1] = Reduced(lane.y);
    xyz[2] = Reduced(lane.z);
}

#ifdef __AVX512F__
// Halves of a and b added lane to lane: lane i of a half gets lanes i and
// i + h of its vector, a's halves first. Both results are vectors of eight.
template <int h>
inline Vec HalvesAdded(const Vec& a, const Vec& b) {
    if constexpr (h == 4) {
        return __builtin_shufflevector(a, b, 0, 1, 2, 3, 8, 9, 10, 11) +
               __builtin_shufflevector(a, b, 4, 5, 6, 7, 12, 13, 14, 15);
    } else if constexpr (h == 2) {
        return __builtin_shufflevector(a, b, 0, 1, 4, 5, 8, 9, 12, 13) +
               __builtin_shufflevector(a, b, 2, 3, 6, 7, 10, 11, 14, 15);
    } else {
        return __builtin_shufflevector(a, b, 0, 2, 4, 6, 8, 10, 12, 14) +
               __builtin_shufflevector(a, b, 1, 3, 5, 7, 9, 11, 13, 15);
    }
}

// The six sums of two spectra, each lane added in Reduced's order, but the
// six vectors halved together: a third of the shuffles and adds (3 % off a
// 5 nm spectrum).
inline void StoreSumsOfTwo(const Lanes& a, const Lanes& b, double* xyz) {
    const Vec quarters0 = HalvesAdded<4>(a.x[0] + a.x[1], a.y[0] + a.y[1]);
    const Vec quarters1 = HalvesAdded<4>(a.z[0] + a.z[1], b.x[0] + b.x[1]);
    const Vec quarters2 = HalvesAdded<4>(b.y[0] + b.y[1], b.z[0] + b.z[1]);
    const Vec pairs0 = HalvesAdded<2>(quarters0, quarters1);
    const Vec pairs1 = HalvesAdded<2>(quarters2, quarters2);
    const Vec sums = HalvesAdded<1>(pairs0, pairs1);
    // Six lanes stored straight from the register: a copy of 48 bytes went
    // through the stack, and its narrower loads waited for the wide store.
    _mm512_mask_storeu_pd(xyz, 0x3F, reinterpret_cast<__m512d>(sums));
}

// Two neighbouring spectra of n >= kLanes values at a time, each step's
// weights loaded once for both. One spectrum at a time loads a weight vector
// per multiply-add; a core that loads one 64-byte vector a cycle (AMD Zen 4)
// is then bound by its loads, not by its arithmetic or by memory. Each
// spectrum's lanes take the same operations in the same order as alone.
inline void SumTwo(const double* w0, const double* w1, const double* w2, std::size_t n,
                   const Tail& tail, const float* a, double* xyz) {
    const float* b = a + n;
    const std::size_t whole = n / kLanes * kLanes;
    const char* ahead = reinterpret_cast<const char*>(a) + kPrefetchBytes;
    Lanes la, lb;
    // Two lines fetched a step, in the order they lie in memory: fetched as
    // two streams side by side (a's line and b's), two threads ran slower.
    for (std::size_t k = 0; k < whole; k += kLanes) {
        __builtin_prefetch(ahead + 2 * k * sizeof(float), 0, 3);
        __builtin_prefetch(ahead + (2 * k + kLanes) * sizeof(float), 0, 3);
        Weights w;
        LoadWeights(w, w0 + k, w1 + k, w2 + k);
        // In registers, once: left to itself GCC folds each load into both
        // spectra's multiply-adds, loading every vector twice.
        asm(""
            : "+v"(w.x[0]), "+v"(w.x[1]), "+v"(w.y[0]), "+v"(w.y[1]), "+v"(w.z[0]), "+v"(w.z[1]));
        AddLanes(la, w, a + k);
        AddLanes(lb, w, b + k);
    }
    __builtin_prefetch(ahead + 2 * whole * sizeof(float), 0, 3);
    __builtin_prefetch(ahead + 2 * n * sizeof(float) - 1, 0, 3);
    if (whole < n) {
        Weights w;
        LoadWeights(w, tail.row[0], tail.row[1], tail.row[2]);
        AddLanes(la, w, a + n - kLanes);
        AddLanes(lb, w, b + n - kLanes);
    }
    StoreSumsOfTwo(la, lb, xyz);
}
#endif

// Whether the last step of a spectrum of n values overlaps the one before
// (Tail); a spectrum shorter than kLanes is summed from a padded copy.
inline bool TailOverlaps(std::size_t n) {
    return n >= kLanes && n % kLanes != 0;
}

// The weights hold zeros after the n-th value up to a multiple of kLanes, so
// that a spectrum shorter than kLanes can be summed from a padded copy. The
// tail's weights are made once per call of the kernel (TailOf).
inline void SumSpectra(const double* w0, const double* w1, const double* w2, std::size_t n,
                       const Tail& tail, const float* spectra, std::size_t count, double* xyz) {
    const std::size_t whole = n / kLanes * kLanes;
    const bool overlap = TailOverlaps(n);
    std::size_t i = 0;
#ifdef __AVX512F__
    if (n >= kLanes) {
        for (; i + 2 <= count; i += 2, spectra += 2 * n, xyz += 6)
            SumTwo(w0, w1, w2, n, tail, spectra, xyz);
    }
#endif
    for (; i < count; ++i, spectra += n, xyz += 3) {
        // A line fetched per step (a step reads kLanes floats, one line's
        // worth), and the lines of the tail: fetched in a burst instead, the
        // lines of a long spectrum wait for each other.
        const char* ahead = reinterpret_cast<const char*>(spectra) + kPrefetchBytes;
        Lanes lane;
        for (std::size_t k = 0; k < whole; k += kLanes) {
            __builtin_prefetch(ahead + k * sizeof(float), 0, 3);
            AddLanes(lane, w0 + k, w1 + k, w2 + k, spectra + k);
        }
        __builtin_prefetch(ahead + whole * sizeof(float), 0, 3);
        __builtin_prefetch(ahead + n * sizeof(float) - 1, 0, 3);
        if (overlap) {
            AddLanes(lane, tail.row[0], tail.row[1], tail.row[2], spectra + n - kLanes);
        } else if (whole < n) {
            float rest[kLanes] = {};
            for (std::size_t l = 0; whole + l < n; ++l) rest[l] = spectra[whole + l];
            AddLanes(lane, w0 + whole, w1 + whole, w2 + whole, rest);
        }
        StoreSums(lane, xyz);
    }
}

inline Tail TailOf(const double* w0, const double* w1, const double* w2, std::size_t n) {
    return Tail(w0, w1, w2, TailOverlaps(n) ? n : kLanes);
}

inline void SumSpectra(const double* w0, const double* w1, const double* w2, std::size_t n,
                       const float* spectra, std::size_t count, double* xyz) {
    SumSpectra(w0, w1, w2, n, TailOf(w0, w1, w2, n), spectra, count, xyz);
}

// kWidth colours as three vectors of interleaved triples (x0 y0 z0 x1 ...),
// taken apart into a vector per component and put back together: CIELAB is
// then whole-vector arithmetic, with no lane handled alone.
constexpr std::size_t kLabBlock = kWidth;

struct Planes {
    Vec x, y, z;
};

inline void Deinterleave(const double* triples, Planes& p) {
    Vec v0, v1, v2;
    std::memcpy(&v0, triples, sizeof v0);
    std::memcpy(&v1, triples + kWidth, sizeof v1);
    std::memcpy(&v2, triples + 2 * kWidth, sizeof v2);
#if defined(__AVX512F__)
    const Vec x = __builtin_shufflevector(v0, v1, 0, 3, 6, 9, 12, 15, 0, 0);
    const Vec y = __builtin_shufflevector(v0, v1, 1, 4, 7, 10, 13, 0, 0, 0);
    const Vec z = __builtin_shufflevector(v0, v1, 2, 5, 8, 11, 14, 0, 0, 0);
    p.x = __builtin_shufflevector(x, v2, 0, 1, 2, 3, 4, 5, 10, 13);
    p.y = __builtin_shufflevector(y, v2, 0, 1, 2, 3, 4, 8, 11, 14);
    p.z = __builtin_shufflevector(z, v2, 0, 1, 2, 3, 4, 9, 12, 15);
#elif defined(__AVX__)
    const Vec x = __builtin_shufflevector(v0, v1, 0, 3, 6, 0);
    const Vec y = __builtin_shufflevector(v0, v1, 1, 4, 7, 0);
    const Vec z = __builtin_shufflevector(v0, v1, 2, 5, 0, 0);
    p.x = __builtin_shufflevector(x, v2, 0, 1, 2, 5);
    p.y = __builtin_shufflevector(y, v2, 0, 1, 2, 6);
    p.z = __builtin_shufflevector(z, v2, 0, 1, 4, 7);
#else
    p.x = __builtin_shufflevector(v0, v1, 0, 3);
    p.y = __builtin_shufflevector(v0, v2, 1, 2);
    p.z = __builtin_shufflevector(v1, v2, 0, 3);
#endif
}

inline void Interleave(const Planes& p, double* triples) {
#if defined(__AVX512F__)
    const Vec xy0 = __builtin_shufflevector(p.x, p.y, 0, 8, 0, 1, 9, 0, 2, 10);
    const Vec xy1 = __builtin_shufflevector(p.x, p.y, 0, 3, 11, 0, 4, 12, 0, 5);
    const Vec xy2 = __builtin_shufflevector(p.x, p.y, 13, 0, 6, 14, 0, 7, 15, 0);
    const Vec v0 = __builtin_shufflevector(xy0, p.z, 0, 1, 8, 3, 4, 9, 6, 7);
    const Vec v1 = __builtin_shufflevector(xy1, p.z, 10, 1, 2, 11, 4, 5, 12, 7);
    const Vec v2 = __builtin_shufflevector(xy2, p.z, 0, 13, 2, 3, 14, 5, 6, 15);
#elif defined(__AVX__)
    const Vec xy0 = __builtin_shufflevector(p.x, p.y, 0, 4, 0, 1);
    const Vec xy1 = __builtin_shufflevector(p.x, p.y, 5, 0, 2, 6);
    const Vec xy2 = __builtin_shufflevector(p.x, p.y, 0, 3, 7, 0);
    const Vec v0 = __builtin_shufflevector(xy0, p.z, 0, 1, 4, 3);
    const Vec v1 = __builtin_shufflevector(xy1, p.z, 0, 5, 2, 3);
    const Vec v2 = __builtin_shufflevector(xy2, p.z, 6, 1, 2, 7);
#else
    const Vec v0 = __builtin_shufflevector(p.x, p.y, 0, 2);
    const Vec v1 = __builtin_shufflevector(p.z, p.x, 0, 3);
    const Vec v2 = __builtin_shufflevector(p.y, p.z, 1, 3);
#endif
    std::memcpy(triples, &v0, sizeof v0);
    std::memcpy(triples + kWidth, &v1, sizeof v1);
    std::memcpy(triples + 2 * kWidth, &v2, sizeof v2);
}

// CIELAB of kLabBlock triples in place, from the white's reciprocals: the
// ratios are multiplied, not divided (a division costs as much as the rest;
// the ratios differ from the quotients by at most an ulp).
inline void LabOfBlock(double* triples, const double* reciprocal) {
    Planes p;
    Deinterleave(triples, p);
    p.x *= reciprocal[0];
    p.y *= reciprocal[1];
    p.z *= reciprocal[2];
    // 0 when the three ratios are finite, NaN otherwise (inf - inf): added
    // to L*, a* and b*, it leaves them or makes them NaN without a branch.
    const Vec unusable = (p.x - p.x) + (p.y - p.y) + (p.z - p.z);
    cielab::TakeFOfLanes<Vec, VecBits, ThisFile>(p.x);
    cielab::TakeFOfLanes<Vec, VecBits, ThisFile>(p.y);
    cielab::TakeFOfLanes<Vec, VecBits, ThisFile>(p.z);
    const Planes lab = {(116.0 * p.y - 16.0) + unusable, 500.0 * (p.x - p.y) + unusable,
                        200.0 * (p.y - p.z) + unusable};
    Interleave(lab, triples);
}

// The last count % kLabBlock triples go through a copy padded with zeros, so
// that a colour gets the same bits alone as among many.
inline void LabWithReciprocals(double* xyz, std::size_t count, const double* reciprocal) {
    std::size_t i = 0;
    for (; i + kLabBlock <= count; i += kLabBlock) LabOfBlock(xyz + 3 * i, reciprocal);
    if (i == count) return;
    double rest[3 * kLabBlock] = {};
    std::memcpy(rest, xyz + 3 * i, 3 * (count - i) * sizeof(double));
    LabOfBlock(rest, reciprocal);
    std::memcpy(xyz + 3 * i, rest, 3 * (count - i) * sizeof(double));
}

// The white's reciprocals, by which LabOfBlock multiplies.
struct Reciprocals {
    explicit Reciprocals(const double* white)
        : of{1.0 / white[0], 1.0 / white[1], 1.0 / white[2]} {}
    double of[3];
};

inline void LabOfTriples(double* xyz, std::size_t count, const double* white) {
    LabWithReciprocals(xyz, count, Reciprocals(white).of);
}

// Spectra a block, each block summed, taken to CIELAB and narrowed before the
// next. Blocks this small keep the next spectra's lines arriving while a
// block's CIELAB is computed: in blocks of 64 (a call of the sum and the
// CIELAB kernels each), memory idled meanwhile, and 5 nm spectra converted
// at three quarters of the read's rate.
constexpr std::size_t kConvertBlock = 16;

inline void ConvertSpectra(const double* w0, const double* w1, const double* w2, std::size_t n,
                           const float* spectra, std::size_t count, const double* white,
                           float* out) {
    const Tail tail = TailOf(w0, w1, w2, n);
    const double kNoWhite[3] = {1.0, 1.0, 1.0};
    const Reciprocals reciprocal(white ? white : kNoWhite);
    double xyz[3 * kConvertBlock];
    for (std::size_t first = 0; first < count; first += kConvertBlock) {
        const std::size_t block = count - first < kConvertBlock ? count - first : kConvertBlock;
        SumSpectra(w0, w1, w2, n, tail, spectra + first * n, block, xyz);
        if (white) LabWithReciprocals(xyz, block, reciprocal.of);
        for (std::size_t i = 0; i < 3 * block; ++i) out[3 * first + i] = static_cast<float>(xyz[i]);
    }
}

inline Kernels TheseKernels() {
    return {&SumSpectra, &LabOfTriples, &ConvertSpectra};
}

}  // namespace
}  // namespace nxbase::finegrid

#endif  // NXBASE_SOURCE_COLORIMETRY_FINEGRID_SUM_H_
