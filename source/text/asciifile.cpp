#include "nxbase/asciifile.h"

#include <algorithm>
#include <charconv>
#include <climits>
#include <cmath>
#include <cstring>
#include <iostream>
#include <iterator>
#include <limits>
#include <stdexcept>

#include "asciifile_io.h"
#include "nxbase/appconfig.h"
#include "nxbase/logfile.h"
#include "toolkit/system.h"

namespace {

constexpr char kCaret = '^';
constexpr char kTab = '\t';
constexpr char kLineFeed = '\n';
constexpr char kReturn = '\r';
// Bytes handed to istream::getline per call while collecting one line.
constexpr std::streamsize kLineChunk = 1024;
// Decimals accepted by the real writers.
constexpr int kMaxPrecision = 40;
// Field widths of the array writers, so that columns line up.
constexpr int kShortField = 6;
constexpr int kIntField = 7;
// Reals whose digits form an integer of at most 2^53 with at most 22
// decimals convert exactly by one division; 19 digits cannot overflow.
constexpr std::size_t kExactDigits = 19;
constexpr std::uint64_t kExactMantissa = std::uint64_t{1} << 53;
constexpr double kPowersOfTen[] = {1e0,  1e1,  1e2,  1e3,  1e4,  1e5,  1e6,  1e7,
                                   1e8,  1e9,  1e10, 1e11, 1e12, 1e13, 1e14, 1e15,
                                   1e16, 1e17, 1e18, 1e19, 1e20, 1e21, 1e22};
// Oldest format version CheckVersion accepts.
constexpr int kOldestVersion = 2;

constexpr const char* kVersionTitle = "File";
constexpr const char* kApplicationKey = "Application";
constexpr const char* kVersionKey = "Version";

// Code page 850 (DOS, Western Europe) to Windows-1252, bytes 0x80..0xFF;
// characters that Windows-1252 lacks (box drawing, dotless i, ...) become "?".
// From the code-page definitions published by IBM (CP850) and Microsoft
// (cp1252.txt of the Unicode mapping tables).
constexpr unsigned char kCp850ToCp1252[128] = {
    0xC7, 0xFC, 0xE9, 0xE2, 0xE4, 0xE0, 0xE5, 0xE7,  // 0x80
    0xEA, 0xEB, 0xE8, 0xEF, 0xEE, 0xEC, 0xC4, 0xC5,  // 0x88
    0xC9, 0xE6, 0xC6, 0xF4, 0xF6, 0xF2, 0xFB, 0xF9,  // 0x90
    0xFF, 0xD6, 0xDC, 0xF8, 0xA3, 0xD8, 0xD7, 0x83,  // 0x98
    0xE1, 0xED, 0xF3, 0xFA, 0xF1, 0xD1, 0xAA, 0xBA,  // 0xA0
    0xBF, 0xAE, 0xAC, 0xBD, 0xBC, 0xA1, 0xAB, 0xBB,  // 0xA8
    0x3F, 0x3F, 0x3F, 0x3F, 0x3F, 0xC1, 0xC2, 0xC0,  // 0xB0
    0xA9, 0x3F, 0x3F, 0x3F, 0x3F, 0xA2, 0xA5, 0x3F,  // 0xB8
    0x3F, 0x3F, 0x3F, 0x3F, 0x3F, 0x3F, 0xE3, 0xC3,  // 0xC0
    0x3F, 0x3F, 0x3F, 0x3F, 0x3F, 0x3F, 0x3F, 0xA4,  // 0xC8
    0xF0, 0xD0, 0xCA, 0xCB, 0xC8, 0x3F, 0xCD, 0xCE,  // 0xD0
    0xCF, 0x3F, 0x3F, 0x3F, 0x3F, 0xA6, 0xCC, 0x3F,  // 0xD8
    0xD3, 0xDF, 0xD4, 0xD2, 0xF5, 0xD5, 0xB5, 0xFE,  // 0xE0
    0xDE, 0xDA, 0xDB, 0xD9, 0xFD, 0xDD, 0xAF, 0xB4,  // 0xE8
    0xAD, 0xB1, 0x3F, 0xBE, 0xB6, 0xA7, 0xF7, 0xB8,  // 0xF0
    0xB0, 0xA8, 0xB7, 0xB9, 0xB3, 0xB2, 0x3F, 0xA0,  // 0xF8
};

void DosToWindows(std::string& text) {
    for (char& c : text) {
        auto byte = static_cast<unsigned char>(c);
        if (byte >= 0x80) c = static_cast<char>(kCp850ToCp1252[byte - 0x80]);
    }
}

bool IsBlank(char c) {
    return c == ' ' || c == kTab;
}
bool IsDigit(char c) {
    return c >= '0' && c <= '9';
}

template <class T>
T Clamp(long long value) {
    if (value < std::numeric_limits<T>::min()) return std::numeric_limits<T>::min();
    if (value > std::numeric_limits<T>::max()) return std::numeric_limits<T>::max();
    return static_cast<T>(value);
}

// Decimal text of an integer, right-aligned in a field of `width` blanks.
void AppendInteger(std::string& out, long long value, int width = 0) {
    char digits[24];
    auto result = std::to_chars(digits, digits + sizeof digits, value);
    auto length = static_cast<int>(result.ptr - digits);
    if (width > length) out.append(static_cast<std::size_t>(width - length), ' ');
    out.append(digits, result.ptr);
}

// Two digits with a leading zero for 0..9; other values as they are.
void AppendTwoDigits(std::string& out, int value) {
    if (value >= 0 && value < 10) out.push_back('0');
    AppendInteger(out, value);
}

// Fixed notation with `precision` decimals and "." as the separator.
void AppendReal(std::string& out, double value, int precision) {
    precision = std::clamp(precision, 0, kMaxPrecision);
    // 309 integer digits of DBL_MAX, sign, separator and the decimals.
    char text[400];
    auto result =
        std::to_chars(text, text + sizeof text, value, std::chars_format::fixed, precision);
    out.append(text, result.ptr);
}

// Caret escapes: control bytes other than TAB as "^" plus (byte + 64), the
// caret itself as "^" 0x9E; every other byte as it is.
void AppendEscaped(std::string& out, const std::string& text) {
    for (char c : text) {
        auto byte = static_cast<unsigned char>(c);
        if (byte < 32 && c != kTab) {
            out.push_back(kCaret);
            out.push_back(static_cast<char>(byte + 64));
        } else if (c == kCaret) {
            out.push_back(kCaret);
            out.push_back(static_cast<char>(static_cast<unsigned char>(kCaret) + 64));
        } else {
            out.push_back(c);
        }
    }
}

// The current application's version text, from the AppName singleton
// (which throws when the application has not created it).
String ApplicationVersionText() {
    return AppName::Instance()->GetVersionString();
}

[[noreturn]] void Unsupported() {
    throw std::logic_error("Unsupported operation");
}

bool RejectWriting(bool axForReading) {
    if (!axForReading) throw std::logic_error("ASCIIFile 2 does not support write");
    return axForReading;
}

}  // namespace

