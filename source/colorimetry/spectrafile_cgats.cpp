// CGATS spectra through LittleCMS's CGATS/IT8 parser.
#include <lcms2.h>
#include <locale.h>

#include <algorithm>
#include <cmath>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <iterator>
#include <limits>
#include <string>
#include <vector>

#include "nxbase/spectrafile.h"
#include "nxbase/strhelp.h"
#include "spectrafile_parse.h"

namespace nxbase {
namespace {

// LittleCMS's CGATS parser takes at most this many sets and fields.
constexpr int kMostCgatsSets = 32766;

// The whitespace-separated tokens of a CGATS line as LittleCMS reads them: a
// token that starts with a double or a single quote runs to the next one of
// the same kind (so "a""b" is two tokens and "" one empty token); "#"
// outside quotes starts a comment.
std::size_t CountTokens(std::string_view line) {
    std::size_t count = 0;
    std::size_t at = 0;
    while (at < line.size()) {
        const char c = line[at];
        if (c == ' ' || c == '\t' || c == '\r') {
            ++at;
        } else if (c == '#') {
            break;
        } else if (c == '"' || c == '\'') {
            const std::size_t close = line.find(c, at + 1);
            ++count;
            if (close == std::string_view::npos) break;
            at = close + 1;
        } else {
            ++count;
            while (at < line.size() && line[at] != ' ' && line[at] != '\t' && line[at] != '\r' &&
                   line[at] != '"' && line[at] != '\'')
                ++at;
        }
    }
    return count;
}

std::string_view TrimLine(std::string_view line) {
    while (!line.empty() && (line.front() == ' ' || line.front() == '\t')) line.remove_prefix(1);
    while (!line.empty() && (line.back() == '\r' || line.back() == ' ' || line.back() == '\t'))
        line.remove_suffix(1);
    return line;
}

// The value after a keyword ("NUMBER_OF_SETS 24" or "NUMBER_OF_SETS \"24\"").
std::string KeywordValue(std::string_view line, std::string_view keyword) {
    std::string_view rest = TrimLine(line.substr(keyword.size()));
    if (rest.size() >= 2 && rest.front() == '"' && rest.back() == '"')
        rest = rest.substr(1, rest.size() - 2);
    return std::string(rest);
}

bool IsCount(const std::string& text, double* value) {
    return detail::ParseNumber(text, value) && *value >= 0 && *value == std::floor(*value) &&
           *value < 1e9;
}

// What one pass over the text finds: the line of each data set (one set
// per non-blank, non-comment line after BEGIN_DATA, the layout writers
// use) and the first fault LittleCMS would misreport.
struct Layout {
    std::vector<int> dataLines;
    std::string problem;  // "" when nothing is found
};

// The problem: NUMBER_OF_FIELDS and NUMBER_OF_SETS against the data format
// and the data, and, where the data holds one set per line, the first line
// whose count of values differs, each with the line a user must look at.
std::string LayoutProblem(const std::string& source, int fieldsLine, const std::string& fieldsText,
                          int setsLine, const std::string& setsText, int formatLine,
                          std::size_t formatFields,
                          const std::vector<std::pair<int, std::size_t>>& dataLines);

Layout ScanLayout(std::string_view text, const std::string& source) {
    int fieldsLine = 0, setsLine = 0, formatLine = 0, number = 0;
    std::string fieldsText, setsText;
    std::size_t formatFields = 0;
    std::vector<std::pair<int, std::size_t>> dataLines;  // (line, tokens)
    enum { kHeader, kFormat, kData, kDone } section = kHeader;
    while (!text.empty() && section != kDone) {
        const std::size_t end = text.find('\n');
        const std::string_view line = TrimLine(text.substr(0, end));
        ++number;
        if (section == kFormat) {
            if (line.rfind("END_DATA_FORMAT", 0) == 0) {
                section = kHeader;
            } else {
                formatFields += CountTokens(line);
            }
        } else if (section == kData) {
            if (line.rfind("END_DATA", 0) == 0) {
                section = kDone;
            } else if (!line.empty() && line.front() != '#') {
                dataLines.emplace_back(number, CountTokens(line));
            }
        } else if (line.rfind("NUMBER_OF_FIELDS", 0) == 0) {
            fieldsLine = number;
            fieldsText = KeywordValue(line, "NUMBER_OF_FIELDS");
        } else if (line.rfind("NUMBER_OF_SETS", 0) == 0) {
            setsLine = number;
            setsText = KeywordValue(line, "NUMBER_OF_SETS");
        } else if (line.rfind("BEGIN_DATA_FORMAT", 0) == 0) {
            formatLine = number;
            section = kFormat;
        } else if (line.rfind("BEGIN_DATA", 0) == 0) {
            section = kData;
        }
        if (end == std::string_view::npos) break;
        text.remove_prefix(end + 1);
    }
    Layout layout;
    for (const auto& line : dataLines) layout.dataLines.push_back(line.first);
    layout.problem = LayoutProblem(source, fieldsLine, fieldsText, setsLine, setsText, formatLine,
                                   formatFields, dataLines);
    return layout;
}

std::string LayoutProblem(const std::string& source, int fieldsLine, const std::string& fieldsText,
                          int setsLine, const std::string& setsText, int formatLine,
                          std::size_t formatFields,
                          const std::vector<std::pair<int, std::size_t>>& dataLines) {
    const auto at = [&](int line) { return source + ":" + std::to_string(line) + ": "; };
    double fields = 0.0, sets = 0.0;
    if (formatLine > 0 && fieldsLine == 0) {
        return at(formatLine) +
               "NUMBER_OF_FIELDS is missing: it must stand before BEGIN_DATA_FORMAT and give the "
               "number of fields (" +
               std::to_string(formatFields) + " here)";
    }
    if (fieldsLine > 0 && !IsCount(fieldsText, &fields)) {
        return at(fieldsLine) + "NUMBER_OF_FIELDS \"" + detail::Shown(fieldsText) +
               "\" is not a number of fields";
    }
    if (formatLine > 0 && static_cast<std::size_t>(fields) != formatFields) {
        return at(formatLine) + "the data format names " + std::to_string(formatFields) +
               " fields, NUMBER_OF_FIELDS on line " + std::to_string(fieldsLine) + " says " +
               fieldsText;
    }
    if (setsLine > 0 && !IsCount(setsText, &sets)) {
        return at(setsLine) + "NUMBER_OF_SETS \"" + detail::Shown(setsText) +
               "\" is not a number of sets";
    }
    if (sets > kMostCgatsSets || fields > kMostCgatsSets) {
        return at(sets > kMostCgatsSets ? setsLine : fieldsLine) + "more than " +
               std::to_string(kMostCgatsSets) + (sets > kMostCgatsSets ? " sets" : " fields") +
               ", which the CGATS parser (LittleCMS) does not take; split the file, or write it as "
               "CSV";
    }
    if (fields == 0.0 || dataLines.empty()) return "";
    std::size_t oneSetLines = 0;
    for (const auto& line : dataLines)
        oneSetLines += line.second == static_cast<std::size_t>(fields);
    if (2 * oneSetLines < dataLines.size()) return "";  // sets laid out over several lines
    for (const auto& line : dataLines) {
        if (line.second != static_cast<std::size_t>(fields)) {
            return at(line.first) + std::to_string(line.second) +
                   (line.second == 1 ? " value" : " values") + " where the data format has " +
                   fieldsText +
                   " fields (a value missing or extra, a name with blanks outside quotes, or an "
                   "unclosed quote)";
        }
    }
    if (setsLine > 0 && static_cast<std::size_t>(sets) != dataLines.size()) {
        return at(setsLine) + "NUMBER_OF_SETS says " + setsText + ", the data holds " +
               std::to_string(dataLines.size()) + " sets";
    }
    return "";
}

// LittleCMS words syntax errors "<file>: Line <n>, <what>" (no file name for
// text in memory); they become "<source>:<n>: <what>".
std::string LocateError(const std::string& source, const std::string& message) {
    const std::string marker = "Line ";
    const std::size_t at = message.find(marker);
    if (at != std::string::npos) {
        std::size_t end = at + marker.size();
        while (end < message.size() && message[end] >= '0' && message[end] <= '9') ++end;
        if (end > at + marker.size() && message.compare(end, 2, ", ") == 0) {
            return source + ":" + message.substr(at + marker.size(), end - at - marker.size()) +
                   ": " + message.substr(end + 2);
        }
    }
    return source + ": " + message;
}

// LittleCMS reports parse errors through a per-context handler.
void CollectError(cmsContext context, cmsUInt32Number, const char* text) {
    auto* errors = static_cast<std::vector<std::string>*>(cmsGetContextUserData(context));
    if (!errors || !text) return;
    std::string message(text);
    // Messages come with line ends of their own.
    while (!message.empty() &&
           (message.back() == '\n' || message.back() == '\r' || message.back() == ' ')) {
        message.pop_back();
    }
    errors->push_back(std::move(message));
}

class Cgats {
  public:
    Cgats() : amContext(cmsCreateContext(nullptr, &amErrors)) {
        if (amContext) cmsSetLogErrorHandlerTHR(amContext, CollectError);
    }
    ~Cgats() {
        if (amHandle) cmsIT8Free(amHandle);
        if (amContext) cmsDeleteContext(amContext);
    }
    Cgats(const Cgats&) = delete;
    Cgats& operator=(const Cgats&) = delete;

