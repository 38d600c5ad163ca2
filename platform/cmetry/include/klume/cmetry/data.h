// The CIE data objects of the colorimetry data provider: illuminants,
// observers and density standards. Every object is immutable once made, so
// any thread may read it without synchronisation.
#ifndef KLUME_CMETRY_DATA_H_
#define KLUME_CMETRY_DATA_H_

#include <array>
#include <boost/shared_ptr.hpp>
#include <string>
#include <vector>

#include "nxbase/export.h"
#include "nxbase/spectralgrid.h"

namespace klume {
namespace cmetry {

// The grid on which weights and density products are delivered: 36 samples,
// 380..730 nm in 10 nm steps (index i is 380 + 10 i nm).
constexpr int kSampleCount = nxbase::kSpectrumSize;
constexpr int kFirstWavelength = nxbase::kFirstWavelength;
constexpr int kLastWavelength = nxbase::kLastWavelength;
constexpr int kWavelengthStep = nxbase::kWavelengthStep;

using SampleTable = std::array<double, kSampleCount>;

// A light source: relative spectral power on the source table's own grid.
class NXBASE_EXPORT IIlluminant {
  public:
    virtual ~IIlluminant();
    // Repository name: "A", "C", "D50", "D55", "D65", "D75", "E", "FL1".."FL12",
    // or the file stem of an installed illuminant.
    virtual const std::string& GetName() const = 0;
    // Descriptive text, e.g. "CIE standard illuminant D65".
    virtual const std::string& GetDescription() const = 0;
    // Table wavelengths in nm, strictly ascending, at least two.
    virtual const std::vector<double>& GetWavelengths() const = 0;
    // Relative spectral power, one per wavelength; only ratios matter.
    virtual const std::vector<double>& GetPowers() const = 0;

    // Power at `nm`: linear interpolation between table points, the end values
    // held beyond the table (CIE 15 interpolation for the D series, used here
    // for every illuminant).
    double GetPower(double nm) const;
};

// A standard colorimetric observer: colour-matching functions at 1 nm.
class NXBASE_EXPORT IObserver {
  public:
    virtual ~IObserver();
    // Repository name: "2" (CIE 1931) or "10" (CIE 1964).
    virtual const std::string& GetName() const = 0;
    virtual const std::string& GetDescription() const = 0;
    // Field size in degrees (2 or 10).
    virtual int GetFieldSize() const = 0;
    // First wavelength (nm) and count of the 1 nm tables.
    virtual int GetFirstWavelength() const = 0;
    virtual int GetSampleCount() const = 0;
    // x-bar, y-bar, z-bar for channel 0, 1, 2: GetSampleCount() values from
    // GetFirstWavelength() in 1 nm steps. REQUIRES: 0 <= channel <= 2.
    virtual const double* GetCMF(int channel) const = 0;
};

// A density standard: one linear spectral product per channel on the
// 36-sample grid, each normalised to 1.0 at its peak.
class NXBASE_EXPORT IDensityStandard {
  public:
    virtual ~IDensityStandard();
    // Repository name, e.g. "Status E".
    virtual const std::string& GetName() const = 0;
    // Number of channels; 3 for the status densities (0 = red filter, cyan
    // density; 1 = green, magenta; 2 = blue, yellow).
    virtual int GetChannelCount() const = 0;
    // Column name of the channel in the source table ("red", "green", "blue").
    // REQUIRES: 0 <= channel < GetChannelCount().
    virtual const std::string& GetChannelName(int channel) const = 0;
    // Linear spectral product 10^(P - 5) of the channel (P the ISO 5-3 log10
    // product, peak 5.000); 0.0 where the table has no entry.
    // REQUIRES: 0 <= channel < GetChannelCount().
    virtual const SampleTable& GetProducts(int channel) const = 0;
};

// An illuminant from a table (as IIlluminant defines it). Empty pointer, with
// the reason in *error, when the name is empty, the sizes differ, there are
// fewer than two points, the wavelengths are not strictly ascending, a value
// is not finite or negative, or the light has no power anywhere in the
// 360..780 nm range the weights are computed over.
NXBASE_EXPORT boost::shared_ptr<IIlluminant> MakeIlluminant(const std::string& name,
                                                            const std::string& description,
                                                            std::vector<double> wavelengths,
                                                            std::vector<double> powers,
                                                            std::string* error = nullptr);

}  // namespace cmetry
}  // namespace klume

#endif  // KLUME_CMETRY_DATA_H_
