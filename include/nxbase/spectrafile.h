// Reading reflectance spectra from CSV or CGATS text: optional
// id fields and 36 reflectance factors, 380..730 nm in 10 nm steps, per
// spectrum.
//
// CSV format: fields separated by ","; double quotes around a field are removed
// ("" inside stands for one quote); blank lines and lines starting with "#"
// are skipped; CR LF line ends and a UTF-8 byte order mark are accepted.
// Numbers are read with "." as decimal separator whatever the locale. An
// optional header is the first line whose last field is not a number; its
// spectral columns are the trailing fields that name a wavelength ("r380",
// "380", "nm380", "SPEC_380", "SPECTRAL_NM380") and must be exactly 380..730 nm in
// 10 nm steps. Without a header the last 36 fields of each row are the values
// and the fields before them the id.
#ifndef NXBASE_SPECTRAFILE_H_
#define NXBASE_SPECTRAFILE_H_

#include <array>
#include <string>
#include <string_view>
#include <vector>

#include "nxbase/export.h"

namespace nxbase {

constexpr int kSpectrumSize = 36;
constexpr int kFirstWavelength = 380;
constexpr int kWavelengthStep = 10;
// Longest line accepted; longer lines are reported and skipped.
constexpr std::size_t kMaxLineLength = 64 * 1024;
// Most id fields a row may have before its values.
constexpr std::size_t kMaxIdFields = 16;

struct NXBASE_EXPORT SpectrumRow {
    std::string id;                         // id fields joined by " "; the row number if none
    std::array<float, kSpectrumSize> values{};
    int line = 0;                           // 1-based line in the source; 0 unknown
};

struct NXBASE_EXPORT SpectraTable {
    std::vector<SpectrumRow> rows;
    // One message per rejected row or header, "<source>:<line>: <what>".
    std::vector<std::string> errors;
    // Nothing could be read: a header or data format with a grid other than
    // 380..730/10 nm, or a CGATS file its parser rejects.
    bool unusable = false;
};

// Parses `text`; `source` names it in the messages. Each bad row is reported
// and skipped; the others are kept. `scale` divides every value (100 for
// percentages). Never throws on any input.
NXBASE_EXPORT SpectraTable ParseSpectraCsv(std::string_view text, const std::string& source, float scale = 1.0f);

// CGATS (CGATS.17 / IT8.7 text as measurement software writes it), read with
// LittleCMS's parser: the spectral fields of the data format ("SPECTRAL_NM380",
// "SPEC_380", "nm380", "R380"; see detail::WavelengthOf) must
// be exactly 380..730 nm in 10 nm steps, in any order; the id is SAMPLE_ID,
// SAMPLE_NAME or the set number. A value that is not a number is reported with
// the line of its set (sets counted one per line after BEGIN_DATA) and the set
// skipped; a file the parser rejects is one error with its message.
NXBASE_EXPORT SpectraTable ParseSpectraCgats(std::string_view text, const std::string& source, float scale = 1.0f);
// True when `text` has a CGATS data format section.
NXBASE_EXPORT bool LooksLikeCgats(std::string_view text);
// CGATS when LooksLikeCgats, CSV otherwise.
NXBASE_EXPORT SpectraTable ParseSpectra(std::string_view text, const std::string& source, float scale = 1.0f);

// Reads and parses a file ("-" is standard input) as ParseSpectra does. False,
// with the reason in *error, when the file cannot be read.
NXBASE_EXPORT bool ReadSpectraFile(const std::string& path, float scale, SpectraTable* table, std::string* error);

namespace detail {
// A finite decimal number ("." separator, optional leading "+"), whole field.
NXBASE_EXPORT bool ParseNumber(std::string_view text, double* value);
// The wavelength a spectral column name gives: digits after one of the
// prefixes SPECTRAL_NM, SPECTRAL_, SPEC_, SPEC, NM, R_, R or none (any case),
// optionally followed by "nm" ("r380", "SPECTRAL_NM380", "380nm"); else -1.
NXBASE_EXPORT int WavelengthOf(std::string_view field);
// A field as shown in messages: at most 40 bytes, control bytes as "?".
std::string Shown(std::string_view field);
}  // namespace detail

}  // namespace nxbase

#endif  // NXBASE_SPECTRAFILE_H_
