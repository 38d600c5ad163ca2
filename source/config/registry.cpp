// RegistryEntry, RegistryHandler and the full-path functions on top of the
// SQLite store (registry_store.cpp), and the log options read from it.
#include "nxbase/registry.h"

#include <algorithm>
#include <cctype>
#include <mutex>

#include "nxbase/logfile.h"
#include "toolkit/string.h"

// An opened key: the hive and the normalised key path.
struct HKEY__ {
    nxbase::RegistryHive hive = nxbase::RegistryHive::CurrentUser;
    std::string path;
};

namespace nxbase {
namespace {

constexpr const char* kLocalMachine = "HKEY_LOCAL_MACHINE";
constexpr const char* kCurrentUser = "HKEY_CURRENT_USER";
constexpr long kInvalidHandle = 6;  // the Windows code for a handle that is no key

std::string Upper(std::string asText) {
    std::transform(asText.begin(), asText.end(), asText.begin(),
                   [](unsigned char c) { return static_cast<char>(std::toupper(c)); });
    return asText;
}

// The hive holds UTF-8; the applications' strings are ANSI (Windows-1252).
// Converting at this boundary gives an application back exactly the bytes it
// wrote, and tools that read the hive see one encoding.
std::string ToHive(const std::string& asAnsi) {
    return toolkit::Windows1252ToUtf8(asAnsi);
}

std::string FromHive(const std::string& asUtf8) {
    return toolkit::Utf8ToWindows1252(asUtf8);
}

bool StartsWith(const std::string& asText, const char* asPrefix) {
    return asText.compare(0, std::char_traits<char>::length(asPrefix), asPrefix) == 0;
}

// "<root>\<subKey>" (empty components vanish in the store).
std::string BelowRoot(const std::string& asSubKey) {
    return RegistryHandler::GetRootPath() + "\\" + asSubKey;
}

// The hive of a handle, or a store error for anything else.
RegistryHive RequireHive(HKEY axHKey) {
    std::optional<RegistryHive> hive = HiveOf(axHKey);
    if (!hive) {
        throw RegistryError(nxbase::RegistryErrorKind::kInvalidHandle, kInvalidHandle,
                            "Not a registry hive handle");
    }
    return *hive;
}

[[noreturn]] void ThrowTypeError(RegistryHive axHive, const std::string& asKey,
                                 const std::string& asName) {
    throw RegistryKeyTypeError("Registry value \"" + asName + "\" in " + HiveName(axHive) + "\\" +
                               asKey + " is not a string");
}

// The string values of an ANSI key path, names and data in ANSI.
std::map<std::string, std::string> StringValues(RegistryHive axHive, const std::string& asKey) {
    std::map<std::string, std::string> values;
    for (RegistryValue& value : RegistryStore::Values(axHive, ToHive(asKey))) {
        if (value.type != RegistryType::String) ThrowTypeError(axHive, asKey, FromHive(value.name));
        values.emplace(FromHive(value.name), FromHive(value.text));
    }
    return values;
}

// Full-path rule of the free functions: the exact hive name at the start,
// the key path after the first "\".
bool SplitFullPath(const std::string& asPath, RegistryHive& axHive, std::string& asKey) {
    if (StartsWith(asPath, kLocalMachine)) {
        axHive = RegistryHive::LocalMachine;
    } else if (StartsWith(asPath, kCurrentUser)) {
        axHive = RegistryHive::CurrentUser;
    } else {
        return false;
    }
    std::size_t separator = asPath.find('\\');
    asKey = separator == std::string::npos ? std::string() : asPath.substr(separator + 1);
    return true;
}

// Opening a full path creates its key. A hive that this process may not
// write (the machine's, for a user) is only read.
void CreateKeyForReading(RegistryHive axHive, const std::string& asKey) {
    if (RegistryStore::KeyExists(axHive, ToHive(asKey))) return;
    try {
        RegistryStore::CreateKey(axHive, ToHive(asKey));
    } catch (const RegistryError& error) {
        if (error.GetKind() != nxbase::RegistryErrorKind::kNotWritable) throw;
    }
}

}  // namespace

RegistryValue RegistryValue::Text(const std::string& asName, const std::string& asText) {
    RegistryValue value;
    value.name = asName;
    value.type = RegistryType::String;
    value.text = asText;
    return value;
}

RegistryValue RegistryValue::Dword(const std::string& asName, std::uint32_t alValue) {
    RegistryValue value;
    value.name = asName;
    value.type = RegistryType::Dword;
    value.dword = alValue;
    return value;
}

std::string RegistryValue::ToString() const {
    switch (type) {
        case RegistryType::Dword:
            return std::to_string(dword);
        case RegistryType::String:
        case RegistryType::ExpandString:
            return text;
        case RegistryType::MultiString: {
            std::string lines = text;
            while (!lines.empty() && lines.back() == '\0') lines.pop_back();
            std::replace(lines.begin(), lines.end(), '\0', '\n');
            return lines;
        }
        default: {
            static const char kDigits[] = "0123456789abcdef";
            std::string hex;
            for (unsigned char byte : text) {
                if (!hex.empty()) hex += ',';
                hex += kDigits[byte >> 4];
                hex += kDigits[byte & 15];
            }
            return hex;
        }
    }
}

std::optional<RegistryHive> HiveOf(HKEY axHKey) {
    if (axHKey == HKEY_CURRENT_USER) return RegistryHive::CurrentUser;
    if (axHKey == HKEY_LOCAL_MACHINE) return RegistryHive::LocalMachine;
    return std::nullopt;
}

bool SplitRegistryPath(const std::string& asPath, RegistryHive& axHive, std::string& asKeyPath) {
    std::size_t separator = asPath.find('\\');
    std::string hive = Upper(asPath.substr(0, separator));
    if (hive == kCurrentUser || hive == "HKCU") {
        axHive = RegistryHive::CurrentUser;
    } else if (hive == kLocalMachine || hive == "HKLM") {
        axHive = RegistryHive::LocalMachine;
    } else {
        return false;
    }
    asKeyPath = separator == std::string::npos ? std::string() : asPath.substr(separator + 1);
    return true;
}

}  // namespace nxbase

