// Tristimulus values of spectra measured finer than 10 nm, computed at the
// spectra's own interval, as CIE 15 and ASTM E308 prescribe for 1 nm and 5 nm
// data, instead of thinning them to the 10 nm points first (which costs up to
// several ΔE00 for spectra with narrow features, such as lamp lines).
//
// Method (doc/finegrid.md): on a regular grid of step h < 10 nm,
//   X_c = k Σ S(λ) cmf_c(λ) R(λ),  k = 100 / Σ S(λ) ȳ(λ),
// summed over every λ = λ_0 + j h within 360..830 nm, the observer's range;
// R is held at its end values outside the measured range (the sums of the
// unmeasured wavelengths are added to the end samples' weights, as ASTM E308
// does), and samples outside 360..830 nm get no weight. The illuminant is
// interpolated linearly between its table points and the colour-matching
// functions between their 1 nm values. On an uneven grid with a step below
// 10 nm somewhere (a file that samples a feature finely), the sum runs over
// every whole nanometre of 360..830 nm with R interpolated linearly between
// its samples, instead of thinning the fine part to 10 nm. Weights are
// double; the perfect diffuser gives Y = 100 exactly up to rounding. Spectra
// on a 10 nm or coarser grid stay on the ASTM E308 tables of the 36-point
// path.
//
// An object is immutable after construction: any number of threads may use
// one at once.
#ifndef NXBASE_FINEGRID_H_
#define NXBASE_FINEGRID_H_

#include <array>
#include <cstddef>
#include <vector>

#include "nxbase/export.h"
#include "toolkit/system.h"

class MeasuringCondition;

namespace nxbase {

// CIE 1976 L*a*b* of XYZ against a white, in double, with the library's
// CIELAB constants (t > 0.008856: cube root, else 7.787 t + 16/116), and
// its inverse (f > 0.206893034423: cube, else linear). A colour with a
// component that is not finite or whose ratio to the white overflows, or a
// white with a component that is not positive, normal and finite, gives NaN.
NXBASE_EXPORT std::array<double, 3> CielabOf(const std::array<double, 3>& axXYZ,
                                             const std::array<double, 3>& axWhite);
// CielabOf of alCount colours, three doubles each, in place: the same values,
// several times faster than a call per colour.
NXBASE_EXPORT void CielabInPlace(double* pXYZ, std::size_t alCount,
                                 const std::array<double, 3>& axWhite);
NXBASE_EXPORT std::array<double, 3> XyzOfCielab(const std::array<double, 3>& axLab,
                                                const std::array<double, 3>& axWhite);

class NXBASE_EXPORT FineGridTristimulus {
  public:
    // True for at least three increasing wavelengths that form a regular grid
    // (equal steps within 0.01 nm) with a step below 10 nm, or an uneven one
    // with some step below 10 nm: the grids this class is for.
    static bool Applies(const std::vector<double>& wavelengths);

    // Weights for the illuminant and observer of `axCondition` on
    // `wavelengths`. Throws std::invalid_argument unless Applies(wavelengths).
    FineGridTristimulus(const MeasuringCondition& axCondition, std::vector<double> wavelengths);

    const std::vector<double>& Wavelengths() const { return amWavelengths; }
    // The weight of sample k in channel c (0 X, 1 Y, 2 Z).
    double Weight(int channel, std::size_t k) const { return amWeights[channel][k]; }
    // XYZ of the perfect diffuser (R = 1 everywhere): Y = 100.
    const std::array<double, 3>& White() const { return amWhite; }

    // XYZ of one spectrum (Wavelengths().size() values, reflectance factors).
    std::array<double, 3> ToXYZ(const float* pValues) const;
    // CIE 1976 L*a*b* relative to White(): CielabOf(ToXYZ(...), White()).
    std::array<double, 3> ToLab(const float* pValues) const;
    // alCount spectra, spectrum i at pSpectra + i * Wavelengths().size(), into
    // pOut[3i..3i+2] as float: the one-spectrum values, narrowed (a value
    // beyond float's range becomes infinite, NaN stays NaN).
    void ToXYZ(const float* pSpectra, std::size_t alCount, float* pOut) const;
    void ToLab(const float* pSpectra, std::size_t alCount, float* pOut) const;
    // Machines with AVX2 or AVX-512 give the same bits; without AVX2 (no
    // fused multiply-add) the last bits may differ, by about 1e-16 relative.
    // The same with the spectra split over alThreads threads (0: one per
    // core), the calling thread one of them; identical results. Counts too
    // small to gain from a thread (about 600 000 values per thread) stay on
    // the calling thread.
    void ToXYZParallel(const float* pSpectra, std::size_t alCount, float* pOut,
                       unsigned alThreads = 0) const;
    void ToLabParallel(const float* pSpectra, std::size_t alCount, float* pOut,
                       unsigned alThreads = 0) const;

  private:
    void Sum(const float* pSpectra, std::size_t alCount, double* pXYZ) const;
    template <bool kLab>
    void Convert(const float* pSpectra, std::size_t alCount, float* pOut) const;
    template <bool kLab>
    void ConvertParallel(const float* pSpectra, std::size_t alCount, float* pOut,
                         unsigned alThreads) const;

    std::vector<double> amWavelengths;
    std::array<std::vector<double>, 3> amWeights;
    std::array<double, 3> amWhite{};
};

namespace detail {
// Switches the kernels of the fine grid and CIELAB to those of `isa` (false
// when the machine lacks it or they are not built), as UseBatchIsa does for
// the batch: for the tests only, never while a conversion runs.
NXBASE_EXPORT bool UseFineGridIsa(toolkit::VectorIsa isa);
}  // namespace detail

}  // namespace nxbase

#endif  // NXBASE_FINEGRID_H_
