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

using SessionConfigurationTest = SessionTest;

TEST_F(SessionConfigurationTest, SetSessionInfoConfiguresTheSession) {
  SessionTestHarness h(env);
  Dictionary extra{{"HierarchyToken", hierarchyToken("T1", 2)}};
  h.client().send(ipc::Operation::SetSessionInfo, setInfoArgs(sessionInfoMap(7, 12, extra), Value(), true));
  ASSERT_TRUE(h.client().call(ipc::Operation::FetchDisplayURL, {}));
  EXPECT_EQ(h.session()->sessionID(), 12u);
  EXPECT_TRUE(capture.contains("setSessionInfo: Configuring session 12"));
  EXPECT_EQ(h.session()->hierarchyToken(), "T1");
  EXPECT_EQ(h.session()->hierarchyLevel(), 2);
  EXPECT_TRUE(h.session()->hasAggregator());
  EXPECT_TRUE(h.session()->isCounted());
  EXPECT_EQ(h.delegate()->correlatedUpdates(), 1);
  EXPECT_FALSE(capture.contains("setSessionInfo: Configure session: user info provided without requiring it"));
}

TEST_F(SessionConfigurationTest, UserInfoWithoutRequiringItIsLoggedAndKept) {
  SessionTestHarness h(env);
  h.client().send(ipc::Operation::SetSessionInfo, setInfoArgs(sessionInfoMap(7, 12), userInfoMap("c", "s")));
  ASSERT_TRUE(h.client().call(ipc::Operation::FetchDisplayURL, {}));
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "setSessionInfo: Configure session: user info provided without requiring it"));
  EXPECT_EQ(h.session()->userInfo()["_clientName"].stringOrEmpty(), "c");
}

TEST_F(SessionConfigurationTest, HierarchyTokenThatIsNotAMapMakesAStandaloneSession) {
  SessionTestHarness h(env);
  Dictionary extra{{"HierarchyToken", Value("not a map")}};
  h.client().send(ipc::Operation::SetSessionInfo, setInfoArgs(sessionInfoMap(7, 12, extra)));
  ASSERT_TRUE(h.client().call(ipc::Operation::FetchDisplayURL, {}));
  EXPECT_FALSE(h.session()->hierarchyToken());
  EXPECT_EQ(h.session()->hierarchyLevel(), 0);
}

TEST_F(SessionConfigurationTest, RefusedSessionStoresOnlyItsSessionInfoAndIsInvalidated) {
  SessionTestHarness h(env);
  h.delegate()->setLimitReached(true);
  h.client().send(ipc::Operation::SetSessionInfo, setInfoArgs(sessionInfoMap(7, 12), userInfoMap("c", "s"), true));
  ASSERT_TRUE(h.client().waitUntilDisconnected());
  ASSERT_TRUE(waitUntil([&] { return h.session()->isTornDown(); }));
  EXPECT_EQ(h.session()->sessionID(), 0u);
  EXPECT_EQ(h.session()->sessionInfo()["SessionID"].integerValue(), 12);
  EXPECT_FALSE(capture.contains("setSessionInfo: Configuring session 12"));
  EXPECT_EQ(h.delegate()->correlatedUpdates(), 0);
  EXPECT_EQ(h.delegate()->helperCopies(), 0);
}

TEST_F(SessionConfigurationTest, StartWithoutStorebagRepliesNothingAndLaterStartTriesAgain) {
  addBackend();
  SessionTestHarness h(env);
  h.client().send(ipc::Operation::SetSessionInfo, setInfoArgs(sessionInfoMap(7, 3)));
  auto reply = h.client().call(ipc::Operation::StartConfig, {});
  ASSERT_TRUE(reply);
  ASSERT_EQ(reply->size(), 3u);
  EXPECT_TRUE((*reply)[0].isNull());
  EXPECT_TRUE((*reply)[1].isNull());
  EXPECT_TRUE((*reply)[2].isNull());
  EXPECT_TRUE(capture.contains("startConfigWithCompletionHandler: Starting configuration for session 3"));
  EXPECT_FALSE(h.session()->backends());

  h.delegate()->setStorebag(Value::dictionary());
  reply = h.client().call(ipc::Operation::StartConfig, {});
  ASSERT_TRUE(reply);
  ASSERT_TRUE((*reply)[0].isArray());
  EXPECT_EQ((*reply)[0], Value(Array{Value("a-splunk")}));
  EXPECT_EQ(env.backends->calls(), 1);
}

