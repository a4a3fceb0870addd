// SystemInfo: small questions about the process and its environment: the locale's
// country code, the local time-zone offset, the task's memory, the thread's
// scheduling class and the framework's version.
//
// Every function is thread-safe. The overloads that take an environment look-up or a
// path exist so that tests need not change the real environment.
#pragma once

#include <cstdint>
#include <ctime>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

namespace telvane {

// Looks up an environment variable: nullopt when it is unset.
using EnvironmentLookup = std::function<std::optional<std::string>(const char* name)>;

// The region of the message locale: the first of LC_ALL, LC_MESSAGES and LANG that is
// set and not empty decides ("en_US.UTF-8" → "US", "de_DE@euro" → "DE"). Nothing for
// "C", "POSIX" or a locale without a region.
std::optional<std::string> localeCountryCode();
std::optional<std::string> localeCountryCode(const EnvironmentLookup& lookup);
// The region part of one locale name, upper-cased; nothing when there is none.
std::optional<std::string> regionOfLocale(std::string_view locale);

// Seconds east of UTC of the local time now (tm_gmtoff), or at the given time.
long timeZoneOffsetSeconds();
long timeZoneOffsetSeconds(std::time_t at);

// The anonymous resident memory of this process (RssAnon of /proc/self/status) in
// bytes; 0 when it cannot be read.
std::uint64_t taskMemoryBytes();
std::uint64_t taskMemoryBytes(const std::string& statusPath);

// Moves the calling thread into the utility class: its nice value is raised to 5.
// A thread that already runs at 5 or lower priority is left alone (never lowered).
void setUtilityQualityOfService();
constexpr int kUtilityNiceValue = 5;

// The project's version (from the build), or "8.0" when the build sets none.
std::string frameworkBundleVersion();
// The rule above over a configured version text.
std::string bundleVersionOr(std::string_view configured);

}  // namespace telvane
