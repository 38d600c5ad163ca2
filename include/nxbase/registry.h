// Registry access: string values below key paths in two hives, the machine's
// (HKEY_LOCAL_MACHINE) and the user's (HKEY_CURRENT_USER), kept in one SQLite
// database per hive. Any thread and any number of processes may read and
// write at once; each write is one transaction. The root path is set once at
// start, before other threads use the registry.
//
// Hive files: HKEY_CURRENT_USER is $NXBASE_USER_REGISTRY, else
// $XDG_CONFIG_HOME/K-Lume/registry.sqlite (~/.config when XDG_CONFIG_HOME is
// unset); HKEY_LOCAL_MACHINE is $NXBASE_MACHINE_REGISTRY, else
// /etc/k-lume/registry.sqlite. A missing hive reads as empty and is created
// (with its directory) on the first write.
//
// Names: key paths are components separated by "\"; key paths and value names
// compare without regard to ASCII case and keep the case they were created
// with. Empty components (leading, trailing or doubled "\") are dropped.
//
// Errors: store failures (a file that cannot be opened or written, a corrupt
// database, named in the text) throw nxbase::RegistryError; reading a value
// that is not a string throws nxbase::RegistryKeyTypeError; building an
// application or user entry without a root path throws std::logic_error
// "Registry root path not set". A missing value or key is not an error.
#ifndef NXBASE_REGISTRY_H_
#define NXBASE_REGISTRY_H_

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <string_view>
#include <vector>

#include "nxbase/export.h"

// A hive, or a key opened below one. The hives are fixed handles with the
// Windows values; opened keys are handles owned by an HKeyHolder.
struct HKEY__;
typedef HKEY__* HKEY;

#define HKEY_CURRENT_USER (reinterpret_cast<HKEY>(static_cast<std::uintptr_t>(0x80000001)))
#define HKEY_LOCAL_MACHINE (reinterpret_cast<HKEY>(static_cast<std::uintptr_t>(0x80000002)))

namespace nxbase {

// What went wrong in the store, independent of the database underneath.
enum class RegistryErrorKind {
    kNotWritable,    // the hive file or its directory may not be written (or read) by this user
    kCorrupt,        // the file is damaged or no registry database
    kInvalidHandle,  // a handle that names no hive
    kOther,          // anything else: full disk, I/O error, busy for too long, ...
};

// A store failure: the text names the hive file and the cause; GetKind() says
// what kind of failure it is, Code() the database's own result code (0 when
// the failure is not the database's).
class NXBASE_EXPORT RegistryError : public std::runtime_error {
  public:
    RegistryError(RegistryErrorKind kind, long code, const std::string& message)
        : std::runtime_error(message), amKind(kind), amCode(code) {}
    RegistryErrorKind GetKind() const { return amKind; }
    long Code() const { return amCode; }

  private:
    RegistryErrorKind amKind = RegistryErrorKind::kOther;
    long amCode = 0;
};

// A value that was read as a string holds another type (a DWORD).
class NXBASE_EXPORT RegistryKeyTypeError : public std::runtime_error {
  public:
    using std::runtime_error::runtime_error;
};

}  // namespace nxbase

// One value in the registry: its hive, the key path below the hive (sub key)
// and the value's name (key). Copyable.
class NXBASE_EXPORT RegistryEntry {
  public:
    RegistryEntry() = default;
    RegistryEntry(HKEY axHKey, const std::string& asSubKey, const std::string& asKey)
        : amHKey(axHKey), amSubKey(asSubKey), amKey(asKey) {}

    // HKEY_LOCAL_MACHINE, "<root path>\<subKey>", `key`. Throws
    // std::logic_error "Registry root path not set" without a root path.
    static RegistryEntry CreateAppRegistryEntry(const std::string& asSubKey,
                                                const std::string& asKey);
    // The same in HKEY_CURRENT_USER.
    static RegistryEntry CreateUserRegistryEntry(const std::string& asSubKey,
                                                 const std::string& asKey);

