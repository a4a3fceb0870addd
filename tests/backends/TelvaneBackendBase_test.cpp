#include "backends/TelvaneBackendBase.h"

#include <gtest/gtest.h>

#include <vector>

#include "backends/BackendTestSupport.h"

namespace telvane {
namespace {

// A backend that records the event ids the six-argument send receives.
class RecordingBackend : public TelvaneBackendBase {
 public:
  explicit RecordingBackend(BackendPlatform platform)
      : TelvaneBackendBase("recording", Value::dictionary(), std::string("Laptop"), std::move(platform)) {}

  using TelvaneBackendBase::sendMessage;
  std::optional<std::string> sendMessage(const Value&, TimeValue, std::uint16_t, std::uint16_t, std::uint16_t eventID,
                                         std::uint32_t) override {
    ids.push_back(eventID);
    return std::nullopt;
  }
  std::vector<std::uint16_t> ids;
};

class TelvaneBackendBaseTest : public test::BackendTestBase {
 protected:
  std::shared_ptr<TelvaneBackendBase> makeBase(std::uint32_t draw = 0) {
    random->pushUniform(draw);
    return TelvaneBackendBase::create("plain", Value(Dictionary{{"display_url", Value("x")}}), std::string("Laptop"),
                                      platform());
  }
};

TEST_F(TelvaneBackendBaseTest, FirstEventCarriesIdOneAndTheCounterWrapsAfter65535) {
  RecordingBackend backend(platform().withSystemDefaults());
  for (int i = 0; i < 65535; ++i) backend.sendMessage(Value(), TimeValue{}, 1, 2, kMessageFlagOrdinary);
  ASSERT_EQ(backend.ids.size(), 65535u);
  EXPECT_EQ(backend.ids.front(), 1);
  EXPECT_EQ(backend.ids.back(), 65535);
  backend.sendMessage(Value(), TimeValue{}, 1, 2, kMessageFlagOrdinary);
  backend.sendMessage(Value(), TimeValue{}, 1, 2, kMessageFlagOrdinary);
  EXPECT_EQ(backend.ids[65535], 0);
  EXPECT_EQ(backend.ids[65536], 1);
  EXPECT_EQ(backend.eventID(), 1);
}

TEST_F(TelvaneBackendBaseTest, SelfVersionTakesThreeElementsCutToEightBits) {
  auto backend = makeBase();
  backend->setSelfVersion("7");
  EXPECT_EQ(backend->selfVersionMajor(), 7);
  EXPECT_EQ(backend->selfVersionMiddle(), 0);
  EXPECT_EQ(backend->selfVersionMinor(), 0);
  backend->setSelfVersion("7.1.2.9");
  EXPECT_EQ(backend->selfVersionMajor(), 7);
  EXPECT_EQ(backend->selfVersionMiddle(), 1);
  EXPECT_EQ(backend->selfVersionMinor(), 2);
  backend->setSelfVersion("300.1.300");
  EXPECT_EQ(backend->selfVersionMajor(), 44);
  EXPECT_EQ(backend->selfVersionMiddle(), 1);
  EXPECT_EQ(backend->selfVersionMinor(), 44);
  backend->setSelfVersion("");
  EXPECT_EQ(backend->selfVersionMajor(), 0);
  backend->setSelfVersion("x.y");
  EXPECT_EQ(backend->selfVersionMajor(), 0);
  EXPECT_EQ(backend->selfVersionMiddle(), 0);
}

TEST_F(TelvaneBackendBaseTest, AnEmptyPresentWhitelistRefusesEveryCategory) {
  auto backend = makeBase();
  EXPECT_TRUE(backend->isWhitelistedEvent(1));
  EXPECT_TRUE(backend->isWhitelistedEvent(65535));
  backend->setEventWhitelist(Array{});
  for (std::int32_t category : {0, 1, 7, 65535}) EXPECT_FALSE(backend->isWhitelistedEvent(category)) << category;
  backend->setEventWhitelist(Array{Value(3), Value("4"), Value(5.9)});
  EXPECT_TRUE(backend->isWhitelistedEvent(3));
  EXPECT_TRUE(backend->isWhitelistedEvent(4));  // integer value of the text
  EXPECT_TRUE(backend->isWhitelistedEvent(5));  // truncated
  EXPECT_FALSE(backend->isWhitelistedEvent(6));
}

TEST_F(TelvaneBackendBaseTest, AbsentOrEmptyBlacklistRefusesNothing) {
  auto backend = makeBase();
  EXPECT_FALSE(backend->isBlacklistedEvent(5));
  backend->setEventBlacklist(Array{});
  EXPECT_FALSE(backend->isBlacklistedEvent(5));
  backend->setEventBlacklist(Array{Value(5)});
  EXPECT_TRUE(backend->isBlacklistedEvent(5));
  EXPECT_FALSE(backend->isBlacklistedEvent(6));
}

TEST_F(TelvaneBackendBaseTest, FlushRunsTheCompletionAtOnceWithNothing) {
  auto backend = makeBase();
  int calls = 0;
  backend->flushMessagesWithCompletion([&](std::optional<std::string> result, std::optional<TelvaneError> error) {
    ++calls;
    EXPECT_FALSE(result.has_value());
    EXPECT_FALSE(error.has_value());
  });
  EXPECT_EQ(calls, 1);  // before the call returned
  backend->flushMessagesWithCompletion(nullptr);  // an absent completion is fine
}

TEST_F(TelvaneBackendBaseTest, SamplingFactorIsTheDrawInTenThousandths) {
  EXPECT_DOUBLE_EQ(makeBase(1234)->samplingFactor(), 0.1234);
  EXPECT_DOUBLE_EQ(makeBase(9999)->samplingFactor(), 0.9999);
  EXPECT_DOUBLE_EQ(makeBase(0)->samplingFactor(), 0.0);
}

TEST_F(TelvaneBackendBaseTest, StateStartsPendingAndAReadAfterAWriteSeesIt) {
  auto backend = makeBase();
  EXPECT_EQ(backend->state(), kBackendStatePending);
  for (std::int32_t state : {3, 1, 2, 0}) {
    backend->setState(state);
    EXPECT_EQ(backend->state(), state);
  }
  EXPECT_EQ(backend->updateState(), kBackendStateEnabled);
  EXPECT_EQ(backend->state(), kBackendStateEnabled);
}

TEST_F(TelvaneBackendBaseTest, BaseOperationsDoNothing) {
  auto backend = makeBase();
  EXPECT_EQ(backend->kind(), BackendKind::Other);
  EXPECT_EQ(backend->name(), "plain");
  EXPECT_FALSE(backend->sendMessage(Value(Dictionary{{"a", Value(1)}}), TimeValue{1, 0}, 1, 1, 0).has_value());
  EXPECT_EQ(backend->eventID(), 1);
  FileAccessToken token;
  EXPECT_FALSE(backend->uploadFileAtPath("/tmp/x", token));
  EXPECT_FALSE(backend->uploadLogData(Array{}));
  EXPECT_EQ(backend->batchedEventsSize(), 0);
  EXPECT_FALSE(backend->displayURL().has_value());  // only the HTTPS backend reads "display_url"
  backend->cleanup();
}

TEST_F(TelvaneBackendBaseTest, StartTimestampIsSecondsPlusMicroseconds) {
  auto backend = makeBase();
  backend->setStartTimestamp(TimeValue{1'000'059, 700'000});
  EXPECT_DOUBLE_EQ(backend->startTimeStamp(), 1'000'059.7);
}

TEST_F(TelvaneBackendBaseTest, CorrelatedSessionIdentifierIsStoredAsTheCombinedOne) {
  auto backend = makeBase();
  EXPECT_FALSE(backend->combinedSessionIDString().has_value());
  backend->setCombinedSessionIDString("17");
  EXPECT_EQ(backend->combinedSessionIDString(), std::optional<std::string>("17"));
  backend->setCorrelatedSessionID("3.17");
  EXPECT_EQ(backend->combinedSessionIDString(), std::optional<std::string>("3.17"));
}

TEST_F(TelvaneBackendBaseTest, UserInformationIsTheBackendsOwnCopy) {
  auto backend = makeBase();
  Value info = test::userInfo("app", "svc");
  backend->setUserInfoDict(info);
  info.asDictionary()->set("extra", Value(1));
  EXPECT_TRUE(backend->userInfoDict()["extra"].isNull());
  EXPECT_EQ(backend->userInfoDict()["_clientName"], Value("app"));
  backend->setUserInfoDict(Value());
  EXPECT_TRUE(backend->userInfoDict().isNull());
}

TEST_F(TelvaneBackendBaseTest, AnEmptyDigestKeyIsAKeyAndNoneIsNone) {
  auto backend = makeBase();
  EXPECT_FALSE(backend->digestKey().has_value());
  backend->setDigestKey(Bytes{});
  EXPECT_EQ(backend->digestKey(), std::optional<Bytes>(Bytes{}));
  backend->setDigestKey(Bytes{1, 2});
  EXPECT_EQ(backend->digestKey(), std::optional<Bytes>(Bytes{1, 2}));
  backend->setDigestKey(std::nullopt);
  EXPECT_FALSE(backend->digestKey().has_value());
}

TEST_F(TelvaneBackendBaseTest, ConnectivityDelegateIsHeldWeakly) {
  auto backend = makeBase();
  auto fake = std::make_shared<test::FakeConnectivityHelper>();
  backend->setReportingSessionConnectivityDelegate(fake);
  EXPECT_EQ(backend->reportingSessionConnectivityDelegate(), fake);
  fake.reset();
  EXPECT_EQ(backend->reportingSessionConnectivityDelegate(), nullptr);
}

TEST_F(TelvaneBackendBaseTest, Sha256OfAbc) {
  EXPECT_EQ(TelvaneBackendBase::convertIntoSHA256("abc"),
            "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad");
}

}  // namespace
}  // namespace telvane
