#include "toolkit/string.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <clocale>
#include <locale>

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
    EXPECT_EQ(String("  -42x").ToLong(), -42);
    EXPECT_EQ(String("junk").ToLong(), 0);
    const char* previous = std::setlocale(LC_NUMERIC, "de_DE.UTF-8");
    EXPECT_DOUBLE_EQ(String("2.5").ToDouble(), 2.5);
    EXPECT_EQ(String::CreateFromInt(-1234567), "-1234567");
    if (previous) std::setlocale(LC_NUMERIC, "C");
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
