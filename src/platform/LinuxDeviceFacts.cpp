#include "platform/LinuxDeviceFacts.h"

#include <sys/utsname.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>

#include "platform/Crypto.h"
#include "platform/Log.h"

namespace telvane {

namespace {

constexpr std::string_view kBlanks = " \t\r\n\v\f";

std::string_view trim(std::string_view s) {
  auto first = s.find_first_not_of(kBlanks);
  if (first == std::string_view::npos) return {};
  auto last = s.find_last_not_of(kBlanks);
  return s.substr(first, last - first + 1);
}

// The whole file, or nullopt when it cannot be read. `errorNumber` gets errno.
std::optional<std::string> readFile(const std::string& path, int* errorNumber = nullptr) {
  std::ifstream in(path, std::ios::binary);
  if (!in) {
    if (errorNumber) *errorNumber = errno;
    return std::nullopt;
  }
  std::ostringstream ss;
  ss << in.rdbuf();
  if (in.bad()) {
    if (errorNumber) *errorNumber = EIO;
    return std::nullopt;
  }
  return ss.str();
}

// A one-value file (sysfs attribute, machine id): trimmed, cut at the first NUL (the
// device-tree model is NUL-terminated); nullopt when unreadable or empty.
std::optional<std::string> readValueFile(const std::string& path) {
  auto text = readFile(path);
  if (!text) return std::nullopt;
  std::string_view v = *text;
  if (auto nul = v.find('\0'); nul != std::string_view::npos) v = v.substr(0, nul);
  v = trim(v);
  if (v.empty()) return std::nullopt;
  return std::string(v);
}

std::string_view unquote(std::string_view v) {
  if (v.size() >= 2 && (v.front() == '"' || v.front() == '\'') && v.back() == v.front()) {
    return v.substr(1, v.size() - 2);
  }
  return v;
}

std::map<std::string, std::string, std::less<>> parseKeyValues(std::string_view text, std::string_view source,
                                                               bool logBadLines) {
  std::map<std::string, std::string, std::less<>> out;
  std::size_t lineNumber = 0;
  while (!text.empty()) {
    auto end = text.find('\n');
    std::string_view line = text.substr(0, end);
    text = end == std::string_view::npos ? std::string_view{} : text.substr(end + 1);
    ++lineNumber;
    line = trim(line);
    if (line.empty() || line.front() == '#') continue;
    auto eq = line.find('=');
    std::string_view key = eq == std::string_view::npos ? std::string_view{} : trim(line.substr(0, eq));
    if (key.empty()) {
      if (logBadLines) {
        log::error("LinuxDeviceFacts: Ignoring malformed line %u of %s", static_cast<unsigned>(lineNumber),
                   std::string(source));
      }
      continue;
    }
    out[std::string(key)] = std::string(unquote(trim(line.substr(eq + 1))));
  }
  return out;
}

class FixedDeviceFacts : public DeviceFacts {
 public:
  explicit FixedDeviceFacts(std::map<std::string, std::string> answers) : answers_(std::move(answers)) {}
  std::optional<std::string> answer(std::string_view key) override {
    auto it = answers_.find(std::string(key));
    if (it == answers_.end()) return std::nullopt;
    return it->second;
  }

