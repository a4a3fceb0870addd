#include "platform/SqliteSettingsStore.h"

#include <pwd.h>
#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <filesystem>

#include "platform/Log.h"
#include "platform/MessagePack.h"

namespace telvane {

namespace {

constexpr int kBusyTimeoutMs = 5000;

// The type tags of the rows. Strings, integers, doubles and booleans are the values
// people write with telvane-defaults; the rest serve the system's own keys.
constexpr char kTagString[] = "string";
constexpr char kTagInteger[] = "int";
constexpr char kTagUnsigned[] = "uint";
constexpr char kTagDouble[] = "double";
constexpr char kTagBoolean[] = "bool";
constexpr char kTagData[] = "data";
constexpr char kTagDate[] = "date";
constexpr char kTagNull[] = "null";
constexpr char kTagMessagePack[] = "msgpack";

// The declared type BLOB gives the value column no affinity, so every value keeps the
// storage class it was written with (a text "123" stays text).
constexpr char kCreateTable[] =
    "CREATE TABLE IF NOT EXISTS settings ("
    " domain TEXT NOT NULL, key TEXT NOT NULL, type TEXT NOT NULL, value BLOB,"
    " PRIMARY KEY (domain, key)) WITHOUT ROWID";

constexpr const char* kStatementTexts[] = {
    "BEGIN IMMEDIATE",
    "COMMIT",
    "ROLLBACK",
    "SELECT type, value FROM settings WHERE domain = ?1 AND key = ?2",
    "SELECT key, type, value FROM settings WHERE domain = ?1 ORDER BY key",
    "INSERT OR REPLACE INTO settings (domain, key, type, value) VALUES (?1, ?2, ?3, ?4)",
    "DELETE FROM settings WHERE domain = ?1 AND key = ?2",
    "DELETE FROM settings WHERE domain = ?1",
};

// Resets a cached statement when the scope ends, whatever the path out.
class StatementReset {
 public:
  explicit StatementReset(sqlite3_stmt* statement) : statement_(statement) {}
  ~StatementReset() {
    sqlite3_reset(statement_);
    sqlite3_clear_bindings(statement_);
  }
  StatementReset(const StatementReset&) = delete;
  StatementReset& operator=(const StatementReset&) = delete;

