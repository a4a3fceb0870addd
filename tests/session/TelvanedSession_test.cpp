#include "session/TelvanedSession.h"

#include <gtest/gtest.h>

#include "platform/Log.h"
#include "support/FakeConnectivityHelper.h"
#include "support/SessionTestHarness.h"

using namespace telvane;
using namespace telvane::test;

namespace {

Array setInfoArgs(const Value& sessionInfo, const Value& userInfo = Value(), bool aggregator = false) {
  return Array{sessionInfo, userInfo, Value::array(), Value(aggregator)};
}

Value userInfoMap(const std::string& client, const std::string& service) {
  return Value(Dictionary{{"_clientName", Value(client)}, {"_serviceName", Value(service)}});
}

// True when the expected lines appear in this order (other lines may come between).
bool appearInOrder(const std::vector<std::string>& lines, const std::vector<std::string>& expected) {
  std::size_t next = 0;
  for (const auto& line : lines) {
    if (next < expected.size() && line == expected[next]) ++next;
  }
  return next == expected.size();
}

using TelvanedSessionTest = SessionTest;

TEST_F(TelvanedSessionTest, CreationLogsAndMakesABase64Identifier) {
  SessionTestHarness h(env);
  EXPECT_EQ(h.session()->sessionIDString(), "AAECAwQFRgeICQoLDA0ODw==");
  EXPECT_EQ(h.session()->sessionIDString().size(), 24u);
  EXPECT_TRUE(capture.contains("initWithSessionDelegate: TelvanedSession initWithSessionDelegate:<FakeSessionDelegate>"));
  EXPECT_TRUE(capture.contains("initWithSessionDelegate: Initialized session with UUID AAECAwQFRgeICQoLDA0ODw=="));
  EXPECT_EQ(h.session()->deviceID(), kTestDeviceID);
  EXPECT_EQ(h.session()->connectivityHelperReleaseTimeout(), 30u);
  EXPECT_EQ(h.session()->description(), "<TelvanedSession: session 0, AAECAwQFRgeICQoLDA0ODw==>");
}

TEST_F(TelvanedSessionTest, DeviceIdentifierStaysEmptyWhenTheQueryFails) {
  env.deviceFacts.erase("UniqueDeviceID");
  SessionTestHarness h(env);
  EXPECT_EQ(h.session()->deviceID(), "");
}

TEST_F(TelvanedSessionTest, UserInfoWithoutNamesGetsNoHelperAndTeardownReleasesTheTransaction) {
  auto helper = std::make_shared<FakeConnectivityHelper>();
  SessionTestHarness h(env);
  h.delegate()->setHelper(helper);
  Value userInfo(Dictionary{{"other", Value("x")}});
  h.client().send(ipc::Operation::SetSessionInfo,
                  setInfoArgs(sessionInfoMap(7, 5, {{"RequireUserDict", Value(true)}}), userInfo));
  ASSERT_TRUE(h.client().call(ipc::Operation::FetchDisplayURL, {}));
  EXPECT_EQ(h.delegate()->helperCopies(), 0);
  EXPECT_FALSE(h.session()->connectivityHelper());
  ASSERT_TRUE(h.closeAndWaitForTeardown());
  EXPECT_EQ(h.delegate()->releasedTransactions(), std::vector<std::uint32_t>{1});
  EXPECT_TRUE(capture.contains(
      "TelvanedSession dealloc: release IPC transaction for session without connectivity helper for session 5"));
  EXPECT_EQ(helper->totalSessionsServed(), 0);
}

TEST_F(TelvanedSessionTest, ValidUserInfoGetsTheSharedHelperAndTeardownCountsTheSession) {
  auto helper = std::make_shared<FakeConnectivityHelper>();
  SessionTestHarness h(env);
  h.delegate()->setHelper(helper);
  h.client().send(ipc::Operation::SetSessionInfo,
                  setInfoArgs(sessionInfoMap(7, 5, {{"RequireUserDict", Value(true)}}), userInfoMap("c", "s")));
  ASSERT_TRUE(h.client().call(ipc::Operation::FetchDisplayURL, {}));
  EXPECT_EQ(h.delegate()->helperCopies(), 1);
  EXPECT_EQ(helper->releaseTimeouts(), std::vector<std::uint32_t>{30});
  ASSERT_TRUE(h.closeAndWaitForTeardown());
  EXPECT_TRUE(h.delegate()->releasedTransactions().empty());
  EXPECT_EQ(helper->totalSessionsServed(), 1);
  EXPECT_TRUE(capture.contains("TelvanedSession dealloc: incrementing total sessions count for session 5"));
  // The teardown gives the helper back to the agent.
  EXPECT_EQ(h.delegate()->helperReleases(), 1);
}

TEST_F(TelvanedSessionTest, TeardownBeforeStorebagSendsNoEndMessage) {
  SessionTestHarness h(env);
  h.client().send(ipc::Operation::SetSessionInfo, setInfoArgs(sessionInfoMap(7, 5)));
  ASSERT_TRUE(h.client().call(ipc::Operation::StartConfig, {}));
  ASSERT_TRUE(h.closeAndWaitForTeardown());
  EXPECT_TRUE(capture.contains("dealloc: TelvanedSession dealloc: 5"));
  EXPECT_FALSE(capture.containsPrefix("internalSendMessage:"));
  EXPECT_FALSE(capture.containsPrefix("flushMessagesWithCompletion:"));
}

TEST_F(TelvanedSessionTest, TeardownSendsTheEndMessageFlushesAndReleasesInOrder) {
  auto backend = addBackend();
  backend->setBatchedSize(10);
  SessionTestHarness h(env);
  h.delegate()->setStorebag(Value::dictionary());
  h.delegate()->setStorebagVersion(std::string("v9"));
  h.client().send(ipc::Operation::SetSessionInfo, setInfoArgs(sessionInfoMap(7, 5), Value(), true));
  ASSERT_TRUE(h.client().call(ipc::Operation::StartConfig, {}));
  h.client().send(ipc::Operation::FinishSessionGracefully, {});
  ASSERT_TRUE(h.client().call(ipc::Operation::FetchDisplayURL, {}));
  EXPECT_TRUE(capture.contains("finishSessionGracefully: Session 5 has been finished gracefully"));
  capture.clear();
  ASSERT_TRUE(h.closeAndWaitForTeardown());

  EXPECT_TRUE(appearInOrder(
      capture.texts(),
      {"dealloc: TelvanedSession dealloc: 5", "internalSendMessage: Sent internal message (method:0 respCode:1)",
       "flushMessagesWithCompletion: Flushing messages for session 5", "internalFlushMessagesWithCompletion: a-splunk",
       "shutdownSessionAggregation: Disable aggregation module for session 5",
       "TelvanedSession dealloc: release IPC transaction for session without connectivity helper for session 5"}));
  auto sent = backend->sent();
  ASSERT_EQ(sent.size(), 2u);
  EXPECT_EQ(sent[1].method, 0);
  EXPECT_EQ(sent[1].respCode, 1);
  EXPECT_EQ(sent[1].flag, 0u);
  EXPECT_EQ(sent[1].blob["ClientData"], Value(Dictionary{{"StorebagVersion", Value("v9")},
                                                          {"GracefulTermination", Value(true)},
                                                          {"SessionsCount_CNF", Value(1u)},
                                                          {"BatchSize_CNF", Value(10u)},
                                                          {"StorebagsCount", Value(0u)},
                                                          {"StorebagsSize", sent[1].blob["ClientData"]["StorebagsSize"]},
                                                          {"CalculatedMemoryUsage",
                                                           sent[1].blob["ClientData"]["CalculatedMemoryUsage"]},
                                                          {"ProcessMemoryUsage", Value(123456u)}}));
  std::uint64_t storebagsSize = sent[1].blob["ClientData"]["StorebagsSize"].unsignedLongLongValue();
  EXPECT_EQ(storebagsSize, static_cast<std::uint64_t>(Value::dictionary().sizeEstimate()));
  EXPECT_EQ(sent[1].blob["ClientData"]["CalculatedMemoryUsage"].unsignedLongLongValue(), 10 + storebagsSize);
  EXPECT_EQ(backend->flushCount(), 1);
  EXPECT_EQ(backend->cleanupCount(), 1);
  EXPECT_EQ(h.delegate()->releasedTransactions(), std::vector<std::uint32_t>{1});
  EXPECT_FALSE(h.session()->backends());
}

TEST_F(TelvanedSessionTest, GracefulTerminationIsAbsentWithoutStorebagVersion) {
  auto backend = addBackend();
  SessionTestHarness h(env);
  h.delegate()->setStorebag(Value::dictionary());
  h.client().send(ipc::Operation::SetSessionInfo, setInfoArgs(sessionInfoMap(7, 5)));
  ASSERT_TRUE(h.client().call(ipc::Operation::StartConfig, {}));
  h.client().send(ipc::Operation::FinishSessionGracefully, {});
  ASSERT_TRUE(h.closeAndWaitForTeardown());
  auto sent = backend->sent();
  ASSERT_EQ(sent.size(), 2u);
  const Value& payload = sent[1].blob["ClientData"];
  EXPECT_TRUE(payload["GracefulTermination"].isNull());
  EXPECT_TRUE(payload["StorebagVersion"].isNull());
  EXPECT_EQ(payload["SessionsCount_CNF"], Value(1u));
}

}  // namespace
