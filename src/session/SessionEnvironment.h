// SessionEnvironment: everything outside the daemon that a reporting session touches,
// gathered so that the agent hands one set to every session it creates and tests can
// replace each piece.
//
// A default-constructed environment is empty; `withSystemDefaults()` fills every
// missing piece with the process's real service (settings database, device facts,
// system randomness and clock, the build's framework version, the locale, the task's
// memory, the message log file) and, for the backend factory, with one that yields no
// backends.
//
// Threading: a resolved environment is immutable and shared by all sessions; each
// service is thread-safe itself.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "backends/TelvaneBackend.h"
#include "platform/Clock.h"
#include "platform/Random.h"
#include "platform/SettingsStore.h"
#include "telvane/Value.h"
#include "util/DeviceInfo.h"

namespace telvane {

// Builds a session's backends from its storebag section, given the session info,
// the user info (null when none) and the device identifier. The storebag document
// and the concrete backends supply the real one; the default yields an empty map.
using BackendFactory = std::function<BackendMap(const Value& section, const Value& sessionInfo,
                                                const Value& userInfo, const std::string& deviceID)>;

struct SessionEnvironment {
  std::shared_ptr<SettingsStore> settings;
  std::shared_ptr<const DeviceInfo> deviceInfo;
  std::shared_ptr<Random> random;
  std::shared_ptr<Clock> clock;
  // Whether the device runs an internal build; unset: the process-wide flag.
  std::optional<bool> internalBuild;
  // The client framework's bundle version; a function that answers nothing stands
  // for a bundle without a version.
  std::function<std::optional<std::string>()> frameworkBundleVersion;
  // The current locale's country code, if any.
  std::function<std::optional<std::string>()> localeCountryCode;
  // The daemon's anonymous resident memory in bytes (0 when unknown).
  std::function<std::uint64_t()> taskMemoryBytes;
  // Appends one line to the daily message log.
  std::function<void(const std::string& line)> messageLog;
  BackendFactory backendFactory;

  // A copy with every unset piece replaced by the process's real one.
  SessionEnvironment withSystemDefaults() const;
};

}  // namespace telvane
