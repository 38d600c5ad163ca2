#include "nxbase/strhelp.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <cmath>
#include <string_view>
#include <system_error>

namespace {

// Pieces of `asText` between separators, empty ones included; a text that
// ends in a separator ends in an empty piece. One pass, so long texts with
// many separators stay linear.
template <typename Piece>
std::vector<Piece> Cut(std::string_view asText, char axSeparator) {
    std::vector<Piece> pieces;
    std::size_t start = 0;
    for (;;) {
        std::size_t end = asText.find(axSeparator, start);
        if (end == std::string_view::npos) {
            pieces.emplace_back(asText.substr(start));
            return pieces;
        }
        pieces.emplace_back(asText.substr(start, end - start));
        start = end + 1;
    }
}

std::string PadLeft(std::string asText, int alWidth, char axPad, std::size_t alAfter) {
    if (alWidth > static_cast<int>(String::kMaxLen)) alWidth = static_cast<int>(String::kMaxLen);
    if (alWidth > static_cast<int>(asText.size()))
        asText.insert(alAfter, static_cast<std::size_t>(alWidth) - asText.size(), axPad);
    return asText;
}

}  // namespace

// ---------------------------------------------------------- StringHelpers

void StringHelpers::Replace(std::string& asText, const std::string& asWhat,
                            const std::string& asWith) {
    if (asWhat.empty()) return;
    std::string result;
    result.reserve(asText.size());
    std::size_t start = 0;
    for (std::size_t found; (found = asText.find(asWhat, start)) != std::string::npos;) {
        result.append(asText, start, found - start);
        result += asWith;
        start = found + asWhat.size();
    }
    result.append(asText, start, std::string::npos);
    asText = std::move(result);
}

std::vector<std::string> StringHelpers::Split(const std::string& asText, char axSeparator) {
    std::size_t first = asText.find_first_not_of(' ');
    if (first == std::string::npos) return {};
    std::size_t last = asText.find_last_not_of(' ');
    return Cut<std::string>(std::string_view(asText).substr(first, last - first + 1), axSeparator);
}

std::vector<std::string> StringHelpers::SplitSearchStringToVector(const std::string& asText,
                                                                  char axSeparator) {
    if (asText.empty() || asText == "*" || asText == " ") return {"*"};
    return Split(asText, axSeparator);
}

std::vector<String> StringHelpers::SplitStringToVector(const String& asText, char axSeparator) {
    // The same tokens as String::GetTokenCount / GetToken, cut in one pass.
    if (asText.IsEmpty()) return {String("*")};
    return Cut<String>(asText.str(), axSeparator);
}

String StringHelpers::Concatenate(std::vector<String> axParts, const String& asSeparator) {
    std::string joined;
    for (std::size_t i = 0; i < axParts.size(); ++i) {
        if (i > 0) joined += asSeparator.str();
        joined += axParts[i].str();
    }
    return String(joined);
}

std::string StringHelpers::ToLower(const std::string& asText) {
    std::string result(asText);
    for (char& c : result)
        if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
    return result;
}

std::string StringHelpers::ToUpper(const std::string& asText) {
    std::string result(asText);
    for (char& c : result)
        if (c >= 'a' && c <= 'z') c = static_cast<char>(c - 'a' + 'A');
    return result;
}

std::string StringHelpers::BaseConverter(unsigned int alNumber, const std::string& asDigits) {
    const std::size_t base = asDigits.size();
    if (base < 2) return {};
    std::string result;
    do {
        result += asDigits[alNumber % base];
        alNumber = static_cast<unsigned int>(alNumber / base);
    } while (alNumber != 0);
    std::reverse(result.begin(), result.end());
    return result;
}

const std::string& StringHelpers::CharactersBase2() {
    static const std::string digits("01");
    return digits;
}

const std::string& StringHelpers::CharactersBase8() {
    static const std::string digits("01234567");
    return digits;
}

const std::string& StringHelpers::CharactersBase10() {
    static const std::string digits("0123456789");
    return digits;
}

const std::string& StringHelpers::CharactersBase16() {
    static const std::string digits("0123456789ABCDEF");
    return digits;
}

std::string StringHelpers::Fixed(double axValue, int alDecimals) {
    std::array<char, 320 + GString::kMaxDecimals> buffer;
    const auto [end, error] =
        std::to_chars(buffer.data(), buffer.data() + buffer.size(), axValue,
                      std::chars_format::fixed, std::clamp(alDecimals, 0, GString::kMaxDecimals));
    return error == std::errc() ? std::string(buffer.data(), end) : std::string("nan");
}