using nxbase::RegistryHive;
using nxbase::RegistryStore;
using nxbase::RegistryType;
using nxbase::RegistryValue;

// ---- RegistryEntry ----

RegistryEntry RegistryEntry::CreateAppRegistryEntry(const std::string& asSubKey,
                                                    const std::string& asKey) {
    if (RegistryHandler::GetRootPath().empty()) {
        throw std::logic_error("Registry root path not set");
    }
    return RegistryEntry(HKEY_LOCAL_MACHINE, nxbase::BelowRoot(asSubKey), asKey);
}

RegistryEntry RegistryEntry::CreateUserRegistryEntry(const std::string& asSubKey,
                                                     const std::string& asKey) {
    if (RegistryHandler::GetRootPath().empty()) {
        throw std::logic_error("Registry root path not set");
    }
    return RegistryEntry(HKEY_CURRENT_USER, nxbase::BelowRoot(asSubKey), asKey);
}

// ---- HKeyHolder ----

HKeyHolder::~HKeyHolder() {
    RegistryHandler::CloseKey(amHKey);
}

HKEY* HKeyHolder::GetHKeyPtr() {
    RegistryHandler::CloseKey(amHKey);
    amHKey = nullptr;
    return &amHKey;
}

// ---- RegistryHandler ----

std::string RegistryHandler::smRootPath;

void RegistryHandler::SetRootPath(const std::string& asRootPath) {
    smRootPath = asRootPath;
    if (!asRootPath.empty()) nxbase::InstallRegistryLogOptions();
}

const std::string& RegistryHandler::GetRootPath() {
    return smRootPath;
}

std::string RegistryHandler::GetRegistryEntry(const RegistryEntry& axEntry,
                                              const std::string& asDefault) {
    RegistryHive hive = nxbase::RequireHive(axEntry.GetHKey());
    std::optional<RegistryValue> value = RegistryStore::Read(
        hive, nxbase::ToHive(axEntry.GetSubKey()), nxbase::ToHive(axEntry.GetKey()));
    if (!value) return asDefault;
    if (value->type != RegistryType::String) {
        nxbase::ThrowTypeError(hive, axEntry.GetSubKey(), axEntry.GetKey());
    }
    return nxbase::FromHive(value->text);
}

