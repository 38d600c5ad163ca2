// REGEDIT4 text: reading it into store changes and writing keys out as it.
#include <charconv>
#include <cstdint>
#include <stdexcept>
#include <string_view>

#include "nxbase/registry.h"
#include "nxbase/strhelp.h"
#include "toolkit/string.h"

namespace nxbase {
namespace {

constexpr std::size_t kMaxLineLength = 1 << 20;  // longer lines are refused
constexpr std::size_t kMaxExcerpt = 60;          // of the offending text in errors
constexpr std::size_t kMaxDwordDigits = 8;

class ParseError : public std::runtime_error {
  public:
    using std::runtime_error::runtime_error;
};

// Hexadecimal digits only, the whole field (no sign).
bool IsHexField(std::string_view asDigits, long long& axValue) {
    return !asDigits.empty() && asDigits.front() != '-' &&
           StringHelpers::ParseInteger(asDigits, axValue, 16);
}

// The start of the offending text, with control bytes written as \xNN so
// that an error message never carries them to a terminal.
std::string Excerpt(std::string_view asText) {
    static const char kDigits[] = "0123456789ABCDEF";
    std::string excerpt;
    for (char c : asText.substr(0, kMaxExcerpt)) {
        unsigned char byte = static_cast<unsigned char>(c);
        if (byte < 0x20 || byte == 0x7F) {
            excerpt += "\\x";
            excerpt += kDigits[byte >> 4];
            excerpt += kDigits[byte & 15];
        } else {
            excerpt += c;
        }
    }
    return asText.size() > kMaxExcerpt ? excerpt + "..." : excerpt;
}

// ---- the text's encoding ----

// UTF-16LE bytes (an odd last byte ignored) as UTF-8; a lone surrogate
// becomes U+FFFD.
std::string Utf16LeToUtf8(std::string_view asBytes) {
    std::string out;
    out.reserve(asBytes.size());
    auto unit = [&](std::size_t at) {
        return static_cast<char16_t>(static_cast<unsigned char>(asBytes[at]) |
                                     (static_cast<unsigned char>(asBytes[at + 1]) << 8));
    };
    for (std::size_t at = 0; at + 1 < asBytes.size(); at += 2) {
        char32_t code = unit(at);
        if (code >= 0xD800 && code <= 0xDBFF && at + 3 < asBytes.size()) {
            char32_t low = unit(at + 2);
            if (low >= 0xDC00 && low <= 0xDFFF) {
                code = 0x10000 + ((code - 0xD800) << 10) + (low - 0xDC00);
                at += 2;
            }
        }
        if (code >= 0xD800 && code <= 0xDFFF) code = 0xFFFD;
        toolkit::AppendUtf8(out, code);
    }
    return out;
}

// Eight-bit text as UTF-8: kept when it is UTF-8 already, else Windows-1252.
std::string NarrowToUtf8(std::string_view asText) {
    return toolkit::EightBitToUtf8(asText);
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

// The bytes of "0a,ff,..." (spaces allowed around the commas; may be empty).
std::string ReadHexBytes(std::string_view asList) {
    std::string bytes;
    asList = TrimLeft(TrimRight(asList));
    while (!asList.empty()) {
        std::size_t comma = asList.find(',');
        std::string_view pair = TrimLeft(TrimRight(asList.substr(0, comma)));
        long long value = 0;
        if (pair.size() > 2 || !IsHexField(pair, value)) {
            throw ParseError("hex data must be byte pairs separated by commas");
        }
        bytes += static_cast<char>(value);
        if (comma == std::string_view::npos) break;
        asList.remove_prefix(comma + 1);
        if (TrimLeft(asList).empty()) throw ParseError("hex data ends with a comma");
    }
    return bytes;
}

// hex(2) and hex(7) data: zero-terminated strings in the file's units.
std::vector<std::string> ReadStrings(const std::string& asBytes, bool abWide) {
    std::string text = abWide ? Utf16LeToUtf8(asBytes) : NarrowToUtf8(asBytes);
    std::vector<std::string> strings;
    std::size_t start = 0;
    while (start < text.size()) {
        std::size_t end = text.find('\0', start);
        if (end == std::string::npos) end = text.size();
        if (end == start) break;  // the empty string ends a multi-string
        strings.push_back(text.substr(start, end - start));
        start = end + 1;
    }
    return strings;
}

RegistryValue ReadHexValue(std::string_view asData, std::string asName, bool abWide) {
    std::uint32_t type = static_cast<std::uint32_t>(RegistryType::Binary);
    asData.remove_prefix(3);  // "hex"
    if (!asData.empty() && asData.front() == '(') {
        std::size_t close = asData.find(')');
        std::string_view digits = asData.substr(1, close == std::string_view::npos ? 0 : close - 1);
        long long number = 0;
        if (close == std::string_view::npos || !IsHexField(digits, number) || number > UINT32_MAX) {
            throw ParseError("hex(N) needs a hexadecimal type number");
        }
        type = static_cast<std::uint32_t>(number);
        asData.remove_prefix(close + 1);
    }
    if (asData.empty() || asData.front() != ':') throw ParseError("missing : after hex");
    RegistryValue value;
    value.name = std::move(asName);
    value.type = static_cast<RegistryType>(type);
    std::string bytes = ReadHexBytes(asData.substr(1));
    if (value.type == RegistryType::ExpandString) {
        std::vector<std::string> strings = ReadStrings(bytes, abWide);
        value.text = strings.empty() ? std::string() : strings.front();
    } else if (value.type == RegistryType::MultiString) {
        for (const std::string& one : ReadStrings(bytes, abWide)) {
            value.text += one;
            value.text += '\0';
        }
    } else if (value.type == RegistryType::Dword) {
        if (bytes.size() != 4) throw ParseError("hex(4) needs four bytes");
        value.dword = 0;
        for (int i = 3; i >= 0; --i) {
            value.dword = (value.dword << 8) | static_cast<unsigned char>(bytes[i]);
        }
    } else {
        value.text = std::move(bytes);
    }
    return value;
}

RegistryValue ReadData(std::string_view asData, std::string asName, bool& axDelete, bool abWide) {
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
        long long number = 0;
        if (digits.size() > kMaxDwordDigits || !IsHexField(digits, number)) {
            throw ParseError("a dword needs 1 to 8 hexadecimal digits");
        }
        return RegistryValue::Dword(asName, static_cast<std::uint32_t>(number));
    }
    if (asData.substr(0, 3) == "hex") return ReadHexValue(asData, std::move(asName), abWide);
    throw ParseError("a value must be \"text\", dword:XXXXXXXX, hex...: or -");
}

// The first line of registry text: REGEDIT4, or what regedit writes today.
bool IsHeaderLine(std::string_view asLine) {
    return asLine == "REGEDIT4" || asLine == "Windows Registry Editor Version 5.00";
}

void RefuseZeroByte(const std::string& asName, const char* asWhat) {
    if (asName.find('\0') != std::string::npos) {
        throw ParseError(std::string("a ") + asWhat + " holding a NUL byte");
    }
}

void ParseLine(std::string_view asLine, bool abWide, bool& axHeaderSeen, bool& axInSection,
               RegistryStore::Change& axSection, std::vector<RegistryStore::Change>& axChanges) {
    std::string_view line = TrimLeft(TrimRight(asLine));
    if (!axHeaderSeen) {
        if (line.empty()) return;
        if (!IsHeaderLine(line)) {
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
        RefuseZeroByte(std::string(path), "key path");
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
        RefuseZeroByte(name, "value name");
    } else {
        throw ParseError("a value line must start with \"name\" or @");
    }
    line = TrimLeft(line);
    if (line.empty() || line.front() != '=') throw ParseError("missing = after the value name");
    line = TrimLeft(line.substr(1));
    bool remove = false;
    RegistryStore::Change change = axSection;
    change.value = ReadData(line, name, remove, abWide);
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

// hex:, hex(2): or hex(N): and the bytes of a value that is neither a
// String nor a Dword; the strings of hex(2)/hex(7) as UTF-8 with their zeros.
void AppendHex(std::string& axOut, const RegistryValue& axValue) {
    static const char kDigits[] = "0123456789abcdef";
    std::string bytes = axValue.text;
    if (axValue.type == RegistryType::Binary) {
        axOut += "hex:";
    } else {
        char type[9];
        auto end =
            std::to_chars(type, type + sizeof type, static_cast<std::uint32_t>(axValue.type), 16);
        axOut += "hex(";
        axOut.append(type, end.ptr);
        axOut += "):";
        if (axValue.type == RegistryType::ExpandString) bytes += '\0';
        if (axValue.type == RegistryType::MultiString) bytes += '\0';
    }
    for (std::size_t i = 0; i < bytes.size(); ++i) {
        if (i > 0) axOut += ',';
        unsigned char byte = static_cast<unsigned char>(bytes[i]);
        axOut += kDigits[byte >> 4];
        axOut += kDigits[byte & 15];
    }
}

}  // namespace

namespace {

bool IsWide(std::string_view asText) {
    return asText.size() >= 2 && asText[0] == '\xFF' && asText[1] == '\xFE';
}

// The text in UTF-8, its byte-order mark dropped.
std::string DecodeRegistryText(std::string_view asText) {
    if (IsWide(asText)) return Utf16LeToUtf8(asText.substr(2));
    if (asText.substr(0, 3) == "\xEF\xBB\xBF") asText.remove_prefix(3);  // UTF-8 mark
    return NarrowToUtf8(asText);
}

}  // namespace

bool CheckRegedit4Header(std::string_view asHead, bool abComplete, const std::string& asSource) {
    // A UTF-16 head may end inside a character; only whole ones are decoded.
    if (IsWide(asHead) && asHead.size() % 2 != 0) asHead.remove_suffix(1);
    const std::string decoded = DecodeRegistryText(asHead);
    std::string_view text(decoded);
    std::size_t lineNumber = 0;
    while (!text.empty()) {
        const std::size_t end = text.find('\n');
        if (end == std::string_view::npos && !abComplete) return false;
        std::string_view line = text.substr(0, end);
        ++lineNumber;
        const std::string_view trimmed = TrimLeft(TrimRight(line));
        if (!trimmed.empty()) {
            if (IsHeaderLine(trimmed)) return true;
            throw std::runtime_error(asSource + ":" + std::to_string(lineNumber) +
                                     ": the first line must be REGEDIT4: " + Excerpt(line));
        }
        if (end == std::string_view::npos) break;
        text.remove_prefix(end + 1);
    }
    if (!abComplete) return false;
    throw std::runtime_error(asSource + ": not REGEDIT4 text (empty)");
}

std::vector<RegistryStore::Change> ParseRegedit4(const std::string& asText,
                                                 const std::string& asSource) {
    const bool wide = IsWide(asText);
    const std::string decoded = DecodeRegistryText(asText);
    std::vector<RegistryStore::Change> changes;
    std::string_view text(decoded);
    bool headerSeen = false;
    bool inSection = false;
    RegistryStore::Change section;
    std::size_t lineNumber = 0;
    std::size_t start = 0;
    auto nextLine = [&](std::string_view& axLine) {
        std::size_t end = text.find('\n', start);
        if (end == std::string_view::npos) end = text.size();
        axLine = text.substr(start, end - start);
        if (!axLine.empty() && axLine.back() == '\r') axLine.remove_suffix(1);
        start = end + 1;
        ++lineNumber;
    };
    while (start < text.size()) {
        std::string_view physical;
        nextLine(physical);
        std::size_t firstLine = lineNumber;
        std::string logical(physical);
        try {
            // Hex data continues on the next line after ",\".
            while (TrimRight(logical).size() >= 2 &&
                   TrimRight(logical).substr(TrimRight(logical).size() - 2) == ",\\" &&
                   start < text.size()) {
                logical.resize(TrimRight(logical).size() - 1);
                std::string_view more;
                nextLine(more);
                logical += TrimLeft(more);
                if (logical.size() > kMaxLineLength) throw ParseError("line too long");
            }
            if (logical.size() > kMaxLineLength) throw ParseError("line too long");
            ParseLine(logical, wide, headerSeen, inSection, section, changes);
        } catch (const ParseError& error) {
            throw std::runtime_error(asSource + ":" + std::to_string(firstLine) + ": " +
                                     error.what() + ": " + Excerpt(logical));
        }
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
            if (value.type != RegistryType::Dword && value.type != RegistryType::String) {
                AppendHex(out, value);
            } else if (value.type == RegistryType::Dword) {
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
