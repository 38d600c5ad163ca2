// OSInfo on Linux: the toolkit's system queries and the SSH variables of a
// remote session.
#include "nxbase/osinfo.h"

#include <charconv>
#include <cstdlib>
#include <cstring>

#include "nxbase/logfile.h"
#include "toolkit/system.h"

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
    const std::string release = toolkit::KernelRelease();
    unsigned long major = 0;
    std::from_chars(release.data(), release.data() + release.size(), major);
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
    const std::string host = toolkit::HostName();
    std::string name = Limited(host.c_str(), kMachineNameLength);
    LogFile::WriteToLog(String("Computername length: " + std::to_string(name.size())), String());
    return name;
}

std::string OSInfo::GetUserName() {
    const std::string login = toolkit::LoginName();
    if (!login.empty()) return Limited(login.c_str(), kUserNameLength);
    for (const char* variable : {"LOGNAME", "USER"}) {
        if (IsSet(variable)) return Limited(std::getenv(variable), kUserNameLength);
    }
    return std::string();
}

unsigned int OSInfo::GetCoreCount() {
    return toolkit::OnlineProcessorCount();
}
