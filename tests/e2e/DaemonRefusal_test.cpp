// The real daemon refusing clients, as the `telvane` tool and the client library see
// it: a caller without the entitlement, and a sixth live session of one client type,
// each told why before its connection closes, while the daemon logs what it always
// logged. And what the tool counts as sent under a storebag that takes events.
#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <future>
#include <memory>
#include <string>
#include <vector>

#include "e2e/E2eHelpers.h"
#include "e2e/StorebagDaemonTest.h"
#include "support/DaemonProcess.h"
#include "support/TempDir.h"
#include "support/ToolRunner.h"
#include "support/WaitUntil.h"
#include "telvane/Telvane.h"

using namespace telvane;
using namespace telvane::test;
using namespace std::chrono_literals;

namespace {

constexpr const char* kNotEntitled = "missing the entitlement com.zembra.private.telvaned";
constexpr const char* kTooManySessionsOfType7 = "too many active sessions for client type 7 (at most 5)";

ToolRun tool(const DaemonProcess& daemon, const std::vector<std::string>& arguments) {
  return runTool(builtToolPath("telvane"), arguments, {"TELVANED_SOCKET=" + daemon.socketPath()});
}

// Starts the session and waits for the start's completion (nullopt when none came).
std::optional<bool> start(Telvane& session) {
  auto started = std::make_shared<std::promise<bool>>();
  session.startConfigurationWithCompletionHandler([started](bool received) { started->set_value(received); });
  auto future = started->get_future();
  if (future.wait_for(20s) != std::future_status::ready) return std::nullopt;
  return future.get();
}

Error refusal(const std::string& reason) { return Error{"TelvaneErrorDomain", Error::kCodeRefusedByDaemon, reason, Value()}; }

}  // namespace

TEST(DaemonRefusal, CallerWithoutTheEntitlementIsToldWhyAndTheToolFails) {
  TempDir dir;
  DaemonOptions options;
  options.entitlementLines = {"com.zembra.private.telvaned uid:" + std::to_string(::getuid() + 1)};
  DaemonProcess daemon(dir.str(), options);
  ASSERT_TRUE(daemon.start());

  ToolRun send = tool(daemon, {"send", "--component-type", "7", "--category", "12", "--type", "1", "--timeout", "30"});
  EXPECT_EQ(send.exitCode, 1);
  EXPECT_EQ(send.err, "telvane: the daemon refused the session: " + std::string(kNotEntitled) + "\n");
  EXPECT_EQ(send.out, "") << "no start result and no sent event";

  ToolRun states = tool(daemon, {"states", "--component-type", "7", "--timeout", "30"});
  EXPECT_EQ(states.exitCode, 1);
  EXPECT_EQ(states.err, "telvane: the daemon refused the session: " + std::string(kNotEntitled) + "\n");
  EXPECT_EQ(states.out, "") << "not the \"start: not configured\" of a daemon without a storebag";

  // A single event without a session: the reason shows in the library's error line.
  ToolRun oneshot =
      tool(daemon, {"oneshot", "--component-type", "7", "--category", "12", "--type", "1", "--timeout", "30"});
  EXPECT_EQ(oneshot.exitCode, 1);
  EXPECT_EQ(oneshot.out, "");
  EXPECT_NE(oneshot.err.find("<error> sendOneMessageWithSessionInfo: The daemon refused the session: " +
                             std::string(kNotEntitled) + "\n"),
            std::string::npos)
      << oneshot.err;
  EXPECT_NE(oneshot.err.find("telvane: no reply from the daemon at " + daemon.socketPath() +
                             " (it is not running or it refused the connection)\n"),
            std::string::npos)
      << oneshot.err;

  // The library tells a client program the same.
  useDaemon(daemon);
  auto client = Telvane::create(sessionInfoFor(7, 1), Value(), Value());
  ASSERT_TRUE(client);
  EXPECT_EQ(start(*client), std::optional<bool>(false));
  EXPECT_EQ(client->connectionError(), refusal(kNotEntitled));
  client.reset();

  // The daemon logs its refusal as it always did, once per caller, and made no session.
  const std::string pid = "listener: new IPC connection pid ";
  const std::string refused = " does not have required telvane entitlement. Closing connection...";
  EXPECT_TRUE(daemon.waitForLogContaining(pid + std::to_string(::getpid()) + " uid ", refused));
  EXPECT_TRUE(waitUntil([&] { return daemon.countLogPrefix(pid) == 4; })) << daemon.log();
  EXPECT_EQ(daemon.countLogPrefix("createReportingSessionWithDelegate:"), 0u);
  EXPECT_EQ(daemon.stop(), 0);
}

