// Config is the toolkit's INI file: groups of named string keys in one text
// file, kept in file order with their comments. One Config object belongs to
// one thread; any number of objects and processes may share one file.
//
// Rules of the file:
// - Group and key names compare case-insensitively (ASCII) and keep the case
//   they were first written with.
// - Reads see the file as it is now: a read reloads the file when it changed
//   on disk (checked by one stat()).
// - Every write takes an exclusive flock() on "<file>.lock" beside the file,
//   re-reads the file, applies the one change and replaces the file with
//   toolkit::ReplaceFile (temporary file in the same directory, fsync,
//   rename), so a crash leaves the old or the new file and two processes
//   writing different keys never lose each other's changes. A path that is a
//   symbolic link stays one: the file it points to is replaced. The old
//   file's permissions and owner carry over; a file with several hard links,
//   or one whose owner cannot be given to the replacement, or a writable file
//   in a directory closed to new files is rewritten in place instead (not
//   atomic). A writer killed mid-write may leave its temporary file
//   ".<name>.XXXXXX" behind.
// - A malformed line (no "=", an empty key name, an unclosed "[") is skipped
//   and dropped by the next write; a missing file reads as empty.
// - A write that fails leaves the old file whole, reports one line through
//   the error sink (see SetErrorSink) and returns false.
#ifndef TOOLKIT_CONFIG_H_
#define TOOLKIT_CONFIG_H_

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "nxbase/export.h"
#include "toolkit/string.h"

class NXBASE_EXPORT Config {
  public:
    // Opens the INI file at `path` ("\" is taken as "/"); nothing is read or
    // created until the first operation.
    explicit Config(const String& path);
    ~Config();
    Config(const Config&) = delete;
    Config& operator=(const Config&) = delete;

    const String& GetPathName() const;

    // Selects the group that the key operations below address. The empty
    // name addresses keys standing before the first group header.
    void SetGroup(const String& group);
    const String& GetGroup() const;

    // The value of `key` in the selected group, or `defaultValue`.
    String ReadKey(const String& key, const String& defaultValue = String());
    // Creates or overwrites `key` in the selected group (creating the group).
    // A key name that cannot stand in an INI file (empty, with "=", a line
    // break, a leading "[", ";" or "#", or blanks around it) and a value with
    // a line break are refused. Values lose leading and trailing blanks, as
    // every INI reader trims them.
    bool WriteKey(const String& key, const String& value);
    // Removes `key` from the selected group; true if the file holds no such
    // key afterwards.
    bool DeleteKey(const String& key);
    // Removes the group with all its keys; true if the file holds no such
    // group afterwards.
    bool DeleteGroup(const String& group);

    // Keys of the selected group, in file order.
    std::uint16_t GetKeyCount();
    // The name of the key at `index` in file order, "" past the end.
    String GetKeyName(std::uint16_t index);
    // The value of the key at `index` in file order, "" past the end.
    String ReadKey(std::uint16_t index);

    // Every key of the selected group with its value, in file order: the
    // same as GetKeyName and ReadKey by index, with one look at the file.
    std::vector<std::pair<String, String>> ReadGroup();

    // Groups of the file, in file order.
    std::uint16_t GetGroupCount();
    String GetGroupName(std::uint16_t index);
    bool HasGroup(const String& group);

    // The reason of the last failed write, "" after a successful one.
    const std::string& GetLastError() const;

    // Where failed writes are reported (one line each); the library routes
    // them to its log. Null restores the default, which writes to stderr.
    // Returns the previous sink. Any thread may call it.
    using ErrorSink = std::function<void(const std::string& line)>;
    static ErrorSink SetErrorSink(ErrorSink sink);

  private:
    struct Impl;
    std::unique_ptr<Impl> pImpl;
};

#endif  // TOOLKIT_CONFIG_H_
