#include "toolkit/config.h"

// Plain bytes in and out (no wide-character conversion); the template
// bodies are compiled here (Debian splits them behind SI_IMPLEMENTATION).
#define SI_NO_CONVERSION
#define SI_IMPLEMENTATION
#include <SimpleIni.h>
#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <iostream>
#include <list>
#include <mutex>
#include <vector>

#include "toolkit/eintr.h"
#include "toolkit/fileio.h"
#include "toolkit/system.h"

namespace {

// Case-insensitive (ASCII) INI store that keeps file order; single values per
// key, no multi-line values, no quote handling: the plain Windows INI dialect.
using Ini = CSimpleIniA;

std::mutex& SinkMutex() {
    static std::mutex mutex;
    return mutex;
}

Config::ErrorSink& Sink() {
    static Config::ErrorSink sink;
    return sink;
}

void Report(const std::string& line) {
    Config::ErrorSink sink;
    {
        std::lock_guard<std::mutex> lock(SinkMutex());
        sink = Sink();
    }
    if (sink) {
        sink(line);
    } else {
        std::cerr << line << '\n';
    }
}

std::string ErrnoText(const char* what) {
    int error = errno;
    return std::string(what) + ": " + std::strerror(error);
}

// Identity of the file as last loaded; a difference means someone replaced or
// changed it.
struct FileId {
    bool exists = false;
    dev_t dev = 0;
    ino_t ino = 0;
    off_t size = 0;
    long mtimeSec = 0;
    long mtimeNsec = 0;

    static FileId Of(const struct stat& st) {
        FileId id;
        id.exists = true;
        id.dev = st.st_dev;
        id.ino = st.st_ino;
        id.size = st.st_size;
        id.mtimeSec = static_cast<long>(st.st_mtim.tv_sec);
        id.mtimeNsec = static_cast<long>(st.st_mtim.tv_nsec);
        return id;
    }
    bool operator==(const FileId& o) const {
        return exists == o.exists && dev == o.dev && ino == o.ino && size == o.size &&
               mtimeSec == o.mtimeSec && mtimeNsec == o.mtimeNsec;
    }
    bool operator!=(const FileId& o) const { return !(*this == o); }
};

// Closes a descriptor on scope exit.
class Fd {
  public:
    explicit Fd(int fd = -1) : fd_(fd) {}
    ~Fd() { Reset(); }
    Fd(const Fd&) = delete;
    Fd& operator=(const Fd&) = delete;
    int get() const { return fd_; }
    void Reset(int fd = -1) {
        if (fd_ >= 0) ::close(fd_);
        fd_ = fd;
    }
    int Release() {
        int fd = fd_;
        fd_ = -1;
        return fd;
    }

