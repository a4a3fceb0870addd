#include "daemon/TelvanedAgent.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>
#include <future>
#include <thread>

#include "platform/Log.h"
#include "support/AgentTestHarness.h"
#include "support/TempDir.h"

using namespace telvane;
using namespace telvane::test;

namespace {

std::string peerDescription() { return "pid " + std::to_string(::getpid()) + " uid " + std::to_string(::getuid()); }

class TelvanedAgentTest : public ::testing::Test {
 protected:
  log::LogCapture capture;
  AgentTestHarness h;
};

TEST_F(TelvanedAgentTest, ConnectionWithoutTheEntitlementIsRefused) {
  for (std::optional<bool> value : {std::optional<bool>(), std::optional<bool>(false)}) {
    capture.clear();
    h.setEntitlement(value);
    auto opened = h.open();
    EXPECT_FALSE(opened.session);
    EXPECT_TRUE(opened.client->waitUntilDisconnected());
    // The caller is told why before the connection closes.
    EXPECT_EQ(opened.client->connection()->peerRefusal(),
              std::optional<std::string>("missing the entitlement com.zembra.private.telvaned"));
    EXPECT_EQ(h.agent->sessionCount(), 0u);
    EXPECT_EQ(h.agent->ipcTransactionReference(), 0);
    EXPECT_TRUE(capture.contains("listener: new IPC connection " + peerDescription() +
                                 " does not have required telvane entitlement. Closing connection..."));
    EXPECT_FALSE(capture.containsPrefix("initWithSessionDelegate:"));
  }
  EXPECT_TRUE(h.keepAlive->events().empty());
  EXPECT_EQ(h.lookedUpEntitlements(),
            (std::vector<std::string>{"com.zembra.private.telvaned", "com.zembra.private.telvaned"}));
}

TEST_F(TelvanedAgentTest, TwoSessionsBeginOneTransactionAndCountTwo) {
  auto first = h.open();
  ASSERT_TRUE(first.session);
  EXPECT_EQ(h.agent->ipcTransactionReference(), 1);
  EXPECT_EQ(h.keepAlive->events(), std::vector<std::string>{"begin"});
  EXPECT_TRUE(capture.contains("listener: Accepting new IPC connection " + peerDescription() +
                               " as it has proper entitlement, 0(0) connections."));
  EXPECT_TRUE(capture.contains("createReportingSessionWithDelegate: IPC transaction started with session " +
                               first.session->description()));
  EXPECT_TRUE(capture.contains("createReportingSessionWithDelegate: retained IPC Transaction. Ref count is 1"));

  auto second = h.open();
  ASSERT_TRUE(second.session);
  EXPECT_EQ(h.agent->ipcTransactionReference(), 2);
  EXPECT_EQ(h.keepAlive->events(), std::vector<std::string>{"begin"});
  EXPECT_EQ(capture.count("createReportingSessionWithDelegate: IPC transaction started with session " +
                          second.session->description()),
            0u);
  EXPECT_TRUE(capture.contains("listener: Accepting new IPC connection " + peerDescription() +
                               " as it has proper entitlement, 1(0) connections."));
  EXPECT_TRUE(capture.contains("createReportingSessionWithDelegate: retained IPC Transaction. Ref count is 2"));
  EXPECT_EQ(h.agent->copyReportingAgentState().sessionList,
            (std::vector<std::shared_ptr<TelvanedSession>>{first.session, second.session}));
}

TEST_F(TelvanedAgentTest, ClosedSessionsAreRemovedAndTheTransactionEnds) {
  auto first = h.openWithInfo(sessionInfoMap(6, 11));
  auto second = h.openWithInfo(sessionInfoMap(6, 12));
  std::string description = first.session->description();
  ASSERT_TRUE(h.close(first));
  EXPECT_TRUE(capture.contains("listener: IPC connection to " + description + " was invalidated"));
  EXPECT_TRUE(capture.contains("invalidateReportingSession: TelvanedSession " + description + " was invalidated"));
  EXPECT_TRUE(capture.contains(log::Level::Debug,
                               "invalidateReportingSession: active session count for clientType 6 got decremented to 1"));
  EXPECT_TRUE(capture.contains("releaseIPCTransactions: IPC transaction ref count is 1, decremented by 1"));
  EXPECT_EQ(h.agent->sessionCount(), 1u);
  EXPECT_EQ(h.agent->activeClientCount(6), 1);
  EXPECT_EQ(h.keepAlive->events(), std::vector<std::string>{"begin"});

  ASSERT_TRUE(h.close(second));
  EXPECT_EQ(h.agent->ipcTransactionReference(), 0);
  EXPECT_EQ(h.agent->activeClientCount(6), 0);
  EXPECT_TRUE(capture.contains("releaseIPCTransactions: IPC transaction ref count is 0, decremented by 1"));
  EXPECT_TRUE(capture.contains("releaseIPCTransactions: IPC transaction ended"));
  EXPECT_EQ(h.keepAlive->events(), (std::vector<std::string>{"begin", "end"}));

  // A new session begins a new transaction.
  h.open();
  EXPECT_EQ(h.keepAlive->events(), (std::vector<std::string>{"begin", "end", "begin"}));
}

TEST_F(TelvanedAgentTest, InterruptionIsOnlyLogged) {
  auto opened = h.openWithInfo(sessionInfoMap(6, 11));
  // The daemon side never reports interruptions by itself; its handler only logs.
  EXPECT_EQ(h.agent->sessionCount(), 1u);
  EXPECT_FALSE(capture.containsPrefix("listener: IPC connection to"));
}

TEST_F(TelvanedAgentTest, ReleaseAtZeroDoesNothing) {
  h.agent->releaseIPCTransactions(1);
  EXPECT_EQ(h.agent->ipcTransactionReference(), 0);
  EXPECT_FALSE(capture.containsPrefix("releaseIPCTransactions:"));
  EXPECT_TRUE(h.keepAlive->events().empty());
}

TEST_F(TelvanedAgentTest, ReleaseIsNotClamped) {
  h.open();
  h.agent->releaseIPCTransactions(3);
  EXPECT_EQ(h.agent->ipcTransactionReference(), -2);
  EXPECT_TRUE(capture.contains("releaseIPCTransactions: IPC transaction ref count is -2, decremented by 3"));
  EXPECT_EQ(h.keepAlive->events(), (std::vector<std::string>{"begin", "end"}));
}

TEST_F(TelvanedAgentTest, SixthSessionOfATypeIsRefusedAndItsSlotReadsSixUntilItGoes) {
  std::vector<AgentTestHarness::Opened> accepted;
  for (unsigned i = 1; i <= 5; ++i) accepted.push_back(h.openWithInfo(sessionInfoMap(3, i)));
  EXPECT_EQ(h.agent->activeClientCount(3), 5);
  for (const auto& opened : accepted) EXPECT_FALSE(opened.client->disconnected());

  // The sixth session's configuration runs on its queue and then holds the queue, so
  // that its invalidation (queued behind) waits.
  auto sixth = h.open();
  std::promise<bool> configured;
  std::promise<void> release;
  std::shared_future<void> released = release.get_future().share();
  sixth.session->queue()->async([&configured, released, session = sixth.session] {
    session->setSessionInfo(sessionInfoMap(3, 6), Value(), Value::array(), false);
    configured.set_value(session->isCounted());
    released.wait();
  });
  EXPECT_TRUE(configured.get_future().get());
  EXPECT_EQ(h.agent->activeClientCount(3), 6);
  EXPECT_EQ(h.agent->sessionCount(), 6u);
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "isActiveClientLimitReachedForSession: session 0 exceeds number of allowed active "
                               "connections for clientType 3. Session terminated..."));
  EXPECT_TRUE(capture.contains(log::Level::Debug,
                               "isActiveClientLimitReachedForSession: active session count for clientType 3 got "
                               "incremented to 6"));
  EXPECT_FALSE(capture.contains("setSessionInfo: Configuring session 6"));
  release.set_value();
  EXPECT_TRUE(sixth.client->waitUntilDisconnected());
  ASSERT_TRUE(waitUntil([&] { return h.agent->sessionCount() == 5; }));
  EXPECT_EQ(h.agent->activeClientCount(3), 5);
}

