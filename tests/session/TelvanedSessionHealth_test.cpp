#include <gtest/gtest.h>

#include "platform/Log.h"
#include "session/TelvanedSession.h"
#include "support/SessionTestHarness.h"

using namespace telvane;
using namespace telvane::test;

namespace {

Value userInfoMap(const std::string& client, const std::string& service) {
  return Value(Dictionary{{"_clientName", Value(client)}, {"_serviceName", Value(service)}});
}

class HealthTest : public ::testing::Test {
 protected:
  // A session of the component type whose backends hold `batched` bytes.
  std::unique_ptr<SessionTestHarness> makeSession(long componentType, std::int64_t batched,
                                                  bool aggregator = false, Value userInfo = Value()) {
    auto env = std::make_unique<TestEnvironment>();
    auto backend = std::make_shared<FakeBackend>("a");
    backend->setBatchedSize(batched);
    env->backends->add(backend);
    auto h = std::make_unique<SessionTestHarness>(*env);
    h->client().send(ipc::Operation::SetSessionInfo, Array{sessionInfoMap(componentType, 1), userInfo,
                                                          Value::array(), Value(aggregator)});
    EXPECT_TRUE(h->client().call(ipc::Operation::FetchDisplayURL, {}));
    h->run([&] { h->session()->createBackendsWithStorebag(Value::dictionary()); });
    environments.push_back(std::move(env));
    return h;
  }

