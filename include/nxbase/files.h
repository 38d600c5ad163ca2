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
// either the old one or the complete new one, never a part:
// - a regular file (or a missing one) is replaced through a temporary file
//   in its directory, synced and renamed over it; an existing file keeps its
//   permissions and its owner. The file is rewritten in place instead, which
//   is not atomic, when it has more than one hard link (so that every name
//   sees the new content), when its owner cannot be given to the
//   replacement, or when the directory cannot take the temporary file but
//   the file itself is writable.
// - a symbolic link is followed to its final target, which is replaced as
//   above; the link stays a link.
// - anything else (a FIFO, a terminal, /dev/null, /dev/full) is opened and
//   written directly, never replaced by a plain file.
// Every write is checked; throws std::runtime_error naming the file and the
// reason on failure, leaving no temporary file behind.
NXBASE_EXPORT void WriteWholeFile(const std::string& path, std::string_view content);

// The directory of the data files shipped with the library (the texts in
// "lng/"): <prefix>/share/nxbase beside the installed library, found from
// where the library is loaded, so that any install prefix works; in a build
// tree, the sources' data directory. "" when neither exists.
NXBASE_EXPORT std::string LibraryDataDirectory();

}  // namespace nxbase

#endif  // NXBASE_FILES_H_
