// ColorBatch: spectra to XYZ and CIELAB, eight spectra per step.
//
// Each spectrum is multiplied chunk by chunk with the weight tables (laid out
// in 8-float chunks), and the partial sums of eight spectra are reduced across
// lanes together, so that every step works on full 8-float vectors and no
// spectrum is transposed. The colour vectors sum one spectrum in the same
// order (detail::LaneSums) and the file is compiled without floating-point
// contraction, so XYZ agree bit for bit and Lab up to the cube root. The code
// is target-independent (GCC/Clang vector extensions); on x86-64 GCC also
// builds an x86-64-v3 (AVX2) clone of the kernels that is picked at load time,
// and machines with AVX-512 sum two spectra per 16-float register, reduce the
// partial sums in registers as soon as neighbours are there, and fetch every
// line of the input some blocks ahead, so that the sums overlap the reading
// from memory. Results go back to memory order with shuffles, not lane by
// lane. Double input is rounded to float as it is read.
#include "nxbase/colorbatch.h"

#include <algorithm>
#include <cstdint>
#include <cstring>

#if defined(__x86_64__) && defined(__GNUC__) && !defined(__clang__)
#include <immintrin.h>
#endif

#include "nxbase/cmetry.h"
#include "nxbase/spectrafile.h"
#include "nxbase/thread.h"
#include "tristimulus.h"

// The vector helpers below are file-local and inlined; the ABI note GCC and
// Clang give for 32-byte vector arguments without AVX does not apply to them.
#if defined(__GNUC__)
#pragma GCC diagnostic ignored "-Wpsabi"
#endif

