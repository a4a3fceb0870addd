// SqliteSettingsStore: the persistent settings store, one SQLite database of
// (domain, key, typed value) rows.
//
// Several processes may use one database at once (the daemon, clients, the
// telvane-defaults tool): the database runs in WAL mode with a busy timeout, and every
// write is its own transaction, so a reader sees a key either before or after a write.
// Strings, integers, doubles and booleans are stored as native SQLite values; bytes,
// dates and unsigned integers keep their own type tags; arrays and dictionaries are
// stored in their MessagePack form.
//
// Threading: one connection per store, guarded by mutex_; any thread may call any
// function. Prepared statements are made once at open and reused under the mutex.
#pragma once

#include <array>
#include <memory>
#include <mutex>
#include <string>

#include "platform/SettingsStore.h"

struct sqlite3;
struct sqlite3_stmt;

namespace telvane {

class SqliteSettingsStore final : public SettingsStore {
 public:
  // Opens (and creates, with its folder, mode 0700) the database at `path`. Returns
  // nullptr, after an error-level log line naming the reason, when it cannot be opened.
  static std::shared_ptr<SqliteSettingsStore> open(const std::string& path);
  ~SqliteSettingsStore() override;
  SqliteSettingsStore(const SqliteSettingsStore&) = delete;
  SqliteSettingsStore& operator=(const SqliteSettingsStore&) = delete;

  std::optional<Value> read(std::string_view domain, std::string_view key) override;
  std::vector<std::pair<std::string, Value>> readDomain(std::string_view domain) override;
  bool write(std::string_view domain, std::string_view key, const Value& value) override;
  bool remove(std::string_view domain, std::string_view key) override;
  bool removeDomain(std::string_view domain) override;

  const std::string& path() const { return path_; }

 private:
  enum Statement { kBegin, kCommit, kRollback, kSelectKey, kSelectDomain, kUpsert, kDeleteKey, kDeleteDomain,
                   kStatementCount };

  SqliteSettingsStore(std::string path, sqlite3* db);
  bool prepareStatements();
  // Runs a statement that returns no rows to completion; false (logged) on error.
  bool stepToDoneLocked(sqlite3_stmt* statement, const char* what);
  // Runs `body` between BEGIN IMMEDIATE and COMMIT, rolling back when it fails.
  template <typename Body>
  bool inTransactionLocked(const char* what, Body&& body);
  void logErrorLocked(const char* what) const;

  // Constant after construction.
  const std::string path_;

  mutable std::mutex mutex_;
  sqlite3* db_ = nullptr;                                  // guarded by mutex_
  std::array<sqlite3_stmt*, kStatementCount> statements_{};  // guarded by mutex_
};

}  // namespace telvane
