// Registry point reads and autocommit writes against their floor: a raw
// SQLite loop (WAL, synchronous=NORMAL, one prepared statement, a plain
// key/value table) in the same program on the same disk, each pair run in
// interleaved rounds and timed in real time (the work waits on the file
// system, which CPU time leaves out). Two sizes: 1000
// values visited in turn (all in SQLite's page cache: "Cached1000"), and one
// million values in 1000 keys visited in random order ("Random1M", a 60 MB
// database whose pages mostly miss SQLite's cache; the files stay in the
// operating system's page cache).
#include <benchmark/benchmark.h>
#include <sqlite3.h>

#include <algorithm>
#include <random>
#include <string>
#include <vector>

#include "interleaved.h"
#include "nxbase/registry.h"
#include "test_util.h"

namespace {

using nxbase::RegistryHive;
using nxbase::RegistryStore;
using nxbase::RegistryValue;

constexpr int kValues = 1000;  // distinct values read or written in turn
constexpr int kLargeValues = 1000000;
constexpr int kLargeKeys = 1000;
const std::string kKey = "Software\\K-Lume\\Bench\\Settings";

std::string Name(int i) {
    return "Value" + std::to_string(i);
}

// ---- the raw SQLite floor ----

class RawSqlite {
  public:
    explicit RawSqlite(const std::string& path) {
        sqlite3_open_v2(path.c_str(), &db,
                        SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX, nullptr);
        sqlite3_exec(db,
                     "PRAGMA journal_mode = WAL; PRAGMA synchronous = NORMAL;"
                     "CREATE TABLE kv(k TEXT PRIMARY KEY, v TEXT) WITHOUT ROWID;",
                     nullptr, nullptr, nullptr);
        sqlite3_prepare_v2(db, "SELECT v FROM kv WHERE k = ?1", -1, &select, nullptr);
        sqlite3_prepare_v2(
            db, "INSERT INTO kv(k, v) VALUES(?1, ?2) ON CONFLICT(k) DO UPDATE SET v = excluded.v",
            -1, &upsert, nullptr);
    }
    ~RawSqlite() {
        sqlite3_finalize(select);
        sqlite3_finalize(upsert);
        sqlite3_close_v2(db);
    }
    void Write(const std::string& key, const std::string& value) {
        sqlite3_bind_text(upsert, 1, key.data(), static_cast<int>(key.size()), SQLITE_STATIC);
        sqlite3_bind_text(upsert, 2, value.data(), static_cast<int>(value.size()), SQLITE_STATIC);
        if (sqlite3_step(upsert) != SQLITE_DONE) std::abort();
        sqlite3_reset(upsert);
    }
    void Exec(const char* sql) { sqlite3_exec(db, sql, nullptr, nullptr, nullptr); }
    std::string Read(const std::string& key) {
        sqlite3_bind_text(select, 1, key.data(), static_cast<int>(key.size()), SQLITE_STATIC);
        std::string value;
        if (sqlite3_step(select) == SQLITE_ROW) {
            value = reinterpret_cast<const char*>(sqlite3_column_text(select, 0));
        }
        sqlite3_reset(select);
        return value;
    }

