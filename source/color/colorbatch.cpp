// ColorBatch: spectra to XYZ and CIELAB, eight spectra per step.
//
// Each spectrum is multiplied chunk by chunk with the weight tables (laid out
// in 8-float chunks), and the partial sums of eight spectra are reduced across
// lanes together, so that every step works on full 8-float vectors and no
// spectrum is transposed. The colour vectors sum one spectrum in the same
// order (detail::LaneSums) and the file is compiled without floating-point
// contraction, so XYZ agree bit for bit and Lab up to the cube root. The code
// is target-independent (GCC/Clang vector extensions); on x86-64 GCC also
// builds an x86-64-v3 (AVX2) clone of the kernels that is picked at load time.
#include "nxbase/colorbatch.h"

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <system_error>
#include <thread>
#include <vector>

#include "nxbase/cmetry.h"
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
static_assert(detail::BatchTables::kChunks * kLanes - 4 == kSamples, "five chunks, the last overlapping");

typedef float V8 __attribute__((vector_size(kLanes * sizeof(float))));
typedef std::int32_t I8 __attribute__((vector_size(kLanes * sizeof(std::int32_t))));

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

NXBASE_BATCH_INLINE V8 Splat(float v) { return V8{} + v; }

NXBASE_BATCH_INLINE V8 Load(const float* p) {
    V8 v;
    std::memcpy(&v, p, sizeof v);
    return v;
}

NXBASE_BATCH_INLINE void Store(float* p, V8 v) { std::memcpy(p, &v, sizeof v); }

// Cube root of positive normal floats: an exponent-thirding first guess
// (relative error below 4%) refined by two Halley steps (cubic convergence:
// 4e-2 -> 2e-5 -> below float resolution). Zero, negative and non-finite
// lanes give meaningless values that callers mask out.
NXBASE_BATCH_INLINE V8 CbrtV(V8 t) {
    I8 bits;
    std::memcpy(&bits, &t, sizeof bits);
    // bits/3 + magic, with the division done in float (exact enough for a guess).
    const V8 third = __builtin_convertvector(bits, V8) * Splat(1.0f / 3.0f);
    I8 guessBits = __builtin_convertvector(third, I8) + 0x2a5137a0;
    V8 y;
    std::memcpy(&y, &guessBits, sizeof y);
    for (int i = 0; i < 2; ++i) {
        // Halley written as a correction, so that its rounding stays small.
        const V8 y3 = y * y * y;
        y = y + y * (t - y3) / (y3 + y3 + t);
    }
    return y;
}

