// INI files (toolkit Config), the configuration stores and their cascade.
#include "toolkit/config.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <boost/make_shared.hpp>
#include <chrono>
#include <map>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "nxbase/appconfig.h"
#include "nxbase/configuration.h"
#include "nxbase/logfile.h"
#include "test_util.h"

namespace {

using nxtest::ReadFile;
using nxtest::TempDir;
using nxtest::WriteFile;

// Keys of a group as "name=value" in file order.
std::vector<std::string> Keys(Config& config, const char* group) {
    config.SetGroup(group);
    std::vector<std::string> keys;
    for (std::uint16_t i = 0; i < config.GetKeyCount(); ++i) {
        keys.push_back(config.GetKeyName(i).str() + "=" + config.ReadKey(i).str());
    }
    return keys;
}

bool HavePython() {
    return std::system("python3 -c 'import configparser' >/dev/null 2>&1") == 0;
}

TEST(IniFile, AMissingFileReadsAsEmptyAndIsNotCreatedByReading) {
    TempDir dir;
    Config config(dir.File("absent.ini"));
    config.SetGroup("Group");
    EXPECT_EQ(config.ReadKey("Key", "fallback"), "fallback");
    EXPECT_EQ(config.GetKeyCount(), 0);
    EXPECT_EQ(config.GetKeyName(0), "");
    EXPECT_EQ(config.GetGroupCount(), 0);
    EXPECT_FALSE(std::filesystem::exists(dir.File("absent.ini")));
}

TEST(IniFile, NamesCompareWithoutCaseAndKeepTheCaseFirstWritten) {
    TempDir dir;
    Config config(dir.File("case.ini"));
    config.SetGroup("Colour Settings");
    ASSERT_TRUE(config.WriteKey("WhitePoint", "D50"));
    config.SetGroup("COLOUR SETTINGS");
    EXPECT_EQ(config.ReadKey("whitepoint"), "D50");
    ASSERT_TRUE(config.WriteKey("WHITEPOINT", "D65"));
    EXPECT_EQ(config.GetKeyCount(), 1);
    EXPECT_EQ(config.GetKeyName(0), "WhitePoint");
    EXPECT_EQ(config.GetGroupName(0), "Colour Settings");
    EXPECT_EQ(ReadFile(dir.File("case.ini")), "[Colour Settings]\nWhitePoint = D65\n");
    EXPECT_TRUE(config.DeleteGroup("colour settings"));
    EXPECT_FALSE(config.HasGroup("Colour Settings"));
}

TEST(IniFile, WritesKeepCommentsAndFileOrderAndAppendNewKeysToTheirGroup) {
    TempDir dir;
    const std::string path = dir.File("order.ini");
    WriteFile(path,
              "; K-Lume settings\n\n"
              "[Zeta]\n"
              "; the measuring device\n"
              "Device = i1Pro\n"
              "Aperture = 4.5\n\n"
              "# second group\n"
              "[Alpha]\n"
              "b = 2\n"
              "a = 1\n\n"
              "; end of file\n");
    Config config(path);
    config.SetGroup("Alpha");
    ASSERT_TRUE(config.WriteKey("c", "3"));
    config.SetGroup("Zeta");
    ASSERT_TRUE(config.WriteKey("Device", "i1Pro3"));
    ASSERT_TRUE(config.DeleteKey("Aperture"));
    // SimpleIni sets comments apart by a blank line; the layout is then stable.
    const std::string expected =
        "; K-Lume settings\n\n\n"
        "[Zeta]\n\n"
        "; the measuring device\n"
        "Device = i1Pro3\n\n\n"
        "# second group\n"
        "[Alpha]\n"
        "b = 2\n"
        "a = 1\n"
        "c = %\n\n"
        "; end of file\n";
    auto withC = [&](const char* c) {
        std::string text = expected;
        return text.replace(text.find('%'), 1, c);
    };
    EXPECT_EQ(ReadFile(path), withC("3"));
    config.SetGroup("alpha");
    ASSERT_TRUE(config.WriteKey("C", "4"));
    EXPECT_EQ(ReadFile(path), withC("4"));
    EXPECT_EQ(Keys(config, "Alpha"), (std::vector<std::string>{"b=2", "a=1", "c=4"}));
    std::vector<std::string> bulk;
    for (const auto& [key, value] : config.ReadGroup())
        bulk.push_back(key.str() + "=" + value.str());
    EXPECT_EQ(bulk, Keys(config, "Alpha"));
    EXPECT_EQ(config.GetGroupName(0), "Zeta");
    EXPECT_EQ(config.GetGroupName(1), "Alpha");
    EXPECT_EQ(config.GetGroupName(2), "");
}

TEST(IniFile, AFileOfCommentsOnlyKeepsThemAboveTheFirstGroup) {
    TempDir dir;
    const std::string path = dir.File("comments.ini");
    WriteFile(path, "; written by hand\n\n# nothing set yet\n");
    Config config(path);
    config.SetGroup("G");
    ASSERT_TRUE(config.WriteKey("k", "v"));
    EXPECT_EQ(ReadFile(path), "; written by hand\n\n# nothing set yet\n\n[G]\nk = v\n");
    ASSERT_TRUE(config.WriteKey("k", "w"));
    const std::string once = ReadFile(path);
    ASSERT_TRUE(config.WriteKey("k", "v"));
    ASSERT_TRUE(config.WriteKey("k", "w"));
    EXPECT_EQ(ReadFile(path), once);
    EXPECT_THAT(once, HasSubstr("; written by hand"));
    EXPECT_THAT(once, HasSubstr("# nothing set yet"));

    // A file from Windows: CRLF lines, a comment after the last key.
    WriteFile(path, "[G]\r\nk = v\r\n; last\r\n; words\r\n");
    ASSERT_TRUE(config.WriteKey("l", "w"));
    EXPECT_EQ(ReadFile(path), "[G]\nk = v\nl = w\n\n; last\n; words\n");
}

TEST(IniFile, AByteOrderMarkIsASignatureOnlyAtTheStartOfTheFile) {
    TempDir dir;
    const std::string path = dir.File("bom.ini");
    const std::string bom = "\xEF\xBB\xBF";
    WriteFile(path, bom + "[G]\nk = v\n");
    Config config(path);
    EXPECT_EQ(Keys(config, "G"), (std::vector<std::string>{"k=v"}));
    ASSERT_TRUE(config.WriteKey("l", "w"));
    EXPECT_EQ(ReadFile(path), bom + "[G]\nk = v\nl = w\n");

    // A key that begins with the mark's bytes keeps them, first in the file
    // or not.
    WriteFile(path, "\n" + bom + "key = 1\n");
    Config top(path);
    top.SetGroup("");
    EXPECT_EQ(top.ReadKey(bom + "key"), "1");
    ASSERT_TRUE(top.WriteKey("other", "2"));
    Config reread(path);
    reread.SetGroup("");
    EXPECT_EQ(reread.ReadKey(bom + "key"), "1");
    EXPECT_EQ(reread.ReadKey("key", "absent"), "absent");
}

TEST(IniFile, MalformedLinesAreSkippedAndTheRestIsRead) {
    TempDir dir;
    const std::string path = dir.File("bad.ini");
    WriteFile(path,
              "[Good]\n"
              "no equals sign here\n"
              "= value without a key\n"
              "Key = Value\r\n"
              "[Unclosed\n"
              "Other=  spaced value  \n"
              "[Second]\n"
              "x=1\n");
    Config config(path);
    EXPECT_EQ(Keys(config, "Good"), (std::vector<std::string>{"Key=Value", "Other=spaced value"}));
    EXPECT_EQ(Keys(config, "Second"), (std::vector<std::string>{"x=1"}));
    config.SetGroup("Second");
    ASSERT_TRUE(config.WriteKey("y", "2"));
    Config reread(path);
    EXPECT_EQ(Keys(reread, "Good"), (std::vector<std::string>{"Key=Value", "Other=spaced value"}));
    EXPECT_EQ(Keys(reread, "Second"), (std::vector<std::string>{"x=1", "y=2"}));
}

TEST(IniFile, ALinkedFileStaysALinkAndKeepsItsPermissions) {
    TempDir dir;
    const std::string real = dir.File("real.ini");
    const std::string link = dir.File("link.ini");
    WriteFile(real, "[G]\nOld = 1\n");
    ::chmod(real.c_str(), 0640);
    std::filesystem::create_symlink(real, link);
    Config config(link);
    config.SetGroup("G");
    ASSERT_TRUE(config.WriteKey("New", "2"));
    EXPECT_TRUE(std::filesystem::is_symlink(link));
    EXPECT_EQ(ReadFile(real), "[G]\nOld = 1\nNew = 2\n");
    struct stat st {};
    ASSERT_EQ(::stat(real.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0640u);
}

TEST(IniFile, RefusesNamesAndValuesThatWouldCorruptTheFile) {
    TempDir dir;
    const std::string path = dir.File("refuse.ini");
    Config config(path);
    config.SetGroup("G");
    ASSERT_TRUE(config.WriteKey("Key", "old"));
    const std::string before = ReadFile(path);
    Config::ErrorSink previous = Config::SetErrorSink([](const std::string&) {});
    EXPECT_FALSE(config.WriteKey("a=b", "x"));
    EXPECT_FALSE(config.WriteKey("", "x"));
    EXPECT_FALSE(config.WriteKey("[Injected]", "x"));
    EXPECT_FALSE(config.WriteKey("Key", "two\nlines"));
    config.SetGroup("Bad]Group");
    EXPECT_FALSE(config.WriteKey("Key", "x"));
    Config::SetErrorSink(previous);
    EXPECT_EQ(ReadFile(path), before);
}

TEST(IniFile, TwoProcessesWritingAThousandKeysEachLoseNone) {
    constexpr int kKeysPerProcess = 1000;
    // Two thousand fsyncs take half a minute on a virtual disk; the race is
    // the same on a memory file system.
    std::optional<nxtest::ScopedEnv> inMemory;
    if (::access("/dev/shm", W_OK) == 0) inMemory.emplace("TMPDIR", "/dev/shm");
    TempDir dir;
    const std::string path = dir.File("race.ini");
    // An object that read the file before the writers sees their keys at its next read.
    Config before(path);
    before.SetGroup("Shared");
    EXPECT_EQ(before.ReadKey("P1_0", "none"), "none");
    std::vector<pid_t> children;
    for (int p = 0; p < 2; ++p) {
        children.push_back(nxtest::Fork([&] {
            Config config(path);
            config.SetGroup(p == 0 ? "Shared" : "shared");
            bool ok = true;
            for (int i = 0; i < kKeysPerProcess; ++i) {
                std::string key = "P" + std::to_string(p) + "_" + std::to_string(i);
                ok = config.WriteKey(key, std::to_string(i)) && ok;
            }
            return ok ? 0 : 1;
        }));
    }
    for (pid_t pid : children) EXPECT_EQ(nxtest::WaitExit(pid), 0);
    EXPECT_EQ(before.ReadKey("P1_0", "none"), "0");
    Config config(path);
    config.SetGroup("Shared");
    ASSERT_EQ(config.GetKeyCount(), 2 * kKeysPerProcess);
    for (int p = 0; p < 2; ++p) {
        for (int i = 0; i < kKeysPerProcess; ++i) {
            std::string key = "P" + std::to_string(p) + "_" + std::to_string(i);
            ASSERT_EQ(config.ReadKey(key, "lost").str(), std::to_string(i)) << key;
        }
    }
}

TEST(IniFile, AWriterKilledMidLoopLeavesTheOldOrTheNewFile) {
    TempDir dir;
    const std::string path = dir.File("killed.ini");
    WriteFile(path, "[Loop]\nCounter = start\n");
    for (int round = 0; round < 5; ++round) {
        const pid_t pid = nxtest::Fork([&] {
            Config config(path);
            config.SetGroup("Loop");
            // Each write also grows a long value, so writes take a while.
            for (int i = 0;; ++i) {
                config.WriteKey("Counter", std::to_string(i));
                config.WriteKey("K" + std::to_string(i % 300), std::string(200, 'a' + i % 26));
            }
            return 0;
        });
        std::this_thread::sleep_for(std::chrono::milliseconds(30 + 17 * round));
        ::kill(pid, SIGKILL);
        nxtest::WaitExit(pid);

        // A complete file: every line a group header or a full key line, and
        // the whole file as this writer would have saved it.
        const std::string text = ReadFile(path);
        ASSERT_FALSE(text.empty());
        ASSERT_EQ(text.back(), '\n');
        Config config(path);
        config.SetGroup("Loop");
        const std::string counter = config.ReadKey("Counter", "").str();
        ASSERT_FALSE(counter.empty()) << "round " << round;
        std::string saved;
        for (std::uint16_t i = 0; i < config.GetKeyCount(); ++i) {
            const std::string name = config.GetKeyName(i).str(), value = config.ReadKey(i).str();
            EXPECT_TRUE(name == "Counter" || value.size() == 200u) << name;
            saved += name + " = " + value + "\n";
        }
        EXPECT_EQ(text, "[Loop]\n" + saved);
    }
}

TEST(IniFile, AFailedWriteKeepsTheOldFileAndReportsALine) {
    TempDir dir;
    const std::string path = dir.File("keep.ini");
    {
        Config config(path);
        config.SetGroup("G");
        ASSERT_TRUE(config.WriteKey("Key", "old"));
    }
    const std::string before = ReadFile(path);

    // A file-size limit makes the temporary file's write fail halfway.
    EXPECT_EQ(nxtest::InChild([&] {
                  nxtest::LimitFileSize(64);
                  std::vector<std::string> reported;
                  Config::SetErrorSink([&](const std::string& line) { reported.push_back(line); });
                  Config config(path);
                  config.SetGroup("G");
                  bool wrote = config.WriteKey("Key", std::string(500, 'x'));
                  // Nothing but the file and its lock is left in the directory.
                  bool cleaned = std::distance(std::filesystem::directory_iterator(dir.path()),
                                               std::filesystem::directory_iterator()) == 2;
                  bool logged =
                      reported.size() == 1 &&
                      reported[0].find("Cannot write configuration file \"" + path + "\"") == 0;
                  return !wrote && cleaned && logged ? 0 : 1;
              }),
              0);
    EXPECT_EQ(ReadFile(path), before);
}

// The store and its log line, with a directory the writer may not change.
TEST(IniConfigStore, AnUnwritableDirectoryKeepsTheOldFileAndLogsTheFailure) {
    TempDir dir(TempDir::Reach::kOtherUsers);
    const std::string path = dir.File("locked.ini");
    IniConfig store(path);
    store.WriteKey("G", "Key", "old");
    const std::string before = ReadFile(path);
    ::chmod(dir.path().c_str(), 0755);
    ::chmod((path + ".lock").c_str(), 0666);
    ::chmod(path.c_str(), 0444);  // a writable file would be rewritten in place

    EXPECT_EQ(nxtest::InChild([&] {
                  if (!nxtest::DropRoot()) return 2;  // root writes anywhere
                  ::chmod(dir.path().c_str(), 0555);
                  auto recorder = boost::make_shared<nxtest::RecordingLog>();
                  LogFile::Instance()->AddLogListener(recorder);
                  IniConfig child(path);
                  child.WriteKey("G", "Key", "new");
                  const std::string failure = "|Cannot write configuration file \"" + path;
                  const bool logged = std::any_of(
                      recorder->lines.begin(), recorder->lines.end(),
                      [&](const std::string& line) { return line.find(failure) != line.npos; });
                  return logged && child.ReadKey("G", "Key", "") == "old" ? 0 : 1;
              }),
              0);
    ::chmod(dir.path().c_str(), 0700);
    EXPECT_EQ(ReadFile(path), before);
}

TEST(IniFile, PythonConfigparserReadsOurFilesAndWeReadItsFiles) {
    if (!HavePython()) GTEST_SKIP() << "python3 with configparser is not installed";
    TempDir dir;
    const std::string ours = dir.File("ours.ini");
    {
        Config config(ours);
        config.SetGroup("LPM-Server");
        config.WriteKey("Path", "/opt/k-lume/bin/lumaserver");
        config.WriteKey("Version", "2.10");
        config.SetGroup("Colour Libraries");
        config.WriteKey("Library 1", "Pantone % \xE9t\xE9");
        config.WriteKey("Empty", "");
    }
    const std::string dump =
        "import configparser,sys\n"
        "c=configparser.ConfigParser(interpolation=None)\n"
        "c.optionxform=str\n"
        "c.read(sys.argv[1],encoding='latin-1')\n"
        "for s in c.sections():\n"
        "  for k,v in c.items(s): print(s+'|'+k+'|'+v)\n";
    WriteFile(dir.File("dump.py"), dump);
    std::string out =
        nxtest::ShellOutput("PYTHONIOENCODING=utf-8 python3 " + dir.File("dump.py") + " " + ours);
    EXPECT_EQ(out,
              "LPM-Server|Path|/opt/k-lume/bin/lumaserver\n"
              "LPM-Server|Version|2.10\n"
              "Colour Libraries|Library 1|Pantone % \xC3\xA9t\xC3\xA9\n"
              "Colour Libraries|Empty|\n");

    const std::string theirs = dir.File("theirs.ini");
    const std::string write =
        "import configparser,sys\n"
        "c=configparser.ConfigParser(interpolation=None)\n"
        "c.optionxform=str\n"
        "c['Gradus']={'Steps':'12','Mode':'Linear'}\n"
        "c['Licenses']={'Key One':'A-B-C'}\n"
        "c.write(open(sys.argv[1],'w'))\n";
    WriteFile(dir.File("write.py"), write);
    ASSERT_EQ(std::system(("python3 " + dir.File("write.py") + " " + theirs).c_str()), 0);
    Config config(theirs);
    EXPECT_EQ(Keys(config, "gradus"), (std::vector<std::string>{"Steps=12", "Mode=Linear"}));
    EXPECT_EQ(Keys(config, "Licenses"), (std::vector<std::string>{"Key One=A-B-C"}));
}

TEST(MemoryConfigStore, NamesAreCaseSensitiveAndReadingCreatesNothing) {
    MemoryConfig store;
    EXPECT_EQ(store.ReadKey("Group", "Key", "default"), "default");
    EXPECT_EQ(store.GetGroupCount(), 0u);
    store.WriteKey("Group", "Key", "v");
    store.WriteKey("group", "key", "w");
    EXPECT_EQ(store.ReadKey("Group", "Key", ""), "v");
    EXPECT_EQ(store.ReadKey("group", "key", ""), "w");
    EXPECT_EQ(store.ReadKey("Group", "key", "none"), "none");
    store.DeleteGroup("Group");
    EXPECT_EQ(store.ReadKey("Group", "Key", "gone"), "gone");
    EXPECT_EQ(store.ReadKey("group", "key", ""), "w");
}

class CascadeTest : public ::testing::Test {
  protected:
    void SetUp() override {
        AppConfig::CreateAppConfig(String(dir.path().string()), "app.ini");
        UserConfig::CreateUserConfig("Cascade Test", String(dir.path().string()), "");
    }
    void TearDown() override { NxSingleton::DeleteAllSingleton(); }
    TempDir dir;
};

TEST_F(CascadeTest, TheUserValueWinsOverTheApplicationValueOverTheDefault) {
    AppConfig::Instance()->WriteKey("Display", "Both", "app");
    UserConfig::Instance()->WriteKey("Display", "BOTH", "user");
    AppConfig::Instance()->WriteKey("Display", "AppOnly", "app");
    UserConfig::Instance()->WriteKey("Display", "UserOnly", "user");

    EXPECT_EQ(CascadedConfig::ReadKey("Display", "both", "default"), "user");
    EXPECT_EQ(CascadedConfig::ReadKey("Display", "AppOnly", "default"), "app");
    EXPECT_EQ(CascadedConfig::ReadKey("Display", "UserOnly", "default"), "user");
    EXPECT_EQ(CascadedConfig::ReadKey("Display", "Neither", "default"), "default");
    EXPECT_EQ(CascadedConfig::ReadKey("Other", "Both", ""), "");

    // One entry per name, the user's spelling and value, ordered by key.
    std::map<String, String> entries = CascadedConfig::GetEntries("display");
    std::vector<std::string> listed;
    for (const auto& [key, value] : entries) listed.push_back(key.str() + "=" + value.str());
    EXPECT_EQ(listed, (std::vector<std::string>{"AppOnly=app", "BOTH=user", "UserOnly=user"}));
}

TEST_F(CascadeTest, TheFactoryHandsOutIndependentStoresOnTheSingletonsFiles) {
    boost::shared_ptr<Configuration> app = ConfigurationFactory::CreateAppConfig();
    boost::shared_ptr<Configuration> user = ConfigurationFactory::CreateUserConfig();
    ASSERT_NE(app, ConfigurationFactory::CreateAppConfig());
    app->WriteKey("G", "K", "from app store");
    user->WriteKey("G", "K", "from user store");
    EXPECT_EQ(AppConfig::Instance()->ReadKey("G", "K"), "from app store");
    EXPECT_EQ(CascadedConfig::ReadKey("G", "K", ""), "from user store");
    user->DeleteGroup("g");
    EXPECT_EQ(CascadedConfig::ReadKey("G", "K", ""), "from app store");

    NxSingleton::DeleteAllSingleton();
    EXPECT_THROW(ConfigurationFactory::CreateAppConfig(), std::runtime_error);
    EXPECT_THROW(ConfigurationFactory::CreateUserConfig(), std::runtime_error);
    EXPECT_THROW(CascadedConfig::ReadKey("G", "K", ""), std::runtime_error);
}

}  // namespace