    bool Load(std::string_view text) {
        if (!amContext || text.size() > std::numeric_limits<cmsUInt32Number>::max()) return false;
        amHandle =
            cmsIT8LoadFromMem(amContext, text.data(), static_cast<cmsUInt32Number>(text.size()));
        return amHandle != nullptr;
    }
    cmsHANDLE Handle() const { return amHandle; }
    std::string FirstError() const {
        return amErrors.empty() ? std::string("not a readable CGATS file") : amErrors.front();
    }

  private:
    std::vector<std::string> amErrors;
    cmsContext amContext = nullptr;
    cmsHANDLE amHandle = nullptr;
};

// A property as a number, or 0 when it is absent or not a number.
double NumericProperty(cmsHANDLE it8, const char* name) {
    const char* text = cmsIT8GetProperty(it8, name);
    double value = 0.0;
    if (!text || !detail::ParseNumber(text, &value)) return 0.0;
    return value;
}

// The spectral fields of the data format, sorted by wavelength: (nm, field).
using Fields = std::vector<std::pair<double, int>>;

Fields SpectralFields(char** names, int fields, int* idField, int* nameField) {
    Fields spectral;
    for (int f = 0; f < fields && names; ++f) {
        const std::string name = names[f] ? names[f] : "";
        if (name == "SAMPLE_ID") {
            *idField = f;
        } else if (name == "SAMPLE_NAME") {
            *nameField = f;
        } else if (detail::WavelengthOf(name) >= 0) {
            spectral.emplace_back(detail::WavelengthOf(name), f);
        }
    }
    std::sort(spectral.begin(), spectral.end());
    return spectral;
}

// The grid SPECTRAL_BANDS/START/END state, if they state one.
std::vector<double> StatedGrid(cmsHANDLE it8) {
    const double bands = NumericProperty(it8, "SPECTRAL_BANDS");
    const double start = NumericProperty(it8, "SPECTRAL_START_NM");
    const double end = NumericProperty(it8, "SPECTRAL_END_NM");
    std::vector<double> grid;
    if (bands < 2 || bands > kMaxBands || bands != std::floor(bands) || start <= 0.0 ||
        end <= start)
        return grid;
    for (int i = 0; i < static_cast<int>(bands); ++i)
        grid.push_back(start + (end - start) * i / (bands - 1.0));
    return grid;
}

// The header's grid keywords as the file gives them.
std::string StatedKeywords(cmsHANDLE it8) {
    const auto shown = [&](const char* name) {
        const char* text = cmsIT8GetProperty(it8, name);
        return std::string(name) + " " + (text ? detail::Shown(text) : std::string("(missing)"));
    };
    return shown("SPECTRAL_BANDS") + ", " + shown("SPECTRAL_START_NM") + ", " +
           shown("SPECTRAL_END_NM");
}

// Where the field names and the stated grid part: "" when every field names
// its stated wavelength (to the whole nanometre the names are written in).
std::string Contradiction(const Fields& spectral, const std::vector<double>& stated, char** names) {
    if (stated.size() != spectral.size()) {
        return std::to_string(spectral.size()) + " spectral fields (" +
               StringHelpers::Shortest(spectral.front().first) + ".." +
               StringHelpers::Shortest(spectral.back().first) + " nm)";
    }
    for (std::size_t i = 0; i < stated.size(); ++i) {
        if (std::fabs(stated[i] - spectral[i].first) >= 1.0) {
            return "field " + detail::Shown(names[spectral[i].second]) + " (" +
                   StringHelpers::Shortest(spectral[i].first) + " nm where they put " +
                   StringHelpers::Fixed(stated[i], 2) + " nm)";
        }
    }
    return "";
}

// The grid: the field names give it; SPECTRAL_BANDS/START/END, where given,
// must agree with them and then make fractional steps exact.
std::string TakeGrid(cmsHANDLE it8, const Fields& spectral, char** names, SpectralSet* set) {
    if (spectral.size() < 3)
        return spectral.empty() ? "spectral fields missing" : "fewer than 3 spectral fields";
    if (spectral.size() > kMaxBands)
        return "more than " + std::to_string(kMaxBands) + " spectral fields";
    for (std::size_t i = 1; i < spectral.size(); ++i) {
        if (spectral[i].first == spectral[i - 1].first) {
            return "two spectral fields for " + StringHelpers::Shortest(spectral[i].first) + " nm";
        }
    }
    const bool stated = cmsIT8GetProperty(it8, "SPECTRAL_BANDS") ||
                        cmsIT8GetProperty(it8, "SPECTRAL_START_NM") ||
                        cmsIT8GetProperty(it8, "SPECTRAL_END_NM");
    const std::vector<double> grid = StatedGrid(it8);
    if (stated) {
        // A header that states a grid the fields do not have: ArgyllCMS
        // refuses the file, and so do we, rather than pick one of the two.
        const std::string contradiction = Contradiction(spectral, grid, names);
        if (!contradiction.empty()) {
            return "the header (" + StatedKeywords(it8) + ") contradicts the data format's " +
                   contradiction + "; ArgyllCMS refuses such a file too";
        }
        set->wavelengths = grid;
        return "";
    }
    for (const auto& field : spectral) set->wavelengths.push_back(field.first);
    return "";
}

// LittleCMS formats the numbers it reads with the C library, which follows
// the process's locale ("0,055" under a German one): the parser runs under
// the "C" locale on this thread, whatever the application chose.
class CLocaleScope {
  public:
    CLocaleScope() : amLocale(newlocale(LC_ALL_MASK, "C", nullptr)) {
        if (amLocale) amPrevious = uselocale(amLocale);
    }
    ~CLocaleScope() {
        if (!amLocale) return;
        uselocale(amPrevious);
        freelocale(amLocale);
    }
    CLocaleScope(const CLocaleScope&) = delete;
    CLocaleScope& operator=(const CLocaleScope&) = delete;

