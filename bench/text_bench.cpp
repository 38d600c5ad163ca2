// Loading a language file of 20 000 lines (1 000 groups of 19 texts with
// line numbers), in ANSI and in UTF-8, against reading the same file and
// cutting it into lines as the baseline.
#include <benchmark/benchmark.h>

#include <fstream>
#include <sstream>
#include <string>

#include "interleaved.h"
#include "nxbase/text.h"
#include "test_util.h"

namespace {

constexpr int kGroups = 1000;
constexpr int kTextsPerGroup = 19;  // with the group line: 20 lines a group

std::string MakeTextFile(bool utf8) {
    std::string bytes = utf8 ? "; Encoding=UTF-8\r\n" : "";
    int line = 1;
    for (int g = 0; g < kGroups; ++g) {
        bytes += std::to_string(line++) + " {Group" + std::to_string(g) + "}\r\n";
        for (int t = 0; t < kTextsPerGroup; ++t) {
            bytes += std::to_string(line++) + " [";
            bytes += utf8 ? "Messger\xC3\xA4t nicht bereit [" : "Messger\xE4t nicht bereit [";
            bytes += std::to_string(t) + "], bitte pr" + (utf8 ? "\xC3\xBC" : "\xFC") +
                     "fen Sie die Verbindung]\r\n";
        }
    }
    return bytes;
}

class TextFiles {
  public:
    TextFiles() {
        nxtest::WriteFile(ansi(), MakeTextFile(false));
        nxtest::WriteFile(utf8(), MakeTextFile(true));
    }
    std::string ansi() const { return dir.File("Texte49.lng"); }
    std::string utf8() const { return dir.File("Texte33.lng"); }

  private:
    nxtest::TempDir dir;
};

TextFiles& Files() {
    static TextFiles files;
    return files;
}

void BM_ReadAndSplitLines(benchmark::State& state) {
    const std::string path = Files().ansi();
    for (auto _ : state) {
        std::ifstream in(path, std::ios::binary);
        std::size_t lines = 0;
        for (std::string line; std::getline(in, line);) lines += line.empty() ? 0 : 1;
        benchmark::DoNotOptimize(lines);
    }
    state.SetItemsProcessed(state.iterations() * kGroups * (kTextsPerGroup + 1));
}

void LoadText(benchmark::State& state, const std::string& path) {
    for (auto _ : state) {
        Text::FreeResources();
        bool loaded = Text::LoadText(String(path));
        benchmark::DoNotOptimize(loaded);
    }
    if (Text::GetEntryCount("Group999") != kTextsPerGroup) state.SkipWithError("file not parsed");
    state.SetItemsProcessed(state.iterations() * kGroups * (kTextsPerGroup + 1));
}

void BM_LoadTextAnsi(benchmark::State& state) {
    LoadText(state, Files().ansi());
}

void BM_LoadTextUtf8(benchmark::State& state) {
    LoadText(state, Files().utf8());
}

}  // namespace

int main(int argc, char** argv) {
    const std::vector<nxbench::Pair> pairs = {
        {"LoadTextAnsi_vs_ReadAndSplitLines", BM_ReadAndSplitLines, BM_LoadTextAnsi, false},
        {"LoadTextUtf8_vs_ReadAndSplitLines", BM_ReadAndSplitLines, BM_LoadTextUtf8, false},
    };
    return nxbench::RunPairs(argc, argv, pairs, "load of the file");
}