TEST(DaemonRefusal, SixthSessionOfClientType7IsToldItWasRefused) {
  TempDir dir;
  DaemonProcess daemon(dir.str());
  ASSERT_TRUE(daemon.start());
  useDaemon(daemon);
  std::vector<std::unique_ptr<Telvane>> five;
  for (unsigned i = 1; i <= 5; ++i) {
    five.push_back(Telvane::create(sessionInfoFor(7, i), Value(), Value()));
    ASSERT_TRUE(five.back());
    // No storebag is served: started, but not configured.
    EXPECT_EQ(start(*five.back()), std::optional<bool>(false));
  }
  ASSERT_TRUE(daemon.waitForLogLine(
      "isActiveClientLimitReachedForSession: active session count for clientType 7 got incremented to 5"));

  auto sixth = Telvane::create(sessionInfoFor(7, 6), Value(), Value());
  ASSERT_TRUE(sixth);
  EXPECT_EQ(start(*sixth), std::optional<bool>(false));
  EXPECT_EQ(sixth->connectionError(), refusal(kTooManySessionsOfType7));
  EXPECT_TRUE(daemon.waitForLogLine(
      "isActiveClientLimitReachedForSession: session 0 exceeds number of allowed active connections for clientType "
      "7. Session terminated..."));
  EXPECT_TRUE(daemon.waitForLogLine(
      "invalidateReportingSession: active session count for clientType 7 got decremented to 5"));
  // Calls after the refusal fail at once, without a new connection.
  EXPECT_EQ(start(*sixth), std::optional<bool>(false));
  EXPECT_EQ(daemon.countLogLines(
                "isActiveClientLimitReachedForSession: active session count for clientType 7 got incremented to 6"),
            1u);

  // The tool as a further session of the type.
  ToolRun states = tool(daemon, {"states", "--component-type", "7", "--timeout", "30"});
  EXPECT_EQ(states.exitCode, 1);
  EXPECT_EQ(states.err, "telvane: the daemon refused the session: " + std::string(kTooManySessionsOfType7) + "\n");
  EXPECT_EQ(states.out, "");

  // And a single event of the type, refused with the daemon's own answer.
  ToolRun oneshot = tool(daemon, {"oneshot", "--component-type", "7", "--category", "12", "--type", "1",
                                  "--client", "com.example.conference", "--timeout", "30"});
  EXPECT_EQ(oneshot.exitCode, 1);
  EXPECT_EQ(oneshot.out, "");
  EXPECT_NE(oneshot.err.find("telvane: the daemon refused the session: Exceeded maximum active reporting session "
                             "limit for userInfo="),
            std::string::npos)
      << oneshot.err;

  for (const auto& session : five) EXPECT_EQ(session->connectionError(), std::nullopt) << "the five stay";
  sixth.reset();
  five.clear();
  EXPECT_EQ(daemon.stop(), 0);
}

namespace {

class DaemonToolSend : public StorebagDaemonTest {
 protected:
  // A storebag whose HTTPS post backend takes every event of the sessions of
  // "com.example.conference" except those of category 9.
  void startDaemon() {
    answerPath("/post", "{}");
    answerPath("/rt", "{}");
    Value rule(Dictionary{{"override_dnu", Value(1)},
                          {"locale_whitelist", Value(Array{Value("US")})},
                          {"sampling_threshold", Value(1)},
                          {"post_url", Value(server_.url("/post"))},
                          {"realtime_post_url", Value(server_.url("/rt"))},
                          {"filters", Value(Array{Value(Dictionary{{"key", Value("PostTime")},
                                                                   {"action", Value("remove")}})})},
                          {"event_blacklist", Value(Array{Value(9)})}});
    StorebagBuilder builder;
    builder.version("tool-send-1");
    for (const char* section : {"zembra_internal", "development", "seed", "release"}) {
      builder.backend(section, "brindle",
                      Value(Dictionary{{"display_url", Value(server_.url("/post"))}, {"clients", Value(Array{rule})}}));
    }
    DaemonOptions options;
    options.environment["LC_ALL"] = "en_US.UTF-8";
    startDaemonWith(builder, options);
  }

  ToolRun send(const std::string& componentType, const std::string& category, const std::string& count) {
    return tool(*daemon_, {"send", "--component-type", componentType, "--client", "com.example.conference",
                           "--service", "calls", "--batch", "--category", category, "--type", "1", "--count", count,
                           "--timeout", "30"});
  }
};

}  // namespace

