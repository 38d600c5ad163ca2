// The registry's SQLite seam: hive files, connections, statements and
// transactions. Nothing else in the library talks to SQLite.
//
// Layout of a hive database (application_id "NxRg", user_version 1):
//   keys(id, path)                  one row per key; path compares NOCASE
//   vals(key_id, name, type, data)  one row per value; name compares NOCASE
// A key's parents always have rows of their own, so the direct sub keys of a
// key are rows, and a key's subtree is the range of paths between
// "<key>\" and "<key>]" ("]" follows "\" in every collation used here).
//
// Each thread keeps its own connections (one per hive file) with their
// prepared statements; a child process after fork() abandons its parent's
// connections without closing them, as SQLite requires.
#include <sqlite3.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <string_view>
#include <thread>

#include "nxbase/registry.h"
#include "toolkit/direntry.h"
#include "toolkit/fileio.h"
#include "toolkit/system.h"

namespace nxbase {
namespace {

constexpr int kBusyTimeoutMs = 30000;       // a writer holds the lock for microseconds
constexpr int kApplicationId = 0x4E785267;  // "NxRg"
constexpr int kSchemaVersion = 1;
constexpr std::size_t kMaxCachedConnections = 4;  // per thread

constexpr const char* kSchema =
    "CREATE TABLE IF NOT EXISTS keys("
    "  id INTEGER PRIMARY KEY,"
    "  path TEXT NOT NULL UNIQUE COLLATE NOCASE);"
    "CREATE TABLE IF NOT EXISTS vals("
    "  key_id INTEGER NOT NULL,"
    "  name TEXT NOT NULL COLLATE NOCASE,"
    "  type INTEGER NOT NULL,"
    "  data,"
    "  PRIMARY KEY(key_id, name)) WITHOUT ROWID;";

enum Statement : std::size_t {
    kReadValue,
    kKeyExists,
    kInsertKey,
    kUpsertValue,
    kListValues,
    kListTree,
    kListAll,
    kDeleteValue,
    kDeleteTreeValues,
    kDeleteTreeKeys,
    kBegin,
    kCommit,
    kRollback,
    kStatementCount
};

constexpr std::array<const char*, kStatementCount> kStatementText = {
    "SELECT v.type, v.data FROM keys k JOIN vals v ON v.key_id = k.id"
    " WHERE k.path = ?1 AND v.name = ?2",
    "SELECT 1 FROM keys WHERE path = ?1",
    "INSERT OR IGNORE INTO keys(path) VALUES(?1)",
    "INSERT INTO vals(key_id, name, type, data) SELECT id, ?2, ?3, ?4 FROM keys WHERE path = ?1"
    " ON CONFLICT(key_id, name) DO UPDATE SET type = excluded.type, data = excluded.data",
    "SELECT v.name, v.type, v.data FROM keys k JOIN vals v ON v.key_id = k.id"
    " WHERE k.path = ?1 ORDER BY v.name",
    "SELECT path FROM keys WHERE path = ?1 OR (path > ?2 AND path < ?3) ORDER BY path",
    "SELECT path FROM keys ORDER BY path",
    "DELETE FROM vals WHERE key_id = (SELECT id FROM keys WHERE path = ?1) AND name = ?2",
    "DELETE FROM vals WHERE key_id IN"
    " (SELECT id FROM keys WHERE path = ?1 OR (path > ?2 AND path < ?3))",
    "DELETE FROM keys WHERE path = ?1 OR (path > ?2 AND path < ?3)",
    "BEGIN IMMEDIATE",
    "COMMIT",
    "ROLLBACK",
};

// ---- key paths ----

// Drops empty components: "\a\\b\" becomes "a\b".
std::string NormalizeKey(std::string_view asKey) {
    bool clean = asKey.empty() || (asKey.front() != '\\' && asKey.back() != '\\' &&
                                   asKey.find("\\\\") == std::string_view::npos);
    if (clean) return std::string(asKey);
    std::string result;
    result.reserve(asKey.size());
    std::size_t start = 0;
    while (start <= asKey.size()) {
        std::size_t end = asKey.find('\\', start);
        if (end == std::string_view::npos) end = asKey.size();
        if (end > start) {
            if (!result.empty()) result += '\\';
            result.append(asKey.substr(start, end - start));
        }
        start = end + 1;
    }
    return result;
}

// The key as the store keeps it, without a copy when it is already clean.
std::string_view KeyView(const std::string& asKey, std::string& asBuffer) {
    if (!asKey.empty() && (asKey.front() == '\\' || asKey.back() == '\\' ||
                           asKey.find("\\\\") != std::string::npos)) {
        asBuffer = NormalizeKey(asKey);
        return asBuffer;
    }
    return asKey;
}

bool FileExists(const std::string& asFile) {
    return toolkit::KindOf(asFile) != toolkit::FileKind::kNone;
}

void HiveFileInto(RegistryHive axHive, std::string& asFile) {
    const char* variable = std::getenv(
        axHive == RegistryHive::LocalMachine ? "NXBASE_MACHINE_REGISTRY" : "NXBASE_USER_REGISTRY");
    if (variable && *variable) {
        asFile.assign(variable);
    } else {
        asFile = RegistryHiveFile(axHive);
    }
}

// ---- connections ----

class Connection;
[[noreturn]] void Fail(const Connection& axConnection, int alResult, const std::string& asWhat);

class Connection {
  public:
    Connection(std::string asFile, sqlite3* pDb, bool abWritable)
        : amFile(std::move(asFile)), pDb(pDb), amWritable(abWritable) {}
    ~Connection() {
        for (sqlite3_stmt* statement : amStatements) sqlite3_finalize(statement);
        sqlite3_close_v2(pDb);
    }
    Connection(const Connection&) = delete;
    Connection& operator=(const Connection&) = delete;

