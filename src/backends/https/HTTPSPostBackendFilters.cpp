// HTTPSPostBackend: the server's event filters, which remove or hash top-level values
// before they leave the device, and the list matching used by the client rules.
//
// Filters act where they are applied and nowhere else: on the top-level keys of every
// post document ("postTime", "clientId", "events"; the records inside "events" are not
// walked) and, at a flush, on a copy of the session's user information before it goes
// into each batched record. A realtime event therefore carries its user information
// unfiltered; only batched events get filtered user information. This asymmetry is
// intended.
//
// Letter case is compared for ASCII letters only: keys, country codes and device
// names are identifiers.
#include <algorithm>
#include <string_view>
#include <utility>

#include "backends/https/HTTPSPostBackend.h"

namespace telvane {

namespace {

constexpr const char* kFilterMethodKey = "method";
constexpr const char* kFilterStatusKey = "status";
constexpr const char* kFilterKeyKey = "key";
constexpr const char* kFilterValueKey = "value";
constexpr const char* kFilterActionKey = "action";
constexpr const char* kRecordMethodKey = "_method";
constexpr const char* kRecordStatusKey = "_status";

char lowerAscii(char c) { return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c; }

bool equalsIgnoringCase(std::string_view a, std::string_view b) {
  if (a.size() != b.size()) return false;
  for (std::size_t i = 0; i < a.size(); ++i) {
    if (lowerAscii(a[i]) != lowerAscii(b[i])) return false;
  }
  return true;
}

// An empty needle is contained in nothing.
bool containsIgnoringCase(std::string_view haystack, std::string_view needle) {
  if (needle.empty() || needle.size() > haystack.size()) return false;
  auto it = std::search(haystack.begin(), haystack.end(), needle.begin(), needle.end(),
                        [](char a, char b) { return lowerAscii(a) == lowerAscii(b); });
  return it != haystack.end();
}

std::uint8_t actionNumber(const Value& action) {
  const std::string* text = action.asString();
  if (!text) return HTTPSPostBackend::kFilterActionNone;
  if (*text == "remove") return HTTPSPostBackend::kFilterActionRemove;
  if (*text == "sha256") return HTTPSPostBackend::kFilterActionSha256;
  if (*text == "blacklistValues") return HTTPSPostBackend::kFilterActionBlacklistValues;
  if (*text == "whitelistValues") return HTTPSPostBackend::kFilterActionWhitelistValues;
  return HTTPSPostBackend::kFilterActionNone;
}

// A filter field that is a number (numbers, and text read as one); -1 (any) when
// absent or of another kind.
std::int32_t filterNumber(const Value& value) {
  return value.isNumber() || value.isString() ? value.intValue() : -1;
}

bool containsAnyListed(std::string_view text, const Array& listed) {
  for (const Value& element : listed) {
    const std::string* needle = element.asString();
    if (needle && containsIgnoringCase(text, *needle)) return true;
  }
  return false;
}

template <typename Match>
bool matchWithList(const Value& list, const std::optional<std::string>& string, bool whitelist, Match match) {
  const Array* elements = list.asArray();
  if (!elements || elements->empty()) return whitelist;
  if (!string) return !whitelist;
  for (const Value& element : *elements) {
    const std::string* text = element.asString();
    if (text && match(*string, *text)) return true;
  }
  return false;
}

}  // namespace

bool HTTPSPostBackend::matchExactStringWithList(const Value& list, const std::optional<std::string>& string,
                                                bool whitelist) {
  return matchWithList(list, string, whitelist, [](const std::string& s, const std::string& element) {
    return equalsIgnoringCase(s, element);
  });
}

bool HTTPSPostBackend::matchStringWithList(const Value& list, const std::optional<std::string>& string,
                                           bool whitelist) {
  return matchWithList(list, string, whitelist, [](const std::string& s, const std::string& element) {
    return containsIgnoringCase(s, element);
  });
}

void HTTPSPostBackend::createFiltersFromArray(const Value& descriptions) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  createFiltersFromArrayLocked(descriptions);
}

void HTTPSPostBackend::createFiltersFromArrayLocked(const Value& descriptions) {
  const Array* list = descriptions.asArray();
  // An empty list keeps the filters compiled earlier.
  if (!list || list->empty()) return;
  std::vector<CompiledFilter> compiled;
  compiled.reserve(list->size());
  for (const Value& description : *list) {
    CompiledFilter filter;
    filter.method = filterNumber(description[kFilterMethodKey]);
    filter.status = filterNumber(description[kFilterStatusKey]);
    filter.action = actionNumber(description[kFilterActionKey]);
    if (const std::string* key = description[kFilterKeyKey].asString()) filter.key = *key;
    if (const Array* values = description[kFilterValueKey].asArray()) filter.values = *values;
    compiled.push_back(std::move(filter));
  }
  filters_ = std::move(compiled);
}

std::size_t HTTPSPostBackend::numberOfFilters() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return filters_.size();
}

std::vector<HTTPSPostBackend::CompiledFilter> HTTPSPostBackend::filters() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return filters_;
}

void HTTPSPostBackend::filterEvent(Dictionary& dictionary) const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  filterEventLocked(dictionary);
}

void HTTPSPostBackend::filterEventLocked(Dictionary& dictionary) const {
  if (filters_.empty()) return;
  std::int32_t method = dictionary.get(kRecordMethodKey).intValue();
  std::int32_t status = dictionary.get(kRecordStatusKey).intValue();
  // Walk a snapshot of the keys: filters remove entries.
  std::vector<std::string> keys;
  keys.reserve(dictionary.size());
  for (const auto& [key, value] : dictionary) keys.push_back(key);

  for (const std::string& key : keys) {
    // Only the first filter that fits the key acts on it.
    const CompiledFilter* filter = nullptr;
    for (const CompiledFilter& candidate : filters_) {
      if (!candidate.key || !equalsIgnoringCase(*candidate.key, key)) continue;
      if (candidate.method >= 0 && candidate.method != method) continue;
      if (candidate.status >= 0 && candidate.status != status) continue;
      filter = &candidate;
      break;
    }
    if (!filter) continue;
    const Value* value = dictionary.find(key);
    if (!value) continue;
    const std::string* text = value->asString();
    switch (filter->action) {
      case kFilterActionRemove:
        dictionary.erase(key);
        break;
      case kFilterActionSha256:
        // Only text is hashed; values of other kinds are left as they are.
        if (text) dictionary.set(key, Value(convertIntoSHA256(*text)));
        break;
      case kFilterActionBlacklistValues:
        if (text && containsAnyListed(*text, filter->values)) dictionary.erase(key);
        break;
      case kFilterActionWhitelistValues:
        // Values that are not text are kept.
        if (text && !containsAnyListed(*text, filter->values)) dictionary.erase(key);
        break;
      default:
        break;
    }
  }
}

}  // namespace telvane
