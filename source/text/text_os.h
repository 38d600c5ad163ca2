// Operating-system seam of the text subsystem: whole-file reads, the
// environment, the C runtime locale and code-page conversion (iconv). Every
// function may be called from any thread; the locale functions change
// process-wide state.
#ifndef NXBASE_SOURCE_TEXT_TEXT_OS_H_
#define NXBASE_SOURCE_TEXT_TEXT_OS_H_

#include <cstddef>
#include <string>
#include <string_view>

namespace nxbase::detail {

// Largest file ReadWholeFile accepts; language files are a few hundred KB.
constexpr std::size_t kMaxReadFileBytes = std::size_t{256} << 20;

// Reads the whole file into `bytes`. False (and `bytes` empty) when the file
// cannot be opened or read, is not a regular file or exceeds kMaxReadFileBytes.
bool ReadWholeFile(const std::string& path, std::string& bytes);

// True when `path` names a regular file this process may read.
bool IsReadableFile(const std::string& path);

// The value of an environment variable, "" when unset.
std::string GetEnvironment(const char* name);

// The C runtime locale name of `category`, "" when unknown.
std::string QueryCLocale(int category);
// Sets `category` to `name` and returns the locale now in force, "" when the
// name is refused (the locale is then unchanged).
std::string SetCLocale(int category, const std::string& name);

// UTF-8 to Windows-1252. Each character the code page cannot hold, and each
// byte that is not part of a valid UTF-8 sequence, becomes one '?'.
std::string Utf8ToWindows1252(std::string_view utf8);

}  // namespace nxbase::detail

#endif  // NXBASE_SOURCE_TEXT_TEXT_OS_H_
