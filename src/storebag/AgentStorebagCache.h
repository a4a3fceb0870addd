// AgentStorebagCache: the daemon-wide cache of storebag sections, one entry per
// storebag name, so that the sessions of one client family share one storebag and the
// disk, signature and network work of the retrieval happens only when the entry is
// stale. A failed fetch keeps the section of an earlier success and holds further
// attempts off for 900 seconds.
//
// An entry is a dictionary with "StorebagData" (the environment section, set only on
// success), "StorebagVersion" (the document's version, set with it),
// "StorebagFetchTime" (date of the last attempt), "StorebagFetchState" ("Fetch
// Successful" or "Fetch Failure") and "StorebagMaxAge" (seconds). Entries are made at
// the first attempt for a name and never removed. An update replaces an entry with a
// new dictionary rather than changing it, so the entries a copy of the cache shares
// stay as they were when copied.
//
// The agent owns the cache. Threading: every operation takes the lock given at
// construction (the agent's recursive lock) for its whole duration, including the
// fetch, so concurrent sessions wait for one another; the storebag lock of the
// retrieval is taken inside it, never around it.
#pragma once
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "platform/Clock.h"
#include "storebag/StorebagDocument.h"
#include "telvane/Value.h"

namespace telvane {

inline constexpr const char* kStorebagEntryData = "StorebagData";
inline constexpr const char* kStorebagEntryVersion = "StorebagVersion";
inline constexpr const char* kStorebagEntryFetchTime = "StorebagFetchTime";
inline constexpr const char* kStorebagEntryFetchState = "StorebagFetchState";
inline constexpr const char* kStorebagEntryMaxAge = "StorebagMaxAge";
inline constexpr const char* kStorebagFetchSuccessful = "Fetch Successful";
inline constexpr const char* kStorebagFetchFailure = "Fetch Failure";
// How long a failed fetch holds further attempts off.
inline constexpr std::int32_t kStorebagRetryIntervalSeconds = 900;

class AgentStorebagCache {
 public:
  // Selects the section of a client type (the document's fetch and choice of
  // environment).
  using Selector = std::function<StorebagSelectionResult(std::int32_t clientType)>;
  // The modification time (seconds since 1970) of a name's disk-cache file, or
  // nothing without a file.
  using FileTime = std::function<std::optional<double>(const std::string& name)>;

  AgentStorebagCache(std::recursive_mutex& lock, Selector selector, FileTime fileTime,
                     std::shared_ptr<Clock> clock);

  // storebagForSession: the section for a session's client type, fetched when the
  // entry is missing or stale; nothing for a client type without a storebag.
  std::optional<Value> storebagForSession(std::uint32_t sessionID, std::int32_t clientType);
  // storebagVersionForSession: the cached version; never fetches.
  std::optional<std::string> storebagVersionForSession(std::int32_t clientType);
  // Refreshes the entry of the client type's storebag name.
  void fetchAndCacheStorebag(std::int32_t clientType);
  // A new dictionary of the entries (the entries themselves are shared; they are
  // never changed afterwards, so the caller may read them without the lock).
  Value copyCachedStorebags() const;
  std::size_t entryCount() const;

 private:
  // Constant after construction.
  std::recursive_mutex& lock_;
  const Selector selector_;
  const FileTime fileTime_;
  const std::shared_ptr<Clock> clock_;

  // Guarded by lock_: storebag name -> entry dictionary.
  Value cachedStorebags_ = Value::dictionary();
};

}  // namespace telvane
