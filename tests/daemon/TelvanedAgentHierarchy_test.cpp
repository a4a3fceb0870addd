#include <gtest/gtest.h>

#include <future>

#include "daemon/TelvanedAgent.h"
#include "platform/Log.h"
#include "support/AgentTestHarness.h"

using namespace telvane;
using namespace telvane::test;

namespace {

// Holds a session's queue while it lives, so that the session's teardown (which drops
// its hierarchy map) waits.
class HeldQueue {
 public:
  explicit HeldQueue(const std::shared_ptr<TelvanedSession>& session) {
    auto released = release_.get_future().share();
    session->queue()->async([released] { released.wait(); });
  }
  ~HeldQueue() { release_.set_value(); }

 private:
  std::promise<void> release_;
};

class HierarchyTest : public ::testing::Test {
 protected:
  // A session of the token at the level, with the given session ID.
  AgentTestHarness::Opened member(const std::string& token, long level, unsigned sessionID, bool aggregator = false) {
    return h.openWithInfo(sessionInfoMap(6, sessionID, {{"HierarchyToken", hierarchyToken(token, level)}}),
                          aggregator);
  }
  std::optional<std::string> chain(const AgentTestHarness::Opened& opened) {
    return h.agent->parentSessionIDStringForSession(opened.session);
  }

  log::LogCapture capture;
  AgentTestHarness h;
};

TEST_F(HierarchyTest, StandaloneSessionHasNoCorrelationAndSharesNothing) {
  auto opened = h.openWithInfo(sessionInfoMap(6, 1));
  EXPECT_TRUE(capture.contains(
      "updateCorrelatedSessions: Session 1 has no correlated sessions as it is a standalone session"));
  opened.client->send(ipc::Operation::UpdateSharedDataForKey, {Value("k"), Value("v")});
  opened.client->send(ipc::Operation::UpdateSharedDataWithDictionary, {Value(Dictionary{{"a", Value(1)}})});
  ASSERT_TRUE(opened.client->call(ipc::Operation::FetchDisplayURL, {}));
  std::lock_guard<std::recursive_mutex> lock(h.agent->agentLock());
  EXPECT_FALSE(h.agent->sharedDataForSession(opened.session));
  EXPECT_FALSE(h.agent->parentSessionIDStringForSession(opened.session));
}

TEST_F(HierarchyTest, SessionsAreFiledInOrderAndMoveWithTheirToken) {
  auto root = member("T", 0, 1);
  auto child = member("T", 1, 2);
  EXPECT_TRUE(capture.contains("updateCorrelatedSessions: Adding session 1 to list for hierarchyToken T with "
                               "hierarchyLevel 0"));
  EXPECT_EQ(h.agent->correlatedSessions("T"),
            (std::vector<std::shared_ptr<TelvanedSession>>{root.session, child.session}));

  // The one-shot send files the session under its new token; the old list stays.
  auto reply = child.client->call(
      ipc::Operation::SendMessageWithSessionInfo,
      {sessionInfoMap(6, 2, {{"HierarchyToken", hierarchyToken("U", 0)}}), Value(), Value(1), Value(2), Value()});
  ASSERT_TRUE(reply);
  EXPECT_EQ((*reply)[0], Value("storebag not available"));
  EXPECT_EQ(h.agent->correlatedSessions("T"), std::vector<std::shared_ptr<TelvanedSession>>{root.session});
  EXPECT_EQ(h.agent->correlatedSessions("U"), std::vector<std::shared_ptr<TelvanedSession>>{child.session});
}

TEST_F(HierarchyTest, ChainOfALevelTwoSessionIsRootThenParent) {
  auto root = member("T", 0, 1);
  auto parent = member("T", 1, 2);
  auto child = member("T", 2, 3);
  EXPECT_EQ(chain(child), root.session->sessionIDString() + "." + parent.session->sessionIDString());
  EXPECT_TRUE(capture.contains("parentSessionIDStringForSession: Checking hierarchyToken 'T' for session 3"));
  EXPECT_FALSE(chain(root));
}

TEST_F(HierarchyTest, GapAtTheDirectParentGivesNoChain) {
  auto root = member("T", 0, 1);
  auto parent = member("T", 1, 2);
  auto child = member("T", 2, 3);
  ASSERT_TRUE(h.close(parent));
  EXPECT_FALSE(chain(child));
  EXPECT_TRUE(capture.contains("parentSessionIDStringForSession: Found a gap in hierarchy (one of parents missing): "
                               "incomplete parentSessionID is '(null)'"));
}

TEST_F(HierarchyTest, GapHigherUpKeepsWhatWasBuilt) {
  auto root = member("T", 0, 1);
  auto levelTwo = member("T", 2, 3);
  auto levelThree = member("T", 3, 4);
  std::string id = levelTwo.session->sessionIDString();
  EXPECT_EQ(chain(levelThree), id);
  EXPECT_TRUE(capture.contains("parentSessionIDStringForSession: Found a gap in hierarchy (one of parents missing): "
                               "incomplete parentSessionID is '" +
                               id + "'"));
}

TEST_F(HierarchyTest, FirstOfTwoLevelOneSessionsIsTheParent) {
  auto root = member("T", 0, 1);
  auto first = member("T", 1, 2);
  auto second = member("T", 1, 3);
  auto child = member("T", 2, 4);
  std::lock_guard<std::recursive_mutex> lock(h.agent->agentLock());
  EXPECT_EQ(h.agent->parentSessionForChild(child.session), first.session);
  EXPECT_EQ(chain(child), root.session->sessionIDString() + "." + first.session->sessionIDString());
  EXPECT_TRUE(capture.contains("parentSessionForChild: Checking hierarchyToken 'T' for session 4"));
}

TEST_F(HierarchyTest, ParentLookupFailuresAreLogged) {
  auto child = member("T", 2, 4);
  {
    std::lock_guard<std::recursive_mutex> lock(h.agent->agentLock());
    EXPECT_FALSE(h.agent->parentSessionForChild(child.session));
  }
  EXPECT_TRUE(capture.contains("parentSessionForChild: Unable to find session with hierarchy of 1 for hierarchyToken 'T'"));

  HeldQueue held(child.session);
  h.agent->invalidateReportingSession(child.session);
  ASSERT_TRUE(h.agent->hasCorrelationList("T"));
  std::lock_guard<std::recursive_mutex> lock(h.agent->agentLock());
  EXPECT_FALSE(h.agent->parentSessionForChild(child.session));
  EXPECT_TRUE(capture.contains(log::Level::Error, "parentSessionForChild: ERROR: No sessions found for hierarchyToken T"));
  EXPECT_FALSE(h.agent->parentSessionIDStringForSession(child.session));
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "parentSessionIDStringForSession: ERROR: No sessions found for hierarchyToken T"));
}

