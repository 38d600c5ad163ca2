#include "nxbase/appconfig.h"

#include <cstdlib>
#include <map>
#include <memory>
#include <stdexcept>
#include <string>

#include "nxbase/check.h"
#include "nxbase/files.h"
#include "nxbase/logfile.h"
#include "toolkit/config.h"
#include "toolkit/system.h"

namespace {

bool EndsWithIgnoreCase(const String& text, const char* suffix) {
    String tail(suffix);
    if (text.Len() < tail.Len()) return false;
    return text.Copy(text.Len() - tail.Len()).EqualsIgnoreCaseAscii(tail);
}

String JoinPath(const String& directory, const String& name) {
    if (directory.IsEmpty()) return name;
    String path = directory;
    if (path.GetChar(path.Len() - 1) != '/' && path.GetChar(path.Len() - 1) != '\\') path += '/';
    return path + name;
}

// The application's option file: the executable's name with a four-character
// extension (".exe") replaced by ".ini", or ".ini" appended, in the per-user
// configuration directory.
std::string ApplicationOptionFile() {
    std::string directory = UserConfig::GetConfigDirectoryPath().str();
    std::string name = toolkit::ExecutableFileName();
    name = name.substr(name.find_last_of('/') + 1);
    if (directory.empty() || name.empty()) return std::string();
    std::size_t dot = name.rfind('.');
    if (dot != std::string::npos && dot + 4 == name.size()) name.erase(dot);
    return directory + "/" + name + ".ini";
}

// Gives the log the option "Path": key "Path" of group "Log" in the
// application's option file.
class OptionFileLogProvider : public nxbase::LogOptionProvider {
  public:
    std::string LogPath() override {
        std::string file = ApplicationOptionFile();
        if (file.empty()) return std::string();
        Config options{String(file)};
        options.SetGroup("Log");
        return options.ReadKey(kLogOptionPath).str();
    }
    std::map<std::string, std::string> LogOptions() override { return {}; }
};

// Installed when the library loads, before any log is made.
const bool kOptionFileProviderInstalled = [] {
    nxbase::SetLogOptionProvider(std::make_shared<OptionFileLogProvider>());
    return true;
}();

}  // namespace

// ------------------------------------------------------------------ AppName

AppName* AppName::smInstance = nullptr;

AppName::AppName(const String& asTitel, const String& asShortName, const String& asFullName,
                 const ApplicationVersion& axVersion)
    : NxSingleton("AppName"),
      amTitel(asTitel),
      amShortName(asShortName),
      amFullName(asFullName),
      amVersion(axVersion) {}

AppName::~AppName() {
    if (smInstance == this) smInstance = nullptr;
}

AppName* AppName::CreateAppName(const String& asTitel, const String& asShortName,
                                const String& asFullName, const ApplicationVersion& axVersion) {
    return nxbase::CreateOrReplaceSingleton(smInstance, asTitel, asShortName, asFullName,
                                            axVersion);
}

AppName* AppName::Instance() {
    return nxbase::StrictSingletonInstance(smInstance,
                                           "Please create the AppName-Singleton first !");
}

bool AppName::IsInitialized() {
    return smInstance != nullptr;
}

String AppName::GetVersionString() const {
    return amVersion.GetVersionString(2);
}

// ------------------------------------------------------------------- AppDir

AppDir* AppDir::smInstance = nullptr;

AppDir::AppDir(const String& asPath) : NxSingleton("AppDir"), amEntry(asPath) {}

AppDir::~AppDir() {
    if (smInstance == this) smInstance = nullptr;
}

AppDir* AppDir::CreateAppDir(const String& asPath) {
    LogFile::WriteToLog(String("Create AppDir: ") + asPath, String("Language"));
    return nxbase::CreateOrReplaceSingleton(smInstance, asPath);
}

AppDir* AppDir::Instance() {
    return nxbase::StrictSingletonInstance(smInstance,
                                           "Please create the AppDir-Singleton first !");
}

bool AppDir::IsInitialized() {
    return smInstance != nullptr;
}

