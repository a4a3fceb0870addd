#include "platform/SystemInfo.h"

#include <sys/resource.h>
#include <unistd.h>

#include <cctype>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fstream>

#include "platform/Log.h"

#ifndef TELVANE_VERSION
#define TELVANE_VERSION ""
#endif

namespace telvane {

namespace {
constexpr const char* kDefaultBundleVersion = "8.0";
constexpr std::uint64_t kBytesPerKilobyte = 1024;
}  // namespace

std::optional<std::string> regionOfLocale(std::string_view locale) {
  // language[_territory][.codeset][@modifier]
  auto cut = locale.find_first_of(".@");
  if (cut != std::string_view::npos) locale = locale.substr(0, cut);
  auto underscore = locale.find('_');
  if (underscore == std::string_view::npos) return std::nullopt;
  std::string_view region = locale.substr(underscore + 1);
  if (region.empty()) return std::nullopt;
  std::string out;
  for (char c : region) {
    if (!std::isalnum(static_cast<unsigned char>(c))) return std::nullopt;
    out += static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
  }
  return out;
}

std::optional<std::string> localeCountryCode(const EnvironmentLookup& lookup) {
  for (const char* name : {"LC_ALL", "LC_MESSAGES", "LANG"}) {
    auto value = lookup(name);
    if (value && !value->empty()) return regionOfLocale(*value);
  }
  return std::nullopt;
}

std::optional<std::string> localeCountryCode() {
  return localeCountryCode([](const char* name) -> std::optional<std::string> {
    const char* v = std::getenv(name);
    if (!v) return std::nullopt;
    return std::string(v);
  });
}

long timeZoneOffsetSeconds(std::time_t at) {
  std::tm local{};
  if (!localtime_r(&at, &local)) return 0;
  return local.tm_gmtoff;
}

long timeZoneOffsetSeconds() { return timeZoneOffsetSeconds(std::time(nullptr)); }

std::uint64_t taskMemoryBytes(const std::string& statusPath) {
  std::ifstream in(statusPath);
  std::string line;
  while (std::getline(in, line)) {
    constexpr std::string_view kField = "RssAnon:";
    if (line.compare(0, kField.size(), kField) != 0) continue;
    const char* p = line.c_str() + kField.size();
    char* end = nullptr;
    errno = 0;
    unsigned long long kilobytes = std::strtoull(p, &end, 10);
    if (end == p || errno != 0) return 0;
    return static_cast<std::uint64_t>(kilobytes) * kBytesPerKilobyte;
  }
  return 0;
}

std::uint64_t taskMemoryBytes() { return taskMemoryBytes("/proc/self/status"); }

void setUtilityQualityOfService() {
  const id_t thread = static_cast<id_t>(gettid());
  errno = 0;
  int current = getpriority(PRIO_PROCESS, thread);
  if (current == -1 && errno != 0) {
    log::error("setUtilityQualityOfService: getpriority failed: %s", std::strerror(errno));
    return;
  }
  if (current >= kUtilityNiceValue) return;
  if (setpriority(PRIO_PROCESS, thread, kUtilityNiceValue) != 0) {
    log::error("setUtilityQualityOfService: setpriority failed: %s", std::strerror(errno));
  }
}

std::string bundleVersionOr(std::string_view configured) {
  return configured.empty() ? std::string(kDefaultBundleVersion) : std::string(configured);
}

std::string frameworkBundleVersion() { return bundleVersionOr(TELVANE_VERSION); }

}  // namespace telvane
