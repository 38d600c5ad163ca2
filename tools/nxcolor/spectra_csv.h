// nxcolor reads spectra through the library's reader; the built-in chart is
// nxcolor's own.
#ifndef NXCOLOR_SPECTRA_CSV_H_
#define NXCOLOR_SPECTRA_CSV_H_

#include <string_view>

#include "nxbase/spectrafile.h"

namespace nxcolor {

using nxbase::kFirstWavelength;
using nxbase::kMaxIdFields;
using nxbase::kMaxLineLength;
using nxbase::kSpectrumSize;
using nxbase::kWavelengthStep;
using nxbase::LooksLikeCgats;
using nxbase::ParseSpectra;
using nxbase::ParseSpectraCgats;
using nxbase::ParseSpectraCsv;
using nxbase::ReadSpectralFile;
using nxbase::SpectraTable;
using nxbase::SpectrumRow;

// The ColorChecker chart built into nxcolor (BabelColor average, 24 patches).
std::string_view EmbeddedChart();
const char* EmbeddedChartName();

}  // namespace nxcolor

#endif  // NXCOLOR_SPECTRA_CSV_H_
