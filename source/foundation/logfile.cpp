#include "nxbase/logfile.h"

#include <pthread.h>

#include <boost/stacktrace.hpp>
#include <cerrno>
#include <charconv>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <mutex>
#include <sstream>

#include "nxbase/thread.h"
#include "toolkit/fileio.h"
#include "toolkit/system.h"

namespace {

constexpr const char* kLogWrite = "LogWrite";
constexpr const char* kLogListeners = "LogListeners";
constexpr const char* kUnlimited = kLogOptionUnlimited;
constexpr const char* kThreadId = kLogOptionThreadId;

// Bits of a key's state: announced once in "# - Available key: ", enabled.
constexpr std::uint8_t kAvailable = 1;
constexpr std::uint8_t kEnabled = 2;

bool IsDirectory(const std::string& path) {
    return toolkit::KindOf(path) == toolkit::FileKind::kDirectory;
}

// Bytes of stack between the caller's frame and the end of its thread's stack.
long AvailableStackBytes() {
    pthread_attr_t attr;
    if (pthread_getattr_np(pthread_self(), &attr) != 0) return -1;
    void* base = nullptr;
    std::size_t size = 0;
    pthread_attr_getstack(&attr, &base, &size);
    pthread_attr_destroy(&attr);
    char here = 0;
    return static_cast<long>(reinterpret_cast<std::uintptr_t>(&here) -
                             reinterpret_cast<std::uintptr_t>(base));
}

// ---- time stamp "05.03.2009 - 07:04:09", formatted once per second per thread ----

void Put2(char* at, int value) {
    at[0] = static_cast<char>('0' + value / 10 % 10);
    at[1] = static_cast<char>('0' + value % 10);
}

const std::string& TimeStamp() {
    thread_local std::time_t cachedSecond = -1;
    thread_local std::string cached;
    std::time_t now = std::time(nullptr);
    if (now != cachedSecond) {
        std::tm local{};
        localtime_r(&now, &local);
        char text[] = "dd.mm.yyyy - hh:mm:ss";
        Put2(text, local.tm_mday);
        Put2(text + 3, local.tm_mon + 1);
        int year = local.tm_year + 1900;
        Put2(text + 6, year / 100);
        Put2(text + 8, year % 100);
        Put2(text + 13, local.tm_hour);
        Put2(text + 16, local.tm_min);
        Put2(text + 19, local.tm_sec);
        cached.assign(text, sizeof text - 1);
        cachedSecond = now;
    }
    return cached;
}

// ---- where options come from ----

std::map<std::string, std::string> OptionsFromEnvironment() {
    std::map<std::string, std::string> options;
    const char* list = std::getenv("NXBASE_LOG_OPTIONS");
    if (list == nullptr) return options;
    std::string text(list);
    std::size_t start = 0;
    while (start <= text.size()) {
        std::size_t end = text.find_first_of(",; ", start);
        if (end == std::string::npos) end = text.size();
        if (end > start) options[text.substr(start, end - start)] = "1";
        start = end + 1;
    }
    return options;
}

// Until the configuration installs its provider, a log knows only what the
// environment says.
class DefaultLogOptionProvider : public nxbase::LogOptionProvider {
  public:
    std::string LogPath() override { return std::string(); }
    std::map<std::string, std::string> LogOptions() override { return {}; }
};

std::mutex& ProviderMutex() {
    static std::mutex mutex;
    return mutex;
}

std::shared_ptr<nxbase::LogOptionProvider>& ProviderSlot() {
    static auto* provider = new std::shared_ptr<nxbase::LogOptionProvider>(
        std::make_shared<DefaultLogOptionProvider>());
    return *provider;
}

std::shared_ptr<nxbase::LogOptionProvider> CurrentProvider() {
    std::lock_guard<std::mutex> lock(ProviderMutex());
    return ProviderSlot();
}

// The executable's base name: after the last "/", before the first ".".
std::string ExecutableBaseName() {
    std::string path = toolkit::ExecutableFileName();
    std::string base = path.substr(path.find_last_of('/') + 1);
    return base.substr(0, base.find('.'));
}

// The user's private log directory, <temp>/k-lume-<uid>: nobody else can
// plant the log's name there first or put a symlink in its place.
std::string DefaultLogDirectory() {
    std::string refusal;
    std::string directory = toolkit::UserTempDirectory(&refusal);
    if (directory.empty()) directory = toolkit::TempDirectory();
    if (!refusal.empty()) {
        std::fprintf(stderr, "Log directory refused (%s); using %s\n", refusal.c_str(),
                     directory.c_str());
    }
    return directory;
}

// The log path: "Path" names the file, or the directory when it is one (or
// ends in "/"); without it, <temp>/<name or executable>.log.
std::string ResolveLogPath(const std::string& name, const std::string& pathOption) {
    std::string fileName = (name.empty() ? ExecutableBaseName() : name) + ".log";
    if (pathOption.empty()) return DefaultLogDirectory() + "/" + fileName;
    std::string path = toolkit::NormalizePath(pathOption);
    if (path.back() == '/') return path + fileName;
    if (IsDirectory(path)) return path + "/" + fileName;
    return path;
}

bool IsTrue(const std::string& value) {
    return value == "1" || value == "true";
}

// The process log, never destroyed: singletons log in their destructors
// during static destruction.
std::mutex& InstanceMutex() {
    static auto* mutex = new std::mutex();
    return *mutex;
}

boost::shared_ptr<LogFile>& InstanceSlot() {
    static auto* instance = new boost::shared_ptr<LogFile>();
    return *instance;
}

// The process log once made. It is never replaced or destroyed, so
// WriteToLog may use it without the lock and without a reference count.
std::atomic<LogFile*> gInstance{nullptr};

// Makes the process log under InstanceMutex if there is none yet.
void EnsureInstance(const std::string& name) {
    if (InstanceSlot()) return;
    InstanceSlot().reset(new LogFile(name));
    gInstance.store(InstanceSlot().get(), std::memory_order_release);
}

}  // namespace