TEST_F(TelvanedAgentTest, SixthSessionOverIpcIsInvalidated) {
  for (unsigned i = 1; i <= 5; ++i) h.openWithInfo(sessionInfoMap(3, i));
  auto sixth = h.open();
  sixth.client->send(ipc::Operation::SetSessionInfo, Array{sessionInfoMap(3, 6), Value(), Value::array(), Value(false)});
  EXPECT_TRUE(sixth.client->waitUntilDisconnected());
  EXPECT_EQ(sixth.client->connection()->peerRefusal(),
            std::optional<std::string>("too many active sessions for client type 3 (at most 5)"));
  ASSERT_TRUE(waitUntil([&] { return sixth.session->isTornDown(); }));
  EXPECT_EQ(sixth.session->sessionID(), 0u);
  EXPECT_EQ(h.agent->activeClientCount(3), 5);
  EXPECT_EQ(h.agent->sessionCount(), 5u);
  // Other types are not limited by it.
  auto other = h.openWithInfo(sessionInfoMap(4, 7));
  EXPECT_FALSE(other.client->disconnected());
  EXPECT_EQ(h.agent->activeClientCount(4), 1);
}

TEST_F(TelvanedAgentTest, MissingComponentTypeIsInvalidatedWithoutCounting) {
  auto opened = h.open();
  Value info(Dictionary{{"SessionID", Value(9)}});
  opened.client->send(ipc::Operation::SetSessionInfo, Array{info, Value(), Value::array(), Value(false)});
  EXPECT_TRUE(opened.client->waitUntilDisconnected());
  EXPECT_EQ(opened.client->connection()->peerRefusal(),
            std::optional<std::string>("no ComponentType in the session information"));
  ASSERT_TRUE(waitUntil([&] { return opened.session->isTornDown(); }));
  EXPECT_TRUE(capture.contains(log::Level::Error, "isActiveClientLimitReachedForSession: session 0 missing clientType "
                                                  "in its sessionInfo " +
                                                      info.description() + ". Session terminated..."));
  for (long type = 0; type < 31; ++type) EXPECT_EQ(h.agent->activeClientCount(type), 0) << type;
  EXPECT_FALSE(capture.containsPrefix("invalidateReportingSession: active session count"));
  EXPECT_EQ(h.agent->sessionCount(), 0u);
}

