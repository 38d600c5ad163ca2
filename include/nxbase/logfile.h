// LogFile appends time-stamped lines to one file; any thread, and any number
// of processes sharing the file, may write to it. A line with a non-empty key
// is written only while that key is enabled; an empty key always writes.
// Every line reaches the file in one write() on an O_APPEND descriptor, so
// lines of several threads and processes do not interleave on a local file
// system that takes each write whole. A line cut short (a full disk, a
// file-size limit) is left as it is, counts as not written and is reported to
// the listeners; NFS and other network file systems may interleave appends.
// Writing never throws: a file that cannot be opened loses the line.
#ifndef NXBASE_LOGFILE_H_
#define NXBASE_LOGFILE_H_

#include <atomic>
#include <boost/shared_ptr.hpp>
#include <cstdint>
#include <list>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <unordered_map>
#include <vector>

#include "nxbase/export.h"
#include "toolkit/string.h"

// The log's fixed option names.
inline constexpr const char* kLogOptionUnlimited = "Unlimited";
inline constexpr const char* kLogOptionPath = "Path";
inline constexpr const char* kLogOptionThreadId = "ThreadId";
inline constexpr const char* kLogOptionUILog = "UILog";

class NXBASE_EXPORT LogInterface {
  public:
    virtual ~LogInterface() = default;
    virtual bool IsLogOptionEnabled(const String& key) const = 0;
    virtual void WriteLog(const String& text, const String& key) = 0;
    virtual void WriteStackTrace() = 0;
    virtual void UpdateInfo(const String& name, const String& value) = 0;
};

namespace nxbase {

// Where a new LogFile finds its options. The configuration subsystem installs
// one that reads the application's option file and the registry; without it
// the log uses the temporary directory and the NXBASE_LOG_OPTIONS variable.
class NXBASE_EXPORT LogOptionProvider {
  public:
    virtual ~LogOptionProvider() = default;
    // The option "Path" of the application's option file, "" when unset.
    virtual std::string LogPath() = 0;
    // The values below "Log" in the user's store: name to data.
    virtual std::map<std::string, std::string> LogOptions() = 0;
};

// Installs the provider that log files created from now on consult (null:
// the built-in default). Returns the previous one.
NXBASE_EXPORT std::shared_ptr<LogOptionProvider> SetLogOptionProvider(
    std::shared_ptr<LogOptionProvider> provider);

}  // namespace nxbase

class NXBASE_EXPORT LogFile : public LogInterface {
  public:
    // Lines after which a limited log starts afresh.
    static constexpr std::uint32_t kLineLimit = 50000;

    // Opens a log named by the path rule: `name` (or the executable's base
    // name when empty) plus ".log" in the temporary directory, unless the
    // option "Path" names the file. Writes "Starting log", which truncates.
    explicit LogFile(const std::string& name);
    ~LogFile() override;
    LogFile(const LogFile&) = delete;
    LogFile& operator=(const LogFile&) = delete;

    // Creates the process log unless one exists.
    static void CreateLogFile(const std::string& name);
    // The process log, created with an empty name on first use; never null.
    static boost::shared_ptr<LogFile> Instance();
    static void WriteToLog(const String& text, const String& key);

    bool IsLogOptionEnabled(const String& key) const override;
    void WriteLog(const String& text, const String& key) override;
    // With "StackTrace" enabled, writes "\nStackTrace:\n" and the call stack.
    void WriteStackTrace() override;
    // Writes "<name>: <value>" under the key "Info".
    void UpdateInfo(const String& name, const String& value) override;
    // With "AvailableStack" enabled, writes the text and the bytes of stack
    // left to the calling thread.
    virtual void LogAvailableStack(const String& text);

    void SetLogOption(const std::string& key, bool enable);
    std::set<std::string> GetAvailableLogOptions() const;

    void AddLogListener(boost::shared_ptr<LogInterface> listener);
    void RemoveLogListener(boost::shared_ptr<LogInterface> listener);
    void RemoveListeners();