  private:
    int fd_;
};

// Reads the whole file. A missing file gives an empty text and true; other
// failures give false with `error` set. `id` receives the file's identity.
bool ReadWhole(const std::string& path, std::string& text, FileId& id, std::string& error) {
    text.clear();
    id = FileId();
    Fd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    if (fd.get() < 0) {
        if (errno == ENOENT || errno == ENOTDIR) return true;
        error = ErrnoText(("cannot open \"" + path + "\"").c_str());
        return false;
    }
    struct stat st {};
    if (::fstat(fd.get(), &st) != 0) {
        error = ErrnoText("fstat");
        return false;
    }
    if (!S_ISREG(st.st_mode)) {
        error = "\"" + path + "\" is not a regular file";
        return false;
    }
    text.reserve(static_cast<std::size_t>(st.st_size));
    char buffer[65536];
    for (;;) {
        const ssize_t n =
            toolkit::RetryOnEintr([&] { return ::read(fd.get(), buffer, sizeof buffer); });
        if (n < 0) {
            error = ErrnoText(("cannot read \"" + path + "\"").c_str());
            return false;
        }
        if (n == 0) break;
        text.append(buffer, static_cast<std::size_t>(n));
    }
    id = FileId::Of(st);
    return true;
}

bool IsBlank(char c) {
    return c == ' ' || c == '\t';
}

// Whether one line (without its terminator) is blank, a comment, a group
// header or a key line. Anything else is malformed: a header without "]", a
// line without "=", an empty key name, a NUL byte.
bool IsWellFormed(const char* begin, const char* end) {
    if (std::find(begin, end, '\0') != end) return false;
    while (begin != end && IsBlank(*begin)) ++begin;
    if (begin == end || *begin == ';' || *begin == '#') return true;
    if (*begin == '[') return std::find(begin, end, ']') != end;
    const char* equals = std::find(begin, end, '=');
    return equals != end && equals != begin;
}

// Comment lines SimpleIni would drop, kept aside to be written back: those
// after the last group or key line (`after`), or every comment of a file
// without any group or key (`before`).
struct LooseComments {
    std::string before;
    std::string after;
    bool signature = false;  // the file began with a UTF-8 byte-order mark
};

// A UTF-8 byte-order mark: a signature at the start of a file, ordinary bytes
// anywhere else (even at the start of a key name).
const char kBom[] = "\xEF\xBB\xBF";

bool StartsWithBom(const std::string& text) {
    return text.compare(0, 3, kBom) == 0;
}

bool IsEntry(const std::string& line) {
    std::size_t first = line.find_first_not_of(" \t");
    return first != std::string::npos && line[first] != ';' && line[first] != '#';
}

// Hands SimpleIni the well-formed lines only, so that a malformed line is
// skipped on its own and never changes how the lines after it read (SimpleIni
// would file the keys after an unclosed "[" under a garbage group).
LooseComments Parse(Ini& ini, const std::string& text) {
    ini.Reset();
    std::vector<std::string> lines;
    LooseComments loose;
    loose.signature = StartsWithBom(text);
    const char* p = text.data() + (loose.signature ? 3 : 0);
    const char* const end = text.data() + text.size();
    while (p < end) {
        const char* eol = p;
        while (eol < end && *eol != '\n' && *eol != '\r') ++eol;
        if (IsWellFormed(p, eol)) lines.emplace_back(p, eol);
        // "\r\n", "\n" and a lone "\r" each end one line.
        if (eol + 1 < end && eol[0] == '\r' && eol[1] == '\n') ++eol;
        p = eol < end ? eol + 1 : end;
    }
    std::size_t lastEntry = lines.size();
    for (std::size_t i = lines.size(); i-- > 0;) {
        if (IsEntry(lines[i])) {
            lastEntry = i;
            break;
        }
    }
    std::string clean;
    clean.reserve(text.size());
    if (lastEntry == lines.size()) {
        for (const std::string& line : lines) {
            if (!loose.before.empty() || line.find_first_not_of(" \t") != std::string::npos) {
                loose.before += line + "\n";
            }
        }
    } else {
        for (std::size_t i = 0; i < lines.size(); ++i) {
            std::string& target = i <= lastEntry ? clean : loose.after;
            if (i > lastEntry && target.empty() && !IsEntry(lines[i]) &&
                lines[i].find_first_not_of(" \t") == std::string::npos) {
                continue;  // blank lines between the last key and a comment
            }
            target += lines[i];
            target += '\n';
        }
    }
    // SimpleIni takes a mark at the start of its data as the signature: keep
    // a key that merely begins with those bytes from starting the data.
    if (StartsWithBom(clean)) clean.insert(0, "\n");
    ini.LoadData(clean.data(), clean.size());
    return loose;
}

bool HasLineBreakOrNul(const std::string& s) {
    return s.find_first_of(std::string("\r\n\0", 3)) != std::string::npos;
}

// Whether a key name survives a write and a re-read unchanged.
bool IsStorableKey(const std::string& key) {
    if (key.empty() || HasLineBreakOrNul(key)) return false;
    if (key.find('=') != std::string::npos) return false;
    if (key.front() == '[' || key.front() == ';' || key.front() == '#') return false;
    return !IsBlank(key.front()) && !IsBlank(key.back());
}

bool IsStorableGroup(const std::string& group) {
    if (HasLineBreakOrNul(group) || group.find(']') != std::string::npos) return false;
    return group.empty() || (!IsBlank(group.front()) && !IsBlank(group.back()));
}

}  // namespace