// ---- ASCIIFile ----

ASCIIFile::~ASCIIFile() = default;

boost::shared_ptr<ASCIIFile> ASCIIFile::Get(const String& asFileName, bool axForReading,
                                            bool axTabMode) {
    return boost::shared_ptr<ASCIIFile>(new ASCIIFileImpl(asFileName, axForReading, axTabMode));
}

boost::shared_ptr<ASCIIFile> ASCIIFile::Get(std::iostream* pStream, bool axForReading,
                                            bool axTabMode) {
    return boost::shared_ptr<ASCIIFile>(new ASCIIFileImpl(pStream, axForReading, axTabMode));
}

// ---- ASCIIFileImpl: construction ----

ASCIIFileImpl::ASCIIFileImpl(const String& asFileName, bool axForReading, bool axTabMode)
    : amFileName(asFileName), amTabMode(axTabMode), amOwnsStream(true) {
    std::string path = toolkit::NormalizePath(asFileName.str());
    if (axForReading) {
        pOwned = nxbase::detail::DataFileStream::OpenForReading(path, kLineFeedProbe);
        std::uint64_t size = pOwned->Size();
        amTotalSize = static_cast<std::uint32_t>(std::min<std::uint64_t>(size, 0xFFFFFFFEu));
        amLineFeed = pOwned->HasLineFeed();
        pInput = pOwned->Stream();
        // Reading the first line counts one byte, as every scanned line does.
        amConsumed = 0;
        ScanLine();
    } else {
        pOwned = nxbase::detail::DataFileStream::OpenForWriting(path);
        pOutput = pOwned->Stream();
        amAtEnd = true;
        CheckOutError();
    }
}

