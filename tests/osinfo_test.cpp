#include "nxbase/osinfo.h"

#include <gtest/gtest.h>

#include <thread>

#include "test_util.h"

namespace {

class OSInfoTest : public ::testing::Test {
  protected:
    // The process log is made once, by the first test: all tests share its directory.
    static const nxtest::TempDir& Dir() {
        static nxtest::TempDir dir;
        return dir;
    }
    nxtest::ScopedEnv logPath{"NXBASE_LOG_PATH", Dir().path().string()};
    nxtest::ScopedEnv logOptions{"NXBASE_LOG_OPTIONS", "Info"};
};

TEST_F(OSInfoTest, AnswersWhatTheSystemReports) {
    // Linux 2.6 is long gone; anything newer than 99 would be a parse error.
    EXPECT_GE(OSInfo::GetOSMajorVersion(), 3u);
    EXPECT_LE(OSInfo::GetOSMajorVersion(), 99u);
    EXPECT_FALSE(OSInfo::IsWindowsNT());

    // A name a Windows peer can take: present and at most 64 characters.
    EXPECT_FALSE(OSInfo::GetMachineName().empty());
    EXPECT_LE(OSInfo::GetMachineName().size(), 64u);

    EXPECT_FALSE(OSInfo::GetUserName().empty());
    EXPECT_LE(OSInfo::GetUserName().size(), 255u);

    EXPECT_GE(OSInfo::GetCoreCount(), 1u);
    if (std::thread::hardware_concurrency() != 0) {
        EXPECT_EQ(OSInfo::GetCoreCount(), std::thread::hardware_concurrency());
    }
}

TEST_F(OSInfoTest, ARemoteSessionCountsAsTerminalServer) {
    {
        nxtest::ScopedEnv connection("SSH_CONNECTION", "");
        nxtest::ScopedEnv client("SSH_CLIENT", "");
        nxtest::ScopedEnv tty("SSH_TTY", "");
        EXPECT_FALSE(OSInfo::IsTerminalServer());
        nxtest::ScopedEnv remote("SSH_CONNECTION", "10.0.0.1 52000 10.0.0.2 22");
        EXPECT_TRUE(OSInfo::IsTerminalServer());
    }
    OSInfo::GetMachineName();
    std::string log;
    for (const auto& entry : std::filesystem::directory_iterator(Dir().path())) {
        log += nxtest::ReadFile(entry.path().string());
    }
    EXPECT_THAT(log, HasSubstr("TerminalServer: 0")) << log;
    EXPECT_THAT(log, HasSubstr("TerminalServer: 1")) << log;
    EXPECT_THAT(log, HasSubstr("Computername length: ")) << log;
}

}  // namespace
