// The parsing pieces that the CSV and CGATS spectral readers share. Internal.
#ifndef NXBASE_SOURCE_COLORIMETRY_SPECTRAFILE_PARSE_H_
#define NXBASE_SOURCE_COLORIMETRY_SPECTRAFILE_PARSE_H_

#include <string>
#include <string_view>
#include <vector>

#include "nxbase/spectrafile.h"

namespace nxbase {

namespace detail {
// A finite decimal number ("." separator, one optional sign, "+" included),
// whole field.
bool ParseNumber(std::string_view text, double* value);
// The wavelength a spectral column name gives: a decimal number after one of
// the prefixes SPECTRAL_NM_, SPECTRAL_NM, SPECTRAL_, SPEC_, SPEC, NM, R_, R or
// none (any case), optionally followed by "nm" ("r380", "SPECTRAL_NM380",
// "380nm", "382.5"); else -1.
double WavelengthOf(std::string_view field);

// A field as shown in messages: at most 40 bytes, control bytes as "?".
std::string Shown(std::string_view field);

// Shared by the CSV and CGATS readers: records an error within the bound.
void AddError(SpectralSet* pSet, std::string message);
// Checks that the grid covers the visible, applies the scale (auto
// detection included) and drops implausible spectra.
void FinishSet(SpectralSet* pSet, const SpectralReadOptions& axOptions, double axFileNorm,
               const std::string& axNormReason, const std::string& source);
SpectralSet ReadCsvText(std::string_view text, const std::string& source,
                        const SpectralReadOptions& axOptions);
SpectralSet ReadCgatsText(std::string_view text, const std::string& source,
                          const SpectralReadOptions& axOptions);

// Builds a CSV set line by line.
class CsvSpectraParser {
  public:
    CsvSpectraParser(const std::string& source, const SpectralReadOptions& axOptions,
                     SpectralSet* pSet);
    // False once reading should stop (limit reached, unusable header).
    bool Line(std::string_view line, int number);
    void Finish();

  private:
    void Header(const std::vector<std::string>& fields, int line);
    void Row(const std::vector<std::string>& fields, int line);
    void Error(int line, const std::string& what);
    void DetectDialect(std::string_view firstLine);

    std::string amSource;
    SpectralReadOptions amOptions;
    SpectralSet* pSet;
    bool amSeenContent = false;
    int amIdFields = -1;        // from the header; -1 without one
    bool amDescending = false;  // the header lists the wavelengths from long to short
    bool amIdsNoted = false;    // the id fields of a headerless file were said
    bool amStopped = false;
    char amSeparator = ',';  // "," ";" or TAB, from the first content line
};
}  // namespace detail

}  // namespace nxbase

#endif  // NXBASE_SOURCE_COLORIMETRY_SPECTRAFILE_PARSE_H_
