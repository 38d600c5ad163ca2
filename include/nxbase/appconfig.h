// The application's identity, directories and INI configurations: AppName,
// AppDir, KLConfig with AppConfig, UserConfig and LocalConfig, and the maker's
// shared file VELTRAConfig. The singletons are created and replaced on the
// main thread at start-up; reads may then come from any thread that does not
// race a replacement. A KLConfig object itself is not locked: share one
// between threads only with outside locking (the file is safe to share).
//
// Where the files live on Linux:
// - per-user directory: $XDG_CONFIG_HOME/K-Lume when XDG_CONFIG_HOME is
//   absolute, else $HOME/.config/K-Lume (created on first use, with
//   ~/.config if that is missing too; the user's registry hive lies there
//   too, by the same rule: toolkit::ConfigDirectory);
// - UserConfig: <per-user directory>/<application name made a file name>.ini;
// - LocalConfig: <per-user directory>/<short name>.ini;
// - AppConfig and VELTRAConfig: wherever their creator points them.
#ifndef NXBASE_APPCONFIG_H_
#define NXBASE_APPCONFIG_H_

#include <cstdint>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "nxbase/export.h"
#include "nxbase/singleton.h"
#include "toolkit/direntry.h"
#include "toolkit/string.h"
#include "toolkit/version.h"

class Config;

// Name and version of the running application (identifier "AppName").
class NXBASE_EXPORT AppName : public NxSingleton {
  public:
    // Creates or replaces the instance. The strings are, in this order, the
    // title shown in window captions ("K-Lume ColorCheck"), the short name
    // used for file names ("ColorCheck"), and the full product name
    // ("K-Lume ColorCheck for Linux").
    static AppName* CreateAppName(const String& asTitel, const String& asShortName,
                                  const String& asFullName, const ApplicationVersion& axVersion);
    // Throws std::logic_error "Please create the AppName-Singleton first !".
    static AppName* Instance();
    static bool IsInitialized();

    const String& GetTitel() const { return amTitel; }
    void SetTitel(const String& asTitel) { amTitel = asTitel; }
    const String& GetShortName() const { return amShortName; }
    const String& GetFullName() const { return amFullName; }
    const ApplicationVersion& GetVersion() const { return amVersion; }
    // The version with two components, "2.10".
    String GetVersionString() const;

    ~AppName() override;

  private:
    AppName(const String& asTitel, const String& asShortName, const String& asFullName,
            const ApplicationVersion& axVersion);
    template <class T, class... Args>
    friend T* nxbase::CreateOrReplaceSingleton(T*&, Args&&...);

    String amTitel;
    String amShortName;
    String amFullName;
    ApplicationVersion amVersion;
    static AppName* smInstance;
};

// The application's installation directories (identifier "AppDir"), derived
// from the executable's path given at creation: <root>/bin/<exe> gives
// BinDirEntry <root>/bin, RootDirEntry <root>, LngDirEntry <root>/LNG,
// HlpDirEntry <root>/DOC.
class NXBASE_EXPORT AppDir : public NxSingleton {
  public:
    // Logs "Create AppDir: <path>" under "Language", then creates or
    // replaces the instance. `asPath` is the executable's path (use
    // toolkit::ExecutableFileName() for the running program).
    static AppDir* CreateAppDir(const String& asPath);
    // Throws std::logic_error "Please create the AppDir-Singleton first !".
    static AppDir* Instance();
    static bool IsInitialized();

    ~AppDir() override;
    // The parent of BinDirEntry(), through the virtual BinDirEntry().
    virtual DirEntry RootDirEntry() const;
    virtual DirEntry LngDirEntry() const;
    // The directory of the executable: the creation path without its name.
    virtual DirEntry BinDirEntry() const;
    virtual DirEntry HlpDirEntry() const;
    // The mount point of the file system holding BinDirEntry() (the nearest
    // existing ancestor when it does not exist), "/" when unknown.
    virtual DirEntry TargetDisk() const;

    const DirEntry& GetEntry() const { return amEntry; }

  protected:
    explicit AppDir(const String& asPath);
    // Installs an instance made by a derived class, replacing (and deleting)
    // the current one. Takes ownership.
    static void SetAppDir(AppDir* pAppDir);

  private:
    template <class T, class... Args>
    friend T* nxbase::CreateOrReplaceSingleton(T*&, Args&&...);

    DirEntry amEntry;
    static AppDir* smInstance;
};

// One INI file at a path; base of AppConfig, UserConfig and LocalConfig.
// Names compare case-insensitively and keep their case. A write that fails
// leaves the old file and logs one line (empty log key).
class NXBASE_EXPORT KLConfig {
  public:
    explicit KLConfig(const String& asPath);
    virtual ~KLConfig();
    KLConfig(const KLConfig&) = delete;
    KLConfig& operator=(const KLConfig&) = delete;

    // The value, "" when absent.
    String ReadKey(const String& asGroup, const String& asKey);
    String ReadKey(const String& asGroup, const String& asKey, const String& asDefault);
    // True when the file holds the value afterwards.
    bool WriteKey(const String& asGroup, const String& asKey, const String& asValue);
    // Keys of the group in file order (at most 65535 counted).
    std::uint16_t GetKeyCount(const String& asGroup);
    // The key name at `index` in file order, "" past the end.
    String GetKeyName(const String& asGroup, std::uint16_t alIndex);
    // Every key of the group with its value, in file order (one look at the
    // file instead of one per key).
    std::vector<std::pair<String, String>> GetEntries(const String& asGroup);
    // Removes the group with all its keys.
    bool EmptyGroup(const String& asGroup);