namespace nxbase {
namespace {

constexpr int kSamples = BatchWeights::kSamples;
constexpr int kLanes = 8;
using PaddedWeights = detail::BatchTables;
static_assert(detail::BatchTables::kChunks * kLanes - 4 == kSamples,
              "five chunks, the last overlapping");

typedef float V8 __attribute__((vector_size(kLanes * sizeof(float))));
typedef std::int32_t I8 __attribute__((vector_size(kLanes * sizeof(std::int32_t))));

// The integer vector of the same width as a float vector.
template <class V>
struct IntOf;
template <>
struct IntOf<V8> {
    using type = I8;
};

using detail::kLabEpsilon;
using detail::kLabKappa;
using detail::kLabOffset;

// The kernels' helpers are forced inline so that each clone gets its own copy.
#define NXBASE_BATCH_INLINE inline __attribute__((always_inline))

// The clones are chosen by an IFUNC resolver that runs while the library is
// relocated, before ThreadSanitizer's runtime is up; a TSan build uses the
// default code only.
#if defined(__GNUC__) && !defined(__clang__) && defined(__x86_64__) && \
    !defined(NXBASE_BATCH_NO_CLONES) && !defined(__SANITIZE_THREAD__)
#define NXBASE_BATCH_CLONES __attribute__((target_clones("arch=x86-64-v3", "default")))
#else
#define NXBASE_BATCH_CLONES
#endif

template <class V = V8>
NXBASE_BATCH_INLINE V Splat(float v) {
    return V{} + v;
}

NXBASE_BATCH_INLINE V8 Load(const float* p) {
    V8 v;
    std::memcpy(&v, p, sizeof v);
    return v;
}

NXBASE_BATCH_INLINE void Store(float* p, V8 v) {
    std::memcpy(p, &v, sizeof v);
}

// Cube root of positive normal floats: an exponent-thirding first guess
// (relative error below 4%) refined by two Halley steps (cubic convergence:
// 4e-2 -> 2e-5 -> below float resolution). Zero, negative and non-finite
// lanes give meaningless values that callers mask out. (Newton steps on the
// inverse cube root avoid the divisions but measure slower here.)
template <class V>
NXBASE_BATCH_INLINE V CbrtV(V t) {
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
NXBASE_BATCH_INLINE V LabF(V t) {
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

#if defined(__clang__)
#define NXBASE_SHUFFLE(a, b, ...) __builtin_shufflevector(a, b, __VA_ARGS__)
#else
#define NXBASE_SHUFFLE(a, b, ...) __builtin_shuffle(a, b, I8{__VA_ARGS__})
#endif

// Lane s of the result is the sum of the eight lanes of p[s]: a pairwise
// tree of shuffles and adds (14 shuffles, 7 adds for 64 numbers).
NXBASE_BATCH_INLINE V8 SumLanes(const float (*p)[kLanes]) {
    V8 q[4];
    for (int i = 0; i < 4; ++i) {
        const V8 a = Load(p[2 * i]);
        const V8 b = Load(p[2 * i + 1]);
        q[i] = NXBASE_SHUFFLE(a, b, 0, 8, 2, 10, 4, 12, 6, 14) +
               NXBASE_SHUFFLE(a, b, 1, 9, 3, 11, 5, 13, 7, 15);
    }
    V8 h[2];
    for (int i = 0; i < 2; ++i) {
        const V8 a = q[2 * i];
        const V8 b = q[2 * i + 1];
        h[i] = NXBASE_SHUFFLE(a, b, 0, 1, 8, 9, 4, 5, 12, 13) +
               NXBASE_SHUFFLE(a, b, 2, 3, 10, 11, 6, 7, 14, 15);
    }
    return NXBASE_SHUFFLE(h[0], h[1], 0, 1, 2, 3, 8, 9, 10, 11) +
           NXBASE_SHUFFLE(h[0], h[1], 4, 5, 6, 7, 12, 13, 14, 15);
}

// Weighted sums of eight spectra (src holds 8 x 36 floats). Each spectrum is
// read as five 8-float chunks (the last at offset 28, overlapping the fourth,
// whose first four weights are zero in the padded table) and multiplied with
// the weights laid out the same way; the eight partial sums per channel are
// then reduced across lanes for all eight spectra at once. The order of the
// operations is the one detail::LaneSums spells out for a single spectrum.
NXBASE_BATCH_INLINE void SumBlock(const PaddedWeights& w, const float* src, V8 sums[3]) {
    alignas(32) float part[3][kLanes][kLanes];
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
    for (int c = 0; c < 3; ++c) sums[c] = SumLanes(part[c]);
}

// XYZ from the weighted sums, in place: 100 * S / sum_1, as XYZVector.
template <class V>
NXBASE_BATCH_INLINE void XyzOfSums(const PaddedWeights& w, V v[3]) {
    const V sumY = Splat<V>(w.sumY);
    for (int c = 0; c < 3; ++c) v[c] = v[c] / sumY * Splat<V>(100.0f);
}

// Lab from the weighted sums, in place: t = S / sum_c, which LABVector gets
// through XYZ as X * sum_1 / sum_c / 100; taken as one multiplication by
// 1 / sum_c instead of a division and two multiplications.
template <class V>
NXBASE_BATCH_INLINE void LabOfSums(const PaddedWeights& w, V v[3]) {
    V f[3];
    for (int c = 0; c < 3; ++c) f[c] = LabF(v[c] * Splat<V>(w.inverseSums[c]));
    v[0] = Splat<V>(116.0f) * f[1] - Splat<V>(16.0f);
    v[1] = Splat<V>(500.0f) * (f[0] - f[1]);
    v[2] = Splat<V>(200.0f) * (f[1] - f[2]);
}

NXBASE_BATCH_INLINE void XyzBlock(const PaddedWeights& w, const float* src, V8 xyz[3]) {
    SumBlock(w, src, xyz);
    XyzOfSums(w, xyz);
}

NXBASE_BATCH_INLINE void LabBlock(const PaddedWeights& w, const float* src, V8 lab[3]) {
    SumBlock(w, src, lab);
    LabOfSums(w, lab);
}

// Eight (x, y, z) triples from three channel vectors into 24 floats in
// memory order: two two-input shuffles per output vector.
// (Streaming the stores past the cache measured no faster for results far
// larger than the cache: the input dominates the memory traffic.)
NXBASE_BATCH_INLINE void InterleaveVectors(const V8 v[3], V8 o[3]) {
    const V8 t0 = NXBASE_SHUFFLE(v[0], v[1], 0, 8, 0, 1, 9, 1, 2, 10);    // x0 y0 . x1 y1 . x2 y2
    o[0] = NXBASE_SHUFFLE(t0, v[2], 0, 1, 8, 3, 4, 9, 6, 7);              // z0, z1 in
    const V8 t1 = NXBASE_SHUFFLE(v[0], v[1], 2, 3, 11, 3, 4, 12, 4, 5);   // . x3 y3 . x4 y4 . x5
    o[1] = NXBASE_SHUFFLE(t1, v[2], 10, 1, 2, 11, 4, 5, 12, 7);           // z2, z3, z4 in
    const V8 t2 = NXBASE_SHUFFLE(v[0], v[1], 13, 5, 6, 14, 6, 7, 15, 7);  // y5 . x6 y6 . x7 y7 .
    o[2] = NXBASE_SHUFFLE(t2, v[2], 0, 13, 2, 3, 14, 5, 6, 15);           // z5, z6, z7 in
}

NXBASE_BATCH_INLINE void InterleaveFull(const V8 v[3], float* out) {
    V8 o[3];
    InterleaveVectors(v, o);
    for (int k = 0; k < 3; ++k) Store(out + 8 * k, o[k]);
}

NXBASE_BATCH_INLINE void Interleave(const V8 v[3], float* out, int lanes) {
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

template <bool kLab>
NXBASE_BATCH_INLINE void RunBlocks(const PaddedWeights& w, const float* src, std::size_t count,
                                   float* out) {
    V8 v[3];
    std::size_t i = 0;
    for (; i + kLanes <= count; i += kLanes) {
        if (kLab) {
            LabBlock(w, src + i * kSamples, v);
        } else {
            XyzBlock(w, src + i * kSamples, v);
        }
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
        Interleave(v, out + 3 * i, rest);
    }
}

NXBASE_BATCH_CLONES
void RunXyz(const PaddedWeights& w, const float* src, std::size_t count, float* out) {
    RunBlocks<false>(w, src, count, out);
}

NXBASE_BATCH_CLONES
void RunLab(const PaddedWeights& w, const float* src, std::size_t count, float* out) {
    RunBlocks<true>(w, src, count, out);
}

NXBASE_BATCH_CLONES
void RunCbrt(const float* in, std::size_t count, float* out) {
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

// GCC only, as the clones above: Clang refuses the 8-float helpers' vector
// returns inside a function of another target.
#if defined(__x86_64__) && defined(__GNUC__) && !defined(__clang__)
#define NXBASE_BATCH_WIDE 1
// GCC 12 reports the undefined upper halves of _mm512_castps256_ps512 and
// _mm512_broadcast_f32x8 (which the instructions overwrite) as uninitialised.
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wmaybe-uninitialized"
#pragma GCC diagnostic ignored "-Wuninitialized"
// AVX-512: two spectra per 16-float register, the same products and sums per
// lane as the 8-float kernel (so the same results), half the instructions.
#define NXBASE_WIDE_TARGET __attribute__((target("avx512f,avx512dq,avx512vl,avx2,bmi2")))

// Chunk k (8 samples from offset at) of spectra a and b in one register, as
// floats; double input is rounded to float on loading, exactly as a float
// copy of it would be.
NXBASE_WIDE_TARGET NXBASE_BATCH_INLINE __m512 LoadPair(const float* a, const float* b) {
    return _mm512_insertf32x8(_mm512_castps256_ps512(_mm256_loadu_ps(a)), _mm256_loadu_ps(b), 1);
}

NXBASE_WIDE_TARGET NXBASE_BATCH_INLINE __m512 LoadPair(const double* a, const double* b) {
    return _mm512_insertf32x8(_mm512_castps256_ps512(_mm512_cvtpd_ps(_mm512_loadu_pd(a))),
                              _mm512_cvtpd_ps(_mm512_loadu_pd(b)), 1);
}

// One level of the lane reduction for the registers a and b: within each
// 128-bit group, neighbouring lanes are added, a's pairs first.
NXBASE_WIDE_TARGET NXBASE_BATCH_INLINE __m512 AddNeighbours(__m512 a, __m512 b) {
    return _mm512_add_ps(_mm512_shuffle_ps(a, b, 0x88), _mm512_shuffle_ps(a, b, 0xdd));
}

// The lane SumBlock16 leaves spectrum s in.
constexpr int SumLane(int s) {
    return (s / 8) * 8 + (s % 2) * 4 + (s % 8) / 2;
}

using WideWeights = __m512[3][detail::BatchTables::kChunks];

// The eight partial sums per channel of spectra a (low half) and a + 36
// (high half), in the order of the eight-lane kernel.
template <class T>
NXBASE_WIDE_TARGET NXBASE_BATCH_INLINE void SumPair(const WideWeights& weights, const T* a,
                                                    __m512 acc[3]) {
    const T* b = a + kSamples;
    const __m512 r0 = LoadPair(a, b);
    const __m512 r1 = LoadPair(a + 8, b + 8);
    const __m512 r2 = LoadPair(a + 16, b + 16);
    const __m512 r3 = LoadPair(a + 24, b + 24);
    const __m512 r4 = LoadPair(a + 28, b + 28);
#pragma GCC unroll 3
    for (int c = 0; c < 3; ++c) {
        const __m512 low =
            _mm512_add_ps(_mm512_mul_ps(r0, weights[c][0]), _mm512_mul_ps(r1, weights[c][1]));
        const __m512 high =
            _mm512_add_ps(_mm512_mul_ps(r2, weights[c][2]), _mm512_mul_ps(r3, weights[c][3]));
        acc[c] = _mm512_add_ps(_mm512_add_ps(low, high), _mm512_mul_ps(r4, weights[c][4]));
    }
}

// The lane sums of four pairs (eight spectra from `src`), reduced as soon as
// two neighbours are there, so that few partial sums are live at once.
// Groups 0 and 1 of out[c] hold the sums of lanes 0..3 and 4..7 of spectra
// 0, 2, 4, 6; groups 2 and 3 those of spectra 1, 3, 5, 7.
template <class T>
NXBASE_WIDE_TARGET NXBASE_BATCH_INLINE void SumEight(const WideWeights& weights, const T* src,
                                                     __m512 out[3]) {
    __m512 quad[2][3];
#pragma GCC unroll 2
    for (int k = 0; k < 2; ++k) {
        __m512 first[3];
        __m512 second[3];
        SumPair(weights, src + (4 * k) * kSamples, first);
        SumPair(weights, src + (4 * k + 2) * kSamples, second);
#pragma GCC unroll 3
        for (int c = 0; c < 3; ++c) quad[k][c] = AddNeighbours(first[c], second[c]);
    }
#pragma GCC unroll 3
    for (int c = 0; c < 3; ++c) out[c] = AddNeighbours(quad[0][c], quad[1][c]);
}

// Weighted sums of sixteen spectra, spectrum s in lane SumLane(s). The
// additions per spectrum are those of SumLanes, ((0+1) + (2+3)) + ((4+5) +
// (6+7)), so the results agree with the eight-lane kernel bit for bit.
template <class T>
NXBASE_WIDE_TARGET NXBASE_BATCH_INLINE void SumBlock16(const WideWeights& weights, const T* src,
                                                       __m512 sums[3]) {
    __m512 half[2][3];
    SumEight(weights, src, half[0]);
    SumEight(weights, src + kLanes * kSamples, half[1]);
#pragma GCC unroll 3
    for (int c = 0; c < 3; ++c) {
        const __m512 low =
            _mm512_shuffle_f32x4(half[0][c], half[1][c], 0x88);  // groups 0, 2 of each
        const __m512 high =
            _mm512_shuffle_f32x4(half[0][c], half[1][c], 0xdd);  // groups 1, 3 of each
        sums[c] = _mm512_add_ps(low, high);
    }
}

// Index vectors for _mm512_permutex2var_ps that write sixteen (x, y, z)
// triples in memory order from three registers in SumLane order: for output
// register k, first x and y are gathered, then z is merged in.
struct WideInterleave {
    alignas(64) std::int32_t xy[3][16];
    alignas(64) std::int32_t z[3][16];
    constexpr WideInterleave() : xy{}, z{} {
        for (int k = 0; k < 3; ++k) {
            for (int j = 0; j < 16; ++j) {
                const int g = 16 * k + j;
                const int lane = SumLane(g / 3);
                xy[k][j] = g % 3 == 1 ? 16 + lane : lane;
                z[k][j] = g % 3 == 2 ? 16 + lane : j;
            }
        }
    }
};
constexpr WideInterleave kWideInterleave;

NXBASE_WIDE_TARGET NXBASE_BATCH_INLINE void InterleaveSixteen(const __m512 v[3], float* out) {
    for (int k = 0; k < 3; ++k) {
        const __m512 xy =
            _mm512_permutex2var_ps(v[0], _mm512_load_si512(kWideInterleave.xy[k]), v[1]);
        _mm512_storeu_ps(out + 16 * k,
                         _mm512_permutex2var_ps(xy, _mm512_load_si512(kWideInterleave.z[k]), v[2]));
    }
}

typedef float V16 __attribute__((vector_size(16 * sizeof(float))));
typedef std::int32_t I16 __attribute__((vector_size(16 * sizeof(std::int32_t))));
template <>
struct IntOf<V16> {
    using type = I16;
};

// How far ahead of the block being summed its successors are fetched: far
// enough to cover the memory latency at the rate the kernel consumes them
// (measured best at 8 to 9 KiB for float spectra; 4 and 16 KiB were slower).
constexpr std::size_t kPrefetchSpectra = 64;

template <bool kLab, class T>
NXBASE_WIDE_TARGET void RunWide(const PaddedWeights& w, const T* src, std::size_t count,
                                float* out) {
    WideWeights weights;
    for (int c = 0; c < 3; ++c) {
        for (int k = 0; k < detail::BatchTables::kChunks; ++k) {
            weights[c][k] = _mm512_broadcast_f32x8(_mm256_load_ps(w.chunks[c][k]));
        }
    }
    constexpr std::size_t kBlockBytes = 2 * kLanes * kSamples * sizeof(T);
    for (std::size_t i = 0; i + 2 * kLanes <= count; i += 2 * kLanes) {
        // Every line of a block some way ahead: the hardware's stream
        // prefetcher alone leaves compute and memory taking turns.
        const char* ahead = reinterpret_cast<const char*>(src + (i + kPrefetchSpectra) * kSamples);
        for (std::size_t line = 0; line < kBlockBytes; line += 64)
            __builtin_prefetch(ahead + line, 0, 3);
        __m512 sums[3];
        SumBlock16(weights, src + i * kSamples, sums);
        V16 v[3];
        std::memcpy(v, sums, sizeof v);
        if (kLab) {
            LabOfSums(w, v);
        } else {
            XyzOfSums(w, v);
        }
        std::memcpy(sums, v, sizeof v);
        InterleaveSixteen(sums, out + 3 * i);
    }
}

bool HasWideKernel() {
    static const bool wide = __builtin_cpu_supports("avx512f") &&
                             __builtin_cpu_supports("avx512dq") &&
                             __builtin_cpu_supports("avx512vl");
    return wide;
}
#pragma GCC diagnostic pop
#endif

template <bool kLab, class T>
void Run(const PaddedWeights& w, const T* src, std::size_t count, float* out);

// Spectra that are not contiguous floats (doubles, a table's rows): copied a
// piece at a time into a buffer that stays in the cache, fill(first, n,
// piece) writing spectra first..first+n-1, and each piece converted as an
// array.
template <bool kLab, class Fill>
void RunCopied(const PaddedWeights& w, std::size_t count, float* out, Fill fill) {
    constexpr std::size_t kPiece = 64;
    alignas(64) float piece[kPiece * kSamples];
    for (std::size_t first = 0; first < count; first += kPiece) {
        const std::size_t n = std::min(kPiece, count - first);
        fill(first, n, piece);
        Run<kLab>(w, static_cast<const float*>(piece), n, out + 3 * first);
    }
}

template <bool kLab>
void RunNarrow(const PaddedWeights& w, const float* src, std::size_t count, float* out) {
    kLab ? RunLab(w, src, count, out) : RunXyz(w, src, count, out);
}

// Doubles on the eight-lane path: rounded to float first, as the float path
// would see a float copy of them.
template <bool kLab>
void RunNarrow(const PaddedWeights& w, const double* src, std::size_t count, float* out) {
    RunCopied<kLab>(w, count, out, [src](std::size_t first, std::size_t n, float* piece) {
        std::copy(src + first * kSamples, src + (first + n) * kSamples, piece);
    });
}

// The kernel for the machine: sixteen spectra at a time with AVX-512, the
// rest (and machines without it) eight at a time.
template <bool kLab, class T>
void Run(const PaddedWeights& w, const T* src, std::size_t count, float* out) {
#ifdef NXBASE_BATCH_WIDE
    if (HasWideKernel()) {
        const std::size_t wide = count / (2 * kLanes) * (2 * kLanes);
        RunWide<kLab>(w, src, wide, out);
        src += wide * kSamples;
        out += 3 * wide;
        count -= wide;
    }
#endif
    RunNarrow<kLab>(w, src, count, out);
}

}  // namespace

namespace {

BatchWeights WeightsOf(const CMetryFilter& axFilter) {
    BatchWeights w;
    for (unsigned short c = 0; c < BatchWeights::kChannels; ++c) {
        std::memcpy(w.weights[c], axFilter.GetWeights(c), sizeof w.weights[c]);
        w.sums[c] = axFilter.GetWeightSum(c);
    }
    return w;
}

}  // namespace

ColorBatch::ColorBatch() : ColorBatch(WeightsOf(*CMetry::Instance()->GetLXYZFilter())) {}

ColorBatch::ColorBatch(const CMetryFilter& axFilter) : ColorBatch(WeightsOf(axFilter)) {}

ColorBatch::ColorBatch(const MeasuringCondition& axCondition)
    : ColorBatch(WeightsOf(
          CMetryFilter(Lichtart(axCondition.GetIllum()), Observer(axCondition.GetObserver())))) {}

ColorBatch::ColorBatch(const BatchWeights& axWeights) : amWeights(axWeights) {
    for (int c = 0; c < BatchWeights::kChannels; ++c) {
        float* chunks = &amTables.chunks[c][0][0];
        std::memcpy(chunks, amWeights.weights[c], sizeof(float) * 32);
        // The fifth chunk reads samples 28..35; 28..31 are summed in the fourth.
        for (int k = 0; k < 4; ++k) chunks[32 + k] = 0.0f;
        std::memcpy(chunks + 36, amWeights.weights[c] + 32, sizeof(float) * 4);
        amTables.sums[c] = amWeights.sums[c];
        amTables.inverseSums[c] = static_cast<float>(1.0 / amWeights.sums[c]);
    }
    amTables.sumY = amWeights.sums[1];
}

void ColorBatch::ToXYZ(const float* pSpectra, std::size_t alCount, float* pXYZ) const {
    Run<false>(amTables, pSpectra, alCount, pXYZ);
}

void ColorBatch::ToLab(const float* pSpectra, std::size_t alCount, float* pLab) const {
    Run<true>(amTables, pSpectra, alCount, pLab);
}

void ColorBatch::ToXYZ(const double* pSpectra, std::size_t alCount, float* pXYZ) const {
    Run<false>(amTables, pSpectra, alCount, pXYZ);
}

void ColorBatch::ToLab(const double* pSpectra, std::size_t alCount, float* pLab) const {
    Run<true>(amTables, pSpectra, alCount, pLab);
}

namespace {

// Spectra per thread below which starting a thread costs more than it saves.
constexpr std::size_t kMinPerThread = 16384;

template <bool kLab, class T>
void RunParallel(const PaddedWeights& w, const T* src, std::size_t count, float* out,
                 unsigned threads) {
    // Parts start at multiples of sixteen: every part but the last runs on
    // the wide kernel only.
    RunInParts(count, threads, kMinPerThread, 2 * kLanes, [&](std::size_t first, std::size_t n) {
        Run<kLab>(w, src + first * kSamples, n, out + 3 * first);
    });
}

}  // namespace

void ColorBatch::ToXYZParallel(const float* pSpectra, std::size_t alCount, float* pXYZ,
                               unsigned alThreads) const {
    RunParallel<false>(amTables, pSpectra, alCount, pXYZ, alThreads);
}

void ColorBatch::ToLabParallel(const float* pSpectra, std::size_t alCount, float* pLab,
                               unsigned alThreads) const {
    RunParallel<true>(amTables, pSpectra, alCount, pLab, alThreads);
}

void ColorBatch::ToXYZParallel(const double* pSpectra, std::size_t alCount, float* pXYZ,
                               unsigned alThreads) const {
    RunParallel<false>(amTables, pSpectra, alCount, pXYZ, alThreads);
}

void ColorBatch::ToLabParallel(const double* pSpectra, std::size_t alCount, float* pLab,
                               unsigned alThreads) const {
    RunParallel<true>(amTables, pSpectra, alCount, pLab, alThreads);
}

namespace {

template <bool kLab>
std::vector<float> RunTable(const PaddedWeights& w, const SpectraTable& axTable) {
    std::vector<float> out(3 * axTable.rows.size());
    RunCopied<kLab>(w, axTable.rows.size(), out.data(),
                    [&](std::size_t first, std::size_t n, float* piece) {
                        for (std::size_t i = 0; i < n; ++i) {
                            const auto& values = axTable.rows[first + i].values;
                            std::copy(values.begin(), values.end(), piece + i * kSamples);
                        }
                    });
    return out;
}

}  // namespace

std::vector<float> ColorBatch::ToXYZ(const SpectraTable& axTable) const {
    return RunTable<false>(amTables, axTable);
}

std::vector<float> ColorBatch::ToLab(const SpectraTable& axTable) const {
    return RunTable<true>(amTables, axTable);
}

float ColorBatch::WhitePoint(int alChannel) const {
    return 100.0f * amWeights.sums[alChannel] / amWeights.sums[1];
}

void SpectraToXYZ(const MeasuringCondition& axCondition, const float* pSpectra, std::size_t alCount,
                  float* pXYZ) {
    ColorBatch(axCondition).ToXYZ(pSpectra, alCount, pXYZ);
}

void SpectraToLab(const MeasuringCondition& axCondition, const float* pSpectra, std::size_t alCount,
                  float* pLab) {
    ColorBatch(axCondition).ToLab(pSpectra, alCount, pLab);
}

namespace detail {

void BatchCbrt(const float* pIn, std::size_t alCount, float* pOut) {
    RunCbrt(pIn, alCount, pOut);
}

}  // namespace detail
}  // namespace nxbase