    const std::string& File() const { return amFile; }
    sqlite3* Db() const { return pDb; }
    bool Writable() const { return amWritable; }

    // The cached statement, prepared on first use.
    sqlite3_stmt* Get(Statement axWhich) {
        sqlite3_stmt*& statement = amStatements[axWhich];
        if (statement == nullptr) {
            int result = sqlite3_prepare_v3(pDb, kStatementText[axWhich], -1,
                                            SQLITE_PREPARE_PERSISTENT, &statement, nullptr);
            if (result != SQLITE_OK) Fail(*this, result, "cannot prepare a statement");
        }
        return statement;
    }

    // Runs SQL without results (set-up only).
    void Exec(const char* asSql, const char* asWhat) {
        char* pError = nullptr;
        int result = sqlite3_exec(pDb, asSql, nullptr, nullptr, &pError);
        sqlite3_free(pError);
        if (result != SQLITE_OK) Fail(*this, result, asWhat);
    }

    // The single integer a query returns.
    long long QueryInt(const char* asSql, const char* asWhat) {
        sqlite3_stmt* statement = nullptr;
        int result = sqlite3_prepare_v2(pDb, asSql, -1, &statement, nullptr);
        long long value = 0;
        if (result == SQLITE_OK) {
            result = sqlite3_step(statement);
            if (result == SQLITE_ROW) {
                value = sqlite3_column_int64(statement, 0);
                result = SQLITE_OK;
            } else if (result == SQLITE_DONE) {
                result = SQLITE_OK;
            }
        }
        sqlite3_finalize(statement);
        if (result != SQLITE_OK) Fail(*this, result, asWhat);
        return value;
    }

