#include "util/DeviceInfo.h"

#include <cmath>
#include <cstring>

#include "platform/Random.h"

namespace telvane {

namespace {

constexpr std::int64_t kSecondsPerMinute = 60;
constexpr double kMicrosecondsPerSecond = 1e6;
constexpr double kInvalidTimeInterval = -1.0;

std::string lowerAscii(const std::string& text) {
  std::string out = text;
  for (char& c : out) {
    if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
  }
  return out;
}

}  // namespace

DeviceInfo::DeviceInfo(std::shared_ptr<DeviceFacts> facts) : facts_(std::move(facts)) {}

const DeviceInfo& DeviceInfo::shared() {
  static const DeviceInfo* info = new DeviceInfo(DeviceFacts::system());  // lives for the process
  return *info;
}

std::optional<std::string> DeviceInfo::ask(const char* key) const {
  if (!facts_) return std::nullopt;
  return facts_->answer(key);
}

std::optional<std::string> DeviceInfo::uniqueDeviceID() const { return ask(kDeviceFactUniqueDeviceID); }
std::optional<std::string> DeviceInfo::productVersion() const { return ask(kDeviceFactProductVersion); }
std::optional<std::string> DeviceInfo::buildVersion() const { return ask(kDeviceFactBuildVersion); }
std::optional<std::string> DeviceInfo::productType() const { return ask(kDeviceFactProductType); }
std::optional<std::string> DeviceInfo::deviceName() const { return ask(kDeviceFactDeviceName); }
std::optional<std::string> DeviceInfo::hwModelStr() const { return ask(kDeviceFactHWModelStr); }
std::optional<std::string> DeviceInfo::serialNumber() const { return ask(kDeviceFactSerialNumber); }
std::optional<std::string> DeviceInfo::releaseType() const { return ask(kDeviceFactReleaseType); }

bool DeviceInfo::copyUniqueDeviceID(char* buffer, std::size_t size) const {
  auto identifier = uniqueDeviceID();
  if (!identifier || !buffer) return false;
  // The conversion needs room for the text and its terminator.
  if (size == 0 || identifier->size() + 1 > size) return false;
  std::memcpy(buffer, identifier->data(), identifier->size());
  buffer[identifier->size()] = '\0';
  buffer[size - 1] = '\0';
  return true;
}

bool isInternalReleaseType(DeviceFacts& facts) {
  auto type = facts.answer(kDeviceFactReleaseType);
  return type && *type == kInternalReleaseType;
}

bool isInternalBuild() {
  static const bool internal = [] {
    const auto& facts = DeviceInfo::shared().facts();
    return facts && isInternalReleaseType(*facts);
  }();
  return internal;
}

double secondsFromTimeValue(std::int64_t seconds, std::int64_t microseconds) {
  return static_cast<double>(seconds) + static_cast<double>(microseconds) / kMicrosecondsPerSecond;
}

double sanitizedTimeInterval(double seconds) {
  if (std::isinf(seconds) || std::isnan(seconds)) return kInvalidTimeInterval;
  return seconds;
}

std::int64_t coarsenTimestamp(std::int64_t seconds, bool internal) {
  if (internal) return seconds;
  return seconds / kSecondsPerMinute * kSecondsPerMinute;
}

std::int64_t coarsenTimestamp(std::int64_t seconds) { return coarsenTimestamp(seconds, isInternalBuild()); }

std::string connectivityClientKey(const Value& userInfo) {
  const Value& client = userInfo["_clientName"];
  const Value& service = userInfo["_serviceName"];
  std::string key = client.isString() ? lowerAscii(*client.asString()) : std::string();
  key += ':';
  key += service.isString() ? lowerAscii(*service.asString()) : std::string();
  return key;
}

std::string processInstanceIdentifier() {
  static const std::string identifier = Random::system()->uuidString();
  return identifier;
}

}  // namespace telvane
