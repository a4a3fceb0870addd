// StorebagDiskCache: the last good signed envelope of every storebag name, one file
// per name, in "<cache parent>/storebags/<name>". The file holds the envelope exactly
// as received, so it is verified again on every load; its modification time is the
// time of the last successful save and the age reference for expiry.
//
// Saves are atomic: the bytes go to a temporary file in the same folder, are flushed
// to the disk and then renamed over the old file, so a failed save leaves the old
// file as it was. Failures are logged with the system's lines.
//
// Also here: the process-wide storebag lock that serialises every disk-cache and
// metrics access of the retrieval (recursive; taken inside the agent's lock, never
// around it).
//
// Threading: the object is immutable after construction and safe from any thread;
// callers that need a load and its metrics to agree hold storebagLock().
#pragma once

#include <cstdint>
#include <mutex>
#include <optional>
#include <string>

#include "telvane/Value.h"

namespace telvane {

// The folder of the envelope files below the cache parent.
inline constexpr const char* kStorebagCacheFolderName = "storebags";

class StorebagDiskCache {
 public:
  // `parentDir` is the folder above "storebags"; `internalBuild` turns on the
  // protection step before loads.
  StorebagDiskCache(std::string parentDir, bool internalBuild);
  // The daemon's cache under storebagCacheParentDir(), for isInternalBuild().
  static StorebagDiskCache system();

  const std::string& parentDirectory() const { return parentDir_; }
  std::string directory() const;
  // The envelope file of the name. Creates the folders on every call (errors are
  // ignored: the save or load that follows reports them).
  std::string cacheFilePath(const std::string& name) const;

  // Writes the envelope atomically; false (and a log line) on failure.
  bool save(const std::string& name, const Bytes& envelope) const;
  // The whole file, read without keeping it in the system's file cache; nothing (and
  // a log line) when it cannot be read, a missing file included.
  std::optional<Bytes> load(const std::string& name) const;
  // The file's modification time in seconds since 1970; nothing without a file.
  std::optional<double> modificationTime(const std::string& name) const;
  // The absolute number of seconds between the file's modification time and `now`.
  std::optional<double> ageSeconds(const std::string& name, double now) const;

 private:
  std::string parentDir_;
  bool internalBuild_;
};

// An envelope is stale when its age is strictly greater than its max age.
bool isStorebagCacheExpired(double ageSeconds, std::int32_t maxAgeSeconds);

// Sets the no-protection file class on the path. Linux has no file protection
// classes, so there is nothing to set and this always succeeds.
bool setStorageClassProtectionLevel(const std::string& path);

// The process-wide storebag lock.
std::recursive_mutex& storebagLock();

}  // namespace telvane
