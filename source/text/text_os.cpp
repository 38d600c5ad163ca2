// The text subsystem's calls of the system; see text_os.h.
#include "text_os.h"

#include <clocale>
#include <cstdlib>

#include "toolkit/fileio.h"
#include "toolkit/string.h"

namespace nxbase::detail {

bool ReadWholeFile(const std::string& path, std::string& bytes) {
    std::string why;
    return toolkit::ReadWholeFile(path, kMaxReadFileBytes, bytes, why);
}

bool IsReadableFile(const std::string& path) {
    return toolkit::IsReadableFile(path);
}

std::string GetEnvironment(const char* name) {
    const char* value = std::getenv(name);
    return value != nullptr ? std::string(value) : std::string();
}

std::string QueryCLocale(int category) {
    const char* current = std::setlocale(category, nullptr);
    return current != nullptr ? std::string(current) : std::string();
}

std::string SetCLocale(int category, const std::string& name) {
    const char* result = std::setlocale(category, name.c_str());
    return result != nullptr ? std::string(result) : std::string();
}

// One converter for the whole library (the toolkit's): every byte of the
// code page has a character, so ANSI text survives the round trip.
std::string Utf8ToWindows1252(std::string_view utf8) {
    return toolkit::Utf8ToWindows1252(utf8);
}

}  // namespace nxbase::detail
