#include "toolkit/string.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <clocale>
#include <cmath>
#include <cstdlib>
#include <random>
#include <string>

namespace {

TEST(String, SearchAnswersNotFoundAndRespectsStart) {
    String text("xxabcyyabc");
    EXPECT_EQ(text.Search("abc"), 2);
    EXPECT_EQ(text.Search("abc", 3), 7);
    EXPECT_EQ(text.Search("abc", 8), STRING_NOTFOUND);
    EXPECT_EQ(text.Search(""), STRING_NOTFOUND);
    EXPECT_EQ(text.Search('y', 200), STRING_NOTFOUND);
    EXPECT_EQ(String().Search('a'), STRING_NOTFOUND);
}

TEST(String, LengthIsCutAtSixteenBits) {
    String longText(std::string(70000, 'a'));
    EXPECT_EQ(longText.Len(), String::kMaxLen);
    longText += "more";
    EXPECT_EQ(longText.Len(), String::kMaxLen);
    EXPECT_EQ(longText.Search('b'), STRING_NOTFOUND);
}

TEST(String, TokensCountSeparatorsPlusOneAndEmptyTextHasNone) {
    EXPECT_EQ(String().GetTokenCount(';'), 0);
    String text("a;;b;");
    EXPECT_EQ(text.GetTokenCount(';'), 4);
    const char* tokens[] = {"a", "", "b", "", ""};  // the last stands for any index beyond
    for (int k : {0, 1, 2, 3, 9}) EXPECT_EQ(text.GetToken(k, ';'), tokens[std::min(k, 4)]) << k;
    EXPECT_EQ(String("ANSWER!SPECTRUM").GetToken(1, '!'), "SPECTRUM");
}

TEST(String, NumbersAreReadWithoutLocale) {
    EXPECT_TRUE(String("0123").IsNumeric());
    for (const char* text : {"", "-1", "1.5"}) EXPECT_FALSE(String(text).IsNumeric()) << text;
    const char* previous = std::setlocale(LC_NUMERIC, "de_DE.UTF-8");
    EXPECT_DOUBLE_EQ(String("2.5").ToDouble(), 2.5);
    EXPECT_EQ(String::CreateFromInt(-1234567), "-1234567");
    if (previous) std::setlocale(LC_NUMERIC, "C");
}

// The leading number against the C library under the "C" locale, which
// reads the same grammar: blanks, one sign, digits, for decimals a "." and
// an exponent; the rest of the text ignored. Beyond a double's range
// ToDouble answers 0.
TEST(String, LeadingNumbersReadAsTheCLibraryReadsThemOverRandomText) {
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 random(seed);
    const std::string alphabet = "0123456789+- .eEz";
    for (int round = 0; round < 20000; ++round) {
        std::string text;
        for (int i = static_cast<int>(random() % 10); i > 0; --i)
            text += alphabet[random() % (random() % 2 ? 10 : alphabet.size())];
        EXPECT_EQ(String(text).ToLong(), std::strtol(text.c_str(), nullptr, 10)) << text;
        errno = 0;
        const double model = std::strtod(text.c_str(), nullptr);
        EXPECT_EQ(String(text).ToDouble(), errno == ERANGE && std::isinf(model) ? 0.0 : model)
            << text;
    }
}

TEST(String, EditingKeepsBoundsSafe) {
    String text("  abc  ");
    text.EraseLeadingChars().EraseTrailingChars();
    EXPECT_EQ(text, "abc");
    EXPECT_EQ(text.Copy(1), "bc");
    EXPECT_EQ(text.Copy(5, 2), "");
    text.Insert("X", 1).Insert("Y");
    EXPECT_EQ(text, "aXbcY");
    text.Erase(10);
    text.Erase(1, 1);
    EXPECT_EQ(text, "abcY");
    EXPECT_EQ(String("a.b.c").SearchAndReplaceAll(".", ""), 2);
    String upper("mIxEd");
    EXPECT_TRUE(upper.EqualsIgnoreCaseAscii("MIXED"));
    EXPECT_EQ(upper.ToUpper(), "MIXED");
    EXPECT_EQ(text.GetChar(100), '\0');
}

}  // namespace

namespace {

// Well-formedness by decoding first, then checking the code point's range for
// its length: another route than the lead and second byte tables.
bool DecodesAsUtf8(const std::string& text) {
    for (std::size_t at = 0; at < text.size();) {
        const auto byte = [&](std::size_t i) { return static_cast<unsigned char>(text[at + i]); };
        int length = 0;
        for (unsigned char lead = byte(0); lead & 0x80;
             lead = static_cast<unsigned char>(lead << 1))
            ++length;
        if (length == 0) length = 1;
        if (length == 1 ? byte(0) >= 0x80 : length > 4 || at + length > text.size()) return false;
        unsigned long code = byte(0) & (0x7F >> length);
        for (int i = 1; i < length; ++i) {
            if ((byte(i) & 0xC0) != 0x80) return false;
            code = code << 6 | (byte(i) & 0x3F);
        }
        const unsigned long least[] = {0, 0, 0x80, 0x800, 0x10000};
        if ((length > 1 && code < least[length]) || code > 0x10FFFF ||
            (code >= 0xD800 && code <= 0xDFFF))
            return false;
        at += static_cast<std::size_t>(length);
    }
    return true;
}

TEST(String, Utf8ValidityAgreesWithDecodingOverRandomBytes) {
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 random(seed);
    const unsigned char edges[] = {0x00, 0x7F, 0x80, 0x8F, 0x90, 0x9F, 0xA0, 0xBF, 0xC0, 0xC1,
                                   0xC2, 0xDF, 0xE0, 0xED, 0xEF, 0xF0, 0xF4, 0xF5, 0xF8, 0xFF};
    for (int i = 0; i < 200000; ++i) {
        std::string text(random() % 7, ' ');
        for (char& c : text)
            c = static_cast<char>(random() % 2 ? edges[random() % sizeof edges] : random() % 256);
        ASSERT_EQ(toolkit::IsValidUtf8(text), DecodesAsUtf8(text))
            << ::testing::PrintToString(text);
    }
}

// One "?" stands for a malformed sequence: its lead byte and the continuation
// bytes its class allows; every boundary of the lead classes.
TEST(String, AMalformedSequenceBecomesOneQuestionMarkUpToItsLeadsLength) {
    const std::pair<const char*, const char*> cases[] = {
        {"\xC1\x80", "??"},        {"\xC2\x41", "?A"},     {"\xDF\x80\x80", "??"},
        {"\xE0\x80\x80", "?"},     {"\xEF\x80\x41", "?A"}, {"\xF0\x80\x80\x80", "?"},
        {"\xF4\x90\x80\x80", "?"}, {"\xF5\x80", "??"},
    };
    for (const auto& [utf8, ansi] : cases)
        EXPECT_EQ(toolkit::Utf8ToWindows1252(utf8), ansi) << ::testing::PrintToString(utf8);
}

}  // namespace
