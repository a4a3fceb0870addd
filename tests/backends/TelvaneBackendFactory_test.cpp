#include "backends/TelvaneBackendFactory.h"
#include "backends/upload/UploadBackend.h"
#include "backends/dashboard/DashboardBackend.h"

#include <gtest/gtest.h>

#include "backends/BackendTestSupport.h"
#include "backends/telemetry/JoulemeterBackend.h"
#include "backends/telemetry/MetrixBackend.h"
#include "storebag/StorebagBackends.h"
#include "support/FakePowerLog.h"

namespace telvane {
namespace {

class TelvaneBackendFactoryTest : public test::BackendTestBase {
 protected:
  Value httpsProfile() { return test::profileWithRules({test::enablingRule()}); }
};

TEST_F(TelvaneBackendFactoryTest, NamesPickTheirClassInTableOrder) {
  std::optional<std::string> model = "Board9";
  EXPECT_EQ(backendKindForName("dashboard", model), BackendKind::Dashboard);
  EXPECT_EQ(backendKindForName("upload_server", model), BackendKind::Upload);
  EXPECT_EQ(backendKindForName("splunk", model), BackendKind::HTTPSPost);
  EXPECT_EQ(backendKindForName("my-splunk-prod", model), BackendKind::HTTPSPost);
  EXPECT_EQ(backendKindForName("brindle", model), BackendKind::HTTPSPost);
  EXPECT_EQ(backendKindForName("power", model), BackendKind::Joulemeter);
  EXPECT_EQ(backendKindForName("quarl", model), BackendKind::HTTPSPost);
  EXPECT_EQ(backendKindForName("metrix", model), BackendKind::Metrix);
  EXPECT_EQ(backendKindForName("metrix", std::nullopt), BackendKind::Metrix);
}

TEST_F(TelvaneBackendFactoryTest, OtherNamesMustMatchWholeAndInTheirCase) {
  std::optional<std::string> model = "Board9";
  for (const char* name : {"Dashboard", "dashboard2", "Brindle", "quarl ", "SPLUNK", "release_timeout", "", "powers"}) {
    EXPECT_EQ(backendKindForName(name, model), std::nullopt) << name;
  }
  EXPECT_EQ(backendKindForName("metrix", std::string("Maravel")), std::nullopt);
  EXPECT_EQ(backendKindForName("metrix", std::string("maravel")), BackendKind::Metrix);
}

TEST_F(TelvaneBackendFactoryTest, ANameContainingSplunkMakesAnHTTPSPostBackend) {
  auto backend = newBackendWithName("my-splunk-prod", httpsProfile(), std::string("Laptop"), 7, platform());
  ASSERT_NE(backend, nullptr);
  EXPECT_EQ(backend->kind(), BackendKind::HTTPSPost);
  EXPECT_NE(dynamic_cast<HTTPSPostBackend*>(backend.get()), nullptr);
  EXPECT_EQ(backend->name(), "my-splunk-prod");
  EXPECT_EQ(backend->displayURL(), std::optional<std::string>("collector.test"));
  EXPECT_FALSE(capture.containsPrefix("TelvaneBackend(newBackendWithName)"));
}

TEST_F(TelvaneBackendFactoryTest, DashboardWithACapitalLetterCreatesNothing) {
  EXPECT_EQ(newBackendWithName("Dashboard", httpsProfile(), std::string("Laptop"), 7, platform()), nullptr);
  EXPECT_TRUE(capture.contains(log::Level::Error, "TelvaneBackend(newBackendWithName): Dashboard"));
}

TEST_F(TelvaneBackendFactoryTest, MetrixOnAMaravelDeviceCreatesNothingAndLogs) {
  deviceFacts["ProductType"] = "Maravel";
  EXPECT_EQ(newBackendWithName("metrix", Value(Dictionary{{"active", Value(true)}}), std::string("Laptop"), 7,
                               platform()),
            nullptr);
  EXPECT_TRUE(capture.contains(log::Level::Error, "TelvaneBackend(newBackendWithName): metrix"));
}

TEST_F(TelvaneBackendFactoryTest, DashboardMakesADashboardBackendFromAGoodProfileAndNothingFromABadOne) {
  auto backend = newBackendWithName(
      "dashboard",
      Value(Dictionary{{"ip", Value("127.0.0.1")}, {"port", Value(9)}, {"display_url", Value("dashboard.example")}}),
      std::string("Laptop"), 7, platform());
  ASSERT_NE(backend, nullptr);
  EXPECT_EQ(backend->kind(), BackendKind::Dashboard);
  EXPECT_NE(dynamic_cast<DashboardBackend*>(backend.get()), nullptr);
  EXPECT_EQ(backend->name(), "dashboard");
  EXPECT_EQ(backend->displayURL(), std::optional<std::string>("dashboard.example"));
  backend->cleanup();
  // Without an address its initialiser refuses, and the factory adds no line of its own.
  capture.clear();
  EXPECT_EQ(newBackendWithName("dashboard", Value::dictionary(), std::string("Laptop"), 7, platform()), nullptr);
  EXPECT_TRUE(capture.contains(log::Level::Error, "DashboardBackend(initWithName): can't resolve server IP"));
  EXPECT_FALSE(capture.containsPrefix("TelvaneBackend(newBackendWithName)"));
}

TEST_F(TelvaneBackendFactoryTest, UploadServerMakesAnUploadBackendWhenItsProfileHasAPostURL) {
  auto backend = newBackendWithName("upload_server", Value(Dictionary{{"post_url", Value("https://uploads.test/u")}}),
                                    std::string("Laptop"), 7, platform());
  ASSERT_NE(backend, nullptr);
  EXPECT_EQ(backend->kind(), BackendKind::Upload);
  EXPECT_NE(dynamic_cast<UploadBackend*>(backend.get()), nullptr);
  // Without one its initialiser refuses, and the factory adds no line of its own.
  capture.clear();
  EXPECT_EQ(newBackendWithName("upload_server", Value::dictionary(), std::string("Laptop"), 7, platform()), nullptr);
  EXPECT_TRUE(capture.contains(log::Level::Error, "UploadBackend(initWithName): can't resolve upload post URL."));
  EXPECT_FALSE(capture.containsPrefix("TelvaneBackend(newBackendWithName)"));
}

TEST_F(TelvaneBackendFactoryTest, PowerMakesAPowerLogBackendWithAnyProfile) {
  BackendPlatform withPowerLog = platform();
  withPowerLog.powerLog = std::make_shared<test::FakePowerLog>();
  for (const Value& profile : {Value::dictionary(), Value()}) {
    auto backend = newBackendWithName("power", profile, std::string("Laptop"), 7, withPowerLog);
    ASSERT_NE(backend, nullptr);
    EXPECT_EQ(backend->kind(), BackendKind::Joulemeter);
    EXPECT_NE(dynamic_cast<JoulemeterBackend*>(backend.get()), nullptr);
    EXPECT_EQ(backend->name(), "power");
  }
  EXPECT_FALSE(capture.containsPrefix("TelvaneBackend(newBackendWithName)"));
}

TEST_F(TelvaneBackendFactoryTest, MetrixIsMadeWithTheSessionsClientType) {
  BackendPlatform withAdaptor = platform();
  withAdaptor.metrixAdaptorPath = "/nonexistent/telvane-test/metrix-adaptor.so";
  auto backend = newBackendWithName("metrix", Value::dictionary(), std::string("Laptop"), 11, withAdaptor);
  ASSERT_NE(backend, nullptr);
  EXPECT_EQ(backend->kind(), BackendKind::Metrix);
  auto* metrix = dynamic_cast<MetrixBackend*>(backend.get());
  ASSERT_NE(metrix, nullptr);
  EXPECT_EQ(metrix->clientType(), 11);
  EXPECT_TRUE(capture.contains(log::Level::Info,
                               "MetrixBackend(initWithName): Loading Metrix adaptor class for client type 11"));

  // A client type the backend does not serve: its own error line, not the factory's.
  capture.clear();
  EXPECT_EQ(newBackendWithName("metrix", Value::dictionary(), std::string("Laptop"), 8, withAdaptor), nullptr);
  EXPECT_TRUE(
      capture.contains(log::Level::Error, "MetrixBackend(initWithName): No matching bundle found for client type 8"));
  EXPECT_FALSE(capture.containsPrefix("TelvaneBackend(newBackendWithName)"));
}

TEST_F(TelvaneBackendFactoryTest, AnHTTPSProfileWithoutClientsCreatesNothing) {
  const Value profiles[] = {Value(Dictionary{{"display_url", Value("x")}}),
                            Value(Dictionary{{"clients", Value::array()}}),
                            Value(Dictionary{{"clients", Value("everyone")}}),
                            Value(Dictionary{{"clients", Value::dictionary()}}), Value("not a profile")};
  for (const Value& profile : profiles) {
    capture.clear();
    EXPECT_EQ(newBackendWithName("quarl", profile, std::string("Laptop"), 7, platform()), nullptr)
        << profile.description();
    EXPECT_TRUE(capture.contains(log::Level::Error, "HTTPSPostBackend(initWithName): can't find the client list."));
    EXPECT_FALSE(capture.containsPrefix("TelvaneBackend(newBackendWithName)"));
  }
}

TEST_F(TelvaneBackendFactoryTest, AnHTTPSBackendNeedsAProfileAndAProductFamily) {
  EXPECT_EQ(newBackendWithName("quarl", Value(), std::string("Laptop"), 7, platform()), nullptr);
  EXPECT_EQ(newBackendWithName("quarl", httpsProfile(), std::nullopt, 7, platform()), nullptr);
  EXPECT_TRUE(capture.lines().empty());
}

TEST_F(TelvaneBackendFactoryTest, TheEntryFactoryAppliesEverySessionSetting) {
  BackendServices services;
  services.deviceInfo = std::make_shared<DeviceInfo>(makeFixedDeviceFacts(
      {{"ProductVersion", "12.4"}, {"BuildVersion", "B77"}, {"ProductType", "Board9"}, {"DeviceName", "Laptop"}}));
  services.internalBuild = true;
  services.frameworkBundleVersion = [] { return std::optional<std::string>("3.4.5"); };
  services.clock = std::make_shared<test::ManualClock>(1'700'000'123.5);

  Value section(Dictionary{{"my-splunk-prod", httpsProfile()},
                           {"quarl", httpsProfile()},
                           {"dashboard", Value::dictionary()},
                           {"release_timeout", Value(30)}});
  Value sessionInfo(Dictionary{{"SessionID", Value(4242)},
                               {"ComponentType", Value(28)},
                               {"ClientVersion", Value(70000)},
                               {"BatchEvents", Value(true)},
                               {"RequireUserDict", Value(false)}});
  auto factory = makeStorebagBackendFactory(makeTelvaneBackendEntryFactory(platform()), services);
  BackendMap backends = factory(section, sessionInfo, test::userInfo("app", "svc"), "device-7");

  ASSERT_EQ(backends.size(), 2u);
  // A dashboard entry without an address is refused by its class.
  EXPECT_TRUE(capture.contains(log::Level::Error, "DashboardBackend(initWithName): can't resolve server IP"));
  EXPECT_TRUE(capture.contains(log::Level::Error, "TelvaneBackend(newBackendWithName): release_timeout"));
  for (const char* name : {"my-splunk-prod", "quarl"}) {
    ASSERT_TRUE(backends.count(name)) << name;
    auto* backend = dynamic_cast<HTTPSPostBackend*>(backends[name].get());
    ASSERT_NE(backend, nullptr);
    EXPECT_EQ(backend->sessionID(), 4242u);
    EXPECT_EQ(backend->compType(), 28);
    EXPECT_EQ(backend->clientVersion(), static_cast<std::uint16_t>(70000));
    EXPECT_EQ(backend->udid(), "device-7");
    EXPECT_EQ(backend->productVersion(), std::optional<std::string>("12.4"));
    EXPECT_EQ(backend->buildVersion(), std::optional<std::string>("B77"));
    EXPECT_EQ(backend->hardwareType(), std::optional<std::string>("Board9"));
    EXPECT_EQ(backend->productFamily(), std::optional<std::string>("Laptop"));
    EXPECT_TRUE(backend->isInternal());
    EXPECT_FALSE(backend->requireUserInfo());
    EXPECT_TRUE(backend->batchEvents());
    EXPECT_TRUE(backend->allowNestedData());  // client type 28
    EXPECT_EQ(backend->userInfoDict()["_clientName"], Value("app"));
    EXPECT_EQ(backend->selfVersionMajor(), 3);
    EXPECT_EQ(backend->selfVersionMiddle(), 4);
    EXPECT_EQ(backend->selfVersionMinor(), 5);
    EXPECT_DOUBLE_EQ(backend->startTimeStamp(), 1'700'000'123.5);
    EXPECT_EQ(backend->state(), kBackendStatePending);
  }
}

TEST_F(TelvaneBackendFactoryTest, BadSessionValuesBecomeZerosNotCrashes) {
  BackendSettings settings;
  settings.sessionIdentifier = "not a number";
  settings.daemonVersion = "junk";
  settings.userInfo = Value("not a map");
  auto backend = newBackendWithName("brindle", httpsProfile(), std::string("Laptop"), 7, platform());
  ASSERT_NE(backend, nullptr);
  applyBackendSettings(*backend, settings);
  EXPECT_EQ(backend->sessionID(), 0u);
  EXPECT_EQ(backend->selfVersionMajor(), 0);
  // User information that is not a map counts as none.
  backend->setRequireUserInfo(true);
  EXPECT_EQ(backend->updateState(), kBackendStatePending);
}

}  // namespace
}  // namespace telvane
