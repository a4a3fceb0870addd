// DeviceInfo: who and what is reporting, and the small conversions the backends share.
//
// A DeviceInfo asks a DeviceFacts service one key per getter; nothing is cached here
// (the Linux facts cache their own files). `DeviceInfo::shared()` is the process's
// instance over the system's facts. The internal-build flag and the process-instance
// identifier are computed once per process.
//
// Threading: everything here is thread-safe; the one-time values use thread-safe
// static initialisation.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "platform/DeviceFacts.h"
#include "telvane/Value.h"

namespace telvane {

inline constexpr const char* kDeviceFactUniqueDeviceID = "UniqueDeviceID";
inline constexpr const char* kDeviceFactProductVersion = "ProductVersion";
inline constexpr const char* kDeviceFactBuildVersion = "BuildVersion";
inline constexpr const char* kDeviceFactProductType = "ProductType";
inline constexpr const char* kDeviceFactDeviceName = "DeviceName";
inline constexpr const char* kDeviceFactHWModelStr = "HWModelStr";
inline constexpr const char* kDeviceFactSerialNumber = "SerialNumber";
inline constexpr const char* kDeviceFactReleaseType = "ReleaseType";
inline constexpr const char* kInternalReleaseType = "Internal";

class DeviceInfo {
 public:
  explicit DeviceInfo(std::shared_ptr<DeviceFacts> facts);

  // The process's instance over DeviceFacts::system().
  static const DeviceInfo& shared();

  std::optional<std::string> uniqueDeviceID() const;
  std::optional<std::string> productVersion() const;
  std::optional<std::string> buildVersion() const;
  std::optional<std::string> productType() const;
  std::optional<std::string> deviceName() const;
  std::optional<std::string> hwModelStr() const;
  std::optional<std::string> serialNumber() const;
  std::optional<std::string> releaseType() const;

  // Copies "UniqueDeviceID" as a NUL-terminated UTF-8 string into the buffer of
  // `size` bytes. With no answer the buffer is left untouched. When the text and its
  // terminator do not fit, the conversion fails and the buffer is left untouched too.
  // On success the byte at size - 1 is also set to zero (bytes between the
  // terminator and that last byte keep what they had). Returns whether it copied.
  bool copyUniqueDeviceID(char* buffer, std::size_t size) const;

  const std::shared_ptr<DeviceFacts>& facts() const { return facts_; }

 private:
  std::optional<std::string> ask(const char* key) const;

  const std::shared_ptr<DeviceFacts> facts_;  // constant after construction
};

// True when the facts answer "ReleaseType" with exactly "Internal"; false with no
// answer.
bool isInternalReleaseType(DeviceFacts& facts);

// The process-wide internal-build flag over the shared DeviceInfo, computed once.
bool isInternalBuild();

// A time value of whole seconds plus microseconds as floating seconds.
double secondsFromTimeValue(std::int64_t seconds, std::int64_t microseconds);
// A floating time that is infinite or not a number becomes -1.0; any other value
// passes unchanged.
double sanitizedTimeInterval(double seconds);

// Event-record timestamps: whole seconds pass unchanged on internal builds; on all
// others they fall to the whole minute (division by 60 truncates toward zero, so
// negative times move up toward zero).
std::int64_t coarsenTimestamp(std::int64_t seconds, bool internal);
// The same with the process's isInternalBuild().
std::int64_t coarsenTimestamp(std::int64_t seconds);

// The connectivity client key of a user-information dictionary: "%s:%s" of the
// lower-cased "_clientName" and "_serviceName", a missing (or non-text) one counting
// as the empty string. Lower-casing is ASCII-only; client and service names are
// identifiers.
std::string connectivityClientKey(const Value& userInfo);

// One random UUID text, made on first use and kept for the life of the process.
std::string processInstanceIdentifier();

}  // namespace telvane