  private:
    std::string amFile;
    sqlite3* pDb = nullptr;
    bool amWritable = false;
    std::array<sqlite3_stmt*, kStatementCount> amStatements{};
};

// The kind of failure an SQLite result code stands for.
RegistryErrorKind KindOf(int alResult) {
    switch (alResult & 0xFF) {
        case SQLITE_PERM:
        case SQLITE_READONLY:
        case SQLITE_CANTOPEN:
        case SQLITE_AUTH:
            return RegistryErrorKind::kNotWritable;
        case SQLITE_CORRUPT:
        case SQLITE_NOTADB:
            return RegistryErrorKind::kCorrupt;
        default:
            return RegistryErrorKind::kOther;
    }
}

[[noreturn]] void Fail(const Connection& axConnection, int alResult, const std::string& asWhat) {
    int primary = alResult & 0xFF;
    std::string message = "Registry database '" + axConnection.File() + "': ";
    if (primary == SQLITE_CORRUPT || primary == SQLITE_NOTADB) {
        message += "the file is corrupt or not a registry database (" +
                   std::string(sqlite3_errstr(alResult)) + ")";
    } else {
        const char* detail =
            axConnection.Db() ? sqlite3_errmsg(axConnection.Db()) : sqlite3_errstr(alResult);
        message += asWhat + ": " + detail;
    }
    throw RegistryError(KindOf(alResult), alResult, message);
}

// Resets a statement when the scope ends, so that it holds no read lock.
class Reset {
  public:
    explicit Reset(sqlite3_stmt* pStatement) : pStatement(pStatement) {}
    ~Reset() { sqlite3_reset(pStatement); }
    Reset(const Reset&) = delete;
    Reset& operator=(const Reset&) = delete;

