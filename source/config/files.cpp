#include "nxbase/files.h"

#include <dlfcn.h>

#include <cstring>
#include <filesystem>
#include <stdexcept>
#include <string>

#include "toolkit/fileio.h"

String MakeValidFileName(const String& asName) {
    std::string name = asName.str();
    for (char& c : name) {
        unsigned char u = static_cast<unsigned char>(c);
        if (u < 0x20 || u == 0x7F || std::strchr("\\/:*?\"<>|", c) != nullptr) c = '_';
    }
    // Windows drops trailing blanks and dots from names; keep them visible.
    for (auto it = name.rbegin(); it != name.rend() && (*it == ' ' || *it == '.'); ++it) *it = '_';
    if (name.empty()) name = "_";
    return String(name);
}

namespace nxbase {

void WriteWholeFile(const std::string& path, std::string_view content) {
    std::string why;
    if (!toolkit::ReplaceFile(path, content, why))
        throw std::runtime_error("cannot write " + path + ": " + why);
}

std::string LibraryDataDirectory() {
    std::error_code ignored;
    Dl_info info{};
    if (dladdr(reinterpret_cast<void*>(&LibraryDataDirectory), &info) != 0 &&
        info.dli_fname != nullptr) {
        const std::filesystem::path library =
            std::filesystem::weakly_canonical(info.dli_fname, ignored);
        const std::filesystem::path installed = library.parent_path() / NXBASE_LIBDIR_TO_DATADIR;
        if (std::filesystem::is_directory(installed, ignored))
            return installed.lexically_normal().string();
    }
    if (std::filesystem::is_directory(NXBASE_SOURCE_DATA_DIR, ignored))
        return NXBASE_SOURCE_DATA_DIR;
    return "";
}

}  // namespace nxbase
