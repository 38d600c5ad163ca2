// String is the toolkit's 8-bit string in the ANSI code page (Windows-1252)
// with a 16-bit unsigned length: texts longer than String::kMaxLen are cut.
// Positions are unsigned 16-bit; searches that fail answer STRING_NOTFOUND.
// A String is a value; distinct objects may be used on distinct threads.
#ifndef TOOLKIT_STRING_H_
#define TOOLKIT_STRING_H_

#include <cstdint>
#include <iosfwd>
#include <string>
#include <string_view>

#include "nxbase/export.h"

using xub_StrLen = std::uint16_t;

constexpr xub_StrLen STRING_NOTFOUND = 0xFFFF;
// "To the end" for counts, as in Copy(5, STRING_LEN).
constexpr xub_StrLen STRING_LEN = 0xFFFF;

class NXBASE_EXPORT String {
  public:
    // The longest text a String holds; one less than STRING_NOTFOUND so that
    // no valid position equals it.
    static constexpr std::size_t kMaxLen = 0xFFFE;

    String() = default;
    String(const char* text);  // NOLINT: implicit, as the toolkit's
    String(const char* text, xub_StrLen length);
    String(const std::string& text);  // NOLINT
    String(std::string_view text);    // NOLINT
    explicit String(char c);

    // Decimal text of a number, without locale.
    static String CreateFromInt(long value);

    xub_StrLen Len() const { return static_cast<xub_StrLen>(text_.size()); }
    bool IsEmpty() const { return text_.empty(); }
    const char* GetBuffer() const { return text_.c_str(); }
    const char* GetStr() const { return text_.c_str(); }
    const std::string& str() const { return text_; }
    operator std::string() const { return text_; }  // NOLINT

    char GetChar(xub_StrLen index) const { return index < text_.size() ? text_[index] : '\0'; }
    char operator[](xub_StrLen index) const { return GetChar(index); }
    void SetChar(xub_StrLen index, char c);

    // First position of `what` at or after `from`, or STRING_NOTFOUND. An
    // empty `what` is never found.
    xub_StrLen Search(const String& what, xub_StrLen from = 0) const;
    xub_StrLen Search(char c, xub_StrLen from = 0) const;
    xub_StrLen SearchBackward(char c) const;
    // Replaces every occurrence, left to right; returns the count.
    xub_StrLen SearchAndReplaceAll(const String& what, const String& with);

    // Substring of at most `count` characters from `from` (empty past the end).
    String Copy(xub_StrLen from, xub_StrLen count = STRING_LEN) const;
    String& Erase(xub_StrLen from = 0, xub_StrLen count = STRING_LEN);
    String& Insert(const String& text, xub_StrLen at = STRING_LEN);
    String& Append(const String& text);
    String& Append(char c);
    String& EraseLeadingChars(char c = ' ');
    String& EraseTrailingChars(char c = ' ');
    String& EraseAllChars(char c = ' ');
    String& ToUpper();  // ASCII letters only
    String& ToLower();

    // Token functions: the text cut at every separator. An empty text has no
    // token; otherwise the count is the number of separators plus one.
    xub_StrLen GetTokenCount(char separator = ';') const;
    String GetToken(xub_StrLen index, char separator = ';') const;

    // True for a non-empty text of ASCII digits only.
    bool IsNumeric() const;
    // The decimal integer that leads the text after blanks, with one optional
    // sign ("+-5" has none); 0 when none.
    long ToLong() const;
    // The same for a decimal number, read with "." whatever the locale; also 0
    // beyond a double's range ("1e999"), which the caller cannot tell from "0".
    double ToDouble() const;

    bool EqualsIgnoreCaseAscii(const String& other) const;

    String& operator+=(const String& text) { return Append(text); }
    String& operator+=(const char* text) { return Append(String(text)); }
    String& operator+=(char c) { return Append(c); }

    friend bool operator==(const String& a, const String& b) { return a.text_ == b.text_; }
    friend bool operator!=(const String& a, const String& b) { return a.text_ != b.text_; }
    friend bool operator<(const String& a, const String& b) { return a.text_ < b.text_; }
    friend bool operator==(const String& a, const char* b) { return a.text_ == b; }
    friend bool operator!=(const String& a, const char* b) { return a.text_ != b; }

  private:
    void Clip();

    std::string text_;
};

NXBASE_EXPORT String operator+(const String& a, const String& b);
NXBASE_EXPORT String operator+(const String& a, const char* b);
NXBASE_EXPORT String operator+(const char* a, const String& b);
NXBASE_EXPORT std::ostream& operator<<(std::ostream& out, const String& text);

namespace toolkit {

// Appends the UTF-8 bytes of the code point `code` (up to U+10FFFF).
NXBASE_EXPORT void AppendUtf8(std::string& out, char32_t code);

// Windows-1252 (the ANSI code page of String) to UTF-8. Every byte has a
// character: the five bytes the code page leaves undefined become U+0081,
// U+008D, U+008F, U+0090 and U+009D, so that Utf8ToWindows1252 gives back
// every byte string unchanged.
NXBASE_EXPORT std::string Windows1252ToUtf8(std::string_view ansi);
// UTF-8 to Windows-1252: a character the code page lacks becomes "?", and so
// does each byte of an invalid UTF-8 sequence.
NXBASE_EXPORT std::string Utf8ToWindows1252(std::string_view utf8);
// True when `text` is well-formed UTF-8 (no overlong forms, no surrogates,
// nothing above U+10FFFF).
NXBASE_EXPORT bool IsValidUtf8(std::string_view text);
// Eight-bit text of unknown origin as UTF-8: kept when it is UTF-8 already,
// else read as Windows-1252 (what Windows programs export).
NXBASE_EXPORT std::string EightBitToUtf8(std::string_view text);

// A whole field as a number, whatever the locale: an optional "-" (for a
// decimal with `plus`, a "+" instead), digits of `base` (2 to 36; letters in
// either case, no "0x") and, for a decimal, decimal digits, a "." and an
// exponent. False, with `value` untouched, for anything else: blanks, an
// empty field, a sign after a sign, a value out of range (beyond the largest
// double, or so small it would read as 0; a subnormal is taken), NaN or
// infinity. Every layer reads its whole-field numbers with these.
NXBASE_EXPORT bool ParseWholeInteger(std::string_view text, long long& value, int base = 10);
NXBASE_EXPORT bool ParseWholeDecimal(std::string_view text, double& value, bool plus = false);

}  // namespace toolkit

#endif  // TOOLKIT_STRING_H_
