// The log line against its own floor: a bare open/append/close of the same
// bytes in the same program, and the cost of a disabled key.
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <unistd.h>

#include "interleaved.h"
#include "nxbase/logfile.h"
#include "test_util.h"

namespace {

// Same length as a written log line: stamp, tab, text, line feed.
const std::string kText = "Spectrum received from LumaServer, 36 values";

void BM_BareOpenWriteClose(benchmark::State& state) {
    nxtest::TempDir dir;
    std::string path = dir.File("bare.log");
    std::string line = "22.11.2026 - 10:00:00\t" + kText + "\n";
    for (auto _ : state) {
        int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
        benchmark::DoNotOptimize(::write(fd, line.data(), line.size()));
        ::close(fd);
    }
    state.SetItemsProcessed(state.iterations());
}

void BM_LogLineEnabledKey(benchmark::State& state) {
    nxtest::TempDir dir;
    nxtest::ScopedEnv path("NXBASE_LOG_PATH", dir.File("log.log"));
    LogFile log("bench");
    log.SetLogOption("Unlimited", true);
    log.SetLogOption("Measure", true);
    String text(kText), key("Measure");
    for (auto _ : state) log.WriteLog(text, key);
    state.SetItemsProcessed(state.iterations());
}

void BM_LogLineDisabledKey(benchmark::State& state) {
    nxtest::TempDir dir;
    nxtest::ScopedEnv path("NXBASE_LOG_PATH", dir.File("log.log"));
    LogFile log("bench");
    String text(kText), key("Quiet");
    for (auto _ : state) log.WriteLog(text, key);
    state.SetItemsProcessed(state.iterations());
}

// The same through the process log, as library code writes its lines.
void BM_WriteToLogDisabledKey(benchmark::State& state) {
    nxtest::TempDir dir;
    nxtest::ScopedEnv path("NXBASE_LOG_PATH", dir.File("log.log"));
    String text(kText), key("Quiet");
    for (auto _ : state) LogFile::WriteToLog(text, key);
    state.SetItemsProcessed(state.iterations());
}

// The yardstick for the disabled key: one look-up in a set of a few keys.
void BM_OneSetLookup(benchmark::State& state) {
    std::set<std::string, std::less<>> keys{"Startup", "Language", "Keys", "Measure",
                                            "Communication"};
    std::string key = "Quiet";
    for (auto _ : state) benchmark::DoNotOptimize(keys.find(key) != keys.end());
}

}  // namespace

int main(int argc, char** argv) {
    const std::vector<nxbench::Pair> pairs = {
        {"LogLineEnabledKey_vs_BareOpenWriteClose", BM_BareOpenWriteClose, BM_LogLineEnabledKey,
         false},
        {"LogLineDisabledKey_vs_OneSetLookup", BM_OneSetLookup, BM_LogLineDisabledKey, false},
        {"WriteToLogDisabledKey_vs_OneSetLookup", BM_OneSetLookup, BM_WriteToLogDisabledKey, false},
    };
    return nxbench::RunPairs(argc, argv, pairs, "line");
}
