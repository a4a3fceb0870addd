// StorebagMetrics: what the storebag server said about caching, kept per storebag
// name in the daemon's settings domain under "CACHED_<name>_max-age" (seconds the
// cached envelope counts as fresh) and "CACHED_<name>_Last-Modified" (sent back as
// "If-Modified-Since").
//
// The retrieval saves the metrics of every 200 answer (before and independently of
// the signature check) and reads them before it decides whether to refresh.
//
// Threading: safe from any thread (the settings store synchronises itself); callers
// hold storebagLock() when a read must agree with a save made elsewhere.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/SettingsStore.h"

namespace telvane {

// The max age when the server sets none.
inline constexpr std::int32_t kStorebagDefaultMaxAgeSeconds = 86400;

class StorebagMetrics {
 public:
  explicit StorebagMetrics(std::shared_ptr<SettingsStore> settings);

  static std::string maxAgeKey(const std::string& name);
  static std::string lastModifiedKey(const std::string& name);
  // The max age of a "Cache-Control" header: the piece after the first piece that is
  // exactly "max-age", splitting at "=" and at spaces; 86400 without one.
  static std::int32_t maxAgeFromCacheControl(const std::optional<std::string>& cacheControl);

  // Records a 200 answer's headers: the max age, and "Last-Modified" (removed when
  // the answer has none). Logs what was received.
  void save(const std::string& name, const std::optional<std::string>& cacheControl,
            const std::optional<std::string>& lastModified);

  // Reads the metrics. `maxAge` (when given) gets the stored max age, 0 without one.
  // When `lastModified` is given and a value is stored: an equal value sets
  // `notModified` (when given); a different one (or none) is replaced by the stored
  // value.
  void get(const std::string& name, std::int32_t* maxAge, bool* notModified,
           std::optional<std::string>* lastModified) const;

 private:
  std::shared_ptr<SettingsStore> settings_;
};

}  // namespace telvane