TEST_F(TelvanedAgentTest, AskingTheLimitTwiceCountsOnce) {
  auto opened = h.open();
  Value info = sessionInfoMap(8, 1);
  EXPECT_FALSE(h.agent->isActiveClientLimitReachedForSession(opened.session, info));
  EXPECT_FALSE(h.agent->isActiveClientLimitReachedForSession(opened.session, info));
  EXPECT_EQ(h.agent->activeClientCount(8), 1);
  EXPECT_TRUE(opened.session->isCounted());

  // setSessionInfo, fetchStates and the one-shot send ask again: still once.
  opened.client->send(ipc::Operation::SetSessionInfo, Array{info, Value(), Value::array(), Value(false)});
  ASSERT_TRUE(opened.client->call(ipc::Operation::FetchStates, {Value()}));
  ASSERT_TRUE(opened.client->call(ipc::Operation::SendMessageWithSessionInfo,
                                  {info, Value(Dictionary{{"_clientName", Value("c")}}), Value(1), Value(2), Value()}));
  EXPECT_EQ(h.agent->activeClientCount(8), 1);
}

TEST_F(TelvanedAgentTest, TypesOutsideTheArrayHaveSlotsOfTheirOwnWithTheSameLimit) {
  for (unsigned i = 1; i <= 5; ++i) h.openWithInfo(sessionInfoMap(31, i));
  auto otherType = h.openWithInfo(sessionInfoMap(-1, 9));
  EXPECT_EQ(h.agent->activeClientCount(31), 5);
  EXPECT_EQ(h.agent->activeClientCount(-1), 1);
  EXPECT_FALSE(otherType.client->disconnected());
  auto sixth = h.open();
  sixth.client->send(ipc::Operation::SetSessionInfo,
                     Array{sessionInfoMap(31, 6), Value(), Value::array(), Value(false)});
  EXPECT_TRUE(sixth.client->waitUntilDisconnected());
  ASSERT_TRUE(waitUntil([&] { return h.agent->sessionCount() == 6; }));
  EXPECT_EQ(h.agent->activeClientCount(31), 5);
}

