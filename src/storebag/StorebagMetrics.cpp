#include "storebag/StorebagMetrics.h"

#include <climits>
#include <utility>
#include <vector>

#include "platform/Log.h"
#include "storebag/StorebagDocument.h"

namespace telvane {

namespace {

bool isSeparator(char c) { return c == '=' || c == ' ' || c == '\t' || c == '\n' || c == '\r' || c == '\v' || c == '\f'; }

// Splits at every separator; empty pieces stay.
std::vector<std::string_view> splitHeader(std::string_view text) {
  std::vector<std::string_view> pieces;
  std::size_t start = 0;
  for (std::size_t i = 0; i <= text.size(); ++i) {
    if (i == text.size() || isSeparator(text[i])) {
      pieces.push_back(text.substr(start, i - start));
      start = i + 1;
    }
  }
  return pieces;
}

std::int32_t saturatedInt32(std::int64_t value) {
  if (value > INT32_MAX) return INT32_MAX;
  if (value < INT32_MIN) return INT32_MIN;
  return static_cast<std::int32_t>(value);
}

}  // namespace

StorebagMetrics::StorebagMetrics(std::shared_ptr<SettingsStore> settings) : settings_(std::move(settings)) {}

std::string StorebagMetrics::maxAgeKey(const std::string& name) { return "CACHED_" + name + "_max-age"; }

std::string StorebagMetrics::lastModifiedKey(const std::string& name) { return "CACHED_" + name + "_Last-Modified"; }

std::int32_t StorebagMetrics::maxAgeFromCacheControl(const std::optional<std::string>& cacheControl) {
  if (!cacheControl) return kStorebagDefaultMaxAgeSeconds;
  std::vector<std::string_view> pieces = splitHeader(*cacheControl);
  for (std::size_t i = 0; i < pieces.size(); ++i) {
    if (pieces[i] != "max-age") continue;
    if (i + 1 >= pieces.size()) break;
    return saturatedInt32(integerFromText(pieces[i + 1]));
  }
  return kStorebagDefaultMaxAgeSeconds;
}

void StorebagMetrics::save(const std::string& name, const std::optional<std::string>& cacheControl,
                           const std::optional<std::string>& lastModified) {
  std::int32_t maxAge = maxAgeFromCacheControl(cacheControl);
  settings_->write(kTelvaneSettingsDomain, maxAgeKey(name), Value(maxAge));
  if (lastModified) {
    settings_->write(kTelvaneSettingsDomain, lastModifiedKey(name), Value(*lastModified));
  } else {
    settings_->remove(kTelvaneSettingsDomain, lastModifiedKey(name));
  }
  log::info("saveLastLoadedStorebagMetricsWithName: New storebag '%s' received: maxAge %d, Last-Modified '%s'", name,
            maxAge, lastModified ? *lastModified : std::string("(null)"));
}

void StorebagMetrics::get(const std::string& name, std::int32_t* maxAge, bool* notModified,
                          std::optional<std::string>* lastModified) const {
  if (maxAge) {
    std::optional<Value> stored = settings_->read(kTelvaneSettingsDomain, maxAgeKey(name));
    *maxAge = stored ? saturatedInt32(stored->integerValue()) : 0;
    log::info("getLastLoadedStorebagMetricsWithName: maxAge is %d for storebag %s", *maxAge, name);
  }
  if (!lastModified) return;
  std::optional<Value> stored = settings_->read(kTelvaneSettingsDomain, lastModifiedKey(name));
  if (!stored) return;
  std::string storedText = stored->isString() ? stored->stringOrEmpty() : stored->description();
  if (*lastModified && **lastModified == storedText) {
    log::info("getLastLoadedStorebagMetricsWithName: 'Last-Modified' has not changed for storebag '%s': '%s'", name,
              storedText);
    if (notModified) *notModified = true;
  } else {
    *lastModified = storedText;
    log::info("getLastLoadedStorebagMetricsWithName: 'Last-Modified' has changed to '%s' for storebag '%s'", storedText,
              name);
  }
}

}  // namespace telvane