TEST_F(HierarchyTest, SessionMissingFromItsListIsLogged) {
  auto other = member("T", 0, 1);
  auto child = member("T", 2, 4);
  HeldQueue held(child.session);
  h.agent->invalidateReportingSession(child.session);
  std::lock_guard<std::recursive_mutex> lock(h.agent->agentLock());
  EXPECT_FALSE(h.agent->parentSessionForChild(child.session));
  EXPECT_TRUE(capture.contains(log::Level::Error, "parentSessionForChild: ERROR: Session 4 not found for hierarchyToken T"));
  EXPECT_FALSE(h.agent->parentSessionIDStringForSession(child.session));
  EXPECT_TRUE(capture.contains("parentSessionIDStringForSession: Session 4 not found for hierarchyToken T"));
}

TEST_F(HierarchyTest, TopmostAggregatingAncestorWins) {
  auto root = member("T", 0, 1, /*aggregator=*/true);
  auto parent = member("T", 1, 2, /*aggregator=*/true);
  auto child = member("T", 2, 3);
  std::lock_guard<std::recursive_mutex> lock(h.agent->agentLock());
  EXPECT_EQ(h.agent->getAncestorWithAggregatorForSession(child.session), root.session);
  EXPECT_EQ(h.agent->getAncestorWithAggregatorForSession(parent.session), root.session);
  EXPECT_FALSE(h.agent->getAncestorWithAggregatorForSession(root.session));
}