// f(t) of CIELAB: t^(1/3) above kLabEpsilon, 7.787 t + 16/116 at or below.
NXBASE_BATCH_INLINE V8 LabF(V8 t) {
    const I8 cube = t > Splat(kLabEpsilon);  // all ones where the cube root applies
    const V8 root = CbrtV(t);
    const V8 linear = Splat(kLabKappa) * t + Splat(kLabOffset);
    I8 rootBits;
    I8 linearBits;
    std::memcpy(&rootBits, &root, sizeof rootBits);
    std::memcpy(&linearBits, &linear, sizeof linearBits);
    const I8 mixed = (rootBits & cube) | (linearBits & ~cube);
    V8 out;
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

// XYZ of a block: 100 * S / sum_1, as XYZVector.
NXBASE_BATCH_INLINE void XyzBlock(const PaddedWeights& w, const float* src, V8 xyz[3]) {
    SumBlock(w, src, xyz);
    const V8 sumY = Splat(w.sumY);
    for (int c = 0; c < 3; ++c) xyz[c] = xyz[c] / sumY * Splat(100.0f);
}

// Lab of a block, as LABVector from XYZ with the same weights and the same
// operations: t = X * sum_1 / sum_c / 100.
NXBASE_BATCH_INLINE void LabBlock(const PaddedWeights& w, const float* src, V8 lab[3]) {
    V8 xyz[3];
    XyzBlock(w, src, xyz);
    const V8 sumY = Splat(w.sumY);
    V8 f[3];
    for (int c = 0; c < 3; ++c) f[c] = LabF(xyz[c] * sumY / Splat(w.sums[c]) / Splat(100.0f));
    lab[0] = Splat(116.0f) * f[1] - Splat(16.0f);
    lab[1] = Splat(500.0f) * (f[0] - f[1]);
    lab[2] = Splat(200.0f) * (f[1] - f[2]);
}

NXBASE_BATCH_INLINE void Interleave(const V8 v[3], float* out, int lanes) {
    alignas(32) float lane[3][kLanes];
    for (int c = 0; c < 3; ++c) Store(lane[c], v[c]);
    for (int s = 0; s < lanes; ++s) {
        for (int c = 0; c < 3; ++c) out[3 * s + c] = lane[c][s];
    }
}

template <bool kLab>
NXBASE_BATCH_INLINE void RunBlocks(const PaddedWeights& w, const float* src, std::size_t count, float* out) {
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
    : ColorBatch(WeightsOf(CMetryFilter(Lichtart(axCondition.GetIllum()),
                                        Observer(axCondition.GetObserver())))) {}

ColorBatch::ColorBatch(const BatchWeights& axWeights) : amWeights(axWeights) {
    for (int c = 0; c < BatchWeights::kChannels; ++c) {
        float* chunks = &amTables.chunks[c][0][0];
        std::memcpy(chunks, amWeights.weights[c], sizeof(float) * 32);
        // The fifth chunk reads samples 28..35; 28..31 are summed in the fourth.
        for (int k = 0; k < 4; ++k) chunks[32 + k] = 0.0f;
        std::memcpy(chunks + 36, amWeights.weights[c] + 32, sizeof(float) * 4);
        amTables.sums[c] = amWeights.sums[c];
    }
    amTables.sumY = amWeights.sums[1];
}

void ColorBatch::ToXYZ(const float* pSpectra, std::size_t alCount, float* pXYZ) const {
    RunXyz(amTables, pSpectra, alCount, pXYZ);
}

void ColorBatch::ToLab(const float* pSpectra, std::size_t alCount, float* pLab) const {
    RunLab(amTables, pSpectra, alCount, pLab);
}

namespace {

// Spectra per thread below which starting a thread costs more than it saves.
constexpr std::size_t kMinPerThread = 16384;

// Runs fRun(first, count) over [0, alCount) in up to alThreads parts whose
// starts are multiples of eight.
template <typename Run>
void SplitOverThreads(std::size_t alCount, unsigned alThreads, Run fRun) {
    unsigned threads = alThreads ? alThreads : std::max(1u, std::thread::hardware_concurrency());
    threads = static_cast<unsigned>(
        std::min<std::size_t>(threads, std::max<std::size_t>(1, alCount / kMinPerThread)));
    if (threads <= 1) {
        fRun(0, alCount);
        return;
    }
    const std::size_t part = (alCount / threads + kLanes - 1) / kLanes * kLanes;
    std::vector<std::thread> workers;
    std::size_t next = part;  // the calling thread takes [0, part)
    for (unsigned t = 1; t < threads && next < alCount; ++t) {
        const std::size_t first = next;
        const std::size_t count = std::min(part, alCount - first);
        try {
            workers.emplace_back([=] { fRun(first, count); });
        } catch (const std::system_error&) {
            fRun(first, count);  // no thread to be had: do it here
        }
        next += count;
    }
    if (next < alCount) fRun(next, alCount - next);
    fRun(0, std::min(part, alCount));
    for (std::thread& worker : workers) worker.join();
}

}  // namespace

void ColorBatch::ToXYZParallel(const float* pSpectra, std::size_t alCount, float* pXYZ,
                               unsigned alThreads) const {
    SplitOverThreads(alCount, alThreads, [&](std::size_t first, std::size_t count) {
        RunXyz(amTables, pSpectra + first * kSamples, count, pXYZ + 3 * first);
    });
}

void ColorBatch::ToLabParallel(const float* pSpectra, std::size_t alCount, float* pLab,
                               unsigned alThreads) const {
    SplitOverThreads(alCount, alThreads, [&](std::size_t first, std::size_t count) {
        RunLab(amTables, pSpectra + first * kSamples, count, pLab + 3 * first);
    });
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

void BatchCbrt(const float* pIn, std::size_t alCount, float* pOut) { RunCbrt(pIn, alCount, pOut); }

}  // namespace detail
}  // namespace nxbase
