// HTTPSPostBackend: the server-driven state. Picks the per-client rule of the profile
// that fits the session and turns it into the reporting state and the settings
// (batching, URLs, consent, sampling, filters, category lists).
//
// Rule keys of the wrong type count as absent, except that a number is accepted as
// text where a name list or a version is expected, and text where a number is
// expected is read as a number.
#include <utility>

#include "backends/https/HTTPSPostBackend.h"
#include "platform/Log.h"
#include "util/PersistentIdentifiers.h"

namespace telvane {

namespace {

constexpr const char* kClientsKey = "clients";
constexpr const char* kClientKey = "client";
constexpr const char* kServiceKey = "service";
constexpr const char* kExpediteKey = "expedite";
constexpr const char* kEnabledSinceKey = "enabledSince";
constexpr const char* kOverrideDnuKey = "override_dnu";
constexpr const char* kLocaleWhitelistKey = "locale_whitelist";
constexpr const char* kDeviceWhitelistKey = "device_whitelist";
constexpr const char* kDeviceBlacklistKey = "device_blacklist";
constexpr const char* kFiltersKey = "filters";
constexpr const char* kSamplingThresholdKey = "sampling_threshold";
constexpr const char* kPerCountrySamplingThresholdsKey = "per_country_sampling_thresholds";
constexpr const char* kCountryKey = "country";
constexpr const char* kThresholdKey = "threshold";
constexpr const char* kOverrideSamplingKey = "override_sampling";
constexpr const char* kEventThresholdKey = "event_threshold";
constexpr const char* kExtrasOnInternalKey = "extras_on_internal";
constexpr const char* kCustomClientIdKey = "custom_clientId";
constexpr const char* kPostURLKey = "post_url";
constexpr const char* kRealtimePostURLKey = "realtime_post_url";
constexpr const char* kEventWhitelistKey = "event_whitelist";
constexpr const char* kEventBlacklistKey = "event_blacklist";
constexpr const char* kUseWiFiOnlyKey = "use_wifi_only";
constexpr const char* kClientNameKey = "_clientName";
constexpr const char* kServiceNameKey = "_serviceName";

// The value of a rule key (null when the rule is not a dictionary or lacks the key).
const Value& ruleValue(const Value& rule, const char* key) { return rule[key]; }

bool hasKey(const Value& rule, const char* key) { return !ruleValue(rule, key).isNull(); }

std::optional<std::string> textOf(const Value& value) {
  if (const std::string* text = value.asString()) return *text;
  return std::nullopt;
}

// An integer of the rule: numbers (truncated) and text read as a number; anything
// else counts as absent.
std::optional<std::int64_t> integerOf(const Value& value) {
  if (value.isNumber() || value.isString()) return value.integerValue();
  return std::nullopt;
}

// A number object of the rule: numbers as they are, text read as a number, anything
// else absent.
std::optional<double> numberOf(const Value& value) {
  if (value.isNumber() || value.isString()) return value.doubleValue();
  return std::nullopt;
}

// A comma-separated list of names as an array of its parts (not trimmed); nothing
// when the value is absent. A number counts as its text.
Value commaList(const Value& value) {
  std::string text;
  if (const std::string* s = value.asString()) {
    text = *s;
  } else if (value.isNumber()) {
    text = value.description();
  } else {
    return Value();
  }
  Array parts;
  std::size_t start = 0;
  for (;;) {
    std::size_t comma = text.find(',', start);
    parts.emplace_back(text.substr(start, comma == std::string::npos ? std::string::npos : comma - start));
    if (comma == std::string::npos) break;
    start = comma + 1;
  }
  return Value(std::move(parts));
}

// "major.middle.minor" as three numbers, each modulo 256, missing ones 0.
void versionParts(const std::string& text, std::uint8_t parts[3]) {
  parts[0] = parts[1] = parts[2] = 0;
  std::size_t start = 0;
  for (int index = 0; index < 3; ++index) {
    std::size_t dot = text.find('.', start);
    std::string_view element(text.data() + start, (dot == std::string::npos ? text.size() : dot) - start);
    parts[index] = static_cast<std::uint8_t>(integerFromText(element));
    if (dot == std::string::npos) break;
    start = dot + 1;
  }
}

std::string describe(const std::optional<std::string>& text) { return text ? *text : "(null)"; }
std::string describe(const Value& value) { return value.isNull() ? "(null)" : value.description(); }

}  // namespace

std::int32_t HTTPSPostBackend::updateState() {
  std::int32_t state = updateBackendState();
  setState(state);
  return state;
}

bool HTTPSPostBackend::matchClientNameAndServiceID(const Value& rule, const std::optional<std::string>& clientName,
                                                   const std::optional<std::string>& serviceName) {
  // An entry of the client list that is not a rule applies to nobody.
  if (!rule.isDictionary()) return false;
  return matchExactStringWithList(commaList(ruleValue(rule, kClientKey)), clientName, true) &&
         matchStringWithList(commaList(ruleValue(rule, kServiceKey)), serviceName, true);
}

bool HTTPSPostBackend::isFrameworkEnabledForClient(const Value& rule) const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return isFrameworkEnabledForClientLocked(rule);
}

