// LinuxDeviceFacts: the device-information service of a Linux machine.
//
// Each key is answered from the usual places of a Linux system:
//   "UniqueDeviceID"  40 lower-case hex digits of HMAC-SHA1 of /etc/machine-id
//                     (trimmed) under a fixed application key, so that the machine
//                     id itself never leaves the device;
//   "ProductVersion"  VERSION_ID of /etc/os-release (else /usr/lib/os-release), else
//                     the kernel release (rolling distributions have no VERSION_ID);
//   "BuildVersion"    BUILD_ID of os-release, else the kernel release;
//   "ProductType"     /sys/class/dmi/id/product_name, else the device-tree model;
//   "HWModelStr"      /sys/class/dmi/id/board_name, else the device-tree model;
//   "DeviceName"      CHASSIS of /etc/machine-info, else the DMI chassis type as a
//                     word (desktop, laptop, server, tablet, ...), else "Linux";
//   "SerialNumber"    /sys/class/dmi/id/product_serial, when readable;
//   "ReleaseType"     no system source.
// The kernel release is read from /proc/sys/kernel/osrelease (uname(2) when that
// fails on the real root).
//
// The override file (KEY=value lines) wins over all of these and may name any key.
// Its format: one KEY=value per line; blank lines and lines whose first non-blank
// character is '#' are ignored; blanks around key and value are trimmed; a value
// wrapped in matching single or double quotes loses them; "KEY=" with an empty value
// makes the key answer nothing (so a device maker can hide, say, the serial number).
// Lines without '=' or with an empty key are logged and skipped. The file is read
// once, at creation; the system sources are read once, on the first question.
//
// `root` prefixes every system path, so tests can build a fake /etc, /sys and /proc.
//
// Threading: thread-safe; answers are immutable once read.
#pragma once

#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "platform/DeviceFacts.h"

namespace telvane {

class LinuxDeviceFacts : public DeviceFacts {
 public:
  // The application key under which the machine id is hashed.
  static constexpr std::string_view kDeviceIdentityKey = "telvane.device-identity.v1";
  static constexpr const char* kDefaultOverrideFile = "/etc/telvaned/device-info.conf";

  LinuxDeviceFacts(std::string overrideFile, std::string root);

  std::optional<std::string> answer(std::string_view key) override;

  // Parses override-file text: key → value; an empty value is kept as empty (it means
  // "no answer"). `source` names the file in log lines.
  static std::map<std::string, std::string, std::less<>> parseOverrides(std::string_view text,
                                                                        std::string_view source);
  // The word for an SMBIOS chassis type number; nullopt for unknown types.
  static std::optional<std::string> chassisWord(int chassisType);

 private:
  std::string systemPath(std::string_view absolute) const;
  std::map<std::string, std::string, std::less<>> readSystemAnswers() const;
  std::optional<std::string> kernelRelease() const;
  std::optional<std::string> deviceTreeModel() const;

  // Constant after construction.
  const std::string root_;
  std::map<std::string, std::string, std::less<>> overrides_;

  std::once_flag systemOnce_;
  std::map<std::string, std::string, std::less<>> system_;  // written once under systemOnce_
};

}  // namespace telvane