ASCIIFileImpl::ASCIIFileImpl(std::iostream* pStream, bool axForReading, bool axTabMode)
    : amTabMode(axTabMode) {
    if (axForReading) {
        pInput = pStream;
        ScanLine();
    } else {
        pOutput = pStream;
        amAtEnd = true;
        CheckOutError();
    }
}

ASCIIFileImpl::~ASCIIFileImpl() {
    if (!amOwnsStream || !pOwned) return;
    if (pOutput != nullptr) CheckOutError();
    if (!pOwned->Close(!amError) || amError) {
        LogFile::WriteToLog("ASCIIFile: writing \"" + amFileName +
                                "\" failed; the file keeps the lines written before the failure",
                            "");
    }
}

// ---- line input ----

void ASCIIFileImpl::ScanLine() {
    // Only the scanned part of a line counts, so that progress grows with
    // scanning; saturates instead of wrapping.
    std::uint64_t consumed = std::uint64_t{amConsumed} + amPos + 1;
    amConsumed = static_cast<std::uint32_t>(std::min<std::uint64_t>(consumed, 0xFFFFFFFFu));
    amLine.clear();
    amPos = 0;
    if (pInput == nullptr || amAtEnd) {
        amAtEnd = true;
        return;
    }

    char chunk[kLineChunk];
    bool readAny = false;
    for (;;) {
        pInput->getline(chunk, kLineChunk, kLineFeed);
        std::streamsize extracted = pInput->gcount();
        std::ios::iostate state = pInput->rdstate();
        bool lineEnded = (state & (std::ios::failbit | std::ios::eofbit)) == 0;
        std::size_t stored = static_cast<std::size_t>(extracted) - (lineEnded ? 1 : 0);
        if (extracted > 0) readAny = true;
        if (amLine.size() < kMaxLineLength) {
            amLine.append(chunk, std::min(stored, kMaxLineLength - amLine.size()));
        }
        if (lineEnded || (state & (std::ios::eofbit | std::ios::badbit)) != 0 || extracted == 0) {
            break;
        }
        // The chunk filled up before the line feed: clear the fail bit and go on.
        pInput->clear(state & ~std::ios::failbit);
    }
    if (!readAny) {
        amAtEnd = true;
        return;
    }
    if (std::memchr(amLine.data(), kReturn, amLine.size()) != nullptr) {
        amLine.erase(std::remove(amLine.begin(), amLine.end(), kReturn), amLine.end());
    }
}

bool ASCIIFileImpl::Fail() {
    amPos = 0;
    return false;
}

bool ASCIIFileImpl::Succeed() {
    ScanLine();
    return true;
}

// ---- scanning primitives ----

bool ASCIIFileImpl::SkipBlanks() {
    while (amPos < amLine.size() && IsBlank(amLine[amPos])) ++amPos;
    return amPos < amLine.size() && amLine[amPos] != '\0';
}

bool ASCIIFileImpl::SkipChar(char axChar) {
    std::uint32_t start = amPos;
    while (amPos < amLine.size() && amLine[amPos] == axChar) ++amPos;
    return amPos > start;
}

// Decodes from the scan position up to `axStop` (the end of the line when
// NUL) into `out` and steps past the stop; false when a stop other than NUL
// is missing. Caret escapes are pairs, so "^=" never stops a key.
bool ASCIIFileImpl::ScanString(char axStop, bool axRemoveTabs, std::string& out) {
    out.clear();
    const char* line = amLine.data();
    const std::size_t size = amLine.size();
    std::size_t pos = amPos;
    bool found = axStop == '\0';
    while (pos < size) {
        // Copy the run of plain bytes in one go.
        std::size_t run = pos;
        while (run < size) {
            char c = line[run];
            if (c == kCaret || c == axStop || (axRemoveTabs && c == kTab)) break;
            ++run;
        }
        out.append(line + pos, run - pos);
        pos = run;
        if (pos >= size) break;

        char c = line[pos];
        if (c == axStop) {
            ++pos;
            found = true;
            break;
        }
        if (c == kTab) {  // axRemoveTabs
            ++pos;
            continue;
        }
        // A caret escape.
        if (pos + 1 >= size) {  // the line ends inside the escape
            ++pos;
            if (amLineFeed) out.push_back(kCaret);
            continue;
        }
        auto next = static_cast<unsigned char>(line[pos + 1]);
        pos += 2;
        if (amLineFeed) {
            if (next >= 0x40 && next <= 0x5F) {
                char decoded = static_cast<char>(next - 0x40);
                if (!(axRemoveTabs && decoded == kTab)) out.push_back(decoded);
            } else {
                out.push_back(kCaret);
                if (!(axRemoveTabs && next == kTab)) out.push_back(static_cast<char>(next));
            }
        } else if (next == 'M') {
            out.push_back(kReturn);
        } else if (next == 'J') {
            out.push_back(kLineFeed);
        }
    }
    amPos = static_cast<std::uint32_t>(pos);
    if (!amLineFeed) DosToWindows(out);
    return found;
}