std::string StringHelpers::Shortest(double axValue) {
    std::array<char, 32> buffer;
    const auto [end, error] = std::to_chars(buffer.data(), buffer.data() + buffer.size(), axValue);
    return error == std::errc() ? std::string(buffer.data(), end) : std::string("nan");
}

bool StringHelpers::ParseInteger(std::string_view asText, long long& axValue, int alBase) {
    return toolkit::ParseWholeInteger(asText, axValue, alBase);
}

bool StringHelpers::ParseDecimal(std::string_view asText, double& axValue) {
    return toolkit::ParseWholeDecimal(asText, axValue);
}

// ---------------------------------------------------------------- GString

GString::GString(double axValue, int alDecimals, int alWidth, char axDecimalSeparator,
                 bool axZeroPad, bool axPlusSign) {
    std::string text = StringHelpers::Fixed(axValue, alDecimals);
    const bool finite = std::isfinite(axValue);
    if (finite && text[0] == '-' && text.find_first_not_of("0.", 1) == std::string::npos) {
        text.erase(0, 1);  // -0.00 reads as 0.00
    }
    if (finite && axDecimalSeparator != '.')
        std::replace(text.begin(), text.end(), '.', axDecimalSeparator);
    if (axPlusSign && text[0] != '-' && text != "nan") text.insert(0, 1, '+');
    const bool signed_ = text[0] == '-' || text[0] == '+';
    if (axZeroPad && finite) {
        text = PadLeft(std::move(text), alWidth, '0', signed_ ? 1 : 0);
    } else {
        text = PadLeft(std::move(text), alWidth, ' ', 0);
    }
    static_cast<String&>(*this) = String(text);
}

GString::GString(int axValue, int alWidth) {
    std::array<char, 16> buffer;
    auto result = std::to_chars(buffer.data(), buffer.data() + buffer.size(), axValue);
    static_cast<String&>(*this) =
        String(PadLeft(std::string(buffer.data(), result.ptr), alWidth, ' ', 0));
}

GString::operator double() const {
    std::string text = str();
    std::size_t at = text.find_first_not_of(" \t");
    if (at == std::string::npos) return 0.0;
    if (text[at] == '+' && at + 1 < text.size() && text[at + 1] != '-') ++at;
    // Accept ',' as the decimal separator too: the first ',' becomes '.'
    // unless a '.' already came first.
    std::size_t comma = text.find(',', at);
    if (comma != std::string::npos && text.find('.', at) > comma) text[comma] = '.';
    double value = 0.0;
    auto result = std::from_chars(text.data() + at, text.data() + text.size(), value);
    if (result.ec == std::errc::result_out_of_range) {
        // from_chars leaves the value unset; answer the signed limit instead.
        return text[at] == '-' ? -HUGE_VAL : HUGE_VAL;
    }
    return result.ec == std::errc() ? value : 0.0;
}

bool GString::MatchPattern(const String& asPattern) const {
    xub_StrLen position = 0;
    for (const String& token : Cut<String>(asPattern.str(), '*')) {
        if (token.IsEmpty()) continue;
        xub_StrLen found = Search(token, position);
        if (found == STRING_NOTFOUND) return false;
        position = static_cast<xub_StrLen>(found + token.Len());
    }
    return true;
}

bool GString::MatchVectorPattern(const std::vector<String>& axPatterns) const {
    if (axPatterns.empty()) return false;
    return std::all_of(axPatterns.begin(), axPatterns.end(),
                       [this](const String& pattern) { return MatchPattern(pattern); });
}

// --------------------------------------------------------- DynStringArray

DynStringArray::DynStringArray(unsigned long alSize) : amSlots(alSize, nullptr) {}

String* DynStringArray::Put(unsigned long alIndex, String* p) {
    if (alIndex >= amSlots.size()) return nullptr;
    amSlots[alIndex] = p;
    return p;
}

String* DynStringArray::Get(unsigned long alIndex) const {
    return alIndex < amSlots.size() ? amSlots[alIndex] : nullptr;
}

void DynStringArray::ChangeSize(unsigned long alNewSize) {
    amSlots.resize(alNewSize, nullptr);
}

void DynStringArray::Clear() {
    std::fill(amSlots.begin(), amSlots.end(), nullptr);
}

bool operator==(const DynStringArray& a, const DynStringArray& b) {
    if (a.amSlots.size() != b.amSlots.size()) return false;
    for (std::size_t i = 0; i < a.amSlots.size(); ++i) {
        const String* x = a.amSlots[i];
        const String* y = b.amSlots[i];
        if (x == y) continue;
        if (x == nullptr || y == nullptr || *x != *y) return false;
    }
    return true;
}
