// OSInfo on Linux: uname, gethostname, getlogin/getpwuid, sysconf and the
// SSH variables of a remote session.
#include "nxbase/osinfo.h"

#include <pwd.h>
#include <sys/utsname.h>
#include <unistd.h>

#include <charconv>
#include <cstdlib>
#include <cstring>

#include "nxbase/logfile.h"

namespace {

constexpr std::size_t kMachineNameLength = 64;  // the Windows buffer, and HOST_NAME_MAX
constexpr std::size_t kUserNameLength = 255;

bool IsSet(const char* asName) {
    const char* value = std::getenv(asName);
    return value != nullptr && *value != '\0';
}

std::string Limited(const char* asText, std::size_t alLength) {
    return std::string(asText, strnlen(asText, alLength));
}

}  // namespace

unsigned long OSInfo::GetOSMajorVersion() {
    utsname name;
    if (::uname(&name) != 0) return 0;
    unsigned long major = 0;
    const char* end = name.release + std::strlen(name.release);
    std::from_chars(name.release, end, major);
    return major;
}

bool OSInfo::IsWindowsNT() {
    return false;
}

bool OSInfo::IsTerminalServer() {
    bool remote = IsSet("SSH_CONNECTION") || IsSet("SSH_CLIENT") || IsSet("SSH_TTY");
    LogFile::WriteToLog(String(remote ? "TerminalServer: 1" : "TerminalServer: 0"), String("Info"));
    return remote;
}

std::string OSInfo::GetMachineName() {
    char buffer[kMachineNameLength + 1] = {};
    std::string name;
    if (::gethostname(buffer, kMachineNameLength) == 0) name = Limited(buffer, kMachineNameLength);
    LogFile::WriteToLog(String("Computername length: " + std::to_string(name.size())), String());
    return name;
}

std::string OSInfo::GetUserName() {
    char buffer[kUserNameLength + 1] = {};
    if (::getlogin_r(buffer, sizeof buffer) == 0 && buffer[0] != '\0') {
        return Limited(buffer, kUserNameLength);
    }
    long size = ::sysconf(_SC_GETPW_R_SIZE_MAX);
    std::string storage(size > 0 ? static_cast<std::size_t>(size) : 16384, '\0');
    passwd entry;
    passwd* found = nullptr;
    if (::getpwuid_r(::getuid(), &entry, storage.data(), storage.size(), &found) == 0 && found &&
        found->pw_name && *found->pw_name) {
        return Limited(found->pw_name, kUserNameLength);
    }
    for (const char* variable : {"LOGNAME", "USER"}) {
        if (IsSet(variable)) return Limited(std::getenv(variable), kUserNameLength);
    }
    return std::string();
}

unsigned int OSInfo::GetCoreCount() {
    long count = ::sysconf(_SC_NPROCESSORS_ONLN);
    return count > 0 ? static_cast<unsigned int>(count) : 1u;
}
