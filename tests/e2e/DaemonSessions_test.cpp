// The real daemon on a temporary socket: entitlements, the per-type session limit,
// keep-alive transactions with the idle exit and socket activation.
#include <gtest/gtest.h>
#include <unistd.h>

#include <future>

#include "e2e/E2eHelpers.h"
#include "support/DaemonProcess.h"
#include "support/TempDir.h"
#include "telvane/Telvane.h"

using namespace telvane;
using namespace telvane::test;
using namespace std::chrono_literals;

namespace {

std::string connectionDescription() { return "pid " + std::to_string(::getpid()) + " uid " + std::to_string(::getuid()); }

}  // namespace

TEST(DaemonSessions, PeerWithoutTheEntitlementIsRefusedAndNoSessionExists) {
  TempDir dir;
  DaemonOptions options;
  options.entitlementLines = {"com.zembra.private.telvaned uid:" + std::to_string(::getuid() + 1)};
  DaemonProcess daemon(dir.str(), options);
  ASSERT_TRUE(daemon.start());
  RawSession session = openRawSession(daemon.socketPath(), sessionInfoFor(7, 1));
  EXPECT_TRUE(session.waitEnded()) << "the daemon closes a refused connection";
  EXPECT_TRUE(daemon.waitForLogLine("listener: new IPC connection " + connectionDescription() +
                                    " does not have required telvane entitlement. Closing connection..."));
  EXPECT_EQ(daemon.countLogPrefix("createReportingSessionWithDelegate:"), 0u);
  EXPECT_EQ(daemon.countLogPrefix("initWithSessionDelegate:"), 0u);
  EXPECT_EQ(daemon.stop(), 0);
}

TEST(DaemonSessions, FiveSessionsOfOneTypeAreAcceptedAndTheSixthIsInvalidated) {
  TempDir dir;
  DaemonProcess daemon(dir.str());
  ASSERT_TRUE(daemon.start());
  std::vector<RawSession> sessions;
  for (unsigned i = 1; i <= 5; ++i) {
    sessions.push_back(openRawSession(daemon.socketPath(), sessionInfoFor(3, i)));
    ASSERT_TRUE(daemon.waitForLogLine(
        "isActiveClientLimitReachedForSession: active session count for clientType 3 got incremented to " +
        std::to_string(i)));
  }
  // Every one of the five still answers.
  for (auto& s : sessions) {
    auto reply = callAndWait(*s.connection, ipc::Operation::FetchDisplayURL, Array{});
    ASSERT_TRUE(reply.has_value());
    EXPECT_EQ((*reply)[0].stringOrEmpty(), "URL not available");
  }
  // The limit is checked before the session takes its identifier, so the refusal
  // names session 0.
  RawSession sixth = openRawSession(daemon.socketPath(), sessionInfoFor(3, 6));
  EXPECT_TRUE(sixth.waitEnded()) << "the sixth session invalidates itself";
  EXPECT_TRUE(daemon.waitForLogLine(
      "isActiveClientLimitReachedForSession: session 0 exceeds number of allowed active connections for clientType "
      "3. Session terminated..."));
  EXPECT_TRUE(daemon.waitForLogLine(
      "isActiveClientLimitReachedForSession: active session count for clientType 3 got incremented to 6"));
  EXPECT_TRUE(daemon.waitForLogLine(
      "invalidateReportingSession: active session count for clientType 3 got decremented to 5"));
  for (auto& s : sessions) EXPECT_FALSE(s.waitEnded(0ms)) << "the five stay connected";

  // A one-shot send of the same type is refused too, and says so in its reply before
  // its connection ends.
  {
    auto connected = IpcConnection::connect(daemon.socketPath(), SerialQueue::create("e2e.oneshot"));
    ASSERT_TRUE(connected.ok());
    auto oneShot = connected.value();
    oneShot->resume();
    Value userInfo(Dictionary{{"_clientName", "demo"}});
    auto reply = callAndWait(*oneShot, ipc::Operation::SendMessageWithSessionInfo,
                             Array{sessionInfoFor(3, 8), userInfo, Value(5), Value(1), Value()});
    ASSERT_TRUE(reply.has_value()) << "the refusal is answered";
    EXPECT_EQ((*reply)[0].stringOrEmpty(),
              "Exceeded maximum active reporting session limit for userInfo='" + userInfo.description() + "'");
    ASSERT_TRUE(daemon.waitForLogLine(
        "invalidateReportingSession: active session count for clientType 3 got decremented to 5", 20s, 2));
  }

  // Once one of the five has gone, a new session of the type is accepted.
  sessions.front().connection->invalidate();
  ASSERT_TRUE(daemon.waitForLogLine(
      "invalidateReportingSession: active session count for clientType 3 got decremented to 4"));
  RawSession replacement = openRawSession(daemon.socketPath(), sessionInfoFor(3, 7));
  ASSERT_TRUE(daemon.waitForLogLine("setSessionInfo: Configuring session 7"));
  auto reply = callAndWait(*replacement.connection, ipc::Operation::FetchDisplayURL, Array{});
  EXPECT_TRUE(reply.has_value());
  EXPECT_FALSE(replacement.waitEnded(0ms));
  EXPECT_EQ(daemon.stop(), 0);
}

