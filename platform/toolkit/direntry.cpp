#include "toolkit/direntry.h"

#include <system_error>

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

String DirEntry::GetFull() const { return String(amPath.string()); }

String DirEntry::GetName() const { return String(amPath.filename().string()); }

String DirEntry::GetBase() const { return String(amPath.stem().string()); }

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
