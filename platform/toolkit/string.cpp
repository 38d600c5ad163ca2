#include "toolkit/string.h"

#include <algorithm>
#include <charconv>
#include <cmath>
#include <ostream>
#include <system_error>

String::String(const char* text) : text_(text ? text : "") {
    Clip();
}

String::String(const char* text, xub_StrLen length)
    : text_(text ? std::string(text, length) : "") {}

String::String(const std::string& text) : text_(text) {
    Clip();
}

String::String(std::string_view text) : text_(text) {
    Clip();
}

String::String(char c) : text_(1, c) {}

String String::CreateFromInt(long value) {
    char buffer[24];
    auto result = std::to_chars(buffer, buffer + sizeof buffer, value);
    return String(std::string_view(buffer, static_cast<std::size_t>(result.ptr - buffer)));
}

void String::Clip() {
    if (text_.size() > kMaxLen) text_.resize(kMaxLen);
}

void String::SetChar(xub_StrLen index, char c) {
    if (index < text_.size()) text_[index] = c;
}

xub_StrLen String::Search(const String& what, xub_StrLen from) const {
    if (what.text_.empty() || from >= text_.size()) return STRING_NOTFOUND;
    std::size_t at = text_.find(what.text_, from);
    return at == std::string::npos ? STRING_NOTFOUND : static_cast<xub_StrLen>(at);
}

xub_StrLen String::Search(char c, xub_StrLen from) const {
    if (from >= text_.size()) return STRING_NOTFOUND;
    std::size_t at = text_.find(c, from);
    return at == std::string::npos ? STRING_NOTFOUND : static_cast<xub_StrLen>(at);
}

xub_StrLen String::SearchBackward(char c) const {
    std::size_t at = text_.rfind(c);
    return at == std::string::npos ? STRING_NOTFOUND : static_cast<xub_StrLen>(at);
}

xub_StrLen String::SearchAndReplaceAll(const String& what, const String& with) {
    if (what.text_.empty()) return 0;
    std::string result;
    xub_StrLen count = 0;
    std::size_t start = 0;
    for (std::size_t at = text_.find(what.text_); at != std::string::npos;
         at = text_.find(what.text_, start)) {
        result.append(text_, start, at - start).append(with.text_);
        start = at + what.text_.size();
        ++count;
    }
    result.append(text_, start, std::string::npos);
    text_ = std::move(result);
    Clip();
    return count;
}

String String::Copy(xub_StrLen from, xub_StrLen count) const {
    if (from >= text_.size()) return String();
    return String(std::string_view(text_).substr(from, count));
}

String& String::Erase(xub_StrLen from, xub_StrLen count) {
    if (from < text_.size()) text_.erase(from, count);
    return *this;
}

String& String::Insert(const String& text, xub_StrLen at) {
    text_.insert(std::min<std::size_t>(at, text_.size()), text.text_);
    Clip();
    return *this;
}

String& String::Append(const String& text) {
    text_.append(text.text_);
    Clip();
    return *this;
}

String& String::Append(char c) {
    if (text_.size() < kMaxLen) text_.push_back(c);
    return *this;
}

String& String::EraseLeadingChars(char c) {
    text_.erase(0, text_.find_first_not_of(c));
    return *this;
}

String& String::EraseTrailingChars(char c) {
    std::size_t last = text_.find_last_not_of(c);
    text_.erase(last == std::string::npos ? 0 : last + 1);
    return *this;
}

String& String::EraseAllChars(char c) {
    text_.erase(std::remove(text_.begin(), text_.end(), c), text_.end());
    return *this;
}

String& String::ToUpper() {
    for (char& c : text_) {
        if (c >= 'a' && c <= 'z') c = static_cast<char>(c - 'a' + 'A');
    }
    return *this;
}

String& String::ToLower() {
    for (char& c : text_) {
        if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
    }
    return *this;
}

xub_StrLen String::GetTokenCount(char separator) const {
    if (text_.empty()) return 0;
    return static_cast<xub_StrLen>(std::count(text_.begin(), text_.end(), separator) + 1);
}

