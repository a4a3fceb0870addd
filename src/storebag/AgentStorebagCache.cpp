#include "storebag/AgentStorebagCache.h"

#include <cmath>
#include <utility>

#include "platform/Log.h"
#include "platform/SystemInfo.h"

namespace telvane {

namespace {

std::string describeTime(double secondsSince1970) { return Value::date(secondsSince1970).description(); }

// The section an entry holds, or nothing when it has none (no entry, or no success yet).
std::optional<Value> sectionOf(const Value* entry) {
  if (!entry) return std::nullopt;
  const Value& data = (*entry)[kStorebagEntryData];
  if (data.isNull()) return std::nullopt;
  return data;
}

}  // namespace

AgentStorebagCache::AgentStorebagCache(std::recursive_mutex& lock, Selector selector, FileTime fileTime,
                                       std::shared_ptr<Clock> clock)
    : lock_(lock),
      selector_(std::move(selector)),
      fileTime_(std::move(fileTime)),
      clock_(clock ? std::move(clock) : Clock::system()) {}

std::optional<Value> AgentStorebagCache::storebagForSession(std::uint32_t sessionID, std::int32_t clientType) {
  const std::optional<std::string> name = storebagNameForClientType(clientType);
  if (!name) return std::nullopt;
  log::info("storebagForSession: Retrieving storebag for session %u with client type %d", sessionID, clientType);

  std::lock_guard<std::recursive_mutex> lock(lock_);
  if (const Value* entry = cachedStorebags_.asDictionary()->find(*name)) {
    const double fetchTime = (*entry)[kStorebagEntryFetchTime].asDate()
                                 ? (*entry)[kStorebagEntryFetchTime].asDate()->secondsSince1970
                                 : 0;
    const bool succeeded = (*entry)[kStorebagEntryFetchState].stringOrEmpty() == kStorebagFetchSuccessful;
    const std::int64_t maxAge = (*entry)[kStorebagEntryMaxAge].integerValue();
    const double elapsed = std::fabs(clock_->now() - fetchTime);
    const std::optional<double> fileTime = fileTime_ ? fileTime_(*name) : std::nullopt;
    if (fileTime && *fileTime > fetchTime) {
      // A background refresh wrote a newer envelope: the entry is stale at once.
      log::info("storebagForSession: Override maxAge as disk cache for storebag '%s' was updated: modification time "
                "'%s' is greater than last fetch time '%s",
                *name, describeTime(*fileTime), describeTime(fetchTime));
    } else if (succeeded && elapsed < static_cast<double>(maxAge)) {
      log::info("storebagForSession: Cached storebag found for client type %d", clientType);
      return sectionOf(entry);
    } else if (!succeeded && elapsed < kStorebagRetryIntervalSeconds) {
      log::info("storebagForSession: Not fetching storebag for client type %d - must wait %d seconds between attempts",
                clientType, kStorebagRetryIntervalSeconds);
      return sectionOf(entry);
    }
  }
  fetchAndCacheStorebag(clientType);
  return sectionOf(cachedStorebags_.asDictionary()->find(*name));
}

std::optional<std::string> AgentStorebagCache::storebagVersionForSession(std::int32_t clientType) {
  const std::optional<std::string> name = storebagNameForClientType(clientType);
  if (!name) return std::nullopt;
  std::lock_guard<std::recursive_mutex> lock(lock_);
  const Value* entry = cachedStorebags_.asDictionary()->find(*name);
  if (!entry) return std::nullopt;
  const Value& version = (*entry)[kStorebagEntryVersion];
  if (!version.isString()) return std::nullopt;
  return *version.asString();
}

void AgentStorebagCache::fetchAndCacheStorebag(std::int32_t clientType) {
  log::info("fetchAndCacheStorebag: Fetching storebag for client type %d", clientType);
  const std::optional<std::string> name = storebagNameForClientType(clientType);
  if (!name) {
    log::error("fetchAndCacheStorebag: clientType %d is invalid", clientType);
    return;
  }
  std::lock_guard<std::recursive_mutex> lock(lock_);
  Dictionary& entries = *cachedStorebags_.asDictionary();
  if (!entries.find(*name)) entries.set(*name, Value::dictionary());

  StorebagSelectionResult result = selector_(clientType);
  // Copies handed out by copyCachedStorebags share the entries and are read without
  // the lock, so an entry is never changed in place: the update goes into a new entry
  // that replaces the old one.
  Value entry = entries.find(*name)->copy();
  const std::int32_t maxAge = result.selection ? result.selection->maxAgeSeconds : result.maxAgeSeconds;
  log::info("fetchAndCacheStorebag: Storebag max age: %d seconds", maxAge);
  Dictionary& fields = *entry.asDictionary();
  if (result.selection) {
    fields.set(kStorebagEntryData, std::move(result.selection->section));
    fields.set(kStorebagEntryVersion, Value(result.selection->version));
  } else if (!result.notModified) {
    log::error("fetchAndCacheStorebag: Unable to fetch storebag for client type %d", clientType);
  }
  fields.set(kStorebagEntryFetchTime, Value::date(clock_->now()));
  fields.set(kStorebagEntryFetchState,
             Value(result.selection || result.notModified ? kStorebagFetchSuccessful : kStorebagFetchFailure));
  fields.set(kStorebagEntryMaxAge, Value(maxAge));
  entries.set(*name, std::move(entry));
}

Value AgentStorebagCache::copyCachedStorebags() const {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  return cachedStorebags_.copy();
}

std::size_t AgentStorebagCache::entryCount() const {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  return cachedStorebags_.asDictionary()->size();
}

}  // namespace telvane
