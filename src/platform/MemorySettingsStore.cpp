#include "platform/MemorySettingsStore.h"

namespace telvane {

std::optional<Value> MemorySettingsStore::read(std::string_view domain, std::string_view key) {
  std::lock_guard<std::mutex> lock(mutex_);
  auto d = domains_.find(domain);
  if (d == domains_.end()) return std::nullopt;
  auto entry = d->second.find(key);
  if (entry == d->second.end()) return std::nullopt;
  return entry->second.deepCopy();
}

std::vector<std::pair<std::string, Value>> MemorySettingsStore::readDomain(std::string_view domain) {
  std::lock_guard<std::mutex> lock(mutex_);
  std::vector<std::pair<std::string, Value>> entries;
  auto d = domains_.find(domain);
  if (d == domains_.end()) return entries;
  entries.reserve(d->second.size());
  for (const auto& [key, value] : d->second) entries.emplace_back(key, value.deepCopy());
  return entries;
}

bool MemorySettingsStore::write(std::string_view domain, std::string_view key, const Value& value) {
  Value stored = value.deepCopy();
  std::lock_guard<std::mutex> lock(mutex_);
  auto d = domains_.find(domain);
  if (d == domains_.end()) d = domains_.emplace(std::string(domain), Domain{}).first;
  d->second.insert_or_assign(std::string(key), std::move(stored));
  return true;
}

bool MemorySettingsStore::remove(std::string_view domain, std::string_view key) {
  std::lock_guard<std::mutex> lock(mutex_);
  auto d = domains_.find(domain);
  if (d == domains_.end()) return false;
  auto entry = d->second.find(key);
  if (entry == d->second.end()) return false;
  d->second.erase(entry);
  if (d->second.empty()) domains_.erase(d);
  return true;
}

bool MemorySettingsStore::removeDomain(std::string_view domain) {
  std::lock_guard<std::mutex> lock(mutex_);
  auto d = domains_.find(domain);
  if (d == domains_.end()) return false;
  domains_.erase(d);
  return true;
}

std::shared_ptr<SettingsStore> makeMemorySettingsStore() { return std::make_shared<MemorySettingsStore>(); }

}  // namespace telvane
