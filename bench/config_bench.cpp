// CascadedConfig::ReadKey against an application and a user file of 200 keys
// each, next to its floor: a read checks both files for changes by one stat()
// each, so two stat() calls in the same program are the baseline.
#include <benchmark/benchmark.h>
#include <sys/stat.h>

#include <map>
#include <string>

#include "interleaved.h"
#include "nxbase/appconfig.h"
#include "nxbase/configuration.h"
#include "test_util.h"

namespace {

constexpr int kKeys = 200;

// Files of 200 keys in group "Measure"; the user file overrides every other
// key of the application's.
struct Files {
    Files() {
        std::string app = "[Other]\nx = 1\n[Measure]\n";
        std::string user = "[Measure]\n";
        for (int i = 0; i < kKeys; ++i) {
            app += "AppKey" + std::to_string(i) + " = app value " + std::to_string(i) + "\n";
            if (i % 2 == 0) {
                user += "AppKey" + std::to_string(i) + " = user value " + std::to_string(i) + "\n";
            } else {
                user += "UserKey" + std::to_string(i) + " = user value " + std::to_string(i) + "\n";
            }
        }
        nxtest::WriteFile(dir.File("app.ini"), app);
        nxtest::WriteFile(dir.File("user.ini"), user);
        AppConfig::CreateAppConfig(String(dir.path().string()), "app.ini");
        UserConfig::CreateUserConfig("user", String(dir.path().string()), "");
    }
    ~Files() { NxSingleton::DeleteAllSingleton(); }
    nxtest::TempDir dir;
};

void BM_TwoStatCalls(benchmark::State& state) {
    Files files;
    std::string app = files.dir.File("app.ini");
    std::string user = files.dir.File("user.ini");
    struct stat st {};
    for (auto _ : state) {
        benchmark::DoNotOptimize(::stat(app.c_str(), &st));
        benchmark::DoNotOptimize(::stat(user.c_str(), &st));
    }
    state.SetItemsProcessed(state.iterations());
}

// `which`: 0 the user's key, 1 the application's, 2 neither.
void CascadedReadKey(benchmark::State& state, int which) {
    Files files;
    const char* keys[] = {"AppKey100", "AppKey101", "NoSuchKey"};
    String group("Measure"), key(keys[which]), fallback("default");
    for (auto _ : state) benchmark::DoNotOptimize(CascadedConfig::ReadKey(group, key, fallback));
    state.SetItemsProcessed(state.iterations());
}

void BM_CascadedGetEntries(benchmark::State& state) {
    Files files;
    String group("Measure");
    for (auto _ : state) benchmark::DoNotOptimize(CascadedConfig::GetEntries(group));
    state.SetItemsProcessed(state.iterations());
}

}  // namespace

int main(int argc, char** argv) {
    const std::vector<nxbench::Pair> pairs = {
        {"CascadedReadKey_UserKey_vs_TwoStatCalls", BM_TwoStatCalls,
         [](benchmark::State& state) { CascadedReadKey(state, 0); }, false},
        {"CascadedReadKey_ApplicationKey_vs_TwoStatCalls", BM_TwoStatCalls,
         [](benchmark::State& state) { CascadedReadKey(state, 1); }, false},
        {"CascadedReadKey_MissingKey_vs_TwoStatCalls", BM_TwoStatCalls,
         [](benchmark::State& state) { CascadedReadKey(state, 2); }, false},
        {"CascadedGetEntries_vs_TwoStatCalls", BM_TwoStatCalls, BM_CascadedGetEntries, false},
    };
    return nxbench::RunPairs(argc, argv, pairs, "call");
}
