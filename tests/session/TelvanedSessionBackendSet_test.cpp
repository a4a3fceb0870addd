#include <gtest/gtest.h>

#include <algorithm>

#include "platform/Log.h"
#include "session/TelvanedSession.h"
#include "support/FakeConnectivityHelper.h"
#include "support/SessionTestHarness.h"

using namespace telvane;
using namespace telvane::test;

namespace {

Value userInfoMap(const std::string& client, const std::string& service) {
  return Value(Dictionary{{"_clientName", Value(client)}, {"_serviceName", Value(service)}});
}

std::vector<std::int64_t> integers(const std::optional<Array>& list) {
  std::vector<std::int64_t> out;
  if (list) {
    for (const auto& v : *list) out.push_back(v.integerValue());
  }
  std::sort(out.begin(), out.end());
  return out;
}

class BackendSetTest : public SessionTest {
 protected:
  // Builds the backends from the section and brings their states up to date.
  void build(SessionTestHarness& h, const Value& section = Value::dictionary()) {
    h.run([&] {
      h.session()->createBackendsWithStorebag(section);
      h.session()->updateReportingStates();
    });
  }
};

TEST_F(BackendSetTest, CreationLogsStampsTheIdentifierAndDefaultsTheReleaseTimeout) {
  auto backend = addBackend("a");
  SessionTestHarness h(env);
  h.run([&] { h.session()->createBackendsWithStorebag(Value::dictionary()); });
  EXPECT_TRUE(capture.contains("createBackendsWithStorebag: Creating backends for session 0"));
  EXPECT_EQ(h.session()->connectivityHelperReleaseTimeout(), 30u);
  EXPECT_EQ(backend->combinedSessionIDString(), h.session()->sessionIDString());
  EXPECT_EQ(backend->connectivityDelegateSets(), 1);
}

TEST_F(BackendSetTest, ReleaseTimeoutOfTheSectionActivatesTheHelper) {
  addBackend("a-splunk");
  auto helper = std::make_shared<FakeConnectivityHelper>();
  SessionTestHarness h(env);
  h.delegate()->setHelper(helper);
  h.delegate()->setStorebag(Value(Dictionary{{"release_timeout", Value(45)}}));
  h.client().send(ipc::Operation::SetSessionInfo,
                  Array{sessionInfoMap(9, 4), userInfoMap("c", "s"), Value::array(), Value(false)});
  ASSERT_TRUE(h.client().call(ipc::Operation::StartConfig, {}));
  EXPECT_EQ(h.session()->connectivityHelperReleaseTimeout(), 45u);
  EXPECT_EQ(helper->releaseTimeouts(), std::vector<std::uint32_t>{30});
  EXPECT_EQ(helper->activations(), std::vector<std::uint32_t>{45});
  EXPECT_TRUE(capture.contains("activate: activating connectivity helper for WebSession with ID <inactive>"));
}

TEST_F(BackendSetTest, WithoutReleaseTimeoutTheHelperIsActivatedForThirtySeconds) {
  addBackend("a-splunk");
  auto helper = std::make_shared<FakeConnectivityHelper>();
  SessionTestHarness h(env);
  h.delegate()->setHelper(helper);
  h.delegate()->setStorebag(Value::dictionary());
  h.client().send(ipc::Operation::SetSessionInfo,
                  Array{sessionInfoMap(9, 4), userInfoMap("c", "s"), Value::array(), Value(false)});
  ASSERT_TRUE(h.client().call(ipc::Operation::StartConfig, {}));
  EXPECT_EQ(helper->activations(), std::vector<std::uint32_t>{30});
}

TEST_F(BackendSetTest, NoActiveBackendMeansNoActivation) {
  auto backend = addBackend("a-splunk");
  backend->setUpdateStateResult(kBackendStateDisabled);
  auto helper = std::make_shared<FakeConnectivityHelper>();
  SessionTestHarness h(env);
  h.delegate()->setHelper(helper);
  h.delegate()->setStorebag(Value::dictionary());
  h.client().send(ipc::Operation::SetSessionInfo,
                  Array{sessionInfoMap(9, 4), userInfoMap("c", "s"), Value::array(), Value(false)});
  auto reply = h.client().call(ipc::Operation::StartConfig, {});
  ASSERT_TRUE(reply);
  EXPECT_TRUE(helper->activations().empty());
  EXPECT_EQ((*reply)[0], Value(Array{}));
  EXPECT_EQ(backend->connectivityDelegate(), helper);
}

TEST_F(BackendSetTest, EmptySectionGivesEmptyStatesAndNoLists) {
  SessionTestHarness h(env);
  build(h);
  EXPECT_EQ(h.session()->fetchReportingStates(), Array{});
  EXPECT_FALSE(h.session()->fetchWhitelistedEvents());
  EXPECT_FALSE(h.session()->fetchBlacklistedEvents());
}

TEST_F(BackendSetTest, StatesListTheEnabledBackends) {
  auto a = addBackend("a");
  auto b = addBackend("b");
  auto c = addBackend("c");
  b->setUpdateStateResult(kBackendStateDeferred);
  SessionTestHarness h(env);
  EXPECT_FALSE(h.session()->fetchReportingStates());
  build(h);
  EXPECT_EQ(h.session()->fetchReportingStates(), (Array{Value("a"), Value("c")}));
}

TEST_F(BackendSetTest, WhitelistsOfActiveHTTPSBackendsAreJoined) {
  auto a = addBackend("a");
  auto b = addBackend("b");
  a->setWhitelist(Array{Value(1), Value(2)});
  b->setWhitelist(Array{Value(2), Value(3)});
  SessionTestHarness h(env);
  build(h);
  EXPECT_EQ(integers(h.session()->fetchWhitelistedEvents()), (std::vector<std::int64_t>{1, 2, 3}));
}

TEST_F(BackendSetTest, ActiveHTTPSBackendWithoutWhitelistAllowsEverything) {
  auto a = addBackend("a");
  auto b = addBackend("b");
  a->setWhitelist(Array{Value(1)});
  SessionTestHarness h(env);
  build(h);
  EXPECT_FALSE(h.session()->fetchWhitelistedEvents());

  // An inactive one, or one of another class, does not.
  b->setState(kBackendStateDisabled);
  EXPECT_EQ(integers(h.session()->fetchWhitelistedEvents()), (std::vector<std::int64_t>{1}));
}

TEST_F(BackendSetTest, OtherClassesWithoutWhitelistDoNotOpenEverything) {
  auto a = addBackend("a");
  auto dashboard = addBackend("dashboard", BackendKind::Dashboard);
  a->setWhitelist(Array{Value(8)});
  dashboard->setWhitelist(Array{Value(9)});
  auto upload = addBackend("upload_server", BackendKind::Upload);
  SessionTestHarness h(env);
  build(h);
  EXPECT_EQ(integers(h.session()->fetchWhitelistedEvents()), (std::vector<std::int64_t>{8, 9}));
}

TEST_F(BackendSetTest, BlacklistsOfHTTPSBackendsAreIntersected) {
  auto a = addBackend("a");
  auto b = addBackend("b");
  auto dashboard = addBackend("dashboard", BackendKind::Dashboard);
  a->setBlacklist(Array{Value(4), Value(5)});
  b->setBlacklist(Array{Value(5), Value(6)});
  b->setUpdateStateResult(kBackendStateDisabled);  // any state counts
  dashboard->setBlacklist(Array{Value(7)});
  SessionTestHarness h(env);
  build(h);
  EXPECT_EQ(integers(h.session()->fetchBlacklistedEvents()), (std::vector<std::int64_t>{5}));
}

TEST_F(BackendSetTest, NoHTTPSBlacklistGivesNone) {
  auto a = addBackend("a");
  auto dashboard = addBackend("dashboard", BackendKind::Dashboard);
  dashboard->setBlacklist(Array{Value(7)});
  SessionTestHarness h(env);
  build(h);
  EXPECT_FALSE(h.session()->fetchBlacklistedEvents());
}

TEST_F(BackendSetTest, DigestGoesToQuarlOnlyAndTheAlgorithmIsNotKept) {
  auto quarl = addBackend("quarl");
  auto other = addBackend("a-splunk");
  SessionTestHarness h(env);
  build(h);
  h.client().send(ipc::Operation::SetDigestKey, {Value(Bytes{1, 2, 3}), Value(5)});
  ASSERT_TRUE(h.client().call(ipc::Operation::FetchDisplayURL, {}));
  EXPECT_EQ(quarl->digestKey(), (Bytes{1, 2, 3}));
  EXPECT_EQ(quarl->digestAlgorithm(), 5);
  EXPECT_FALSE(other->digestKey());

  // A user-info change hands the backend the stored algorithm, which stayed 0.
  ASSERT_TRUE(h.client().call(ipc::Operation::FetchStates, {userInfoMap("c", "s")}));
  EXPECT_EQ(quarl->digestKey(), (Bytes{1, 2, 3}));
  EXPECT_EQ(quarl->digestAlgorithm(), 0);
  EXPECT_FALSE(other->digestKey());
  EXPECT_EQ(other->userInfoDict()["_clientName"].stringOrEmpty(), "c");
}

TEST_F(BackendSetTest, AnEmptyDigestKeyIsPresentAndNilClearsIt) {
  auto quarl = addBackend("quarl");
  SessionTestHarness h(env);
  build(h);
  h.client().send(ipc::Operation::SetDigestKey, {Value(Bytes{}), Value(0)});
  ASSERT_TRUE(h.client().call(ipc::Operation::FetchDisplayURL, {}));
  EXPECT_EQ(quarl->digestKey(), std::optional<Bytes>(Bytes{}));
  // Kept through a user-info change, as any key.
  ASSERT_TRUE(h.client().call(ipc::Operation::FetchStates, {userInfoMap("c", "s")}));
  EXPECT_EQ(quarl->digestKey(), std::optional<Bytes>(Bytes{}));

  h.client().send(ipc::Operation::SetDigestKey, {Value(), Value(0)});
  ASSERT_TRUE(h.client().call(ipc::Operation::FetchDisplayURL, {}));
  EXPECT_FALSE(quarl->digestKey().has_value());
}

TEST_F(BackendSetTest, CombinedIdentifierJoinsTheParentChain) {
  auto backend = addBackend("a");
  SessionTestHarness h(env);
  build(h);
  h.run([&] { h.session()->updateCombinedSessionID(); });
  EXPECT_FALSE(backend->correlatedSessionID());
  EXPECT_FALSE(capture.containsPrefix("updateCombinedSessionID:"));

  h.delegate()->setParentIDString(std::string("A.B"));
  h.session()->updateCombinedSessionID();
  std::string combined = "A.B." + h.session()->sessionIDString();
  EXPECT_EQ(backend->correlatedSessionID(), combined);
  EXPECT_TRUE(capture.contains("updateCombinedSessionID: Updating combined session ID '" + combined +
                               "' for session 0 backends"));
}

class SyncReportingStatesTest : public BackendSetTest {
 protected:
  // A parent session with backends "a" (state 2, threshold 0.25) and "b" (state 1).
  void SetUp() override {
    parentA = std::make_shared<FakeBackend>("a");
    parentB = std::make_shared<FakeBackend>("b");
    parentEnv.backends->add(parentA);
    parentEnv.backends->add(parentB);
    parent = std::make_unique<SessionTestHarness>(parentEnv);
    build(*parent);
    parentA->setSamplingThreshold(0.25);
    parentB->setState(kBackendStateDisabled);
  }
  void TearDown() override { parent.reset(); }

