#include "klume/cmetry/repository.h"

#include <algorithm>
#include <atomic>
#include <cctype>
#include <cstdlib>
#include <filesystem>
#include <map>
#include <mutex>
#include <utility>

#include "csvtable.h"
#include "embedded.h"
#include "objects.h"
#include "toolkit/string.h"

namespace klume {
namespace cmetry {

namespace {

constexpr const char* kDefaultIlluminant = "D50";
constexpr const char* kDefaultObserver = "2";
constexpr const char* kDefaultDensityStandard = "Status E";
constexpr const char* kDataDirVariable = "NXBASE_DATA_DIR";
// Longest name looked up as a file.
constexpr std::size_t kMaxFileNameLength = 64;

std::string IlluminantDescription(const std::string& name) {
    if (name == "A" || name == "D65") return "CIE standard illuminant " + name;
    if (name == "E") return "CIE equal-energy illuminant E";
    if (name.compare(0, 2, "FL") == 0) return "CIE illuminant F" + name.substr(2);
    return "CIE illuminant " + name;
}

struct BuiltIns {
    std::map<std::string, boost::shared_ptr<IIlluminant>> illuminants;
    std::map<std::string, boost::shared_ptr<IObserver>> observers;
    std::map<std::string, boost::shared_ptr<IDensityStandard>> standards;
    std::vector<std::string> illuminantNames;
    std::vector<std::string> observerNames;
    std::vector<std::string> standardNames;
};

std::vector<std::string> SplitHeader(const char* header) {
    std::vector<std::string> names;
    std::string current;
    for (const char* p = header; *p != '\0'; ++p) {
        if (*p == ',') {
            names.push_back(current);
            current.clear();
        } else {
            current += *p;
        }
    }
    names.push_back(current);
    return names;
}

// Constant-initialised, so it is in place before any static constructor runs.
std::atomic<MessageHandler> gMessageHandler{nullptr};

void Report(const std::string& message) {
    const MessageHandler handler = gMessageHandler.load();
    if (handler != nullptr) handler(message);
}

// A handle that does not own: the repositories keep every table they hand
// out for the life of the process, so handles need no reference count, and
// colour values that carry them copy without atomic operations (copies on
// many threads would otherwise contend for one counter).
template <typename T>
boost::shared_ptr<T> Unowned(const boost::shared_ptr<T>& table) {
    return boost::shared_ptr<T>(boost::shared_ptr<T>(), table.get());
}

// Made once, on first use; read-only afterwards, never destroyed (handles
// may be used until the very end of the process).
const BuiltIns& GetBuiltIns() {
    static const BuiltIns* builtIns = new BuiltIns([] {
        BuiltIns b;
        for (int i = 0; i < embedded::kObserversCount; ++i) {
            const embedded::EmbeddedTable& t = embedded::kObservers[i];
            long long field = 0;
            toolkit::ParseWholeInteger(t.key, field);
            const std::string description =
                field == 2 ? "CIE 1931 2 degree standard colorimetric observer"
                           : "CIE 1964 10 degree supplementary standard colorimetric observer";
            b.observers[t.key] = detail::MakeObserver(t, description, static_cast<int>(field));
            b.observerNames.push_back(t.key);
        }
        for (int i = 0; i < embedded::kIlluminantsCount; ++i) {
            const embedded::EmbeddedTable& t = embedded::kIlluminants[i];
            std::vector<double> wavelengths;
            std::vector<double> powers;
            for (int row = 0; row < t.rows; ++row) {
                wavelengths.push_back(t.values[row * t.columns]);
                powers.push_back(t.values[row * t.columns + 1]);
            }
            b.illuminants[t.key] = MakeIlluminant(t.key, IlluminantDescription(t.key),
                                                  std::move(wavelengths), std::move(powers));
            b.illuminantNames.push_back(t.key);
        }
        for (int i = 0; i < embedded::kDensityStandardsCount; ++i) {
            const embedded::EmbeddedTable& t = embedded::kDensityStandards[i];
            std::vector<std::string> columns = SplitHeader(t.header);
            columns.erase(columns.begin());
            std::vector<double> wavelengths;
            std::vector<std::vector<double>> products(columns.size());
            for (int row = 0; row < t.rows; ++row) {
                wavelengths.push_back(t.values[row * t.columns]);
                for (std::size_t c = 0; c < columns.size(); ++c) {
                    products[c].push_back(t.values[row * t.columns + 1 + static_cast<int>(c)]);
                }
            }
            std::string error;
            b.standards[t.key] =
                detail::MakeDensityStandard(t.key, columns, wavelengths, products, error);
            b.standardNames.push_back(t.key);
        }
        return b;
    }());
    return *builtIns;
}

// Installed tables, by path; parsed once per process.
struct InstalledCache {
    std::mutex mutex;
    std::map<std::string, boost::shared_ptr<IIlluminant>> illuminants;
    std::map<std::string, boost::shared_ptr<IDensityStandard>> standards;
    // Tables added from a path (AddFile), by the name they were given.
    std::map<std::string, boost::shared_ptr<IIlluminant>> addedIlluminants;
    std::map<std::string, boost::shared_ptr<IDensityStandard>> addedStandards;
};

InstalledCache& GetInstalled() {
    static InstalledCache* cache = new InstalledCache;  // never destroyed, as GetBuiltIns
    return *cache;
}

bool SetError(std::string* error, std::string text) {
    if (error != nullptr) *error = std::move(text);
    return false;
}

// The data directory, or "" when none is set.
std::string DataDirectory() {
    const char* dir = std::getenv(kDataDirVariable);
    return dir == nullptr ? std::string() : std::string(dir);
}

// Names that may become file names: letters, digits, blank, "_", "-", ".",
// not starting with "." and not too long.
bool IsSafeFileName(const std::string& name) {
    if (name.empty() || name.size() > kMaxFileNameLength || name[0] == '.') return false;
    for (char c : name) {
        const unsigned char u = static_cast<unsigned char>(c);
        if (!(std::isalnum(u) || c == ' ' || c == '_' || c == '-' || c == '.')) return false;
    }
    return true;
}

std::string DensityFileStem(const std::string& name) {
    std::string stem;
    for (char c : name) {
        const unsigned char u = static_cast<unsigned char>(c);
        stem += c == ' ' ? '_' : static_cast<char>(std::tolower(u));
    }
    return stem;
}

bool LoadTable(const std::string& path, std::size_t minColumns, detail::CsvTable& table,
               std::string* error) {
    std::string text;
    std::string message;
    if (!detail::ReadTableFile(path, text, message) ||
        !detail::ParseCsvTable(text, path, minColumns, table, message)) {
        return SetError(error, message);
    }
    return true;
}

}  // namespace

MessageHandler SetMessageHandler(MessageHandler handler) {
    return gMessageHandler.exchange(handler);
}

namespace {

// What differs between the two kinds of table that may be installed or added
// from a file: where they live, how a file is read into one, the words of
// their messages.
template <typename T>
struct Kind;

template <>
struct Kind<IIlluminant> {
    static constexpr const char* kTitle = "Illuminant";
    static constexpr const char* kDefault = kDefaultIlluminant;
    static auto& BuiltIn() { return GetBuiltIns().illuminants; }
    static auto& Installed(InstalledCache& cache) { return cache.illuminants; }
    static auto& Added(InstalledCache& cache) { return cache.addedIlluminants; }
    static std::string Unknown(const std::string& name) {
        return "unknown illuminant \"" + name + "\"";
    }
    static std::string NotInstalled(const std::string& name) {
        return Unknown(name) + " (" + kDataDirVariable + " not set)";
    }
    static std::string PathOf(const std::string& dir, const std::string& name) {
        return dir + "/illuminants/" + name + ".csv";
    }
    static std::string NameOf(const std::string& path) {
        return std::filesystem::path(path).stem().string();
    }
    static boost::shared_ptr<IIlluminant> Make(const std::string& name, const std::string& path,
                                               detail::CsvTable& table, std::string& message) {
        if (table.columns.size() != 2) {
            message = "expected the columns wavelength,value";
            return {};
        }
        return MakeIlluminant(name, "Illuminant " + name + " (" + path + ")",
                              std::move(table.wavelengths), std::move(table.values[0]), &message);
    }
};

template <>
struct Kind<IDensityStandard> {
    static constexpr const char* kTitle = "Density standard";
    static constexpr const char* kDefault = kDefaultDensityStandard;
    static auto& BuiltIn() { return GetBuiltIns().standards; }
    static auto& Installed(InstalledCache& cache) { return cache.standards; }
    static auto& Added(InstalledCache& cache) { return cache.addedStandards; }
    static std::string Unknown(const std::string& name) {
        return "unknown density standard \"" + name + "\"";
    }
    static std::string NotInstalled(const std::string& name) {
        return "density standard \"" + name + "\" is not installed (" + kDataDirVariable +
               " not set)";
    }
    static std::string PathOf(const std::string& dir, const std::string& name) {
        return dir + "/density/" + DensityFileStem(name) + "_log10.csv";
    }
    static std::string NameOf(const std::string& path) {
        std::string stem = std::filesystem::path(path).stem().string();
        const std::string suffix = "_log10";
        if (stem.size() > suffix.size() &&
            stem.compare(stem.size() - suffix.size(), suffix.size(), suffix) == 0) {
            stem.resize(stem.size() - suffix.size());
        }
        return stem;
    }
    static boost::shared_ptr<IDensityStandard> Make(const std::string& name, const std::string&,
                                                    detail::CsvTable& table, std::string& message) {
        std::vector<std::string> channels(table.columns.begin() + 1, table.columns.end());
        return detail::MakeDensityStandard(name, channels, table.wavelengths, table.values,
                                           message);
    }
};

// A built-in table, one added from a file, or one installed in the data
// directory (read once per process).
template <typename T>
boost::shared_ptr<T> FindTable(const std::string& name, std::string* error) {
    const auto builtIn = Kind<T>::BuiltIn().find(name);
    if (builtIn != Kind<T>::BuiltIn().end()) return Unowned(builtIn->second);
    InstalledCache& cache = GetInstalled();
    {
        std::lock_guard<std::mutex> lock(cache.mutex);
        const auto added = Kind<T>::Added(cache).find(name);
        if (added != Kind<T>::Added(cache).end()) return Unowned(added->second);
    }
    if (!IsSafeFileName(name)) {
        SetError(error, Kind<T>::Unknown(name));
        return {};
    }
    const std::string dir = DataDirectory();
    if (dir.empty()) {
        SetError(error, Kind<T>::NotInstalled(name));
        return {};
    }
    const std::string path = Kind<T>::PathOf(dir, name);
    std::lock_guard<std::mutex> lock(cache.mutex);
    const auto cached = Kind<T>::Installed(cache).find(path);
    if (cached != Kind<T>::Installed(cache).end()) return Unowned(cached->second);
    detail::CsvTable table;
    if (!LoadTable(path, 2, table, error)) return {};
    std::string message;
    boost::shared_ptr<T> made = Kind<T>::Make(name, path, table, message);
    if (!made) {
        SetError(error, path + ": " + message);
        return {};
    }
    Kind<T>::Installed(cache)[path] = made;
    return Unowned(made);
}

template <typename T>
bool AddTableFile(const std::string& path, std::string* name, std::string* error) {
    detail::CsvTable table;
    if (!LoadTable(path, 2, table, error)) return false;
    const std::string added = Kind<T>::NameOf(path);
    std::string message;
    boost::shared_ptr<T> made = Kind<T>::Make(added, path, table, message);
    if (!made) return SetError(error, path + ": " + message);
    InstalledCache& cache = GetInstalled();
    std::lock_guard<std::mutex> lock(cache.mutex);
    Kind<T>::Added(cache)[added] = made;
    *name = added;
    return true;
}

// The table, or the default one with a message saying why.
template <typename T>
boost::shared_ptr<T> TableOrDefault(const std::string& name) {
    std::string error;
    boost::shared_ptr<T> table = FindTable<T>(name, &error);
    if (table) return table;
    Report(std::string(Kind<T>::kTitle) + " \"" + name + "\" not available (" + error +
           "); using \"" + Kind<T>::kDefault + "\"");
    return Unowned(Kind<T>::BuiltIn().at(Kind<T>::kDefault));
}

}  // namespace

boost::shared_ptr<IIlluminant> IlluminantRepository::Find(const std::string& name,
                                                          std::string* error) {
    return FindTable<IIlluminant>(name, error);
}

bool IlluminantRepository::AddFile(const std::string& path, std::string* name, std::string* error) {
    return AddTableFile<IIlluminant>(path, name, error);
}

std::string IlluminantRepository::CanonicalName(const std::string& name) {
    std::string upper;
    for (char c : name) upper += static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
    if (upper.size() >= 2 && upper[0] == 'F' &&
        std::isdigit(static_cast<unsigned char>(upper[1]))) {
        upper.insert(1, "L");
    }
    const BuiltIns& b = GetBuiltIns();
    return b.illuminants.count(upper) != 0 ? upper : name;
}

std::vector<std::string> IlluminantRepository::GetInstalledNames() {
    std::vector<std::string> names;
    const std::string dir = DataDirectory();
    std::error_code ignored;
    if (dir.empty() || !std::filesystem::is_directory(dir + "/illuminants", ignored)) return names;
    for (const auto& entry : std::filesystem::directory_iterator(dir + "/illuminants", ignored)) {
        const std::filesystem::path& file = entry.path();
        if (file.extension() == ".csv" && IsSafeFileName(file.stem().string()))
            names.push_back(file.stem().string());
    }
    std::sort(names.begin(), names.end());
    return names;
}

boost::shared_ptr<IIlluminant> IlluminantRepository::Get(const std::string& name) {
    return TableOrDefault<IIlluminant>(name);
}

boost::shared_ptr<IIlluminant> IlluminantRepository::GetDefault() {
    return Unowned(GetBuiltIns().illuminants.at(kDefaultIlluminant));
}

bool IlluminantRepository::Exists(const std::string& name) {
    return static_cast<bool>(Find(name));
}

std::vector<std::string> IlluminantRepository::GetNames() {
    return GetBuiltIns().illuminantNames;
}

boost::shared_ptr<IObserver> ObserverRepository::Get(const std::string& name) {
    const BuiltIns& b = GetBuiltIns();
    const auto it = b.observers.find(name);
    return it == b.observers.end() ? boost::shared_ptr<IObserver>() : Unowned(it->second);
}

boost::shared_ptr<IObserver> ObserverRepository::GetDefault() {
    return Unowned(GetBuiltIns().observers.at(kDefaultObserver));
}

std::vector<std::string> ObserverRepository::GetNames() {
    return GetBuiltIns().observerNames;
}

boost::shared_ptr<IDensityStandard> DensityStandardRepository::Find(const std::string& name,
                                                                    std::string* error) {
    return FindTable<IDensityStandard>(name, error);
}

bool DensityStandardRepository::AddFile(const std::string& path, std::string* name,
                                        std::string* error) {
    return AddTableFile<IDensityStandard>(path, name, error);
}

boost::shared_ptr<IDensityStandard> DensityStandardRepository::Get(const std::string& name) {
    return TableOrDefault<IDensityStandard>(name);
}

boost::shared_ptr<IDensityStandard> DensityStandardRepository::GetDefault() {
    return Unowned(GetBuiltIns().standards.at(kDefaultDensityStandard));
}

bool DensityStandardRepository::Exists(const std::string& name) {
    return static_cast<bool>(Find(name));
}

std::vector<std::string> DensityStandardRepository::GetNames() {
    return GetBuiltIns().standardNames;
}

}  // namespace cmetry
}  // namespace klume