TEST(DaemonSessions, TransactionBeginsWithTheFirstSessionAndTheIdleDaemonExitsAndComesBack) {
  TempDir dir;
  DaemonOptions options;
  options.socketActivated = true;
  options.idleExitSeconds = 1.0;
  DaemonProcess daemon(dir.str(), options);
  ASSERT_TRUE(daemon.start());
  useDaemon(daemon);
  {
    auto client = Telvane::create(Value(Dictionary{{"ComponentType", 9}, {"SessionID", 41}}), Value(), Value());
    ASSERT_TRUE(client);
    ASSERT_TRUE(daemon.waitForLogLine("createReportingSessionWithDelegate: retained IPC Transaction. Ref count is 1"));
    EXPECT_EQ(daemon.countLogPrefix("createReportingSessionWithDelegate: IPC transaction started with session "), 1u);
    auto second = Telvane::create(Value(Dictionary{{"ComponentType", 9}, {"SessionID", 42}}), Value(), Value());
    ASSERT_TRUE(second);
    ASSERT_TRUE(daemon.waitForLogLine("createReportingSessionWithDelegate: retained IPC Transaction. Ref count is 2"));
    EXPECT_EQ(daemon.countLogPrefix("createReportingSessionWithDelegate: IPC transaction started with session "), 1u)
        << "only the first session begins the transaction";
  }
  // Both clients are gone: their sessions end, the transaction ends, and after the
  // idle period the daemon exits cleanly (and without leaks, under the sanitizers).
  EXPECT_TRUE(daemon.waitForLogLine("releaseIPCTransactions: IPC transaction ended"));
  auto status = daemon.waitForExit(20s);
  ASSERT_TRUE(status.has_value()) << "the idle daemon exits by itself";
  EXPECT_EQ(*status, 0) << daemon.log();
  EXPECT_TRUE(daemon.waitForLogLine("main: No IPC transaction for 1 seconds, exiting while idle", 0ms));

  // A new connection starts it again, and the waiting client is served.
  auto promise = std::make_shared<std::promise<bool>>();
  auto client = Telvane::create(Value(Dictionary{{"ComponentType", 9}, {"SessionID", 43}}), Value(), Value());
  ASSERT_TRUE(client);
  ASSERT_TRUE(daemon.respawnWhenConnectionPending(20s));
  client->startConfigurationWithCompletionHandler([promise](bool received) { promise->set_value(received); });
  auto started = promise->get_future();
  ASSERT_EQ(started.wait_for(20s), std::future_status::ready);
  EXPECT_FALSE(started.get()) << "no storebag yet: the start reply carries no states";
  EXPECT_TRUE(daemon.waitForLogLine("setSessionInfo: Configuring session 43"));
  EXPECT_TRUE(daemon.waitForLogLine("startConfigWithCompletionHandler: Starting configuration for session 43"));
  client.reset();
  EXPECT_EQ(daemon.stop(), 0);
}
