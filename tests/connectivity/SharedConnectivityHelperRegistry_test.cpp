// The agent's registry of shared connectivity helpers, with real sessions over real
// connections: sharing by user-info key, usage counting, the release period and the
// hand-back of the sessions' IPC transactions.
#include <gtest/gtest.h>

#include "connectivity/ReportingSessionConnectivityHelperImpl.h"
#include "daemon/TelvanedAgent.h"
#include "platform/Log.h"
#include "support/AgentTestHarness.h"
#include "support/WaitUntil.h"

namespace telvane {
namespace {

using test::AgentTestHarness;
using test::waitUntil;

Value sessionInfo() { return Value(Dictionary{{"ComponentType", Value(7)}, {"SessionID", Value(11)}}); }
Value userInfo(const char* client, const char* service) {
  return Value(Dictionary{{"_clientName", client}, {"_serviceName", service}});
}

TEST(SharedConnectivityHelperRegistry, SessionsOfOneClientShareOneHelper) {
  log::LogCapture capture;
  AgentTestHarness harness;
  auto first = harness.openWithInfo(sessionInfo(), false, userInfo("MediaKit", "Playback"));
  auto second = harness.openWithInfo(sessionInfo(), false, userInfo("mediakit", "PLAYBACK"));
  auto other = harness.openWithInfo(sessionInfo(), false, userInfo("MediaKit", "Capture"));
  ASSERT_TRUE(first.session && second.session && other.session);
  auto helper = harness.agent->sharedConnectivityHelperForKey("mediakit:playback");
  ASSERT_TRUE(helper);
  EXPECT_EQ(first.session->connectivityHelper(), helper);
  EXPECT_EQ(second.session->connectivityHelper(), helper);
  EXPECT_NE(other.session->connectivityHelper(), helper);
  EXPECT_EQ(helper->mode(), ReportingSessionConnectivityHelper::kPOSTRequestMode);
  EXPECT_EQ(helper->usageCount(), 2u);
  EXPECT_EQ(capture.count("requestSharedConnectivityHelperForReportingSession: Creating shared connectivity helper "
                          "for userInfoKey mediakit:playback"),
            1u);
  EXPECT_EQ(capture.count("requestSharedConnectivityHelperForReportingSession: Found existing shared connectivity "
                          "helper for userInfoKey mediakit:playback"),
            1u);
  EXPECT_EQ(capture.count("requestSharedConnectivityHelperForReportingSession: Incrementing usage of shared "
                          "connectivity helper for userInfoKey mediakit:playback"),
            2u);
  EXPECT_TRUE(capture.contains("requestSharedConnectivityHelperForReportingSession: Requesting shared connectivity "
                               "helper for userInfoKey mediakit:capture"));
}

TEST(SharedConnectivityHelperRegistry, UserInfoWithoutNamesGetsNoHelper) {
  AgentTestHarness harness;
  auto opened = harness.openWithInfo(sessionInfo(), false, Value(Dictionary{{"other", "x"}}));
  ASSERT_TRUE(opened.session);
  EXPECT_EQ(harness.agent->copySharedConnectivityHelperForReportingSession(opened.session, 4), nullptr);
  EXPECT_EQ(opened.session->connectivityHelper(), nullptr);
}

TEST(SharedConnectivityHelperRegistry, ExistingHelperKeepsItsModeWhenAskedForAnother) {
  AgentTestHarness harness;
  auto opened = harness.openWithInfo(sessionInfo(), false, userInfo("A", "B"));
  auto asGet = harness.agent->copySharedConnectivityHelperForReportingSession(
      opened.session, ReportingSessionConnectivityHelper::kGETRequestMode);
  auto helper = harness.agent->sharedConnectivityHelperForKey("a:b");
  ASSERT_TRUE(helper);
  EXPECT_EQ(asGet, helper);
  EXPECT_EQ(helper->mode(), ReportingSessionConnectivityHelper::kPOSTRequestMode);
}

TEST(SharedConnectivityHelperRegistry, SecondSessionDuringTheReleasePeriodGetsTheSameHelperAndStopsTheTimer) {
  log::LogCapture capture;
  AgentTestHarness harness;
  auto first = harness.openWithInfo(sessionInfo(), false, userInfo("A", "B"));
  auto helper = harness.agent->sharedConnectivityHelperForKey("a:b");
  ASSERT_TRUE(helper);
  ASSERT_TRUE(harness.close(first));
  // The session's teardown gave the helper back: its 30 s release period runs.
  ASSERT_TRUE(waitUntil([&] { return helper->hasReleaseTimer(); }));
  EXPECT_EQ(helper->usageCount(), 0u);
  EXPECT_EQ(helper->totalSessionsServedCount(), 1u);
  EXPECT_TRUE(capture.contains("releaseSharedConnectivityHelperForReportingSession: Releasing shared connectivity "
                               "helper for userInfoKey a:b"));
  EXPECT_TRUE(capture.contains("releaseSharedConnectivityHelperForReportingSession: Decrementing usage count of "
                               "shared connectivity helper for userInfoKey a:b"));
  // The served session's transaction is still held by the helper.
  EXPECT_EQ(harness.agent->ipcTransactionReference(), 1);

  auto second = harness.openWithInfo(sessionInfo(), false, userInfo("a", "b"));
  EXPECT_EQ(second.session->connectivityHelper(), helper);
  EXPECT_FALSE(helper->hasReleaseTimer());
  EXPECT_EQ(helper->usageCount(), 1u);
  EXPECT_EQ(harness.agent->sharedConnectivityHelperForKey("a:b"), helper);
}

TEST(SharedConnectivityHelperRegistry, ReleasedHelperIsInvalidatedAndHandsBackTheServedTransactions) {
  log::LogCapture capture;
  AgentTestHarness harness;
  auto first = harness.openWithInfo(sessionInfo(), false, userInfo("A", "B"));
  auto second = harness.openWithInfo(sessionInfo(), false, userInfo("A", "B"));
  auto helper = harness.agent->sharedConnectivityHelperForKey("a:b");
  ASSERT_TRUE(helper);
  helper->setReleaseTimeout(1);
  EXPECT_EQ(harness.agent->ipcTransactionReference(), 2);
  ASSERT_TRUE(harness.close(first));
  ASSERT_TRUE(harness.close(second));
  // Both sessions ended holding the helper; the timer (1 s) fires, the agent drops and
  // invalidates the helper, which gives both transactions back in one call.
  ASSERT_TRUE(waitUntil([&] { return harness.agent->ipcTransactionReference() == 0; }));
  EXPECT_EQ(harness.agent->sharedConnectivityHelperForKey("a:b"), nullptr);
  EXPECT_TRUE(capture.contains("releaseSharedConnectivityHelperForReportingSession: Usage count of shared "
                               "connectivity helper for userInfoKey a:b reached zero. Invalidating the helper"));
  EXPECT_TRUE(capture.contains("ReportingSessionConnectivityHelper:invalidate: release 2 IPC transactions for "
                               "inactive connectivity helper"));
  EXPECT_TRUE(capture.contains("releaseIPCTransactions: IPC transaction ref count is 0, decremented by 2"));
  EXPECT_TRUE(capture.contains("releaseIPCTransactions: IPC transaction ended"));
}

TEST(SharedConnectivityHelperRegistry, EverLastingHelperStaysInTheRegistry) {
  AgentTestHarness harness;
  auto first = harness.openWithInfo(sessionInfo(), false, userInfo("A", "B"));
  auto second = harness.openWithInfo(sessionInfo(), false, userInfo("X", "Y"));
  auto helper = harness.agent->sharedConnectivityHelperForKey("a:b");
  ASSERT_TRUE(helper);
  helper->setReleaseTimeout(0);
  ASSERT_TRUE(harness.close(first));
  // The helper hands the served transaction back at once and stays registered.
  ASSERT_TRUE(waitUntil([&] { return harness.agent->ipcTransactionReference() == 1; }));
  EXPECT_EQ(helper->totalSessionsServedCount(), 0u);
  EXPECT_FALSE(helper->hasReleaseTimer());
  harness.agent->stateQueue()->sync([] {});
  EXPECT_EQ(harness.agent->sharedConnectivityHelperForKey("a:b"), helper);
}

}  // namespace
}  // namespace telvane
