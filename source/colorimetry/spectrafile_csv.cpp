// CSV spectra; see nxbase/spectrafile.h for the format.
#include "nxbase/spectrafile.h"

#include <cctype>
#include <charconv>
#include <cmath>

namespace nxbase {
namespace {

std::string_view Trim(std::string_view s) {
    while (!s.empty() && (s.front() == ' ' || s.front() == '\t')) s.remove_prefix(1);
    while (!s.empty() && (s.back() == ' ' || s.back() == '\t' || s.back() == '\r')) s.remove_suffix(1);
    return s;
}

// Splits one line at "," outside double quotes; quotes are removed and ""
// inside quotes gives one quote.
std::vector<std::string> SplitFields(std::string_view line) {
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
        } else if (c == ',') {
            fields.emplace_back(Trim(field));
            field.clear();
        } else {
            field += c;
        }
    }
    fields.emplace_back(Trim(field));
    return fields;
}

}  // namespace

namespace detail {

bool ParseNumber(std::string_view text, double* value) {
    text = Trim(text);
    if (!text.empty() && text.front() == '+') text.remove_prefix(1);
    if (text.empty()) return false;
    const auto result = std::from_chars(text.data(), text.data() + text.size(), *value);
    return result.ec == std::errc() && result.ptr == text.data() + text.size() && std::isfinite(*value);
}

int WavelengthOf(std::string_view field) {
    // Known prefixes, longest first; compared without ASCII case.
    static const char* const kPrefixes[] = {"SPECTRAL_NM", "SPECTRAL_", "SPEC_", "SPEC", "NM", "R_", "R", ""};
    auto upper = [](char c) { return static_cast<char>(std::toupper(static_cast<unsigned char>(c))); };
    for (const char* prefix : kPrefixes) {
        const std::string_view p(prefix);
        if (field.size() <= p.size()) continue;
        bool match = true;
        for (std::size_t i = 0; i < p.size() && match; ++i) match = upper(field[i]) == p[i];
        if (!match) continue;
        std::string_view rest = field.substr(p.size());
        if (rest.size() > 2 && upper(rest[rest.size() - 2]) == 'N' && upper(rest.back()) == 'M') {
            rest.remove_suffix(2);  // "380nm"
        }
        int nm = 0;
        const auto result = std::from_chars(rest.data(), rest.data() + rest.size(), nm);
        if (result.ec == std::errc() && result.ptr == rest.data() + rest.size() && nm >= 0) return nm;
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

// A header ends in a field that is not a number, and either names a
// wavelength there or has mostly text fields; a data row with one bad value
// at its end is not taken for one.
bool LooksLikeHeader(const std::vector<std::string>& fields) {
    double value = 0.0;
    if (ParseNumber(fields.back(), &value)) return false;
    if (WavelengthOf(fields.back()) >= 0) return true;
    std::size_t numbers = 0;
    for (const std::string& field : fields) numbers += ParseNumber(field, &value) ? 1 : 0;
    return 2 * numbers < fields.size();
}

class Parser {
public:
    Parser(const std::string& source, float scale, SpectraTable* table)
        : amSource(source), amScale(scale), pTable(table) {}

    void Line(std::string_view line, int number) {
        if (number == 1 && line.substr(0, 3) == "\xEF\xBB\xBF") line.remove_prefix(3);
        const std::string_view content = Trim(line);
        if (content.empty() || content.front() == '#') return;
        if (line.size() > kMaxLineLength) {
            Error(number, "line longer than " + std::to_string(kMaxLineLength) + " bytes");
            return;
        }
        const std::vector<std::string> fields = SplitFields(line);
        if (!amSeenContent) {
            amSeenContent = true;
            if (LooksLikeHeader(fields)) {
                Header(fields, number);
                return;
            }
        }
        if (pTable->unusable) return;
        Row(fields, number);
    }

private:
    void Error(int line, const std::string& what) {
        pTable->errors.push_back(amSource + ":" + std::to_string(line) + ": " + what);
    }

    void Header(const std::vector<std::string>& fields, int line) {
        // The spectral columns: the trailing fields that name a wavelength.
        std::size_t first = fields.size();
        while (first > 0 && WavelengthOf(fields[first - 1]) >= 0) --first;
        const std::size_t count = fields.size() - first;
        bool grid = count == static_cast<std::size_t>(kSpectrumSize);
        for (std::size_t i = 0; grid && i < count; ++i) {
            grid = WavelengthOf(fields[first + i]) ==
                   kFirstWavelength + kWavelengthStep * static_cast<int>(i);
        }
        if (!grid) {
            std::string what = "spectral columns ";
            if (count == 0) {
                what += "missing";
            } else {
                what += std::to_string(WavelengthOf(fields[first])) + ".." +
                        std::to_string(WavelengthOf(fields.back())) + " nm (" +
                        std::to_string(count) + " columns)";
            }
            Error(line, what + "; nxcolor needs 36 columns, 380..730 nm in 10 nm steps");
            pTable->unusable = true;
            return;
        }
        amIdFields = static_cast<int>(first);
    }

    void Row(const std::vector<std::string>& fields, int line) {
        const std::size_t expected = amIdFields >= 0 ? amIdFields + kSpectrumSize : 0;
        if (expected != 0 && fields.size() != expected) {
            Error(line, std::to_string(fields.size()) + " fields, expected " + std::to_string(expected));
            return;
        }
        if (fields.size() < static_cast<std::size_t>(kSpectrumSize)) {
            Error(line, std::to_string(fields.size()) + " fields, expected at least 36 values");
            return;
        }
        const std::size_t ids = fields.size() - kSpectrumSize;
        if (ids > kMaxIdFields) {
            Error(line, std::to_string(fields.size()) + " fields: more than " +
                            std::to_string(kMaxIdFields) + " before the 36 values");
            return;
        }
        SpectrumRow row;
        row.line = line;
        for (std::size_t i = 0; i < ids; ++i) {
            if (i > 0) row.id += ' ';
            row.id += fields[i];
        }
        if (row.id.empty()) row.id = std::to_string(pTable->rows.size() + 1);
        for (int k = 0; k < kSpectrumSize; ++k) {
            double value = 0.0;
            const std::string& field = fields[ids + k];
            if (!ParseNumber(field, &value)) {
                Error(line, "field " + std::to_string(ids + k + 1) + " (" +
                                std::to_string(kFirstWavelength + kWavelengthStep * k) + " nm): \"" +
                                Shown(field) + "\" is not a number");
                return;
            }
            const float scaled = static_cast<float>(value / amScale);
            if (!std::isfinite(scaled)) {
                Error(line, "field " + std::to_string(ids + k + 1) + " (" +
                                std::to_string(kFirstWavelength + kWavelengthStep * k) + " nm): \"" +
                                Shown(field) + "\" is out of range");
                return;
            }
            row.values[k] = scaled;
        }
        pTable->rows.push_back(std::move(row));
    }

    std::string amSource;
    float amScale;
    SpectraTable* pTable;
    bool amSeenContent = false;
    int amIdFields = -1;  // from the header; -1 without one
};

}  // namespace

SpectraTable ParseSpectraCsv(std::string_view text, const std::string& source, float scale) {
    SpectraTable table;
    Parser parser(source, scale, &table);
    int number = 0;
    while (!text.empty()) {
        const std::size_t end = text.find('\n');
        const std::string_view line = text.substr(0, end);
        parser.Line(line, ++number);
        if (end == std::string_view::npos) break;
        text.remove_prefix(end + 1);
    }
    return table;
}

}  // namespace nxbase
