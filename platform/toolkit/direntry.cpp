#include "toolkit/direntry.h"

#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <system_error>
#include <vector>

#include "toolkit/system.h"

namespace {

// "\" to "/", repeated and trailing separators dropped ("/" stays "/").
std::filesystem::path Clean(const std::string& text) {
    std::string s = toolkit::NormalizePath(text);
    std::string out;
    out.reserve(s.size());
    for (char c : s) {
        if (c == '/' && !out.empty() && out.back() == '/') continue;
        out += c;
    }
    while (out.size() > 1 && out.back() == '/') out.pop_back();
    return std::filesystem::path(out);
}

}  // namespace

DirEntry::DirEntry(const String& path) : amPath(Clean(path.str())) {}
DirEntry::DirEntry(const std::string& path) : amPath(Clean(path)) {}
DirEntry::DirEntry(const char* path) : amPath(Clean(path ? path : "")) {}
DirEntry::DirEntry(const std::filesystem::path& path) : amPath(Clean(path.string())) {}

String DirEntry::GetFull() const {
    return String(amPath.string());
}

String DirEntry::GetName() const {
    return String(amPath.filename().string());
}

String DirEntry::GetBase() const {
    return String(amPath.stem().string());
}

String DirEntry::GetExtension() const {
    std::string ext = amPath.extension().string();
    return String(ext.empty() ? ext : ext.substr(1));
}

DirEntry DirEntry::GetPath() const {
    if (amPath == "/") return *this;
    return DirEntry(amPath.parent_path());
}

DirEntry& DirEntry::operator+=(const DirEntry& child) {
    if (amPath.empty()) {
        amPath = child.amPath;
    } else if (!child.amPath.empty()) {
        amPath = Clean((amPath / child.amPath.relative_path()).string());
    }
    return *this;
}

bool DirEntry::Exists() const {
    std::error_code ec;
    return std::filesystem::exists(amPath, ec);
}

bool DirEntry::IsDirectory() const {
    std::error_code ec;
    return std::filesystem::is_directory(amPath, ec);
}

bool DirEntry::MakeDir() const {
    std::error_code ec;
    std::filesystem::create_directory(amPath, ec);
    return IsDirectory();
}

bool DirEntry::MakeDirs() const {
    std::error_code ec;
    std::filesystem::create_directories(amPath, ec);
    return IsDirectory();
}

DirEntry DirEntry::GetMountPoint() const {
    namespace fs = std::filesystem;
    std::error_code ec;
    fs::path at = fs::absolute(amPath, ec);
    if (ec) return DirEntry("/");
    at = at.lexically_normal();
    struct stat st {};
    // The nearest existing ancestor...
    while (::stat(at.c_str(), &st) != 0) {
        if (at == at.root_path() || at.empty()) return DirEntry("/");
        at = at.parent_path();
    }
    // ...then up while the parent lies on the same device.
    while (at != at.root_path()) {
        fs::path parent = at.parent_path();
        struct stat up {};
        if (::stat(parent.c_str(), &up) != 0 || up.st_dev != st.st_dev) break;
        at = parent;
    }
    return DirEntry(at);
}

bool DirEntry::CopyToIfAbsent(const DirEntry& target) const {
    namespace fs = std::filesystem;
    std::error_code ec;
    if (fs::exists(target.amPath, ec)) return true;
    if (!fs::is_regular_file(amPath, ec)) return false;
    const std::string to = target.amPath.string();
    const std::string temp = to + ".copy." + std::to_string(::getpid());
    if (!fs::copy_file(amPath, temp, fs::copy_options::overwrite_existing, ec)) return false;
    (void)::link(temp.c_str(), to.c_str());
    ::unlink(temp.c_str());
    return fs::exists(target.amPath, ec);
}

namespace toolkit {

std::string HomeDirectory() {
    const char* home = std::getenv("HOME");
    if (home != nullptr && *home != '\0') return home;
    std::vector<char> buffer(16384);
    struct passwd entry {};
    struct passwd* found = nullptr;
    if (::getpwuid_r(::getuid(), &entry, buffer.data(), buffer.size(), &found) == 0 &&
        found != nullptr && found->pw_dir != nullptr) {
        return found->pw_dir;
    }
    return std::string();
}

std::string ConfigDirectory() {
    std::string base;
    if (const char* xdg = std::getenv("XDG_CONFIG_HOME"); xdg != nullptr && xdg[0] == '/') {
        base = xdg;
    } else {
        const std::string home = HomeDirectory();
        if (home.empty()) return home;
        base = home + "/.config";
    }
    while (base.size() > 1 && base.back() == '/') base.pop_back();
    return base;
}

}  // namespace toolkit
