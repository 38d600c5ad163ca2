#include "nxbase/asciifile.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <charconv>
#include <filesystem>
#include <fstream>
#include <functional>
#include <limits>
#include <sstream>
#include <stdexcept>
#include <vector>

#include "nxbase/appconfig.h"
#include "nxbase/singleton.h"
#include "test_util.h"

namespace {

// Reals are written with 6 decimals below; reading back must agree to the
// last written digit.
constexpr int kDecimals = 6;
constexpr double kDecimalTolerance = 0.5e-6;

class ASCIIFileTest : public ::testing::Test {
  protected:
    nxtest::TempDir dir;
    nxtest::ScopedEnv logPath{"NXBASE_LOG_PATH", dir.path().string()};
    nxtest::ScopedEnv logOptions{"NXBASE_LOG_OPTIONS", ""};

    std::string Write(const std::string& name, const std::string& bytes) {
        std::string path = dir.File(name);
        nxtest::WriteFile(path, bytes);
        return path;
    }
};

// Every byte value except the caret, for the string round trip.
std::string AllBytesButCaret() {
    std::string bytes;
    for (int c = 0; c < 256; ++c) {
        if (c != '^') bytes.push_back(static_cast<char>(c));
    }
    return bytes;
}

TEST_F(ASCIIFileTest, EveryValueTypeReadsBackAsWrittenInBothSeparatorModes) {
    const short shorts[4] = {0, -32768, 32767, 12};
    const int ints[3] = {-2147483647 - 1, 2147483647, 0};
    const double reals[3] = {0.0451, -12.5, 1234567.125};
    const std::string bytes = AllBytesButCaret();

    for (bool tabMode : {false, true}) {
        SCOPED_TRACE(tabMode ? "tab mode" : "blank mode");
        std::string path = dir.File(tabMode ? "tab.dat" : "blank.dat");
        {
            auto file = ASCIIFile::Get(String(path), false, tabMode);
            file->PutTitel("Measurement");
            file->PutBOOL("Valid", true);
            file->PutBOOL("Stale", false);
            file->PutShort("Short", -123);
            file->PutShortArray("Shorts", shorts, 4);
            file->PutInt("Int", -2147483647 - 1);
            file->PutIntArray("Ints", ints, 3);
            file->PutReal("Real", -0.0451234, kDecimals);
            file->PutRealArray("Reals", reals, 3, kDecimals);
            file->PutDate("Date", 22, 11, 2026, 9, 5, 59);
            file->PutString("Bytes", String(bytes));
            file->PutString("Lines", std::vector<String>{"first", "\tsecond", ""});
            file->PutString("Caret", String("a^b"));
            file->CheckOutError();
            EXPECT_FALSE(file->GetError());
        }
        auto file = ASCIIFile::Get(String(path), true, tabMode);
        bool valid = false, stale = true;
        short s = 0, shortsBack[4] = {};
        int i = 0, intsBack[3] = {};
        double r = 0, realsBack[3] = {};
        int d[6] = {};
        String text, caret;
        std::vector<String> lines;
        ASSERT_TRUE(file->GetTitel("Measurement"));
        ASSERT_TRUE(file->GetBOOL("Valid", valid));
        ASSERT_TRUE(file->GetBOOL("Stale", stale));
        ASSERT_TRUE(file->GetShort("Short", s));
        ASSERT_TRUE(file->GetShortArray("Shorts", shortsBack, 4));
        ASSERT_TRUE(file->GetInt("Int", i));
        ASSERT_TRUE(file->GetIntArray("Ints", intsBack, 3));
        ASSERT_TRUE(file->GetReal("Real", r));
        ASSERT_TRUE(file->GetRealArray("Reals", realsBack, 3));
        ASSERT_TRUE(file->GetDate("Date", d[0], d[1], d[2], d[3], d[4], d[5]));
        ASSERT_TRUE(file->GetString("Bytes", text));
        ASSERT_TRUE(file->GetString("Lines", lines));
        ASSERT_TRUE(file->GetString("Caret", caret));

        EXPECT_TRUE(valid);
        EXPECT_FALSE(stale);
        EXPECT_EQ(s, -123);
        EXPECT_EQ(std::vector<short>(shortsBack, shortsBack + 4),
                  std::vector<short>(shorts, shorts + 4));
        EXPECT_EQ(i, -2147483647 - 1);
        EXPECT_EQ(std::vector<int>(intsBack, intsBack + 3), std::vector<int>(ints, ints + 3));
        EXPECT_NEAR(r, -0.045123, kDecimalTolerance);
        for (int k = 0; k < 3; ++k) EXPECT_NEAR(realsBack[k], reals[k], kDecimalTolerance);
        EXPECT_EQ(std::vector<int>(d, d + 6), (std::vector<int>{22, 11, 2026, 9, 5, 59}));
        EXPECT_EQ(text.str(), bytes);
        EXPECT_EQ(lines, (std::vector<String>{"first", "\tsecond", ""}));
        // The caret is written as "^" 0x9E and reads back as a caret followed
        // by 0x9E: the format's own asymmetry.
        EXPECT_EQ(caret.str(),
                  "a^\x9E"
                  "b");
    }
}

TEST_F(ASCIIFileTest, WriterLinesAreExactlyTheDocumentedText) {
    std::string path = dir.File("exact.dat");
    const short shorts[3] = {1, -20, 300};
    const int ints[2] = {5, -123456};
    const double reals[2] = {0.5, -2.0};
    {
        ASCIIFileImpl file(String(path), false);
        file.PutShortArray("S", shorts, 3);
        file.PutIntArray("I", ints, 2);
        file.PutRealArray("R", reals, 2, 3);
        file.PutReal("Zero", 1.25, 0);
        file.PutDate("Date", 1, 2, 2026, 3, 4, 5);
        file.PutString("Esc", String(std::string("\r\n\x1F\t^", 5)));
    }
    EXPECT_EQ(nxtest::ReadFile(path),
              "S=     1    -20    300\n"
              "I=      5 -123456\n"
              "R=0.500 -2.000\n"
              "Zero=1\n"
              "Date=2026-02-01 03:04:05\n"
              "Esc=^M^J^_\t^\x9E\n");
    {
        ASCIIFileImpl file(String(path), false, true);
        file.PutIntArray("I", ints, 2);
    }
    EXPECT_EQ(nxtest::ReadFile(path), "I=\t      5\t-123456\n");
}

TEST_F(ASCIIFileTest, AFailedReaderLeavesTheWholeLineAndSkippingFindsTitles) {
    std::stringstream stream("[Data]\nCount=  42\nValues=1 2\nName=x\n");
    ASCIIFileImpl file(&stream, true);
    int count = 0;
    int values[3] = {};
    String name;
    EXPECT_FALSE(file.GetTitel("Other"));
    EXPECT_FALSE(file.GetInt("Data", count));
    EXPECT_TRUE(file.GetTitel("Data"));
    EXPECT_FALSE(file.GetInt("Coun", count));
    EXPECT_FALSE(file.GetTitel("Count"));
    EXPECT_FALSE(file.GetString("Name", name));
    ASSERT_TRUE(file.GetInt("Count", count));
    EXPECT_EQ(count, 42);
    // Two values on the line: asking for three fails and rewinds.
    EXPECT_FALSE(file.GetIntArray("Values", values, 3));
    ASSERT_TRUE(file.GetIntArray("Values", values, 2));
    EXPECT_EQ(values[1], 2);
    ASSERT_TRUE(file.GetKeyString(name));
    EXPECT_EQ(name, "Name=x");
    EXPECT_FALSE(file.GetKeyString(name));
    EXPECT_TRUE(file.AtEnd());

    // "^=" is an escape inside the key, not its end: the key "a^=b" holds a
    // caret and "=", and the value starts after the plain "=".
    std::stringstream caret("a^=b=5\n");
    ASCIIFileImpl keys(&caret, true);
    EXPECT_FALSE(keys.GetInt("a^", count));
    ASSERT_TRUE(keys.GetInt("a^=b", count));
    EXPECT_EQ(count, 5);

    // Skipping to a title, and multiline values.
    std::stringstream sections(
        "junk\n[A]\nx\n[B]\nNote=one\nNote=two^Jhalf\nNote=\nOther=1\n[C]\n");
    ASCIIFileImpl skipping(&sections, true);
    String note;
    std::vector<String> notes;
    EXPECT_TRUE(skipping.SkipToTitel("B"));
    EXPECT_FALSE(skipping.GetString("Other", notes));
    EXPECT_TRUE(notes.empty());
    ASSERT_TRUE(skipping.GetMultilineString("Note", note));
    EXPECT_EQ(note.str(), "one\ntwo\nhalf\n");
    EXPECT_TRUE(skipping.SkipLines(1));
    EXPECT_TRUE(skipping.GetTitel("C"));
    EXPECT_FALSE(skipping.SkipToTitel("A"));
    EXPECT_TRUE(skipping.SkipLines(5));
}

// Numbers are read the same under any locale (see the locale test).
TEST_F(ASCIIFileTest, NumbersStopAtTheFirstCharacterTheirGrammarLacks) {
    // A lone minus or separator reads as 0; there is no plus sign; an
    // exponent or hexadecimal prefix ends the number; out of range saturates.
    std::stringstream in(
        "A=3,25\nB=-  7.5\nC=-\nD=,\nE=+5\nF=1e3\nG=12 ,5 -0,5\nH=99999999999\nI=0x1F\nJ=.5\n");
    ASCIIFileImpl file(&in, true);
    double a = 0, b = 0, d = 1, f = 0, g[3] = {}, j = 0;
    int c = 1, e = 0, h = 0, i = 0;
    EXPECT_TRUE(file.GetReal("A", a));
    EXPECT_TRUE(file.GetReal("B", b));
    EXPECT_TRUE(file.GetInt("C", c));   // a lone minus reads as 0
    EXPECT_TRUE(file.GetReal("D", d));  // a lone separator reads as 0
    EXPECT_FALSE(file.GetInt("E", e));  // no plus sign
    ASSERT_TRUE(file.SkipLines(1));
    EXPECT_TRUE(file.GetReal("F", f));  // no exponent: "1" and the rest ignored
    EXPECT_TRUE(file.GetRealArray("G", g, 3));
    EXPECT_TRUE(file.GetInt("H", h));
    EXPECT_TRUE(file.GetInt("I", i));  // no hexadecimal: "0" and the rest ignored
    EXPECT_TRUE(file.GetReal("J", j));

    EXPECT_EQ((std::vector<double>{a, b, d, f, g[0], g[1], g[2], j}),
              (std::vector<double>{3.25, -7.5, 0, 1, 12, 0.5, -0.5, 0.5}));
    EXPECT_EQ((std::vector<int>{c, h, i}), (std::vector<int>{0, 2147483647, 0}));  // H saturates
}

TEST_F(ASCIIFileTest, RealsAreTheCorrectlyRoundedValueOfTheirDigits) {
    // Short reals take a quick path; every real must equal the full
    // conversion bit for bit, whatever its length.
    std::uint64_t seed = 12345;
    auto next = [&seed](unsigned bound) {
        seed = seed * 6364136223846793005u + 1442695040888963407u;
        return static_cast<unsigned>((seed >> 33) % bound);
    };
    std::string content;
    std::vector<double> expected;
    for (int n = 0; n < 5000; ++n) {
        std::string digits;
        for (unsigned i = 0, count = 1 + next(20); i < count; ++i) digits += char('0' + next(10));
        std::string decimals;
        for (unsigned i = 0, count = next(26); i < count; ++i) decimals += char('0' + next(10));
        std::string text = digits + "." + decimals;
        double value = 0;
        std::from_chars(text.data(), text.data() + text.size(), value);
        expected.push_back(value);
        content += "R=" + digits + (n % 2 ? "," : ".") + decimals + "\n";
    }
    content += "R=0." + std::string(400, '0') + "1\nR=-" + std::string(400, '9') + "\n";
    std::stringstream stream(content);
    ASCIIFileImpl file(&stream, true);
    for (double value : expected) {
        double back = -1;
        ASSERT_TRUE(file.GetReal("R", back));
        ASSERT_EQ(back, value);
    }
    double tiny = -1, huge = 0;
    ASSERT_TRUE(file.GetReal("R", tiny));
    ASSERT_TRUE(file.GetReal("R", huge));
    EXPECT_EQ(tiny, 0.0);
    EXPECT_EQ(huge, -std::numeric_limits<double>::infinity());
}

TEST_F(ASCIIFileTest, AFileWithoutLineFeedInItsHeadIsReadWithTheLegacyRules) {
    // CP850 0x81 is u-umlaut, 0x82 e-acute; Windows-1252 has them at 0xFC, 0xE9.
    std::string legacy = Write("legacy.dat", "Name=Gr\x81n^M^X^J caf\x82\r");
    auto file = ASCIIFile::Get(String(legacy), true);
    String name;
    ASSERT_TRUE(file->GetString("Name", name));
    EXPECT_EQ(name.str(), "Gr\xFCn\r\n caf\xE9");

    // The probe sees only the first 1024 bytes.
    std::string longLine = "Pad=" + std::string(1100, 'x') + "\nName=^A^M\n";
    std::string late = Write("late.dat", longLine);
    auto lateFile = ASCIIFile::Get(String(late), true);
    ASSERT_TRUE(lateFile->SkipLines(1));
    ASSERT_TRUE(lateFile->GetString("Name", name));
    EXPECT_EQ(name.str(), "\r");

    std::string early = Write("early.dat", "Name=^A^M\x81\n" + longLine);
    auto earlyFile = ASCIIFile::Get(String(early), true);
    ASSERT_TRUE(earlyFile->GetString("Name", name));
    EXPECT_EQ(name.str(), "\x01\r\x81");
}

TEST_F(ASCIIFileTest, LinesAroundTheReadChunkSizeAreKeptWhole) {
    // Lines are collected in chunks of 1024 bytes; lines that end just
    // before, on and after a chunk boundary, the last one without a line feed.
    std::string content;
    std::vector<std::string> values;
    for (std::size_t length = 1018; length <= 1030; ++length) {
        values.push_back(std::string(length - 2, static_cast<char>('a' + length % 26)));
        content += "V=" + values.back() + (length == 1030 ? "" : "\n");
    }
    std::stringstream stream(content);
    ASCIIFileImpl file(&stream, true);
    for (const std::string& expected : values) {
        String value;
        ASSERT_TRUE(file.GetString("V", value));
        EXPECT_EQ(value.str(), expected);
    }
    EXPECT_TRUE(file.AtEnd());
}

TEST_F(ASCIIFileTest, CarriageReturnsAreDroppedSoCrLfFilesReadLikeLfFiles) {
    std::string path = Write("crlf.dat",
                             "[File]\r\nApplication=K-Lume\r\nVersion=3\r\n"
                             "Date=2026 - 11 -22   10 : 15:\r30\r\nName=a\rb\r\n");
    auto file = ASCIIFile::Get(String(path), true);
    EXPECT_TRUE(file->CheckVersion(3));
    int d[6] = {};
    String name;
    ASSERT_TRUE(file->GetDate("Date", d[0], d[1], d[2], d[3], d[4], d[5]));
    EXPECT_EQ(std::vector<int>(d, d + 6), (std::vector<int>{22, 11, 2026, 10, 15, 30}));
    ASSERT_TRUE(file->GetString("Name", name));
    EXPECT_EQ(name, "ab");
}

TEST_F(ASCIIFileTest, VersionSectionAcceptsOnlyVersionsFromTwoToTheHighestKnown) {
    for (int version : {1, 2, 4, 5}) {
        std::stringstream stream;
        {
            ASCIIFileImpl writer(&stream, false);
            nxbase::detail::WriteVersionSection(writer, version, "K-Lume 4.2");
        }
        EXPECT_EQ(stream.str(),
                  "[File]\nApplication=K-Lume 4.2\nVersion=" + std::to_string(version) + "\n");
        ASCIIFileImpl reader(&stream, true);
        EXPECT_EQ(reader.CheckVersion(4), version >= 2 && version <= 4) << version;
        EXPECT_EQ(reader.Version(), version);
    }
    std::stringstream missing("[File]\nVersion=3\n");
    ASCIIFileImpl reader(&missing, true);
    EXPECT_FALSE(reader.CheckVersion(4));

    // Without an application to name, SetVersion writes nothing.
    std::string path = dir.File("noapp.dat");
    {
        ASCIIFileImpl writer(String(path), false);
        EXPECT_THROW(writer.SetVersion(3), std::logic_error);
    }
    EXPECT_EQ(nxtest::ReadFile(path), "");

    // With one, its two-component version text names the writer.
    AppName::CreateAppName("ColorLab", "ColorLab", "K-Lume ColorLab", ApplicationVersion(4, 2, 7));
    std::stringstream named;
    {
        ASCIIFileImpl writer(&named, false);
        writer.SetVersion(3);
    }
    EXPECT_EQ(named.str(), "[File]\nApplication=" + AppName::Instance()->GetVersionString().str() +
                               "\nVersion=3\n");
    ASCIIFileImpl reader2(&named, true);
    EXPECT_TRUE(reader2.CheckVersion(3));
    NxSingleton::DeleteAllSingleton();
}

TEST_F(ASCIIFileTest, PercentDoneGrowsWithScanningUpToOne) {
    for (const std::string& path : {Write("empty.dat", ""), dir.File("none.dat")}) {
        EXPECT_EQ(ASCIIFile::Get(String(path), true)->GetPercentDone(), -1.0f) << path;
    }

    std::string content;
    for (int i = 0; i < 100; ++i) content += "Value=" + std::to_string(1000 + i) + "\n";
    auto file = ASCIIFile::Get(String(Write("values.dat", content)), true);
    float last = file->GetPercentDone();
    EXPECT_FLOAT_EQ(last, 1.0f / static_cast<float>(content.size()))
        << "the first line read counts one byte";
    int value = 0;
    while (file->GetInt("Value", value)) {
        float now = file->GetPercentDone();
        EXPECT_GT(now, last);
        last = now;
    }
    // Every line was scanned to its end: all bytes are consumed.
    EXPECT_FLOAT_EQ(last, 1.0f);
}

TEST_F(ASCIIFileTest, WriteFailuresAreLatchedAndNeverThrowNorLeaveHalfFiles) {
    // A file size limit hit in the middle of a line: the line is taken back
    // and the failure latched.
    {
        const std::string limited = dir.File("limited.dat");
        EXPECT_EQ(nxtest::InChild([&] {
                      nxtest::LimitFileSize(1000);
                      ASCIIFileImpl file(String(limited), false);
                      for (int i = 0; i < 10; ++i) {
                          file.PutString("Line", String(std::string(295, 'a' + i)));
                          file.CheckOutError();
                      }
                      return file.GetError() ? 0 : 1;
                  }),
                  0)
            << "the failure was not latched";
        const std::string written = nxtest::ReadFile(limited);
        EXPECT_EQ(written.size(), 3u * 301u);
        EXPECT_EQ(written.back(), '\n');
    }

    // A directory that does not exist.
    {
        auto file = ASCIIFile::Get(String(dir.File("missing/dir/out.dat")), false);
        EXPECT_TRUE(file->GetError());
        EXPECT_NO_THROW(file->PutInt("Value", 1));
        EXPECT_TRUE(file->GetError());
    }
    EXPECT_FALSE(std::filesystem::exists(dir.File("missing")));

    // A full disk.
    if (std::filesystem::exists("/dev/full")) {
        ASCIIFileImpl file(String("/dev/full"), false);
        EXPECT_FALSE(file.GetError());
        file.PutString("Value", String(std::string(1000, 'x')));
        file.CheckOutError();
        EXPECT_TRUE(file.GetError());
    }

    // The directory removed while the file is written.
    std::string sub = dir.File("sub");
    std::filesystem::create_directory(sub);
    {
        ASCIIFileImpl file(String(sub + "/out.dat"), false);
        file.PutInt("Value", 1);
        std::filesystem::remove_all(sub);
        file.CheckOutError();
        EXPECT_TRUE(file.GetError());
    }
    EXPECT_FALSE(std::filesystem::exists(sub));

    // Opened, the file exists (empty); after each check it holds exactly the
    // lines written so far, in the same file: a reader that opened it at the
    // start sees them, and so does a second hard link. No temporary file is
    // left beside it.
    std::string keep = Write("keep.dat", "Value=1\n");
    std::string link = dir.File("link.dat");
    std::filesystem::create_hard_link(keep, link);
    {
        ASCIIFileImpl file(String(keep), false);
        EXPECT_EQ(nxtest::ReadFile(keep), "");
        std::ifstream follower(keep, std::ios::binary);
        std::string line;
        for (int value : {2, 20}) {
            file.PutInt("Value", value);
            file.CheckOutError();
            follower.clear();
            ASSERT_TRUE(std::getline(follower, line));
            EXPECT_EQ(line, "Value=" + std::to_string(value));
        }
        EXPECT_EQ(nxtest::ReadFile(link), "Value=2\nValue=20\n");
        file.PutInt("Other", 3);
    }
    std::filesystem::remove(link);
    std::vector<std::string> left;
    for (const auto& entry : std::filesystem::directory_iterator(dir.path())) {
        if (entry.path().filename().string().rfind("keep.dat", 0) == 0) {
            left.push_back(entry.path().filename().string());
        }
    }
    EXPECT_EQ(left, std::vector<std::string>{"keep.dat"});
    EXPECT_EQ(nxtest::ReadFile(keep), "Value=2\nValue=20\nOther=3\n");

    // A writable file in a directory that takes no new files.
    std::string closed = dir.File("closed");
    std::filesystem::create_directory(closed);
    nxtest::WriteFile(closed + "/data.dat", "old\n");
    std::filesystem::permissions(
        closed, std::filesystem::perms::owner_read | std::filesystem::perms::owner_exec);
    {
        ASCIIFileImpl file(String(closed + "/data.dat"), false);
        file.PutInt("Value", 4);
        file.CheckOutError();
        EXPECT_FALSE(file.GetError());
        EXPECT_EQ(nxtest::ReadFile(closed + "/data.dat"), "Value=4\n");
    }
    std::filesystem::permissions(closed, std::filesystem::perms::owner_all);
    EXPECT_EQ(nxtest::ReadFile(closed + "/data.dat"), "Value=4\n");
}

TEST_F(ASCIIFileTest, ASCIIFile2ReadsButRefusesEveryWrite) {
    std::stringstream stream("Value=5\n");
    EXPECT_THROW(ASCIIFile2(&stream, false), std::exception);
    ASCIIFile2 file(&stream, true);
    int value = 0;
    EXPECT_TRUE(file.GetInt("Value", value));
    EXPECT_EQ(value, 5);
    ASCIIFile& base = file;
    const short s[1] = {1};
    const int i[1] = {1};
    const double r[1] = {1};
    auto expectUnsupported = [](const std::function<void()>& write) {
        EXPECT_THROW(write(), std::exception);
    };
    expectUnsupported([&] { base.PutTitel("T"); });
    expectUnsupported([&] { base.PutBOOL("K", true); });
    expectUnsupported([&] { base.PutShort("K", 1); });
    expectUnsupported([&] { base.PutShortArray("K", s, 1); });
    expectUnsupported([&] { base.PutInt("K", 1); });
    expectUnsupported([&] { base.PutIntArray("K", i, 1); });
    expectUnsupported([&] { base.PutReal("K", 1, 1); });
    expectUnsupported([&] { base.PutRealArray("K", r, 1, 1); });
    expectUnsupported([&] { base.PutDate("K", 1, 2, 3, 4, 5, 6); });
    expectUnsupported([&] { base.PutString("K", std::vector<String>{"a"}); });
    expectUnsupported([&] { base.PutString("K", String("a")); });
}

TEST_F(ASCIIFileTest, HostileInputNeitherCrashesNorHangs) {
    // A 10 MB line, a NUL byte, a title without its closing bracket, a file
    // ending inside a caret escape.
    std::string hostile = "Head=1\nBig=" + std::string(10u << 20, '7') + "\n[Open\n" +
                          std::string("Nul=a\0b\n", 8) + "Name=abc^";
    auto file = ASCIIFile::Get(String(Write("hostile.dat", hostile)), true);
    int big = 0;
    String name;
    ASSERT_TRUE(file->SkipLines(1));
    ASSERT_TRUE(file->GetInt("Big", big));
    EXPECT_EQ(big, 2147483647);
    EXPECT_FALSE(file->GetTitel("Open"));
    EXPECT_TRUE(file->SkipLines(1));
    ASSERT_TRUE(file->GetString("Nul", name));
    EXPECT_EQ(name, "a");  // a raw NUL ends the value, as in a C string
    ASSERT_TRUE(file->GetString("Name", name));
    EXPECT_EQ(name, "abc^");

    std::string junk;
    for (int i = 0; i < 70000; ++i) junk.push_back(static_cast<char>((i * 7919) >> 3));
    auto junkFile = ASCIIFile::Get(String(Write("junk.dat", junk)), true);
    String line;
    int lines = 0;
    while (junkFile->GetKeyString(line)) ++lines;
    EXPECT_GT(lines, 0);
    EXPECT_LE(junkFile->GetPercentDone(), 1.0f);
}

}  // namespace
