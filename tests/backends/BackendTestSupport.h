// Shared set-up of the backend tests: a platform whose every service the test sets
// (settings in memory, scripted randomness, a manual clock, fixed device facts,
// consent, country, time zone and environment), profiles and rules built from
// dictionaries, and a helper that reads back what a backend posted.
#pragma once

#include <gtest/gtest.h>

#include <atomic>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "backends/BackendPlatform.h"
#include "backends/https/HTTPSPostBackend.h"
#include "platform/Json.h"
#include "platform/Log.h"
#include "support/FakeConnectivityHelper.h"
#include "support/Gunzip.h"
#include "support/ManualClock.h"
#include "support/ScriptedRandom.h"

namespace telvane::test {

inline std::optional<std::string> headerOf(const HttpRequest& request, const std::string& name) {
  for (const auto& [key, value] : request.headers) {
    if (key == name) return value;
  }
  return std::nullopt;
}

// The JSON text a request carries (inflated when it is compressed).
inline std::string jsonBodyOf(const HttpRequest& request) {
  if (headerOf(request, "Content-Encoding") == std::optional<std::string>("gzip")) {
    return gunzip(request.body).value_or(std::string());
  }
  return request.body;
}

inline Value documentOf(const HttpRequest& request) {
  Result<Value> parsed = json::parse(jsonBodyOf(request));
  EXPECT_TRUE(parsed.ok()) << parsed.error();
  return parsed.ok() ? parsed.value() : Value();
}

inline Value strings(std::initializer_list<const char*> items) {
  Array list;
  for (const char* item : items) list.emplace_back(item);
  return Value(std::move(list));
}

inline Value numbers(std::initializer_list<long long> items) {
  Array list;
  for (long long item : items) list.emplace_back(item);
  return Value(std::move(list));
}

// A rule that enables a consenting US device for every client: an empty filter list,
// the US locale, a sampling threshold above every draw, and post URLs.
inline Dictionary enablingRule() {
  return Dictionary{{"locale_whitelist", strings({"US"})},
                    {"filters", Value::array()},
                    {"sampling_threshold", Value(1.0)},
                    {"post_url", Value("https://collector.test/batch")},
                    {"realtime_post_url", Value("https://collector.test/realtime")}};
}

inline Value profileWithRules(std::vector<Dictionary> rules) {
  Array clients;
  for (auto& rule : rules) clients.emplace_back(std::move(rule));
  return Value(Dictionary{{"clients", Value(std::move(clients))}, {"display_url", Value("collector.test")}});
}

inline Value userInfo(const char* clientName, const char* serviceName) {
  Dictionary info;
  if (clientName) info.set("_clientName", Value(clientName));
  if (serviceName) info.set("_serviceName", Value(serviceName));
  return Value(std::move(info));
}

class BackendTestBase : public ::testing::Test {
 protected:
  BackendPlatform platform() {
    BackendPlatform platform;
    platform.settings = settings;
    platform.random = random;
    platform.clock = clock;
    platform.deviceInfo = std::make_shared<DeviceInfo>(makeFixedDeviceFacts(deviceFacts));
    platform.internalRelease = internalRelease;
    platform.diagnosticsConsent = [this] { return consent.load(); };
    platform.localeCountryCode = [this]() -> std::optional<std::string> {
      std::lock_guard<std::mutex> lock(mutex);
      return countryCode;
    };
    platform.timeZoneOffsetSeconds = [] { return 7200L; };
    platform.environmentType = [this] { return environment.load(); };
    return platform;
  }

  // An HTTPS post backend with the session identity a session would give it. The
  // sampling draw is `draw` / 10000.
  std::shared_ptr<HTTPSPostBackend> makeBackend(const Value& profile, const std::string& name = "splunk",
                                                std::uint32_t draw = 5000) {
    random->pushUniform(draw);
    auto backend = HTTPSPostBackend::create(name, profile, std::string("Laptop"), platform());
    if (!backend) return backend;
    backend->setSessionID(4242);
    backend->setCompType(7);
    backend->setClientVersion(12);
    backend->setUdid("udid-0001");
    backend->setProductVersion(std::string("12.4"));
    backend->setBuildVersion(std::string("B77"));
    backend->setHardwareType(std::string("Board9"));
    backend->setRequireUserInfo(true);
    backend->setSelfVersion("8.1.2");
    backend->setStartTimestamp(TimeValue{1'700'000'000, 0});
    backend->setReportingSessionConnectivityDelegate(helper);
    return backend;
  }

  // A backend that is enabled (state 2) for client "app" of service "svc".
  std::shared_ptr<HTTPSPostBackend> makeEnabledBackend(Dictionary rule = enablingRule(),
                                                       const std::string& name = "splunk") {
    auto backend = makeBackend(profileWithRules({std::move(rule)}), name);
    if (!backend) return backend;
    backend->setUserInfoDict(userInfo("app", "svc"));
    EXPECT_EQ(backend->updateState(), kBackendStateEnabled);
    return backend;
  }

  // The event blob a session hands over.
  static Value blob(Dictionary payload) { return Value(Dictionary{{"ClientData", Value(std::move(payload))}}); }

  static TimeValue at(std::int64_t seconds, std::int64_t microseconds = 0) { return TimeValue{seconds, microseconds}; }

  std::shared_ptr<SettingsStore> settings = makeMemorySettingsStore();
  std::shared_ptr<ScriptedRandom> random = std::make_shared<ScriptedRandom>();
  std::shared_ptr<ManualClock> clock = std::make_shared<ManualClock>(1'700'000'100.25);
  std::map<std::string, std::string> deviceFacts{{"ProductType", "Board9"}};
  bool internalRelease = false;
  std::atomic<bool> consent{true};
  std::atomic<std::uint32_t> environment{4};
  std::mutex mutex;
  std::optional<std::string> countryCode = "US";  // guarded by mutex
  std::shared_ptr<FakeConnectivityHelper> helper = std::make_shared<FakeConnectivityHelper>();
  log::LogCapture capture;
};

}  // namespace telvane::test
