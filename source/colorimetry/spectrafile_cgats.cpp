// CGATS spectra for nxcolor (through LittleCMS's CGATS/IT8 parser), the choice
// between CGATS and CSV, and reading files.
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

#include <lcms2.h>

namespace nxbase {
namespace {

// The line of each data set, counting one set per non-blank, non-comment
// line after the BEGIN_DATA keyword (the layout writers use).
std::vector<int> DataLines(std::string_view text) {
    std::vector<int> lines;
    bool inData = false;
    int number = 0;
    while (!text.empty()) {
        const std::size_t end = text.find('\n');
        std::string_view line = text.substr(0, end);
        ++number;
        while (!line.empty() && (line.front() == ' ' || line.front() == '\t')) line.remove_prefix(1);
        while (!line.empty() && (line.back() == '\r' || line.back() == ' ' || line.back() == '\t')) {
            line.remove_suffix(1);
        }
        if (!inData) {
            inData = line == "BEGIN_DATA";
        } else if (line == "END_DATA") {
            break;
        } else if (!line.empty() && line.front() != '#') {
            lines.push_back(number);
        }
        if (end == std::string_view::npos) break;
        text.remove_prefix(end + 1);
    }
    return lines;
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
            return source + ":" + message.substr(at + marker.size(), end - at - marker.size()) + ": " +
                   message.substr(end + 2);
        }
    }
    return source + ": " + message;
}

// LittleCMS reports parse errors through a per-context handler.
void CollectError(cmsContext context, cmsUInt32Number, const char* text) {
    auto* errors = static_cast<std::vector<std::string>*>(cmsGetContextUserData(context));
    if (errors && text) errors->emplace_back(text);
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
        amHandle = cmsIT8LoadFromMem(amContext, text.data(), static_cast<cmsUInt32Number>(text.size()));
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


}  // namespace

bool LooksLikeCgats(std::string_view text) {
    return text.find("BEGIN_DATA_FORMAT") != std::string_view::npos;
}

SpectraTable ParseSpectraCgats(std::string_view text, const std::string& source, float scale) {
    SpectraTable table;
    Cgats cgats;
    if (!cgats.Load(text)) {
        table.errors.push_back(LocateError(source, cgats.FirstError()));
        table.unusable = true;  // nothing usable
        return table;
    }
    cmsHANDLE it8 = cgats.Handle();
    char** names = nullptr;
    const int fields = cmsIT8EnumDataFormat(it8, &names);
    int idField = -1;
    int nameField = -1;
    std::vector<std::pair<int, int>> spectral;  // (wavelength, field)
    for (int f = 0; f < fields && names; ++f) {
        const std::string name = names[f] ? names[f] : "";
        if (name == "SAMPLE_ID") {
            idField = f;
        } else if (name == "SAMPLE_NAME") {
            nameField = f;
        } else if (detail::WavelengthOf(name) >= 0) {
            spectral.emplace_back(detail::WavelengthOf(name), f);
        }
    }
    std::sort(spectral.begin(), spectral.end());
    bool grid = spectral.size() == static_cast<std::size_t>(kSpectrumSize);
    for (std::size_t i = 0; grid && i < spectral.size(); ++i) {
        grid = spectral[i].first == kFirstWavelength + kWavelengthStep * static_cast<int>(i);
    }
    if (!grid) {
        std::string what = source + ": spectral fields ";
        if (spectral.empty()) {
            what += "missing";
        } else {
            what += std::to_string(spectral.front().first) + ".." +
                    std::to_string(spectral.back().first) + " nm (" +
                    std::to_string(spectral.size()) + " fields)";
        }
        table.errors.push_back(what + "; nxcolor needs 36 fields, 380..730 nm in 10 nm steps");
        table.unusable = true;
        return table;
    }
    const std::vector<int> lines = DataLines(text);
    const double sets = cmsIT8GetPropertyDbl(it8, "NUMBER_OF_SETS");
    const int count = sets > 0 && sets < 1e8 ? static_cast<int>(sets) : 0;
    for (int set = 0; set < count; ++set) {
        SpectrumRow row;
        row.line = set < static_cast<int>(lines.size()) ? lines[set] : 0;
        const std::string where =
            source + ":" + (row.line ? std::to_string(row.line) : "set " + std::to_string(set + 1));
        const char* id = idField >= 0 ? cmsIT8GetDataRowCol(it8, set, idField) : nullptr;
        const char* name = nameField >= 0 ? cmsIT8GetDataRowCol(it8, set, nameField) : nullptr;
        if (id && *id) row.id = id;
        if (name && *name) row.id += (row.id.empty() ? "" : " ") + std::string(name);
        if (row.id.empty()) row.id = std::to_string(set + 1);
        bool good = true;
        for (int k = 0; k < kSpectrumSize && good; ++k) {
            const char* value = cmsIT8GetDataRowCol(it8, set, spectral[k].second);
            double number = 0.0;
            if (!value || !detail::ParseNumber(value, &number)) {
                table.errors.push_back(where + ": " + names[spectral[k].second] + ": \"" +
                                       detail::Shown(value ? value : "") + "\" is not a number");
                good = false;
                break;
            }
            row.values[k] = static_cast<float>(number / scale);
            if (!std::isfinite(row.values[k])) {
                table.errors.push_back(where + ": " + names[spectral[k].second] + ": \"" +
                                       detail::Shown(value) + "\" is out of range");
                good = false;
            }
        }
        if (good) table.rows.push_back(std::move(row));
    }
    return table;
}

SpectraTable ParseSpectra(std::string_view text, const std::string& source, float scale) {
    return LooksLikeCgats(text) ? ParseSpectraCgats(text, source, scale)
                                : ParseSpectraCsv(text, source, scale);
}

bool ReadSpectraFile(const std::string& path, float scale, SpectraTable* table, std::string* error) {
    std::string text;
    if (path == "-") {
        text.assign(std::istreambuf_iterator<char>(std::cin), std::istreambuf_iterator<char>());
    } else {
        std::error_code ignored;
        if (std::filesystem::is_directory(path, ignored)) {
            *error = path + ": is a directory";
            return false;
        }
        std::ifstream in(path, std::ios::binary);
        if (!in) {
            *error = path + ": cannot open the file";
            return false;
        }
        text.assign(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
        if (in.bad()) {
            *error = path + ": read error";
            return false;
        }
    }
    *table = ParseSpectra(text, path == "-" ? "<stdin>" : path, scale);
    return true;
}

}  // namespace nxbase