    HKEY GetHKey() const { return amHKey; }
    const std::string& GetSubKey() const { return amSubKey; }
    const std::string& GetKey() const { return amKey; }
    void SetKey(const std::string& asKey) { amKey = asKey; }
    void SetKey(HKEY axHKey, const std::string& asKey) {
        amHKey = axHKey;
        amKey = asKey;
    }

  private:
    HKEY amHKey = HKEY_CURRENT_USER;
    std::string amSubKey;
    std::string amKey;
};

// Owns one opened key handle and closes it on destruction. Not copyable.
class NXBASE_EXPORT HKeyHolder {
  public:
    HKeyHolder() = default;
    ~HKeyHolder();
    HKeyHolder(const HKeyHolder&) = delete;
    HKeyHolder& operator=(const HKeyHolder&) = delete;

    HKEY GetHKey() const { return amHKey; }
    // For the call that opens the key; a handle held already is closed first.
    HKEY* GetHKeyPtr();

  private:
    HKEY amHKey = nullptr;
};

// Reads and writes string values below the process-wide root path (set once
// at start, e.g. "Software\K-Lume\MyApp"). No per-object state.
class NXBASE_EXPORT RegistryHandler {
  public:
    virtual ~RegistryHandler() = default;

    // Sets the root path. The first non-empty root path also installs the
    // registry as the source of the log options (see
    // nxbase::InstallRegistryLogOptions), so set it before the first log line.
    static void SetRootPath(const std::string& asRootPath);
    static const std::string& GetRootPath();

    // The value's text, or `default` when the value or its key is missing.
    // Throws RegistryKeyTypeError when the value is not a string.
    static std::string GetRegistryEntry(const RegistryEntry& axEntry,
                                        const std::string& asDefault = std::string());
    // The value below "<root path>\<subKey>" in one hive.
    static std::string GetValue(HKEY axHKey, const std::string& asSubKey, const std::string& asKey,
                                const std::string& asDefault = std::string());
    // The user's value, else the machine's, else `default`.
    static std::string GetValue(const std::string& asSubKey, const std::string& asKey,
                                const std::string& asDefault = std::string());
    // The value below an absolute sub key (no root path).
    static std::string GetGlobalValue(HKEY axHKey, const std::string& asSubKey,
                                      const std::string& asKey,
                                      const std::string& asDefault = std::string());

    // Creates the key when needed and writes the value as a string. Returns
    // true; store failures throw RegistryError.
    static bool AddRegistryEntry(const RegistryEntry& axEntry, const std::string& asValue);
    static bool AddRegistryEntry(HKEY axHKey, const std::string& asSubKey, const std::string& asKey,
                                 const std::string& asValue);

    // Every value of the entry's key (its value name is ignored), name to text,
    // ordered by name; a missing key gives an empty map. Throws
    // RegistryKeyTypeError when one of the values is not a string.
    static std::map<std::string, std::string> GetKeys(const RegistryEntry& axEntry);
    static std::map<std::string, std::string> GetKeys(HKEY axHKey, const std::string& asSubKey);
    // The number of values of the key (of any type); 0 for a missing key.
    static std::uint32_t GetKeyCount(const RegistryEntry& axEntry);
    static std::uint32_t GetKeyCount(HKEY axHKey, const std::string& asSubKey);

    // Deletes one value; a key of the entry outside "SOFTWARE\VELTRAMOND" and
    // "SOFTWARE\K-LUME" is left alone. Returns true when a value was deleted.
    static bool DeleteKey(const RegistryEntry& axEntry);
    static bool DeleteKey(HKEY axHKey, const std::string& asKey);
    // Deletes a whole key with its sub keys, with the same guard. Returns true
    // when the key existed.
    static bool DeleteGroup(const RegistryEntry& axEntry);
    static bool DeleteGroup(HKEY axHKey, const std::string& asGroup);

  private:
    // Opens (without creating) the entry's key into the holder; false when
    // the key is missing.
    static bool OpenKey(const RegistryEntry& axEntry, HKeyHolder& axHolder);
    // Opens the key and tells whether the entry's value exists.
    static bool HasKey(const RegistryEntry& axEntry, HKeyHolder& axHolder);
    static void CloseKey(HKEY axHKey);
    // True only inside the maker's two branches (upper-cased sub key contains
    // "SOFTWARE\VELTRAMOND" or "SOFTWARE\K-LUME").
    static bool CanDeleteEntry(const RegistryEntry& axEntry);

