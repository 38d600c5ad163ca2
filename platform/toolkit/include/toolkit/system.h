// Facts about the running process and the platform that the toolkit offered
// on Windows: local date and time, the temporary directory, the executable's
// file name, the calling thread's id. Any thread may call these.
#ifndef TOOLKIT_SYSTEM_H_
#define TOOLKIT_SYSTEM_H_

#include <cstddef>
#include <cstdint>
#include <string>

#include "nxbase/export.h"

// Local calendar date.
struct NXBASE_EXPORT Date {
    int day = 1;
    int month = 1;
    int year = 1970;
    static Date Today();
};

// Local time of day.
struct NXBASE_EXPORT Time {
    int hour = 0;
    int minute = 0;
    int second = 0;
    static Time Now();
};

namespace toolkit {

// Local date and time of one instant, read once so that date and time agree.
NXBASE_EXPORT void LocalNow(Date& date, Time& time);

// $TMPDIR if set and non-empty, else "/tmp"; without a trailing "/".
NXBASE_EXPORT std::string TempDirectory();

// Full path of the running executable ("/proc/self/exe"), or "" if unknown.
NXBASE_EXPORT std::string ExecutableFileName();

// The calling thread's operating-system id (gettid).
NXBASE_EXPORT std::uint32_t CurrentThreadId();
// The process's effective user id: whose peers it may talk to.
NXBASE_EXPORT std::uint32_t EffectiveUserId();

// The kernel's release text ("6.1.0-13-amd64"), "" when unknown.
NXBASE_EXPORT std::string KernelRelease();
// This machine's host name, "" when unknown.
NXBASE_EXPORT std::string HostName();
// The login name of the session, else the name of the process's user in the
// user database, else ""; `$LOGNAME` and `$USER` are the caller's last resort.
NXBASE_EXPORT std::string LoginName();
// Processors online, at least 1.
NXBASE_EXPORT unsigned int OnlineProcessorCount();
// The widest vector instruction set the processor offers of those the
// colour kernels are built for: AVX-512 (F, DQ and VL) with x86-64-v3, AVX2
// with the rest of x86-64-v3, or neither (any other processor); in order of
// width, so that a set the machine has compares <= its answer.
enum class VectorIsa { kBaseline, kAvx2, kAvx512 };
NXBASE_EXPORT VectorIsa MachineVectorIsa();
// How many fork() calls lie between the original process and this one (0
// there): an object that remembers the value it was made under sees by a
// change that its threads and locks are its parent's.
NXBASE_EXPORT unsigned ForkGeneration();
// The process's nice value (0 when it cannot be read), and setting a
// thread's (by its CurrentThreadId()); false when refused (raising a
// priority needs privileges).
NXBASE_EXPORT int ProcessNiceValue();
NXBASE_EXPORT bool SetThreadNiceValue(std::uint32_t threadId, int nice);
// Whether `fd` is a terminal, and its width in columns (0 when unknown).
NXBASE_EXPORT bool IsTerminal(int fd);
NXBASE_EXPORT std::size_t TerminalColumns(int fd);

// Creates `path` (and missing parents) with mode 0700 when it does not exist.
// Returns "" when `path` is then a directory (not a symlink), owned by the
// calling user and not open to group or others; otherwise a text that says
// why it is refused. An existing directory is never changed.
NXBASE_EXPORT std::string EnsurePrivateDirectory(const std::string& path);

// The calling user's private directory in the temporary directory,
// <temp>/k-lume-<uid>, made by EnsurePrivateDirectory. When that name is
// taken by someone else (or is not private), a fresh private directory
// <temp>/k-lume-<uid>-XXXXXX is made instead and `refusal` (if given) says why.
// "" only when no directory can be made at all.
NXBASE_EXPORT std::string UserTempDirectory(std::string* refusal = nullptr);

// Converts "\" to "/" so that paths written by Windows applications work.
NXBASE_EXPORT std::string NormalizePath(const std::string& path);

}  // namespace toolkit

#endif  // TOOLKIT_SYSTEM_H_