    const std::string& GetFileName() const { return fileName; }

  private:
    bool CheckKey(const String& key);
    // Sets and clears state bits of a key in a new snapshot; returns the
    // state before.
    std::uint8_t ChangeKeyState(const std::string& key, std::uint8_t set, std::uint8_t clear);
    void NotifyListeners(const String& text, const String& key);
    void ApplyOptions(const std::map<std::string, std::string>& options);

    std::string fileName = "NxBLog.log";
    bool firstWrite = true;
    std::uint32_t loggedLines = 0;
    bool unlimited = false;
    std::atomic<bool> withThreadId{false};
    // Available (announced) and enabled keys in one table, so that a line
    // costs one look-up. Readers take the current snapshot without a lock;
    // a change copies the table under keysMutex and publishes the copy. Old
    // snapshots are kept until the log goes (keys change a few dozen times in
    // a program's life), so a reader never holds a freed table.
    using KeyTable = std::unordered_map<std::string, std::uint8_t>;
    std::atomic<const KeyTable*> keyStates{nullptr};
    std::vector<std::unique_ptr<const KeyTable>> keyTables;
    std::list<boost::shared_ptr<LogInterface>> listeners;
    // The restart note, written at the head of the fresh file.
    std::string restartNote;
    // Serialises changes of keyStates; file writes use the named lock
    // "LogWrite", listeners the named lock "LogListeners".
    mutable std::mutex keysMutex;
    std::atomic<bool> hasListeners{false};
};

// AutoLog writes "|->text" on entry and "|<-text" on exit of a scope under a
// key, indenting the lines between by two blanks. The indentation depth is
// process-wide, shared by all threads.
class NXBASE_EXPORT AutoLog {
  public:
    AutoLog(const String& text, const String& key);
    AutoLog(LogInterface* log, const String& text, const String& key);
    ~AutoLog();
    AutoLog(const AutoLog&) = delete;
    AutoLog& operator=(const AutoLog&) = delete;

    // Writes a line inside the block when the block is active.
    void Log(const String& text);

    static unsigned short GetIndent();
    static String GetIndentString();
    static std::uint32_t GetAutoLogCounter();

  private:
    void StartBlock(const String& text, const String& key);
    void WriteLog(const String& text);

    String amText;
    String amKey;
    bool active = false;
    LogInterface* pLog = nullptr;
    // Shared by the owner of the process log, so that it outlives the block.
    boost::shared_ptr<LogFile> amOwnedLog;

    static std::atomic<unsigned short> smIndent;
    static std::atomic<std::uint32_t> smAutoLogCounter;
};

namespace nxbase {

// IsLogOptionEnabled of the process log for one fixed key, for hot paths:
// while no option changes, the answer costs one atomic load instead of a
// locked look-up. Any thread may call Enabled(); a change of the options is
// seen by the next call.
class NXBASE_EXPORT CachedLogOption {
  public:
    explicit CachedLogOption(std::string key) : amKey(std::move(key)) {}
    // Inline: the hot paths ask several times per message.
    bool Enabled() {
        const std::uint64_t state = amState.load(std::memory_order_relaxed);
        if ((state >> 1) == smVersion.load(std::memory_order_acquire)) return (state & 1) != 0;
        return LookUp();
    }
    // Makes every cached option look again: the log's options changed.
    static void OptionsChanged() { smVersion.fetch_add(1, std::memory_order_acq_rel); }

  private:
    bool LookUp();

    // Counts changes of any log's options; starts at 1, so that a state of 0
    // always means "not looked up".
    static std::atomic<std::uint64_t> smVersion;

    const String amKey;
    // (options version << 1) | enabled; 0 before the first look-up.
    std::atomic<std::uint64_t> amState{0};
};

}  // namespace nxbase

#endif  // NXBASE_LOGFILE_H_
