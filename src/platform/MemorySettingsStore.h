// MemorySettingsStore: settings held in this process's memory only, with the same
// semantics as the persistent store (absent keys read as nullopt, domains are separate,
// readDomain is sorted by key). Tests use it, and the process falls back to it when the
// database cannot be opened.
//
// Values are copied in and out at every level, the way a database would store them: a
// container written here is not the caller's live container afterwards.
//
// Threading: all state is guarded by mutex_; any thread may call any function.
#pragma once

#include <map>
#include <mutex>
#include <string>

#include "platform/SettingsStore.h"

namespace telvane {

class MemorySettingsStore final : public SettingsStore {
 public:
  MemorySettingsStore() = default;

  std::optional<Value> read(std::string_view domain, std::string_view key) override;
  std::vector<std::pair<std::string, Value>> readDomain(std::string_view domain) override;
  bool write(std::string_view domain, std::string_view key, const Value& value) override;
  bool remove(std::string_view domain, std::string_view key) override;
  bool removeDomain(std::string_view domain) override;

 private:
  using Domain = std::map<std::string, Value, std::less<>>;

  std::mutex mutex_;
  std::map<std::string, Domain, std::less<>> domains_;  // guarded by mutex_; no empty domains
};

}  // namespace telvane
