// The process log of a test program in a directory of its own: test
// programs run as many processes at once, and each truncates its log file
// when it writes its first line.
#ifndef NXBASE_TESTS_LOG_TEST_UTIL_H_
#define NXBASE_TESTS_LOG_TEST_UTIL_H_

#include <gtest/gtest.h>

#include <memory>
#include <sstream>
#include <string>

#include "nxbase/logfile.h"
#include "test_util.h"

namespace nxtest {

// Sends the process log into a temporary directory for the whole test
// program and makes it there before the first test: the log is a process
// singleton and keeps its first path, so a fixture that points
// NXBASE_LOG_PATH elsewhere later (for the programs it starts) does not move
// it. `options` are log options on for the whole program ("A,B").
class LogDirEnvironment : public ::testing::Environment {
  public:
    explicit LogDirEnvironment(std::string options = "") : options_(std::move(options)) {}
    void SetUp() override {
        dir.reset(new TempDir());
        logPath.reset(new ScopedEnv("NXBASE_LOG_PATH", dir->File("log")));
        LogFile::Instance();
        std::istringstream names(options_);
        for (std::string name; std::getline(names, name, ',');)
            LogFile::Instance()->SetLogOption(name, true);
    }
    void TearDown() override {
        logPath.reset();
        dir.reset();
    }

  private:
    std::string options_;
    std::unique_ptr<TempDir> dir;
    std::unique_ptr<ScopedEnv> logPath;
};

// What the process log gained since this was made: a test's own lines, also
// when all tests of a program run in one process and share its log.
class LogSince {
  public:
    LogSince() : start_(Read().size()) {
        EXPECT_GT(start_, 0u) << "no process log at " << LogFile::Instance()->GetFileName();
    }
    std::string Text() const {
        const std::string all = Read();
        EXPECT_GE(all.size(), start_) << "the log was truncated";
        return all.size() < start_ ? all : all.substr(start_);
    }

  private:
    static std::string Read() { return ReadFile(LogFile::Instance()->GetFileName()); }
    std::size_t start_;
};

}  // namespace nxtest

#endif  // NXBASE_TESTS_LOG_TEST_UTIL_H_