bool ASCIIFileImpl::ScanKey(const String& asKey) {
    if (!ScanString('=', true, amKeyScratch) || amKeyScratch != asKey.str()) return false;
    // The TAB a tab-mode writer puts after "=".
    if (amTabMode && amPos < amLine.size() && amLine[amPos] == kTab) ++amPos;
    return true;
}

// Optional "-" and decimal digits, after blanks; true when at least one
// character was collected (a lone "-" reads as 0). Saturates like strtoll.
bool ASCIIFileImpl::ScanLong(long long& axValue) {
    SkipBlanks();
    const char* line = amLine.data();
    std::size_t start = amPos;
    std::size_t pos = amPos;
    bool negative = pos < amLine.size() && line[pos] == '-';
    if (negative) ++pos;
    std::size_t digits = pos;
    while (pos < amLine.size() && IsDigit(line[pos])) ++pos;
    if (pos == start) return false;
    amPos = static_cast<std::uint32_t>(pos);

    unsigned long long magnitude = 0;
    if (pos > digits) {
        auto result = std::from_chars(line + digits, line + pos, magnitude);
        if (result.ec == std::errc::result_out_of_range) {
            magnitude = std::numeric_limits<unsigned long long>::max();
        }
    }
    constexpr unsigned long long kMax = std::numeric_limits<long long>::max();
    if (negative) {
        axValue = magnitude > kMax ? std::numeric_limits<long long>::min()
                                   : -static_cast<long long>(magnitude);
    } else {
        axValue = magnitude > kMax ? std::numeric_limits<long long>::max()
                                   : static_cast<long long>(magnitude);
    }
    return true;
}

bool ASCIIFileImpl::ScanInt(int& axValue) {
    long long value = 0;
    if (!ScanLong(value)) return false;
    axValue = Clamp<int>(value);
    return true;
}

// Optional "-", blanks, digits, optional "." or "," and digits, after
// blanks; no exponent. Read without the user's locale.
bool ASCIIFileImpl::ScanReal(double& axValue) {
    SkipBlanks();
    const char* line = amLine.data();
    const std::size_t size = amLine.size();
    std::size_t pos = amPos;
    std::size_t collected = 0;
    bool negative = pos < size && line[pos] == '-';
    if (negative) {
        ++pos;
        ++collected;
        while (pos < size && IsBlank(line[pos])) ++pos;
    }
    // The digits are gathered into an integer mantissa as they are scanned.
    std::uint64_t mantissa = 0;
    std::size_t start = pos;
    while (pos < size && IsDigit(line[pos])) {
        mantissa = mantissa * 10 + static_cast<unsigned>(line[pos] - '0');
        ++pos;
    }
    std::size_t integerDigits = pos - start;
    std::size_t separator = size;
    std::size_t decimals = 0;
    if (pos < size && (line[pos] == '.' || line[pos] == ',')) {
        separator = pos++;
        std::size_t first = pos;
        while (pos < size && IsDigit(line[pos])) {
            mantissa = mantissa * 10 + static_cast<unsigned>(line[pos] - '0');
            ++pos;
        }
        decimals = pos - first;
    }
    collected += pos - start;
    if (collected == 0) return false;
    amPos = static_cast<std::uint32_t>(pos);

    double value = 0.0;
    if (integerDigits + decimals <= kExactDigits && mantissa <= kExactMantissa &&
        decimals < std::size(kPowersOfTen)) {
        // Both operands are exact doubles and IEEE division rounds correctly
        // (Clinger's fast path), so this equals the full conversion.
        value = static_cast<double>(mantissa) / kPowersOfTen[decimals];
    } else {
        std::from_chars_result result{};
        if (separator < size && line[separator] == ',') {
            amNumberScratch.assign(line + start, pos - start);
            amNumberScratch[separator - start] = '.';
            const char* text = amNumberScratch.data();
            result = std::from_chars(text, text + amNumberScratch.size(), value,
                                     std::chars_format::fixed);
        } else {
            result = std::from_chars(line + start, line + pos, value, std::chars_format::fixed);
        }
        if (result.ec == std::errc::result_out_of_range) {
            // Too large when a non-zero digit precedes the separator, else too small.
            bool large = std::find_if(line + start, line + start + integerDigits, [](char c) {
                             return c != '0';
                         }) != line + start + integerDigits;
            value = large ? std::numeric_limits<double>::infinity() : 0.0;
        } else if (result.ec != std::errc()) {
            value = 0.0;  // a lone "-" or separator
        }
    }
    axValue = negative ? -value : value;
    return true;
}

