// HTTPSPostBackend: creation and settings accessors.
#include "backends/https/HTTPSPostBackend.h"

#include <utility>

#include "platform/Log.h"
#include "util/PersistentIdentifiers.h"

namespace telvane {

namespace {

constexpr const char* kClientsKey = "clients";
constexpr const char* kDisplayURLKey = "display_url";

// The user default of that key, when it is present as text.
std::optional<std::string> defaultsString(SettingsStore& settings, const char* key) {
  std::optional<Value> stored = settings.read(kBackendDefaultsDomain, key);
  if (!stored) return std::nullopt;
  if (const std::string* text = stored->asString()) return *text;
  return std::nullopt;
}

}  // namespace

std::shared_ptr<HTTPSPostBackend> HTTPSPostBackend::create(const std::string& name, const Value& profile,
                                                           const std::optional<std::string>& productFamily,
                                                           const BackendPlatform& platform) {
  if (profile.isNull() || !productFamily) return nullptr;
  const Value& clients = profile[kClientsKey];
  if (!clients.isArray() || clients.asArray()->empty()) {
    log::error("HTTPSPostBackend(initWithName): can't find the client list.");
    return nullptr;
  }
  return std::shared_ptr<HTTPSPostBackend>(
      new HTTPSPostBackend(name, profile.copy(), productFamily, platform.withSystemDefaults()));
}

HTTPSPostBackend::HTTPSPostBackend(std::string name, Value profile, std::optional<std::string> productFamily,
                                   BackendPlatform platform)
    : TelvaneBackendBase(std::move(name), std::move(profile), std::move(productFamily), std::move(platform)) {
  SettingsStore& settings = *platform_.settings;
  internalRelease_ = platform_.internalRelease.value_or(false);
  {
    std::lock_guard<std::mutex> lock(settingsMutex_);
    postURL_ = defaultsString(settings, kHttpsPostURLDefaultsKey);
    if (postURL_) log::info("HTTPSPostBackend(initWithName): Using user default '%s' for postURL", *postURL_);
    useDefaultPostURL_ = postURL_.has_value();
    realtimePostURL_ = defaultsString(settings, kHttpsRealtimePostURLDefaultsKey);
    if (realtimePostURL_) {
      log::info("HTTPSPostBackend(initWithName): Using user default '%s' for realtimePostURL", *realtimePostURL_);
    }
    useDefaultRealtimePostURL_ = realtimePostURL_.has_value();
    if (const std::string* url = profile_[kDisplayURLKey].asString()) displayURL_ = *url;
    eventThreshold_ = kDefaultEventThreshold;
  }
  dnuEnabled_ = platform_.diagnosticsConsent();
  uuidRespectDnu_ = getPersistentIdentifierForDNU(settings, *platform_.random, true);
  uuidOverrideDnu_ = getPersistentIdentifierForDNU(settings, *platform_.random, false);
  std::optional<Value> force = settings.read(kBackendDefaultsDomain, kForceEventLoggingDefaultsKey);
  forceEventLogging_ = force && force->boolValue();
}

std::optional<std::string> HTTPSPostBackend::postURL() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return postURL_;
}

void HTTPSPostBackend::setPostURL(std::optional<std::string> url) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  postURL_ = std::move(url);
}

std::optional<std::string> HTTPSPostBackend::realtimePostURL() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return realtimePostURL_;
}

std::int32_t HTTPSPostBackend::dnuType() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return dnuType_;
}

std::int32_t HTTPSPostBackend::eventThreshold() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return eventThreshold_;
}

std::int32_t HTTPSPostBackend::extrasOnInternal() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return extrasOnInternal_;
}

std::optional<double> HTTPSPostBackend::overrideSampling() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return overrideSampling_;
}

std::optional<std::string> HTTPSPostBackend::uuidCustom() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return uuidCustom_;
}

bool HTTPSPostBackend::isImmutable() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return immutable_;
}

std::string HTTPSPostBackend::clientIdentifier() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return clientIdentifierLocked();
}

std::string HTTPSPostBackend::clientIdentifierLocked() const {
  // The device identifier goes out only from internal devices whose rule asks for it.
  if (extrasOnInternal_ != 0 && isInternal_) return udid_;
  if (uuidCustom_) return *uuidCustom_;
  if (dnuType_ != 0) return uuidOverrideDnu_;
  return uuidRespectDnu_;
}

}  // namespace telvane