void AppDir::SetAppDir(AppDir* pAppDir) {
    nxbase::InstallSingleton(smInstance, pAppDir);
}

DirEntry AppDir::BinDirEntry() const {
    return amEntry.GetPath();
}

DirEntry AppDir::RootDirEntry() const {
    return BinDirEntry().GetPath();
}

DirEntry AppDir::LngDirEntry() const {
    return RootDirEntry() + DirEntry("LNG");
}

DirEntry AppDir::HlpDirEntry() const {
    return RootDirEntry() + DirEntry("DOC");
}

DirEntry AppDir::TargetDisk() const {
    return BinDirEntry().GetMountPoint();
}

// ----------------------------------------------------------------- KLConfig

KLConfig::KLConfig(const String& asPath) : amPath(asPath), pConfig(new Config(asPath)) {}

KLConfig::~KLConfig() = default;

String KLConfig::ReadKey(const String& asGroup, const String& asKey) {
    return ReadKey(asGroup, asKey, String());
}

String KLConfig::ReadKey(const String& asGroup, const String& asKey, const String& asDefault) {
    pConfig->SetGroup(asGroup);
    return pConfig->ReadKey(asKey, asDefault);
}

bool KLConfig::WriteKey(const String& asGroup, const String& asKey, const String& asValue) {
    pConfig->SetGroup(asGroup);
    return pConfig->WriteKey(asKey, asValue);
}

std::uint16_t KLConfig::GetKeyCount(const String& asGroup) {
    pConfig->SetGroup(asGroup);
    return pConfig->GetKeyCount();
}

String KLConfig::GetKeyName(const String& asGroup, std::uint16_t alIndex) {
    pConfig->SetGroup(asGroup);
    return pConfig->GetKeyName(alIndex);
}

std::vector<std::pair<String, String>> KLConfig::GetEntries(const String& asGroup) {
    pConfig->SetGroup(asGroup);
    return pConfig->ReadGroup();
}

bool KLConfig::EmptyGroup(const String& asGroup) {
    return pConfig->DeleteGroup(asGroup);
}

// ---------------------------------------------------------------- AppConfig

AppConfig* AppConfig::smInstance = nullptr;

AppConfig::AppConfig(const String& asPath) : KLConfig(asPath), NxSingleton("AppConfig") {}

AppConfig::~AppConfig() {
    if (smInstance == this) smInstance = nullptr;
}

AppConfig* AppConfig::CreateAppConfig(const String& asDirectory, const String& asFileName) {
    String path = JoinPath(asDirectory, asFileName);
    if (DirEntry(asFileName).GetExtension().IsEmpty()) path += ".ini";
    LogFile::WriteToLog(String("App config file: \"") + path + "\"", String("Startup"));
    return nxbase::CreateOrReplaceSingleton(smInstance, path);
}

AppConfig* AppConfig::Instance() {
    return nxbase::StrictSingletonInstance<AppConfig, std::runtime_error>(smInstance,
                                                                          "No AppConfig instance");
}

bool AppConfig::IsInitialized() {
    return smInstance != nullptr;
}

void AppConfig::SetAppConfig(AppConfig* pAppConfig) {
    nxbase::InstallSingleton(smInstance, pAppConfig);
}

// --------------------------------------------------------------- UserConfig

UserConfig* UserConfig::smInstance = nullptr;

UserConfig::UserConfig(const String& asPath) : KLConfig(asPath), NxSingleton("UserConfig") {}

UserConfig::~UserConfig() {
    if (smInstance == this) smInstance = nullptr;
}

String UserConfig::GetConfigDirectoryPath() {
    const std::string base = toolkit::ConfigDirectory();
    if (base.empty()) return String();
    DirEntry dir(base + "/K-Lume");
    if (!dir.IsDirectory()) dir.MakeDirs();
    return dir.GetFull();
}

