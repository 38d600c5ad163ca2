// The AVX-512 batch kernels: two spectra per 16-float register, the same
// products and sums per lane as the eight-lane kernels (so the same results),
// half the instructions; the partial sums are reduced in registers as soon as
// neighbours are there, and every line of the input is fetched some blocks
// ahead, so that the sums overlap the reading from memory. Double input is
// rounded to float as it is read.
#include <immintrin.h>

#include "colorbatch_simd.h"

namespace nxbase::batch {
namespace {

// Chunk k (8 samples from offset at) of spectra a and b in one register, as
// floats; double input is rounded to float on loading, exactly as a float
// copy of it would be.
[[gnu::always_inline]] inline __m512 LoadPair(const float* a, const float* b) {
    return _mm512_insertf32x8(_mm512_castps256_ps512(_mm256_loadu_ps(a)), _mm256_loadu_ps(b), 1);
}

[[gnu::always_inline]] inline __m512 LoadPair(const double* a, const double* b) {
    return _mm512_insertf32x8(_mm512_castps256_ps512(_mm512_cvtpd_ps(_mm512_loadu_pd(a))),
                              _mm512_cvtpd_ps(_mm512_loadu_pd(b)), 1);
}

// One level of the lane reduction for the registers a and b: within each
// 128-bit group, neighbouring lanes are added, a's pairs first.
[[gnu::always_inline]] inline __m512 AddNeighbours(__m512 a, __m512 b) {
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
[[gnu::always_inline]] inline void SumPair(const WideWeights& weights, const T* a, __m512 acc[3]) {
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
[[gnu::always_inline]] inline void SumEight(const WideWeights& weights, const T* src,
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
[[gnu::always_inline]] inline void SumBlock16(const WideWeights& weights, const T* src,
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

template <bool kStream>
[[gnu::always_inline]] inline void InterleaveSixteen(const __m512 v[3], float* out) {
    for (int k = 0; k < 3; ++k) {
        const __m512 xy =
            _mm512_permutex2var_ps(v[0], _mm512_load_si512(kWideInterleave.xy[k]), v[1]);
        const __m512 triples =
            _mm512_permutex2var_ps(xy, _mm512_load_si512(kWideInterleave.z[k]), v[2]);
        if constexpr (kStream) {
            _mm512_stream_ps(out + 16 * k, triples);
        } else {
            _mm512_storeu_ps(out + 16 * k, triples);
        }
    }
}

// How far ahead of the block being summed its successors are fetched: far
// enough to cover the memory latency at the rate the kernel consumes them
// (measured best at 8 to 9 KiB for float spectra; 4 and 16 KiB were slower).
constexpr std::size_t kPrefetchSpectra = 64;

template <bool kLab, bool kStream, class T>
Seen RunWide(const PaddedWeights& w, const T* src, std::size_t count, float* out) {
    WideWeights weights;
    for (int c = 0; c < 3; ++c) {
        for (int k = 0; k < detail::BatchTables::kChunks; ++k) {
            weights[c][k] = _mm512_broadcast_f32x8(_mm256_load_ps(w.chunks[c][k]));
        }
    }
    constexpr std::size_t kBlockBytes = 2 * kLanes * kSamples * sizeof(T);
    Watch<V16> watch;
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
        watch.template Add<kLab>(v);
        std::memcpy(sums, v, sizeof v);
        InterleaveSixteen<kStream>(sums, out + 3 * i);
    }
    // Streamed stores are weakly ordered: fenced, so that whoever is told
    // the results are done sees them.
    if constexpr (kStream) _mm_sfence();
    return watch.Result();
}

template <bool kLab, bool kStream, class T>
Seen Run(const PaddedWeights& w, const T* src, std::size_t count, float* out) {
    return RunWide<kLab, kStream>(w, src, count, out);
}

}  // namespace

WideKernels Avx512Kernels() {
    return {{&Run<false, false, float>, &Run<true, false, float>, &Run<false, false, double>,
             &Run<true, false, double>},
            {&Run<false, true, float>, &Run<true, true, float>, &Run<false, true, double>,
             &Run<true, true, double>}};
}

}  // namespace nxbase::batch
