// File-name helpers of the configuration subsystem. Pure functions; any
// thread may call them.
#ifndef NXBASE_FILES_H_
#define NXBASE_FILES_H_

#include <string>
#include <string_view>

#include "nxbase/export.h"
#include "toolkit/string.h"

// `asName` made usable as a file name on every system the family's files
// travel to: each character that Windows or Linux forbids in a name
// (\ / : * ? " < > | and control characters) becomes "_", trailing blanks and
// dots become "_" as well (so "." and ".." cannot result), and an empty name
// becomes "_".
NXBASE_EXPORT String MakeValidFileName(const String& asName);

namespace nxbase {

// Writes `content` as the whole of the file at `path`, so that the file is
// either the old one or the complete new one, never a part (links, owners,
// permissions and special files as toolkit::ReplaceFile says). Throws
// std::runtime_error "cannot write <path>: <reason>" on failure, leaving no
// temporary file behind.
NXBASE_EXPORT void WriteWholeFile(const std::string& path, std::string_view content);

// The directory of the data files shipped with the library (the texts in
// "lng/"): <prefix>/share/nxbase beside the installed library, found from
// where the library is loaded, so that any install prefix works; in a build
// tree, the sources' data directory. "" when neither exists.
NXBASE_EXPORT std::string LibraryDataDirectory();

}  // namespace nxbase

#endif  // NXBASE_FILES_H_