 private:
  sqlite3_stmt* statement_;
};

void bindText(sqlite3_stmt* statement, int index, std::string_view text) {
  sqlite3_bind_text64(statement, index, text.data(), text.size(), SQLITE_TRANSIENT, SQLITE_UTF8);
}

void bindBlob(sqlite3_stmt* statement, int index, const void* data, std::size_t size) {
  static const std::uint8_t kEmpty = 0;
  sqlite3_bind_blob64(statement, index, size ? data : &kEmpty, size, SQLITE_TRANSIENT);
}

// Binds the type tag (?3) and the value (?4) of a row. False when the value cannot be
// encoded.
bool bindValue(sqlite3_stmt* statement, const Value& value) {
  switch (value.type()) {
    case Value::Type::Null:
      bindText(statement, 3, kTagNull);
      sqlite3_bind_null(statement, 4);
      return true;
    case Value::Type::Boolean:
      bindText(statement, 3, kTagBoolean);
      sqlite3_bind_int(statement, 4, value.boolValue() ? 1 : 0);
      return true;
    case Value::Type::Integer:
      bindText(statement, 3, kTagInteger);
      sqlite3_bind_int64(statement, 4, value.integerValue());
      return true;
    case Value::Type::Unsigned:
      // Stored as the same 64 bits in SQLite's signed integer.
      bindText(statement, 3, kTagUnsigned);
      sqlite3_bind_int64(statement, 4, static_cast<sqlite3_int64>(value.unsignedLongLongValue()));
      return true;
    case Value::Type::Double:
      bindText(statement, 3, kTagDouble);
      sqlite3_bind_double(statement, 4, value.doubleValue());
      return true;
    case Value::Type::String:
      bindText(statement, 3, kTagString);
      bindText(statement, 4, *value.asString());
      return true;
    case Value::Type::Bytes:
      bindText(statement, 3, kTagData);
      bindBlob(statement, 4, value.asBytes()->data(), value.asBytes()->size());
      return true;
    case Value::Type::Date:
      bindText(statement, 3, kTagDate);
      sqlite3_bind_double(statement, 4, value.asDate()->secondsSince1970);
      return true;
    case Value::Type::Array:
    case Value::Type::Dictionary: {
      std::string encoded;
      if (!msgpack_codec::encode(value, encoded)) {
        log::error("settings store: container cannot be encoded (too deep or too large)");
        return false;
      }
      bindText(statement, 3, kTagMessagePack);
      bindBlob(statement, 4, encoded.data(), encoded.size());
      return true;
    }
  }
  return false;
}

// The value of a row from its type tag and value column; nullopt for a row this
// version cannot read (logged).
std::optional<Value> columnValue(sqlite3_stmt* statement, int typeColumn, int valueColumn) {
  const auto* tagText = sqlite3_column_text(statement, typeColumn);
  std::string_view tag = tagText ? reinterpret_cast<const char*>(tagText) : "";
  const int storage = sqlite3_column_type(statement, valueColumn);
  if (tag == kTagString) {
    const auto* text = sqlite3_column_text(statement, valueColumn);
    const int size = sqlite3_column_bytes(statement, valueColumn);
    return Value(std::string(text ? reinterpret_cast<const char*>(text) : "", static_cast<std::size_t>(size)));
  }
  if (tag == kTagInteger) return Value(static_cast<long long>(sqlite3_column_int64(statement, valueColumn)));
  if (tag == kTagUnsigned) {
    return Value(static_cast<unsigned long long>(sqlite3_column_int64(statement, valueColumn)));
  }
  if (tag == kTagBoolean) return Value(sqlite3_column_int64(statement, valueColumn) != 0);
  // SQLite keeps a NaN as NULL.
  if (tag == kTagDouble) {
    return Value(storage == SQLITE_NULL ? std::nan("") : sqlite3_column_double(statement, valueColumn));
  }
  if (tag == kTagDate) return Value::date(sqlite3_column_double(statement, valueColumn));
  if (tag == kTagNull) return Value();
  if (tag == kTagData || tag == kTagMessagePack) {
    const auto* blob = static_cast<const std::uint8_t*>(sqlite3_column_blob(statement, valueColumn));
    const auto size = static_cast<std::size_t>(sqlite3_column_bytes(statement, valueColumn));
    if (tag == kTagData) return Value(Bytes(blob, blob + size));
    auto decoded = msgpack_codec::decode(blob, size);
    if (decoded.ok()) return std::move(decoded).value();
    log::error("settings store: stored container cannot be decoded: %s", decoded.error());
    return std::nullopt;
  }
  log::error("settings store: unknown value type '%s'", std::string(tag));
  return std::nullopt;
}

// mkdir -p of the folder, with mode 0700 for the folders it makes.
bool makeDirectories(const std::filesystem::path& folder, std::string& reason) {
  std::filesystem::path prefix;
  for (const auto& part : folder) {
    prefix /= part;
    if (::mkdir(prefix.c_str(), 0700) == 0 || errno == EEXIST) continue;
    reason = "cannot create " + prefix.string() + ": " + std::strerror(errno);
    return false;
  }
  struct stat st {};
  if (::stat(folder.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
    reason = folder.string() + " is not a folder";
    return false;
  }
  return true;
}

// The variable's value; empty when it is unset or empty.
std::string environmentValue(const char* name) {
  const char* v = std::getenv(name);
  return v ? std::string(v) : std::string();
}

std::string homeFolder() {
  std::string home = environmentValue("HOME");
  if (!home.empty()) return home;
  struct passwd pw {};
  struct passwd* result = nullptr;
  char buf[4096];
  if (getpwuid_r(getuid(), &pw, buf, sizeof buf, &result) == 0 && result && result->pw_dir) return result->pw_dir;
  return "/";
}

}  // namespace

// --- SqliteSettingsStore ---

std::shared_ptr<SqliteSettingsStore> SqliteSettingsStore::open(const std::string& path) {
  if (path.empty()) {
    log::error("settings store: no database path");
    return nullptr;
  }
  std::string reason;
  const std::filesystem::path folder = std::filesystem::path(path).parent_path();
  if (!folder.empty() && !makeDirectories(folder, reason)) {
    log::error("settings store %s: %s", path, reason);
    return nullptr;
  }
  struct stat st {};
  const bool existed = ::stat(path.c_str(), &st) == 0;
  sqlite3* db = nullptr;
  int rc = sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX,
                           nullptr);
  if (rc != SQLITE_OK) {
    log::error("settings store %s: cannot open: %s", path, db ? sqlite3_errmsg(db) : sqlite3_errstr(rc));
    sqlite3_close_v2(db);
    return nullptr;
  }
  // A new database is private to the user; SQLite gives its -wal and -shm files the
  // permissions of the database file. Never open and close the file ourselves: closing
  // any descriptor of it would drop the POSIX locks that other connections of this
  // process hold on it, and another process could then reset the write-ahead log under
  // them.
  if (!existed) ::chmod(path.c_str(), 0600);
  sqlite3_busy_timeout(db, kBusyTimeoutMs);
  // WAL lets readers go on while another process writes; NORMAL synchronisation is
  // durable enough in WAL mode (a power loss can lose only the last commits).
  const char* setup[] = {"PRAGMA journal_mode=WAL", "PRAGMA synchronous=NORMAL", kCreateTable};
  for (const char* sql : setup) {
    char* message = nullptr;
    if (sqlite3_exec(db, sql, nullptr, nullptr, &message) != SQLITE_OK) {
      log::error("settings store %s: %s failed: %s", path, sql, message ? message : sqlite3_errmsg(db));
      sqlite3_free(message);
      sqlite3_close_v2(db);
      return nullptr;
    }
  }
  std::shared_ptr<SqliteSettingsStore> store(new SqliteSettingsStore(path, db));
  if (!store->prepareStatements()) return nullptr;
  return store;
}

SqliteSettingsStore::SqliteSettingsStore(std::string path, sqlite3* db) : path_(std::move(path)), db_(db) {}

SqliteSettingsStore::~SqliteSettingsStore() {
  for (auto* statement : statements_) sqlite3_finalize(statement);
  sqlite3_close_v2(db_);
}

bool SqliteSettingsStore::prepareStatements() {
  static_assert(std::size(kStatementTexts) == kStatementCount, "one text per statement");
  std::lock_guard<std::mutex> lock(mutex_);
  for (int i = 0; i < kStatementCount; ++i) {
    if (sqlite3_prepare_v3(db_, kStatementTexts[i], -1, SQLITE_PREPARE_PERSISTENT, &statements_[i], nullptr) !=
        SQLITE_OK) {
      logErrorLocked(kStatementTexts[i]);
      return false;
    }
  }
  return true;
}

void SqliteSettingsStore::logErrorLocked(const char* what) const {
  log::error("settings store %s: %s failed: %s", path_, what, sqlite3_errmsg(db_));
}

bool SqliteSettingsStore::stepToDoneLocked(sqlite3_stmt* statement, const char* what) {
  StatementReset reset(statement);
  if (sqlite3_step(statement) == SQLITE_DONE) return true;
  logErrorLocked(what);
  return false;
}

template <typename Body>
bool SqliteSettingsStore::inTransactionLocked(const char* what, Body&& body) {
  if (!stepToDoneLocked(statements_[kBegin], "BEGIN")) return false;
  if (body() && stepToDoneLocked(statements_[kCommit], what)) return true;
  if (!sqlite3_get_autocommit(db_)) stepToDoneLocked(statements_[kRollback], "ROLLBACK");
  return false;
}

std::optional<Value> SqliteSettingsStore::read(std::string_view domain, std::string_view key) {
  std::lock_guard<std::mutex> lock(mutex_);
  sqlite3_stmt* statement = statements_[kSelectKey];
  StatementReset reset(statement);
  bindText(statement, 1, domain);
  bindText(statement, 2, key);
  int rc = sqlite3_step(statement);
  if (rc == SQLITE_ROW) return columnValue(statement, 0, 1);
  if (rc != SQLITE_DONE) logErrorLocked("read");
  return std::nullopt;
}

std::vector<std::pair<std::string, Value>> SqliteSettingsStore::readDomain(std::string_view domain) {
  std::lock_guard<std::mutex> lock(mutex_);
  std::vector<std::pair<std::string, Value>> entries;
  sqlite3_stmt* statement = statements_[kSelectDomain];
  StatementReset reset(statement);
  bindText(statement, 1, domain);
  int rc;
  while ((rc = sqlite3_step(statement)) == SQLITE_ROW) {
    const auto* key = sqlite3_column_text(statement, 0);
    const int keySize = sqlite3_column_bytes(statement, 0);
    auto value = columnValue(statement, 1, 2);
    if (!value) continue;
    entries.emplace_back(std::string(key ? reinterpret_cast<const char*>(key) : "", static_cast<std::size_t>(keySize)),
                         std::move(*value));
  }
  if (rc != SQLITE_DONE) logErrorLocked("read domain");
  return entries;
}

bool SqliteSettingsStore::write(std::string_view domain, std::string_view key, const Value& value) {
  std::lock_guard<std::mutex> lock(mutex_);
  return inTransactionLocked("write", [&] {
    sqlite3_stmt* statement = statements_[kUpsert];
    StatementReset reset(statement);
    bindText(statement, 1, domain);
    bindText(statement, 2, key);
    if (!bindValue(statement, value)) return false;
    if (sqlite3_step(statement) == SQLITE_DONE) return true;
    logErrorLocked("write");
    return false;
  });
}

bool SqliteSettingsStore::remove(std::string_view domain, std::string_view key) {
  std::lock_guard<std::mutex> lock(mutex_);
  bool existed = false;
  bool ok = inTransactionLocked("remove", [&] {
    sqlite3_stmt* statement = statements_[kDeleteKey];
    StatementReset reset(statement);
    bindText(statement, 1, domain);
    bindText(statement, 2, key);
    if (sqlite3_step(statement) != SQLITE_DONE) {
      logErrorLocked("remove");
      return false;
    }
    existed = sqlite3_changes(db_) > 0;
    return true;
  });
  return ok && existed;
}

bool SqliteSettingsStore::removeDomain(std::string_view domain) {
  std::lock_guard<std::mutex> lock(mutex_);
  bool existed = false;
  bool ok = inTransactionLocked("remove domain", [&] {
    sqlite3_stmt* statement = statements_[kDeleteDomain];
    StatementReset reset(statement);
    bindText(statement, 1, domain);
    if (sqlite3_step(statement) != SQLITE_DONE) {
      logErrorLocked("remove domain");
      return false;
    }
    existed = sqlite3_changes(db_) > 0;
    return true;
  });
  return ok && existed;
}

// --- free functions ---

std::shared_ptr<SettingsStore> openSqliteSettingsStore(const std::string& path) {
  return SqliteSettingsStore::open(path);
}

std::string defaultSettingsDatabasePath() {
  std::string explicitPath = environmentValue("TELVANE_DEFAULTS_DB");
  if (!explicitPath.empty()) return explicitPath;
  // systemd's StateDirectory= may list several folders, separated by colons.
  std::string stateDirectory = environmentValue("STATE_DIRECTORY");
  if (!stateDirectory.empty()) {
    stateDirectory = stateDirectory.substr(0, stateDirectory.find(':'));
    if (!stateDirectory.empty()) return stateDirectory + "/defaults.sqlite3";
  }
  // A relative XDG_STATE_HOME is invalid and ignored, as the base-directory rules say.
  std::string stateHome = environmentValue("XDG_STATE_HOME");
  if (stateHome.empty() || stateHome.front() != '/') stateHome = homeFolder() + "/.local/state";
  return stateHome + "/telvane/defaults.sqlite3";
}

std::shared_ptr<SettingsStore> defaultSettingsStore() {
  // Opened once, on first use; the static's initialisation is thread-safe.
  static const std::shared_ptr<SettingsStore> store = []() -> std::shared_ptr<SettingsStore> {
    const std::string path = defaultSettingsDatabasePath();
    if (auto sqlite = openSqliteSettingsStore(path)) return sqlite;
    log::error("settings store %s cannot be opened; settings are kept in memory by this process only", path);
    return makeMemorySettingsStore();
  }();
  return store;
}

}  // namespace telvane