    static std::string smRootPath;
    friend class HKeyHolder;
};

NXBASE_EXPORT std::string GetHKeyLocalMachine();  // "HKEY_LOCAL_MACHINE"
NXBASE_EXPORT std::string GetHKeyCurrentUser();   // "HKEY_CURRENT_USER"

// Full paths begin with "HKEY_LOCAL_MACHINE" or "HKEY_CURRENT_USER"; the key
// path is everything after the first "\". Opening a full path creates the key
// when it is missing (for reading too, when the hive can be written). A path
// in neither hive opens nothing: the readers return empty, the writer false.

// The value's text, "" when it is missing. Throws RegistryKeyTypeError for a
// value that is not a string.
NXBASE_EXPORT std::string NxReadRegistryKeyString(const std::string& asPath,
                                                  const std::string& asValueName);
// Every string value of the key, name to text. Throws RegistryKeyTypeError
// when one of them is not a string.
NXBASE_EXPORT std::map<std::string, std::string> NxReadRegistryKeysString(
    const std::string& asPath);
// Writes the value as a string; true on success.
NXBASE_EXPORT bool NxWriteRegistryKeyString(const std::string& asPath,
                                            const std::string& asValueName,
                                            const std::string& asValue);

namespace nxbase {

// ---- the store below the classes above, for tools and tests ----

enum class RegistryHive { CurrentUser, LocalMachine };

// "HKEY_CURRENT_USER" or "HKEY_LOCAL_MACHINE".
NXBASE_EXPORT const char* HiveName(RegistryHive axHive);
// The hive of a handle given to RegistryHandler (HKEY_CURRENT_USER or
// HKEY_LOCAL_MACHINE); nullopt for anything else.
NXBASE_EXPORT std::optional<RegistryHive> HiveOf(HKEY axHKey);
// Splits "HKEY_CURRENT_USER\a\b" (or "HKCU\a\b", "HKEY_LOCAL_MACHINE\...",
// "HKLM\...", any case) into hive and key path; false for another hive.
NXBASE_EXPORT bool SplitRegistryPath(const std::string& asPath, RegistryHive& axHive,
                                     std::string& asKeyPath);
// The hive's database file from the environment (see the top of this file).
NXBASE_EXPORT std::string RegistryHiveFile(RegistryHive axHive);

namespace detail {
// For tests: called between seeing a fresh hive file and creating its
// tables, the window racing creators would collide in without the
// transaction around both. Null (the default) calls nothing.
NXBASE_EXPORT void SetSchemaCheckHook(void (*fHook)());
}  // namespace detail

// Value types, numbered as Windows numbers them. Only String values are read
// by the library's string readers; the others exist so that files written by
// Windows' regedit import whole (and those readers raise the key-type error).
enum class RegistryType : std::uint32_t {
    String = 1,
    ExpandString = 2,
    Binary = 3,
    Dword = 4,
    MultiString = 7
};

// Names, key paths and texts in the store are UTF-8.
struct NXBASE_EXPORT RegistryValue {
    std::string name;
    RegistryType type = RegistryType::String;
    // The data of every type but Dword: the text of a String or ExpandString,
    // the bytes of a Binary (or of a type not listed above), and the strings
    // of a MultiString, each followed by one zero byte.
    std::string text;
    std::uint32_t dword = 0;  // data of a Dword value

