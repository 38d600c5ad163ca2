// ColorBatch turns contiguous arrays of spectra into XYZ or CIELAB under one
// illuminant and observer, many spectra per call. An object is immutable after
// construction: any number of threads may use one at once. Nothing is checked
// or thrown: the caller passes valid arrays of the stated sizes.
//
// A spectrum is 36 floats, 380..730 nm in 10 nm steps (reflectance factors,
// white = 1.0); spectrum i of an array starts at float 36*i. Results are three
// floats per spectrum at float 3*i. The batch computes what XYZVector and
// LABVector (CIE 1976, type 0) compute from a ReflectanceSpectrum with the same
// filter: the weighted sums are formed in the same order with the same single
// precision operations, so XYZ agree bit for bit, and Lab differs only by the
// scaling of t (the weighted sum S times 1 / sum_c, where the objects compute
// X = S / sum_1 * 100 and then t = X * sum_1 / sum_c / 100) and the cube root, a
// vectorised approximation agreeing with the objects' pow(t, 0.33333334) to a
// unit or two in the last place (within 1e-5 of the vector's length).
#ifndef NXBASE_COLORBATCH_H_
#define NXBASE_COLORBATCH_H_

#include <cstddef>
#include <limits>
#include <vector>

#include "nxbase/export.h"
#include "nxbase/spectralgrid.h"
#include "toolkit/system.h"

class CMetryFilter;
class MeasuringCondition;

namespace nxbase {

struct SpectraTable;

namespace detail {
// The weights as the kernels read them: per channel five 8-float chunks
// covering samples 0..31 and 28..35 (the fifth chunk's first four weights
// zero), and the normalising factors.
struct BatchTables {
    static constexpr int kChunks = 5;
    alignas(32) float chunks[3][kChunks][8] = {};
    float sumY = 0.0f;  // XYZ = S / sumY * 100
    float sums[3] = {};
    float inverseSums[3] = {};  // Lab: t = S * (1 / sums[c])
};
}  // namespace detail

// The X, Y, Z weight tables of one illuminant and observer on the 36-point
// grid, with the sums the filters report for them.
struct NXBASE_EXPORT BatchWeights {
    static constexpr int kChannels = 3;
    static constexpr int kSamples = kSpectrumSize;
    float weights[kChannels][kSamples] = {};
    float sums[kChannels] = {};  // sum of each table; sums[1] scales Y of white to 100
};

// What a conversion saw of its results as it wrote them: the brightest
// result's Y (ToXYZ, white = 100) or L* (ToLab), results that are NaN
// skipped, -infinity when there are none; and whether every component of
// every result is finite. Reflectance factors give Y up to about 100 (more
// for fluorescent samples); percentages give up to 10 000. Gathering it
// costs a few per cent of the arithmetic, far less than a second pass over
// the results.
struct BatchRange {
    float brightest = -std::numeric_limits<float>::infinity();
    bool allFinite = true;
};

class NXBASE_EXPORT ColorBatch {
  public:
    // The weights of the current colorimetric filter of the CMetry facade.
    ColorBatch();
    // The weights of `axFilter`.
    explicit ColorBatch(const CMetryFilter& axFilter);
    // The weights for the illuminant and observer of `axCondition`.
    explicit ColorBatch(const MeasuringCondition& axCondition);
    // Caller's own tables; sums[1] must not be 0.
    explicit ColorBatch(const BatchWeights& axWeights);

    // XYZ (white Y = 100) of alCount spectra: pXYZ[3i + c] = 100 * S_c / sum_1,
    // S_c the weighted sum of spectrum i against table c. pSpectra and pXYZ
    // must not overlap. Every array form returns the BatchRange of its
    // results. A call (or a thread's part) with 1 MiB of results or more
    // (87 382 spectra) writes them around the cache, on machines with
    // AVX-512: from memory that is up to a tenth faster, but the results are
    // then not in the cache for whoever reads them next.
    BatchRange ToXYZ(const float* pSpectra, std::size_t alCount, float* pXYZ) const;

    // CIE 1976 L*a*b* (CIE 15:2004, formulas as in LABVector) of alCount
    // spectra relative to the white point of the weights; pLab[3i..3i+2] =
    // L, a, b. Always CIE 1976: the process-wide DIN99 setting of LABVector
    // does not apply here. pSpectra and pLab must not overlap.
    BatchRange ToLab(const float* pSpectra, std::size_t alCount, float* pLab) const;

    // As above for spectra held as doubles: each value is rounded to float
    // as it is read, so the results equal those of a float copy of the array
    // without making one.
    BatchRange ToXYZ(const double* pSpectra, std::size_t alCount, float* pXYZ) const;
    BatchRange ToLab(const double* pSpectra, std::size_t alCount, float* pLab) const;

    // As ToXYZ and ToLab, with the array split over alThreads threads (0: one
    // per core); the calling thread takes one part. Results are identical to
    // the one-thread forms. Small counts, or threads that cannot be started,
    // are done on the calling thread.
    BatchRange ToXYZParallel(const float* pSpectra, std::size_t alCount, float* pXYZ,
                             unsigned alThreads = 0) const;
    BatchRange ToLabParallel(const float* pSpectra, std::size_t alCount, float* pLab,
                             unsigned alThreads = 0) const;
    BatchRange ToXYZParallel(const double* pSpectra, std::size_t alCount, float* pXYZ,
                             unsigned alThreads = 0) const;
    BatchRange ToLabParallel(const double* pSpectra, std::size_t alCount, float* pLab,
                             unsigned alThreads = 0) const;

    // XYZ or Lab of every row of a table read from a file (its values on the
    // 36-point grid), three floats per row in row order: the same numbers
    // as the array forms give for the rows' values.
    std::vector<float> ToXYZ(const SpectraTable& axTable) const;
    std::vector<float> ToLab(const SpectraTable& axTable) const;

    // White point Xn, Yn (= 100), Zn of the weights.
    float WhitePoint(int alChannel) const;
    const BatchWeights& Weights() const { return amWeights; }

  private:
    BatchWeights amWeights;
    detail::BatchTables amTables;
};

// One-call forms for the weights of a measuring condition's illuminant and
// observer. Preparing the weights costs about as much as a few hundred
// spectra; keep a ColorBatch for repeated calls.
NXBASE_EXPORT void SpectraToXYZ(const MeasuringCondition& axCondition, const float* pSpectra,
                                std::size_t alCount, float* pXYZ);
NXBASE_EXPORT void SpectraToLab(const MeasuringCondition& axCondition, const float* pSpectra,
                                std::size_t alCount, float* pLab);

namespace detail {
// The batch cube root: pOut[i] = t^(1/3) for positive normal pIn[i], to a few
// units in the last place. Exposed for the tests.
NXBASE_EXPORT void BatchCbrt(const float* pIn, std::size_t alCount, float* pOut);
// The instruction sets the kernels are built for (the toolkit's, widest
// last). The widest the machine has is used; UseBatchIsa switches (false
// when the machine lacks it or the kernel is not built), for the tests only:
// never while a conversion runs.
using BatchIsa = toolkit::VectorIsa;
NXBASE_EXPORT bool UseBatchIsa(BatchIsa isa);
NXBASE_EXPORT BatchIsa BatchIsaInUse();
}  // namespace detail

}  // namespace nxbase

#endif  // NXBASE_COLORBATCH_H_
