#include "nxbase/check.h"

#include <cstdio>
#include <cstdlib>

#include "nxbase/logfile.h"
#include "toolkit/userinterface.h"

namespace {

constexpr int kFirstDatabaseError = 2000;

String Decimal(long value) {
    return String::CreateFromInt(value);
}

// Shows a report box and unwinds the caller with the int 1.
[[noreturn]] void ReportAndThrow(const String& text) {
    UserInterface::Current()->ErrorBox(text.str());
    throw 1;
}

// Set while a report that is already in the log asks its question, so that
// the default handler does not write the same text a second time.
thread_local bool tReportInLog = false;

// The yes/no part of the assertion and error reports.
void AskToQuit(const String& text) {
    LogFile::WriteToLog(text, String());
    LogFile::Instance()->WriteStackTrace();
    tReportInLog = true;
    bool quit = UserInterface::Current()->QueryBox((text + "\n\nQuit application?").str(), false);
    tReportInLog = false;
    if (quit) std::_Exit(-1);
}

// The default box handler of the library: the text goes to the log (empty
// key, so it is always written) and to stderr; queries take the default.
class LogAndStderrUserInterface : public StderrUserInterface {
  public:
    void ErrorBox(const std::string& text) override {
        LogFile::WriteToLog(String(text), String());
        StderrUserInterface::ErrorBox(text);
    }
    void InfoBox(const std::string& text) override {
        LogFile::WriteToLog(String(text), String());
        StderrUserInterface::InfoBox(text);
    }
    bool QueryBox(const std::string& text, bool defaultAnswer) override {
        if (!tReportInLog) LogFile::WriteToLog(String(text), String());
        return StderrUserInterface::QueryBox(text, defaultAnswer);
    }
};

// Replaces the toolkit's bare stderr handler when the library is loaded.
const bool kDefaultHandlerInstalled = [] {
    auto current = UserInterface::Current();
    const UserInterface& handler = *current;
    if (dynamic_cast<LogAndStderrUserInterface*>(current.get()) == nullptr &&
        typeid(handler) == typeid(StderrUserInterface)) {
        UserInterface::Install(std::make_shared<LogAndStderrUserInterface>());
    }
    return true;
}();

}  // namespace

String Check::CommonErrStr(const char* module, const char* date, const char* time, int line) {
    return String("Module: ") + String(module) + "   Date: " + String(date) +
           "   Time: " + String(time) + "   Line: " + Decimal(line);
}

void Check::POINTER(const void* p, const char* module, const char* date, const char* time,
                    int line) {
    if (p != nullptr) return;
    ReportAndThrow(String("Internal ERROR!\n\nPOINTER -> NULL\n") +
                   CommonErrStr(module, date, time, line));
}

void Check::POET(int code, const char* module, const char* date, const char* time, int line) {
    if (code >= 0 && code < kFirstDatabaseError) return;
    ReportAndThrow(String("Database error!\n\n") + "ErrorCode: " + Decimal(code) + "\n" +
                   CommonErrStr(module, date, time, line));
}

void Check::AssertFailed(const char* condition, const char* file, int line) {
    AskToQuit(String("*****ASSERT*****\nCondition:\n") + String(condition) +
              "\n failed\nfile: " + String(file) + "\nline: " + Decimal(line));
}

void Check::ErrorReport(const char* message, const char* file, int line) {
    AskToQuit(String("*****ERROR*****\n") + String(message) + "\nfile: " + String(file) +
              "\nline: " + Decimal(line));
}

void DisplayError(int errNo, const char* module, const char* date, const char* time, int line) {
    ReportAndThrow(String("Internal ERROR!\n\n") + "ErrNo. " + Decimal(errNo) + "\n" +
                   Check::CommonErrStr(module, date, time, line));
}
