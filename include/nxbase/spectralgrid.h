// The spectral grid of the family's spectra: 36 samples, 380..730 nm in
// 10 nm steps (sample i at 380 + 10 i nm). Every spectrum, weight table and
// file of the library uses it; other grids are brought onto it first.
#ifndef NXBASE_SPECTRALGRID_H_
#define NXBASE_SPECTRALGRID_H_

namespace nxbase {

constexpr int kSpectrumSize = 36;
constexpr int kFirstWavelength = 380;
constexpr int kWavelengthStep = 10;
constexpr int kLastWavelength = kFirstWavelength + kWavelengthStep * (kSpectrumSize - 1);

// A reflectance factor further from 0 than this is taken for a wrong scale
// or a broken measurement (fluorescent samples stay below it).
constexpr double kMaxPlausibleReflectance = 2.0;

}  // namespace nxbase

#endif  // NXBASE_SPECTRALGRID_H_
