// BackendPlatform: everything outside the daemon that a backend reads, gathered so
// that the factory hands one set to every backend it makes and tests can replace each
// piece: the settings domain (user-default URLs, forced event logging, persistent
// identifiers, the diagnostics consent), randomness (the sampling draw, new
// identifiers), the clock (post times), device facts (the model that decides the
// wireless-diagnostics backend), the internal-release flag, the locale's country code,
// the time-zone offset, the environment type, the power log (the power-log backend's
// sink) and the wireless-diagnostics adaptor object.
//
// A default-constructed platform is empty; `withSystemDefaults()` fills every missing
// piece with the process's real service.
//
// Threading: a resolved platform is immutable and shared by all backends; each
// service is thread-safe itself.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/Clock.h"
#include "platform/PowerLog.h"
#include "platform/Random.h"
#include "platform/SettingsStore.h"
#include "util/DeviceInfo.h"

namespace telvane {

// The settings domain and the keys the backends read from it.
inline constexpr const char* kBackendDefaultsDomain = "com.zembra.telvane";
inline constexpr const char* kHttpsPostURLDefaultsKey = "httpsPostURL";
inline constexpr const char* kHttpsRealtimePostURLDefaultsKey = "httpsRealtimePostURL";
inline constexpr const char* kForceEventLoggingDefaultsKey = "forceEventLogging";
inline constexpr const char* kEnvironmentTypeDefaultsKey = "environmentType";
// The user's diagnostics-submission consent: a boolean, absent meaning no consent.
inline constexpr const char* kDiagnosticsDefaultsDomain = "com.zembra.diagnostics";
inline constexpr const char* kSubmitDiagnosticsDefaultsKey = "SubmitDiagnostics";

struct BackendPlatform {
  std::shared_ptr<SettingsStore> settings;
  std::shared_ptr<Random> random;
  std::shared_ptr<Clock> clock;
  std::shared_ptr<const DeviceInfo> deviceInfo;
  // The device runs an internal release ("ReleaseType" is "Internal"); unset: the
  // process-wide flag. Distinct from a backend's `isInternal`, which the session sets.
  std::optional<bool> internalRelease;
  // The diagnostics-submission consent, asked once per backend at creation.
  std::function<bool()> diagnosticsConsent;
  // The current locale's country code, if any.
  std::function<std::optional<std::string>()> localeCountryCode;
  // Seconds east of GMT of the local time zone, now.
  std::function<long()> timeZoneOffsetSeconds;
  // The storebag environment number in force (1 development, 2 internal, 3 seed,
  // 4 release). The daemon passes the storebag's own reading; the default reads the
  // setting without logging.
  std::function<std::uint32_t()> environmentType;
  // Where the power-log backend records its events; default: the journal.
  std::shared_ptr<PowerLog> powerLog;
  // The shared object of the wireless-diagnostics adaptor; unset: $TELVANED_METRIX_ADAPTOR,
  // else "<libdir>/telvane/metrix-adaptor.so".
  std::optional<std::string> metrixAdaptorPath;

  // A copy with every unset piece replaced by the process's real one.
  BackendPlatform withSystemDefaults() const;
};

// The environment number from "environmentType" of the daemon's settings: a value of
// 5 or more (as unsigned) becomes 2; without the key, 2 on internal builds and 3
// otherwise. Logs nothing.
std::uint32_t environmentTypeFromSettings(SettingsStore& settings, bool internalBuild);

}  // namespace telvane