std::string RegistryHandler::GetValue(HKEY axHKey, const std::string& asSubKey,
                                      const std::string& asKey, const std::string& asDefault) {
    return GetRegistryEntry(RegistryEntry(axHKey, nxbase::BelowRoot(asSubKey), asKey), asDefault);
}

std::string RegistryHandler::GetValue(const std::string& asSubKey, const std::string& asKey,
                                      const std::string& asDefault) {
    std::string machine = GetValue(HKEY_LOCAL_MACHINE, asSubKey, asKey, asDefault);
    return GetValue(HKEY_CURRENT_USER, asSubKey, asKey, machine);
}

std::string RegistryHandler::GetGlobalValue(HKEY axHKey, const std::string& asSubKey,
                                            const std::string& asKey,
                                            const std::string& asDefault) {
    return GetRegistryEntry(RegistryEntry(axHKey, asSubKey, asKey), asDefault);
}

bool RegistryHandler::AddRegistryEntry(const RegistryEntry& axEntry, const std::string& asValue) {
    RegistryHive hive = nxbase::RequireHive(axEntry.GetHKey());
    RegistryStore::Write(
        hive, nxbase::ToHive(axEntry.GetSubKey()),
        RegistryValue::Text(nxbase::ToHive(axEntry.GetKey()), nxbase::ToHive(asValue)));
    return true;
}

bool RegistryHandler::AddRegistryEntry(HKEY axHKey, const std::string& asSubKey,
                                       const std::string& asKey, const std::string& asValue) {
    return AddRegistryEntry(RegistryEntry(axHKey, nxbase::BelowRoot(asSubKey), asKey), asValue);
}

std::map<std::string, std::string> RegistryHandler::GetKeys(const RegistryEntry& axEntry) {
    return nxbase::StringValues(nxbase::RequireHive(axEntry.GetHKey()), axEntry.GetSubKey());
}

std::map<std::string, std::string> RegistryHandler::GetKeys(HKEY axHKey,
                                                            const std::string& asSubKey) {
    return GetKeys(RegistryEntry(axHKey, nxbase::BelowRoot(asSubKey), std::string()));
}

std::uint32_t RegistryHandler::GetKeyCount(const RegistryEntry& axEntry) {
    RegistryHive hive = nxbase::RequireHive(axEntry.GetHKey());
    return static_cast<std::uint32_t>(
        RegistryStore::Values(hive, nxbase::ToHive(axEntry.GetSubKey())).size());
}

std::uint32_t RegistryHandler::GetKeyCount(HKEY axHKey, const std::string& asSubKey) {
    return GetKeyCount(RegistryEntry(axHKey, nxbase::BelowRoot(asSubKey), std::string()));
}

bool RegistryHandler::DeleteKey(const RegistryEntry& axEntry) {
    if (!CanDeleteEntry(axEntry)) return false;
    HKeyHolder holder;
    if (!HasKey(axEntry, holder)) return false;
    return RegistryStore::DeleteValue(holder.GetHKey()->hive, holder.GetHKey()->path,
                                      nxbase::ToHive(axEntry.GetKey()));
}

bool RegistryHandler::DeleteKey(HKEY axHKey, const std::string& asKey) {
    return DeleteKey(RegistryEntry(axHKey, nxbase::BelowRoot(asKey), std::string()));
}

bool RegistryHandler::DeleteGroup(const RegistryEntry& axEntry) {
    if (!CanDeleteEntry(axEntry)) return false;
    HKeyHolder holder;
    if (!OpenKey(axEntry, holder)) return false;
    return RegistryStore::DeleteKey(holder.GetHKey()->hive, holder.GetHKey()->path);
}

bool RegistryHandler::DeleteGroup(HKEY axHKey, const std::string& asGroup) {
    return DeleteGroup(RegistryEntry(axHKey, nxbase::BelowRoot(asGroup), std::string()));
}

bool RegistryHandler::OpenKey(const RegistryEntry& axEntry, HKeyHolder& axHolder) {
    RegistryHive hive = nxbase::RequireHive(axEntry.GetHKey());
    std::string path = nxbase::ToHive(axEntry.GetSubKey());
    if (!RegistryStore::KeyExists(hive, path)) return false;
    *axHolder.GetHKeyPtr() = new HKEY__{hive, path};
    return true;
}