  log::LogCapture capture;
  std::vector<std::unique_ptr<TestEnvironment>> environments;
};

TEST_F(HealthTest, ReportingSessionIsCountedWithTheList) {
  auto reporting = makeSession(6, 5);
  auto other1 = makeSession(6, 100);
  auto other2 = makeSession(6, 20);
  auto unknown4 = makeSession(4, 1000);
  auto unknown31 = makeSession(31, 3000);

  Dictionary payload;
  Value storebags(Dictionary{{"video", Value(Dictionary{{"brindle", Value::dictionary()}})}});
  reporting->session()->addSessionsAccumulatedHealthInfoToPayload(
      payload, {other1->session(), other2->session(), unknown4->session(), unknown31->session()}, storebags);

  EXPECT_EQ(payload.get("SessionsCount_VID"), Value(3u));
  EXPECT_EQ(payload.get("BatchSize_VID"), Value(125u));
  EXPECT_EQ(payload.get("SessionsCount_Unknown"), Value(2u));
  EXPECT_EQ(payload.get("BatchSize_Unknown"), Value(4000u));
  EXPECT_EQ(payload.get("StorebagsCount"), Value(1u));
  std::uint64_t storebagsSize = static_cast<std::uint32_t>(storebags.sizeEstimate());
  EXPECT_EQ(payload.get("StorebagsSize").unsignedLongLongValue(), storebagsSize);
  EXPECT_EQ(payload.get("CalculatedMemoryUsage").unsignedLongLongValue(), 4125 + storebagsSize);
  EXPECT_EQ(payload.get("ProcessMemoryUsage"), Value(123456u));
  EXPECT_EQ(payload.size(), 8u);
}

TEST_F(HealthTest, ReportingSessionInTheListIsCountedTwice) {
  auto reporting = makeSession(30, 7);
  Dictionary payload;
  reporting->session()->addSessionsAccumulatedHealthInfoToPayload(payload, {reporting->session()},
                                                                  Value::dictionary());
  EXPECT_EQ(payload.get("SessionsCount_EXT"), Value(2u));
  EXPECT_EQ(payload.get("BatchSize_EXT"), Value(14u));
}

TEST_F(HealthTest, SessionHealthInfoAddsToExistingCounters) {
  auto s = makeSession(5, 9);
  Dictionary report{{"SessionsCount_AUD", Value(4)}, {"BatchSize_AUD", Value(1)}};
  EXPECT_EQ(TelvanedSession::addSessionHealthInfo(*s->session(), report), 9u);
  EXPECT_EQ(report.get("SessionsCount_AUD"), Value(5u));
  EXPECT_EQ(report.get("BatchSize_AUD"), Value(10u));
}

TEST_F(HealthTest, ShutdownTellsTheClientOnceWithEverythingEmpty) {
  auto s = makeSession(6, 0, /*aggregator=*/true);
  s->session()->shutdownSessionAggregation();
  s->session()->shutdownSessionAggregation();
  ASSERT_TRUE(s->client().waitForAggregatedMessages(1));
  // A round trip after the second shutdown: nothing more arrived meanwhile.
  ASSERT_TRUE(s->client().call(ipc::Operation::FetchDisplayURL, {}));
  auto messages = s->client().aggregatedMessages();
  ASSERT_EQ(messages.size(), 1u);
  EXPECT_EQ(messages[0], (Array{Value(), Value(0.0), Value(0), Value(0), Value()}));
  EXPECT_EQ(capture.count("shutdownSessionAggregation: Disable aggregation module for session 1"), 2u);
  EXPECT_FALSE(s->session()->hasAggregator());
}

TEST_F(HealthTest, OwnAggregatorReceivesTheEventWithUserInfoMerged) {
  auto s = makeSession(6, 0, /*aggregator=*/true,
                       Value(Dictionary{{"_clientName", Value("cam")}, {"x", Value("from user info")}}));
  s->session()->aggregateMessage(s->session()->sessionInfo(), 12.5, 3, 4,
                                 Value(Dictionary{{"x", Value("from payload")}, {"y", Value(1)}}));
  ASSERT_TRUE(s->client().waitForAggregatedMessages(1));
  auto m = s->client().aggregatedMessages()[0];
  EXPECT_EQ(m[0]["SessionID"].integerValue(), 1);
  EXPECT_EQ(m[1].doubleValue(), 12.5);
  EXPECT_EQ(m[2].integerValue(), 3);
  EXPECT_EQ(m[3].integerValue(), 4);
  EXPECT_EQ(m[4], Value(Dictionary{{"_clientName", Value("cam")}, {"x", Value("from user info")}, {"y", Value(1)}}));
}

TEST_F(HealthTest, WithoutAggregatorOrAncestorNothingIsSent) {
  auto s = makeSession(6, 0, /*aggregator=*/false);
  s->session()->aggregateMessage(s->session()->sessionInfo(), 1.0, 3, 4, Value());
  ASSERT_TRUE(s->client().call(ipc::Operation::FetchDisplayURL, {}));
  EXPECT_TRUE(s->client().aggregatedMessages().empty());
}

TEST_F(HealthTest, AncestorWithAggregatorReceivesTheChildsEvents) {
  auto ancestor = makeSession(6, 0, /*aggregator=*/true);
  auto child = makeSession(6, 0, /*aggregator=*/true, userInfoMap("c", "s"));
  child->delegate()->setAncestor(ancestor->session());
  child->session()->aggregateMessage(child->session()->sessionInfo(), 2.0, 7, 8, Value(Dictionary{{"p", Value(1)}}));
  ASSERT_TRUE(ancestor->client().waitForAggregatedMessages(1));
  auto m = ancestor->client().aggregatedMessages()[0];
  EXPECT_EQ(m[2].integerValue(), 7);
  EXPECT_EQ(m[4], Value(Dictionary{{"p", Value(1)}, {"_clientName", Value("c")}, {"_serviceName", Value("s")}}));
  ASSERT_TRUE(child->client().call(ipc::Operation::FetchDisplayURL, {}));
  EXPECT_TRUE(child->client().aggregatedMessages().empty());
}

TEST_F(HealthTest, AggregatingWithoutConnectionLogsTheProxyError) {
  auto s = makeSession(6, 0, /*aggregator=*/true);
  s->session()->invalidate();
  s->session()->sendToAggregator(Value(), 1.0, 1, 2, Value());
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "sendMessageWithDictionary: Failed to get remote object proxy: the connection to the "
                               "client has been invalidated"));
}

}  // namespace
