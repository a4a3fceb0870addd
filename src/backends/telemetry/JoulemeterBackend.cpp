#include "backends/telemetry/JoulemeterBackend.h"

#include <utility>

namespace telvane {

std::shared_ptr<JoulemeterBackend> JoulemeterBackend::create(const std::string& name, const Value& profile,
                                                             const std::optional<std::string>& productFamily,
                                                             const BackendPlatform& platform) {
  return std::shared_ptr<JoulemeterBackend>(
      new JoulemeterBackend(name, profile.copy(), productFamily, platform.withSystemDefaults()));
}

JoulemeterBackend::JoulemeterBackend(std::string name, Value profile, std::optional<std::string> productFamily,
                                     BackendPlatform platform)
    : TelvaneBackendBase(std::move(name), std::move(profile), std::move(productFamily), std::move(platform)) {}

void JoulemeterBackend::sendMessage(const Value& dictionary, TimeValue /*timestamp*/, std::uint16_t method,
                                    std::uint16_t respCode, std::uint16_t eventID) {
  const Dictionary* entries = dictionary.asDictionary();
  if (method == 0 || !entries || entries->empty()) return;
  // A new dictionary: the caller's map is not changed.
  Dictionary record = *entries;
  record.set(kMethodKey, Value(static_cast<unsigned>(method)));
  record.set(kRespCodeKey, Value(static_cast<unsigned>(respCode)));
  record.set(kEventKey, Value(static_cast<unsigned>(eventID)));
  platform_.powerLog->recordRegisteredEvent(kPowerLogEventCategory, kPowerLogEventName, Value(std::move(record)));
}

}  // namespace telvane