bool RegistryHandler::HasKey(const RegistryEntry& axEntry, HKeyHolder& axHolder) {
    if (!OpenKey(axEntry, axHolder)) return false;
    return RegistryStore::Read(axHolder.GetHKey()->hive, axHolder.GetHKey()->path,
                               nxbase::ToHive(axEntry.GetKey()))
        .has_value();
}

void RegistryHandler::CloseKey(HKEY axHKey) {
    if (axHKey != nullptr && !nxbase::HiveOf(axHKey)) delete axHKey;
}

bool RegistryHandler::CanDeleteEntry(const RegistryEntry& axEntry) {
    std::string subKey = nxbase::Upper(axEntry.GetSubKey());
    return subKey.find("SOFTWARE\\VELTRAMOND") != std::string::npos ||
           subKey.find("SOFTWARE\\K-LUME") != std::string::npos;
}

// ---- full paths ----

std::string GetHKeyLocalMachine() {
    return nxbase::kLocalMachine;
}
std::string GetHKeyCurrentUser() {
    return nxbase::kCurrentUser;
}

std::string NxReadRegistryKeyString(const std::string& asPath, const std::string& asValueName) {
    RegistryHive hive;
    std::string key;
    if (!nxbase::SplitFullPath(asPath, hive, key)) return std::string();
    std::optional<RegistryValue> value =
        RegistryStore::Read(hive, nxbase::ToHive(key), nxbase::ToHive(asValueName));
    if (!value) {
        nxbase::CreateKeyForReading(hive, key);
        return std::string();
    }
    if (value->type != RegistryType::String) nxbase::ThrowTypeError(hive, key, asValueName);
    return nxbase::FromHive(value->text);
}

std::map<std::string, std::string> NxReadRegistryKeysString(const std::string& asPath) {
    RegistryHive hive;
    std::string key;
    if (!nxbase::SplitFullPath(asPath, hive, key)) return {};
    nxbase::CreateKeyForReading(hive, key);
    return nxbase::StringValues(hive, key);
}

bool NxWriteRegistryKeyString(const std::string& asPath, const std::string& asValueName,
                              const std::string& asValue) {
    RegistryHive hive;
    std::string key;
    if (!nxbase::SplitFullPath(asPath, hive, key)) return false;
    RegistryStore::Write(hive, nxbase::ToHive(key),
                         RegistryValue::Text(nxbase::ToHive(asValueName), nxbase::ToHive(asValue)));
    return true;
}

// ---- log options ----

namespace nxbase {
namespace {

// Asks the provider installed before it for the log path and its options,
// and lays the registry's options over them.
class RegistryLogOptionProvider : public LogOptionProvider {
  public:
    void SetPrevious(std::shared_ptr<LogOptionProvider> axPrevious) {
        std::lock_guard<std::mutex> lock(amMutex);
        amPrevious = std::move(axPrevious);
    }
    std::string LogPath() override {
        std::shared_ptr<LogOptionProvider> previous = Previous();
        return previous ? previous->LogPath() : std::string();
    }
    std::map<std::string, std::string> LogOptions() override {
        std::shared_ptr<LogOptionProvider> previous = Previous();
        std::map<std::string, std::string> options;
        if (previous) options = previous->LogOptions();
        for (auto& [name, value] : ReadLogOptionsFromRegistry()) options[name] = std::move(value);
        return options;
    }

  private:
    std::shared_ptr<LogOptionProvider> Previous() {
        std::lock_guard<std::mutex> lock(amMutex);
        return amPrevious;
    }
    std::mutex amMutex;
    std::shared_ptr<LogOptionProvider> amPrevious;
};

}  // namespace

std::map<std::string, std::string> ReadLogOptionsFromRegistry() {
    std::map<std::string, std::string> options;
    const std::string& root = RegistryHandler::GetRootPath();
    if (root.empty()) return options;
    for (RegistryValue& value :
         RegistryStore::Values(RegistryHive::CurrentUser, ToHive(root) + "\\Log")) {
        options[FromHive(value.name)] = FromHive(value.ToString());
    }
    return options;
}

void InstallRegistryLogOptions() {
    static std::once_flag once;
    std::call_once(once, [] {
        auto provider = std::make_shared<RegistryLogOptionProvider>();
        provider->SetPrevious(SetLogOptionProvider(provider));
    });
}

}  // namespace nxbase