  private:
    sqlite3_stmt* pStatement;
};

void BindText(sqlite3_stmt* pStatement, int alIndex, std::string_view asText) {
    sqlite3_bind_text(pStatement, alIndex, asText.data(), static_cast<int>(asText.size()),
                      SQLITE_STATIC);
}

std::string ColumnText(sqlite3_stmt* pStatement, int alColumn) {
    const void* data = sqlite3_column_blob(pStatement, alColumn);
    int size = sqlite3_column_bytes(pStatement, alColumn);
    return data ? std::string(static_cast<const char*>(data), static_cast<std::size_t>(size))
                : std::string();
}

// Steps a statement expected to finish without rows.
void Run(Connection& axConnection, sqlite3_stmt* pStatement, const char* asWhat) {
    int result = sqlite3_step(pStatement);
    if (result != SQLITE_DONE && result != SQLITE_ROW) Fail(axConnection, result, asWhat);
}

std::atomic<void (*)()> gSchemaCheckHook{nullptr};

// Creates the tables in a fresh file, or checks that an existing file is ours.
// The check of a file that is not (yet) ours reads the application id and the
// tables in one transaction, so that a process creating the same hive at this
// moment is seen either not at all or whole; a writer holds the write lock
// while it decides, so that only one creates.
void PrepareSchema(Connection& axConnection) {
    long long applicationId = axConnection.QueryInt("PRAGMA application_id", "cannot read");
    if (applicationId == kApplicationId) return;
    bool writable = axConnection.Writable();
    axConnection.Exec(writable ? "BEGIN IMMEDIATE" : "BEGIN", "cannot read the schema");
    try {
        long long tables =
            axConnection.QueryInt("SELECT count(*) FROM sqlite_master", "cannot read the schema");
        applicationId = axConnection.QueryInt("PRAGMA application_id", "cannot read");
        if (auto hook = gSchemaCheckHook.load(std::memory_order_relaxed)) hook();
        if (applicationId != kApplicationId && (applicationId != 0 || tables != 0)) {
            throw RegistryError(RegistryErrorKind::kCorrupt, 0,
                                "Registry database '" + axConnection.File() +
                                    "': the file is not a registry database");
        }
        // Ours by now, or an empty file opened read-only: it reads as empty.
        if (applicationId == 0 && writable) {
            axConnection.Exec(kSchema, "cannot create the tables");
            axConnection.Exec(("PRAGMA application_id = " + std::to_string(kApplicationId) +
                               "; PRAGMA user_version = " + std::to_string(kSchemaVersion))
                                  .c_str(),
                              "cannot create the tables");
        }
        axConnection.Exec("COMMIT", "cannot create the tables");
    } catch (...) {
        sqlite3_exec(axConnection.Db(), "ROLLBACK", nullptr, nullptr, nullptr);
        throw;
    }
}

// Switching the journal mode needs a lock for which SQLite does not call the
// busy handler, so a process that races another one creating the same hive
// waits here.
void SetJournalMode(Connection& axConnection, const std::string& asMode) {
    constexpr auto kPause = std::chrono::milliseconds(2);
    auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(kBusyTimeoutMs);
    while (true) {
        sqlite3_stmt* pragma = nullptr;
        std::string sql = "PRAGMA journal_mode = " + asMode;
        int result = sqlite3_prepare_v2(axConnection.Db(), sql.c_str(), -1, &pragma, nullptr);
        std::string mode;
        if (result == SQLITE_OK) {
            result = sqlite3_step(pragma);
            if (result == SQLITE_ROW) {
                mode = ColumnText(pragma, 0);
                result = SQLITE_OK;
            }
        }
        sqlite3_finalize(pragma);
        if (result == SQLITE_OK && mode == asMode) return;
        // Another mode back means the switch could not take its lock either.
        bool busy = result == SQLITE_OK || (result & 0xFF) == SQLITE_BUSY ||
                    (result & 0xFF) == SQLITE_LOCKED;
        if (!busy || std::chrono::steady_clock::now() > deadline) {
            Fail(axConnection, result, "cannot switch to journal mode " + asMode);
        }
        std::this_thread::sleep_for(kPause);
    }
}

// `asFile` as an SQLite URI opened read-only and immutable.
std::unique_ptr<Connection> OpenImmutable(const std::string& asFile) {
    std::string uri = "file:";
    for (char c : asFile) {
        if (c == '%' || c == '?' || c == '#') {
            char escaped[4];
            std::snprintf(escaped, sizeof escaped, "%%%02X", static_cast<unsigned char>(c));
            uri += escaped;
        } else {
            uri += c;
        }
    }
    uri += "?immutable=1";
    sqlite3* pDb = nullptr;
    const int result = sqlite3_open_v2(
        uri.c_str(), &pDb, SQLITE_OPEN_READONLY | SQLITE_OPEN_NOMUTEX | SQLITE_OPEN_URI, nullptr);
    auto connection = std::make_unique<Connection>(asFile, pDb, false);
    if (result != SQLITE_OK) Fail(*connection, result, "cannot open");
    sqlite3_extended_result_codes(pDb, 1);
    PrepareSchema(*connection);
    return connection;
}

// Opens a hive file. Without `create` a missing file gives null, and a file
// that cannot be written is opened for reading.
std::unique_ptr<Connection> Open(const std::string& asFile, RegistryHive axHive, bool abCreate) {
    if (!abCreate && !FileExists(asFile)) return nullptr;
    if (abCreate) {
        std::filesystem::path parent = std::filesystem::path(asFile).parent_path();
        std::error_code error;
        if (!parent.empty()) std::filesystem::create_directories(parent, error);
        if (error) {
            throw RegistryError(RegistryErrorKind::kNotWritable, 0,
                                "Registry database '" + asFile +
                                    "': cannot create its directory: " + error.message());
        }
    }
    int flags = SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX | (abCreate ? SQLITE_OPEN_CREATE : 0);
    sqlite3* pDb = nullptr;
    int result = sqlite3_open_v2(asFile.c_str(), &pDb, flags, nullptr);
    if (result != SQLITE_OK && !abCreate) {
        sqlite3_close_v2(pDb);
        pDb = nullptr;
        result = sqlite3_open_v2(asFile.c_str(), &pDb, SQLITE_OPEN_READONLY | SQLITE_OPEN_NOMUTEX,
                                 nullptr);
    }
    bool writable = result == SQLITE_OK && sqlite3_db_readonly(pDb, "main") == 0;
    auto connection = std::make_unique<Connection>(asFile, pDb, writable);
    if (result != SQLITE_OK) Fail(*connection, result, "cannot open");
    sqlite3_extended_result_codes(pDb, 1);
    sqlite3_busy_timeout(pDb, kBusyTimeoutMs);
    if (writable) {
        if (axHive == RegistryHive::LocalMachine) {
            // The machine hive is written rarely, by administrators, and read
            // by every user: a rollback journal leaves no -wal/-shm files
            // that a reader would need to write.
            SetJournalMode(*connection, "delete");
        } else {
            SetJournalMode(*connection, "wal");
            connection->Exec("PRAGMA synchronous = NORMAL", "cannot set the sync mode");
        }
    }
    if (!writable) {
        try {
            PrepareSchema(*connection);
        } catch (const RegistryError& error) {
            // A WAL hive on a read-only mount: SQLite cannot create the
            // shared-memory file it reads through, so it opens the file only
            // when told that nothing can change it, which holds there.
            if ((error.Code() & 0xFF) != SQLITE_CANTOPEN) throw;
            return OpenImmutable(asFile);
        }
        return connection;
    }
    PrepareSchema(*connection);
    return connection;
}

// A child notices by the fork generation that its connections are its
// parent's, without a getpid() system call on every access.

// The calling thread's connections.
struct ConnectionCache {
    unsigned amGeneration = toolkit::ForkGeneration();
    std::vector<std::unique_ptr<Connection>> amConnections;  // most recently used last

