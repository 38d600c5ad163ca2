// nxreg: inspects and changes the registry hives of NxBase from the command
// line, and moves keys in and out as REGEDIT4 text.
#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <iostream>
#include <iterator>
#include <sstream>
#include <string>
#include <vector>

#include "nxbase/files.h"
#include "nxbase/registry.h"
#include "nxbase/strhelp.h"
#include "nxbase/version.h"
#include "toolkit/fileio.h"

namespace {

// Exit codes.
constexpr int kOk = 0;
constexpr int kNotFound = 1;
constexpr int kUsage = 2;
constexpr int kFailed = 3;

constexpr const char* kHelp =
    "Usage: nxreg <command> [arguments]\n"
    "\n"
    "Keys are written with their hive: HKEY_CURRENT_USER\\Software\\K-Lume\\...\n"
    "(or HKCU\\...), HKEY_LOCAL_MACHINE\\... (or HKLM\\...). Quote them in the shell.\n"
    "\n"
    "Commands:\n"
    "  list [-r] KEY               values and sub keys of KEY (-r: everything below)\n"
    "  get KEY NAME                print the value NAME of KEY\n"
    "  set KEY NAME TEXT           write a string value (creates the key)\n"
    "  set --dword KEY NAME N      write a DWORD value (decimal, or 0x hexadecimal)\n"
    "  delete KEY [NAME]           delete the value NAME, or KEY with everything below\n"
    "  export KEY [FILE]           write KEY and everything below as REGEDIT4 text\n"
    "                              (to standard output without FILE or with -)\n"
    "  import FILE                 apply REGEDIT4 text (- reads standard input)\n"
    "  log-options ROOT            the log options below ROOT\\Log in the user's hive\n"
    "  files                       the database file of each hive\n"
    "  --help                      this text\n"
    "  --version                   the version\n"
    "\n"
    "Hive files: HKEY_CURRENT_USER is $NXBASE_USER_REGISTRY, else\n"
    "$XDG_CONFIG_HOME/K-Lume/registry.sqlite; HKEY_LOCAL_MACHINE is\n"
    "$NXBASE_MACHINE_REGISTRY, else /etc/k-lume/registry.sqlite.\n"
    "\n"
    "Exit status: 0 done, 1 value or key not found, 2 bad usage, 3 failure.\n"
    "\n"
    "Examples:\n"
    "  sudo nxreg set 'HKLM\\Software\\K-Lume\\LumaServer' Executable /opt/k-lume/bin/LumaServer\n"
    "  sudo nxreg set 'HKLM\\Software\\K-Lume\\LumaServer' Path /opt/k-lume/bin\n"
    "  sudo nxreg set 'HKLM\\Software\\K-Lume\\LumaServer' Version 3.2\n"
    "  sudo nxreg set 'HKLM\\Software\\K-Lume\\ChromaLink\\Applications' ColorLab "
    "/opt/k-lume/bin/ColorLab\n"
    "  nxreg set 'HKCU\\Software\\K-Lume\\ColorLab\\Log' Startup 1\n"
    "  nxreg log-options 'Software\\K-Lume\\ColorLab'\n"
    "  nxreg export 'HKLM\\Software\\K-Lume' k-lume.reg\n";

class UsageError : public std::runtime_error {
  public:
    using std::runtime_error::runtime_error;
};

struct Key {
    nxbase::RegistryHive hive;
    std::string path;
    std::string Full() const {
        return std::string(nxbase::HiveName(hive)) + (path.empty() ? "" : "\\" + path);
    }
};

Key ParseKey(const std::string& asArgument) {
    Key key{nxbase::RegistryHive::CurrentUser, std::string()};
    if (!nxbase::SplitRegistryPath(asArgument, key.hive, key.path)) {
        throw UsageError("not a key of HKEY_CURRENT_USER or HKEY_LOCAL_MACHINE: " + asArgument);
    }
    return key;
}

std::uint32_t ParseDword(const std::string& asText) {
    std::string_view digits(asText);
    int base = 10;
    if (digits.substr(0, 2) == "0x" || digits.substr(0, 2) == "0X") {
        digits.remove_prefix(2);
        base = 16;
    }
    long long value = 0;
    if (digits.substr(0, 1) == "-" || !StringHelpers::ParseInteger(digits, value, base) ||
        value > UINT32_MAX) {
        throw UsageError("not a 32-bit unsigned number: " + asText);
    }
    return static_cast<std::uint32_t>(value);
}

std::string Describe(const nxbase::RegistryValue& axValue) {
    switch (axValue.type) {
        case nxbase::RegistryType::Dword:
            return "DWORD  " + std::to_string(axValue.dword);
        case nxbase::RegistryType::String:
            return "SZ     " + axValue.text;
        case nxbase::RegistryType::ExpandString:
            return "EXPAND " + axValue.text;
        case nxbase::RegistryType::MultiString:
            return "MULTI  " + axValue.ToString();
        default:
            return "BINARY " + axValue.ToString();
    }
}

void PrintKey(const Key& axKey) {
    for (const nxbase::RegistryValue& value :
         nxbase::RegistryStore::Values(axKey.hive, axKey.path)) {
        std::cout << "  " << (value.name.empty() ? "@" : value.name) << "  " << Describe(value)
                  << "\n";
    }
}

int List(std::vector<std::string> asArguments) {
    bool recursive = !asArguments.empty() && asArguments[0] == "-r";
    if (recursive) asArguments.erase(asArguments.begin());
    if (asArguments.size() != 1) throw UsageError("list takes one key");
    Key key = ParseKey(asArguments[0]);
    if (!nxbase::RegistryStore::KeyExists(key.hive, key.path)) {
        std::cerr << "nxreg: no key " << key.Full() << "\n";
        return kNotFound;
    }
    if (recursive) {
        for (const std::string& path : nxbase::RegistryStore::Tree(key.hive, key.path)) {
            Key below{key.hive, path};
            std::cout << below.Full() << "\n";
            PrintKey(below);
        }
        return kOk;
    }
    std::vector<std::string> tree = nxbase::RegistryStore::Tree(key.hive, key.path);
    if (!tree.empty()) key.path = tree.front();  // as stored, with its own case
    std::cout << key.Full() << "\n";
    PrintKey(key);
    for (const std::string& child : nxbase::RegistryStore::SubKeys(key.hive, key.path)) {
        std::cout << "  [" << child << "]\n";
    }
    return kOk;
}

int Get(const std::vector<std::string>& asArguments) {
    if (asArguments.size() != 2) throw UsageError("get takes a key and a value name");
    Key key = ParseKey(asArguments[0]);
    auto value = nxbase::RegistryStore::Read(key.hive, key.path, asArguments[1]);
    if (!value) {
        std::cerr << "nxreg: no value \"" << asArguments[1] << "\" in " << key.Full() << "\n";
        return kNotFound;
    }
    std::cout << value->ToString() << "\n";
    return kOk;
}

int Set(std::vector<std::string> asArguments) {
    bool dword = !asArguments.empty() && asArguments[0] == "--dword";
    if (dword) asArguments.erase(asArguments.begin());
    if (asArguments.size() != 3) throw UsageError("set takes a key, a value name and the data");
    Key key = ParseKey(asArguments[0]);
    nxbase::RegistryValue value =
        dword ? nxbase::RegistryValue::Dword(asArguments[1], ParseDword(asArguments[2]))
              : nxbase::RegistryValue::Text(asArguments[1], asArguments[2]);
    nxbase::RegistryStore::Write(key.hive, key.path, value);
    return kOk;
}

int Delete(const std::vector<std::string>& asArguments) {
    if (asArguments.empty() || asArguments.size() > 2) {
        throw UsageError("delete takes a key and optionally a value name");
    }
    Key key = ParseKey(asArguments[0]);
    if (asArguments.size() == 2) {
        if (nxbase::RegistryStore::DeleteValue(key.hive, key.path, asArguments[1])) return kOk;
        std::cerr << "nxreg: no value \"" << asArguments[1] << "\" in " << key.Full() << "\n";
        return kNotFound;
    }
    if (key.path.find_first_not_of('\\') == std::string::npos) {
        throw UsageError("refusing to delete a whole hive");
    }
    if (nxbase::RegistryStore::DeleteKey(key.hive, key.path)) return kOk;
    std::cerr << "nxreg: no key " << key.Full() << "\n";
    return kNotFound;
}

int Export(const std::vector<std::string>& asArguments) {
    if (asArguments.empty() || asArguments.size() > 2) {
        throw UsageError("export takes a key and optionally a file");
    }
    Key key = ParseKey(asArguments[0]);
    if (!key.path.empty() && !nxbase::RegistryStore::KeyExists(key.hive, key.path)) {
        std::cerr << "nxreg: no key " << key.Full() << "\n";
        return kNotFound;
    }
    std::string text = nxbase::ExportRegedit4(key.hive, key.path);
    if (asArguments.size() == 1 || asArguments[1] == "-") {
        std::cout << text;
        return kOk;
    }
    nxbase::WriteWholeFile(asArguments[1], text);
    return kOk;
}

// Registry text is never large: an import refuses more than this.
constexpr std::size_t kMaxImportBytes = 64u << 20;
// The first line must be complete within these bytes.
constexpr std::size_t kHeadBytes = 64u << 10;

// Appends up to `limit` more bytes of `fd` to `text`; true at the end of input.
bool ReadUpTo(int fd, std::string& text, std::size_t limit, const std::string& source) {
    const toolkit::ReadEnd end = toolkit::ReadUpTo(fd, limit, text);
    if (end == toolkit::ReadEnd::kError)
        throw std::runtime_error("cannot read " + source + ": " + std::strerror(errno));
    return end == toolkit::ReadEnd::kEnd;
}

int Import(const std::vector<std::string>& asArguments) {
    if (asArguments.size() != 1) throw UsageError("import takes one file");
    const std::string& file = asArguments[0];
    const std::string source = file == "-" ? "<stdin>" : file;
    toolkit::File opened;
    if (file != "-") {
        opened = toolkit::File(file, toolkit::File::Mode::kRead);
        if (!opened.IsOpen())
            throw std::runtime_error("cannot read " + file + ": " + std::strerror(errno));
    }
    const int fd = file == "-" ? 0 : opened.Descriptor();
    // The header is checked before the rest is read, so that a wrong file
    // is refused at once, whatever its size.
    std::string text;
    bool atEnd = ReadUpTo(fd, text, kHeadBytes, source);
    if (!nxbase::CheckRegedit4Header(text, atEnd, source)) {
        throw std::runtime_error(source +
                                 ":1: the first line must be REGEDIT4 (no line end within " +
                                 std::to_string(kHeadBytes >> 10) + " KiB)");
    }
    std::string beyond;
    if (!atEnd && !ReadUpTo(fd, text, kMaxImportBytes - text.size(), source) &&
        !ReadUpTo(fd, beyond, 1, source)) {
        throw std::runtime_error(source + ": more than " + std::to_string(kMaxImportBytes >> 20) +
                                 " MiB; registry text is never this large");
    }
    auto changes = nxbase::ParseRegedit4(text, source);
    nxbase::RegistryStore::Apply(changes);
    return kOk;
}

int LogOptions(const std::vector<std::string>& asArguments) {
    if (asArguments.size() != 1) throw UsageError("log-options takes the registry root path");
    RegistryHandler::SetRootPath(asArguments[0]);
    std::cout << "HKEY_CURRENT_USER\\" << asArguments[0] << "\\Log\n";
    for (const auto& [name, value] : nxbase::ReadLogOptionsFromRegistry()) {
        bool enabled = value == "1" || value == "true";
        std::cout << "  " << name << " = " << value << (enabled ? "  (enabled)" : "  (disabled)")
                  << "\n";
    }
    return kOk;
}

int Files() {
    std::cout << "HKEY_CURRENT_USER  "
              << nxbase::RegistryHiveFile(nxbase::RegistryHive::CurrentUser)
              << "\nHKEY_LOCAL_MACHINE "
              << nxbase::RegistryHiveFile(nxbase::RegistryHive::LocalMachine) << "\n";
    return kOk;
}

}  // namespace