template <class T>
bool ASCIIFileImpl::GetIntegers(const String& asKey, T* pValues, int alCount) {
    if (alCount < 0 || (alCount > 0 && pValues == nullptr) || !ScanKey(asKey)) return Fail();
    amIntScratch.resize(static_cast<std::size_t>(alCount));
    for (long long& value : amIntScratch) {
        if (!ScanLong(value)) return Fail();
    }
    for (int i = 0; i < alCount; ++i) pValues[i] = Clamp<T>(amIntScratch[i]);
    return Succeed();
}

// ---- readers ----

bool ASCIIFileImpl::SkipToTitel(const String& asTitel) {
    while (!amAtEnd) {
        if (GetTitel(asTitel)) return true;
        ScanLine();
    }
    return false;
}

bool ASCIIFileImpl::SkipLines(int alCount) {
    for (int i = 0; i < alCount && !amAtEnd; ++i) ScanLine();
    return true;
}

bool ASCIIFileImpl::GetTitel(const String& asTitel) {
    if (amPos >= amLine.size() || amLine[amPos] != '[') return Fail();
    ++amPos;
    if (!ScanString(']', false, amKeyScratch) || amKeyScratch != asTitel.str()) return Fail();
    return Succeed();
}

bool ASCIIFileImpl::GetBOOL(const String& asKey, bool& axValue) {
    long long value = 0;
    if (!ScanKey(asKey) || !ScanLong(value)) return Fail();
    axValue = value != 0;
    return Succeed();
}

bool ASCIIFileImpl::GetShort(const String& asKey, short& axValue) {
    long long value = 0;
    if (!ScanKey(asKey) || !ScanLong(value)) return Fail();
    axValue = Clamp<short>(value);
    return Succeed();
}

bool ASCIIFileImpl::GetShortArray(const String& asKey, short* pValues, int alCount) {
    return GetIntegers(asKey, pValues, alCount);
}

bool ASCIIFileImpl::GetInt(const String& asKey, int& axValue) {
    int value = 0;
    if (!ScanKey(asKey) || !ScanInt(value)) return Fail();
    axValue = value;
    return Succeed();
}

bool ASCIIFileImpl::GetIntArray(const String& asKey, int* pValues, int alCount) {
    return GetIntegers(asKey, pValues, alCount);
}

bool ASCIIFileImpl::GetReal(const String& asKey, double& axValue) {
    double value = 0.0;
    if (!ScanKey(asKey) || !ScanReal(value)) return Fail();
    axValue = value;
    return Succeed();
}

bool ASCIIFileImpl::GetRealArray(const String& asKey, double* pValues, int alCount) {
    if (alCount < 0 || (alCount > 0 && pValues == nullptr) || !ScanKey(asKey)) return Fail();
    amRealScratch.resize(static_cast<std::size_t>(alCount));
    for (double& value : amRealScratch) {
        if (!ScanReal(value)) return Fail();
    }
    std::copy(amRealScratch.begin(), amRealScratch.end(), pValues);
    return Succeed();
}

bool ASCIIFileImpl::GetDate(const String& asKey, int& axValue1, int& axValue2, int& axValue3,
                            int& axValue4, int& axValue5, int& axValue6) {
    // "a3-a2-a1 a4:a5:a6"; blanks around the separators.
    int field[6] = {};
    auto separator = [this](char c) {
        SkipBlanks();
        return SkipChar(c);
    };
    if (!ScanKey(asKey) || !ScanInt(field[2]) || !separator('-') || !ScanInt(field[1]) ||
        !separator('-') || !ScanInt(field[0]) || !ScanInt(field[3]) || !separator(':') ||
        !ScanInt(field[4]) || !separator(':') || !ScanInt(field[5])) {
        return Fail();
    }
    axValue1 = field[0];
    axValue2 = field[1];
    axValue3 = field[2];
    axValue4 = field[3];
    axValue5 = field[4];
    axValue6 = field[5];
    return Succeed();
}