    ~ConnectionCache() {
        if (amGeneration != toolkit::ForkGeneration()) Abandon();
    }
    void Abandon() {
        for (auto& connection : amConnections) connection.release();  // never closed here
        amConnections.clear();
    }
};

thread_local ConnectionCache tlCache;

// The connection to a hive; null when the hive has no file yet and
// `forWrite` is false. For writing, the file and its directory are created.
Connection* Connect(RegistryHive axHive, bool abForWrite) {
    if (tlCache.amGeneration != toolkit::ForkGeneration()) {
        tlCache.Abandon();
        tlCache.amGeneration = toolkit::ForkGeneration();
    }
    // Resolved on every call, since the environment may point elsewhere, but
    // into a buffer that is reused.
    thread_local std::string file;
    HiveFileInto(axHive, file);
    auto& connections = tlCache.amConnections;
    for (auto at = connections.begin(); at != connections.end(); ++at) {
        if ((*at)->File() != file) continue;
        if (abForWrite && !(*at)->Writable()) {
            connections.erase(at);  // try again for writing below
            break;
        }
        if (at + 1 != connections.end()) std::rotate(at, at + 1, connections.end());
        return connections.back().get();
    }
    std::unique_ptr<Connection> connection = Open(file, axHive, abForWrite);
    if (!connection) return nullptr;
    if (abForWrite && !connection->Writable()) {
        throw RegistryError(RegistryErrorKind::kNotWritable, SQLITE_READONLY,
                            "Registry database '" + file + "': the file cannot be written");
    }
    if (connections.size() >= kMaxCachedConnections) connections.erase(connections.begin());
    connections.push_back(std::move(connection));
    return connections.back().get();
}

// BEGIN IMMEDIATE ... COMMIT, rolled back unless committed.
class Transaction {
  public:
    explicit Transaction(Connection& axConnection) : amConnection(axConnection) {
        sqlite3_stmt* begin = amConnection.Get(kBegin);
        Reset reset(begin);
        Run(amConnection, begin, "cannot begin a transaction");
    }
    ~Transaction() {
        if (amDone) return;
        sqlite3_stmt* rollback = amConnection.Get(kRollback);
        sqlite3_step(rollback);
        sqlite3_reset(rollback);
    }
    Transaction(const Transaction&) = delete;
    Transaction& operator=(const Transaction&) = delete;

    void Commit() {
        sqlite3_stmt* commit = amConnection.Get(kCommit);
        Reset reset(commit);
        Run(amConnection, commit, "cannot commit");
        amDone = true;
    }