 private:
  const std::map<std::string, std::string> answers_;
};

}  // namespace

LinuxDeviceFacts::LinuxDeviceFacts(std::string overrideFile, std::string root) : root_(std::move(root)) {
  if (overrideFile.empty()) return;
  int errorNumber = 0;
  auto text = readFile(overrideFile, &errorNumber);
  if (!text) {
    // A missing file is the normal case; anything else is worth a line.
    if (errorNumber != ENOENT) {
      log::error("LinuxDeviceFacts: Cannot read %s: %s", overrideFile, std::strerror(errorNumber));
    }
    return;
  }
  overrides_ = parseOverrides(*text, overrideFile);
}

std::map<std::string, std::string, std::less<>> LinuxDeviceFacts::parseOverrides(std::string_view text,
                                                                                  std::string_view source) {
  return parseKeyValues(text, source, true);
}

std::optional<std::string> LinuxDeviceFacts::chassisWord(int chassisType) {
  switch (chassisType) {
    case 3: case 4: case 6: case 7: case 13: case 15: case 16: case 24: case 35: case 36:
      return "desktop";
    case 8: case 9: case 10: case 14:
      return "laptop";
    case 11:
      return "handset";
    case 17: case 23: case 28: case 29:
      return "server";
    case 30:
      return "tablet";
    case 31: case 32:
      return "convertible";
    case 33: case 34:
      return "embedded";
    default:
      return std::nullopt;  // 1 "Other", 2 "Unknown", docking stations, enclosures...
  }
}

std::optional<std::string> LinuxDeviceFacts::answer(std::string_view key) {
  if (auto it = overrides_.find(key); it != overrides_.end()) {
    if (it->second.empty()) return std::nullopt;
    return it->second;
  }
  std::call_once(systemOnce_, [this] { system_ = readSystemAnswers(); });
  if (auto it = system_.find(key); it != system_.end()) return it->second;
  return std::nullopt;
}

std::string LinuxDeviceFacts::systemPath(std::string_view absolute) const {
  std::string base = root_;
  while (!base.empty() && base.back() == '/') base.pop_back();
  return base + std::string(absolute);
}

std::optional<std::string> LinuxDeviceFacts::kernelRelease() const {
  if (auto release = readValueFile(systemPath("/proc/sys/kernel/osrelease"))) return release;
  if (systemPath("/").size() > 1) return std::nullopt;  // a fake root: no uname
  utsname name{};
  if (uname(&name) != 0 || name.release[0] == '\0') return std::nullopt;
  return std::string(name.release);
}

std::optional<std::string> LinuxDeviceFacts::deviceTreeModel() const {
  if (auto model = readValueFile(systemPath("/proc/device-tree/model"))) return model;
  return readValueFile(systemPath("/sys/firmware/devicetree/base/model"));
}

std::map<std::string, std::string, std::less<>> LinuxDeviceFacts::readSystemAnswers() const {
  std::map<std::string, std::string, std::less<>> out;

  if (auto machineId = readValueFile(systemPath("/etc/machine-id"))) {
    Bytes key(kDeviceIdentityKey.begin(), kDeviceIdentityKey.end());
    out["UniqueDeviceID"] = crypto::hex(crypto::hmacSha1(key, *machineId));
  }

  auto osRelease = readFile(systemPath("/etc/os-release"));
  if (!osRelease) osRelease = readFile(systemPath("/usr/lib/os-release"));
  auto osFields = parseKeyValues(osRelease.value_or(""), "os-release", false);
  auto kernel = kernelRelease();
  auto fieldOrKernel = [&](const char* field) -> std::optional<std::string> {
    if (auto it = osFields.find(field); it != osFields.end() && !it->second.empty()) return it->second;
    return kernel;
  };
  if (auto v = fieldOrKernel("VERSION_ID")) out["ProductVersion"] = *v;
  if (auto v = fieldOrKernel("BUILD_ID")) out["BuildVersion"] = *v;

  auto productName = readValueFile(systemPath("/sys/class/dmi/id/product_name"));
  auto boardName = readValueFile(systemPath("/sys/class/dmi/id/board_name"));
  std::optional<std::string> model;
  if (!productName || !boardName) model = deviceTreeModel();
  if (auto v = productName ? productName : model) out["ProductType"] = *v;
  if (auto v = boardName ? boardName : model) out["HWModelStr"] = *v;

  std::optional<std::string> deviceName;
  if (auto machineInfo = readFile(systemPath("/etc/machine-info"))) {
    auto fields = parseKeyValues(*machineInfo, "machine-info", false);
    if (auto it = fields.find("CHASSIS"); it != fields.end() && !it->second.empty()) deviceName = it->second;
  }
  if (!deviceName) {
    if (auto type = readValueFile(systemPath("/sys/class/dmi/id/chassis_type"))) {
      char* end = nullptr;
      long number = std::strtol(type->c_str(), &end, 10);
      if (end && *end == '\0' && number > 0 && number < 256) deviceName = chassisWord(static_cast<int>(number));
    }
  }
  out["DeviceName"] = deviceName.value_or("Linux");

  if (auto serial = readValueFile(systemPath("/sys/class/dmi/id/product_serial"))) out["SerialNumber"] = *serial;
  return out;
}

std::shared_ptr<DeviceFacts> DeviceFacts::system() {
  static const std::shared_ptr<DeviceFacts> facts = [] {
    const char* file = std::getenv("TELVANED_DEVICE_INFO");
    return makeLinuxDeviceFacts(file && *file ? file : LinuxDeviceFacts::kDefaultOverrideFile, "/");
  }();
  return facts;
}

std::shared_ptr<DeviceFacts> makeLinuxDeviceFacts(std::string overrideFile, std::string root) {
  return std::make_shared<LinuxDeviceFacts>(std::move(overrideFile), std::move(root));
}

std::shared_ptr<DeviceFacts> makeFixedDeviceFacts(std::map<std::string, std::string> answers) {
  return std::make_shared<FixedDeviceFacts>(std::move(answers));
}

}  // namespace telvane