  private:
    sqlite3* db = nullptr;
    sqlite3_stmt* select = nullptr;
    sqlite3_stmt* upsert = nullptr;
};

void BM_RawSqlitePointRead_Cached1000(benchmark::State& state) {
    nxtest::TempDir dir;
    RawSqlite raw(dir.File("raw.sqlite"));
    std::vector<std::string> names;
    for (int i = 0; i < kValues; ++i) {
        names.push_back(kKey + "\\" + Name(i));
        raw.Write(names.back(), "some setting text");
    }
    int i = 0;
    for (auto _ : state) {
        benchmark::DoNotOptimize(raw.Read(names[i]));
        i = (i + 1) % kValues;
    }
    state.SetItemsProcessed(state.iterations());
}

void BM_RawSqliteAutocommitWrite_Cached1000(benchmark::State& state) {
    nxtest::TempDir dir;
    RawSqlite raw(dir.File("raw.sqlite"));
    std::vector<std::string> names;
    for (int i = 0; i < kValues; ++i) names.push_back(kKey + "\\" + Name(i));
    int i = 0;
    for (auto _ : state) {
        raw.Write(names[i], "some setting text");
        i = (i + 1) % kValues;
    }
    state.SetItemsProcessed(state.iterations());
}

// ---- one million values, random access ----

std::string LargeKey(int i) {
    return kKey + "\\K" + std::to_string(i / (kLargeValues / kLargeKeys));
}
std::string LargeName(int i) {
    return Name(i % (kLargeValues / kLargeKeys));
}

// A random visiting order, the same for every case.
const std::vector<int>& RandomOrder() {
    static const std::vector<int> order = [] {
        std::vector<int> o(kLargeValues);
        for (int i = 0; i < kLargeValues; ++i) o[i] = i;
        std::shuffle(o.begin(), o.end(), std::mt19937(11));
        return o;
    }();
    return order;
}

struct LargeRaw {
    nxtest::TempDir dir;
    RawSqlite raw{dir.File("raw-large.sqlite")};
    std::vector<std::string> names;
    LargeRaw() {
        raw.Exec("BEGIN");
        for (int i = 0; i < kLargeValues; ++i) {
            names.push_back(LargeKey(i) + "\\" + LargeName(i));
            raw.Write(names.back(), "some setting text");
        }
        raw.Exec("COMMIT");
    }
};

// The registry's hives with one million values, built once per process.
struct LargeRegistry {
    nxtest::TempDir dir;
    nxtest::ScopedEnv user{"NXBASE_USER_REGISTRY", dir.File("user-large.sqlite")};
    nxtest::ScopedEnv machine{"NXBASE_MACHINE_REGISTRY", dir.File("machine-large.sqlite")};
    LargeRegistry() {
        for (int i = 0; i < kLargeValues; ++i) {
            RegistryStore::Write(RegistryHive::CurrentUser, LargeKey(i),
                                 RegistryValue::Text(LargeName(i), "some setting text"));
        }
    }
};

LargeRaw& Raw1M() {
    static LargeRaw raw;
    return raw;
}

LargeRegistry& Registry1M() {
    static LargeRegistry registry;
    return registry;
}

void BM_RawSqlitePointRead_Random1M(benchmark::State& state) {
    LargeRaw& large = Raw1M();
    const std::vector<int>& order = RandomOrder();
    std::size_t i = 0;
    for (auto _ : state) {
        benchmark::DoNotOptimize(large.raw.Read(large.names[order[i]]));
        i = (i + 1) % order.size();
    }
    state.SetItemsProcessed(state.iterations());
}

void BM_RawSqliteAutocommitWrite_Random1M(benchmark::State& state) {
    LargeRaw& large = Raw1M();
    const std::vector<int>& order = RandomOrder();
    std::size_t i = 0;
    for (auto _ : state) {
        large.raw.Write(large.names[order[i]], "other setting text");
        i = (i + 1) % order.size();
    }
    state.SetItemsProcessed(state.iterations());
}

void BM_RegistryStorePointRead_Random1M(benchmark::State& state) {
    Registry1M();
    const std::vector<int>& order = RandomOrder();
    std::size_t i = 0;
    for (auto _ : state) {
        const int v = order[i];
        benchmark::DoNotOptimize(
            RegistryStore::Read(RegistryHive::CurrentUser, LargeKey(v), LargeName(v)));
        i = (i + 1) % order.size();
    }
    state.SetItemsProcessed(state.iterations());
}

void BM_RegistryAutocommitWrite_Random1M(benchmark::State& state) {
    Registry1M();
    const std::vector<int>& order = RandomOrder();
    std::size_t i = 0;
    for (auto _ : state) {
        const int v = order[i];
        RegistryStore::Write(RegistryHive::CurrentUser, LargeKey(v),
                             RegistryValue::Text(LargeName(v), "other setting text"));
        i = (i + 1) % order.size();
    }
    state.SetItemsProcessed(state.iterations());
}

// ---- the registry ----

class RegistryFixture {
  public:
    RegistryFixture() {
        for (int i = 0; i < kValues; ++i) {
            names.push_back(Name(i));
            RegistryStore::Write(RegistryHive::CurrentUser, kKey,
                                 RegistryValue::Text(names.back(), "some setting text"));
        }
    }
    nxtest::TempDir dir;
    nxtest::ScopedEnv user{"NXBASE_USER_REGISTRY", dir.File("user.sqlite")};
    nxtest::ScopedEnv machine{"NXBASE_MACHINE_REGISTRY", dir.File("machine.sqlite")};
    std::vector<std::string> names;
};

void BM_RegistryStorePointRead_Cached1000(benchmark::State& state) {
    RegistryFixture fixture;
    int i = 0;
    for (auto _ : state) {
        benchmark::DoNotOptimize(
            RegistryStore::Read(RegistryHive::CurrentUser, kKey, fixture.names[i]));
        i = (i + 1) % kValues;
    }
    state.SetItemsProcessed(state.iterations());
}

void BM_RegistryHandlerGetValue_Cached1000(benchmark::State& state) {
    RegistryFixture fixture;
    RegistryHandler::SetRootPath("Software\\K-Lume\\Bench");
    int i = 0;
    for (auto _ : state) {
        benchmark::DoNotOptimize(
            RegistryHandler::GetValue(HKEY_CURRENT_USER, "Settings", fixture.names[i]));
        i = (i + 1) % kValues;
    }
    state.SetItemsProcessed(state.iterations());
}

void BM_RegistryAutocommitWrite_Cached1000(benchmark::State& state) {
    RegistryFixture fixture;
    int i = 0;
    for (auto _ : state) {
        RegistryStore::Write(RegistryHive::CurrentUser, kKey,
                             RegistryValue::Text(fixture.names[i], "some setting text"));
        i = (i + 1) % kValues;
    }
    state.SetItemsProcessed(state.iterations());
}

void BM_RegistryHandlerAddEntry_Cached1000(benchmark::State& state) {
    RegistryFixture fixture;
    RegistryHandler::SetRootPath("Software\\K-Lume\\Bench");
    int i = 0;
    for (auto _ : state) {
        RegistryHandler::AddRegistryEntry(HKEY_CURRENT_USER, "Settings", fixture.names[i],
                                          "some setting text");
        i = (i + 1) % kValues;
    }
    state.SetItemsProcessed(state.iterations());
}

constexpr int kRounds = 5;

}  // namespace