struct Config::Impl {
    String pathName;
    std::string path;
    String group;
    std::unique_ptr<Ini> ini{new Ini(false, false, false)};
    bool loaded = false;
    FileId id;
    std::string lastError;

    // Key names of one group in file order, rebuilt when the store changes.
    bool orderValid = false;
    std::string orderGroup;
    std::vector<std::string> order;

    // Brings the store up to the file on disk; one stat() when unchanged.
    void Refresh() {
        struct stat st {};
        FileId now;
        if (::stat(path.c_str(), &st) == 0) now = FileId::Of(st);
        if (loaded && now == id) return;
        std::string text;
        std::string error;
        FileId readId;
        if (!ReadWhole(path, text, readId, error)) text.clear();
        Parse(*ini, text);
        id = readId;
        loaded = true;
        orderValid = false;
    }

    const std::vector<std::string>& KeyOrder() {
        Refresh();
        if (orderValid && orderGroup == group.str()) return order;
        order.clear();
        Ini::TNamesDepend keys;
        ini->GetAllKeys(group.GetBuffer(), keys);
        keys.sort(Ini::Entry::LoadOrder());
        for (const auto& key : keys) order.emplace_back(key.pItem);
        orderGroup = group.str();
        orderValid = true;
        return order;
    }

    bool Fail(const std::string& reason) {
        lastError = reason;
        Report("Cannot write configuration file \"" + path + "\": " + reason);
        return false;
    }

