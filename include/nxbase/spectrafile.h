// Reading reflectance spectra of any wavelength grid from CSV or CGATS text,
// and bringing them onto the library's 36-point grid (380..730 nm, 10 nm).
//
// CSV: fields separated by ",", or by ";" or TABs when the first content line
// holds more of those than commas (spreadsheets of continental Europe); in
// those two dialects a number may have a decimal comma ("0,4512"). Double
// quotes around a field are removed ("" inside stands for one quote); blank
// lines and lines starting with "#" are skipped; CR LF line ends and a UTF-8
// byte order mark are accepted. Numbers never depend on the locale. A dialect
// other than "," is named in the notes. An optional header is the first
// content line that ends in wavelength names ("r380", "380", "nm380",
// "SPEC_380", "SPECTRAL_NM380", "SPECTRAL_NM_380", "380nm", "380 nm",
// "382.5"); its trailing wavelength fields must increase or decrease and give
// the grid (a decreasing header is read as it stands: each value under its
// own wavelength); fields before them are ids (the first one the sample id,
// the second its name). A header of bare numbers ("id,380,390,..." or
// "400.0,410.0,...") is recognised by its monotonic numbers from 200 to 2600.
// Without a header the last 36 fields of each row are 380..730 nm and the
// fields before them the id; that is said in `assumptions`.
//
// CGATS (CGATS.17 / IT8.7 / ArgyllCMS .ti3 and .sp), read with LittleCMS's
// parser: the spectral fields of the data format in any of the spellings above
// (ArgyllCMS "SPEC_nnn", X-Rite "nmnnn", LittleCMS "SPECTRAL_NM_nnn"). The
// field names give the wavelengths; SPECTRAL_BANDS, SPECTRAL_START_NM and
// SPECTRAL_END_NM, where given, must describe the same grid (they make
// fractional steps exact) or the file is refused, naming both. SAMPLE_ID and
// SAMPLE_NAME are kept apart. A UTF-8 byte order mark is skipped; UTF-16
// text is refused by name.
//
// Coverage: a grid that does not reach from 400 to 700 nm is refused (its end
// values would have to be held across hundreds of nanometres); one that stops
// short of 380..730 nm is read, and how far its end values are held is said
// in `assumptions`.
//
// Scale: as the caller says, else as the file says (SPECTRAL_NORM gives the
// value that stands for 1.0; an ArgyllCMS "CTI3" file holds percent). Else it
// is decided from the whole file, never from one row: a spectrum with a value
// above 1.5, or brighter than any reflectance as reflectance factors (a mean
// above 1.05 over 500..620 nm, where Y lies), only percent explains; one
// without fits both (a reflectance factor, or a dark patch in percent).
// Percent when every spectrum needs it, reflectance factors when none does
// (ambiguous when all are dark: scaleNote says so every time); when the
// spectra disagree, the file is refused, naming the lines on each side, for
// the caller to say which scale it holds (SpectralReadOptions::scale). Spectra
// beyond both scales take no part. After scaling, a spectrum with a value
// above kMaxPlausibleReflectance or below -kMaxPlausibleReflectance, or with
// every value zero, is implausible: it is reported with its line and left
// out, rather than turned into an L* of 300.
//
// No function here throws on any input or crashes on arbitrary bytes; input is
// bounded (see the limits below) so that endless or binary input ends in an
// error, not in exhausted memory.
#ifndef NXBASE_SPECTRAFILE_H_
#define NXBASE_SPECTRAFILE_H_

#include <array>
#include <cstddef>
#include <iosfwd>
#include <string>
#include <string_view>
#include <vector>

#include "nxbase/export.h"
#include "nxbase/spectralgrid.h"

namespace nxbase {

// Longest line accepted; a longer one ends the reading with an error.
constexpr std::size_t kMaxLineLength = 64 * 1024;
// Most id fields a row may have before its values.
constexpr std::size_t kMaxIdFields = 16;
// Most spectra read from one input; the rest is reported and not read.
constexpr std::size_t kMaxSamples = 4'000'000;
// Largest CGATS text (the parser needs it whole).
constexpr std::size_t kMaxCgatsBytes = 512u << 20;
// Most wavelengths on one grid.
constexpr std::size_t kMaxBands = 4096;
// Error messages kept per input; further ones are counted.
constexpr std::size_t kMaxErrorMessages = 200;

enum class SpectralScale {
    kAuto,      // as the file says, else percent when a value exceeds 1.5
    kFraction,  // reflectance factors, white = 1
    kPercent    // percentages, white = 100
};

// One spectrum as the file gives it, on the file's own grid.
struct NXBASE_EXPORT SpectralSample {
    std::string id;             // SAMPLE_ID or the first id field; the row number if none
    std::string name;           // SAMPLE_NAME or the further id fields joined by " "
    std::vector<float> values;  // one per wavelength of the set, scaled to white = 1
    int line = 0;               // 1-based line in the source; 0 unknown
};

struct NXBASE_EXPORT SpectralSet {
    std::vector<double> wavelengths;  // increasing, nm
    std::vector<SpectralSample> samples;
    // One message per rejected row or header, "<source>:<line>: <what>".
    std::vector<std::string> errors;
    std::size_t suppressedErrors = 0;  // errors beyond kMaxErrorMessages
    // Remarks that are not errors, e.g. how the scale was chosen.
    std::vector<std::string> notes;
    bool unusable = false;  // nothing could be read (no grid, a file the parser rejects)
    bool percent = false;   // the values were read as percentages
    // How the scale was chosen when neither the caller nor the file said:
    // "<source>: read as ...: <why>; <the option that reads the other>".
    // Empty when the scale was given. Worth showing every time.
    std::string scaleNote;
    // What the reading assumed where the file did not say (end values held,
    // the id fields of a headerless file). Worth showing every time.
    std::vector<std::string> assumptions;
    std::string format;  // "CSV" or "CGATS"

