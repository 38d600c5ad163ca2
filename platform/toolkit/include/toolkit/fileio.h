// Writing files so that nothing is half done: every byte of a write, or an
// error; a whole file replaced, or the old one kept. Any thread may call
// these.
#ifndef TOOLKIT_FILEIO_H_
#define TOOLKIT_FILEIO_H_

#include <string>
#include <string_view>

#include "nxbase/export.h"

namespace toolkit {

// Writes all of `bytes` to `fd`, going on after signals and short writes;
// false with errno set (EIO for a write that took nothing) on failure.
NXBASE_EXPORT bool WriteAll(int fd, std::string_view bytes);

// Makes `content` the whole of the file at `path`, so that readers see the
// old file or the complete new one, never a part:
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
// Every step is checked. On failure returns false with `why` saying what
// failed and why ("cannot open: Permission denied"), and leaves no temporary
// file behind; only a process killed while writing leaves its ".<name>.XXXXXX".
// A new file gets the mode open() gives under the process's umask.
NXBASE_EXPORT bool ReplaceFile(const std::string& path, std::string_view content, std::string& why);

}  // namespace toolkit

#endif  // TOOLKIT_FILEIO_H_
