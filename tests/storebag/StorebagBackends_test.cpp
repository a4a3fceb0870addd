#include "storebag/StorebagBackends.h"

#include <gtest/gtest.h>

#include <vector>

#include "support/FakeBackend.h"
#include "support/ManualClock.h"
#include "platform/Log.h"
#include "session/SessionKeys.h"

namespace telvane {
namespace {

struct FactoryCall {
  BackendRequest request;
  BackendSettings settings;
};

class CreateBackendsTest : public ::testing::Test {
 protected:
  CreateBackendsTest() {
    services_.deviceInfo = std::make_shared<DeviceInfo>(makeFixedDeviceFacts({{"ProductVersion", "12.4"},
                                                                              {"BuildVersion", "B77"},
                                                                              {"ProductType", "Board9"},
                                                                              {"DeviceName", "Laptop"}}));
    services_.internalBuild = false;
    services_.frameworkBundleVersion = [] { return std::optional<std::string>("3.1.4"); };
    services_.clock = clock_;
  }

  // Makes a backend for every name except those in refused_.
  BackendEntryFactory factory() {
    return [this](const BackendRequest& request, const BackendSettings& settings) -> std::shared_ptr<TelvaneBackend> {
      calls_.push_back({request, settings});
      for (const std::string& refused : refused_) {
        if (request.name == refused) return nullptr;
      }
      return std::make_shared<test::FakeBackend>(request.name);
    };
  }

  Value sessionInfo(std::int32_t clientType) {
    return Value(Dictionary{{keys::kSessionInfoSessionID, Value(4242)},
                            {keys::kSessionInfoComponentType, Value(clientType)},
                            {keys::kSessionInfoClientVersion, Value(70000)},
                            {keys::kSessionInfoBatchEvents, Value(true)}});
  }