    bool HasErrors() const { return !errors.empty() || suppressedErrors > 0; }
};

struct NXBASE_EXPORT SpectralReadOptions {
    SpectralScale scale = SpectralScale::kAuto;
    std::size_t maxSamples = kMaxSamples;
    // How messages name the two scale choices to the reader's user.
    std::string percentChoice = "--percent";
    std::string fractionChoice = "--fraction";
};

// Parses text already in memory; `source` names it in the messages.
NXBASE_EXPORT SpectralSet ReadSpectralText(std::string_view text, const std::string& source,
                                           const SpectralReadOptions& axOptions = {});
// Reads a stream: CSV line by line (memory bounded by the samples kept), CGATS
// whole up to kMaxCgatsBytes. Binary data (a NUL byte) ends it as unusable.
NXBASE_EXPORT SpectralSet ReadSpectralStream(std::istream& axInput, const std::string& source,
                                             const SpectralReadOptions& axOptions = {});
// A file by name ("-" is standard input). False, with the reason in *pError,
// when the file cannot be opened or read, is unusable or holds no spectrum
// that could be read; *pSet then still holds every message.
NXBASE_EXPORT bool ReadSpectralFile(const std::string& path, const SpectralReadOptions& axOptions,
                                    SpectralSet* pSet, std::string* pError);

// True when `text` has a CGATS data format section.
NXBASE_EXPORT bool LooksLikeCgats(std::string_view text);

// ---- The 36-point grid ----------------------------------------------------

struct NXBASE_EXPORT SpectrumRow {
    std::string id;  // id and name joined by " "
    std::array<float, kSpectrumSize> values{};
    int line = 0;  // 1-based line in the source; 0 unknown
    std::string sampleId;
    std::string sampleName;
    // The values as read, on the table's sourceWavelengths, kept when that
    // grid is finer than 10 nm (SpectraTable::fineGrid): colour is then
    // computed from them at their own interval (nxbase/finegrid.h).
    std::vector<float> native;
};

struct NXBASE_EXPORT SpectraTable {
    std::vector<SpectrumRow> rows;
    std::vector<std::string> errors;
    std::vector<std::string> notes;
    bool unusable = false;
    bool percent = false;
    std::string scaleNote;                 // as SpectralSet::scaleNote
    std::vector<std::string> assumptions;  // as SpectralSet::assumptions
    // The grid the spectra were read on, and how they were brought onto
    // 380..730/10 nm ("as read", "Sprague", "linear").
    std::vector<double> sourceWavelengths;
    std::string resampling;
    // sourceWavelengths is a regular grid finer than 10 nm, and every row
    // keeps its values on it (SpectrumRow::native).
    bool fineGrid = false;
};

// The samples of a set on the 36-point grid (see nxbase/resample.h); a set on
// 380..730/10 nm is copied bit for bit.
NXBASE_EXPORT SpectraTable ToStandardGrid(const SpectralSet& axSet);

// Reading and resampling in one call.
NXBASE_EXPORT SpectraTable ParseSpectra(std::string_view text, const std::string& source,
                                        const SpectralReadOptions& axOptions = {});
NXBASE_EXPORT SpectraTable ParseSpectraCsv(std::string_view text, const std::string& source,
                                           const SpectralReadOptions& axOptions = {});
NXBASE_EXPORT SpectraTable ParseSpectraCgats(std::string_view text, const std::string& source,
                                             const SpectralReadOptions& axOptions = {});
// ReadSpectralFile onto the 36-point grid: the set read, then ToStandardGrid.
NXBASE_EXPORT bool ReadSpectralFile(const std::string& path, const SpectralReadOptions& axOptions,
                                    SpectraTable* pTable, std::string* pError);

}  // namespace nxbase

#endif  // NXBASE_SPECTRAFILE_H_
