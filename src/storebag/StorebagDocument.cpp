#include "storebag/StorebagDocument.h"

#include <algorithm>
#include <atomic>
#include <climits>
#include <utility>

#include "platform/Log.h"
#include "platform/PropertyList.h"
#include "util/DeviceInfo.h"

namespace telvane {

namespace {

std::atomic<std::uint32_t> gLastEnvironment{kStorebagEnvironmentNone};

struct ClientTypeName {
  std::int32_t clientType;
  const char* name;
};

constexpr ClientTypeName kClientTypeNames[] = {
    {5, "quillon"},    {6, "vantor"},    {7, "confera"},   {8, "brisklet"},  {9, "hollowind"},
    {10, "marrowby"},  {11, "confera"},  {12, "pendrake"}, {13, "confera"},  {14, "vantor"},
    {15, "vantor"},    {16, "tessary"},  {17, "glimmerd"}, {18, "corvale"},  {19, "sonvique"},
    {20, "confera"},   {21, "dunmere"},  {22, "prescia"},  {23, "cloudbrim"}, {24, "feathon"},
    {25, "mettling"},  {26, "vaultry"},  {27, "rill"},     {28, "speckle"},  {29, "auguring"},
    {30, "twine"},
};

constexpr const char* kFallbackVersion = "1.0.0-Confera-Fallback";
constexpr std::int64_t kFallbackRefreshCycleSeconds = 3600;

}  // namespace

std::optional<std::string> environmentSectionName(std::uint32_t environment) {
  switch (environment) {
    case kStorebagEnvironmentDevelopment:
      return kStorebagSectionDevelopment;
    case kStorebagEnvironmentInternal:
      return kStorebagSectionInternal;
    case kStorebagEnvironmentSeed:
      return kStorebagSectionSeed;
    case kStorebagEnvironmentRelease:
      return kStorebagSectionRelease;
    default:
      return std::nullopt;
  }
}

std::optional<std::string> storebagNameForClientType(std::int32_t clientType) {
  for (const ClientTypeName& entry : kClientTypeNames) {
    if (entry.clientType == clientType) return entry.name;
  }
  return std::nullopt;
}

std::uint32_t userDefaultsEnvironment(SettingsStore& settings, bool internalBuild) {
  std::uint32_t environment;
  if (std::optional<Value> stored = settings.read(kTelvaneSettingsDomain, kEnvironmentTypeSettingsKey)) {
    environment = stored->unsignedIntValue();
    if (environment >= kStorebagEnvironmentLimit) {
      log::error("userDefaultsEnvironment: Invalid environment type %u", environment);
      environment = kStorebagEnvironmentInternal;
    }
  } else {
    environment = internalBuild ? kStorebagEnvironmentInternal : kStorebagEnvironmentSeed;
  }
  gLastEnvironment.store(environment);
  log::info("userDefaultsEnvironment: Environment type %u", environment);
  return environment;
}

std::uint32_t userDefaultsEnvironment() { return userDefaultsEnvironment(*defaultSettingsStore(), isInternalBuild()); }

std::uint32_t lastUserDefaultsEnvironment() { return gLastEnvironment.load(); }

Value defaultStorebagDocument() {
  auto activeMetrix = [] { return Value(Dictionary{{"metrix", Value(Dictionary{{"active", Value(true)}})}}); };
  return Value(Dictionary{
      {kStorebagSectionInternal, activeMetrix()},
      {kStorebagSectionDevelopment, activeMetrix()},
      {kStorebagSectionRelease, activeMetrix()},
      {kStorebagKeyVersion, Value(kFallbackVersion)},
      {kStorebagKeyRefreshCycle, Value(kFallbackRefreshCycleSeconds)},
  });
}

Bytes defaultStorebagData() {
  // The document is fixed and free of nulls, so encoding cannot fail.
  Result<Bytes> encoded = plist::encodeBinary(defaultStorebagDocument());
  return encoded ? std::move(encoded).value() : Bytes{};
}

StorebagSelectionResult fetchStorebagForEnvironmentAndClientType(std::int32_t clientType,
                                                                 const StorebagFetcher& fetcher,
                                                                 const std::function<std::uint32_t()>& environment) {
  StorebagSelectionResult result;
  std::optional<std::string> name = storebagNameForClientType(clientType);
  if (!name) {
    log::error("fetchStorebagForEnvironmentAndClientType: Could not find storebag name for client type %d", clientType);
    return result;
  }

  std::int32_t maxAge = 0;
  bool notModified = false;
  std::optional<Value> document = fetcher(*name, maxAge, notModified);
  result.maxAgeSeconds = maxAge;
  result.notModified = notModified;
  if (!document) {
    if (!notModified) {
      log::error("fetchStorebagForEnvironmentAndClientType: Could not fetch storebag for client type %d", clientType);
    }
    return result;
  }

  // A missing, misspelt or non-dictionary section yields an empty section (a session
  // without backends), never the release section: the copy of an absent dictionary
  // is an empty one, so there is always a section to hand out.
  std::optional<std::string> sectionName = environmentSectionName(environment());
  Value section = Value::dictionary();
  if (sectionName) {
    const Value& found = (*document)[*sectionName];
    if (found.isDictionary()) section = found.copy();
  }

  if (const Dictionary* top = document->asDictionary()) {
    if (const Value* releaseTimeout = top->find(kStorebagKeyReleaseTimeout)) {
      section.asDictionary()->set(kStorebagKeyReleaseTimeout, *releaseTimeout);
    }
  }

  StorebagSelection selection;
  selection.version = (*document)[kStorebagKeyVersion].stringOrEmpty();
  selection.maxAgeSeconds = maxAge;
  const Value& refreshCycle = (*document)[kStorebagKeyRefreshCycle];
  if (document->isDictionary() && document->asDictionary()->contains(kStorebagKeyRefreshCycle)) {
    std::int64_t cycle = refreshCycle.integerValue();
    // The cap is the only limit; zero and negative cycles are taken as they are.
    cycle = std::clamp<std::int64_t>(cycle, INT32_MIN, kStorebagMaxRefreshCycleSeconds);
    selection.maxAgeSeconds = static_cast<std::int32_t>(cycle);
    log::info("fetchStorebagForEnvironmentAndClientType: Store bag override MaxAge=%d", selection.maxAgeSeconds);
  }
  selection.section = std::move(section);
  result.maxAgeSeconds = selection.maxAgeSeconds;
  result.selection = std::move(selection);
  return result;
}

}  // namespace telvane
