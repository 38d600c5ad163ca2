#include "nxbase/logfile.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <boost/make_shared.hpp>
#include <map>
#include <regex>
#include <set>
#include <thread>

#include "test_util.h"

namespace {

// "05.03.2009 - 07:04:09" and a tab precede every text.
constexpr std::size_t kStampWidth = 22;

std::vector<std::string> Texts(const std::string& path) {
    std::vector<std::string> texts;
    for (const std::string& line : nxtest::ReadLines(path)) {
        texts.push_back(line.size() >= kStampWidth ? line.substr(kStampWidth) : "<short>" + line);
    }
    return texts;
}

class LogFileTest : public ::testing::Test {
  protected:
    nxtest::TempDir dir;
    nxtest::ScopedEnv path{"NXBASE_LOG_PATH", dir.path().string()};
    nxtest::ScopedEnv options{"NXBASE_LOG_OPTIONS", ""};
    nxtest::ScopedEnv userConfig{"XDG_CONFIG_HOME", dir.File("config")};
    std::string File(const char* name) { return dir.File(std::string(name) + ".log"); }
};

TEST_F(LogFileTest, FirstWriteTruncatesAndLaterWritesAppend) {
    nxtest::WriteFile(File("trunc"), "old content of an earlier run\n");
    LogFile log("trunc");
    EXPECT_EQ(log.GetFileName(), File("trunc"));
    log.WriteLog("second", "");
    EXPECT_EQ(Texts(File("trunc")), (std::vector<std::string>{"Starting log", "second"}));

    std::string line = nxtest::ReadLines(File("trunc"))[0];
    EXPECT_TRUE(
        std::regex_match(line, std::regex(R"(\d\d\.\d\d\.\d{4} - \d\d:\d\d:\d\d\tStarting log)")))
        << line;
}

TEST_F(LogFileTest, PathOptionNamesTheFileOrItsDirectory) {
    std::string file = dir.File("explicit-name.txt");
    {
        nxtest::ScopedEnv explicitPath("NXBASE_LOG_PATH", file);
        LogFile log("ignored");
        EXPECT_EQ(log.GetFileName(), file);
    }
    {
        nxtest::ScopedEnv noPath("NXBASE_LOG_PATH", "");
        nxtest::ScopedEnv tmp("TMPDIR", dir.path().string());
        LogFile log("");
        // Without a name the executable's base name is used, in the user's
        // private directory of the temporary directory.
        std::string privateDir = dir.File("k-lume-" + std::to_string(::geteuid()));
        EXPECT_EQ(log.GetFileName(), privateDir + "/logfile_test.log");
        EXPECT_EQ(std::filesystem::status(privateDir).permissions(),
                  std::filesystem::perms::owner_all);
    }
    {
        // "Path" in group "Log" of the application's option file in the
        // per-user configuration directory.
        nxtest::ScopedEnv noPath("NXBASE_LOG_PATH", "");
        std::filesystem::create_directories(dir.File("config/K-Lume"));
        nxtest::WriteFile(dir.File("config/K-Lume/logfile_test.ini"),
                          "[Other]\nPath=/nowhere\n[log]\npath=" + dir.File("from-ini.txt") + "\n");
        LogFile log("ignored");
        EXPECT_EQ(log.GetFileName(), dir.File("from-ini.txt"));
    }
}

TEST_F(LogFileTest, KeysAreAnnouncedOnceAndDisabledKeysAreNotWritten) {
    LogFile log("keys");
    log.SetLogOption("Keys", true);
    log.SetLogOption("Shown", true);
    log.WriteLog("hidden line", "Hidden");
    log.WriteLog("hidden again", "Hidden");
    log.WriteLog("shown line", "Shown");
    log.WriteLog("always", "");
    // "Keys" itself is announced the first time it is used, ahead of the
    // announcement that used it.
    EXPECT_EQ(Texts(File("keys")),
              (std::vector<std::string>{"Starting log", "# - Available key: Keys",
                                        "# - Available key: Hidden", "# - Available key: Shown",
                                        "shown line", "always"}));
    std::set<std::string> available = log.GetAvailableLogOptions();
    EXPECT_TRUE(available.count("Hidden") && available.count("Shown") && available.count("Keys"));
}

TEST_F(LogFileTest, NestedAutoLogBlocksIndentBetweenTheirLines) {
    LogFile log("auto");
    log.SetLogOption("Blocks", true);
    {
        AutoLog a(&log, "a", "Blocks");
        AutoLog b(&log, "b", "Blocks");
        b.Log("inside");
        AutoLog off(&log, "never", "Off");
        off.Log("not written");
    }
    EXPECT_EQ(AutoLog::GetIndent(), 0);
    EXPECT_EQ(Texts(File("auto")), (std::vector<std::string>{"Starting log", "|->a", "  |->b",
                                                             "    inside", "  |<-b", "|<-a"}));
}

TEST_F(LogFileTest, RestartsAfterLineLimitUnlessUnlimited) {
    LogFile log("limit");
    // "Starting log" is line 1; the counter passes the limit after this loop.
    for (std::uint32_t i = 2; i <= LogFile::kLineLimit + 1; ++i) log.WriteLog("x", "");
    log.WriteLog("still appended", "");  // sees the count above the limit
    EXPECT_EQ(nxtest::ReadLines(File("limit")).size(), LogFile::kLineLimit + 2);
    log.WriteLog("fresh", "");
    std::vector<std::string> lines = nxtest::ReadLines(File("limit"));
    ASSERT_EQ(lines.size(), 2u);
    EXPECT_EQ(lines[0], "Log restarted (LogedLines: 50001");
    EXPECT_EQ(lines[1].substr(kStampWidth), "fresh");

    // The note survives a restart whose next text is "APPEND" (no truncation).
    LogFile appended("appended");
    for (std::uint32_t i = 2; i <= LogFile::kLineLimit + 2; ++i) appended.WriteLog("x", "");
    appended.WriteLog("APPEND", "");
    lines = nxtest::ReadLines(File("appended"));
    ASSERT_EQ(lines.size(), LogFile::kLineLimit + 4);
    EXPECT_EQ(lines[lines.size() - 2], "Log restarted (LogedLines: 50001");
    EXPECT_EQ(lines.back().substr(kStampWidth), "APPEND");

    LogFile unlimited("unlimited");
    unlimited.SetLogOption("Unlimited", true);
    for (std::uint32_t i = 0; i < LogFile::kLineLimit + 10; ++i) unlimited.WriteLog("x", "");
    EXPECT_EQ(nxtest::ReadLines(File("unlimited")).size(), LogFile::kLineLimit + 11);
}

TEST_F(LogFileTest, ThreadIdPrefixAndListenersAndOptionsFromEnvironment) {
    nxtest::ScopedEnv env("NXBASE_LOG_OPTIONS", "ThreadId,Extra");
    LogFile log("tid");
    auto listener = boost::make_shared<nxtest::RecordingLog>();
    log.AddLogListener(listener);
    log.WriteLog("hello", "Extra");
    log.RemoveLogListener(listener);
    log.WriteLog("after removal", "Extra");
    std::vector<std::string> texts = Texts(File("tid"));
    ASSERT_EQ(texts.size(), 3u);
    EXPECT_TRUE(std::regex_match(texts[1], std::regex(R"(ThreadId: \d+\thello)"))) << texts[1];
    EXPECT_EQ(listener->lines, std::vector<std::string>{"Extra|hello"});
}

TEST_F(LogFileTest, UnwritableFileLosesLinesWithoutThrowing) {
    nxtest::ScopedEnv badPath("NXBASE_LOG_PATH", dir.File("missing-dir/sub/log.txt"));
    LogFile log("bad");
    EXPECT_NO_THROW(log.WriteLog("lost", ""));
    EXPECT_FALSE(std::filesystem::exists(dir.File("missing-dir")));
}

TEST_F(LogFileTest, ForeignOrOpenDirectoriesAndPlantedSymlinksAreNotUsed) {
    nxtest::ScopedEnv noPath("NXBASE_LOG_PATH", "");
    nxtest::ScopedEnv tmp("TMPDIR", dir.path().string());
    std::string usual = dir.File("k-lume-" + std::to_string(::geteuid()));
    std::filesystem::create_directory(usual);
    ::chmod(usual.c_str(), 0777);  // open to everyone: refused
    {
        LogFile log("open");
        EXPECT_EQ(log.GetFileName().rfind(usual + "-", 0), 0u) << log.GetFileName();
        EXPECT_FALSE(std::filesystem::exists(usual + "/open.log"));
    }
    if (::geteuid() == 0) {
        ::chmod(usual.c_str(), 0700);
        ASSERT_EQ(::chown(usual.c_str(), 65534, 65534), 0);  // someone else's
        LogFile log("foreign");
        EXPECT_EQ(log.GetFileName().rfind(usual + "-", 0), 0u) << log.GetFileName();
        EXPECT_FALSE(std::filesystem::exists(usual + "/foreign.log"));
    }
    // A symlink where the log file should be is never followed.
    std::string target = dir.File("victim");
    nxtest::WriteFile(target, "precious\n");
    std::filesystem::create_symlink(target, dir.File("planted.log"));
    nxtest::ScopedEnv path("NXBASE_LOG_PATH", dir.path().string());
    LogFile log("planted");
    log.WriteLog("line", "");
    EXPECT_EQ(nxtest::ReadFile(target), "precious\n");
}

TEST_F(LogFileTest, AShortWriteCountsAsFailedAndListenersHearOfIt) {
    // A child process with a tiny file-size limit: the line is cut short.
    const int told = nxtest::InChild([] {
        LogFile log("full");
        auto listener = boost::make_shared<nxtest::RecordingLog>();
        log.AddLogListener(listener);
        nxtest::LimitFileSize(200);
        log.WriteLog(std::string(400, 'y').c_str(), "");
        return listener->lines.size() == 2 &&
                       listener->lines[1].find("!!! Log write failed") != std::string::npos
                   ? 0
                   : 1;
    });
    EXPECT_EQ(told, 0) << "the listeners were not told of the failed write";
}

TEST_F(LogFileTest, StackTraceIsWrittenOnlyWhenEnabled) {
    LogFile log("stack");
    log.WriteStackTrace();
    EXPECT_EQ(Texts(File("stack")).size(), 1u);
    log.SetLogOption("StackTrace", true);
    log.WriteStackTrace();
    log.SetLogOption("AvailableStack", true);
    log.LogAvailableStack("here");
    std::string all = nxtest::ReadFile(File("stack"));
    EXPECT_THAT(all, HasSubstr("\nStackTrace:\n"));
    EXPECT_TRUE(std::regex_search(all, std::regex(R"(AvailableStack: here \d+ bytes)")));
}

// Eight threads and a second process append to one file: every line arrives
// whole, exactly once.
TEST_F(LogFileTest, ThreadsAndProcessesLoseNoLineAndTearNone) {
    constexpr int kThreads = 8;
    constexpr int kLinesPerWriter = 10000;
    LogFile log("shared");
    log.SetLogOption("Unlimited", true);

    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        // The child inherits a log whose first write is done: it appends.
        for (int i = 0; i < kLinesPerWriter; ++i) {
            log.WriteLog(String("writer P line ") + String::CreateFromInt(i), "");
        }
        _exit(0);
    }
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([&log, t] {
            for (int i = 0; i < kLinesPerWriter; ++i) {
                log.WriteLog(String("writer ") + String::CreateFromInt(t) + " line " +
                                 String::CreateFromInt(i),
                             "");
            }
        });
    }
    for (auto& thread : threads) thread.join();
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    ASSERT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);

    std::map<std::string, std::set<int>> seen;
    std::regex shape(R"(\d\d\.\d\d\.\d{4} - \d\d:\d\d:\d\d\twriter (\w) line (\d+))");
    std::size_t malformed = 0;
    for (const std::string& line : nxtest::ReadLines(File("shared"))) {
        std::smatch match;
        if (std::regex_match(line, match, shape)) {
            seen[match[1]].insert(std::stoi(match[2]));
        } else if (line.find("Starting log") == std::string::npos) {
            ++malformed;
        }
    }
    EXPECT_EQ(malformed, 0u);
    ASSERT_EQ(seen.size(), static_cast<std::size_t>(kThreads + 1));
    for (const auto& [writer, lines] : seen) {
        EXPECT_EQ(lines.size(), static_cast<std::size_t>(kLinesPerWriter)) << "writer " << writer;
    }
}