namespace nxbase {

std::shared_ptr<LogOptionProvider> SetLogOptionProvider(
    std::shared_ptr<LogOptionProvider> provider) {
    if (!provider) provider = std::make_shared<DefaultLogOptionProvider>();
    std::lock_guard<std::mutex> lock(ProviderMutex());
    std::swap(ProviderSlot(), provider);
    return provider;
}

}  // namespace nxbase

// ---- LogFile ----

LogFile::LogFile(const std::string& name) {
    std::shared_ptr<nxbase::LogOptionProvider> provider = CurrentProvider();
    std::string pathOption;
    std::map<std::string, std::string> options;
    try {
        const char* envPath = std::getenv("NXBASE_LOG_PATH");
        pathOption = (envPath && *envPath) ? envPath : provider->LogPath();
        options = provider->LogOptions();
    } catch (const std::exception& e) {
        std::fprintf(stderr, "Error creating LogFile instance: %s\n", e.what());
    }
    nxbase::CachedLogOption::OptionsChanged();
    fileName = ResolveLogPath(name, pathOption);
    WriteLog(String("Starting log"), String());
    if (loggedLines == 0) std::fprintf(stderr, "Error writing LogFile: %s\n", fileName.c_str());
    for (const auto& [key, value] : OptionsFromEnvironment()) options[key] = value;
    ApplyOptions(options);
}

LogFile::~LogFile() = default;

void LogFile::ApplyOptions(const std::map<std::string, std::string>& options) {
    for (const auto& [key, value] : options) {
        if (IsTrue(value)) SetLogOption(key, true);
    }
}

void LogFile::CreateLogFile(const std::string& name) {
    std::lock_guard<std::mutex> lock(InstanceMutex());
    EnsureInstance(name);
}

boost::shared_ptr<LogFile> LogFile::Instance() {
    std::lock_guard<std::mutex> lock(InstanceMutex());
    EnsureInstance(std::string());
    return InstanceSlot();
}