TEST_F(DaemonToolSend, SentCountsOnlyTheEventsTheDaemonAccepted) {
  startDaemon();
  ToolRun accepted = send("7", "12", "3");
  EXPECT_EQ(accepted.exitCode, 0) << accepted.out << accepted.err;
  EXPECT_NE(accepted.out.find("start: configured\n"), std::string::npos) << accepted.out;
  EXPECT_NE(accepted.out.find("blacklist: 9\n"), std::string::npos) << accepted.out;
  EXPECT_NE(accepted.out.find("events: 3 sent, 0 filtered\nflush: ok\n"), std::string::npos) << accepted.out;
  EXPECT_EQ(accepted.err, "");

  // Events of a blacklisted category never leave the tool.
  ToolRun filtered = send("7", "9", "2");
  EXPECT_NE(filtered.out.find("events: 0 sent, 2 filtered\n"), std::string::npos) << filtered.out << filtered.err;
  EXPECT_EQ(filtered.err.find("not accepted"), std::string::npos) << filtered.err;

  // Client type 9 has no storebag: the daemon answers its event but has nothing to
  // deliver it with.
  ToolRun unconfigured = send("9", "12", "1");
  EXPECT_EQ(unconfigured.exitCode, 1);
  EXPECT_NE(unconfigured.out.find("start: not configured\n"), std::string::npos) << unconfigured.out;
  EXPECT_NE(unconfigured.out.find("events: 0 sent, 0 filtered, 1 not accepted\n"), std::string::npos)
      << unconfigured.out;
  EXPECT_NE(unconfigured.err.find("telvane: 1 of 1 events not accepted: the session is not configured\n"),
            std::string::npos)
      << unconfigured.err;
}

// Calls the client had already written behind the setSessionInfo that gets refused are
// never dispatched: the refused session neither configures itself nor answers.
TEST(DaemonRefusal, CallsPipelinedBehindARefusedSessionInfoAreNotHandled) {
  TempDir dir;
  DaemonProcess daemon(dir.str());
  ASSERT_TRUE(daemon.start());
  std::vector<RawSession> five;
  for (unsigned i = 1; i <= 5; ++i) {
    five.push_back(openRawSession(daemon.socketPath(), sessionInfoFor(7, i)));
    ASSERT_TRUE(daemon.waitForLogLine(
        "isActiveClientLimitReachedForSession: active session count for clientType 7 got incremented to " +
        std::to_string(i)));
  }

  RawSession sixth = openRawSession(daemon.socketPath(), sessionInfoFor(7, 6));
  auto replies = std::make_shared<std::atomic<int>>(0);
  auto count = [replies](Array) { replies->fetch_add(1); };
  sixth.connection->call(ipc::Operation::StartConfig, Array{}, count);
  sixth.connection->call(ipc::Operation::FetchDisplayURL, Array{}, count);
  sixth.connection->call(ipc::Operation::SendMessageWithDictionary,
                         Array{Value(Dictionary{{"ParametersCategory", Value(12)}, {"ParametersType", Value(1)}})},
                         count);
  sixth.connection->call(ipc::Operation::FlushMessages, Array{}, count);
  EXPECT_TRUE(sixth.waitEnded()) << "the refused connection closes";
  EXPECT_EQ(sixth.connection->peerRefusal(), std::optional<std::string>(kTooManySessionsOfType7));
  EXPECT_TRUE(daemon.waitForLogLine(
      "invalidateReportingSession: active session count for clientType 7 got decremented to 5"));
  EXPECT_EQ(replies->load(), 0) << "no call behind the refusal was answered";
  EXPECT_EQ(daemon.countLogPrefix("startConfigWithCompletionHandler:"), 0u) << daemon.log();
  EXPECT_EQ(daemon.countLogPrefix("sendMessageWithDictionary:"), 0u) << daemon.log();
  EXPECT_EQ(daemon.countLogPrefix("flushMessagesWithCompletion:"), 0u) << daemon.log();

  // The five are served throughout.
  for (auto& s : five) {
    auto reply = callAndWait(*s.connection, ipc::Operation::FetchDisplayURL, Array{});
    ASSERT_TRUE(reply.has_value());
    EXPECT_EQ((*reply)[0].stringOrEmpty(), "URL not available");
  }
  EXPECT_EQ(daemon.stop(), 0);
}