TEST_F(HierarchyTest, ChildEventsReachTheAggregatingRootsClient) {
  auto root = member("T", 0, 1, /*aggregator=*/true);
  auto child = member("T", 1, 2);
  AgentTestHarness::buildBackends(child.session);
  ASSERT_TRUE(child.client->call(ipc::Operation::SendMessageWithDictionary,
                                 {Value(Dictionary{{"ParametersCategory", Value(4)}, {"ParametersType", Value(5)}})}));
  ASSERT_TRUE(root.client->waitForAggregatedMessages(1));
  auto message = root.client->aggregatedMessages()[0];
  EXPECT_EQ(message[0]["SessionID"].integerValue(), 2);
  EXPECT_EQ(message[2].integerValue(), 4);
  EXPECT_EQ(message[3].integerValue(), 5);
}

TEST_F(HierarchyTest, OnlyTheTopmostAggregatorOfATreeKeepsAggregating) {
  auto root = member("T", 0, 1, /*aggregator=*/true);
  auto parent = member("T", 1, 2);
  auto child = member("T", 2, 3, /*aggregator=*/true);
  capture.clear();
  h.agent->updateDownstreamSessions(root.session);
  EXPECT_TRUE(root.session->hasAggregator());
  EXPECT_FALSE(child.session->hasAggregator());
  EXPECT_TRUE(capture.contains("shutdownSessionAggregation: Disable aggregation module for session 3"));
  EXPECT_FALSE(capture.contains("shutdownSessionAggregation: Disable aggregation module for session 1"));
  EXPECT_TRUE(capture.contains(
      "updateDownstreamSessions: Updating combined session ID and syncing reporting states for session 2"));
  EXPECT_TRUE(capture.contains(
      "updateDownstreamSessions: Updating combined session ID and syncing reporting states for session 3"));
  ASSERT_TRUE(child.client->waitForAggregatedMessages(1));
  EXPECT_EQ(child.client->aggregatedMessages()[0], (Array{Value(), Value(0.0), Value(0), Value(0), Value()}));
}

TEST_F(HierarchyTest, SessionUnderAnAggregatingAncestorStopsItsOwnAggregation) {
  auto root = member("T", 0, 1, /*aggregator=*/true);
  auto child = member("T", 1, 2, /*aggregator=*/true);
  h.agent->updateDownstreamSessions(child.session);
  EXPECT_FALSE(child.session->hasAggregator());
  EXPECT_TRUE(root.session->hasAggregator());
}

TEST_F(HierarchyTest, DownstreamUpdateStampsChainsAndSyncsStates) {
  auto root = member("T", 0, 1);
  auto child = member("T", 1, 2);
  auto grandchild = member("T", 2, 3);
  for (const auto& opened : {root, child, grandchild}) AgentTestHarness::buildBackends(opened.session);
  AgentTestHarness::backend(root.session, "a")->setState(kBackendStateDisabled);
  AgentTestHarness::backend(root.session, "a")->setSamplingThreshold(0.5);
  AgentTestHarness::backend(grandchild.session, "a")->setState(kBackendStateDeferred);

  h.agent->updateDownstreamSessions(root.session);
  // A root never gets a combined identifier.
  EXPECT_FALSE(AgentTestHarness::backend(root.session, "a")->correlatedSessionID());
  std::string rootID = root.session->sessionIDString();
  std::string childID = child.session->sessionIDString();
  EXPECT_EQ(AgentTestHarness::backend(child.session, "a")->correlatedSessionID(), rootID + "." + childID);
  EXPECT_EQ(AgentTestHarness::backend(grandchild.session, "a")->correlatedSessionID(),
            rootID + "." + childID + "." + grandchild.session->sessionIDString());
  EXPECT_EQ(AgentTestHarness::backend(child.session, "a")->state(), kBackendStateDisabled);
  EXPECT_EQ(AgentTestHarness::backend(child.session, "a")->samplingThreshold(), 0.5);
  EXPECT_TRUE(capture.contains("HTTPSPostBackend(syncReportingStates): a: state and sampling rate updated to 1, 0.50%"));
  // A deferred child keeps its state whatever its parent's.
  EXPECT_EQ(AgentTestHarness::backend(grandchild.session, "a")->state(), kBackendStateDeferred);
}

