// Internal: what every batch kernel file shares. Each kernel file is compiled
// with its own instruction-set flags and gets its own copy of what is here:
// everything is in an unnamed namespace, so that no copy built for a wider
// instruction set can stand in for another file's. The kernel files define
// nothing else the linker could share between files (a test checks their
// symbols).
#ifndef NXBASE_SOURCE_COLOR_COLORBATCH_SIMD_H_
#define NXBASE_SOURCE_COLOR_COLORBATCH_SIMD_H_

#include <cstdint>
#include <cstring>

#include "colorbatch_kernels.h"
#include "tristimulus.h"

namespace nxbase::batch {
namespace {

static_assert(detail::BatchTables::kChunks * kLanes - 4 == kSamples,
              "five chunks, the last overlapping");

typedef float V8 __attribute__((vector_size(kLanes * sizeof(float))));
typedef std::int32_t I8 __attribute__((vector_size(kLanes * sizeof(std::int32_t))));
typedef float V16 __attribute__((vector_size(16 * sizeof(float))));
typedef std::int32_t I16 __attribute__((vector_size(16 * sizeof(std::int32_t))));

// The integer vector of the same width as a float vector.
template <class V>
struct IntOf;
template <>
struct IntOf<V8> {
    using type = I8;
};
template <>
struct IntOf<V16> {
    using type = I16;
};
#ifndef __AVX__
// Without AVX the registers hold four floats: eight-float vectors live in
// memory, and their shuffles come out a float at a time. The baseline kernel
// therefore works on four-float vectors wherever it can, with the same
// operations on every lane (so the same bits).
typedef float V4 __attribute__((vector_size(4 * sizeof(float))));
typedef std::int32_t I4 __attribute__((vector_size(4 * sizeof(std::int32_t))));
template <>
struct IntOf<V4> {
    using type = I4;
};
#endif

using detail::kLabEpsilon;
using detail::kLabKappa;
using detail::kLabOffset;

// The helpers are forced inline so that each kernel is one function of its
// file's instruction set.
template <class V = V8>
[[gnu::always_inline]] inline V Splat(float v) {
    return V{} + v;
}

template <class V = V8>
[[gnu::always_inline]] inline V Load(const float* p) {
    V v;
    std::memcpy(&v, p, sizeof v);
    return v;
}

[[gnu::always_inline]] inline void Store(float* p, V8 v) {
    std::memcpy(p, &v, sizeof v);
}

// Cube root of positive normal floats: an exponent-thirding first guess
// (relative error below 4%) refined by two Halley steps (cubic convergence:
// 4e-2 -> 2e-5 -> below float resolution). Zero, negative and non-finite
// lanes give meaningless values that callers mask out. (Newton steps on the
// inverse cube root avoid the divisions but measure slower here.)
template <class V>
[[gnu::always_inline]] inline V CbrtV(V t) {
    using I = typename IntOf<V>::type;
    I bits;
    std::memcpy(&bits, &t, sizeof bits);
    // bits/3 + magic, with the division done in float (exact enough for a guess).
    const V third = __builtin_convertvector(bits, V) * Splat<V>(1.0f / 3.0f);
    I guessBits = __builtin_convertvector(third, I) + 0x2a5137a0;
    V y;
    std::memcpy(&y, &guessBits, sizeof y);
    for (int i = 0; i < 2; ++i) {
        // Halley written as a correction, so that its rounding stays small.
        const V y3 = y * y * y;
        y = y + y * (t - y3) / (y3 + y3 + t);
    }
    return y;
}

// f(t) of CIELAB: t^(1/3) above kLabEpsilon, 7.787 t + 16/116 at or below.
template <class V>
[[gnu::always_inline]] inline V LabF(V t) {
    using I = typename IntOf<V>::type;
    const I cube = t > Splat<V>(kLabEpsilon);  // all ones where the cube root applies
    const V root = CbrtV(t);
    const V linear = Splat<V>(kLabKappa) * t + Splat<V>(kLabOffset);
    I rootBits;
    I linearBits;
    std::memcpy(&rootBits, &root, sizeof rootBits);
    std::memcpy(&linearBits, &linear, sizeof linearBits);
    const I mixed = (rootBits & cube) | (linearBits & ~cube);
    V out;
    std::memcpy(&out, &mixed, sizeof out);
    return out;
}

#ifndef __AVX__
// Neighbouring lanes of a and b added: (a0+a1, a2+a3, b0+b1, b2+b3).
[[gnu::always_inline]] inline V4 AddNeighbours4(V4 a, V4 b) {
    return __builtin_shufflevector(a, b, 0, 2, 4, 6) + __builtin_shufflevector(a, b, 1, 3, 5, 7);
}

// Lane j: ((p[j][k]+p[j][k+1]) + (p[j][k+2]+p[j][k+3])) for rows p[0..3].
[[gnu::always_inline]] inline V4 SumQuarter(const float (*p)[kLanes], int k) {
    return AddNeighbours4(AddNeighbours4(Load<V4>(p[0] + k), Load<V4>(p[1] + k)),
                          AddNeighbours4(Load<V4>(p[2] + k), Load<V4>(p[3] + k)));
}

// Lane s of the result is the sum of the eight lanes of p[s], in SumLanes'
// order: ((0+1) + (2+3)) + ((4+5) + (6+7)).
[[gnu::always_inline]] inline V8 SumLanes(const float (*p)[kLanes]) {
    const V4 low = SumQuarter(p, 0) + SumQuarter(p, 4);
    const V4 high = SumQuarter(p + 4, 0) + SumQuarter(p + 4, 4);
    float sums[kLanes];
    std::memcpy(sums, &low, sizeof low);
    std::memcpy(sums + 4, &high, sizeof high);
    return Load(sums);
}
#else
// Lane s of the result is the sum of the eight lanes of p[s]: a pairwise
// tree of shuffles and adds (14 shuffles, 7 adds for 64 numbers).
[[gnu::always_inline]] inline V8 SumLanes(const float (*p)[kLanes]) {
    V8 q[4];
    for (int i = 0; i < 4; ++i) {
        const V8 a = Load(p[2 * i]);
        const V8 b = Load(p[2 * i + 1]);
        q[i] = __builtin_shufflevector(a, b, 0, 8, 2, 10, 4, 12, 6, 14) +
               __builtin_shufflevector(a, b, 1, 9, 3, 11, 5, 13, 7, 15);
    }
    V8 h[2];
    for (int i = 0; i < 2; ++i) {
        const V8 a = q[2 * i];
        const V8 b = q[2 * i + 1];
        h[i] = __builtin_shufflevector(a, b, 0, 1, 8, 9, 4, 5, 12, 13) +
               __builtin_shufflevector(a, b, 2, 3, 10, 11, 6, 7, 14, 15);
    }
    return __builtin_shufflevector(h[0], h[1], 0, 1, 2, 3, 8, 9, 10, 11) +
           __builtin_shufflevector(h[0], h[1], 4, 5, 6, 7, 12, 13, 14, 15);
}
#endif

// Weighted sums of eight spectra (src holds 8 x 36 floats). Each spectrum is
// read as five 8-float chunks (the last at offset 28, overlapping the fourth,
// whose first four weights are zero in the padded table) and multiplied with
// the weights laid out the same way; the eight partial sums per channel are
// then reduced across lanes for all eight spectra at once. The order of the
// operations is the one detail::LaneSums spells out for a single spectrum.
[[gnu::always_inline]] inline void SumBlock(const PaddedWeights& w, const float* src, V8 sums[3]) {
    alignas(32) float part[3][kLanes][kLanes];
#ifndef __AVX__
    // Four lanes at a time: the same products and sums, in registers.
    for (int s = 0; s < kLanes; ++s) {
        const float* r = src + s * kSamples;
        for (int h = 0; h < kLanes; h += 4) {
            const V4 r0 = Load<V4>(r + h), r1 = Load<V4>(r + 8 + h), r2 = Load<V4>(r + 16 + h),
                     r3 = Load<V4>(r + 24 + h), r4 = Load<V4>(r + 28 + h);
            for (int c = 0; c < 3; ++c) {
                const V4 acc =
                    (r0 * Load<V4>(w.chunks[c][0] + h) + r1 * Load<V4>(w.chunks[c][1] + h)) +
                    (r2 * Load<V4>(w.chunks[c][2] + h) + r3 * Load<V4>(w.chunks[c][3] + h)) +
                    r4 * Load<V4>(w.chunks[c][4] + h);
                std::memcpy(part[c][s] + h, &acc, sizeof acc);
            }
        }
    }
#else
    for (int s = 0; s < kLanes; ++s) {
        const float* r = src + s * kSamples;
        const V8 r0 = Load(r);
        const V8 r1 = Load(r + 8);
        const V8 r2 = Load(r + 16);
        const V8 r3 = Load(r + 24);
        const V8 r4 = Load(r + 28);
        for (int c = 0; c < 3; ++c) {
            const V8 acc = (r0 * Load(w.chunks[c][0]) + r1 * Load(w.chunks[c][1])) +
                           (r2 * Load(w.chunks[c][2]) + r3 * Load(w.chunks[c][3])) +
                           r4 * Load(w.chunks[c][4]);
            Store(part[c][s], acc);
        }
    }
#endif
    for (int c = 0; c < 3; ++c) sums[c] = SumLanes(part[c]);
}

// XYZ from the weighted sums, in place: 100 * S / sum_1, as XYZVector.
template <class V>
[[gnu::always_inline]] inline void XyzOfSums(const PaddedWeights& w, V v[3]) {
    const V sumY = Splat<V>(w.sumY);
    for (int c = 0; c < 3; ++c) v[c] = v[c] / sumY * Splat<V>(100.0f);
}

// Lab from the weighted sums, in place: t = S / sum_c, which LABVector gets
// through XYZ as X * sum_1 / sum_c / 100; taken as one multiplication by
// 1 / sum_c instead of a division and two multiplications.
template <class V>
[[gnu::always_inline]] inline void LabOfSums(const PaddedWeights& w, V v[3]) {
    V f[3];
    for (int c = 0; c < 3; ++c) f[c] = LabF(v[c] * Splat<V>(w.inverseSums[c]));
    v[0] = Splat<V>(116.0f) * f[1] - Splat<V>(16.0f);
    v[1] = Splat<V>(500.0f) * (f[0] - f[1]);
    v[2] = Splat<V>(200.0f) * (f[1] - f[2]);
}

// f on the eight lanes of v, in four-lane halves where the registers are
// that wide.
template <class F>
[[gnu::always_inline]] inline void OnSums(V8 v[3], F f) {
#ifndef __AVX__
    V4 quarter[6];  // lanes 0..3 of v[c] in quarter[2c], lanes 4..7 in quarter[2c + 1]
    std::memcpy(quarter, v, sizeof quarter);
    V4 low[3] = {quarter[0], quarter[2], quarter[4]};
    V4 high[3] = {quarter[1], quarter[3], quarter[5]};
    f(low);
    f(high);
    for (int c = 0; c < 3; ++c) {
        quarter[2 * c] = low[c];
        quarter[2 * c + 1] = high[c];
    }
    std::memcpy(v, quarter, sizeof quarter);
#else
    f(v);
#endif
}

[[gnu::always_inline]] inline void XyzBlock(const PaddedWeights& w, const float* src, V8 xyz[3]) {
    SumBlock(w, src, xyz);
    OnSums(xyz, [&w](auto* v) { XyzOfSums(w, v); });
}

[[gnu::always_inline]] inline void LabBlock(const PaddedWeights& w, const float* src, V8 lab[3]) {
    SumBlock(w, src, lab);
    OnSums(lab, [&w](auto* v) { LabOfSums(w, v); });
}

// Eight (x, y, z) triples from three channel vectors into 24 floats in
// memory order: two two-input shuffles per output vector.
// (Streaming the stores past the cache measured no faster for results far
// larger than the cache: the input dominates the memory traffic.)
[[gnu::always_inline]] inline void InterleaveVectors(const V8 v[3], V8 o[3]) {
    const V8 t0 =
        __builtin_shufflevector(v[0], v[1], 0, 8, 0, 1, 9, 1, 2, 10);  // x0 y0 . x1 y1 . x2 y2
    o[0] = __builtin_shufflevector(t0, v[2], 0, 1, 8, 3, 4, 9, 6, 7);  // z0, z1 in
    const V8 t1 =
        __builtin_shufflevector(v[0], v[1], 2, 3, 11, 3, 4, 12, 4, 5);    // . x3 y3 . x4 y4 . x5
    o[1] = __builtin_shufflevector(t1, v[2], 10, 1, 2, 11, 4, 5, 12, 7);  // z2, z3, z4 in
    const V8 t2 =
        __builtin_shufflevector(v[0], v[1], 13, 5, 6, 14, 6, 7, 15, 7);   // y5 . x6 y6 . x7 y7 .
    o[2] = __builtin_shufflevector(t2, v[2], 0, 13, 2, 3, 14, 5, 6, 15);  // z5, z6, z7 in
}

[[gnu::always_inline]] inline void InterleaveFull(const V8 v[3], float* out) {
#ifndef __AVX__
    // Four triples at a time, from four-float vectors.
    alignas(32) float channel[3][kLanes];
    for (int c = 0; c < 3; ++c) Store(channel[c], v[c]);
    for (int h = 0; h < kLanes; h += 4, out += 12) {
        const V4 x = Load<V4>(channel[0] + h), y = Load<V4>(channel[1] + h),
                 z = Load<V4>(channel[2] + h);
        const V4 xy01 = __builtin_shufflevector(x, y, 0, 4, 1, 5);  // x0 y0 x1 y1
        const V4 xy23 = __builtin_shufflevector(x, y, 2, 6, 3, 7);  // x2 y2 x3 y3
        const V4 o0 = __builtin_shufflevector(xy01, z, 0, 1, 4, 2);
        const V4 yz1 = __builtin_shufflevector(xy01, z, 3, 5, 3, 5);  // y1 z1 . .
        const V4 o1 = __builtin_shufflevector(yz1, xy23, 0, 1, 4, 5);
        const V4 o2 = __builtin_shufflevector(z, xy23, 2, 6, 7, 3);
        std::memcpy(out, &o0, sizeof o0);
        std::memcpy(out + 4, &o1, sizeof o1);
        std::memcpy(out + 8, &o2, sizeof o2);
    }
#else
    V8 o[3];
    InterleaveVectors(v, o);
    for (int k = 0; k < 3; ++k) Store(out + 8 * k, o[k]);
#endif
}

[[gnu::always_inline]] inline void Interleave(const V8 v[3], float* out, int lanes) {
    if (lanes == kLanes) {
        InterleaveFull(v, out);
        return;
    }
    alignas(32) float lane[3][kLanes];
    for (int c = 0; c < 3; ++c) Store(lane[c], v[c]);
    for (int s = 0; s < lanes; ++s) {
        for (int c = 0; c < 3; ++c) out[3 * s + c] = lane[c][s];
    }
}

// Watches the results as they are written, for Seen: the brightest so far
// per lane (Y or L*; a NaN never compares greater, so it is skipped) and a
// sum that stays zero while every component is finite (x * 0 is NaN for an
// infinite or NaN x). For Lab, L + a + b = 500 fx - 184 fy - 200 fz - 16
// cannot overflow while the cube roots are finite and is not finite when one
// is not: one product per result instead of three.
template <class V>
struct Watch {
    V brightest = Splat<V>(-__builtin_inff());
    V poison = V{};