bool HTTPSPostBackend::isFrameworkEnabledForClientLocked(const Value& rule) const {
  const Value& since = ruleValue(rule, kEnabledSinceKey);
  std::string text;
  if (const std::string* s = since.asString()) {
    text = *s;
  } else if (since.isNumber()) {
    text = since.description();
  } else {
    return true;
  }
  std::uint8_t required[3];
  versionParts(text, required);
  const std::uint8_t own[3] = {selfVersionMajor_, selfVersionMiddle_, selfVersionMinor_};
  for (int i = 0; i < 3; ++i) {
    if (own[i] != required[i]) return own[i] > required[i];
  }
  return true;
}

void HTTPSPostBackend::resetBackendStateWithClient(const Value& rule) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  resetBackendStateWithClientLocked(rule);
}

void HTTPSPostBackend::resetBackendStateWithClientLocked(const Value& rule) {
  eventThreshold_ = static_cast<std::int32_t>(
      integerOf(ruleValue(rule, kEventThresholdKey)).value_or(kDefaultEventThreshold));
  log::info("resetBackendStateWithClient: event_threshold set to %d", eventThreshold_);
  extrasOnInternal_ = static_cast<std::int32_t>(integerOf(ruleValue(rule, kExtrasOnInternalKey)).value_or(0));
  // The first word differs from the method's name; the line has always read so.
  log::info("setBackendStateWithClient: extras on internal is set to %d", extrasOnInternal_);
}

bool HTTPSPostBackend::updatePostLink(const Value& rule) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return updatePostLinkLocked(rule);
}

bool HTTPSPostBackend::updatePostLinkLocked(const Value& rule) {
  bool setPostURL = false;
  // A URL from the user defaults wins over every rule.
  if (!(useDefaultPostURL_ && postURL_)) {
    useDefaultPostURL_ = false;
    if (std::optional<std::string> url = textOf(ruleValue(rule, kPostURLKey))) {
      postURL_ = *url;
      log::info("HTTPSPostBackend(updatePostLink): Storebag '%s' for postURL", *url);
      setPostURL = true;
    }
  }
  if (!(useDefaultRealtimePostURL_ && realtimePostURL_)) {
    useDefaultRealtimePostURL_ = false;
    if (std::optional<std::string> url = textOf(ruleValue(rule, kRealtimePostURLKey))) {
      realtimePostURL_ = *url;
      log::info("HTTPSPostBackend(updatePostLink): Storebag '%s' for realtimePostURL", *url);
    } else {
      // The realtime URL never stays empty while a post URL is known.
      realtimePostURL_ = postURL_;
      log::info("HTTPSPostBackend(updatePostLink): realtimePostURL defaults to postURL '%s'", describe(postURL_));
    }
  }
  return setPostURL;
}