  TestEnvironment parentEnv;
  std::shared_ptr<FakeBackend> parentA, parentB;
  std::unique_ptr<SessionTestHarness> parent;
};

TEST_F(SyncReportingStatesTest, ChildTakesItsParentsStatesExceptWhenDeferred) {
  auto childA = addBackend("a");
  auto childB = addBackend("b");
  auto childC = addBackend("c");
  childB->setUpdateStateResult(kBackendStateDeferred);
  SessionTestHarness child(env);
  build(child);
  child.delegate()->setParent(parent->session());
  child.session()->syncReportingStates();

  EXPECT_EQ(childA->state(), kBackendStateEnabled);
  EXPECT_EQ(childA->samplingThreshold(), 0.25);
  EXPECT_TRUE(capture.contains("HTTPSPostBackend(syncReportingStates): a: state and sampling rate updated to 2, 0.25%"));
  // A deferred child keeps state 3 although its parent's backend is in state 1.
  EXPECT_EQ(childB->state(), kBackendStateDeferred);
  EXPECT_EQ(childC->state(), kBackendStateEnabled);
  EXPECT_TRUE(capture.contains("HTTPSPostBackend(syncReportingStates): Parent session  does not have backend c. "
                               "Current state '2' kept for child session"));
}

TEST_F(SyncReportingStatesTest, DeferredChildKeepsStateThreeUnderAnEnabledParent) {
  auto childA = addBackend("a");
  childA->setUpdateStateResult(kBackendStateDeferred);
  SessionTestHarness child(env);
  build(child);
  child.delegate()->setParent(parent->session());
  child.session()->syncReportingStates();
  EXPECT_EQ(parentA->state(), kBackendStateEnabled);
  EXPECT_EQ(childA->state(), kBackendStateDeferred);
  EXPECT_FALSE(childA->samplingThreshold());
}

TEST_F(SyncReportingStatesTest, ChildWithoutParentLogsPerBackend) {
  auto childA = addBackend("a");
  SessionTestHarness child(env);
  child.client().send(ipc::Operation::SetSessionInfo,
                      Array{sessionInfoMap(9, 8, {{"HierarchyToken", hierarchyToken("T", 1)}}), Value(),
                            Value::array(), Value(false)});
  ASSERT_TRUE(child.client().call(ipc::Operation::FetchDisplayURL, {}));
  build(child);
  child.session()->syncReportingStates();
  EXPECT_TRUE(capture.contains("syncReportingStates: child session 8 (backend a) with hierarchy 1 is missing its parent"));
  EXPECT_EQ(childA->state(), kBackendStateEnabled);
}

}  // namespace
