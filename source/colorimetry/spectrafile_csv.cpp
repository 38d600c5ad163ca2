// CSV spectra; see nxbase/spectrafile.h for the format.
#include <algorithm>
#include <cctype>
#include <charconv>
#include <cmath>

#include "nxbase/spectrafile.h"
#include "nxbase/strhelp.h"
#include "spectrafile_parse.h"
#include "toolkit/string.h"

namespace nxbase {
namespace {

std::string_view Trim(std::string_view s) {
    while (!s.empty() && (s.front() == ' ' || s.front() == '\t')) s.remove_prefix(1);
    while (!s.empty() && (s.back() == ' ' || s.back() == '\t' || s.back() == '\r'))
        s.remove_suffix(1);
    return s;
}

// Splits one line at `separator` outside double quotes; quotes are removed
// and "" inside quotes gives one quote.
std::vector<std::string> SplitFields(std::string_view line, char separator) {
    std::vector<std::string> fields;
    std::string field;
    bool quoted = false;
    for (std::size_t i = 0; i < line.size(); ++i) {
        const char c = line[i];
        if (quoted) {
            if (c == '"' && i + 1 < line.size() && line[i + 1] == '"') {
                field += '"';
                ++i;
            } else if (c == '"') {
                quoted = false;
            } else {
                field += c;
            }
        } else if (c == '"') {
            quoted = true;
        } else if (c == separator) {
            fields.emplace_back(Trim(field));
            field.clear();
        } else {
            field += c;
        }
    }
    fields.emplace_back(Trim(field));
    return fields;
}

// The separator of a CSV dialect, from its first content line: ";" or a TAB
// when the line holds more of it than of ",", else ",".
char DetectSeparator(std::string_view line) {
    std::size_t commas = 0, semicolons = 0, tabs = 0;
    bool quoted = false;
    for (const char c : line) {
        if (c == '"') quoted = !quoted;
        if (quoted) continue;
        commas += c == ',';
        semicolons += c == ';';
        tabs += c == '\t';
    }
    if (semicolons > 0 && semicolons >= commas && semicolons >= tabs) return ';';
    if (tabs > 0 && tabs >= commas) return '\t';
    return ',';
}

// "0,4512" as "0.4512": a field with one comma and no point that then reads
// as a number (spreadsheets of continental Europe write decimal commas).
void UseDecimalPoints(std::vector<std::string>& fields) {
    for (std::string& field : fields) {
        const std::size_t comma = field.find(',');
        if (comma == std::string::npos || field.find(',', comma + 1) != std::string::npos ||
            field.find('.') != std::string::npos) {
            continue;
        }
        std::string candidate = field;
        candidate[comma] = '.';
        double value = 0.0;
        if (detail::ParseNumber(candidate, &value)) field = std::move(candidate);
    }
}

}  // namespace

namespace detail {

bool ParseNumber(std::string_view text, double* value) {
    return toolkit::ParseWholeDecimal(Trim(text), *value, true);
}

double WavelengthOf(std::string_view field) {
    // Known prefixes, longest first; compared without ASCII case.
    static const char* const kPrefixes[] = {
        "SPECTRAL_NM_", "SPECTRAL_NM", "SPECTRAL_", "SPEC_", "SPEC", "NM", "R_", "R", ""};
    auto upper = [](char c) {
        return static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
    };
    for (const char* prefix : kPrefixes) {
        const std::string_view p(prefix);
        if (field.size() <= p.size()) continue;
        bool match = true;
        for (std::size_t i = 0; i < p.size() && match; ++i) match = upper(field[i]) == p[i];
        if (!match) continue;
        std::string_view rest = field.substr(p.size());
        if (rest.size() > 2 && upper(rest[rest.size() - 2]) == 'N' && upper(rest.back()) == 'M') {
            rest.remove_suffix(2);  // "380nm", "380 nm"
            while (!rest.empty() && rest.back() == ' ') rest.remove_suffix(1);
        }
        double nm = 0.0;
        const auto result =
            std::from_chars(rest.data(), rest.data() + rest.size(), nm, std::chars_format::fixed);
        if (result.ec == std::errc() && result.ptr == rest.data() + rest.size() && nm >= 0 &&
            std::isfinite(nm))
            return nm;
    }
    return -1;
}

std::string Shown(std::string_view field) {
    std::string out;
    for (char c : field.substr(0, 40)) {
        out += (static_cast<unsigned char>(c) < 0x20 || c == 0x7f) ? '?' : c;
    }
    if (field.size() > 40) out += "...";
    return out;
}

}  // namespace detail

namespace {

using detail::ParseNumber;
using detail::Shown;
using detail::WavelengthOf;

constexpr int kLowestWavelength = 200;
constexpr int kHighestWavelength = 2600;
constexpr std::size_t kMinBands = 3;

// Trailing fields that are numbers from 200 to 2600, all increasing or all
// decreasing: a header such as "id,380,390,...", "400.0,410.0,..." or
// "730,720,...". Percent or fraction data never looks so.
std::size_t NumericHeaderColumns(const std::vector<std::string>& fields) {
    std::size_t count = 0;
    int direction = 0;  // +1 increasing towards the end, -1 decreasing
    double next = 0.0;
    for (std::size_t i = fields.size(); i > 0; --i) {
        double nm = 0.0;
        if (!ParseNumber(fields[i - 1], &nm) || nm < kLowestWavelength || nm > kHighestWavelength)
            break;
        if (count > 0) {
            const int step = nm < next ? 1 : (nm > next ? -1 : 0);
            if (step == 0 || (direction != 0 && step != direction)) break;
            direction = step;
        }
        next = nm;
        ++count;
    }
    return count >= kMinBands ? count : 0;
}

// A header ends in a field that is not a number and either names a
// wavelength there or has mostly text fields (a data row with one bad value
// at its end is not taken for one), or ends in a numeric wavelength list.
bool LooksLikeHeader(const std::vector<std::string>& fields) {
    if (NumericHeaderColumns(fields) > 0) return true;
    double value = 0.0;
    if (ParseNumber(fields.back(), &value)) return false;
    if (WavelengthOf(fields.back()) >= 0) return true;
    std::size_t numbers = 0;
    for (const std::string& field : fields) numbers += ParseNumber(field, &value) ? 1 : 0;
    return 2 * numbers < fields.size();
}

std::vector<double> StandardGrid() {
    std::vector<double> grid(kSpectrumSize);
    for (int i = 0; i < kSpectrumSize; ++i) grid[i] = kFirstWavelength + kWavelengthStep * i;
    return grid;
}

}  // namespace

namespace detail {

CsvSpectraParser::CsvSpectraParser(const std::string& source, const SpectralReadOptions& axOptions,
                                   SpectralSet* pSetArg)
    : amSource(source), amOptions(axOptions), pSet(pSetArg) {
    pSet->format = "CSV";
}

bool CsvSpectraParser::Line(std::string_view line, int number) {
    if (amStopped) return false;
    if (number == 1 && line.substr(0, 3) == "\xEF\xBB\xBF") line.remove_prefix(3);
    const std::string_view content = Trim(line);
    if (content.empty() || content.front() == '#') return true;
    if (line.size() > kMaxLineLength) {
        Error(number,
              "line longer than " + std::to_string(kMaxLineLength) + " bytes; not read further");
        amStopped = true;
        return false;
    }
    if (!amSeenContent) DetectDialect(content);
    std::vector<std::string> fields = SplitFields(line, amSeparator);
    if (amSeparator != ',') UseDecimalPoints(fields);
    if (!amSeenContent) {
        amSeenContent = true;
        if (LooksLikeHeader(fields)) {
            Header(fields, number);
            return !amStopped;
        }
    }
    Row(fields, number);
    return !amStopped;
}

void CsvSpectraParser::DetectDialect(std::string_view firstLine) {
    amSeparator = DetectSeparator(firstLine);
    if (amSeparator != ',') {
        pSet->notes.push_back(amSource + ": CSV with fields separated by " +
                              std::string(amSeparator == ';' ? "\";\"" : "TABs") +
                              "; a comma in a number is its decimal separator");
    }
}

void CsvSpectraParser::Finish() {
    if (pSet->wavelengths.empty() && !pSet->unusable) pSet->wavelengths = StandardGrid();
}

void CsvSpectraParser::Error(int line, const std::string& what) {
    AddError(pSet, amSource + ":" + std::to_string(line) + ": " + what);
}

void CsvSpectraParser::Header(const std::vector<std::string>& fields, int line) {
    std::size_t count = NumericHeaderColumns(fields);
    if (count == 0) {
        while (count < fields.size() && WavelengthOf(fields[fields.size() - 1 - count]) >= 0)
            ++count;
    }
    const std::size_t first = fields.size() - count;
    std::vector<double> grid;
    for (std::size_t i = first; i < fields.size(); ++i) grid.push_back(WavelengthOf(fields[i]));
    std::string problem;
    if (count < kMinBands) {
        problem = count == 0 ? "spectral columns missing" : "fewer than 3 spectral columns";
    } else if (count > kMaxBands) {
        problem = "more than " + std::to_string(kMaxBands) + " spectral columns";
    } else if (first > kMaxIdFields) {
        problem = "more than " + std::to_string(kMaxIdFields) + " id columns";
    } else {
        const bool descending = grid.size() > 1 && grid[1] < grid[0];
        for (std::size_t i = 0; i < grid.size() && problem.empty(); ++i) {
            if (grid[i] < kLowestWavelength || grid[i] > kHighestWavelength) {
                problem = "column \"" + Shown(fields[first + i]) +
                          "\" is not a wavelength from 200 to 2600 nm";
            } else if (i > 0 && (descending ? grid[i] >= grid[i - 1] : grid[i] <= grid[i - 1])) {
                problem = std::string("wavelengths do not ") +
                          (descending ? "decrease" : "increase") + " at column \"" +
                          Shown(fields[first + i]) + "\"";
            }
        }
        if (descending) {
            std::reverse(grid.begin(), grid.end());
            amDescending = true;
        }
    }
    if (!problem.empty()) {
        Error(line, problem);
        pSet->unusable = true;
        amStopped = true;
        return;
    }
    pSet->wavelengths = std::move(grid);
    amIdFields = static_cast<int>(first);
}

void CsvSpectraParser::Row(const std::vector<std::string>& fields, int line) {
    if (pSet->wavelengths.empty()) pSet->wavelengths = StandardGrid();
    const std::size_t bands = pSet->wavelengths.size();
    const std::size_t expected = amIdFields >= 0 ? amIdFields + bands : 0;
    if (expected != 0 && fields.size() != expected) {
        Error(line,
              std::to_string(fields.size()) + " fields, expected " + std::to_string(expected));
        return;
    }
    if (fields.size() < bands) {
        Error(line, std::to_string(fields.size()) + " fields, expected at least " +
                        std::to_string(bands) + " values");
        return;
    }
    const std::size_t ids = fields.size() - bands;
    if (amIdFields < 0 && ids > 0 && !amIdsNoted) {
        amIdsNoted = true;
        pSet->assumptions.push_back(
            amSource + ":" + std::to_string(line) + ": no header: the last " +
            std::to_string(bands) + " of the " + std::to_string(fields.size()) +
            " fields are taken as the values at 380..730 nm and the first " +
            (ids == 1 ? std::string("one as the id") : std::to_string(ids) + " as id and name"));
    }
    if (ids > kMaxIdFields) {
        Error(line, std::to_string(fields.size()) + " fields: more than " +
                        std::to_string(kMaxIdFields) + " before the " + std::to_string(bands) +
                        " values");
        return;
    }
    if (pSet->samples.size() >= amOptions.maxSamples) {
        Error(line, "more than " + std::to_string(amOptions.maxSamples) +
                        " spectra; the rest is not read");
        amStopped = true;
        return;
    }
    SpectralSample sample;
    sample.line = line;
    if (ids > 0) sample.id = fields[0];
    for (std::size_t i = 1; i < ids; ++i) {
        if (i > 1) sample.name += ' ';
        sample.name += fields[i];
    }
    if (sample.id.empty() && sample.name.empty())
        sample.id = std::to_string(pSet->samples.size() + 1);
    const double divisor = amOptions.scale == SpectralScale::kPercent ? 100.0 : 1.0;
    sample.values.resize(bands);
    for (std::size_t k = 0; k < bands; ++k) {
        double value = 0.0;
        const std::size_t column = ids + (amDescending ? bands - 1 - k : k);
        const std::string& field = fields[column];
        const std::string where = "field " + std::to_string(column + 1) + " (" +
                                  StringHelpers::Shortest(pSet->wavelengths[k]) + " nm): \"" +
                                  Shown(field) + "\"";
        if (!ParseNumber(field, &value)) {
            Error(line, where + " is not a number");
            return;
        }
        const float scaled = static_cast<float>(value / divisor);
        if (!std::isfinite(scaled)) {
            Error(line, where + " is out of range");
            return;
        }
        sample.values[k] = scaled;
    }
    pSet->samples.push_back(std::move(sample));
}

SpectralSet ReadCsvText(std::string_view text, const std::string& source,
                        const SpectralReadOptions& axOptions) {
    SpectralSet set;
    CsvSpectraParser parser(source, axOptions, &set);
    int number = 0;
    while (!text.empty()) {
        const std::size_t end = text.find('\n');
        if (!parser.Line(text.substr(0, end), ++number)) break;
        if (end == std::string_view::npos) break;
        text.remove_prefix(end + 1);
    }
    parser.Finish();
    FinishSet(&set, axOptions, 0.0, "", source);
    return set;
}

}  // namespace detail

}  // namespace nxbase