std::int32_t HTTPSPostBackend::updateBackendState() {
  bool immutable;
  {
    std::lock_guard<std::mutex> lock(settingsMutex_);
    immutable = immutable_;
  }
  if (immutable) return state();

  const Array* rules = profile_[kClientsKey].asArray();
  if (!rules || rules->empty()) return kBackendStateDisabled;
  std::optional<std::string> countryCode = platform_.localeCountryCode();

  std::lock_guard<std::mutex> lock(settingsMutex_);
  std::optional<std::string> clientName = textOf(userInfoDict_[kClientNameKey]);
  std::optional<std::string> serviceName = textOf(userInfoDict_[kServiceNameKey]);

  // The batching switch comes from the first rule that names the session, before
  // anything else.
  for (const Value& rule : *rules) {
    if (!matchClientNameAndServiceID(rule, clientName, serviceName)) continue;
    if (std::optional<std::int64_t> expedite = integerOf(ruleValue(rule, kExpediteKey))) {
      batchEvents_ = *expedite == 0;
      log::info("HTTPSPostBackend(updateBackendState): Store bag override  _batchEvent=%d", batchEvents_ ? 1 : 0);
    }
    break;
  }

  // Without required user information, the backend reports to the first rule's URL
  // and no other rule applies.
  if (!requireUserInfo_) {
    const Value* linked = nullptr;
    for (const Value& rule : *rules) {
      if (updatePostLinkLocked(rule)) {
        linked = &rule;
        break;
      }
    }
    resetBackendStateWithClientLocked(linked ? *linked : Value());
    return kBackendStateEnabled;
  }

  const Dictionary* userInfo = userInfoDict_.asDictionary();
  if (!userInfo || userInfo->empty()) return kBackendStatePending;

  const Value* matched = nullptr;
  for (const Value& rule : *rules) {
    if (matchClientNameAndServiceID(rule, clientName, serviceName) && isFrameworkEnabledForClientLocked(rule)) {
      matched = &rule;
      break;
    }
  }
  if (!matched) return kBackendStateDisabled;
  const Value& rule = *matched;

  // Consent.
  std::optional<std::int64_t> overrideDnu = integerOf(ruleValue(rule, kOverrideDnuKey));
  if (overrideDnu != 1) {
    dnuType_ = 0;
    if (!dnuEnabled_) {
      log::info("HTTPSPostBackend(updateBackendState): reporting disabled by DNU: %d.",
                static_cast<std::int32_t>(overrideDnu.value_or(0)));
      return kBackendStateDisabled;
    }
  } else {
    dnuType_ = dnuEnabled_ ? 2 : 1;
  }

  // Country: tested as a blacklist on purpose, so that a rule without a list disables
  // the backend while a device without a country code passes.
  const Value& locales = ruleValue(rule, kLocaleWhitelistKey);
  if (!matchStringWithList(locales, countryCode, false)) {
    log::info("HTTPSPostBackend(updateBackendState): (%s) isn't in country code list %s", describe(countryCode),
              describe(locales));
    return kBackendStateDisabled;
  }
  const Value& devices = ruleValue(rule, kDeviceWhitelistKey);
  if (!matchStringWithList(devices, productFamily_, true)) {
    log::info("HTTPSPostBackend(updateBackendState): (%s) isn't in device whitelist %s", describe(productFamily_),
              describe(devices));
    return kBackendStateDisabled;
  }
  const Value& refusedDevices = ruleValue(rule, kDeviceBlacklistKey);
  if (matchStringWithList(refusedDevices, hardwareType_, false)) {
    log::info("HTTPSPostBackend(updateBackendState): (%s) is in device blacklist %s", describe(hardwareType_),
              describe(refusedDevices));
    return kBackendStateDisabled;
  }

  const Value& filterDescriptions = ruleValue(rule, kFiltersKey);
  if (!filterDescriptions.isArray()) {
    log::error("HTTPSPostBackend(updateBackendState): filters are required.");
    return kBackendStateDisabled;
  }
  createFiltersFromArrayLocked(filterDescriptions);

  // Sampling threshold: the rule's, unless the first entry naming the country says
  // otherwise.
  samplingThreshold_ = numberOf(ruleValue(rule, kSamplingThresholdKey));
  if (const Array* perCountry = ruleValue(rule, kPerCountrySamplingThresholdsKey).asArray()) {
    for (const Value& entry : *perCountry) {
      const Array* countries = entry[kCountryKey].asArray();
      if (!countries || !countryCode) continue;
      bool names = false;
      for (const Value& country : *countries) {
        const std::string* text = country.asString();
        if (text && *text == *countryCode) {
          names = true;
          break;
        }
      }
      if (!names) continue;
      std::optional<double> threshold = numberOf(entry[kThresholdKey]);
      log::info("HTTPSPostBackend(updateBackendState): sampling threshold for %s changed from %.02f to %.02f",
                *countryCode, static_cast<float>(samplingThreshold_.value_or(0.0)),
                static_cast<float>(threshold.value_or(0.0)));
      samplingThreshold_ = threshold;
      break;
    }
  }

  // Sampling decision. A rule without "override_sampling" never disables a
  // sampled-out device; it only defers its events.
  std::int32_t state;
  if (!samplingThreshold_) {
    state = kBackendStateDisabled;
  } else if (*samplingThreshold_ > samplingFactor_) {
    state = kBackendStateEnabled;
  } else {
    overrideSampling_ = numberOf(ruleValue(rule, kOverrideSamplingKey));
    state = overrideSampling_ && *overrideSampling_ <= samplingFactor_ ? kBackendStateDisabled
                                                                       : kBackendStateDeferred;
  }

  resetBackendStateWithClientLocked(rule);
  if (hasKey(rule, kCustomClientIdKey)) {
    uuidCustom_ =
        getPersistentIdentifierForCustomClientIDSuffix(*platform_.settings, *platform_.random, clientName, serviceName);
  }
  log::info("HTTPSPostBackend(updateBackendState): %s: client found %s:%s, state=%d, samplingFactor=%f", name_,
            describe(clientName), describe(serviceName), state, samplingFactor_);
  updatePostLinkLocked(rule);
  if (const Array* whitelist = ruleValue(rule, kEventWhitelistKey).asArray()) {
    eventWhitelist_ = *whitelist;
    log::info("HTTPSPostBackend(updateBackendState): %s: eventWhitelist=%s", name_, Value(*whitelist).description());
  }
  if (const Array* blacklist = ruleValue(rule, kEventBlacklistKey).asArray()) {
    eventBlacklist_ = *blacklist;
    log::info("HTTPSPostBackend(updateBackendState): %s: eventBlacklist=%s", name_, Value(*blacklist).description());
  }
  shouldUseWiFiOnly_ = static_cast<std::uint8_t>(integerOf(ruleValue(rule, kUseWiFiOnlyKey)).value_or(0)) != 0;
  return state;
}

}  // namespace telvane
