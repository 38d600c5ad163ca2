// ColorBatch: spectra to XYZ and CIELAB, eight spectra per step.
//
// A block of eight spectra is transposed so that each wavelength's eight
// samples lie side by side; every lane then sums its spectrum in wavelength
// order exactly as the one-at-a-time path does, with the same single-precision
// operations, and the compiler turns the lane loops into SIMD code. The code
// is target-independent (GCC/Clang vector extensions); on x86-64 GCC also
// builds an AVX2 clone of the kernel that is picked at load time.
#include "nxbase/colorbatch.h"

#include <cstdint>
#include <cstring>

#include "nxbase/cmetry.h"

// The vector helpers below are file-local and inlined; the ABI note GCC gives
// for 32-byte vector arguments without AVX does not apply to them.
#if defined(__GNUC__) && !defined(__clang__)
#pragma GCC diagnostic ignored "-Wpsabi"
#endif

namespace nxbase {
namespace {

constexpr int kSamples = BatchWeights::kSamples;
constexpr int kLanes = 8;

typedef float V8 __attribute__((vector_size(kLanes * sizeof(float))));
typedef std::int32_t I8 __attribute__((vector_size(kLanes * sizeof(std::int32_t))));

// CIE 15:2004 CIELAB constants, in single precision as LABVector uses them.
constexpr float kLabEpsilon = 0.008856f;  // t at or below: linear branch
constexpr float kLabKappa = 7.787f;
constexpr float kLabOffset = 16.0f / 116.0f;

// The kernels' helpers are forced inline so that each clone gets its own copy.
#define NXBASE_BATCH_INLINE inline __attribute__((always_inline))

#if defined(__GNUC__) && !defined(__clang__) && defined(__x86_64__) && !defined(NXBASE_BATCH_NO_CLONES)
#define NXBASE_BATCH_CLONES __attribute__((target_clones("avx2", "default")))
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

// Weighted sums of eight spectra (src holds 8 x 36 floats), in wavelength
// order per lane.
NXBASE_BATCH_INLINE void SumBlock(const BatchWeights& w, const float* src, V8 sums[3]) {
    alignas(32) float t[kSamples][kLanes];
    for (int s = 0; s < kLanes; ++s) {
        for (int k = 0; k < kSamples; ++k) t[k][s] = src[s * kSamples + k];
    }
    V8 x = Splat(0.0f);
    V8 y = Splat(0.0f);
    V8 z = Splat(0.0f);
    for (int k = 0; k < kSamples; ++k) {
        const V8 r = Load(t[k]);
        x += Splat(w.weights[0][k]) * r;
        y += Splat(w.weights[1][k]) * r;
        z += Splat(w.weights[2][k]) * r;
    }
    sums[0] = x;
    sums[1] = y;
    sums[2] = z;
}

// XYZ of a block: 100 * S / sum_1, as XYZVector.
NXBASE_BATCH_INLINE void XyzBlock(const BatchWeights& w, const float* src, V8 xyz[3]) {
    SumBlock(w, src, xyz);
    const V8 sumY = Splat(w.sums[1]);
    for (int c = 0; c < 3; ++c) xyz[c] = xyz[c] / sumY * Splat(100.0f);
}

// Lab of a block, as LABVector from XYZ with the same weights.
NXBASE_BATCH_INLINE void LabBlock(const BatchWeights& w, const float* src, V8 lab[3]) {
    V8 xyz[3];
    XyzBlock(w, src, xyz);
    const V8 sumY = Splat(w.sums[1]);
    V8 f[3];
    for (int c = 0; c < 3; ++c) {
        const V8 t = xyz[c] * sumY / Splat(w.sums[c]) / Splat(100.0f);
        f[c] = LabF(t);
    }
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
NXBASE_BATCH_INLINE void RunBlocks(const BatchWeights& w, const float* src, std::size_t count, float* out) {
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
void RunXyz(const BatchWeights& w, const float* src, std::size_t count, float* out) {
    RunBlocks<false>(w, src, count, out);
}

NXBASE_BATCH_CLONES
void RunLab(const BatchWeights& w, const float* src, std::size_t count, float* out) {
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

ColorBatch::ColorBatch() : amWeights(WeightsOf(*CMetry::Instance()->GetLXYZFilter())) {}

ColorBatch::ColorBatch(const CMetryFilter& axFilter) : amWeights(WeightsOf(axFilter)) {}

ColorBatch::ColorBatch(const MeasuringCondition& axCondition)
    : amWeights(WeightsOf(CMetryFilter(Lichtart(axCondition.GetIllum()),
                                       Observer(axCondition.GetObserver())))) {}

ColorBatch::ColorBatch(const BatchWeights& axWeights) : amWeights(axWeights) {}

void ColorBatch::ToXYZ(const float* pSpectra, std::size_t alCount, float* pXYZ) const {
    RunXyz(amWeights, pSpectra, alCount, pXYZ);
}

void ColorBatch::ToLab(const float* pSpectra, std::size_t alCount, float* pLab) const {
    RunLab(amWeights, pSpectra, alCount, pLab);
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