    template <bool kLab>
    [[gnu::always_inline]] inline void Add(V x, V y, V z) {
        const V light = kLab ? x : y;
        brightest = light > brightest ? light : brightest;
        poison += kLab ? (x + y + z) * 0.0f : x * 0.0f + y * 0.0f + z * 0.0f;
    }

    // Eight results; without AVX, in the four-float halves the registers hold.
    template <bool kLab, class W>
    [[gnu::always_inline]] inline void Add(const W v[3]) {
        if constexpr (sizeof(W) == sizeof(V)) {
            Add<kLab>(v[0], v[1], v[2]);
        } else {
            V part[3][2];
            for (int c = 0; c < 3; ++c) std::memcpy(part[c], &v[c], sizeof part[c]);
            for (int h = 0; h < 2; ++h) Add<kLab>(part[0][h], part[1][h], part[2][h]);
        }
    }

    // As Add for the first `lanes` (at least one): the padding lanes repeat
    // lane 0, which changes neither the brightest nor the finiteness.
    template <bool kLab>
    [[gnu::always_inline]] inline void AddFirst(const V8 v[3], int lanes) {
        V8 used[3];
        for (int c = 0; c < 3; ++c) {
            for (int l = 0; l < kLanes; ++l) used[c][l] = v[c][l < lanes ? l : 0];
        }
        Add<kLab>(used);
    }