int main(int argc, char** argv) {
    // Time ratios: how many times the raw SQLite loop's time per value.
    const std::vector<nxbench::Pair> pairs = {
        {"RegistryStorePointRead_vs_RawSqlite_Cached1000", BM_RawSqlitePointRead_Cached1000,
         BM_RegistryStorePointRead_Cached1000, false},
        {"RegistryHandlerGetValue_vs_RawSqlite_Cached1000", BM_RawSqlitePointRead_Cached1000,
         BM_RegistryHandlerGetValue_Cached1000, false},
        {"RegistryAutocommitWrite_vs_RawSqlite_Cached1000", BM_RawSqliteAutocommitWrite_Cached1000,
         BM_RegistryAutocommitWrite_Cached1000, false},
        {"RegistryHandlerAddEntry_vs_RawSqlite_Cached1000", BM_RawSqliteAutocommitWrite_Cached1000,
         BM_RegistryHandlerAddEntry_Cached1000, false},
        {"RegistryStorePointRead_vs_RawSqlite_Random1M", BM_RawSqlitePointRead_Random1M,
         BM_RegistryStorePointRead_Random1M, false},
        {"RegistryAutocommitWrite_vs_RawSqlite_Random1M", BM_RawSqliteAutocommitWrite_Random1M,
         BM_RegistryAutocommitWrite_Random1M, false},
    };
    return nxbench::RunPairs(argc, argv, pairs, "value (registry against raw SQLite)", kRounds);
}
