// Spectral input common to CSV and CGATS: the scale, plausibility, bounded
// reading of streams and files, and the 36-point grid.
#include "nxbase/spectrafile.h"

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <memory>
#include <new>

#include "nxbase/finegrid.h"
#include "nxbase/resample.h"
#include "spectrafile_parse.h"

namespace nxbase {
namespace {

constexpr double kPercentThreshold = 1.5;  // above it, a value can only be a percentage
// Read as reflectance factors, a sample whose Y is this far above the white is
// no reflectance: fluorescent papers stay below.
constexpr double kBrightestReflectance = 1.05;
constexpr double kYProxyFrom = 500.0;
constexpr double kYProxyTo = 620.0;
constexpr std::size_t kReadChunk = 64 * 1024;
constexpr std::size_t kSniffBytes = 1 << 20;  // looked at to tell CGATS from CSV

std::string Where(const std::string& source, int line) {
    return source + ":" + (line > 0 ? std::to_string(line) : std::string("?"));
}

// A spectrum far outside reflectance, or all zero, comes from a wrong scale
// or a broken measurement; it would print as nonsense colour.
std::string Implausible(const SpectralSample& sample) {
    bool allZero = true;
    for (const float v : sample.values) {
        if (std::fabs(v) > kMaxPlausibleReflectance) {
            return "value " + std::to_string(v) +
                   " is not a reflectance factor (scale wrong? see --percent)";
        }
        allZero = allZero && v == 0.0f;
    }
    return allZero ? "every value is zero" : "";
}

// The largest value of a sample.
float Largest(const SpectralSample& sample) {
    float largest = 0.0f;
    for (const float v : sample.values) largest = std::max(largest, v);
    return largest;
}

// The mean reflectance over 500..620 nm, where the Y weights lie: Y / 100
// within a few percent, and untouched by optical brighteners, which
// fluoresce below 480 nm. Negative when the grid does not reach there.
double YProxy(const SpectralSample& sample, const std::vector<double>& wavelengths) {
    double sum = 0.0;
    int count = 0;
    for (std::size_t k = 0; k < wavelengths.size() && k < sample.values.size(); ++k) {
        if (wavelengths[k] >= kYProxyFrom && wavelengths[k] <= kYProxyTo) {
            sum += sample.values[k];
            ++count;
        }
    }
    return count > 0 ? sum / count : -1.0;
}

std::string Number(double value, int decimals) {
    char text[64];
    std::snprintf(text, sizeof text, "%.*f", decimals, value);
    return text;
}

void DivideBy100(SpectralSample& sample) {
    for (float& v : sample.values) v = static_cast<float>(static_cast<double>(v) / 100.0);
}

// The scale of a file that does not state it, decided from all its rows: a
// row with a value above 1.5 can only be percent; a row without one fits
// both, as reflectance factors or as a dark patch in percent. The majority
// decides; rows that only the other scale explains are rejected with a
// hint, as are rows that read as reflectance factors brighter than any
// reflectance. Rows beyond both scales take no part.
void GuessScale(SpectralSet* pSet, const std::string& source) {
    std::size_t needPercent = 0, fitFraction = 0;
    float largest = 0.0f;
    for (const SpectralSample& sample : pSet->samples) {
        const float m = Largest(sample);
        if (m > 100.0 * kMaxPlausibleReflectance) continue;
        if (m > kPercentThreshold) {
            ++needPercent;
            largest = std::max(largest, m);
        } else if (m > 0.0f) {
            ++fitFraction;
        }
    }
    const std::string counts =
        std::to_string(needPercent) + " of " + std::to_string(needPercent + fitFraction);
    std::vector<SpectralSample> kept;
    kept.reserve(pSet->samples.size());
    if (needPercent > fitFraction) {
        pSet->percent = true;
        for (SpectralSample& sample : pSet->samples) DivideBy100(sample);
        pSet->scaleNote = source + ": read as percentages: " + counts +
                          " spectra have values above 1.5 (up to " + Number(largest, 2) +
                          "); --fraction reads them as they stand";
        return;
    }
    pSet->scaleNote = source + ": read as reflectance factors (white = 1): " +
                      (needPercent == 0 ? std::string("no value is above 1.5")
                                        : std::to_string(fitFraction) + " of " +
                                              std::to_string(needPercent + fitFraction) +
                                              " spectra stay at or below 1.5") +
                      " and the file does not give its scale; --percent reads percentages";
    for (SpectralSample& sample : pSet->samples) {
        const float m = Largest(sample);
        const double y = YProxy(sample, pSet->wavelengths);
        if (m > kPercentThreshold && m <= 100.0 * kMaxPlausibleReflectance) {
            detail::AddError(
                pSet,
                Where(source, sample.line) + ": a value of " + Number(m, 2) +
                    " fits only percentages, while the other spectra read as reflectance factors; "
                    "--percent or --fraction says which the file holds");
        } else if (y > kBrightestReflectance) {
            detail::AddError(
                pSet, Where(source, sample.line) +
                          ": as reflectance factors this is brighter than any "
                          "reflectance (Y about " +
                          Number(100.0 * y, 0) +
                          " % of the white); if the file holds percentages, --percent reads it");
        } else {
            kept.push_back(std::move(sample));
        }
    }
    pSet->samples = std::move(kept);
}

}  // namespace

namespace detail {

void AddError(SpectralSet* pSet, std::string message) {
    if (pSet->errors.size() < kMaxErrorMessages) {
        pSet->errors.push_back(std::move(message));
    } else {
        ++pSet->suppressedErrors;
    }
}

void FinishScale(SpectralSet* pSet, const SpectralReadOptions& axOptions, double axFileNorm,
                 const std::string& axNormReason, const std::string& source) {
    if (axOptions.scale == SpectralScale::kPercent) {
        pSet->percent = true;
        if (axFileNorm > 0.0) pSet->notes.push_back(source + ": values read as " + axNormReason);
    } else if (axOptions.scale == SpectralScale::kAuto) {
        GuessScale(pSet, source);
    }
    std::vector<SpectralSample> kept;
    kept.reserve(pSet->samples.size());
    for (SpectralSample& sample : pSet->samples) {
        const std::string problem = Implausible(sample);
        if (problem.empty()) {
            kept.push_back(std::move(sample));
        } else {
            AddError(pSet, Where(source, sample.line) + ": " + problem);
        }
    }
    pSet->samples = std::move(kept);
}

}  // namespace detail

bool LooksLikeCgats(std::string_view text) {
    return text.find("BEGIN_DATA_FORMAT") != std::string_view::npos;
}

SpectralSet ReadSpectralText(std::string_view text, const std::string& source,
                             const SpectralReadOptions& axOptions) {
    const std::size_t nul = text.find('\0');
    if (nul != std::string_view::npos) {
        SpectralSet set;
        detail::AddError(&set, source + ": binary data (a NUL byte at offset " +
                                   std::to_string(nul) + "), not a text file");
        set.unusable = true;
        return set;
    }
    return LooksLikeCgats(text) ? detail::ReadCgatsText(text, source, axOptions)
                                : detail::ReadCsvText(text, source, axOptions);
}

namespace {

// Reads up to `limit` more bytes into *text; false on a stream error.
bool ReadMore(std::istream& in, std::string* text, std::size_t limit) {
    char buffer[kReadChunk];
    while (limit > 0 && in) {
        in.read(buffer, static_cast<std::streamsize>(std::min(limit, sizeof buffer)));
        const std::size_t got = static_cast<std::size_t>(in.gcount());
        text->append(buffer, got);
        limit -= got;
        if (got == 0) break;
    }
    return !in.bad();
}

SpectralSet Unusable(const std::string& message) {
    SpectralSet set;
    detail::AddError(&set, message);
    set.unusable = true;
    return set;
}

// CSV from a stream, a line at a time; `text` holds what was read ahead.
SpectralSet StreamCsv(std::istream& in, std::string text, const std::string& source,
                      const SpectralReadOptions& axOptions) {
    SpectralSet set;
    detail::CsvSpectraParser parser(source, axOptions, &set);
    int number = 0;
    std::size_t start = 0;
    bool more = true;
    while (true) {
        const std::size_t end = text.find('\n', start);
        if (end == std::string::npos) {
            text.erase(0, start);
            start = 0;
            if (text.find('\0') != std::string::npos) {
                return Unusable(source + ":" + std::to_string(number + 1) +
                                ": binary data (a NUL byte), not a text file");
            }
            if (!more || text.size() > kMaxLineLength) {
                if (!text.empty()) parser.Line(text, ++number);
                break;
            }
            const std::size_t before = text.size();
            if (!ReadMore(in, &text, kReadChunk)) {
                detail::AddError(&set,
                                 source + ": read error after line " + std::to_string(number));
                break;
            }
            more = text.size() > before;
            continue;
        }
        const std::string_view line(text.data() + start, end - start);
        if (line.find('\0') != std::string_view::npos) {
            return Unusable(source + ":" + std::to_string(number + 1) +
                            ": binary data (a NUL byte), not a text file");
        }
        if (!parser.Line(line, ++number)) break;
        start = end + 1;
    }
    parser.Finish();
    detail::FinishScale(&set, axOptions, 0.0, "", source);
    return set;
}

}  // namespace

SpectralSet ReadSpectralStream(std::istream& axInput, const std::string& source,
                               const SpectralReadOptions& axOptions) {
    try {
        std::string head;
        if (!ReadMore(axInput, &head, kSniffBytes)) return Unusable(source + ": read error");
        if (!LooksLikeCgats(head)) return StreamCsv(axInput, std::move(head), source, axOptions);
        if (!ReadMore(axInput, &head, kMaxCgatsBytes - head.size()))
            return Unusable(source + ": read error");
        if (head.size() >= kMaxCgatsBytes && axInput.peek() != std::char_traits<char>::eof()) {
            return Unusable(source + ": CGATS text larger than " +
                            std::to_string(kMaxCgatsBytes >> 20) + " MiB");
        }
        return ReadSpectralText(head, source, axOptions);
    } catch (const std::bad_alloc&) {
        return Unusable(source + ": out of memory while reading");
    }
}

bool ReadSpectralFile(const std::string& path, const SpectralReadOptions& axOptions,
                      SpectralSet* pSet, std::string* pError) {
    if (path == "-") {
        *pSet = ReadSpectralStream(std::cin, "<stdin>", axOptions);
        return true;
    }
    std::error_code ignored;
    if (std::filesystem::is_directory(path, ignored)) {
        *pError = path + ": is a directory";
        return false;
    }
    std::ifstream in(path, std::ios::binary);
    if (!in) {
        *pError = path + ": cannot open the file: " + std::strerror(errno);
        return false;
    }
    *pSet = ReadSpectralStream(in, path, axOptions);
    return true;
}

SpectraTable ToStandardGrid(const SpectralSet& axSet) {
    SpectraTable table;
    table.errors = axSet.errors;
    if (axSet.suppressedErrors > 0) {
        table.errors.push_back(std::to_string(axSet.suppressedErrors) + " more errors not shown");
    }
    table.notes = axSet.notes;
    table.unusable = axSet.unusable;
    table.percent = axSet.percent;
    table.scaleNote = axSet.scaleNote;
    table.sourceWavelengths = axSet.wavelengths;
    if (axSet.unusable || axSet.wavelengths.size() < 2) {
        table.unusable = true;
        return table;
    }
    const SpectralResampler resampler(axSet.wavelengths);
    table.resampling = resampler.MethodName();
    table.fineGrid = FineGridTristimulus::Applies(axSet.wavelengths);
    table.rows.reserve(axSet.samples.size());
    for (const SpectralSample& sample : axSet.samples) {
        SpectrumRow row;
        row.sampleId = sample.id;
        row.sampleName = sample.name;
        row.id = sample.id.empty()
                     ? sample.name
                     : (sample.name.empty() ? sample.id : sample.id + " " + sample.name);
        row.line = sample.line;
        resampler.Resample(sample.values.data(), row.values.data());
        if (table.fineGrid) row.native = sample.values;
        table.rows.push_back(std::move(row));
    }
    return table;
}

SpectraTable ParseSpectra(std::string_view text, const std::string& source,
                          const SpectralReadOptions& axOptions) {
    return ToStandardGrid(ReadSpectralText(text, source, axOptions));
}

SpectraTable ParseSpectraCsv(std::string_view text, const std::string& source,
                             const SpectralReadOptions& axOptions) {
    return ToStandardGrid(detail::ReadCsvText(text, source, axOptions));
}

SpectraTable ParseSpectraCgats(std::string_view text, const std::string& source,
                               const SpectralReadOptions& axOptions) {
    return ToStandardGrid(detail::ReadCgatsText(text, source, axOptions));
}

bool ReadSpectraFile(const std::string& path, const SpectralReadOptions& axOptions,
                     SpectraTable* pTable, std::string* pError) {
    SpectralSet set;
    if (!ReadSpectralFile(path, axOptions, &set, pError)) return false;
    *pTable = ToStandardGrid(set);
    return true;
}

}  // namespace nxbase