TEST_F(HierarchyTest, SharedDataIsSharedByTheTokenAndAValuelessKeyRemoves) {
  auto root = member("T", 0, 1);
  auto child = member("T", 1, 2);
  AgentTestHarness::buildBackends(child.session);
  root.client->send(ipc::Operation::UpdateSharedDataWithDictionary,
                    {Value(Dictionary{{"a", Value(1)}, {"b", Value(2)}})});
  root.client->send(ipc::Operation::UpdateSharedDataForKey, {Value("b"), Value()});
  root.client->send(ipc::Operation::UpdateSharedDataForKey, {Value("c"), Value("three")});
  ASSERT_TRUE(root.client->call(ipc::Operation::FetchDisplayURL, {}));
  EXPECT_EQ(h.agent->sharedDataForToken("T"), Value(Dictionary{{"a", Value(1)}, {"c", Value("three")}}));

  ASSERT_TRUE(child.client->call(ipc::Operation::SendMessageWithDictionary,
                                 {Value(Dictionary{{"ParametersCategory", Value(1)}, {"ParametersType", Value(2)}})}));
  auto sent = AgentTestHarness::backend(child.session, "a")->sent();
  ASSERT_EQ(sent.size(), 1u);
  EXPECT_EQ(sent[0].blob["SharedData"], Value(Dictionary{{"a", Value(1)}, {"c", Value("three")}}));
}

TEST_F(HierarchyTest, SharedDataChangesLogTheTokensKeyCount) {
  auto root = member("T", 0, 1);
  auto standalone = h.openWithInfo(sessionInfoMap(6, 2));
  // A removal before the token has a map touches nothing.
  root.client->send(ipc::Operation::UpdateSharedDataForKey, {Value("a"), Value()});
  root.client->send(ipc::Operation::UpdateSharedDataWithDictionary,
                    {Value(Dictionary{{"a", Value(1)}, {"b", Value(2)}})});
  root.client->send(ipc::Operation::UpdateSharedDataForKey, {Value("a"), Value()});
  ASSERT_TRUE(root.client->call(ipc::Operation::FetchDisplayURL, {}));
  standalone.client->send(ipc::Operation::UpdateSharedDataForKey, {Value("k"), Value("v")});
  standalone.client->send(ipc::Operation::UpdateSharedDataForKey, {Value("k"), Value()});
  ASSERT_TRUE(standalone.client->call(ipc::Operation::FetchDisplayURL, {}));
  std::vector<std::string> shared;
  for (const auto& line : capture.lines()) {
    if (line.text.find("SharedDataForSession: ") == std::string::npos) continue;
    EXPECT_EQ(line.level, log::Level::Debug) << line.text;
    shared.push_back(line.text);
  }
  EXPECT_EQ(shared, (std::vector<std::string>{
                        "updateSharedDataForSession: hierarchyToken T now shares 2 keys",
                        "removeObjectFromSharedDataForSession: hierarchyToken T now shares 1 keys",
                    }));
}

TEST_F(HierarchyTest, TokenListAndSharedDataOutliveTheirSessions) {
  auto root = member("T", 0, 1);
  auto child = member("T", 1, 2);
  root.client->send(ipc::Operation::UpdateSharedDataForKey, {Value("k"), Value("v")});
  ASSERT_TRUE(root.client->call(ipc::Operation::FetchDisplayURL, {}));
  ASSERT_TRUE(h.close(root));
  ASSERT_TRUE(h.close(child));
  EXPECT_EQ(h.agent->sessionCount(), 0u);
  EXPECT_TRUE(h.agent->hasCorrelationList("T"));
  EXPECT_TRUE(h.agent->correlatedSessions("T").empty());
  EXPECT_EQ(h.agent->sharedDataForToken("T"), Value(Dictionary{{"k", Value("v")}}));
}

}  // namespace