  private:
    Connection& amConnection;
    bool amDone = false;
};

// Inserts the key and, when it is new, its parents. True when it was new.
bool EnsureKey(Connection& axConnection, const std::string& asKey) {
    sqlite3_stmt* insert = axConnection.Get(kInsertKey);
    auto insertOne = [&](std::string_view path) {
        Reset reset(insert);
        BindText(insert, 1, path);
        Run(axConnection, insert, "cannot create a key");
        return sqlite3_changes(axConnection.Db()) > 0;
    };
    if (!insertOne(asKey)) return false;
    for (std::size_t at = asKey.find('\\'); at != std::string::npos;
         at = asKey.find('\\', at + 1)) {
        insertOne(std::string_view(asKey).substr(0, at));
    }
    return true;
}

// Writes a value into an existing key; false when the key is missing.
bool Upsert(Connection& axConnection, std::string_view asKey, const RegistryValue& axValue) {
    sqlite3_stmt* upsert = axConnection.Get(kUpsertValue);
    Reset reset(upsert);
    BindText(upsert, 1, asKey);
    BindText(upsert, 2, axValue.name);
    sqlite3_bind_int(upsert, 3, static_cast<int>(axValue.type));
    if (axValue.type == RegistryType::Dword) {
        sqlite3_bind_int64(upsert, 4, axValue.dword);
    } else {
        sqlite3_bind_blob(upsert, 4, axValue.text.data(), static_cast<int>(axValue.text.size()),
                          SQLITE_STATIC);
    }
    Run(axConnection, upsert, "cannot write a value");
    return sqlite3_changes(axConnection.Db()) > 0;
}

RegistryValue ValueFromRow(sqlite3_stmt* pStatement, int alTypeColumn, std::string asName) {
    RegistryValue value;
    value.name = std::move(asName);
    value.type = static_cast<RegistryType>(sqlite3_column_int(pStatement, alTypeColumn));
    if (value.type == RegistryType::Dword) {
        value.dword =
            static_cast<std::uint32_t>(sqlite3_column_int64(pStatement, alTypeColumn + 1));
    } else {
        value.text = ColumnText(pStatement, alTypeColumn + 1);
    }
    return value;
}

// Binds key, "key\" and "key]" for the subtree statements.
void BindTree(sqlite3_stmt* pStatement, const std::string& asKey, std::string& asLow,
              std::string& asHigh) {
    asLow = asKey + '\\';
    asHigh = asKey + ']';
    BindText(pStatement, 1, asKey);
    BindText(pStatement, 2, asLow);
    BindText(pStatement, 3, asHigh);
}

bool DeleteTree(Connection& axConnection, const std::string& asKey) {
    std::string low;
    std::string high;
    sqlite3_stmt* values = axConnection.Get(kDeleteTreeValues);
    {
        Reset reset(values);
        BindTree(values, asKey, low, high);
        Run(axConnection, values, "cannot delete a key");
    }
    sqlite3_stmt* keys = axConnection.Get(kDeleteTreeKeys);
    Reset reset(keys);
    BindTree(keys, asKey, low, high);
    Run(axConnection, keys, "cannot delete a key");
    return sqlite3_changes(axConnection.Db()) > 0;
}

void RefuseWholeHive(const std::string& asKey) {
    if (asKey.empty()) throw std::invalid_argument("Refusing to delete a whole registry hive");
}

}  // namespace

// ---- hives ----

const char* HiveName(RegistryHive axHive) {
    return axHive == RegistryHive::LocalMachine ? "HKEY_LOCAL_MACHINE" : "HKEY_CURRENT_USER";
}

std::string RegistryHiveFile(RegistryHive axHive) {
    if (axHive == RegistryHive::LocalMachine) {
        const char* file = std::getenv("NXBASE_MACHINE_REGISTRY");
        return (file && *file) ? file : "/etc/k-lume/registry.sqlite";
    }
    if (const char* file = std::getenv("NXBASE_USER_REGISTRY"); file && *file) return file;
    // Without a home the path is relative to the root, where opening it fails with a reason.
    return toolkit::ConfigDirectory() + "/K-Lume/registry.sqlite";
}

void detail::SetSchemaCheckHook(void (*fHook)()) {
    gSchemaCheckHook.store(fHook, std::memory_order_relaxed);
}

// ---- RegistryStore ----

bool RegistryStore::KeyExists(RegistryHive axHive, const std::string& asKey) {
    Connection* connection = Connect(axHive, false);
    if (!connection) return false;
    std::string key = NormalizeKey(asKey);
    if (key.empty()) return true;
    sqlite3_stmt* exists = connection->Get(kKeyExists);
    Reset reset(exists);
    BindText(exists, 1, key);
    int result = sqlite3_step(exists);
    if (result != SQLITE_ROW && result != SQLITE_DONE) Fail(*connection, result, "cannot read");
    return result == SQLITE_ROW;
}

bool RegistryStore::CreateKey(RegistryHive axHive, const std::string& asKey) {
    std::string key = NormalizeKey(asKey);
    Connection* connection = Connect(axHive, true);
    if (key.empty()) return false;
    Transaction transaction(*connection);
    bool created = EnsureKey(*connection, key);
    transaction.Commit();
    return created;
}

std::optional<RegistryValue> RegistryStore::Read(RegistryHive axHive, const std::string& asKey,
                                                 const std::string& asName) {
    Connection* connection = Connect(axHive, false);
    if (!connection) return std::nullopt;
    std::string normalized;
    std::string_view key = KeyView(asKey, normalized);
    sqlite3_stmt* read = connection->Get(kReadValue);
    Reset reset(read);
    BindText(read, 1, key);
    BindText(read, 2, asName);
    int result = sqlite3_step(read);
    if (result == SQLITE_DONE) return std::nullopt;
    if (result != SQLITE_ROW) Fail(*connection, result, "cannot read");
    return ValueFromRow(read, 0, asName);
}

void RegistryStore::Write(RegistryHive axHive, const std::string& asKey,
                          const RegistryValue& axValue) {
    Connection* connection = Connect(axHive, true);
    std::string normalized;
    std::string_view key = KeyView(asKey, normalized);
    // The common case, an existing key, is one autocommit statement.
    if (Upsert(*connection, key, axValue)) return;
    Transaction transaction(*connection);
    EnsureKey(*connection, std::string(key));
    Upsert(*connection, key, axValue);
    transaction.Commit();
}

std::vector<RegistryValue> RegistryStore::Values(RegistryHive axHive, const std::string& asKey) {
    std::vector<RegistryValue> values;
    Connection* connection = Connect(axHive, false);
    if (!connection) return values;
    std::string key = NormalizeKey(asKey);
    sqlite3_stmt* list = connection->Get(kListValues);
    Reset reset(list);
    BindText(list, 1, key);
    int result;
    while ((result = sqlite3_step(list)) == SQLITE_ROW) {
        values.push_back(ValueFromRow(list, 1, ColumnText(list, 0)));
    }
    if (result != SQLITE_DONE) Fail(*connection, result, "cannot read");
    return values;
}

std::vector<std::string> RegistryStore::Tree(RegistryHive axHive, const std::string& asKey) {
    std::vector<std::string> paths;
    Connection* connection = Connect(axHive, false);
    if (!connection) return paths;
    std::string key = NormalizeKey(asKey);
    std::string low;
    std::string high;
    sqlite3_stmt* list = connection->Get(key.empty() ? kListAll : kListTree);
    Reset reset(list);
    if (!key.empty()) BindTree(list, key, low, high);
    int result;
    while ((result = sqlite3_step(list)) == SQLITE_ROW) paths.push_back(ColumnText(list, 0));
    if (result != SQLITE_DONE) Fail(*connection, result, "cannot read");
    return paths;
}

std::vector<std::string> RegistryStore::SubKeys(RegistryHive axHive, const std::string& asKey) {
    std::string key = NormalizeKey(asKey);
    std::size_t prefix = key.empty() ? 0 : key.size() + 1;
    std::vector<std::string> children;
    for (const std::string& path : Tree(axHive, key)) {
        if (path.size() <= prefix && !key.empty()) continue;  // the key itself
        if (path.empty()) continue;                           // the hive's own row
        std::string rest = path.substr(prefix);
        if (rest.find('\\') == std::string::npos) children.push_back(rest);
    }
    return children;
}

bool RegistryStore::DeleteValue(RegistryHive axHive, const std::string& asKey,
                                const std::string& asName) {
    if (!Connect(axHive, false)) return false;
    Connection* connection = Connect(axHive, true);
    std::string key = NormalizeKey(asKey);
    sqlite3_stmt* erase = connection->Get(kDeleteValue);
    Reset reset(erase);
    BindText(erase, 1, key);
    BindText(erase, 2, asName);
    Run(*connection, erase, "cannot delete a value");
    return sqlite3_changes(connection->Db()) > 0;
}

bool RegistryStore::DeleteKey(RegistryHive axHive, const std::string& asKey) {
    std::string key = NormalizeKey(asKey);
    RefuseWholeHive(key);
    if (!Connect(axHive, false)) return false;
    Connection* connection = Connect(axHive, true);
    Transaction transaction(*connection);
    bool existed = DeleteTree(*connection, key);
    transaction.Commit();
    return existed;
}

namespace {

void ApplyToHive(Connection& axConnection, RegistryHive axHive,
                 const std::vector<RegistryStore::Change>& axChanges) {
    using Change = RegistryStore::Change;
    for (const Change& change : axChanges) {
        if (change.hive != axHive) continue;
        std::string key = NormalizeKey(change.key);
        switch (change.kind) {
            case Change::Kind::CreateKey:
                if (!key.empty()) EnsureKey(axConnection, key);
                break;
            case Change::Kind::DeleteKey:
                DeleteTree(axConnection, key);
                break;
            case Change::Kind::SetValue:
                EnsureKey(axConnection, key);
                Upsert(axConnection, key, change.value);
                break;
            case Change::Kind::DeleteValue: {
                sqlite3_stmt* erase = axConnection.Get(kDeleteValue);
                Reset reset(erase);
                BindText(erase, 1, key);
                BindText(erase, 2, change.value.name);
                Run(axConnection, erase, "cannot delete a value");
                break;
            }
        }
    }
}

}  // namespace

void RegistryStore::Apply(const std::vector<Change>& axChanges) {
    // Every hive's changes are made inside its own open transaction before
    // any is committed, so that a hive this process may not write (or any
    // other failure while changing) leaves both hives as they were.
    std::vector<RegistryHive> hives;
    for (RegistryHive hive : {RegistryHive::CurrentUser, RegistryHive::LocalMachine}) {
        bool any = std::any_of(axChanges.begin(), axChanges.end(),
                               [&](const Change& change) { return change.hive == hive; });
        if (!any) continue;
        for (const Change& change : axChanges) {
            if (change.hive == hive && change.kind == Change::Kind::DeleteKey) {
                RefuseWholeHive(NormalizeKey(change.key));
            }
        }
        hives.push_back(hive);
    }
    std::vector<Connection*> connections;
    for (RegistryHive hive : hives) connections.push_back(Connect(hive, true));
    std::vector<std::unique_ptr<Transaction>> transactions;
    for (std::size_t i = 0; i < hives.size(); ++i) {
        transactions.push_back(std::make_unique<Transaction>(*connections[i]));
        ApplyToHive(*connections[i], hives[i], axChanges);
    }
    for (std::size_t i = 0; i < hives.size(); ++i) {
        try {
            transactions[i]->Commit();
        } catch (const RegistryError& error) {
            if (i == 0) throw;
            // The first hive is committed already: say exactly what happened.
            throw RegistryError(error.GetKind(), error.Code(),
                                std::string(HiveName(hives[0])) + " was written; " +
                                    HiveName(hives[i]) + " was not: " + error.what());
        }
    }
}

}  // namespace nxbase
