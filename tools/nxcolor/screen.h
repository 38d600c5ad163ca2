// nxcolor's screen colours: the 8-bit display colour of a spectrum (through
// the ICC engine when one is configured, else the sRGB formulas), and the SVG
// picture of a whole chart. Single-threaded, like the rest of nxcolor.
#ifndef NXCOLOR_SCREEN_H_
#define NXCOLOR_SCREEN_H_

#include <string>

#include "nxbase/colorvector.h"
#include "report.h"

namespace nxcolor {

struct ScreenColor {
    int red = 0;  // 0..255 each
    int green = 0;
    int blue = 0;
};

// The colour the library paints for the spectrum's Lab under `condition`:
// RGBVector(LABVector) and ColorConverter::RGBToColor, reduced to 8 bits.
ScreenColor ScreenColorOf(const ReflectanceSpectrum& spectrum, const MeasuringCondition& condition);
// The same for a CIE 1976 Lab computed elsewhere (spectra finer than 10 nm).
ScreenColor ScreenColorOf(const LABVector& lab);

// "sRGB (built-in formulas)" or "ICC profile <description>".
std::string ScreenColorSource();

// Makes the ICC engine read its settings from the user configuration of
// nxcolor, or, with a non-empty `profilePath`, use that profile for this run.
// Returns "" or a warning that the profile is not usable (the formulas are
// used then).
std::string SetUpScreenColors(const std::string& profilePath);

// Writes one SVG picture of the report's samples: per sample a swatch in its
// screen colour, its id, its Lab and its reflectance curve, in a grid. At most
// kMaxSvgSamples samples are drawn (the title says so when there are more).
// The file is written beside `path` and renamed into place; false with the
// reason in *error on failure, leaving no partial file.
constexpr std::size_t kMaxSvgSamples = 2000;
bool WriteSvgReport(const Report& report, const MeasuringCondition& condition,
                    const std::string& path, std::string* error);

// Writes one SVG plot of the report's spectral curves: reflectance against
// wavelength (380..730 nm), one line per sample in its screen colour, with a
// grid, axis labels and a legend of the first kMaxLegendSamples samples. The
// reflectance axis spans every finite value (fluorescent peaks above 1 and
// values below 0 included): nothing is clipped. A value that is not a number
// leaves a gap in its line, then grey. At most kMaxSvgSamples curves are drawn (the
// title says so when there are more). Written as WriteSvgReport writes.
constexpr std::size_t kMaxLegendSamples = 24;
bool WriteSvgPlot(const Report& report, const MeasuringCondition& condition,
                  const std::string& path, std::string* error);

}  // namespace nxcolor

#endif  // NXCOLOR_SCREEN_H_