String String::GetToken(xub_StrLen index, char separator) const {
    std::size_t start = 0;
    for (xub_StrLen i = 0; i < index; ++i) {
        std::size_t next = text_.find(separator, start);
        if (next == std::string::npos) return String();
        start = next + 1;
    }
    std::size_t end = text_.find(separator, start);
    return String(
        std::string_view(text_).substr(start, end == std::string::npos ? end : end - start));
}

bool String::IsNumeric() const {
    return !text_.empty() &&
           std::all_of(text_.begin(), text_.end(), [](char c) { return c >= '0' && c <= '9'; });
}

namespace {

// Where the number that leads `text` starts: after blanks and a "+", which
// takes no "-" after it ("+-5" is no number).
std::size_t NumberStart(const std::string& text) {
    std::size_t at = text.find_first_not_of(" \t");
    if (at != std::string::npos && text[at] == '+' && text.compare(at + 1, 1, "-") != 0) ++at;
    return at == std::string::npos ? text.size() : at;
}

}  // namespace

long String::ToLong() const {
    long value = 0;
    std::from_chars(text_.data() + NumberStart(text_), text_.data() + text_.size(), value);
    return value;
}

double String::ToDouble() const {
    double value = 0.0;
    std::from_chars(text_.data() + NumberStart(text_), text_.data() + text_.size(), value);
    return value;
}

bool String::EqualsIgnoreCaseAscii(const String& other) const {
    String a(*this), b(other);
    return a.ToUpper().text_ == b.ToUpper().text_;
}

String operator+(const String& a, const String& b) {
    String result(a);
    return result.Append(b);
}

String operator+(const String& a, const char* b) {
    return a + String(b);
}

String operator+(const char* a, const String& b) {
    return String(a) + b;
}

std::ostream& operator<<(std::ostream& out, const String& text) {
    return out << text.str();
}

