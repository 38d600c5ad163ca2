// ColorBatch: spectra to XYZ and CIELAB, eight spectra per step.
//
// Each spectrum is multiplied chunk by chunk with the weight tables (laid out
// in 8-float chunks), and the partial sums of eight spectra are reduced across
// lanes together, so that every step works on full 8-float vectors and no
// spectrum is transposed. The colour vectors sum one spectrum in the same
// order (detail::LaneSums) and the kernels are compiled without
// floating-point contraction, so XYZ agree bit for bit and Lab up to the cube
// root. The kernels are target-independent (GCC/Clang vector extensions) and
// built once per instruction set in files of their own (colorbatch_*.cpp); on
// x86-64 this file picks, once, the AVX2 ones where the machine has AVX2 and
// the AVX-512 ones (sixteen spectra per step) where it has AVX-512. It also
// splits work across threads and feeds spectra that are not contiguous floats.
#include "nxbase/colorbatch.h"

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <limits>
#include <mutex>

#include "colorbatch_kernels.h"
#include "nxbase/cmetry.h"
#include "nxbase/spectrafile.h"
#include "nxbase/thread.h"

namespace nxbase {
namespace {

using batch::kLanes;
using batch::kSamples;
using batch::PaddedWeights;

// The kernels in use: chosen for the machine at first use.
struct Chosen {
    detail::BatchIsa isa = detail::BatchIsa::kBaseline;
    batch::NarrowKernels narrow = batch::BaselineKernels();
    batch::WideKernels wide{};
};

// The widest set the machine has of those built here.
detail::BatchIsa Widest() {
#ifdef NXBASE_BATCH_X86_KERNELS
    return toolkit::MachineVectorIsa();
#else
    return detail::BatchIsa::kBaseline;
#endif
}

Chosen Choose(detail::BatchIsa isa) {
    Chosen chosen;
    chosen.isa = isa;
#ifdef NXBASE_BATCH_X86_KERNELS
    if (isa != detail::BatchIsa::kBaseline) chosen.narrow = batch::Avx2Kernels();
    if (isa == detail::BatchIsa::kAvx512) chosen.wide = batch::Avx512Kernels();
#endif
    return chosen;
}

Chosen& InUse() {
    static Chosen chosen = Choose(Widest());
    return chosen;
}

template <bool kLab, class T>
batch::Seen Run(const PaddedWeights& w, const T* src, std::size_t count, float* out);

// What a run of no spectra saw.
constexpr batch::Seen kNothingSeen{-std::numeric_limits<float>::infinity(), true};

// What two runs saw together.
batch::Seen Merged(batch::Seen a, batch::Seen b) {
    return {std::max(a.brightest, b.brightest), a.finite && b.finite};
}

BatchRange RangeOf(batch::Seen seen) {
    return {seen.brightest, seen.finite};
}

// Spectra that are not contiguous floats (doubles, a table's rows): copied a
// piece at a time into a buffer that stays in the cache, fill(first, n,
// piece) writing spectra first..first+n-1, and each piece converted as an
// array.
template <bool kLab, class Fill>
batch::Seen RunCopied(const PaddedWeights& w, std::size_t count, float* out, Fill fill) {
    constexpr std::size_t kPiece = 64;
    alignas(64) float piece[kPiece * kSamples];
    batch::Seen seen = kNothingSeen;
    for (std::size_t first = 0; first < count; first += kPiece) {
        const std::size_t n = std::min(kPiece, count - first);
        fill(first, n, piece);
        seen = Merged(seen, Run<kLab>(w, static_cast<const float*>(piece), n, out + 3 * first));
    }
    return seen;
}

template <bool kLab>
batch::Seen RunNarrow(const PaddedWeights& w, const float* src, std::size_t count, float* out) {
    const batch::NarrowKernels& kernels = InUse().narrow;
    return (kLab ? kernels.lab : kernels.xyz)(w, src, count, out);
}

// Doubles on the eight-lane path: rounded to float first, as the float path
// would see a float copy of them.
template <bool kLab>
batch::Seen RunNarrow(const PaddedWeights& w, const double* src, std::size_t count, float* out) {
    return RunCopied<kLab>(w, count, out, [src](std::size_t first, std::size_t n, float* piece) {
        std::copy(src + first * kSamples, src + (first + n) * kSamples, piece);
    });
}

template <bool kLab>
batch::Seen RunWide(const batch::WideForms& wide, const PaddedWeights& w, const float* src,
                    std::size_t count, float* out) {
    return (kLab ? wide.lab : wide.xyz)(w, src, count, out);
}

template <bool kLab>
batch::Seen RunWide(const batch::WideForms& wide, const PaddedWeights& w, const double* src,
                    std::size_t count, float* out) {
    return (kLab ? wide.labDouble : wide.xyzDouble)(w, src, count, out);
}

// Results of this many bytes or more are written around the cache: they
// would not stay in a core's cache beside the twelve times as many bytes of
// spectra streaming through it, and a store through the cache first reads
// each line it writes: a twelfth more to read than the spectra alone.
constexpr std::size_t kStreamFromBytes = std::size_t{1} << 20;

// How many spectra's results come before the first 64-byte line boundary in
// `out`: fewer than 16 (a line holds whole triples every 16 spectra), or 16
// for an address no triple starts a line at (not a float's alignment).
std::size_t SpectraBeforeALine(const float* out) {
    const auto address = reinterpret_cast<std::uintptr_t>(out);
    std::size_t spectra = 0;
    while (spectra < 2 * kLanes && (address + spectra * 3 * sizeof(float)) % 64 != 0) ++spectra;
    return spectra;
}

// Sixteen spectra at a time where the machine can, the rest eight at a time;
// a large result from its first whole line on in whole lines around the
// cache. Every kernel gives the same bits.
template <bool kLab, class T>
batch::Seen Run(const PaddedWeights& w, const T* src, std::size_t count, float* out) {
    const Chosen& chosen = InUse();
    if (chosen.wide.cached.xyz == nullptr) return RunNarrow<kLab>(w, src, count, out);
    const std::size_t before =
        count * 3 * sizeof(float) >= kStreamFromBytes ? SpectraBeforeALine(out) : 2 * kLanes;
    const bool stream = before < 2 * kLanes;
    const std::size_t head = stream ? before : 0;
    batch::Seen seen = head ? RunNarrow<kLab>(w, src, head, out) : kNothingSeen;
    const std::size_t wide = (count - head) / (2 * kLanes) * (2 * kLanes);
    seen = Merged(seen, RunWide<kLab>(stream ? chosen.wide.streamed : chosen.wide.cached, w,
                                      src + head * kSamples, wide, out + 3 * head));
    const std::size_t done = head + wide;
    return Merged(seen, RunNarrow<kLab>(w, src + done * kSamples, count - done, out + 3 * done));
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

BatchRange ColorBatch::ToXYZ(const float* pSpectra, std::size_t alCount, float* pXYZ) const {
    return RangeOf(Run<false>(amTables, pSpectra, alCount, pXYZ));
}

BatchRange ColorBatch::ToLab(const float* pSpectra, std::size_t alCount, float* pLab) const {
    return RangeOf(Run<true>(amTables, pSpectra, alCount, pLab));
}

BatchRange ColorBatch::ToXYZ(const double* pSpectra, std::size_t alCount, float* pXYZ) const {
    return RangeOf(Run<false>(amTables, pSpectra, alCount, pXYZ));
}

BatchRange ColorBatch::ToLab(const double* pSpectra, std::size_t alCount, float* pLab) const {
    return RangeOf(Run<true>(amTables, pSpectra, alCount, pLab));
}

namespace {

// Spectra per thread below which starting a thread costs more than it saves.
constexpr std::size_t kMinPerThread = 16384;

template <bool kLab, class T>
batch::Seen RunParallel(const PaddedWeights& w, const T* src, std::size_t count, float* out,
                        unsigned threads) {
    std::mutex mutex;
    batch::Seen seen = kNothingSeen;
    // Parts start at multiples of sixteen: every part but the last runs on
    // the wide kernel only.
    RunInParts(count, threads, kMinPerThread, 2 * kLanes, [&](std::size_t first, std::size_t n) {
        const batch::Seen part = Run<kLab>(w, src + first * kSamples, n, out + 3 * first);
        std::lock_guard<std::mutex> lock(mutex);
        seen = Merged(seen, part);
    });
    return seen;
}

}  // namespace

BatchRange ColorBatch::ToXYZParallel(const float* pSpectra, std::size_t alCount, float* pXYZ,
                                     unsigned alThreads) const {
    return RangeOf(RunParallel<false>(amTables, pSpectra, alCount, pXYZ, alThreads));
}

BatchRange ColorBatch::ToLabParallel(const float* pSpectra, std::size_t alCount, float* pLab,
                                     unsigned alThreads) const {
    return RangeOf(RunParallel<true>(amTables, pSpectra, alCount, pLab, alThreads));
}

BatchRange ColorBatch::ToXYZParallel(const double* pSpectra, std::size_t alCount, float* pXYZ,
                                     unsigned alThreads) const {
    return RangeOf(RunParallel<false>(amTables, pSpectra, alCount, pXYZ, alThreads));
}

BatchRange ColorBatch::ToLabParallel(const double* pSpectra, std::size_t alCount, float* pLab,
                                     unsigned alThreads) const {
    return RangeOf(RunParallel<true>(amTables, pSpectra, alCount, pLab, alThreads));
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
    InUse().narrow.cbrt(pIn, alCount, pOut);
}

bool UseBatchIsa(BatchIsa isa) {
    if (isa > Widest()) return false;
    InUse() = Choose(isa);
    return true;
}

BatchIsa BatchIsaInUse() {
    return InUse().isa;
}

}  // namespace detail
}  // namespace nxbase