void LogFile::WriteToLog(const String& text, const String& key) {
    LogFile* log = gInstance.load(std::memory_order_acquire);
    if (log == nullptr) log = Instance().get();
    log->WriteLog(text, key);
}

namespace {
// The state of `key` in a snapshot (null: no table yet), 0 when absent.
std::uint8_t StateIn(const std::unordered_map<std::string, std::uint8_t>* table,
                     const std::string& key) {
    if (table == nullptr) return 0;
    auto at = table->find(key);
    return at == table->end() ? 0 : at->second;
}
}  // namespace

bool LogFile::IsLogOptionEnabled(const String& key) const {
    return (StateIn(keyStates.load(std::memory_order_acquire), key.str()) & kEnabled) != 0;
}

std::uint8_t LogFile::ChangeKeyState(const std::string& key, std::uint8_t set, std::uint8_t clear) {
    std::lock_guard<std::mutex> lock(keysMutex);
    const KeyTable* current = keyStates.load(std::memory_order_relaxed);
    const std::uint8_t before = StateIn(current, key);
    const std::uint8_t after = static_cast<std::uint8_t>((before | set) & ~clear);
    if (after != before || current == nullptr || current->find(key) == current->end()) {
        auto next = std::make_unique<KeyTable>(current ? *current : KeyTable());
        (*next)[key] = after;
        keyStates.store(next.get(), std::memory_order_release);
        keyTables.push_back(std::move(next));
    }
    return before;
}

void LogFile::SetLogOption(const std::string& key, bool enable) {
    ChangeKeyState(key, enable ? kEnabled : 0, enable ? 0 : kEnabled);
    nxbase::CachedLogOption::OptionsChanged();
    if (key == kUnlimited) {
        CriticalSection section(kLogWrite);
        unlimited = enable;
    }
    if (key == kThreadId) withThreadId = enable;
}

std::set<std::string> LogFile::GetAvailableLogOptions() const {
    std::set<std::string> keys;
    const KeyTable* table = keyStates.load(std::memory_order_acquire);
    if (table == nullptr) return keys;
    for (const auto& [key, state] : *table) {
        if (state & kAvailable) keys.insert(key);
    }
    return keys;
}

// Returns whether lines under `key` are written; announces a new key once.
bool LogFile::CheckKey(const String& key) {
    const std::string& name = key.str();
    const std::uint8_t state = StateIn(keyStates.load(std::memory_order_acquire), name);
    if (state & kAvailable) return name.empty() || (state & kEnabled);
    const std::uint8_t before = ChangeKeyState(name, kAvailable, 0);
    const bool announce = !(before & kAvailable) && !name.empty();
    const bool enabled = name.empty() || (before & kEnabled);
    if (announce) WriteLog(String("# - Available key: ") + key, String("Keys"));
    return enabled;
}

void LogFile::WriteLog(const String& text, const String& key) {
    if (!CheckKey(key)) return;
    bool appendRequested = text == "APPEND";

    std::string line;
    line.reserve(64 + text.Len());
    line += TimeStamp();
    line += '\t';
    line.append(2u * AutoLog::GetIndent(), ' ');
    if (withThreadId) {
        char id[16];
        auto end = std::to_chars(id, id + sizeof id, toolkit::CurrentThreadId()).ptr;
        line += "ThreadId: ";
        line.append(id, end);
        line += '\t';
    }
    line += text.str();
    line += '\n';

    bool written = false;
    int writeError = 0;
    {
        CriticalSection section(kLogWrite);
        bool fresh = firstWrite;
        bool truncate = fresh && !appendRequested;
        firstWrite = false;
        if (!unlimited && loggedLines > kLineLimit) {
            restartNote = "Log restarted (LogedLines: " + std::to_string(loggedLines) + "\n";
            loggedLines = 0;
            firstWrite = true;
        } else if (fresh && !restartNote.empty()) {
            // The first line after a restart carries the note, whether it
            // starts the file afresh or ("APPEND") continues it.
            line.insert(0, restartNote);
            restartNote.clear();
        }
        written = toolkit::AppendInOneWrite(fileName, line, truncate);
        if (written)
            ++loggedLines;
        else
            writeError = errno;
    }
    if (!hasListeners) return;
    NotifyListeners(text, key);
    if (!written) {
        NotifyListeners(String("!!! Log write failed (") + String(std::strerror(writeError)) +
                            "): " + String(fileName),
                        String());
    }
}

