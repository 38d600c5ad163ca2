#include "nxbase/check.h"

#include <gtest/gtest.h>

#include "log_test_util.h"
#include "nxbase/logfile.h"
#include "test_util.h"
#include "toolkit/userinterface.h"

namespace {

// The assertion test reads the log back: a log of this process's own.
::testing::Environment* const kLogDir =
    ::testing::AddGlobalTestEnvironment(new nxtest::LogDirEnvironment);

TEST(Check, PoetAcceptsZeroTo1999AndReportsTheRest) {
    auto ui = std::make_shared<RecordingUserInterface>();
    ScopedUserInterface scope(ui);
    EXPECT_NO_THROW(Check::POET(0, "m", "d", "t", 1));
    EXPECT_NO_THROW(Check::POET(1999, "m", "d", "t", 1));
    EXPECT_TRUE(ui->Boxes().empty());
    for (int code : {-1, 2000}) {
        try {
            Check::POET(code, "db", "Sep  3 2019", "16:04:22", 12);
            ADD_FAILURE() << "no throw for " << code;
        } catch (int thrown) {
            EXPECT_EQ(thrown, 1);
        }
    }
    auto boxes = ui->Boxes();
    ASSERT_EQ(boxes.size(), 2u);
    EXPECT_EQ(boxes[1].kind, UserInterface::BoxKind::kError);
    EXPECT_EQ(boxes[1].text,
              "Database error!\n\nErrorCode: 2000\nModule: db   Date: Sep  3 2019   Time: "
              "16:04:22   Line: 12");
}

TEST(Check, PointerAndDisplayErrorReportAndThrowOne) {
    auto ui = std::make_shared<RecordingUserInterface>();
    ScopedUserInterface scope(ui);
    int value = 0;
    EXPECT_NO_THROW(Check::POINTER(&value, "m", "d", "t", 1));
    EXPECT_TRUE(ui->Boxes().empty());
    EXPECT_THROW(Check::POINTER(nullptr, "mymemblo", "d", "t", 5), int);
    EXPECT_THROW(DisplayError(42, "mod", "d", "t", 9), int);
    auto boxes = ui->Boxes();
    ASSERT_EQ(boxes.size(), 2u);
    EXPECT_EQ(boxes[0].text,
              "Internal ERROR!\n\nPOINTER -> NULL\nModule: mymemblo   Date: d   Time: t   Line: 5");
    EXPECT_EQ(boxes[1].text,
              "Internal ERROR!\n\nErrNo. 42\nModule: mod   Date: d   Time: t   Line: 9");
}

TEST(Check, DecliningToQuitReturnsWithTheAssertionLogged) {
    auto ui = std::make_shared<RecordingUserInterface>(false);
    ScopedUserInterface scope(ui);
    int amStart = 2, amEnd = 1;
    NX_ASSERT(amStart <= amEnd);
    auto boxes = ui->Boxes();
    ASSERT_EQ(boxes.size(), 1u);
    EXPECT_EQ(boxes[0].kind, UserInterface::BoxKind::kQuery);
    std::string expectedHead = "*****ASSERT*****\nCondition:\namStart <= amEnd\n failed\nfile: ";
    EXPECT_EQ(boxes[0].text.substr(0, expectedHead.size()), expectedHead);
    EXPECT_THAT(boxes[0].text, HasSubstr("\n\nQuit application?"));
    std::string log = nxtest::ReadFile(LogFile::Instance()->GetFileName());
    EXPECT_THAT(log, HasSubstr("amStart <= amEnd"));

    NX_ERROR("disk gone");
    EXPECT_EQ(ui->Boxes()[1].text.substr(0, 26), "*****ERROR*****\ndisk gone\n");
}

TEST(Check, TheDefaultHandlerLogsAnAssertionOnce) {
    // No handler installed: the library's default logs every box it shows.
    int uniqueCondition = 0;
    NX_ASSERT(uniqueCondition == 17);
    std::string log = nxtest::ReadFile(LogFile::Instance()->GetFileName());
    std::size_t count = 0;
    for (std::size_t at = log.find("uniqueCondition == 17"); at != std::string::npos;
         at = log.find("uniqueCondition == 17", at + 1)) {
        ++count;
    }
    EXPECT_EQ(count, 1u);
}

TEST(CheckDeathTest, AnsweringYesEndsTheProcessWithMinusOne) {
    EXPECT_EXIT(
        {
            ScopedUserInterface scope(std::make_shared<RecordingUserInterface>(true));
            NX_ASSERT(1 == 2);
        },
        ::testing::ExitedWithCode(255), "");
}

}  // namespace
