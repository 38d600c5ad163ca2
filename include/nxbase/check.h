// Assertions and fatal error reports. Reports go through the toolkit's
// UserInterface handler and the log; any thread may raise them. Error model:
// DisplayError, Check::POINTER (null) and Check::POET (code outside 0..1999)
// show an error box and then throw the int 1; an assertion shows a yes/no box
// and ends the process with exit code -1 on yes, otherwise returns.
#ifndef NXBASE_CHECK_H_
#define NXBASE_CHECK_H_

#include "nxbase/export.h"
#include "toolkit/string.h"

class NXBASE_EXPORT Check {
  public:
    // "Module: <m>   Date: <d>   Time: <t>   Line: <l>".
    static String CommonErrStr(const char* module, const char* date, const char* time, int line);
    // Reports "Internal ERROR!\n\nPOINTER -> NULL\n..." and throws 1 when `p` is null.
    static void POINTER(const void* p, const char* module, const char* date, const char* time,
                        int line);
    // Reports "Database error!..." and throws 1 unless 0 <= code <= 1999.
    static void POET(int code, const char* module, const char* date, const char* time, int line);

    // The assertion report: logs the text and a stack trace, asks "Quit
    // application?", exits with -1 on yes, returns otherwise.
    static void AssertFailed(const char* condition, const char* file, int line);
    // The same for a plain error message, headed "*****ERROR*****".
    static void ErrorReport(const char* message, const char* file, int line);
};

// Reports "Internal ERROR!\n\nErrNo. <n>\n..." and throws 1.
NXBASE_EXPORT void DisplayError(int errNo, const char* module, const char* date, const char* time,
                                int line);

#define NX_ASSERT(condition) \
    ((condition) ? static_cast<void>(0) : Check::AssertFailed(#condition, __FILE__, __LINE__))
// The same with the text the report shows instead of the condition's source.
#define NX_ASSERT_TEXT(condition, text) \
    ((condition) ? static_cast<void>(0) : Check::AssertFailed((text), __FILE__, __LINE__))
#define NX_ERROR(message) Check::ErrorReport((message), __FILE__, __LINE__)
#define NX_DISPLAY_ERROR(errNo) DisplayError((errNo), __FILE__, __DATE__, __TIME__, __LINE__)
#define NX_CHECK_POINTER(p) Check::POINTER((p), __FILE__, __DATE__, __TIME__, __LINE__)
#define NX_CHECK_POET(code) Check::POET((code), __FILE__, __DATE__, __TIME__, __LINE__)

#endif  // NXBASE_CHECK_H_