// Every command's output must reach standard output whole: a full disk or a
// closed pipe is a failure, not a silent success.
int CheckedOutput(int alResult) {
    std::cout.flush();
    if (!std::cout || std::fflush(stdout) != 0 || std::ferror(stdout)) {
        std::cerr << "nxreg: cannot write to standard output\n";
        return kFailed;
    }
    return alResult;
}

int Run(const std::string& command, const std::vector<std::string>& arguments) {
    if (command == "--help" || command == "-h" || command == "help") {
        std::cout << kHelp;
        return kOk;
    }
    if (command == "--version") {
        std::cout << "nxreg (NxBase) " << nxbase::Version() << "\n";
        return kOk;
    }
    if (command == "list") return List(arguments);
    if (command == "get") return Get(arguments);
    if (command == "set") return Set(arguments);
    if (command == "delete") return Delete(arguments);
    if (command == "export") return Export(arguments);
    if (command == "import") return Import(arguments);
    if (command == "log-options") return LogOptions(arguments);
    if (command == "files" && arguments.empty()) return Files();
    throw UsageError("unknown command: " + command);
}

int main(int argc, char** argv) {
    std::vector<std::string> arguments(argv + 1, argv + argc);
    if (arguments.empty()) {
        std::cerr << kHelp;
        return kUsage;
    }
    std::string command = arguments[0];
    arguments.erase(arguments.begin());
    try {
        return CheckedOutput(Run(command, arguments));
    } catch (const UsageError& error) {
        std::cerr << "nxreg: " << error.what() << "\n(nxreg --help lists the commands)\n";
        return kUsage;
    } catch (const std::exception& error) {
        std::cerr << "nxreg: " << error.what() << "\n";
        return kFailed;
    }
}
