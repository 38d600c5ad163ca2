// Repositories of the colorimetry data provider: illuminants, observers and
// density standards by name. The built-in tables are embedded in the library;
// further illuminants and density standards are read from the data directory
// $NXBASE_DATA_DIR on first request and kept for the life of the process.
// Every function may be called from any thread.
//
// Installed files (CSV, one header row, "," between fields, "." decimals):
//   $NXBASE_DATA_DIR/illuminants/<name>.csv   columns wavelength,value
//   $NXBASE_DATA_DIR/density/<file>_log10.csv columns wavelength,<ch>[,<ch>...]
// where <file> is the standard's name in lower case with blanks turned into
// "_" ("Status I" -> status_i_log10.csv, "DIN NB" -> din_nb_log10.csv) and the
// values are ISO 5-3 log10 spectral products (peak 5.000). Built-in names are
// never looked up on disk.
#ifndef KLUME_CMETRY_REPOSITORY_H_
#define KLUME_CMETRY_REPOSITORY_H_

#include <boost/shared_ptr.hpp>
#include <string>
#include <vector>

#include "klume/cmetry/data.h"
#include "nxbase/export.h"

namespace klume {
namespace cmetry {

// Receives the provider's diagnostic lines (a table that is missing or does
// not parse, a fallback to a default). The host application installs one at
// load time; without one the lines are dropped. Any thread may call the
// handler, so it must be thread-safe.
using MessageHandler = void (*)(const std::string& message);
// Installs `handler` (null: drop the lines) and returns the previous one.
NXBASE_EXPORT MessageHandler SetMessageHandler(MessageHandler handler);

class NXBASE_EXPORT IlluminantRepository {
  public:
    // The illuminant of that name: built in, or installed in the data
    // directory. An unknown name, or a file that does not parse, is logged
    // (with the file, line and reason) and yields GetDefault().
    static boost::shared_ptr<IIlluminant> Get(const std::string& name);
    // CIE illuminant D50.
    static boost::shared_ptr<IIlluminant> GetDefault();
    // The illuminant of that name, or an empty pointer with a message naming
    // the file, line and offending text stored in *error (when given).
    static boost::shared_ptr<IIlluminant> Find(const std::string& name,
                                               std::string* error = nullptr);
    static bool Exists(const std::string& name);
    // Names of the built-in illuminants.
    static std::vector<std::string> GetNames();
    // The built-in name meant by `name` in any letter case, with F1..F12 for
    // FL1..FL12 ("d65" -> "D65", "f2" -> "FL2"); other names unchanged.
    static std::string CanonicalName(const std::string& name);
    // Names of the illuminants installed in the data directory, sorted.
    static std::vector<std::string> GetInstalledNames();
    // Reads an illuminant table (the installed files' format) from `path` and
    // makes it available for the life of the process under the file's stem,
    // returned in *name. False with the reason in *error.
    static bool AddFile(const std::string& path, std::string* name, std::string* error);
};

class NXBASE_EXPORT ObserverRepository {
  public:
    // "2" (CIE 1931 2 degree) or "10" (CIE 1964 10 degree); an empty pointer
    // for any other name.
    static boost::shared_ptr<IObserver> Get(const std::string& name);
    // The 2 degree observer.
    static boost::shared_ptr<IObserver> GetDefault();
    static std::vector<std::string> GetNames();
};

class NXBASE_EXPORT DensityStandardRepository {
  public:
    // The standard of that name. Built in: "Status A", "Status T", "Status M",
    // "Status E" (ISO 5-3). "Status I", "DIN", "DIN NB", "SPI" and any other
    // name only when a table is installed. A missing standard is logged and
    // yields GetDefault().
    static boost::shared_ptr<IDensityStandard> Get(const std::string& name);
    // "Status E".
    static boost::shared_ptr<IDensityStandard> GetDefault();
    // True when Get(name) delivers that very standard (built in, or an
    // installed table that parses).
    static bool Exists(const std::string& name);
    // As Get, but an empty pointer and a message in *error for a missing or
    // unreadable standard.
    static boost::shared_ptr<IDensityStandard> Find(const std::string& name,
                                                    std::string* error = nullptr);
    // Names of the built-in standards.
    static std::vector<std::string> GetNames();
    // As IlluminantRepository::AddFile for a density table; a "_log10" ending
    // of the stem is dropped from the name.
    static bool AddFile(const std::string& path, std::string* name, std::string* error);
};

}  // namespace cmetry
}  // namespace klume

#endif  // KLUME_CMETRY_REPOSITORY_H_
