// Resampling spectra from one wavelength grid to another, following CIE 167:2005
// and ASTM E2022: a target wavelength that the source grid holds is copied
// exactly; between source wavelengths of equal spacing (at least six of them)
// the fifth-order Sprague interpolation is used, which keeps the curvature of
// smooth reflectance curves that linear interpolation flattens; on an uneven
// grid, or one of fewer than six points, linear interpolation. Target
// wavelengths outside the measured range take the nearest end value (CIE 15
// practice for reflectance: extrapolating a curve beyond its data invents
// colour). Sprague needs two points beyond each end of the data; they are
// extrapolated with the coefficients CIE 167 gives for that purpose.
//
// Resampling is linear in the values, so a resampler computes, once per grid
// pair, at most six weights per target wavelength and applies them to any
// number of spectra.
#ifndef NXBASE_RESAMPLE_H_
#define NXBASE_RESAMPLE_H_

#include <cstddef>
#include <string>
#include <vector>

#include "nxbase/export.h"

namespace nxbase {

// 380, 390, ..., 730 nm: the grid of the library's weights.
NXBASE_EXPORT std::vector<double> StandardWavelengths();

// The range a spectrum must cover to be given a colour. Holding the end values
// of data that stop short of it by more would invent colour: ASTM E308 holds
// them for a few bands, not across hundreds of nanometres.
constexpr double kVisibleFrom = 400.0;
constexpr double kVisibleTo = 700.0;
// "" when the increasing `wavelengths` reach from kVisibleFrom to kVisibleTo;
// else why not, in words ("covers 900..1000 nm, not the visible 400..700 nm").
NXBASE_EXPORT std::string VisibleCoverageProblem(const std::vector<double>& wavelengths);
// How far the end values are held to fill `from`..`to` nm ("the value at 400
// nm is held down to 380 nm"); "" when the grid reaches both.
NXBASE_EXPORT std::string HeldEnds(const std::vector<double>& wavelengths, double from, double to);

class NXBASE_EXPORT SpectralResampler {
  public:
    enum class Method {
        kSelection,  // every target inside the data is a source wavelength
        kSprague,
        kLinear
    };

    // Throws std::invalid_argument unless `source` has at least two finite,
    // strictly increasing wavelengths and `target` at least one finite one.
    explicit SpectralResampler(std::vector<double> source,
                               std::vector<double> target = StandardWavelengths());

    Method GetMethod() const { return amMethod; }
    // "as read", "Sprague" or "linear".
    const char* MethodName() const;
    std::size_t SourceSize() const { return amSource.size(); }
    std::size_t TargetSize() const { return amTaps.size(); }

    // pOut[t] for every target wavelength from pIn[0..SourceSize()).
    // Copied values are bit for bit the source values.
    void Resample(const float* pIn, float* pOut) const;
    // alCount spectra, source i at pIn + i*SourceSize(), target at
    // pOut + i*TargetSize().
    void ResampleMany(const float* pIn, std::size_t alCount, float* pOut) const;
    void Resample(const double* pIn, double* pOut) const;

  private:
    static constexpr int kMaxTaps = 6;
    struct Taps {
        int first = 0;  // first source index
        int count = 0;  // 1 for a copied value
        double weights[kMaxTaps] = {};
    };

    Taps SpragueTaps(std::size_t axInterval, double axFraction) const;
    Taps LinearTaps(std::size_t axInterval, double axFraction) const;

    std::vector<double> amSource;
    std::vector<Taps> amTaps;
    Method amMethod = Method::kSelection;
};

// One call: values on `wavelengths` to the 36-point grid.
NXBASE_EXPORT std::vector<float> ResampleToStandard(const std::vector<double>& wavelengths,
                                                    const std::vector<float>& values);

}  // namespace nxbase

#endif  // NXBASE_RESAMPLE_H_
