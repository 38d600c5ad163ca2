#include "nxbase/text.h"

#include <gtest/gtest.h>

#include <boost/make_shared.hpp>
#include <string>
#include <vector>

#include "nxbase/appconfig.h"
#include "nxbase/logfile.h"
#include "nxbase/singleton.h"
#include "test_util.h"
#include "toolkit/userinterface.h"

namespace {

using nxtest::RecordingLog;

class TextTest : public ::testing::Test {
  protected:
    void SetUp() override {
        Text::FreeResources();
        // The process log is made once; later tests write where the first
        // one pointed, which is gone by then (such lines are lost quietly).
        LogFile::Instance()->SetLogOption("Language", true);
        LogFile::Instance()->AddLogListener(log);
    }
    void TearDown() override {
        LogFile::Instance()->RemoveLogListener(log);
        Text::FreeResources();
        NxSingleton::DeleteAllSingleton();
    }

    // Writes `bytes` as <dir>/<name> and returns the path.
    std::string Write(const std::string& name, const std::string& bytes) {
        std::string path = dir.File(name);
        nxtest::WriteFile(path, bytes);
        return path;
    }

    // The texts of a group, in order.
    static std::vector<std::string> Group(const std::string& group) {
        std::vector<std::string> texts;
        for (unsigned long i = 0; i < Text::GetEntryCount(group); ++i) {
            texts.push_back(Text::GetText(group, i).str());
        }
        return texts;
    }