  private:
    locale_t amLocale;
    locale_t amPrevious = nullptr;
};

}  // namespace

namespace detail {

SpectralSet ReadCgatsText(std::string_view text, const std::string& source,
                          const SpectralReadOptions& axOptions) {
    SpectralSet set;
    set.format = "CGATS";
    const Layout layout = ScanLayout(text, source);
    if (!layout.problem.empty()) {
        AddError(&set, layout.problem);
        set.unusable = true;
        return set;
    }
    const CLocaleScope cLocale;
    Cgats cgats;
    if (!cgats.Load(text)) {
        AddError(&set, LocateError(source, cgats.FirstError()));
        set.unusable = true;
        return set;
    }
    cmsHANDLE it8 = cgats.Handle();
    char** names = nullptr;
    const int fields = cmsIT8EnumDataFormat(it8, &names);
    int idField = -1;
    int nameField = -1;
    const Fields spectral = SpectralFields(names, fields, &idField, &nameField);
    const std::string gridProblem = TakeGrid(it8, spectral, names, &set);
    if (!gridProblem.empty()) {
        AddError(&set, source + ": " + gridProblem);
        set.unusable = true;
        set.wavelengths.clear();
        return set;
    }

    // The file's own scale: SPECTRAL_NORM is the value that stands for 1.0;
    // ArgyllCMS measurement files (CTI3) hold percentages.
    double fileNorm = NumericProperty(it8, "SPECTRAL_NORM");
    std::string normReason =
        fileNorm > 0.0 ? "SPECTRAL_NORM " + StringHelpers::Shortest(fileNorm) : "";
    const char* sheet = cmsIT8GetSheetType(it8);
    if (fileNorm <= 0.0 && sheet && std::string(sheet).rfind("CTI3", 0) == 0) {
        fileNorm = 100.0;
        normReason = "an ArgyllCMS CTI3 file";
    }
    double divisor = fileNorm > 0.0 ? fileNorm : 1.0;
    if (axOptions.scale == SpectralScale::kPercent) divisor = 100.0;
    if (axOptions.scale == SpectralScale::kFraction) divisor = 1.0;

    const std::vector<int>& lines = layout.dataLines;
    const char* setsText = cmsIT8GetProperty(it8, "NUMBER_OF_SETS");
    double sets = 0.0;
    if (!setsText || !ParseNumber(setsText, &sets) || sets < 0 || sets != std::floor(sets)) {
        AddError(&set, source + ": NUMBER_OF_SETS \"" + Shown(setsText ? setsText : "") +
                           "\" is not a number of sets");
        set.unusable = true;
        return set;
    }
    const std::size_t count = static_cast<std::size_t>(std::min(sets, 1e9));
    for (std::size_t s = 0; s < count; ++s) {
        const int row = static_cast<int>(s);
        SpectralSample sample;
        sample.line = s < lines.size() ? lines[s] : 0;
        const std::string where =
            source + ":" +
            (sample.line ? std::to_string(sample.line) : "set " + std::to_string(s + 1));
        if (set.samples.size() >= axOptions.maxSamples) {
            AddError(&set, where + ": more than " + std::to_string(axOptions.maxSamples) +
                               " spectra; the rest is not read");
            break;
        }
        const char* id = idField >= 0 ? cmsIT8GetDataRowCol(it8, row, idField) : nullptr;
        const char* name = nameField >= 0 ? cmsIT8GetDataRowCol(it8, row, nameField) : nullptr;
        if (id) sample.id = id;
        if (name) sample.name = name;
        if (sample.id.empty() && sample.name.empty()) sample.id = std::to_string(s + 1);
        sample.values.resize(spectral.size());
        bool good = true;
        for (std::size_t k = 0; k < spectral.size() && good; ++k) {
            const char* value = cmsIT8GetDataRowCol(it8, row, spectral[k].second);
            double number = 0.0;
            const std::string field = names[spectral[k].second];
            if (!value || !ParseNumber(value, &number)) {
                AddError(&set, where + ": " + field + ": \"" + Shown(value ? value : "") +
                                   "\" is not a number");
                good = false;
                break;
            }
            sample.values[k] = static_cast<float>(number / divisor);
            if (!std::isfinite(sample.values[k])) {
                AddError(&set, where + ": " + field + ": \"" + Shown(value) + "\" is out of range");
                good = false;
            }
        }
        if (good) set.samples.push_back(std::move(sample));
    }
    const SpectralReadOptions known = {
        fileNorm > 0.0 && axOptions.scale == SpectralScale::kAuto
            ? (fileNorm == 1.0 ? SpectralScale::kFraction : SpectralScale::kPercent)
            : axOptions.scale,
        axOptions.maxSamples};
    FinishSet(&set, known, fileNorm, normReason, source);
    return set;
}

}  // namespace detail

}  // namespace nxbase