    // The write protocol: lock, re-read, change, replace the file (a
    // temporary file synced and renamed over it). The directory is not
    // synced: after a power loss the rename may be lost, which leaves the old
    // file, never a torn one. `change` returns false when the file needs no
    // rewrite. The lock is held until the new file's identity is read.
    template <class Change>
    bool Modify(Change change) {
        lastError.clear();
        // A symbolic link (a shared or managed file) stays a link: the file it
        // names is the one replaced.
        std::string target = path;
        struct stat link {};
        if (::lstat(path.c_str(), &link) == 0 && S_ISLNK(link.st_mode)) {
            if (char* real = ::realpath(path.c_str(), nullptr)) {
                target = real;
                std::free(real);
            }
        }
        Fd lock(::open((target + ".lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0666));
        if (lock.get() < 0) return Fail(ErrnoText("cannot open the lock file"));
        if (toolkit::RetryOnEintr([&] { return ::flock(lock.get(), LOCK_EX); }) != 0)
            return Fail(ErrnoText("cannot lock"));

        std::string text;
        FileId oldId;
        std::string error;
        if (!ReadWhole(target, text, oldId, error)) return Fail(error);
        std::unique_ptr<Ini> fresh(new Ini(false, false, false));
        const LooseComments loose = Parse(*fresh, text);
        if (!change(*fresh)) {
            ini = std::move(fresh);
            id = oldId;
            loaded = true;
            orderValid = false;
            return true;
        }

        std::string out;
        if (fresh->Save(out) != SI_OK) return Fail("cannot format the file");
        if (!loose.before.empty()) out = loose.before + (out.empty() ? "" : "\n") + out;
        if (!loose.after.empty()) out += (out.empty() ? "" : "\n") + loose.after;
        if (StartsWithBom(out)) out.insert(0, "\n");
        if (loose.signature) out.insert(0, kBom);

        std::string why;
        if (!toolkit::ReplaceFile(target, out, why)) return Fail(why);
        struct stat written {};
        if (::stat(target.c_str(), &written) != 0)
            return Fail(ErrnoText("cannot read the written file"));
        // Values are stored trimmed, so the saved text reads back as `fresh`.
        ini = std::move(fresh);
        id = FileId::Of(written);
        loaded = true;
        orderValid = false;
        return true;
    }
};

Config::Config(const String& path) : pImpl(new Impl) {
    pImpl->pathName = path;
    pImpl->path = toolkit::NormalizePath(path.str());
}

Config::~Config() = default;

const String& Config::GetPathName() const {
    return pImpl->pathName;
}

void Config::SetGroup(const String& group) {
    pImpl->group = group;
}

const String& Config::GetGroup() const {
    return pImpl->group;
}

String Config::ReadKey(const String& key, const String& defaultValue) {
    pImpl->Refresh();
    const char* value = pImpl->ini->GetValue(pImpl->group.GetBuffer(), key.GetBuffer(), nullptr);
    return value != nullptr ? String(value) : defaultValue;
}

bool Config::WriteKey(const String& key, const String& value) {
    const std::string group = pImpl->group.str();
    if (!IsStorableGroup(group))
        return pImpl->Fail("the group name \"" + group + "\" cannot be stored");
    if (!IsStorableKey(key.str()))
        return pImpl->Fail("the key name \"" + key.str() + "\" cannot be stored");
    if (HasLineBreakOrNul(value.str()))
        return pImpl->Fail("the value of \"" + key.str() + "\" has a line break");
    std::string trimmed = value.str();
    trimmed.erase(0, trimmed.find_first_not_of(" \t"));
    trimmed.erase(trimmed.find_last_not_of(" \t") + 1);
    return pImpl->Modify([&](Ini& ini) {
        const char* old = ini.GetValue(group.c_str(), key.GetBuffer(), nullptr);
        if (old != nullptr && trimmed == old) return false;
        return ini.SetValue(group.c_str(), key.GetBuffer(), trimmed.c_str()) >= 0;
    });
}

bool Config::DeleteKey(const String& key) {
    const std::string group = pImpl->group.str();
    return pImpl->Modify([&](Ini& ini) {
        if (ini.GetValue(group.c_str(), key.GetBuffer(), nullptr) == nullptr) return false;
        return ini.Delete(group.c_str(), key.GetBuffer(), false);
    });
}

bool Config::DeleteGroup(const String& group) {
    return pImpl->Modify([&](Ini& ini) {
        if (ini.GetSection(group.GetBuffer()) == nullptr) return false;
        return ini.Delete(group.GetBuffer(), nullptr, true);
    });
}

std::uint16_t Config::GetKeyCount() {
    std::size_t n = pImpl->KeyOrder().size();
    return static_cast<std::uint16_t>(std::min<std::size_t>(n, 0xFFFF));
}

String Config::GetKeyName(std::uint16_t index) {
    const auto& order = pImpl->KeyOrder();
    return index < order.size() ? String(order[index]) : String();
}

String Config::ReadKey(std::uint16_t index) {
    const auto& order = pImpl->KeyOrder();
    if (index >= order.size()) return String();
    const char* value = pImpl->ini->GetValue(pImpl->group.GetBuffer(), order[index].c_str(), "");
    return String(value);
}

std::vector<std::pair<String, String>> Config::ReadGroup() {
    const auto& order = pImpl->KeyOrder();
    std::vector<std::pair<String, String>> entries;
    entries.reserve(order.size());
    for (const std::string& key : order) {
        const char* value = pImpl->ini->GetValue(pImpl->group.GetBuffer(), key.c_str(), "");
        entries.emplace_back(String(key), String(value));
    }
    return entries;
}

std::uint16_t Config::GetGroupCount() {
    pImpl->Refresh();
    Ini::TNamesDepend groups;
    pImpl->ini->GetAllSections(groups);
    return static_cast<std::uint16_t>(std::min<std::size_t>(groups.size(), 0xFFFF));
}

String Config::GetGroupName(std::uint16_t index) {
    pImpl->Refresh();
    Ini::TNamesDepend groups;
    pImpl->ini->GetAllSections(groups);
    groups.sort(Ini::Entry::LoadOrder());
    if (index >= groups.size()) return String();
    auto it = groups.begin();
    std::advance(it, index);
    return String(it->pItem);
}

bool Config::HasGroup(const String& group) {
    pImpl->Refresh();
    return pImpl->ini->GetSection(group.GetBuffer()) != nullptr;
}

const std::string& Config::GetLastError() const {
    return pImpl->lastError;
}

Config::ErrorSink Config::SetErrorSink(ErrorSink sink) {
    std::lock_guard<std::mutex> lock(SinkMutex());
    ErrorSink previous = std::move(Sink());
    Sink() = std::move(sink);
    return previous;
}