    nxtest::TempDir dir;
    nxtest::ScopedEnv logPath{"NXBASE_LOG_PATH", dir.path().string()};
    boost::shared_ptr<RecordingLog> log = boost::make_shared<RecordingLog>();
};

using Texts = std::vector<std::string>;

TEST_F(TextTest, GroupAndTextLinesFollowTheLineExpressions) {
    std::string path = Write("tricky.lng",
                             "[dropped: no group yet]\n"
                             "{Main}\n"
                             "12 [Hello]\n"
                             "  7\t[a [nested] text]\n"
                             "[]\n"
                             "[trailing blank] \n"
                             "x [not a text: letter before the bracket]\n"
                             "[unclosed\n"
                             "|3| [bar and digits]\n"
                             "[colon suffix]::\n"
                             " 100 {Numbered}\n"
                             "[first]\n"
                             "{Open\n"
                             "[still Numbered]\n"
                             "{Blank} \n"
                             "[after a group line that does not match]\n");
    ASSERT_TRUE(Text::LoadText(String(path)));

    // "[:space:]" after the closing bracket is the set ":space", not blanks.
    EXPECT_EQ(Group("Main"),
              (Texts{"Hello", "a [nested] text", "", "bar and digits", "colon suffix"}));
    EXPECT_EQ(Group("Numbered"),
              (Texts{"first", "still Numbered", "after a group line that does not match"}));
    EXPECT_EQ(Text::GetEntryCount("Open"), 0u);
    EXPECT_EQ(Text::GetEntryCount("Blank"), 0u);
    EXPECT_EQ(Text::GetEntryCount("Blank} "), 0u);
}

TEST_F(TextTest, FirstDefinitionOfAGroupWins) {
    std::string path = Write("twice.lng",
                             "{A}\n[a0]\n[a1]\n"
                             "{Empty}\n"
                             "{B}\n[b0]\n"
                             "{A}\n[dropped]\n"
                             "{Empty}\n[empty groups can be opened again]\n");
    ASSERT_TRUE(Text::LoadText(String(path)));
    EXPECT_EQ(Group("A"), (Texts{"a0", "a1"}));
    EXPECT_EQ(Group("B"), (Texts{"b0"}));
    EXPECT_EQ(Group("Empty"), (Texts{"empty groups can be opened again"}));

    // A second file adds new groups but cannot change the loaded ones.
    std::string more = Write("more.lng", "{A}\n[other]\n{C}\n[c0]\n");
    ASSERT_TRUE(Text::LoadText(String(more)));
    EXPECT_EQ(Group("A"), (Texts{"a0", "a1"}));
    EXPECT_EQ(Group("C"), (Texts{"c0"}));
}

TEST_F(TextTest, Utf8MarkerBeforeTheFirstGroupConvertsToWindows1252) {
    // U+00E4, U+20AC (0x80 in Windows-1252), U+0103 and U+4E2D (not in the
    // code page), a stray continuation byte, a sequence cut off at the end.
    std::string path = Write("utf8.lng",
                             "; Encoding=UTF-8\n"
                             "{G}\n"
                             "[\xC3\xA4 \xE2\x82\xAC \xC4\x83 \xE4\xB8\xAD \x80 x \xE2\x82]\n");
    ASSERT_TRUE(Text::LoadText(String(path)));
    EXPECT_EQ(Text::GetText("G", 0).str(), "\xE4 \x80 ? ? ? x ?");

    Text::FreeResources();
    std::string late = Write("late.lng", "{G}\nEncoding=UTF8\n[\xC3\xA4]\n");
    ASSERT_TRUE(Text::LoadText(String(late)));
    EXPECT_EQ(Text::GetText("G", 0).str(), "\xC3\xA4") << "a marker after a group is ignored";

    // The library's own texts need no AppDir.
    Text::FreeResources();
    ASSERT_TRUE(Text::LoadLibraryTexts(49));
    EXPECT_EQ(Text::GetText("FarbTexte", 0).str(), "Schwarz");
    Text::FreeResources();
    ASSERT_TRUE(Text::LoadLibraryTexts(77)) << "falls back to English";
    EXPECT_EQ(Text::GetText("FarbTexte", 0).str(), "black");

    // A second line for a known group opens nothing: a marker below it counts.
    Text::FreeResources();
    std::string reopened =
        Write("reopened.lng", "{G}\n[x]\n{G}\nEncoding=UTF-8\n{H}\n[\xC3\xA4]\n");
    ASSERT_TRUE(Text::LoadText(String(reopened)));
    EXPECT_EQ(Text::GetText("H", 0).str(), "\xE4");

    Text::FreeResources();
    std::string ansi = Write("ansi.lng",
                             "{G}\n[Gr\xFC\xDF"
                             "e]\n");
    ASSERT_TRUE(Text::LoadText(String(ansi)));
    EXPECT_EQ(Text::GetText("G", 0).str(),
              "Gr\xFC\xDF"
              "e")
        << "ANSI files are taken as they are";
    EXPECT_EQ(Text::GetTextUtf8("G", 0),
              "Gr\xC3\xBC\xC3\x9F"
              "e")
        << "the same text for GTK or Qt";
    std::string everyByte;
    for (int byte = 1; byte < 256; ++byte) everyByte += static_cast<char>(byte);
    EXPECT_EQ(nxbase::detail::Utf8ToAnsi(nxbase::detail::AnsiToUtf8(everyByte)), everyByte);
    EXPECT_EQ(nxbase::detail::AnsiToUtf8("\x80"), "\xE2\x82\xAC");

    EXPECT_EQ(nxbase::detail::Utf8ToAnsi("\xF0\x9F\x98\x80!"), "?!");
    EXPECT_EQ(nxbase::detail::Utf8ToAnsi("\xC0\xAF"), "??") << "overlong forms are malformed";
}

TEST_F(TextTest, WindowsLineEndsReadAsInTextMode) {
    std::string path =
        Write("crlf.lng", "{G}\r\n[one]\r\n2 [two]\r\n[lone CR]\r\r\n[last without newline]");
    ASSERT_TRUE(Text::LoadText(String(path)));
    // A CR not followed by LF stays in the line, which then matches no
    // expression; a Ctrl-Z ends the file as Windows text mode did.
    EXPECT_EQ(Group("G"), (Texts{"one", "two", "last without newline"}));

    Text::FreeResources();
    std::string eof = Write("ctrlz.lng", "{G}\r\n[kept]\r\n\x1A\r\n[after end of file]\r\n");
    ASSERT_TRUE(Text::LoadText(String(eof)));
    EXPECT_EQ(Group("G"), (Texts{"kept"}));
}

TEST_F(TextTest, MissingFileAndMissingTextsAnswerEmptyWithALogLine) {
    std::string missing = dir.File("absent.lng");
    EXPECT_FALSE(Text::LoadText(String(missing)));
    EXPECT_TRUE(log->Contains("Language|Loading text: \"" + missing + "\""));
    EXPECT_FALSE(Text::LoadText(String(dir.path().string()))) << "a directory is no text file";

    EXPECT_EQ(Text::GetText("Nowhere", 0).str(), "");
    EXPECT_TRUE(log->Contains("Language|Missing group: Nowhere"));
    EXPECT_EQ(Text::GetEntryCount("Nowhere"), 0u);

    ASSERT_TRUE(Text::LoadText(String(Write("one.lng", "{G}\n[only]\n"))));
    EXPECT_EQ(TextSegment("G")[0].str(), "only");
    EXPECT_EQ(TextSegment("G")[1].str(), "");
    EXPECT_TRUE(log->Contains("Language|Missing text: G 1"));
}

TEST_F(TextTest, LoadingLogsTheFileAndWithLanguage2EveryLine) {
    LogFile::Instance()->SetLogOption("Language2", true);
    std::string path = Write("logged.lng", "{G}\r\n[t]\n");
    ASSERT_TRUE(Text::LoadText(String(path)));
    LogFile::Instance()->SetLogOption("Language2", false);
    EXPECT_TRUE(log->Contains("Language|Parse text file: \"" + path + "\""));
    EXPECT_TRUE(log->Contains("Language2| Read line: {G}"));
    EXPECT_TRUE(log->Contains("Language2| Read line: [t]"));
}

TEST_F(TextTest, LanguageFileFallsBackToLanguageOne) {
    Write("Texte1.lng", "{G}\n[english]\n");
    std::string base = dir.File("Texte");
    EXPECT_TRUE(Text::LoadText(String(base), 49));
    EXPECT_EQ(Text::GetLanguage(), 49) << "the requested number stays the current language";
    EXPECT_EQ(Text::GetText("G", 0).str(), "english");

    Text::FreeResources();
    Write("Texte49.lng", "{G}\n[deutsch]\n");
    EXPECT_TRUE(Text::LoadText(String(base), 49));
    EXPECT_EQ(Text::GetText("G", 0).str(), "deutsch");

    Text::FreeResources();
    EXPECT_FALSE(Text::LoadText(String(dir.File("Nothing")), 33));
    EXPECT_EQ(Text::GetEntryCount("G"), 0u);
}

TEST_F(TextTest, BaseNameWithoutDirectoryIsLookedUpInTheLanguageDirectory) {
    std::filesystem::create_directories(dir.path() / "bin");
    std::filesystem::create_directories(dir.path() / "LNG");
    nxtest::WriteFile((dir.path() / "LNG" / "Texte49.lng").string(), "{G}\n[from LNG]\n");
    AppDir::CreateAppDir(String((dir.path() / "bin" / "app").string()));
    EXPECT_EQ(nxbase::detail::TextFilePrefix("Texte"), (dir.path() / "LNG" / "Texte").string());
    EXPECT_TRUE(Text::LoadText(String("Texte"), 49));
    EXPECT_EQ(Text::GetText("G", 0).str(), "from LNG");
}

TEST_F(TextTest, ErrorReportersSpeakGermanForLanguage49) {
    auto ui = std::make_shared<RecordingUserInterface>(true);
    ScopedUserInterface scoped(ui);
    Text::LoadText(String(dir.File("x")), 49);
    EXPECT_TRUE(Text::SyntaxError("T49.lng", '}', "Main"));
    Text::LoadError("T49.lng", 1);
    Text::LoadText(String(dir.File("x")), 1);
    Text::LoadError("T1.lng", 2);
    Text::LoadError("T1.lng", 7);

    auto boxes = ui->Boxes();
    ASSERT_EQ(boxes.size(), 4u);
    EXPECT_EQ(boxes[0].kind, UserInterface::BoxKind::kQuery);
    EXPECT_EQ(boxes[0].text,
              "Fehler in Textdatei 'T49.lng'\nFehlendes Zeichen '}' in Textgruppe 'Main'"
              "\n\nweiterfahren?");
    EXPECT_EQ(boxes[1].text,
              "Fehler in Textdatei 'T49.lng'\nEs ist nicht m\xF6glich die Textdatei zu \xF6"
              "ffnen");
    EXPECT_EQ(boxes[2].kind, UserInterface::BoxKind::kError);
    EXPECT_EQ(boxes[2].text, "error in text file 'T1.lng'\nmore then 10000 text groups");
    EXPECT_EQ(boxes[3].text, "error in text file 'T1.lng'\ngeneral error");
    EXPECT_EQ(nxbase::detail::SyntaxErrorMessage(1, "f", ']', "g"),
              "error in text file 'f'\n']' missing in text group 'g'\n\ncontinue?");
}

TEST_F(TextTest, ParserSurvivesHostileInput) {
    std::string junk;
    for (int i = 0; i < 4096; ++i) junk.push_back(static_cast<char>((i * 131 + 7) & 0xFF));
    nxbase::detail::ParseTextBytes(junk, "junk");

    // A 10 MB line of digits and a group line without a closing brace.
    std::string longLine(10u << 20, '1');
    nxbase::detail::ParseTextBytes("{G}\n" + longLine + "{\n[" + longLine + "]\n{No brace\n[t]\n",
                                   "long");
    EXPECT_EQ(Text::GetEntryCount("G"), 2u);
    EXPECT_EQ(Text::GetText("G", 0).Len(), String::kMaxLen) << "String keeps its length limit";

    std::string many;
    for (int i = 0; i < 5000; ++i) many += "{g" + std::to_string(i) + "}\n[t]\n";
    nxbase::detail::ParseTextBytes(many, "many");
    EXPECT_EQ(Text::GetText("g4999", 0).str(), "t");
}

}  // namespace