TEST_F(SessionConfigurationTest, SecondStartLogsAndDoesNotRebuildOrResend) {
  auto backend = addBackend();
  backend->setWhitelist(Array{Value(4)});
  SessionTestHarness h(env);
  h.delegate()->setStorebag(Value::dictionary());
  h.delegate()->setStorebagVersion(std::string("v9"));
  h.client().send(ipc::Operation::SetSessionInfo, setInfoArgs(sessionInfoMap(7, 3)));
  auto first = h.client().call(ipc::Operation::StartConfig, {});
  auto second = h.client().call(ipc::Operation::StartConfig, {});
  ASSERT_TRUE(first && second);
  EXPECT_EQ(env.backends->calls(), 1);
  EXPECT_EQ(capture.count("internalSendMessage: Sent internal message (method:0 respCode:0)"), 1u);
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "startConfigWithCompletionHandler: has been called more than once for session 3"));
  EXPECT_EQ(*second, *first);
  EXPECT_EQ((*second)[0], Value(Array{Value("a-splunk")}));
  EXPECT_EQ((*second)[1], Value(Array{Value(4)}));
  EXPECT_EQ(h.session()->storebagVersion(), "v9");
  EXPECT_EQ(h.delegate()->downstreamUpdates(), 1);
}

TEST_F(SessionConfigurationTest, NonInternalStartMessageHoldsOnlyTimeSettingAndLocale) {
  auto backend = addBackend();
  SessionTestHarness h(env);
  h.delegate()->setStorebag(Value::dictionary());
  h.client().send(ipc::Operation::SetSessionInfo, setInfoArgs(sessionInfoMap(7, 3)));
  ASSERT_TRUE(h.client().call(ipc::Operation::StartConfig, {}));
  auto sent = backend->sent();
  ASSERT_EQ(sent.size(), 1u);
  EXPECT_EQ(sent[0].method, 0);
  EXPECT_EQ(sent[0].respCode, 0);
  EXPECT_EQ(sent[0].flag, 0u);
  EXPECT_EQ(sent[0].blob["ClientData"],
            Value(Dictionary{{"AutomaticTimeSet", Value(true)}, {"Locale", Value("DE")}}));
  EXPECT_EQ(sent[0].timestamp, TimeValue::fromSeconds(env.clock->now()));
}

TEST_F(SessionConfigurationTest, InternalStartMessageHoldsDeviceKeysAndDefaults) {
  env.internalBuild = true;
  env.bundleVersion.reset();
  env.locale.reset();
  env.deviceFacts.erase("DeviceName");
  env.settings->write("com.zembra.timed", "TMAutomaticTimeZoneEnabled", Value(false));
  auto backend = addBackend();
  SessionTestHarness h(env);
  h.delegate()->setStorebag(Value::dictionary());
  h.client().send(ipc::Operation::SetSessionInfo, setInfoArgs(sessionInfoMap(7, 3)));
  ASSERT_TRUE(h.client().call(ipc::Operation::StartConfig, {}));
  auto sent = backend->sent();
  ASSERT_EQ(sent.size(), 1u);
  EXPECT_EQ(sent[0].blob["ClientData"], Value(Dictionary{{"SerialNum", Value("SN-42")},
                                                          {"Version", Value("12.1")},
                                                          {"Build", Value("B100")},
                                                          {"Hardware", Value("HW-7")},
                                                          {"Product", Value("Unknown")},
                                                          {"ReportVers", Value("8.0")},
                                                          {"Locale", Value("Unknown")},
                                                          {"AutomaticTimeSet", Value(false)}}));
}

TEST_F(SessionConfigurationTest, InternalStartMessageCarriesTheBundleVersion) {
  env.internalBuild = true;
  auto backend = addBackend();
  SessionTestHarness h(env);
  h.delegate()->setStorebag(Value::dictionary());
  h.client().send(ipc::Operation::SetSessionInfo, setInfoArgs(sessionInfoMap(7, 3)));
  ASSERT_TRUE(h.client().call(ipc::Operation::StartConfig, {}));
  ASSERT_EQ(backend->sent().size(), 1u);
  EXPECT_EQ(backend->sent()[0].blob["ClientData"]["ReportVers"], Value("1.2.3"));
}

