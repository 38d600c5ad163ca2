// String helpers: static functions on byte strings (StringHelpers), a String
// with locale-free number formatting and wildcard matching (GString), and an
// array of String pointers (DynStringArray). All are values or stateless; the
// digit alphabets are made once, thread-safely, so any thread may call them.
#ifndef NXBASE_STRHELP_H_
#define NXBASE_STRHELP_H_

#include <string>
#include <string_view>
#include <vector>

#include "nxbase/export.h"
#include "toolkit/string.h"

class NXBASE_EXPORT StringHelpers {
  public:
    // Replaces every occurrence of `asWhat`, left to right, without
    // rescanning inserted text. An empty `asWhat` leaves the text unchanged.
    static void Replace(std::string& asText, const std::string& asWhat, const std::string& asWith);

    // Cuts the text at every separator after removing leading and trailing
    // blanks (byte 32 only). Empty pieces are kept ("a;;b" gives three, "a;"
    // ends in an empty one); a text of blanks only gives an empty vector.
    static std::vector<std::string> Split(const std::string& asText, char axSeparator);
    // As Split, except that "", "*" and " " give the one element "*".
    static std::vector<std::string> SplitSearchStringToVector(const std::string& asText,
                                                              char axSeparator);
    // The String's tokens at the separator (no trimming); an empty text gives
    // the one element "*".
    static std::vector<String> SplitStringToVector(const String& asText, char axSeparator);
    // The parts with the separator between neighbours.
    static String Concatenate(std::vector<String> axParts, const String& asSeparator);

    // Copies with ASCII letters converted; other bytes are kept.
    static std::string ToLower(const std::string& asText);
    static std::string ToUpper(const std::string& asText);

    // `alNumber` written in the base given by the alphabet's length, most
    // significant digit first; 0 is the alphabet's first digit. An alphabet
    // of fewer than two digits gives an empty string.
    static std::string BaseConverter(unsigned int alNumber, const std::string& asDigits);

    // Numbers as files and messages show them, with a decimal point whatever
    // the locale: `axValue` with `alDecimals` decimals (0..40), and the
    // shortest text that reads back as the same double ("390", "382.5").
    // NaN and infinities are written "nan", "inf", "-inf".
    static std::string Fixed(double axValue, int alDecimals);
    static std::string Shortest(double axValue);
    // A whole field as a number, whatever the locale: an optional "-",
    // digits of `alBase` (2 to 36; letters in either case, no "0x") and, for
    // ParseDecimal, decimal digits, a "." and an exponent. False, with the
    // value untouched, for anything else: blanks, "+", an empty field, a
    // value out of range (beyond the largest double, or so small it would
    // read as 0; a subnormal is taken), NaN or infinity. These are
    // toolkit::ParseWholeInteger and ParseWholeDecimal (toolkit/string.h).
    static bool ParseInteger(std::string_view asText, long long& axValue, int alBase = 10);
    static bool ParseDecimal(std::string_view asText, double& axValue);

    // Digit alphabets: "01", "01234567", "0123456789", "0123456789ABCDEF".
    static const std::string& CharactersBase2();
    static const std::string& CharactersBase8();
    static const std::string& CharactersBase10();
    static const std::string& CharactersBase16();
};

// A String with number constructors and wildcard matching. Numbers are written
// and read without the user's locale.
class NXBASE_EXPORT GString : public String {
  public:
    GString() = default;
    GString(const String& asText) : String(asText) {}  // NOLINT: implicit, as String
    GString(const char* asText) : String(asText) {}    // NOLINT

    // `axValue` with `alDecimals` digits after the separator (negative counts
    // as 0, more than kMaxDecimals as kMaxDecimals), correctly rounded from
    // the binary value as printf does (ties to even). Right-aligned in at
    // least `alWidth` characters, padded with blanks, or with zeros after the
    // sign when `axZeroPad`; a '+' before positive values when `axPlusSign`.
    // A value that rounds to zero is written without a minus sign. NaN and
    // infinities are written "nan", "inf", "-inf".
    GString(double axValue, int alDecimals, int alWidth = 0, char axDecimalSeparator = '.',
            bool axZeroPad = false, bool axPlusSign = false);
    // Decimal `axValue`, right-aligned in at least `alWidth` characters with blanks.
    GString(int axValue, int alWidth);

    static constexpr int kMaxDecimals = 40;

    // The leading decimal number (blanks skipped, optional sign, '.' or ','
    // as decimal separator, optional exponent); 0 when the text holds none.
    operator double() const;  // NOLINT: implicit, as the applications use it

    // Wildcard search with "*" as the only wildcard, unanchored: the pieces
    // between stars must occur in order, anywhere (case-sensitive). An empty
    // pattern or "*" matches everything.
    bool MatchPattern(const String& asPattern) const;
    // True when the vector is not empty and every pattern matches.
    bool MatchVectorPattern(const std::vector<String>& axPatterns) const;
};

// A resizable array of String pointers. It owns nothing: Put stores a
// pointer, Get returns it, and the caller keeps the Strings alive.
class NXBASE_EXPORT DynStringArray {
  public:
    // `alSize` empty (null) slots.
    explicit DynStringArray(unsigned long alSize = 0);

    // Stores `p` at `alIndex` and returns it; an index outside the array
    // stores nothing and returns nullptr.
    String* Put(unsigned long alIndex, String* p);
    // The stored pointer, or nullptr when the slot is empty or outside.
    String* Get(unsigned long alIndex) const;
    // Keeps the first slots that still fit; new slots are empty.
    void ChangeSize(unsigned long alNewSize);
    unsigned long GetSize() const { return static_cast<unsigned long>(amSlots.size()); }
    // Empties every slot; the size stays.
    void Clear();

    // Equal when the sizes agree and each pair of slots is either empty in
    // both or points to equal texts.
    friend NXBASE_EXPORT bool operator==(const DynStringArray& a, const DynStringArray& b);
    friend bool operator!=(const DynStringArray& a, const DynStringArray& b) { return !(a == b); }

  private:
    std::vector<String*> amSlots;
};

#endif  // NXBASE_STRHELP_H_
