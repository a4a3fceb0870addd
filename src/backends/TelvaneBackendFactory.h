// The backend factory: turns one backend entry of a storebag section into a backend
// of the right class, and sets it up with what every backend of the session is told.
//
// The backend name decides the class, in this order, first match wins: "dashboard"
// (dashboard backend), "upload_server" (upload backend), any name containing "splunk"
// (HTTPS post backend), "brindle" (HTTPS post), "power" (power-log backend), "quarl"
// (HTTPS post), "metrix" (wireless-diagnostics backend, except on a device whose model
// is "Maravel"). The substring rule for "splunk" is deliberate; the other names must
// match whole and in this letter case. Any other name yields nothing and an error
// line.
//
// The daemon gives the storebag code
//     makeStorebagBackendFactory(makeTelvaneBackendEntryFactory(platform), services)
// as its session environment's backend factory.
//
// Threading: the functions are thread-safe; the platform's services are themselves.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "backends/BackendPlatform.h"
#include "backends/TelvaneBackendBase.h"
#include "storebag/StorebagBackends.h"
#include "telvane/Value.h"

namespace telvane {

inline constexpr const char* kDashboardBackendName = "dashboard";
inline constexpr const char* kUploadBackendName = "upload_server";
inline constexpr const char* kHTTPSPostBackendNamePart = "splunk";
inline constexpr const char* kBrindleBackendName = "brindle";
inline constexpr const char* kPowerBackendName = "power";
inline constexpr const char* kQuarlBackendName = "quarl";
inline constexpr const char* kMetrixBackendName = "metrix";
// The device model on which the wireless-diagnostics backend is never made.
inline constexpr const char* kMetrixExcludedDeviceModel = "Maravel";

// The class a backend name makes on a device of the given model ("ProductType"), or
// nothing when the name makes no backend there.
std::optional<BackendKind> backendKindForName(const std::string& name, const std::optional<std::string>& deviceModel);

// newBackendWithName:profile:productFamily:clientType:. Nothing when the name makes no
// backend (logged as "TelvaneBackend(newBackendWithName): <name>") or when the class's
// initialiser refuses the profile (logged by the class; the wireless-diagnostics
// backend refuses client types other than 7, 11 and 13; the upload backend a profile
// without "post_url"; the dashboard backend a profile without a usable "ip" and
// "port"). The power-log backend is always made.
std::shared_ptr<TelvaneBackendBase> newBackendWithName(const std::string& name, const Value& profile,
                                                       const std::optional<std::string>& productFamily,
                                                       std::int32_t clientType, const BackendPlatform& platform = {});

// Sets what every backend of the session is told, in this order: session identifier,
// client type, client version, device identifier, product version, build version,
// hardware type, internal flag, require-user-info, batch events, nested data, user
// information, daemon version, start timestamp.
void applyBackendSettings(TelvaneBackendBase& backend, const BackendSettings& settings);

// The entry factory of the storebag code: newBackendWithName, then
// applyBackendSettings. The platform is resolved once, here.
BackendEntryFactory makeTelvaneBackendEntryFactory(BackendPlatform platform = {});

}  // namespace telvane