    const String& GetPath() const { return amPath; }

  private:
    String amPath;
    std::unique_ptr<Config> pConfig;
};

// The application's own INI file (identifier "AppConfig").
class NXBASE_EXPORT AppConfig : public KLConfig, public NxSingleton {
  public:
    // Creates or replaces the instance on the file `asFileName` in the
    // directory `asDirectory`: "<asDirectory>/<asFileName>", with ".ini"
    // appended when the name has no extension. An empty directory takes the
    // file name as a path of its own (absolute, or relative to the working
    // directory).
    static AppConfig* CreateAppConfig(const String& asDirectory, const String& asFileName);
    // Throws std::runtime_error "No AppConfig instance".
    static AppConfig* Instance();
    static bool IsInitialized();
    // Installs an instance made elsewhere (or null), deleting the current one.
    static void SetAppConfig(AppConfig* pAppConfig);

    explicit AppConfig(const String& asPath);
    ~AppConfig() override;

  private:
    static AppConfig* smInstance;
};

// The user's INI file in the per-user directory (identifier "UserConfig").
class NXBASE_EXPORT UserConfig : public KLConfig, public NxSingleton {
  public:
    // Creates or replaces the instance. The strings are, in this order:
    // - `asAppName`: the application's name; made a valid file name (see
    //   MakeValidFileName) it names the file, ".ini" appended unless present;
    // - `asDirectory`: the directory of the file; empty selects
    //   GetConfigDirectoryPath() (the working directory if that is "");
    // - `asDefaultsPath`: an INI file copied to the user's file when that does
    //   not exist yet (the shipped defaults); empty for none.
    // Logs User config file: "<path>" under "Startup".
    static UserConfig* CreateUserConfig(const String& asAppName, const String& asDirectory,
                                        const String& asDefaultsPath);
    // Throws std::runtime_error "No UserConfig instance".
    static UserConfig* Instance();
    static bool IsInitialized();
    // $XDG_CONFIG_HOME/K-Lume (an absolute XDG_CONFIG_HOME only), else
    // $HOME/.config/K-Lume (from the password database when HOME is unset),
    // created with missing parents; "" when no base directory is known.
    static String GetConfigDirectoryPath();

    explicit UserConfig(const String& asPath);
    ~UserConfig() override;

  private:
    static UserConfig* smInstance;
};

// An INI file named after the application's short name with ".ini" appended,
// in the per-user directory (GetConfigDirectoryPath()): settings of this
// machine's installation that are not shared with other applications.
// Needs AppName (throws as AppName::Instance()).
class NXBASE_EXPORT LocalConfig : public KLConfig {
  public:
    LocalConfig();
    // The path LocalConfig() opens.
    static String GetLocalConfigPath();
};

// Groups of the maker's shared INI file.
enum VELTRAiniGroup {
    VELTRA_LPM_SERVER = 0,
    VELTRA_GRADUS = 1,
    VELTRA_CHROMALINK_APPLICATIONS = 2,
    VELTRA_COMPATIBILITY = 3,
    VELTRA_32BIT_APPLICATIONS = 4,
    VELTRA_COLOR_LIBRARIES = 5,
    VELTRA_LICENSES = 6
};

// The maker's shared INI file with fixed groups (identifier "VELTRAConfig").
class NXBASE_EXPORT VELTRAConfig : public NxSingleton {
  public:
    // Creates or replaces the instance on the file at `asPath`.
    static VELTRAConfig* CreateVELTRAConfig(const String& asPath);
    // Throws std::logic_error "Please create the VELTRAConfig-Singleton first !".
    static VELTRAConfig* Instance();
    static bool IsInitialized();

    // "LPM-Server", "Gradus", "ChromaLink Applications", "Compatibility",
    // "32-Bit Applications", "Color Libraries", "Licenses"; another value
    // raises the assertion "\"Unknown VELTRAConfig group name\" == 0" and
    // gives "".
    static String GetGroupName(VELTRAiniGroup axGroup);

    String ReadVELTRAKey(VELTRAiniGroup axGroup, const String& asKey);
    String ReadVELTRAKey(VELTRAiniGroup axGroup, const String& asKey, const String& asDefault);
    bool WriteVELTRAKey(VELTRAiniGroup axGroup, const String& asKey, const String& asValue);
    // The identifier (key name) of the application at `alIndex` in
    // "ChromaLink Applications", "" outside 0..count-1.
    String ReadChromaLinkApplication(int alIndex);

    const String& GetPath() const { return amPath; }
    ~VELTRAConfig() override;

  private:
    explicit VELTRAConfig(const String& asPath);
    template <class T, class... Args>
    friend T* nxbase::CreateOrReplaceSingleton(T*&, Args&&...);

    String amPath;
    std::unique_ptr<Config> pConfig;
    static VELTRAConfig* smInstance;
};

#endif  // NXBASE_APPCONFIG_H_
