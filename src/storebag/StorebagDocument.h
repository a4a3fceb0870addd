// The storebag document as the daemon reads it once its signature has been checked:
// the environment numbers and their section keys, the table from client types to
// storebag names, the environment chosen by the settings store, the fallback
// document, and `fetchStorebagForEnvironmentAndClientType`, which turns a verified
// document into the one environment section a session gets.
//
// The document itself comes from a StorebagFetcher (the signed-envelope retrieval
// with its disk cache and network refresh); tests hand in their own.
//
// Threading: every function here is safe from any thread. The settings store and the
// fetcher synchronise themselves; the last chosen environment is an atomic.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>

#include "platform/SettingsStore.h"
#include "telvane/Value.h"

namespace telvane {

// The settings domain of the daemon and the keys read here.
inline constexpr const char* kTelvaneSettingsDomain = "com.zembra.telvane";
inline constexpr const char* kEnvironmentTypeSettingsKey = "environmentType";

// Environment numbers.
inline constexpr std::uint32_t kStorebagEnvironmentNone = 0;
inline constexpr std::uint32_t kStorebagEnvironmentDevelopment = 1;
inline constexpr std::uint32_t kStorebagEnvironmentInternal = 2;
inline constexpr std::uint32_t kStorebagEnvironmentSeed = 3;
inline constexpr std::uint32_t kStorebagEnvironmentRelease = 4;
// The first number that is not an environment.
inline constexpr std::uint32_t kStorebagEnvironmentLimit = 5;

// Top-level keys of a document.
inline constexpr const char* kStorebagKeyVersion = "version";
inline constexpr const char* kStorebagKeyRefreshCycle = "refresh_cycle";
inline constexpr const char* kStorebagKeyReleaseTimeout = "release_timeout";
inline constexpr const char* kStorebagKeySharedValues = "shared_values";
inline constexpr const char* kStorebagSectionInternal = "zembra_internal";
inline constexpr const char* kStorebagSectionDevelopment = "development";
inline constexpr const char* kStorebagSectionSeed = "seed";
inline constexpr const char* kStorebagSectionRelease = "release";

// "refresh_cycle" never makes a storebag fresh for longer than this.
inline constexpr std::int32_t kStorebagMaxRefreshCycleSeconds = 86400;

// The one storebag that has a fallback document.
inline constexpr const char* kFallbackStorebagName = "confera";

// The section key of an environment number, or nothing.
std::optional<std::string> environmentSectionName(std::uint32_t environment);

// The storebag name of a client type ("ComponentType"), or nothing when the client
// type has no storebag.
std::optional<std::string> storebagNameForClientType(std::int32_t clientType);

// The environment from "environmentType" of the daemon's settings domain, read afresh
// on every call: a value of 5 or more (as unsigned) is logged and becomes 2; without
// the key, 2 on internal builds and 3 otherwise. Logs the result.
std::uint32_t userDefaultsEnvironment(SettingsStore& settings, bool internalBuild);
// The same over the process's settings store and isInternalBuild().
std::uint32_t userDefaultsEnvironment();
// The result of the last userDefaultsEnvironment call in this process (0 before any).
std::uint32_t lastUserDefaultsEnvironment();

// The fallback document as a binary property list. It carries no signature, so the
// verification of signed envelopes refuses it.
Bytes defaultStorebagData();
// The same document as a value.
Value defaultStorebagDocument();

// Obtains the verified, macro-expanded document of a storebag name, filling the max
// age (seconds) and the not-modified flag; nothing when no document can be had.
using StorebagFetcher =
    std::function<std::optional<Value>(const std::string& name, std::int32_t& maxAge, bool& notModified)>;

struct StorebagSelection {
  // The environment section: a fresh dictionary the caller owns.
  Value section;
  std::int32_t maxAgeSeconds = 0;
  std::string version;
};

struct StorebagSelectionResult {
  std::optional<StorebagSelection> selection;
  // The document came back unchanged from the server (nothing to report).
  bool notModified = false;
  // The max age the fetcher reported, also when no section was selected.
  std::int32_t maxAgeSeconds = 0;
};

// Selects the section of the current environment for a client type. The environment
// comes from `environment` (called as often as the selection needs it).
StorebagSelectionResult fetchStorebagForEnvironmentAndClientType(std::int32_t clientType,
                                                                 const StorebagFetcher& fetcher,
                                                                 const std::function<std::uint32_t()>& environment);

}  // namespace telvane