bool ASCIIFileImpl::GetString(const String& asKey, std::vector<String>& axValues,
                              bool axRemoveTabs) {
    axValues.clear();
    std::string value;
    while (!amAtEnd && ScanKey(asKey)) {
        ScanString('\0', axRemoveTabs, value);
        axValues.emplace_back(value);
        ScanLine();
    }
    amPos = 0;
    return !axValues.empty();
}

bool ASCIIFileImpl::GetString(const String& asKey, String& asValue, bool axRemoveTabs) {
    if (!ScanKey(asKey)) return Fail();
    std::string value;
    ScanString('\0', axRemoveTabs, value);
    asValue = String(value);
    return Succeed();
}

bool ASCIIFileImpl::GetMultilineString(const String& asKey, String& asValue, bool axRemoveTabs) {
    std::vector<String> lines;
    if (!GetString(asKey, lines, axRemoveTabs)) return false;
    std::string joined;
    for (std::size_t i = 0; i < lines.size(); ++i) {
        if (i > 0) joined.push_back(kLineFeed);
        joined += lines[i].str();
    }
    asValue = String(joined);
    return true;
}

bool ASCIIFileImpl::GetKeyString(String& asText, bool axRemoveTabs) {
    if (amAtEnd) return Fail();
    std::string text;
    ScanString('\0', axRemoveTabs, text);
    asText = String(text);
    return Succeed();
}

// ---- line output ----

void ASCIIFileImpl::StartKeyLine(const String& asKey) {
    amScratch.assign(asKey.str());
    amScratch.push_back('=');
    if (amTabMode) amScratch.push_back(kTab);
}

void ASCIIFileImpl::EndLine() {
    if (pOutput == nullptr) return;
    amScratch.push_back(kLineFeed);
    pOutput->write(amScratch.data(), static_cast<std::streamsize>(amScratch.size()));
    LatchStreamState();
}

void ASCIIFileImpl::LatchStreamState() {
    if (!amError && pOutput != nullptr && pOutput->fail()) amError = true;
}

void ASCIIFileImpl::CheckOutError() {
    if (pOutput == nullptr) return;
    if (amOwnsStream && pOwned) {
        if (!pOwned->Flush()) amError = true;
    } else {
        pOutput->flush();
    }
    LatchStreamState();
}

String ASCIIFileImpl::Trennzeichen() const {
    return String(amTabMode ? "\t" : " ");
}

// ---- writers ----

void ASCIIFileImpl::PutTitel(const String& asTitel) {
    amScratch.assign("[");
    amScratch += asTitel.str();
    amScratch.push_back(']');
    EndLine();
}

void ASCIIFileImpl::PutBOOL(const String& asKey, bool axValue) {
    StartKeyLine(asKey);
    amScratch.push_back(axValue ? '1' : '0');
    EndLine();
}

void ASCIIFileImpl::PutShort(const String& asKey, short axValue) {
    StartKeyLine(asKey);
    AppendInteger(amScratch, axValue);
    EndLine();
}

void ASCIIFileImpl::PutShortArray(const String& asKey, const short* pValues, int alCount) {
    StartKeyLine(asKey);
    const char separator = amTabMode ? kTab : ' ';
    for (int i = 0; i < alCount && pValues != nullptr; ++i) {
        if (i > 0) amScratch.push_back(separator);
        AppendInteger(amScratch, pValues[i], kShortField);
    }
    EndLine();
}

void ASCIIFileImpl::PutInt(const String& asKey, int axValue) {
    StartKeyLine(asKey);
    AppendInteger(amScratch, axValue);
    EndLine();
}

void ASCIIFileImpl::PutIntArray(const String& asKey, const int* pValues, int alCount) {
    StartKeyLine(asKey);
    const char separator = amTabMode ? kTab : ' ';
    for (int i = 0; i < alCount && pValues != nullptr; ++i) {
        if (i > 0) amScratch.push_back(separator);
        AppendInteger(amScratch, pValues[i], kIntField);
    }
    EndLine();
}

