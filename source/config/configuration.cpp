#include "nxbase/configuration.h"

#include <boost/make_shared.hpp>

#include "nxbase/appconfig.h"
#include "nxbase/logfile.h"
#include "toolkit/config.h"

namespace {

// Failed INI writes go to the process log with the empty key, which always
// writes.
const bool kSinkInstalled = [] {
    Config::SetErrorSink(
        [](const std::string& line) { LogFile::WriteToLog(String(line), String()); });
    return true;
}();

}  // namespace

Configuration::~Configuration() = default;

// ---------------------------------------------------------------- IniConfig

IniConfig::IniConfig(const std::string& path)
    : amPath(path), amConfig(boost::make_shared<Config>(String(path))) {
    (void)kSinkInstalled;
}

IniConfig::~IniConfig() = default;

void IniConfig::DeleteGroup(const std::string& group) {
    amConfig->DeleteGroup(String(group));
}

std::string IniConfig::ReadKey(const std::string& group, const std::string& key,
                               const std::string& defaultValue) {
    amConfig->SetGroup(String(group));
    return amConfig->ReadKey(String(key), String(defaultValue)).str();
}

void IniConfig::WriteKey(const std::string& group, const std::string& key,
                         const std::string& value) {
    amConfig->SetGroup(String(group));
    amConfig->WriteKey(String(key), String(value));
}

// ------------------------------------------------------------- MemoryConfig

MemoryConfig::MemoryConfig() = default;
MemoryConfig::~MemoryConfig() = default;

void MemoryConfig::DeleteGroup(const std::string& group) {
    amGroups.erase(group);
}

std::string MemoryConfig::ReadKey(const std::string& group, const std::string& key,
                                  const std::string& defaultValue) {
    auto g = amGroups.find(group);
    if (g == amGroups.end()) return defaultValue;
    auto k = g->second.find(key);
    return k == g->second.end() ? defaultValue : k->second;
}

void MemoryConfig::WriteKey(const std::string& group, const std::string& key,
                            const std::string& value) {
    amGroups[group][key] = value;
}

// ----------------------------------------------------- ConfigurationFactory

boost::shared_ptr<Configuration> ConfigurationFactory::CreateIniConfig(const std::string& path) {
    return boost::make_shared<IniConfig>(path);
}

boost::shared_ptr<Configuration> ConfigurationFactory::CreateMemoryConfig() {
    return boost::make_shared<MemoryConfig>();
}

boost::shared_ptr<Configuration> ConfigurationFactory::CreateAppConfig() {
    return boost::make_shared<IniConfig>(AppConfig::Instance()->GetPath().str());
}

boost::shared_ptr<Configuration> ConfigurationFactory::CreateUserConfig() {
    return boost::make_shared<IniConfig>(UserConfig::Instance()->GetPath().str());
}

// ----------------------------------------------------------- CascadedConfig

String CascadedConfig::ReadKey(const String& group, const String& key, const String& defaultValue) {
    String fromApp = AppConfig::Instance()->ReadKey(group, key, defaultValue);
    return UserConfig::Instance()->ReadKey(group, key, fromApp);
}

std::map<String, String> CascadedConfig::GetEntries(const String& group) {
    std::map<String, String> entries;
    // INI names compare case-insensitively: a user key replaces the
    // application's key of the same name in any case, under the user's
    // spelling. `spelled` maps the lower-case name to the spelling held.
    std::map<std::string, String> spelled;
    auto put = [&](const String& name, const String& value) {
        String lower = name;
        lower.ToLower();
        auto [at, fresh] = spelled.emplace(lower.str(), name);
        if (!fresh) {
            entries.erase(at->second);
            at->second = name;
        }
        entries[name] = value;
    };
    KLConfig* sources[] = {AppConfig::Instance(), UserConfig::Instance()};
    for (KLConfig* source : sources) {
        for (const auto& [name, value] : source->GetEntries(group)) put(name, value);
    }
    return entries;
}