TEST_F(TelvanedAgentTest, NoStorebagYetSoStartRepliesNothing) {
  auto opened = h.openWithInfo(sessionInfoMap(6, 1));
  auto reply = opened.client->call(ipc::Operation::StartConfig, {});
  ASSERT_TRUE(reply);
  EXPECT_EQ(*reply, (Array{Value(), Value(), Value()}));
  auto state = h.agent->copyReportingAgentState();
  EXPECT_EQ(state.cachedStorebags, Value::dictionary());
  EXPECT_EQ(state.sessionList.size(), 1u);
  EXPECT_EQ(h.agent->copySharedConnectivityHelperForReportingSession(opened.session, 4), nullptr);
}

TEST(TelvanedAgentPolicyTest, DefaultLookupReadsThePolicyDirectory) {
  TempDir dir;
  ::setenv("TELVANED_ENTITLEMENTS_DIR", dir.str().c_str(), 1);
  TelvanedAgent::Options options;
  options.environment = TestEnvironment().environment();
  auto agent = TelvanedAgent::create(std::move(options));

  auto [refusedDaemon, refusedClient] = makeSocketPair();
  auto refusedTest = IpcTestClient::adopt(std::move(refusedClient));
  EXPECT_FALSE(agent->acceptConnection(std::move(refusedDaemon)));
  EXPECT_TRUE(refusedTest->waitUntilDisconnected());

  writeFile(dir / "telvane", "# clients\ncom.zembra.private.telvaned uid:" + std::to_string(::getuid()) + "\n");
  auto [daemonEnd, clientEnd] = makeSocketPair();
  auto client = IpcTestClient::adopt(std::move(clientEnd));
  auto session = agent->acceptConnection(std::move(daemonEnd));
  ::unsetenv("TELVANED_ENTITLEMENTS_DIR");
  ASSERT_TRUE(session);
  client->close();
  EXPECT_TRUE(waitUntil([&] { return session->isTornDown() && agent->sessionCount() == 0; }));
}

// Many sessions on several threads at once: created, configured into hierarchies,
// sending, sharing data, changing user info (which updates the descendants of other
// threads' sessions) and closed. Run under ThreadSanitizer too.
TEST(TelvanedAgentConcurrencyTest, ManySessionsOnSeveralThreads) {
  AgentTestHarness h({"a-splunk", "dashboard"});
  constexpr int kThreads = 6;
  constexpr int kSessionsPerThread = 20;
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&h, t] {
      std::vector<AgentTestHarness::Opened> live;
      for (int i = 0; i < kSessionsPerThread; ++i) {
        Dictionary extra{{"HierarchyToken", hierarchyToken(i % 2 ? "shared" : "T" + std::to_string(t), i % 3)}};
        auto opened = h.openWithInfo(sessionInfoMap(5 + (t * kSessionsPerThread + i) % 26, 100 * t + i, extra),
                                     /*aggregator=*/i % 3 == 0);
        if (!opened.session) continue;
        AgentTestHarness::buildBackends(opened.session);
        auto& client = *opened.client;
        client.send(ipc::Operation::UpdateSharedDataForKey, {Value("k" + std::to_string(i)), Value(i)});
        client.call(ipc::Operation::SendMessageWithDictionary,
                    {Value(Dictionary{{"ParametersCategory", Value(1)}, {"ParametersType", Value(i)}})});
        client.call(ipc::Operation::FetchStates,
                    {Value(Dictionary{{"_clientName", Value("c" + std::to_string(i))}})});
        client.send(ipc::Operation::UpdateSharedDataForKey, {Value("k" + std::to_string(i)), Value()});
        client.call(ipc::Operation::FlushMessages, {});
        live.push_back(opened);
        if (live.size() > 3) {
          live.front().client->close();
          live.erase(live.begin());
        }
      }
      for (auto& opened : live) opened.client->close();
    });
  }
  for (auto& thread : threads) thread.join();
  ASSERT_TRUE(waitUntil([&] { return h.agent->sessionCount() == 0 && h.agent->ipcTransactionReference() == 0; },
                        std::chrono::seconds(60)));
  for (long type = 0; type < 31; ++type) EXPECT_EQ(h.agent->activeClientCount(type), 0) << type;
  auto events = h.keepAlive->events();
  ASSERT_FALSE(events.empty());
  EXPECT_EQ(events.back(), "end");
  for (std::size_t i = 0; i < events.size(); ++i) EXPECT_EQ(events[i], i % 2 ? "end" : "begin");
  EXPECT_TRUE(h.agent->hasCorrelationList("shared"));
}

}  // namespace