void ASCIIFileImpl::PutReal(const String& asKey, double axValue, int alPrecision) {
    StartKeyLine(asKey);
    AppendReal(amScratch, axValue, alPrecision);
    EndLine();
}

void ASCIIFileImpl::PutRealArray(const String& asKey, const double* pValues, int alCount,
                                 int alPrecision) {
    StartKeyLine(asKey);
    const char separator = amTabMode ? kTab : ' ';
    for (int i = 0; i < alCount && pValues != nullptr; ++i) {
        if (i > 0) amScratch.push_back(separator);
        AppendReal(amScratch, pValues[i], alPrecision);
    }
    EndLine();
}

void ASCIIFileImpl::PutDate(const String& asKey, int axValue1, int axValue2, int axValue3,
                            int axValue4, int axValue5, int axValue6) {
    StartKeyLine(asKey);
    AppendInteger(amScratch, axValue3);
    amScratch.push_back('-');
    AppendTwoDigits(amScratch, axValue2);
    amScratch.push_back('-');
    AppendTwoDigits(amScratch, axValue1);
    amScratch.push_back(' ');
    AppendTwoDigits(amScratch, axValue4);
    amScratch.push_back(':');
    AppendTwoDigits(amScratch, axValue5);
    amScratch.push_back(':');
    AppendTwoDigits(amScratch, axValue6);
    EndLine();
}

void ASCIIFileImpl::PutString(const String& asKey, const std::vector<String>& axValues) {
    for (const String& value : axValues) PutString(asKey, value);
}

void ASCIIFileImpl::PutString(const String& asKey, const String& asValue) {
    StartKeyLine(asKey);
    AppendEscaped(amScratch, asValue.str());
    EndLine();
}

// ---- version section and progress ----

bool ASCIIFileImpl::CheckVersion(int alHighestKnown) {
    String application;
    int version = 0;
    if (!GetTitel(kVersionTitle) || !GetString(kApplicationKey, application) ||
        !GetInt(kVersionKey, version)) {
        return false;
    }
    amVersion = version;
    return version >= kOldestVersion && version <= alHighestKnown;
}

void ASCIIFileImpl::SetVersion(int alVersion) {
    // Asked first, so that a missing AppName leaves nothing half-written.
    nxbase::detail::WriteVersionSection(*this, alVersion, ApplicationVersionText());
}

void nxbase::detail::WriteVersionSection(ASCIIFile& axFile, int alVersion,
                                         const String& asApplication) {
    axFile.PutTitel(kVersionTitle);
    axFile.Version() = alVersion;
    axFile.PutString(kApplicationKey, asApplication);
    axFile.PutInt(kVersionKey, alVersion);
}

float ASCIIFileImpl::GetPercentDone() const {
    if (amTotalSize == 0) return -1.0f;
    float done = static_cast<float>(amConsumed) / static_cast<float>(amTotalSize);
    return std::min(done, 1.0f);
}

// ---- ASCIIFile2 ----

ASCIIFile2::ASCIIFile2(const String& asFileName, bool axForReading, bool axTabMode)
    : ASCIIFileImpl(asFileName, RejectWriting(axForReading), axTabMode) {}

ASCIIFile2::ASCIIFile2(std::iostream* pStream, bool axForReading, bool axTabMode)
    : ASCIIFileImpl(pStream, RejectWriting(axForReading), axTabMode) {}

ASCIIFile2::~ASCIIFile2() = default;

void ASCIIFile2::PutTitel(const String&) {
    Unsupported();
}
void ASCIIFile2::PutBOOL(const String&, bool) {
    Unsupported();
}
void ASCIIFile2::PutShort(const String&, short) {
    Unsupported();
}
void ASCIIFile2::PutShortArray(const String&, const short*, int) {
    Unsupported();
}
void ASCIIFile2::PutInt(const String&, int) {
    Unsupported();
}
void ASCIIFile2::PutIntArray(const String&, const int*, int) {
    Unsupported();
}
void ASCIIFile2::PutReal(const String&, double, int) {
    Unsupported();
}
void ASCIIFile2::PutRealArray(const String&, const double*, int, int) {
    Unsupported();
}
void ASCIIFile2::PutDate(const String&, int, int, int, int, int, int) {
    Unsupported();
}
void ASCIIFile2::PutString(const String&, const std::vector<String>&) {
    Unsupported();
}
void ASCIIFile2::PutString(const String&, const String&) {
    Unsupported();
}
