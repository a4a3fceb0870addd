// Turning a storebag section into a session's backends.
//
// Every key of the section names one backend; its value is the backend's profile.
// `createBackends` gathers once per call what every backend of the session is told
// (device facts, the internal flag, the daemon version, the session's identity from
// its session info) and asks a BackendEntryFactory for one backend per key; only what
// the factory returns becomes a backend. The factory makes the concrete backend and
// applies the settings to it in the order of BackendSettings' fields.
//
// `makeStorebagBackendFactory` wraps this into the session environment's
// BackendFactory.
//
// Threading: createBackends runs on the caller's thread (a session's queue) and
// shares nothing; the services it is given are thread-safe.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "backends/TelvaneBackend.h"
#include "platform/Clock.h"
#include "telvane/Value.h"
#include "util/DeviceInfo.h"

namespace telvane {

// The daemon version when the framework has none.
inline constexpr const char* kDefaultDaemonVersion = "8.0";
// Client types whose sessions may send nested data (the second one on internal
// builds only).
inline constexpr std::int32_t kNestedDataClientType = 28;
inline constexpr std::int32_t kInternalNestedDataClientType = 7;

// What every backend of a session is told when it is made, in the order it is set.
struct BackendSettings {
  std::string sessionIdentifier;
  std::int32_t clientType = 0;
  std::uint16_t clientVersion = 0;
  std::string deviceIdentifier;
  std::optional<std::string> productVersion;
  std::optional<std::string> buildVersion;
  std::optional<std::string> hardwareType;  // the "ProductType" answer
  bool internalBuild = false;
  bool requireUserInfo = true;
  bool batchEvents = false;
  bool allowNestedData = false;
  Value userInfo;  // null when none
  std::string daemonVersion;
  double startTimestampSeconds = 0;  // wall-clock time of the createBackends call
};

// One backend entry of a section, as handed to the factory.
struct BackendRequest {
  std::string name;
  Value profile;
  std::optional<std::string> productFamily;  // the "DeviceName" answer
  std::int32_t clientType = 0;
};

// Makes the backend of one entry and applies the settings; null for an entry that
// is not a backend (for example "release_timeout").
using BackendEntryFactory =
    std::function<std::shared_ptr<TelvaneBackend>(const BackendRequest& request, const BackendSettings& settings)>;

// What createBackends reads besides its arguments. Unset pieces are the process's.
struct BackendServices {
  std::shared_ptr<const DeviceInfo> deviceInfo;
  std::optional<bool> internalBuild;
  // The framework's bundle version; nothing means "8.0".
  std::function<std::optional<std::string>()> frameworkBundleVersion;
  std::shared_ptr<Clock> clock;
};

// The backends of a session, by name. A null section or null session info is logged
// and yields no backends.
BackendMap createBackends(const Value& section, const Value& sessionInfo, const Value& userInfo,
                          const std::string& deviceIdentifier, const BackendEntryFactory& factory,
                          const BackendServices& services = {});

// The session environment's backend factory over createBackends.
std::function<BackendMap(const Value&, const Value&, const Value&, const std::string&)> makeStorebagBackendFactory(
    BackendEntryFactory factory, BackendServices services = {});

}  // namespace telvane
