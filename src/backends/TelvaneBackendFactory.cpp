#include "backends/TelvaneBackendFactory.h"

#include <utility>

#include "backends/dashboard/DashboardBackend.h"
#include "backends/https/HTTPSPostBackend.h"
#include "backends/telemetry/JoulemeterBackend.h"
#include "backends/telemetry/MetrixBackend.h"
#include "backends/upload/UploadBackend.h"
#include "platform/Log.h"

namespace telvane {

std::optional<BackendKind> backendKindForName(const std::string& name, const std::optional<std::string>& deviceModel) {
  if (name == kDashboardBackendName) return BackendKind::Dashboard;
  if (name == kUploadBackendName) return BackendKind::Upload;
  // Any name that merely contains the word makes an HTTPS post backend.
  if (name.find(kHTTPSPostBackendNamePart) != std::string::npos) return BackendKind::HTTPSPost;
  if (name == kBrindleBackendName) return BackendKind::HTTPSPost;
  if (name == kPowerBackendName) return BackendKind::Joulemeter;
  if (name == kQuarlBackendName) return BackendKind::HTTPSPost;
  if (name == kMetrixBackendName && deviceModel != std::optional<std::string>(kMetrixExcludedDeviceModel)) {
    return BackendKind::Metrix;
  }
  return std::nullopt;
}

std::shared_ptr<TelvaneBackendBase> newBackendWithName(const std::string& name, const Value& profile,
                                                       const std::optional<std::string>& productFamily,
                                                       std::int32_t clientType, const BackendPlatform& platform) {
  BackendPlatform resolved = platform.withSystemDefaults();
  std::optional<BackendKind> kind = backendKindForName(name, resolved.deviceInfo->productType());
  if (kind == BackendKind::Dashboard) return DashboardBackend::create(name, profile, productFamily, resolved);
  if (kind == BackendKind::HTTPSPost) return HTTPSPostBackend::create(name, profile, productFamily, resolved);
  if (kind == BackendKind::Upload) return UploadBackend::create(name, profile, productFamily, resolved);
  if (kind == BackendKind::Joulemeter) return JoulemeterBackend::create(name, profile, productFamily, resolved);
  // The only class whose initialiser receives the client type.
  if (kind == BackendKind::Metrix) return MetrixBackend::create(name, profile, productFamily, clientType, resolved);
  // No backend for this name.
  log::error("TelvaneBackend(newBackendWithName): %s", name);
  return nullptr;
}

void applyBackendSettings(TelvaneBackendBase& backend, const BackendSettings& settings) {
  backend.setSessionID(static_cast<std::uint32_t>(integerFromText(settings.sessionIdentifier)));
  backend.setCompType(settings.clientType);
  backend.setClientVersion(settings.clientVersion);
  backend.setUdid(settings.deviceIdentifier);
  backend.setProductVersion(settings.productVersion);
  backend.setBuildVersion(settings.buildVersion);
  backend.setHardwareType(settings.hardwareType);
  backend.setIsInternal(settings.internalBuild);
  backend.setRequireUserInfo(settings.requireUserInfo);
  backend.setBatchEvents(settings.batchEvents);
  backend.setAllowNestedData(settings.allowNestedData);
  backend.setUserInfoDict(settings.userInfo);
  backend.setSelfVersion(settings.daemonVersion);
  backend.setStartTimestamp(TimeValue::fromSeconds(settings.startTimestampSeconds));
}

BackendEntryFactory makeTelvaneBackendEntryFactory(BackendPlatform platform) {
  BackendPlatform resolved = platform.withSystemDefaults();
  return [resolved = std::move(resolved)](const BackendRequest& request,
                                          const BackendSettings& settings) -> std::shared_ptr<TelvaneBackend> {
    std::shared_ptr<TelvaneBackendBase> backend =
        newBackendWithName(request.name, request.profile, request.productFamily, request.clientType, resolved);
    if (!backend) return nullptr;
    applyBackendSettings(*backend, settings);
    return backend;
  };
}

}  // namespace telvane
