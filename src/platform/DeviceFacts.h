// DeviceFacts: answers of the device-information service, by key ("UniqueDeviceID",
// "ProductVersion", "BuildVersion", "ProductType", "HWModelStr", "DeviceName",
// "SerialNumber", "ReleaseType"). Each answer is a string or nothing.
// Implementations are thread-safe.
#pragma once

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace telvane {

class DeviceFacts {
 public:
  virtual ~DeviceFacts() = default;
  virtual std::optional<std::string> answer(std::string_view key) = 0;

  // The Linux sources, with the override file $TELVANED_DEVICE_INFO (default
  // /etc/telvaned/device-info.conf) winning over them.
  static std::shared_ptr<DeviceFacts> system();
};

// The Linux implementation with explicit locations, so that tests can point it at
// files of their own. `root` prefixes every system path ("/" on a real device).
std::shared_ptr<DeviceFacts> makeLinuxDeviceFacts(std::string overrideFile, std::string root = "/");

// A fixed table (tests, and tools that want no system look-ups).
std::shared_ptr<DeviceFacts> makeFixedDeviceFacts(std::map<std::string, std::string> answers);

}  // namespace telvane
