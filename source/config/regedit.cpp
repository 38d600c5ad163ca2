// REGEDIT4 text: reading it into store changes and writing keys out as it.
#include <charconv>
#include <stdexcept>
#include <string_view>

#include "nxbase/registry.h"

namespace nxbase {
namespace {

constexpr std::size_t kMaxLineLength = 1 << 20;  // longer lines are refused
constexpr std::size_t kMaxExcerpt = 60;          // of the offending text in errors
constexpr std::size_t kMaxDwordDigits = 8;

class ParseError : public std::runtime_error {
  public:
    using std::runtime_error::runtime_error;
};

std::string Excerpt(std::string_view asText) {
    std::string excerpt(asText.substr(0, kMaxExcerpt));
    for (char& c : excerpt) {
        if (static_cast<unsigned char>(c) < 0x20) c = '?';
    }
    return asText.size() > kMaxExcerpt ? excerpt + "..." : excerpt;
}

std::string_view TrimRight(std::string_view asText) {
    while (!asText.empty() && (asText.back() == ' ' || asText.back() == '\t')) {
        asText.remove_suffix(1);
    }
    return asText;
}

std::string_view TrimLeft(std::string_view asText) {
    while (!asText.empty() && (asText.front() == ' ' || asText.front() == '\t')) {
        asText.remove_prefix(1);
    }
    return asText;
}

// Reads a quoted string at the start of `text` (which begins with '"'),
// removing it from `text`.
std::string ReadQuoted(std::string_view& axText) {
    std::string result;
    std::size_t at = 1;
    while (true) {
        if (at >= axText.size()) throw ParseError("missing closing quote");
        char c = axText[at++];
        if (c == '"') break;
        if (c != '\\') {
            result += c;
            continue;
        }
        if (at >= axText.size()) throw ParseError("missing closing quote");
        char escaped = axText[at++];
        switch (escaped) {
            case '\\':
            case '"':
                result += escaped;
                break;
            case 'n':
                result += '\n';
                break;
            case 'r':
                result += '\r';
                break;
            default:
                throw ParseError(std::string("unknown escape \\") + escaped);
        }
    }
    axText.remove_prefix(at);
    return result;
}

RegistryValue ReadData(std::string_view asData, std::string asName, bool& axDelete) {
    axDelete = false;
    if (asData == "-") {
        axDelete = true;
        return RegistryValue::Text(asName, std::string());
    }
    if (!asData.empty() && asData.front() == '"') {
        std::string text = ReadQuoted(asData);
        if (!TrimLeft(asData).empty()) throw ParseError("text after the closing quote");
        return RegistryValue::Text(asName, text);
    }
    constexpr std::string_view kDword = "dword:";
    if (asData.substr(0, kDword.size()) == kDword) {
        std::string_view digits = asData.substr(kDword.size());
        std::uint32_t number = 0;
        auto [end, error] =
            std::from_chars(digits.data(), digits.data() + digits.size(), number, 16);
        if (digits.empty() || digits.size() > kMaxDwordDigits || error != std::errc() ||
            end != digits.data() + digits.size()) {
            throw ParseError("a dword needs 1 to 8 hexadecimal digits");
        }
        return RegistryValue::Dword(asName, number);
    }
    if (asData.substr(0, 3) == "hex") throw ParseError("binary (hex) values are not supported");
    throw ParseError("a value must be \"text\", dword:XXXXXXXX or -");
}

void ParseLine(std::string_view asLine, bool& axHeaderSeen, bool& axInSection,
               RegistryStore::Change& axSection, std::vector<RegistryStore::Change>& axChanges) {
    std::string_view line = TrimLeft(TrimRight(asLine));
    if (!axHeaderSeen) {
        if (line.empty()) return;
        if (line != "REGEDIT4" && line != "Windows Registry Editor Version 5.00") {
            throw ParseError("the first line must be REGEDIT4");
        }
        axHeaderSeen = true;
        return;
    }
    if (line.empty() || line.front() == ';') return;
    if (line.front() == '[') {
        if (line.back() != ']') throw ParseError("a section must end with ]");
        std::string_view path = line.substr(1, line.size() - 2);
        bool remove = !path.empty() && path.front() == '-';
        if (remove) path.remove_prefix(1);
        RegistryStore::Change change;
        if (!SplitRegistryPath(std::string(path), change.hive, change.key)) {
            throw ParseError("unknown hive (HKEY_CURRENT_USER or HKEY_LOCAL_MACHINE)");
        }
        if (remove && change.key.find_first_not_of('\\') == std::string::npos) {
            throw ParseError("a whole hive cannot be deleted");
        }
        change.kind = remove ? RegistryStore::Change::Kind::DeleteKey
                             : RegistryStore::Change::Kind::CreateKey;
        axChanges.push_back(change);
        axSection = change;
        axInSection = !remove;
        return;
    }
    if (!axInSection) throw ParseError("a value outside a section");
    std::string name;
    if (line.front() == '@') {
        line.remove_prefix(1);
    } else if (line.front() == '"') {
        name = ReadQuoted(line);
    } else {
        throw ParseError("a value line must start with \"name\" or @");
    }
    line = TrimLeft(line);
    if (line.empty() || line.front() != '=') throw ParseError("missing = after the value name");
    line = TrimLeft(line.substr(1));
    bool remove = false;
    RegistryStore::Change change = axSection;
    change.value = ReadData(line, name, remove);
    change.kind =
        remove ? RegistryStore::Change::Kind::DeleteValue : RegistryStore::Change::Kind::SetValue;
    axChanges.push_back(std::move(change));
}

void AppendQuoted(std::string& axOut, const std::string& asText) {
    axOut += '"';
    for (char c : asText) {
        switch (c) {
            case '\\':
                axOut += "\\\\";
                break;
            case '"':
                axOut += "\\\"";
                break;
            case '\n':
                axOut += "\\n";
                break;
            case '\r':
                axOut += "\\r";
                break;
            default:
                axOut += c;
        }
    }
    axOut += '"';
}

}  // namespace

std::vector<RegistryStore::Change> ParseRegedit4(const std::string& asText,
                                                 const std::string& asSource) {
    std::vector<RegistryStore::Change> changes;
    std::string_view text(asText);
    if (text.substr(0, 3) == "\xEF\xBB\xBF") text.remove_prefix(3);  // UTF-8 byte order mark
    bool headerSeen = false;
    bool inSection = false;
    RegistryStore::Change section;
    std::size_t lineNumber = 0;
    std::size_t start = 0;
    while (start < text.size()) {
        std::size_t end = text.find('\n', start);
        if (end == std::string_view::npos) end = text.size();
        std::string_view line = text.substr(start, end - start);
        if (!line.empty() && line.back() == '\r') line.remove_suffix(1);
        ++lineNumber;
        try {
            if (line.size() > kMaxLineLength) throw ParseError("line too long");
            ParseLine(line, headerSeen, inSection, section, changes);
        } catch (const ParseError& error) {
            throw std::runtime_error(asSource + ":" + std::to_string(lineNumber) + ": " +
                                     error.what() + ": " + Excerpt(line));
        }
        start = end + 1;
    }
    if (!headerSeen) throw std::runtime_error(asSource + ": not REGEDIT4 text (empty)");
    return changes;
}

std::string ExportRegedit4(RegistryHive axHive, const std::string& asKey) {
    std::string out = "REGEDIT4\n";
    for (const std::string& key : RegistryStore::Tree(axHive, asKey)) {
        out += "\n[";
        out += HiveName(axHive);
        if (!key.empty()) out += "\\" + key;
        out += "]\n";
        for (const RegistryValue& value : RegistryStore::Values(axHive, key)) {
            if (value.name.empty()) {
                out += '@';
            } else {
                AppendQuoted(out, value.name);
            }
            out += '=';
            if (value.type == RegistryType::Dword) {
                char digits[kMaxDwordDigits + 1] = "00000000";
                char number[kMaxDwordDigits];
                auto result = std::to_chars(number, number + sizeof number, value.dword, 16);
                std::size_t length = static_cast<std::size_t>(result.ptr - number);
                std::copy(number, result.ptr, digits + kMaxDwordDigits - length);
                out += "dword:";
                out.append(digits, kMaxDwordDigits);
            } else {
                AppendQuoted(out, value.text);
            }
            out += '\n';
        }
    }
    return out;
}

}  // namespace nxbase
