#include "backends/BackendPlatform.h"

#include "backends/telemetry/MetrixAdaptorLibrary.h"
#include "platform/SystemInfo.h"

namespace telvane {

namespace {

constexpr std::uint32_t kInternalEnvironment = 2;
constexpr std::uint32_t kSeedEnvironment = 3;
constexpr std::uint32_t kEnvironmentCount = 5;

}  // namespace

std::uint32_t environmentTypeFromSettings(SettingsStore& settings, bool internalBuild) {
  std::optional<Value> stored = settings.read(kBackendDefaultsDomain, kEnvironmentTypeDefaultsKey);
  if (!stored) return internalBuild ? kInternalEnvironment : kSeedEnvironment;
  std::uint32_t environment = stored->unsignedIntValue();
  return environment >= kEnvironmentCount ? kInternalEnvironment : environment;
}

BackendPlatform BackendPlatform::withSystemDefaults() const {
  BackendPlatform resolved = *this;
  if (!resolved.settings) resolved.settings = defaultSettingsStore();
  if (!resolved.random) resolved.random = Random::system();
  if (!resolved.clock) resolved.clock = Clock::system();
  if (!resolved.deviceInfo) resolved.deviceInfo = std::make_shared<const DeviceInfo>(DeviceFacts::system());
  if (!resolved.internalRelease) resolved.internalRelease = isInternalBuild();
  if (!resolved.diagnosticsConsent) {
    std::shared_ptr<SettingsStore> settings = resolved.settings;
    resolved.diagnosticsConsent = [settings] {
      std::optional<Value> consent = settings->read(kDiagnosticsDefaultsDomain, kSubmitDiagnosticsDefaultsKey);
      return consent && consent->boolValue();
    };
  }
  if (!resolved.localeCountryCode) {
    resolved.localeCountryCode = []() -> std::optional<std::string> { return telvane::localeCountryCode(); };
  }
  if (!resolved.timeZoneOffsetSeconds) resolved.timeZoneOffsetSeconds = [] { return telvane::timeZoneOffsetSeconds(); };
  if (!resolved.environmentType) {
    std::shared_ptr<SettingsStore> settings = resolved.settings;
    bool internal = *resolved.internalRelease;
    resolved.environmentType = [settings, internal] { return environmentTypeFromSettings(*settings, internal); };
  }
  if (!resolved.powerLog) resolved.powerLog = PowerLog::journal();
  if (!resolved.metrixAdaptorPath) resolved.metrixAdaptorPath = MetrixAdaptorLibrary::defaultPath();
  return resolved;
}

}  // namespace telvane
