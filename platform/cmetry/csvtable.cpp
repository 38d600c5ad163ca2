#include "csvtable.h"

#include "toolkit/fileio.h"
#include "toolkit/string.h"

namespace klume {
namespace cmetry {
namespace detail {

namespace {

std::string_view Trim(std::string_view s) {
    while (!s.empty() && (s.front() == ' ' || s.front() == '\t')) s.remove_prefix(1);
    while (!s.empty() && (s.back() == ' ' || s.back() == '\t' || s.back() == '\r')) {
        s.remove_suffix(1);
    }
    return s;
}

// At most this much of an offending line goes into a message.
constexpr std::size_t kQuotedTextLength = 60;

std::string Quote(std::string_view line) {
    std::string out;
    for (char c : line.substr(0, kQuotedTextLength)) {
        const unsigned char u = static_cast<unsigned char>(c);
        out += (u < 0x20 || u >= 0x7F) ? '?' : c;
    }
    if (line.size() > kQuotedTextLength) out += "...";
    return out;
}

bool Fail(std::string& error, const std::string& source, std::size_t line, const char* reason,
          std::string_view text) {
    error = source + ": line " + std::to_string(line) + ": " + reason + ": " + Quote(text);
    return false;
}

std::vector<std::string_view> SplitFields(std::string_view line) {
    std::vector<std::string_view> fields;
    std::size_t start = 0;
    while (true) {
        const std::size_t comma = line.find(',', start);
        if (comma == std::string_view::npos) {
            fields.push_back(Trim(line.substr(start)));
            return fields;
        }
        fields.push_back(Trim(line.substr(start, comma - start)));
        start = comma + 1;
        if (fields.size() > kMaxTableColumns) return fields;
    }
}

}  // namespace

bool ParseCsvTable(std::string_view text, const std::string& source, std::size_t minColumns,
                   CsvTable& table, std::string& error) {
    table = CsvTable();
    if (text.size() > kMaxTableBytes) {
        return Fail(error, source, 0, "file larger than the limit", std::to_string(kMaxTableBytes));
    }
    std::size_t lineNumber = 0;
    std::size_t position = 0;
    // Spreadsheet programs often save CSV with a UTF-8 byte-order mark.
    if (text.substr(0, 3) == "\xEF\xBB\xBF") position = 3;
    bool haveHeader = false;
    while (position < text.size()) {
        std::size_t end = text.find('\n', position);
        if (end == std::string_view::npos) end = text.size();
        const std::string_view raw = text.substr(position, end - position);
        position = end + 1;
        ++lineNumber;
        if (raw.size() > kMaxTableLineLength) {
            return Fail(error, source, lineNumber, "line too long", raw);
        }
        const std::string_view line = Trim(raw);
        if (line.empty()) continue;
        const std::vector<std::string_view> fields = SplitFields(line);
        if (fields.size() > kMaxTableColumns) {
            return Fail(error, source, lineNumber, "too many columns", line);
        }
        if (!haveHeader) {
            if (fields.size() < 2 || fields.size() < minColumns) {
                return Fail(error, source, lineNumber, "too few columns in the header", line);
            }
            if (fields[0] != "wavelength") {
                return Fail(error, source, lineNumber, "header must start with wavelength", line);
            }
            for (std::string_view name : fields) {
                if (name.empty()) return Fail(error, source, lineNumber, "empty column name", line);
                table.columns.emplace_back(name);
            }
            table.values.resize(fields.size() - 1);
            haveHeader = true;
            continue;
        }
        if (fields.size() != table.columns.size()) {
            return Fail(error, source, lineNumber, "wrong number of fields", line);
        }
        if (table.wavelengths.size() >= kMaxTableRows) {
            return Fail(error, source, lineNumber, "more rows than the limit", line);
        }
        double wavelength = 0.0;
        if (!toolkit::ParseWholeDecimal(fields[0], wavelength, true)) {
            return Fail(error, source, lineNumber, "not a number", fields[0]);
        }
        if (!table.wavelengths.empty() && !(wavelength > table.wavelengths.back())) {
            return Fail(error, source, lineNumber, "wavelengths not strictly ascending", line);
        }
        for (std::size_t c = 1; c < fields.size(); ++c) {
            double value = 0.0;
            if (!toolkit::ParseWholeDecimal(fields[c], value, true)) {
                return Fail(error, source, lineNumber, "not a number", fields[c]);
            }
            table.values[c - 1].push_back(value);
        }
        table.wavelengths.push_back(wavelength);
    }
    if (!haveHeader) return Fail(error, source, lineNumber, "no header", "");
    if (table.wavelengths.size() < 2) {
        return Fail(error, source, lineNumber, "fewer than two rows", "");
    }
    return true;
}

bool ReadTableFile(const std::string& path, std::string& text, std::string& error) {
    std::string why;
    if (toolkit::ReadWholeFile(path, kMaxTableBytes, text, why, false)) return true;
    error = path + ": " + why;
    return false;
}

}  // namespace detail
}  // namespace cmetry
}  // namespace klume
