// OSInfo answers questions about the machine and the session: kernel major
// version, host name, login name, processor count, remote session. Static
// functions without state; any thread may call them.
#ifndef NXBASE_OSINFO_H_
#define NXBASE_OSINFO_H_

#include <string>

#include "nxbase/export.h"

class NXBASE_EXPORT OSInfo {
  public:
    // The kernel's major version (uname release "6.1.0-..." gives 6); 0 when
    // unknown.
    static unsigned long GetOSMajorVersion();
    // Always false: this is not the Windows NT family.
    static bool IsWindowsNT();
    // True when the session is remote: SSH_CONNECTION, SSH_CLIENT or SSH_TTY is
    // set. Writes "TerminalServer: 1" (or 0) under the log key "Info".
    static bool IsTerminalServer();
    // The host name (at most 64 characters); "" when the system refuses it.
    // Writes "Computername length: <n>" to the log (empty key, always written).
    static std::string GetMachineName();
    // The login name of the session's user (getlogin), else the name of the
    // real user id, else $LOGNAME or $USER; at most 255 characters; "" when
    // none is known.
    static std::string GetUserName();
    // The number of online processors; at least 1.
    static unsigned int GetCoreCount();
};

#endif  // NXBASE_OSINFO_H_