TEST(LogFileInstance, IsCreatedOnceAndShared) {
    boost::shared_ptr<LogFile> first = LogFile::Instance();
    LogFile::CreateLogFile("ignored-second-name");
    EXPECT_EQ(first, LogFile::Instance());
    EXPECT_THAT(first->GetFileName(), HasSubstr(".log"));
}

TEST(LogFileInstance, CachedOptionFollowsEveryChangeAlsoUnderConcurrentReaders) {
    boost::shared_ptr<LogFile> log = LogFile::Instance();
    nxbase::CachedLogOption cached("CachedKey");
    EXPECT_FALSE(cached.Enabled());
    log->SetLogOption("CachedKey", true);
    EXPECT_TRUE(cached.Enabled());
    log->SetLogOption("OtherKey", true);  // another key's change keeps the answer
    EXPECT_TRUE(cached.Enabled());
    log->SetLogOption("CachedKey", false);
    EXPECT_FALSE(cached.Enabled());

    // Readers racing a writer: once the writer has finished, every reader
    // sees its last setting.
    std::atomic<bool> done{false};
    std::vector<std::thread> readers;
    for (int r = 0; r < 4; ++r) {
        readers.emplace_back([&] {
            while (!done.load()) cached.Enabled();
        });
    }
    for (int i = 0; i < 2000; ++i) log->SetLogOption("CachedKey", i % 2 == 0);
    done = true;
    for (auto& reader : readers) reader.join();
    EXPECT_FALSE(cached.Enabled());  // the last write (i = 1999) disabled it
}

}  // namespace