  std::shared_ptr<test::ManualClock> clock_ = std::make_shared<test::ManualClock>(1'700'000'123.5);
  BackendServices services_;
  std::vector<FactoryCall> calls_;
  std::vector<std::string> refused_;
  log::LogCapture capture_;
};

TEST_F(CreateBackendsTest, NilSectionOrSessionInfoCreatesNothing) {
  EXPECT_TRUE(createBackends(Value(), sessionInfo(7), Value(), "dev", factory(), services_).empty());
  EXPECT_TRUE(capture_.contains(log::Level::Error, "createBackends: Attempted to create backends with nil storebag"));
  EXPECT_TRUE(createBackends(Value(Dictionary{{"metrix", Value(1)}}), Value(), Value(), "dev", factory(), services_)
                  .empty());
  EXPECT_TRUE(capture_.contains(log::Level::Error, "createBackends: Attempted to create backends with nil session info"));
  EXPECT_TRUE(calls_.empty());
}

TEST_F(CreateBackendsTest, EveryKeyIsOfferedAndOnlyReturnedBackendsAreKept) {
  refused_ = {"release_timeout"};
  Value section(Dictionary{{"metrix", Value(Dictionary{{"active", Value(true)}})},
                           {"poster", Value(Dictionary{{"url", Value("https://x.test")}})},
                           {"release_timeout", Value(30)}});
  BackendMap backends = createBackends(section, sessionInfo(5), Value(), "dev", factory(), services_);
  ASSERT_EQ(calls_.size(), 3u);
  EXPECT_EQ(backends.size(), 2u);
  EXPECT_TRUE(backends.count("metrix"));
  EXPECT_TRUE(backends.count("poster"));
  EXPECT_EQ(backends["metrix"]->name(), "metrix");
  for (const FactoryCall& call : calls_) {
    EXPECT_EQ(call.request.profile, section[call.request.name]);
    EXPECT_EQ(call.request.productFamily, std::optional<std::string>("Laptop"));
    EXPECT_EQ(call.request.clientType, 5);
  }
}

TEST_F(CreateBackendsTest, SettingsCarryDeviceSessionAndDaemonFacts) {
  Value userInfo(Dictionary{{"_clientName", Value("c")}});
  createBackends(Value(Dictionary{{"metrix", Value(1)}}), sessionInfo(5), userInfo, "device-1", factory(), services_);
  ASSERT_EQ(calls_.size(), 1u);
  const BackendSettings& settings = calls_[0].settings;
  EXPECT_EQ(settings.sessionIdentifier, "4242");
  EXPECT_EQ(settings.clientType, 5);
  EXPECT_EQ(settings.clientVersion, static_cast<std::uint16_t>(70000));  // 16 bits
  EXPECT_EQ(settings.deviceIdentifier, "device-1");
  EXPECT_EQ(settings.productVersion, std::optional<std::string>("12.4"));
  EXPECT_EQ(settings.buildVersion, std::optional<std::string>("B77"));
  EXPECT_EQ(settings.hardwareType, std::optional<std::string>("Board9"));
  EXPECT_FALSE(settings.internalBuild);
  EXPECT_TRUE(settings.requireUserInfo) << "absent key means user info is required";
  EXPECT_TRUE(settings.batchEvents);
  EXPECT_FALSE(settings.allowNestedData);
  EXPECT_EQ(settings.userInfo, userInfo);
  EXPECT_EQ(settings.daemonVersion, "3.1.4");
  EXPECT_DOUBLE_EQ(settings.startTimestampSeconds, 1'700'000'123.5);
}

TEST_F(CreateBackendsTest, RequireUserInfoFollowsItsKey) {
  Value info = sessionInfo(5);
  info.asDictionary()->set(keys::kSessionInfoRequireUserDict, Value(false));
  createBackends(Value(Dictionary{{"metrix", Value(1)}}), info, Value(), "d", factory(), services_);
  ASSERT_EQ(calls_.size(), 1u);
  EXPECT_FALSE(calls_[0].settings.requireUserInfo);
}

TEST_F(CreateBackendsTest, NestedDataRules) {
  Value section(Dictionary{{"metrix", Value(1)}});
  createBackends(section, sessionInfo(28), Value(), "d", factory(), services_);
  createBackends(section, sessionInfo(7), Value(), "d", factory(), services_);
  services_.internalBuild = true;
  createBackends(section, sessionInfo(7), Value(), "d", factory(), services_);
  createBackends(section, sessionInfo(11), Value(), "d", factory(), services_);
  ASSERT_EQ(calls_.size(), 4u);
  EXPECT_TRUE(calls_[0].settings.allowNestedData);
  EXPECT_FALSE(calls_[1].settings.allowNestedData);
  EXPECT_TRUE(calls_[2].settings.allowNestedData);
  EXPECT_TRUE(calls_[2].settings.internalBuild);
  EXPECT_FALSE(calls_[3].settings.allowNestedData);
}

TEST_F(CreateBackendsTest, DaemonVersionDefaultsWithoutBundleVersion) {
  services_.frameworkBundleVersion = [] { return std::optional<std::string>(); };
  createBackends(Value(Dictionary{{"metrix", Value(1)}}), sessionInfo(5), Value(), "d", factory(), services_);
  ASSERT_EQ(calls_.size(), 1u);
  EXPECT_EQ(calls_[0].settings.daemonVersion, "8.0");
}

TEST_F(CreateBackendsTest, SessionEnvironmentFactoryWrapsCreateBackends) {
  auto sessionFactory = makeStorebagBackendFactory(factory(), services_);
  BackendMap backends =
      sessionFactory(Value(Dictionary{{"a", Value(1)}, {"b", Value(2)}}), sessionInfo(5), Value(), "dev");
  EXPECT_EQ(backends.size(), 2u);
  ASSERT_EQ(calls_.size(), 2u);
  EXPECT_EQ(calls_[0].request.name, "a");
  EXPECT_EQ(calls_[1].settings.deviceIdentifier, "dev");
}

}  // namespace
}  // namespace telvane
