#include "nxbase/poapps.h"

#include <algorithm>
#include <cctype>
#include <cstdlib>
#include <stdexcept>

#include "nxbase/language.h"
#include "nxbase/logfile.h"
#include "nxbase/registry.h"
#include "nxbase/strhelp.h"
#include "toolkit/fileio.h"
#include "toolkit/process.h"

namespace {

constexpr const char* kServerId = "LumaServer";
constexpr const char* kServerKey = "Software\\K-Lume\\LumaServer";
constexpr const char* kPeersKey = "Software\\K-Lume\\ChromaLink\\Applications";
constexpr double kOldestServerVersion = 3.0;

bool FileExists(const std::string& asPath) {
    return toolkit::KindOf(asPath) != toolkit::FileKind::kNone;
}

// A version text as a number: digits with at most one ".", nothing else.
bool ParseVersion(const std::string& asText, double& axVersion) {
    if (asText.empty() || asText.find_first_not_of("0123456789.") != std::string::npos ||
        std::count(asText.begin(), asText.end(), '.') > 1 || asText == ".") {
        return false;
    }
    return StringHelpers::ParseDecimal(asText, axVersion);
}

}  // namespace

PostOfficeApplication::PostOfficeApplication(const std::string& asId,
                                             const std::string& asExecutablePath)
    : amId(asId) {
    std::size_t separator = asExecutablePath.find_last_of("/\\");
    if (separator == std::string::npos || separator + 1 == asExecutablePath.size()) {
        throw std::runtime_error("Illegal path: " + asExecutablePath);
    }
    amPath = asExecutablePath.substr(0, separator);
    amExecutable = asExecutablePath.substr(separator + 1);
    std::size_t dot = amExecutable.rfind('.');
    amName = dot == std::string::npos ? amExecutable : amExecutable.substr(0, dot);
}

PostOfficeApplication::PostOfficeApplication(const std::string& asId, const std::string& asName,
                                             const std::string& asExecutable,
                                             const std::string& asPath)
    : amId(asId), amName(asName), amExecutable(asExecutable), amPath(asPath) {}

std::string PostOfficeApplication::GetExecutableWithPath() const {
    return amPath + "/" + amExecutable;
}

namespace nxbase {

int WaitTimeoutSeconds() {
    const char* text = std::getenv("NXBASE_WAIT_TIMEOUT");
    if (text == nullptr || *text == '\0') return 0;
    long long seconds = 0;
    return StringHelpers::ParseInteger(text, seconds) && seconds > 0 && seconds < 86400
               ? static_cast<int>(seconds)
               : 0;
}

std::string ServerRegistrationHint() {
    return std::string("LumaServer is registered under HKEY_LOCAL_MACHINE\\") + kServerKey +
           " (Path, Executable, Version) in " + RegistryHiveFile(RegistryHive::LocalMachine) +
           "; `lumaserver --register` writes it";
}

std::chrono::seconds StartWaitLimit() {
    constexpr std::chrono::seconds kStartLimit(10);
    int timeout = WaitTimeoutSeconds();
    return timeout > 0 ? std::min(kStartLimit, std::chrono::seconds(timeout)) : kStartLimit;
}

}  // namespace nxbase

std::vector<std::string> PostOfficeApplication::StartLine(int alCountryCode) const {
    std::vector<std::string> line{GetExecutableWithPath()};
    if (amExecutable == "KXALWIN") line.push_back("/WM");
    line.push_back("-S");
    line.push_back("-LNG");
    line.push_back(std::to_string(alCountryCode));
    return line;
}

int PostOfficeApplication::Start(std::string& asError) const {
    int country =
        Language::IsInitialized() ? static_cast<int>(Language::Instance()->GetCountryCode()) : 1;
    return toolkit::SpawnProcess(StartLine(country), amPath, asError);
}

PostOfficeApplications::PostOfficeApplications(const std::string& asOwnAppName) {
    if (IsServerName(asOwnAppName)) return;
    AddServer();
    AddPeers();
}

bool PostOfficeApplications::IsServerName(const std::string& asAppName) {
    std::string upper(asAppName);
    std::transform(upper.begin(), upper.end(), upper.begin(),
                   [](unsigned char c) { return static_cast<char>(std::toupper(c)); });
    return upper == "LUMASERVER" || upper == "LPMSERV";
}

void PostOfficeApplications::AddServer() {
    LogFile::WriteToLog("Setup LumaServer", "Communication");
    std::string path = RegistryHandler::GetGlobalValue(HKEY_LOCAL_MACHINE, kServerKey, "Path");
    std::string executable =
        RegistryHandler::GetGlobalValue(HKEY_LOCAL_MACHINE, kServerKey, "Executable");
    std::string versionText =
        RegistryHandler::GetGlobalValue(HKEY_LOCAL_MACHINE, kServerKey, "Version");
    if (path.empty() || executable.empty()) throw std::runtime_error("LumaServer missing or old!");
    double version = 0;
    if (!ParseVersion(versionText, version)) {
        throw std::runtime_error("Unknown LumaServer version! Please reinstall LumaServer");
    }
    if (version < kOldestServerVersion) {
        throw std::runtime_error("Old LumaServer found! Please reinstall new LumaServer.");
    }
    amApplications[kServerId] =
        boost::shared_ptr<PostOfficeApplication>(new PostOfficeApplication(kServerId, executable));
}

void PostOfficeApplications::AddPeers() {
    RegistryEntry peers(HKEY_LOCAL_MACHINE, kPeersKey, std::string());
    for (const auto& [id, executablePath] : RegistryHandler::GetKeys(peers)) {
        if (id.empty() || executablePath.empty() || !FileExists(executablePath)) continue;
        amApplications[id] =
            boost::shared_ptr<PostOfficeApplication>(new PostOfficeApplication(id, executablePath));
    }
}

bool PostOfficeApplications::HasApplication(const std::string& asId) const {
    return amApplications.count(asId) > 0;
}

std::vector<std::string> PostOfficeApplications::GetApplications() const {
    std::vector<std::string> ids;
    for (const auto& entry : amApplications) ids.push_back(entry.first);
    return ids;
}

boost::shared_ptr<PostOfficeApplication> PostOfficeApplications::GetApplication(
    const std::string& asId) const {
    auto at = amApplications.find(asId);
    return at == amApplications.end() ? boost::shared_ptr<PostOfficeApplication>() : at->second;
}

PostOfficeApplication PostOfficeApplications::GetApplicationInfo(const std::string& asId) const {
    auto at = amApplications.find(asId);
    if (at == amApplications.end()) throw std::runtime_error("Unknown application: " + asId);
    return *at->second;
}