    static RegistryValue Text(const std::string& asName, const std::string& asText);
    static RegistryValue Dword(const std::string& asName, std::uint32_t alValue);
    // The data as text: a Dword in decimal, a MultiString's strings one per
    // line, a Binary as hexadecimal byte pairs ("0a,ff").
    std::string ToString() const;
};

// Typed access to one hive. Every call is one transaction; store failures
// throw RegistryError. Key paths are normalised as described above.
class NXBASE_EXPORT RegistryStore {
  public:
    static bool KeyExists(RegistryHive axHive, const std::string& asKey);
    // Creates the key and its parents; true when it was missing.
    static bool CreateKey(RegistryHive axHive, const std::string& asKey);
    static std::optional<RegistryValue> Read(RegistryHive axHive, const std::string& asKey,
                                             const std::string& asName);
    // Writes the value, creating its key; an existing value keeps the case
    // of its name and takes the new type and data.
    static void Write(RegistryHive axHive, const std::string& asKey, const RegistryValue& axValue);
    // The key's values ordered by name (ignoring case); empty for a missing key.
    static std::vector<RegistryValue> Values(RegistryHive axHive, const std::string& asKey);
    // The names of the key's direct sub keys, ordered ignoring case.
    static std::vector<std::string> SubKeys(RegistryHive axHive, const std::string& asKey);
    // The key and every key below it, as full key paths, ordered so that a
    // parent comes before its children; empty for a missing key. An empty
    // `key` lists the whole hive.
    static std::vector<std::string> Tree(RegistryHive axHive, const std::string& asKey);
    // True when the value existed.
    static bool DeleteValue(RegistryHive axHive, const std::string& asKey,
                            const std::string& asName);
    // Deletes the key, its values and everything below it; true when it existed.
    static bool DeleteKey(RegistryHive axHive, const std::string& asKey);

    // One change of an import; all changes to one hive apply in one transaction.
    struct Change {
        enum class Kind { CreateKey, DeleteKey, SetValue, DeleteValue };
        Kind kind = Kind::CreateKey;
        RegistryHive hive = RegistryHive::CurrentUser;
        std::string key;
        RegistryValue value;  // SetValue; DeleteValue uses value.name
    };
    static void Apply(const std::vector<Change>& axChanges);
};

// ---- REGEDIT4 text ----

// Parses registry text: the header line "REGEDIT4" or "Windows Registry
// Editor Version 5.00", then sections "[HKEY_CURRENT_USER\...]" (or
// "[-HKEY_...]" to delete a key) holding lines "name"="text" (quote and
// backslash escaped; \n and \r stand for line breaks), "name"=dword:0000000a,
// "name"=hex:.., hex(2):.. (expandable), hex(7):.. (multi-string) and
// hex(N):.., each continued over lines ending in ",\", "name"=- (delete) and
// @ for the unnamed value; ";" starts a comment line. The text is UTF-16LE
// when it starts with its byte-order mark (what regedit writes by default;
// hex(2)/hex(7) bytes are then UTF-16LE too), else UTF-8 when it is valid
// UTF-8, else Windows-1252; the changes hold UTF-8. Throws
// std::runtime_error naming the source, the line and the offending text
// (control bytes escaped as \xNN) on the first error; nothing is applied.
NXBASE_EXPORT std::vector<RegistryStore::Change> ParseRegedit4(const std::string& asText,
                                                               const std::string& asSource);
// Checks the head of registry text (its first bytes; `abComplete` when they
// are the whole text) before the rest is read: true when the first non-blank
// line is the header, false when the head ends before that line does.
// Throws std::runtime_error as ParseRegedit4 does when the line is another,
// or when complete text holds no line at all.
NXBASE_EXPORT bool CheckRegedit4Header(std::string_view asHead, bool abComplete,
                                       const std::string& asSource);
// Writes the key and everything below it as REGEDIT4 text in UTF-8 (hex(2)
// and hex(7) data as UTF-8 bytes with their zero bytes).
NXBASE_EXPORT std::string ExportRegedit4(RegistryHive axHive, const std::string& asKey);

// ---- log options ----

// The values below "<root path>\Log" in the user's hive, name to text (a
// DWORD in decimal). Empty without a root path or when the key is missing.
NXBASE_EXPORT std::map<std::string, std::string> ReadLogOptionsFromRegistry();
// Makes log files created from now on take their options from
// ReadLogOptionsFromRegistry(), merged over those of the provider installed
// before (which keeps answering the option "Path"). Installs once; later
// calls do nothing. RegistryHandler::SetRootPath calls it.
NXBASE_EXPORT void InstallRegistryLogOptions();

}  // namespace nxbase

#endif  // NXBASE_REGISTRY_H_
