// The process log of a test program in a directory of its own: test
// programs run as many processes at once, and each truncates its log file
// when it writes its first line.
#ifndef NXBASE_TESTS_LOG_TEST_UTIL_H_
#define NXBASE_TESTS_LOG_TEST_UTIL_H_

#include <gtest/gtest.h>

#include <memory>

#include "test_util.h"

namespace nxtest {

// Sends the process log into a temporary directory for the whole test
// program (the log is a process singleton and keeps its first path).
class LogDirEnvironment : public ::testing::Environment {
  public:
    void SetUp() override {
        dir.reset(new TempDir());
        logPath.reset(new ScopedEnv("NXBASE_LOG_PATH", dir->File("log")));
    }
    void TearDown() override {
        logPath.reset();
        dir.reset();
    }

  private:
    std::unique_ptr<TempDir> dir;
    std::unique_ptr<ScopedEnv> logPath;
};

}  // namespace nxtest

#endif  // NXBASE_TESTS_LOG_TEST_UTIL_H_
