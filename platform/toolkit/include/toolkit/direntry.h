// DirEntry is the toolkit's path value: a file or directory name that may or
// may not exist. Windows applications' "\" separators are taken as "/". A
// DirEntry is a value; distinct objects may be used on distinct threads.
#ifndef TOOLKIT_DIRENTRY_H_
#define TOOLKIT_DIRENTRY_H_

#include <filesystem>
#include <string>

#include "nxbase/export.h"
#include "toolkit/string.h"

class NXBASE_EXPORT DirEntry {
  public:
    DirEntry() = default;
    explicit DirEntry(const String& path);
    explicit DirEntry(const std::string& path);
    explicit DirEntry(const char* path);
    explicit DirEntry(const std::filesystem::path& path);

    // The whole path as given (normalised separators, no trailing "/").
    String GetFull() const;
    // The last name ("app" of "/opt/k/bin/app"); "" for "/".
    String GetName() const;
    // The name without its last extension ("app" of "app.ini").
    String GetBase() const;
    // The last extension without the dot ("ini"), "" when none.
    String GetExtension() const;
    // The entry without its last name: "/opt/k/bin" of "/opt/k/bin/app", "/"
    // of "/opt", "" of a bare name.
    DirEntry GetPath() const;

    // Appends `child` as a further name ("LNG" to "/opt/k" gives "/opt/k/LNG").
    DirEntry& operator+=(const DirEntry& child);
    friend DirEntry operator+(DirEntry parent, const DirEntry& child) { return parent += child; }

    bool Exists() const;
    bool IsDirectory() const;
    // Creates this directory (one level); true if it exists afterwards.
    bool MakeDir() const;
    // Creates this directory with every missing parent; true if it exists
    // afterwards.
    bool MakeDirs() const;

    // The mount point of the file system holding this entry (of its nearest
    // existing ancestor when it does not exist); "/" when unknown.
    DirEntry GetMountPoint() const;

    // Copies this file to `target` unless `target` exists, never replacing a
    // file that another process creates meanwhile (the copy is linked into
    // place). True if `target` exists afterwards.
    bool CopyToIfAbsent(const DirEntry& target) const;

    const std::filesystem::path& path() const { return amPath; }
    bool operator==(const DirEntry& other) const { return amPath == other.amPath; }
    bool operator!=(const DirEntry& other) const { return !(*this == other); }

  private:
    std::filesystem::path amPath;
};

namespace toolkit {

// The user's home directory: $HOME, else the password database; "" if unknown.
NXBASE_EXPORT std::string HomeDirectory();
// The user's configuration directory: $XDG_CONFIG_HOME when it is absolute
// (a relative one is invalid by the XDG base directory rules), else
// HomeDirectory() + "/.config", without a trailing "/"; "" if the home is
// unknown.
NXBASE_EXPORT std::string ConfigDirectory();

}  // namespace toolkit

#endif  // TOOLKIT_DIRENTRY_H_
