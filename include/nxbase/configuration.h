// Configuration stores: groups of named string keys, kept in an INI file
// (IniConfig) or in memory (MemoryConfig), handed out by ConfigurationFactory,
// and the cascade that looks a key up in the user's file before the
// application's (CascadedConfig). A store object belongs to one thread at a
// time; INI files themselves may be shared by any number of objects,
// threads and processes (see toolkit/config.h).
#ifndef NXBASE_CONFIGURATION_H_
#define NXBASE_CONFIGURATION_H_

#include <boost/shared_ptr.hpp>
#include <map>
#include <string>

#include "nxbase/export.h"
#include "toolkit/string.h"

class Config;

// A group/key/value string store.
class NXBASE_EXPORT Configuration {
  public:
    virtual ~Configuration();
    // Removes the group with all its keys; an unknown group is no error.
    virtual void DeleteGroup(const std::string& group) = 0;
    // The key's value, or `defaultValue` when the group or the key is absent.
    virtual std::string ReadKey(const std::string& group, const std::string& key,
                                const std::string& defaultValue) = 0;
    // Creates or overwrites the key (and its group).
    virtual void WriteKey(const std::string& group, const std::string& key,
                          const std::string& value) = 0;
};

// A store on one INI file. Group and key names compare case-insensitively
// and keep their case. Every write replaces the file as toolkit::Config
// describes (atomically, but for hard-linked files and the other cases it
// names); a write that fails leaves the old file and logs one line (empty
// log key).
class NXBASE_EXPORT IniConfig : public Configuration {
  public:
    explicit IniConfig(const std::string& path);
    ~IniConfig() override;

    void DeleteGroup(const std::string& group) override;
    std::string ReadKey(const std::string& group, const std::string& key,
                        const std::string& defaultValue) override;
    void WriteKey(const std::string& group, const std::string& key,
                  const std::string& value) override;

    const std::string& GetPath() const { return amPath; }

  private:
    std::string amPath;
    boost::shared_ptr<Config> amConfig;
};

// A store in memory; names are case-sensitive (plain byte order). Reading
// never creates entries.
class NXBASE_EXPORT MemoryConfig : public Configuration {
  public:
    MemoryConfig();
    ~MemoryConfig() override;

    void DeleteGroup(const std::string& group) override;
    std::string ReadKey(const std::string& group, const std::string& key,
                        const std::string& defaultValue) override;
    void WriteKey(const std::string& group, const std::string& key,
                  const std::string& value) override;

    // Number of groups held (for callers that inspect the store).
    std::size_t GetGroupCount() const { return amGroups.size(); }

  private:
    std::map<std::string, std::map<std::string, std::string>> amGroups;
};

// Hands out new stores; keeps nothing. Two stores on one file are independent.
class NXBASE_EXPORT ConfigurationFactory {
  public:
    static boost::shared_ptr<Configuration> CreateIniConfig(const std::string& path);
    static boost::shared_ptr<Configuration> CreateMemoryConfig();
    // An IniConfig on AppConfig::Instance()'s file; throws as that Instance().
    static boost::shared_ptr<Configuration> CreateAppConfig();
    // An IniConfig on UserConfig::Instance()'s file; throws as that Instance().
    static boost::shared_ptr<Configuration> CreateUserConfig();
};

// Read-only view of the user configuration over the application
// configuration over the caller's default. Both AppConfig and UserConfig
// must exist (their Instance() throws otherwise). There is no cascaded
// write: write to UserConfig or AppConfig explicitly.
class NXBASE_EXPORT CascadedConfig {
  public:
    // The user's value if the user file has the key, else the application's,
    // else `defaultValue`.
    static String ReadKey(const String& group, const String& key, const String& defaultValue);
    // Every key of the group in either file, the user's value winning;
    // ordered by key name (byte order).
    static std::map<String, String> GetEntries(const String& group);
};

#endif  // NXBASE_CONFIGURATION_H_