    [[gnu::always_inline]] inline Seen Result() const {
        Seen seen{-__builtin_inff(), true};
        for (int l = 0; l < static_cast<int>(sizeof(V) / sizeof(float)); ++l) {
            if (brightest[l] > seen.brightest) seen.brightest = brightest[l];
            seen.finite = seen.finite && poison[l] == 0.0f;
        }
        return seen;
    }
};

#ifdef __AVX__
using NarrowWatch = Watch<V8>;
#else
using NarrowWatch = Watch<V4>;
#endif

template <bool kLab>
[[gnu::always_inline]] inline Seen RunBlocks(const PaddedWeights& w, const float* src,
                                             std::size_t count, float* out) {
    V8 v[3];
    NarrowWatch watch;
    std::size_t i = 0;
    for (; i + kLanes <= count; i += kLanes) {
        if (kLab) {
            LabBlock(w, src + i * kSamples, v);
        } else {
            XyzBlock(w, src + i * kSamples, v);
        }
        watch.template Add<kLab>(v);
        Interleave(v, out + 3 * i, kLanes);
    }
    if (i < count) {
        // The tail goes through a zero-padded block.
        alignas(32) float block[kLanes * kSamples] = {};
        const int rest = static_cast<int>(count - i);
        std::memcpy(block, src + i * kSamples, sizeof(float) * kSamples * rest);
        if (kLab) {
            LabBlock(w, block, v);
        } else {
            XyzBlock(w, block, v);
        }
        watch.template AddFirst<kLab>(v, rest);
        Interleave(v, out + 3 * i, rest);
    }
    return watch.Result();
}

Seen RunXyz(const PaddedWeights& w, const float* src, std::size_t count, float* out) {
    return RunBlocks<false>(w, src, count, out);
}

Seen RunLab(const PaddedWeights& w, const float* src, std::size_t count, float* out) {
    return RunBlocks<true>(w, src, count, out);
}

inline void RunCbrt(const float* in, std::size_t count, float* out) {
    std::size_t i = 0;
    for (; i + kLanes <= count; i += kLanes) Store(out + i, CbrtV(Load(in + i)));
    if (i < count) {
        alignas(32) float block[kLanes];
        for (int s = 0; s < kLanes; ++s) block[s] = 1.0f;
        std::memcpy(block, in + i, sizeof(float) * (count - i));
        Store(block, CbrtV(Load(block)));
        std::memcpy(out + i, block, sizeof(float) * (count - i));
    }
}

// This file's eight-lane kernels.
[[maybe_unused]] NarrowKernels ThisFilesNarrowKernels() {
    return {&RunXyz, &RunLab, &RunCbrt};
}

}  // namespace
}  // namespace nxbase::batch

#endif  // NXBASE_SOURCE_COLOR_COLORBATCH_SIMD_H_
