#include "nxbase/strhelp.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <cmath>
#include <cstdlib>
#include <random>
#include <regex>
#include <string>
#include <vector>

namespace {

using Strings = std::vector<std::string>;

TEST(StringHelpers, SplitTrimsBlanksOnlyKeepsEmptyPiecesAndJoinSeparatesNeighbours) {
    EXPECT_EQ(StringHelpers::Split("  a;b  ", ';'), (Strings{"a", "b"}));
    EXPECT_EQ(StringHelpers::Split("a;;b", ';'), (Strings{"a", "", "b"}));
    EXPECT_EQ(StringHelpers::Split("a;", ';'), (Strings{"a", ""}));
    EXPECT_EQ(StringHelpers::Split(";", ';'), (Strings{"", ""}));
    EXPECT_EQ(StringHelpers::Split("\ta ; b\t", ';'), (Strings{"\ta ", " b\t"}));
    EXPECT_TRUE(StringHelpers::Split("   ", ';').empty());
    EXPECT_TRUE(StringHelpers::Split("", ';').empty());

    EXPECT_EQ(StringHelpers::SplitSearchStringToVector(" ", ';'), (Strings{"*"}));
    EXPECT_EQ(StringHelpers::SplitSearchStringToVector("", ';'), (Strings{"*"}));
    EXPECT_EQ(StringHelpers::SplitSearchStringToVector("*", ';'), (Strings{"*"}));
    EXPECT_EQ(StringHelpers::SplitSearchStringToVector("a*;b", ';'), (Strings{"a*", "b"}));
    EXPECT_TRUE(StringHelpers::SplitSearchStringToVector("  ", ';').empty());

    EXPECT_EQ(StringHelpers::SplitStringToVector(String(""), ';'), (std::vector<String>{"*"}));
    EXPECT_EQ(StringHelpers::SplitStringToVector(String(" a;;b;"), ';'),
              (std::vector<String>{" a", "", "b", ""}));

    // Joining puts separators between neighbours only.
    EXPECT_EQ(StringHelpers::Concatenate({"one"}, ", "), "one");
    EXPECT_EQ(StringHelpers::Concatenate({"a", "", "c"}, "--"), "a----c");
    EXPECT_EQ(StringHelpers::Concatenate({}, ";"), "");
}

TEST(StringHelpers, ReplaceDoesNotRescanInsertedText) {
    std::string text = "aaa";
    StringHelpers::Replace(text, "a", "aa");
    EXPECT_EQ(text, "aaaaaa");
    text = "a.b.c";
    StringHelpers::Replace(text, ".", "");
    EXPECT_EQ(text, "abc");
    text = "abab";
    StringHelpers::Replace(text, "aba", "X");
    EXPECT_EQ(text, "Xb");
    text = "unchanged";
    StringHelpers::Replace(text, "", "X");
    EXPECT_EQ(text, "unchanged");
}

TEST(StringHelpers, CaseAndBaseConversion) {
    EXPECT_EQ(StringHelpers::ToUpper("Lab ä 1"), "LAB ä 1");
    EXPECT_EQ(StringHelpers::ToLower("XYZ@["), "xyz@[");
    EXPECT_EQ(StringHelpers::BaseConverter(0, StringHelpers::CharactersBase2()), "0");
    EXPECT_EQ(StringHelpers::BaseConverter(5, StringHelpers::CharactersBase2()), "101");
    EXPECT_EQ(StringHelpers::BaseConverter(8, StringHelpers::CharactersBase8()), "10");
    EXPECT_EQ(StringHelpers::BaseConverter(4294967295u, StringHelpers::CharactersBase10()),
              "4294967295");
    EXPECT_EQ(StringHelpers::BaseConverter(0xBEEF, StringHelpers::CharactersBase16()), "BEEF");
    EXPECT_EQ(StringHelpers::BaseConverter(7, "x"), "");
}

TEST(GString, MatchPatternIsUnanchored) {
    GString text("xxabcyy");
    EXPECT_TRUE(text.MatchPattern("abc*"));
    EXPECT_TRUE(text.MatchPattern("*c*y"));
    EXPECT_TRUE(text.MatchPattern("x*y"));
    EXPECT_TRUE(text.MatchPattern("b"));
    EXPECT_TRUE(text.MatchPattern(""));
    EXPECT_TRUE(text.MatchPattern("**a**"));
    EXPECT_FALSE(text.MatchPattern("c*a")) << "tokens must occur in order";
    EXPECT_FALSE(text.MatchPattern("ABC")) << "matching is case-sensitive";
    EXPECT_FALSE(text.MatchPattern("abc*abc")) << "a found token is used up";
    EXPECT_FALSE(text.MatchPattern("yyy"));
    EXPECT_TRUE(GString("").MatchPattern("*"));
    EXPECT_FALSE(GString("").MatchPattern("a"));

    EXPECT_FALSE(text.MatchVectorPattern({}));
    EXPECT_TRUE(text.MatchVectorPattern({"abc", "*y"}));
    EXPECT_FALSE(text.MatchVectorPattern({"abc", "z"}));
}

TEST(GString, FormatsNumbersWithWidthRoundingAndSign) {
    EXPECT_EQ(GString(3.14159, 2), "3.14");
    EXPECT_EQ(GString(2.5, 0), "2") << "ties to even, as printf";
    EXPECT_EQ(GString(0.125, 2), "0.12");
    EXPECT_EQ(GString(0.375, 2), "0.38");
    EXPECT_EQ(GString(-0.001, 2), "0.00") << "no minus sign on a zero";
    EXPECT_EQ(GString(-1.5, 1, 7), "   -1.5");
    EXPECT_EQ(GString(-1.5, 1, 7, '.', true), "-0001.5");
    EXPECT_EQ(GString(1.5, 1, 0, ',', false, true), "+1,5");
    EXPECT_EQ(GString(12.0, -3), "12");
    EXPECT_EQ(GString(1e300, 1).Len(), 303);
    EXPECT_EQ(GString(std::nan(""), 2), "nan");
    EXPECT_EQ(GString(-HUGE_VAL, 2, 5), " -inf");
    EXPECT_EQ(GString(42, 5), "   42");
    EXPECT_EQ(GString(-42, 0), "-42");
    EXPECT_EQ(GString(-2147483647 - 1, 3), "-2147483648");
}

TEST(GString, ReadsNumbersWithPointOrComma) {
    EXPECT_DOUBLE_EQ(static_cast<double>(GString("  12.5 mm")), 12.5);
    EXPECT_DOUBLE_EQ(static_cast<double>(GString("12,5")), 12.5);
    EXPECT_DOUBLE_EQ(static_cast<double>(GString("+3e2")), 300.0);
    EXPECT_DOUBLE_EQ(static_cast<double>(GString("-0.25")), -0.25);
    EXPECT_EQ(static_cast<double>(GString("abc")), 0.0);
    EXPECT_EQ(static_cast<double>(GString("")), 0.0);
    EXPECT_EQ(static_cast<double>(GString("+-1")), 0.0);
    EXPECT_EQ(static_cast<double>(GString("1e999")), HUGE_VAL);
    for (double value : {0.1, 1.0 / 3.0, -123456.789, 5e-7}) {
        EXPECT_DOUBLE_EQ(static_cast<double>(GString(value, 17)), value);
    }
}

TEST(DynStringArray, SlotsOutsideTheArrayAreNeitherReadNorWritten) {
    String a("a"), b("b"), alsoA("a");
    DynStringArray array(2);
    array.Put(0, &a);
    array.Put(1, &b);
    EXPECT_EQ(array.Put(2, &a), nullptr);
    EXPECT_EQ(array.Get(2), nullptr);
    EXPECT_EQ(array.Get(~0ul), nullptr);
    EXPECT_EQ(array.Get(1), &b);

    DynStringArray copy(array);
    EXPECT_EQ(copy, array);
    DynStringArray other(2);
    other.Put(0, &alsoA);
    EXPECT_NE(other, array);
    other.Put(1, &b);
    EXPECT_EQ(other, array) << "equal texts in every slot";

    array.ChangeSize(3);
    EXPECT_EQ(array.Get(1), &b);
    EXPECT_EQ(array.Get(2), nullptr);
    EXPECT_NE(array, copy);
    array.ChangeSize(1);
    EXPECT_EQ(array.Get(0), &a);
    EXPECT_EQ(array.Get(1), nullptr);
    array.Clear();
    EXPECT_EQ(array.GetSize(), 1ul);
    EXPECT_EQ(array.Get(0), nullptr);
}

// The whole-field parsers against a model: a grammar written here as a
// regular expression, the value from the C library under the "C" locale.
TEST(StringHelpers, ParsersTakeExactlyWholeFieldsOverRandomText) {
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 random(seed);
    const std::string alphabet = "0123456789.-+eE x,";
    const std::regex integer("-?[0-9]+");
    const std::regex decimal("-?([0-9]+\\.?[0-9]*|\\.[0-9]+)([eE][-+]?[0-9]+)?");
    const std::regex signedDecimal("[-+]?([0-9]+\\.?[0-9]*|\\.[0-9]+)([eE][-+]?[0-9]+)?");
    for (int round = 0; round < 20000; ++round) {
        std::string text;
        const int length = static_cast<int>(random() % 12);
        for (int i = 0; i < length; ++i) {
            // Mostly digits, so that many draws are numbers.
            text += random() % 3 ? alphabet[random() % 10] : alphabet[random() % alphabet.size()];
        }
        if (round % 97 == 0) text = std::string(round % 2 ? "1" : "-9") + std::string(30, '9');
        long long i = 7;
        errno = 0;
        const long long modelInteger = std::strtoll(text.c_str(), nullptr, 10);
        const bool integerOk = std::regex_match(text, integer) && errno != ERANGE;
        ASSERT_EQ(StringHelpers::ParseInteger(text, i), integerOk) << "\"" << text << "\"";
        EXPECT_EQ(i, integerOk ? modelInteger : 7) << text;
        double d = 7.0;
        errno = 0;
        const double modelDecimal = std::strtod(text.c_str(), nullptr);
        // Out of range: beyond the largest double, or so small it reads as
        // 0; a subnormal is a value (strtod says ERANGE for it too).
        const bool outOfRange =
            errno == ERANGE && (modelDecimal == 0.0 || std::isinf(modelDecimal));
        const bool decimalOk =
            std::regex_match(text, decimal) && !outOfRange && std::isfinite(modelDecimal);
        ASSERT_EQ(StringHelpers::ParseDecimal(text, d), decimalOk) << "\"" << text << "\"";
        EXPECT_EQ(d, decimalOk ? modelDecimal : 7.0) << text;
        // Where a "+" may lead, it is one sign like "-", never one before it.
        const bool plusOk =
            std::regex_match(text, signedDecimal) && !outOfRange && std::isfinite(modelDecimal);
        d = 7.0;
        ASSERT_EQ(toolkit::ParseWholeDecimal(text, d, true), plusOk) << "\"" << text << "\"";
        EXPECT_EQ(d, plusOk ? modelDecimal : 7.0) << text;
        // Other bases: the same text with some digits turned into letters.
        const int base = round % 3 == 0 ? 16 : round % 3 == 1 ? 8 : 2;
        for (char& c : text)
            if (random() % 4 == 0 && c >= '0' && c <= '9') c = "abcdefABCDEF"[random() % 12];
        const std::regex digits(base == 16 ? "-?[0-9a-fA-F]+" : base == 8 ? "-?[0-7]+" : "-?[01]+");
        errno = 0;
        const long long modelBased = std::strtoll(text.c_str(), nullptr, base);
        const bool basedOk = std::regex_match(text, digits) && errno != ERANGE;
        i = 7;
        ASSERT_EQ(StringHelpers::ParseInteger(text, i, base), basedOk)
            << base << " \"" << text << "\"";
        EXPECT_EQ(i, basedOk ? modelBased : 7) << text;
    }
}

}  // namespace