UserConfig* UserConfig::CreateUserConfig(const String& asAppName, const String& asDirectory,
                                         const String& asDefaultsPath) {
    String directory = asDirectory.IsEmpty() ? GetConfigDirectoryPath() : asDirectory;
    String name = MakeValidFileName(asAppName);
    if (!EndsWithIgnoreCase(name, ".ini")) name += ".ini";
    String path = JoinPath(directory, name);
    LogFile::WriteToLog(String("User config file: \"") + path + "\"", String("Startup"));
    if (!asDefaultsPath.IsEmpty()) DirEntry(asDefaultsPath).CopyToIfAbsent(DirEntry(path));
    return nxbase::CreateOrReplaceSingleton(smInstance, path);
}

UserConfig* UserConfig::Instance() {
    return nxbase::StrictSingletonInstance<UserConfig, std::runtime_error>(
        smInstance, "No UserConfig instance");
}

bool UserConfig::IsInitialized() {
    return smInstance != nullptr;
}

// -------------------------------------------------------------- LocalConfig

String LocalConfig::GetLocalConfigPath() {
    String name = MakeValidFileName(AppName::Instance()->GetShortName()) + ".ini";
    return JoinPath(UserConfig::GetConfigDirectoryPath(), name);
}

LocalConfig::LocalConfig() : KLConfig(GetLocalConfigPath()) {}

// ------------------------------------------------------------- VELTRAConfig

VELTRAConfig* VELTRAConfig::smInstance = nullptr;

VELTRAConfig::VELTRAConfig(const String& asPath)
    : NxSingleton("VELTRAConfig"), amPath(asPath), pConfig(new Config(asPath)) {}

VELTRAConfig::~VELTRAConfig() {
    if (smInstance == this) smInstance = nullptr;
}

VELTRAConfig* VELTRAConfig::CreateVELTRAConfig(const String& asPath) {
    return nxbase::CreateOrReplaceSingleton(smInstance, asPath);
}

VELTRAConfig* VELTRAConfig::Instance() {
    return nxbase::StrictSingletonInstance(smInstance,
                                           "Please create the VELTRAConfig-Singleton first !");
}

bool VELTRAConfig::IsInitialized() {
    return smInstance != nullptr;
}

String VELTRAConfig::GetGroupName(VELTRAiniGroup axGroup) {
    switch (axGroup) {
        case VELTRA_LPM_SERVER:
            return String("LPM-Server");
        case VELTRA_GRADUS:
            return String("Gradus");
        case VELTRA_CHROMALINK_APPLICATIONS:
            return String("ChromaLink Applications");
        case VELTRA_COMPATIBILITY:
            return String("Compatibility");
        case VELTRA_32BIT_APPLICATIONS:
            return String("32-Bit Applications");
        case VELTRA_COLOR_LIBRARIES:
            return String("Color Libraries");
        case VELTRA_LICENSES:
            return String("Licenses");
    }
    Check::AssertFailed("\"Unknown VELTRAConfig group name\" == 0", __FILE__, __LINE__);
    return String();
}

String VELTRAConfig::ReadVELTRAKey(VELTRAiniGroup axGroup, const String& asKey) {
    return ReadVELTRAKey(axGroup, asKey, String());
}

String VELTRAConfig::ReadVELTRAKey(VELTRAiniGroup axGroup, const String& asKey,
                                   const String& asDefault) {
    pConfig->SetGroup(GetGroupName(axGroup));
    return pConfig->ReadKey(asKey, asDefault);
}

bool VELTRAConfig::WriteVELTRAKey(VELTRAiniGroup axGroup, const String& asKey,
                                  const String& asValue) {
    pConfig->SetGroup(GetGroupName(axGroup));
    return pConfig->WriteKey(asKey, asValue);
}

String VELTRAConfig::ReadChromaLinkApplication(int alIndex) {
    pConfig->SetGroup(GetGroupName(VELTRA_CHROMALINK_APPLICATIONS));
    if (alIndex < 0 || alIndex >= static_cast<int>(pConfig->GetKeyCount())) return String();
    return pConfig->GetKeyName(static_cast<std::uint16_t>(alIndex));
}