void LogFile::NotifyListeners(const String& text, const String& key) {
    CriticalSection section(kLogListeners);
    for (const auto& listener : listeners) listener->WriteLog(text, key);
}

void LogFile::AddLogListener(boost::shared_ptr<LogInterface> listener) {
    CriticalSection section(kLogListeners);
    listeners.push_back(std::move(listener));
    hasListeners = true;
}

void LogFile::RemoveLogListener(boost::shared_ptr<LogInterface> listener) {
    CriticalSection section(kLogListeners);
    listeners.remove(listener);
    hasListeners = !listeners.empty();
}

void LogFile::RemoveListeners() {
    CriticalSection section(kLogListeners);
    listeners.clear();
    hasListeners = false;
}

void LogFile::WriteStackTrace() {
    if (!IsLogOptionEnabled(String("StackTrace"))) return;
    std::ostringstream trace;
    trace << boost::stacktrace::stacktrace();
    WriteLog(String("\nStackTrace:\n") + String(trace.str()), String("StackTrace"));
}

void LogFile::LogAvailableStack(const String& text) {
    if (!IsLogOptionEnabled(String("AvailableStack"))) return;
    WriteLog(String("AvailableStack: ") + text + " " +
                 String::CreateFromInt(AvailableStackBytes()) + " bytes",
             String("AvailableStack"));
}

void LogFile::UpdateInfo(const String& name, const String& value) {
    WriteLog(name + ": " + value, String("Info"));
}

// ---- AutoLog ----

std::atomic<unsigned short> AutoLog::smIndent{0};
std::atomic<std::uint32_t> AutoLog::smAutoLogCounter{0};

AutoLog::AutoLog(const String& text, const String& key) {
    amOwnedLog = LogFile::Instance();
    pLog = amOwnedLog.get();
    StartBlock(text, key);
}

AutoLog::AutoLog(LogInterface* log, const String& text, const String& key) : pLog(log) {
    StartBlock(text, key);
}

void AutoLog::StartBlock(const String& text, const String& key) {
    amText = text;
    amKey = key;
    if (pLog == nullptr || !pLog->IsLogOptionEnabled(key)) return;
    active = true;
    ++smAutoLogCounter;
    pLog->WriteLog(String("|->") + text, key);
    ++smIndent;
}

AutoLog::~AutoLog() {
    if (!active) return;
    --smIndent;
    pLog->WriteLog(String("|<-") + amText, amKey);
}

void AutoLog::Log(const String& text) {
    WriteLog(text);
}

void AutoLog::WriteLog(const String& text) {
    if (active && pLog != nullptr) pLog->WriteLog(text, amKey);
}

unsigned short AutoLog::GetIndent() {
    return smIndent.load();
}

String AutoLog::GetIndentString() {
    return String(std::string(2u * smIndent.load(), ' '));
}

std::uint32_t AutoLog::GetAutoLogCounter() {
    return smAutoLogCounter.load();
}

std::atomic<std::uint64_t> nxbase::CachedLogOption::smVersion{1};

bool nxbase::CachedLogOption::LookUp() {
    // Read the version before the options: a change in between leaves a stale
    // version behind, and the next call looks again.
    const std::uint64_t version = smVersion.load(std::memory_order_acquire);
    const bool enabled = LogFile::Instance()->IsLogOptionEnabled(amKey);
    amState.store((version << 1) | (enabled ? 1 : 0), std::memory_order_relaxed);
    return enabled;
}
