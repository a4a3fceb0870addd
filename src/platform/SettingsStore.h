// SettingsStore: persistent typed settings in named domains ("user defaults").
//
// Values are strings, integers, doubles, booleans (and, for system use, any Value:
// bytes, dates and unsigned integers keep their type; arrays and dictionaries are
// stored in their MessagePack form). An absent key reads as nullopt, which is
// told apart from every present value. Writes are transactional and visible to other
// processes using the same database. Implementations are thread-safe.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "telvane/Value.h"

namespace telvane {

class SettingsStore {
 public:
  virtual ~SettingsStore() = default;
  virtual std::optional<Value> read(std::string_view domain, std::string_view key) = 0;
  // Every key of the domain, sorted by key.
  virtual std::vector<std::pair<std::string, Value>> readDomain(std::string_view domain) = 0;
  virtual bool write(std::string_view domain, std::string_view key, const Value& value) = 0;
  // Returns true when the key existed.
  virtual bool remove(std::string_view domain, std::string_view key) = 0;
  // Returns true when the domain had keys.
  virtual bool removeDomain(std::string_view domain) = 0;
};

// The SQLite store at `path` (created with its folder when missing); nullptr when the
// database cannot be opened.
std::shared_ptr<SettingsStore> openSqliteSettingsStore(const std::string& path);

// The database path: $TELVANE_DEFAULTS_DB, else $STATE_DIRECTORY/defaults.sqlite3
// under systemd, else ${XDG_STATE_HOME:-~/.local/state}/telvane/defaults.sqlite3.
std::string defaultSettingsDatabasePath();

// The process's store at the default path, opened on first use (an in-memory store
// when the file cannot be opened, so that callers always have one).
std::shared_ptr<SettingsStore> defaultSettingsStore();

// A store held in memory only (for tests and as the last resort above).
std::shared_ptr<SettingsStore> makeMemorySettingsStore();

}  // namespace telvane