namespace toolkit {
namespace {

// Code points of the bytes 0x80..0x9F; the rest of the code page is Latin-1.
constexpr char32_t kHighControls[32] = {
    0x20AC, 0x0081, 0x201A, 0x0192, 0x201E, 0x2026, 0x2020, 0x2021, 0x02C6, 0x2030, 0x0160,
    0x2039, 0x0152, 0x008D, 0x017D, 0x008F, 0x0090, 0x2018, 0x2019, 0x201C, 0x201D, 0x2022,
    0x2013, 0x2014, 0x02DC, 0x2122, 0x0161, 0x203A, 0x0153, 0x009D, 0x017E, 0x0178};

bool IsAscii(std::string_view text) {
    for (char c : text) {
        if (static_cast<unsigned char>(c) >= 0x80) return false;
    }
    return true;
}

// The byte for `code`, or '?' when the code page has none.
char ByteFor(char32_t code) {
    if (code < 0x80 || (code >= 0xA0 && code <= 0xFF)) return static_cast<char>(code);
    for (int i = 0; i < 32; ++i) {
        if (kHighControls[i] == code) return static_cast<char>(0x80 + i);
    }
    return '?';
}

// Decodes one UTF-8 sequence at `at`; returns its length, 0 when invalid.
std::size_t DecodeUtf8(std::string_view text, std::size_t at, char32_t& code) {
    unsigned char lead = static_cast<unsigned char>(text[at]);
    std::size_t length = lead < 0xC2 ? 0 : lead < 0xE0 ? 2 : lead < 0xF0 ? 3 : lead < 0xF5 ? 4 : 0;
    if (length == 0 || at + length > text.size()) return 0;
    code = lead & (0x7F >> length);
    for (std::size_t i = 1; i < length; ++i) {
        unsigned char next = static_cast<unsigned char>(text[at + i]);
        if ((next & 0xC0) != 0x80) return 0;
        code = (code << 6) | (next & 0x3F);
    }
    bool overlong = (length == 3 && code < 0x800) || (length == 4 && code < 0x10000);
    bool surrogate = code >= 0xD800 && code <= 0xDFFF;
    return overlong || surrogate || code > 0x10FFFF ? 0 : length;
}

// The bytes one "?" stands for at a malformed sequence: a lead byte with the
// continuation bytes that follow it (a sequence cut short counts once), or
// a single stray byte.
std::size_t MalformedLength(std::string_view text, std::size_t at) {
    unsigned char lead = static_cast<unsigned char>(text[at]);
    std::size_t expected = lead < 0xC2   ? 1
                           : lead < 0xE0 ? 2
                           : lead < 0xF0 ? 3
                           : lead < 0xF5 ? 4
                                         : 1;
    std::size_t length = 1;
    while (length < expected && at + length < text.size() &&
           (static_cast<unsigned char>(text[at + length]) & 0xC0) == 0x80) {
        ++length;
    }
    return length;
}

}  // namespace

void AppendUtf8(std::string& out, char32_t code) {
    if (code < 0x80) {
        out += static_cast<char>(code);
    } else if (code < 0x800) {
        out += static_cast<char>(0xC0 | (code >> 6));
        out += static_cast<char>(0x80 | (code & 0x3F));
    } else if (code < 0x10000) {
        out += static_cast<char>(0xE0 | (code >> 12));
        out += static_cast<char>(0x80 | ((code >> 6) & 0x3F));
        out += static_cast<char>(0x80 | (code & 0x3F));
    } else {
        out += static_cast<char>(0xF0 | (code >> 18));
        out += static_cast<char>(0x80 | ((code >> 12) & 0x3F));
        out += static_cast<char>(0x80 | ((code >> 6) & 0x3F));
        out += static_cast<char>(0x80 | (code & 0x3F));
    }
}

bool IsValidUtf8(std::string_view text) {
    for (std::size_t at = 0; at < text.size();) {
        const unsigned char lead = static_cast<unsigned char>(text[at]);
        const std::size_t length = lead < 0x80   ? 1
                                   : lead < 0xC2 ? 0
                                   : lead < 0xE0 ? 2
                                   : lead < 0xF0 ? 3
                                   : lead < 0xF5 ? 4
                                                 : 0;
        if (length == 0 || at + length > text.size()) return false;
        // The second byte's range where the lead alone does not rule out
        // overlong forms, surrogates and code points above U+10FFFF.
        const unsigned char second = static_cast<unsigned char>(text[at + (length > 1 ? 1 : 0)]);
        if ((lead == 0xE0 && second < 0xA0) || (lead == 0xED && second > 0x9F) ||
            (lead == 0xF0 && second < 0x90) || (lead == 0xF4 && second > 0x8F)) {
            return false;
        }
        for (std::size_t i = 1; i < length; ++i) {
            if ((static_cast<unsigned char>(text[at + i]) & 0xC0) != 0x80) return false;
        }
        at += length;
    }
    return true;
}

std::string EightBitToUtf8(std::string_view text) {
    return IsValidUtf8(text) ? std::string(text) : Windows1252ToUtf8(text);
}

std::string Windows1252ToUtf8(std::string_view ansi) {
    if (IsAscii(ansi)) return std::string(ansi);
    std::string out;
    out.reserve(ansi.size() * 2);
    for (char c : ansi) {
        unsigned char byte = static_cast<unsigned char>(c);
        AppendUtf8(out, byte >= 0x80 && byte < 0xA0 ? kHighControls[byte - 0x80] : byte);
    }
    return out;
}

std::string Utf8ToWindows1252(std::string_view utf8) {
    if (IsAscii(utf8)) return std::string(utf8);
    std::string out;
    out.reserve(utf8.size());
    for (std::size_t at = 0; at < utf8.size();) {
        if (static_cast<unsigned char>(utf8[at]) < 0x80) {
            out += utf8[at++];
            continue;
        }
        char32_t code = 0;
        std::size_t length = DecodeUtf8(utf8, at, code);
        out += length == 0 ? '?' : ByteFor(code);
        at += length == 0 ? MalformedLength(utf8, at) : length;
    }
    return out;
}

bool ParseWholeInteger(std::string_view text, long long& value, int base) {
    long long parsed = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), parsed, base);
    if (text.empty() || error != std::errc() || end != text.data() + text.size()) return false;
    value = parsed;
    return true;
}

bool ParseWholeDecimal(std::string_view text, double& value, bool plus) {
    if (plus && !text.empty() && text.front() == '+') {
        text.remove_prefix(1);
        if (!text.empty() && text.front() == '-') return false;
    }
    double parsed = 0.0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), parsed);
    if (text.empty() || error != std::errc() || end != text.data() + text.size() ||
        !std::isfinite(parsed))
        return false;
    value = parsed;
    return true;
}

}  // namespace toolkit
