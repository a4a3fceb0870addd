#include "storebag/StorebagBackends.h"

#include <utility>
#include <vector>

#include "platform/Log.h"
#include "platform/SystemInfo.h"
#include "session/SessionKeys.h"

namespace telvane {

namespace {

std::string sessionIdentifierText(const Value& value) {
  if (value.isNull()) return std::string();
  if (const std::string* text = value.asString()) return *text;
  if (value.isInteger()) return std::to_string(value.unsignedLongLongValue());
  return value.description();
}

}  // namespace

BackendMap createBackends(const Value& section, const Value& sessionInfo, const Value& userInfo,
                          const std::string& deviceIdentifier, const BackendEntryFactory& factory,
                          const BackendServices& services) {
  BackendMap backends;
  if (section.isNull()) {
    log::error("createBackends: Attempted to create backends with nil storebag");
    return backends;
  }
  if (sessionInfo.isNull()) {
    log::error("createBackends: Attempted to create backends with nil session info");
    return backends;
  }
  const Dictionary* entries = section.asDictionary();
  if (!entries || !factory) return backends;

  const DeviceInfo& device = services.deviceInfo ? *services.deviceInfo : DeviceInfo::shared();
  BackendSettings settings;
  settings.productVersion = device.productVersion();
  settings.buildVersion = device.buildVersion();
  settings.hardwareType = device.productType();
  std::optional<std::string> productFamily = device.deviceName();
  settings.internalBuild = services.internalBuild.value_or(isInternalBuild());
  std::optional<std::string> bundleVersion =
      services.frameworkBundleVersion ? services.frameworkBundleVersion() : std::optional(frameworkBundleVersion());
  settings.daemonVersion = bundleVersion && !bundleVersion->empty() ? *bundleVersion : kDefaultDaemonVersion;

  settings.sessionIdentifier = sessionIdentifierText(sessionInfo[keys::kSessionInfoSessionID]);
  settings.clientType = sessionInfo[keys::kSessionInfoComponentType].intValue();
  settings.clientVersion = sessionInfo[keys::kSessionInfoClientVersion].unsignedShortValue();
  const Dictionary* info = sessionInfo.asDictionary();
  const Value* requireUserInfo = info ? info->find(keys::kSessionInfoRequireUserDict) : nullptr;
  settings.requireUserInfo = requireUserInfo ? requireUserInfo->boolValue() : true;
  settings.batchEvents = sessionInfo[keys::kSessionInfoBatchEvents].boolValue();
  settings.allowNestedData = settings.clientType == kNestedDataClientType ||
                             (settings.internalBuild && settings.clientType == kInternalNestedDataClientType);
  settings.deviceIdentifier = deviceIdentifier;
  settings.userInfo = userInfo;

  std::shared_ptr<Clock> clock = services.clock ? services.clock : Clock::system();
  settings.startTimestampSeconds = clock->now();
  for (const auto& [name, profile] : *entries) {
    BackendRequest request{name, profile, productFamily, settings.clientType};
    std::shared_ptr<TelvaneBackend> backend = factory(request, settings);
    if (backend) backends[name] = std::move(backend);
  }
  return backends;
}

std::function<BackendMap(const Value&, const Value&, const Value&, const std::string&)> makeStorebagBackendFactory(
    BackendEntryFactory factory, BackendServices services) {
  return [factory = std::move(factory), services = std::move(services)](
             const Value& section, const Value& sessionInfo, const Value& userInfo, const std::string& deviceID) {
    return createBackends(section, sessionInfo, userInfo, deviceID, factory, services);
  };
}

}  // namespace telvane
