// Fuzz target for the INI reader: any bytes read as a file must parse without
// crash or hang, and a write into that file must keep every key it read.
#include <stdlib.h>
#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <string>
#include <tuple>
#include <vector>

#include "toolkit/config.h"

namespace {

using Entry = std::tuple<std::string, std::string, std::string>;

std::vector<Entry> ReadAll(Config& config) {
    std::vector<Entry> entries;
    for (std::uint16_t g = 0; g < config.GetGroupCount(); ++g) {
        String group = config.GetGroupName(g);
        config.SetGroup(group);
        for (std::uint16_t k = 0; k < config.GetKeyCount(); ++k) {
            String key = config.GetKeyName(k);
            entries.emplace_back(group.str(), key.str(), config.ReadKey(key).str());
        }
    }
    return entries;
}

// One scratch directory per process, removed at exit.
struct ScratchDirectory {
    ScratchDirectory() {
        std::string base =
            (std::filesystem::temp_directory_path() / "nxbase-ini-fuzz-XXXXXX").string();
        std::vector<char> buffer(base.begin(), base.end());
        buffer.push_back('\0');
        if (::mkdtemp(buffer.data()) != nullptr) directory = buffer.data();
    }
    ~ScratchDirectory() {
        std::error_code ignored;
        if (!directory.empty()) std::filesystem::remove_all(directory, ignored);
    }
    std::string directory;
};

const std::string& ScratchFile() {
    static const ScratchDirectory scratch;
    static const std::string path =
        (scratch.directory.empty() ? std::string(".") : scratch.directory) + "/fuzz.ini";
    return path;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const std::string& path = ScratchFile();
    {
        std::ofstream out(path, std::ios::binary | std::ios::trunc);
        out.write(reinterpret_cast<const char*>(data), static_cast<std::streamsize>(size));
    }
    Config::SetErrorSink([](const std::string& line) {
        std::fprintf(stderr, "unexpected write failure: %s\n", line.c_str());
        std::abort();
    });

    Config config{String(path)};
    std::vector<Entry> before = ReadAll(config);

    config.SetGroup(before.empty() ? String("Fuzz") : String(std::get<0>(before.front())));
    if (!config.WriteKey("NxFuzzKey", "fuzz value")) std::abort();

    Config reread{String(path)};
    for (const auto& [group, key, value] : before) {
        reread.SetGroup(String(group));
        if (reread.ReadKey(String(key), String("\x01missing")).str() != value) {
            std::fprintf(stderr, "lost [%s] %s\n", group.c_str(), key.c_str());
            std::abort();
        }
    }
    reread.SetGroup(before.empty() ? String("Fuzz") : String(std::get<0>(before.front())));
    if (reread.ReadKey("nxfuzzkey").str() != "fuzz value") std::abort();
    return 0;
}