TEST_F(SessionConfigurationTest, FetchStatesWithoutUserInfoKeepsTheRequiredOne) {
  SessionTestHarness h(env);
  h.client().send(ipc::Operation::SetSessionInfo,
                  setInfoArgs(sessionInfoMap(7, 5, {{"RequireUserDict", Value(true)}}), userInfoMap("c", "s")));
  auto reply = h.client().call(ipc::Operation::FetchStates, {Value()});
  ASSERT_TRUE(reply);
  EXPECT_TRUE(capture.contains("fetchStatesWithUserInfo: Fetching states for session 5"));
  EXPECT_FALSE(capture.containsPrefix("receivedUserInfo:"));
  EXPECT_EQ(h.session()->userInfo()["_clientName"].stringOrEmpty(), "c");
  EXPECT_EQ(h.delegate()->downstreamUpdates(), 0);
}

TEST_F(SessionConfigurationTest, FetchStatesWithNewNamesUpdatesTheSession) {
  auto backend = addBackend();
  SessionTestHarness h(env);
  h.delegate()->setStorebag(Value::dictionary());
  h.client().send(ipc::Operation::SetSessionInfo, setInfoArgs(sessionInfoMap(7, 5)));
  ASSERT_TRUE(h.client().call(ipc::Operation::StartConfig, {}));
  int downstream = h.delegate()->downstreamUpdates();
  auto reply = h.client().call(ipc::Operation::FetchStates, {userInfoMap("c", "s")});
  ASSERT_TRUE(reply);
  EXPECT_TRUE(capture.contains("receivedUserInfo: Received new user info for session 5"));
  EXPECT_EQ(h.delegate()->downstreamUpdates(), downstream + 1);
  EXPECT_EQ(backend->userInfoDict()["_serviceName"].stringOrEmpty(), "s");
  EXPECT_EQ((*reply)[0], Value(Array{Value("a-splunk")}));

  // The same names again: the backends get the map, nothing else changes.
  capture.clear();
  ASSERT_TRUE(h.client().call(ipc::Operation::FetchStates, {userInfoMap("c", "s")}));
  EXPECT_FALSE(capture.containsPrefix("receivedUserInfo:"));
  EXPECT_EQ(backend->userInfoUpdates(), 2);
}

TEST_F(SessionConfigurationTest, RefusedFetchStatesRepliesNothing) {
  SessionTestHarness h(env);
  h.delegate()->setLimitReached(true);
  int replies = 0;
  h.run([&] {
    h.session()->fetchStatesWithUserInfo(userInfoMap("c", "s"), [&](std::optional<Array> states,
                                                                     std::optional<Array> whitelist,
                                                                     std::optional<Array> blacklist) {
      ++replies;
      EXPECT_FALSE(states);
      EXPECT_FALSE(whitelist);
      EXPECT_FALSE(blacklist);
    });
  });
  EXPECT_EQ(replies, 1);
  EXPECT_FALSE(capture.containsPrefix("fetchStatesWithUserInfo: Fetching states"));
  EXPECT_TRUE(h.session()->userInfo().isNull());
  // The session refused itself: the client sees its connection end.
  EXPECT_TRUE(h.client().waitUntilDisconnected());
}

TEST_F(SessionConfigurationTest, DisplayURLPrefersSplunkThenBrindleThenDashboard) {
  auto splunkWithout = addBackend("a-splunk");
  auto splunkWith = addBackend("b-splunk");
  auto brindle = addBackend("brindle");
  auto dashboard = std::make_shared<FakeBackend>("dashboard", BackendKind::Dashboard);
  env.backends->add(dashboard);
  brindle->setDisplayURLValue(std::string("https://brindle.example"));
  dashboard->setDisplayURLValue(std::string("udp://dashboard.example"));
  SessionTestHarness h(env);

  auto url = [&] {
    auto reply = h.client().call(ipc::Operation::FetchDisplayURL, {});
    return reply ? (*reply)[0] : Value("no reply");
  };
  EXPECT_EQ(url(), Value("URL not available"));
  EXPECT_TRUE(capture.contains("fetchDisplayURL: Fetching display URL for session 0"));

  h.delegate()->setStorebag(Value::dictionary());
  ASSERT_TRUE(h.client().call(ipc::Operation::StartConfig, {}));
  EXPECT_EQ(url(), Value("https://brindle.example"));
  splunkWith->setDisplayURLValue(std::string("https://splunk.example"));
  EXPECT_EQ(url(), Value("https://splunk.example"));
  splunkWith->setDisplayURLValue(std::nullopt);
  brindle->setDisplayURLValue(std::nullopt);
  EXPECT_EQ(url(), Value("udp://dashboard.example"));
  dashboard->setDisplayURLValue(std::nullopt);
  EXPECT_EQ(url(), Value("URL not available"));
}

}  // namespace
