#include "session/SessionEnvironment.h"

#include "platform/SystemInfo.h"
#include "util/MessageLogFile.h"

namespace telvane {

SessionEnvironment SessionEnvironment::withSystemDefaults() const {
  SessionEnvironment resolved = *this;
  if (!resolved.settings) resolved.settings = defaultSettingsStore();
  if (!resolved.deviceInfo) resolved.deviceInfo = std::make_shared<const DeviceInfo>(DeviceFacts::system());
  if (!resolved.random) resolved.random = Random::system();
  if (!resolved.clock) resolved.clock = Clock::system();
  if (!resolved.internalBuild) resolved.internalBuild = isInternalBuild();
  if (!resolved.frameworkBundleVersion) {
    resolved.frameworkBundleVersion = []() -> std::optional<std::string> { return telvane::frameworkBundleVersion(); };
  }
  if (!resolved.localeCountryCode) {
    resolved.localeCountryCode = []() -> std::optional<std::string> { return telvane::localeCountryCode(); };
  }
  if (!resolved.taskMemoryBytes) resolved.taskMemoryBytes = [] { return telvane::taskMemoryBytes(); };
  if (!resolved.messageLog) {
    resolved.messageLog = [](const std::string& line) { MessageLogFile::shared().writeToLogFile(line); };
  }
  if (!resolved.backendFactory) {
    resolved.backendFactory = [](const Value&, const Value&, const Value&, const std::string&) { return BackendMap{}; };
  }
  return resolved;
}

}  // namespace telvane
