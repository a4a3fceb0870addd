// The `telvane` command line, run as a real process against a fake daemon.
#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <string>
#include <vector>

#include "support/ClientTestHelpers.h"
#include "support/FakeDaemon.h"
#include "support/ToolRunner.h"

namespace telvane {
namespace {

using test::FakeDaemon;
using test::ToolRun;
using Op = ipc::Operation;

Value numbers(std::initializer_list<int> values) {
  Array list;
  for (int v : values) list.emplace_back(v);
  return Value(std::move(list));
}

class TelvaneToolTest : public ::testing::Test {
 protected:
  ToolRun run(const std::vector<std::string>& arguments, const std::vector<std::string>& environment = {}) {
    return test::runTool(test::builtToolPath("telvane"), arguments, environment);
  }
  std::vector<Op> operations() {
    std::vector<Op> out;
    for (const auto& call : daemon_.calls()) out.push_back(call.operation);
    return out;
  }

  FakeDaemon daemon_;
};

TEST_F(TelvaneToolTest, HelpAndUsageErrors) {
  ToolRun help = run({"--help"});
  EXPECT_EQ(help.exitCode, 0);
  EXPECT_EQ(help.out.rfind("usage: telvane send", 0), 0u) << help.out;
  EXPECT_EQ(help.err, "");

  const std::vector<std::pair<std::vector<std::string>, std::string>> cases = {
      {{}, "telvane: no command given\n"},
      {{"publish"}, "telvane: unknown command 'publish'\n"},
      {{"send", "--category", "1", "--type", "1"}, "telvane: --component-type is required\n"},
      {{"send", "--component-type", "7", "--type", "1"}, "telvane: --category is required\n"},
      {{"send", "--component-type", "7", "--category", "1"}, "telvane: --type is required\n"},
      {{"send", "--component-type", "7", "--category", "70000", "--type", "1"},
       "telvane: --category takes a whole number from 0 to 65535, not '70000'\n"},
      {{"send", "--component-type", "x7", "--category", "1", "--type", "1"},
       "telvane: --component-type takes a whole number from 0 to 4294967295, not 'x7'\n"},
      {{"send", "--component-type", "7", "--category", "1", "--type", "1", "--bogus"},
       "telvane: unknown option '--bogus'\n"},
      {{"send", "--component-type", "7", "--category", "1", "--type", "1", "--payload", "{\"a\":"},
       "telvane: --payload is not valid JSON"},
      {{"send", "--component-type", "7", "--category", "1", "--type", "1", "--payload", "[1,2]"},
       "telvane: --payload must be a JSON object\n"},
      {{"states", "--component-type", "7", "--category", "1"}, "telvane: event options are only for send and oneshot\n"},
      {{"states", "--component-type", "7", "--hierarchy-token", "T"},
       "telvane: --hierarchy-token and --hierarchy-level go together\n"},
      {{"upload", "--component-type", "7"}, "telvane: upload takes one FILE\n"},
      {{"send", "--component-type", "7", "--category", "1", "--type", "1", "--count", "0"},
       "telvane: --count takes a whole number from 1 to 1000000, not '0'\n"},
  };
  for (const auto& [arguments, message] : cases) {
    SCOPED_TRACE(message);
    ToolRun r = run(arguments);
    EXPECT_EQ(r.exitCode, 2);
    EXPECT_EQ(r.err.rfind(message, 0), 0u) << r.err;
    EXPECT_EQ(r.out, "");
  }
  EXPECT_EQ(daemon_.connectionCount(), 0u);
}

TEST_F(TelvaneToolTest, SendOpensStartsSendsFlushesAndFinishes) {
  daemon_.setReply(Op::StartConfig, Array{Value(Array{Value("brindle"), Value("upload_server")}), Value(),
                                          numbers({4, 5})});
  daemon_.setReply(Op::SendMessageWithDictionary, Array{Value("posted")});
  daemon_.setReply(Op::FlushMessages, Array{Value("flushed"), Value()});
  ToolRun r = run({"send", "--component-type", "7", "--client", "app", "--service", "svc", "--session-id", "12",
                   "--category", "3", "--type", "4", "--payload", "{\"a\":1,\"b\":\"x\"}", "--count", "2"});
  EXPECT_EQ(r.exitCode, 0) << r.err;
  EXPECT_EQ(r.err, "");
  EXPECT_EQ(r.out,
            "start: configured\n"
            "enabled backends: brindle, upload_server\n"
            "whitelist: none\n"
            "blacklist: 4, 5\n"
            "events: 2 sent, 0 filtered\n"
            "flush: ok\n"
            "reply: URL not available\n"
            "reply: posted\n"
            "reply: posted\n"
            "reply: flushed\n"
            "session: finished\n");

  ASSERT_TRUE(daemon_.waitForDisconnect(0));
  EXPECT_EQ(operations(), (std::vector<Op>{Op::SetSessionInfo, Op::StartConfig, Op::FetchDisplayURL,
                                           Op::SendMessageWithDictionary, Op::SendMessageWithDictionary,
                                           Op::FlushMessages, Op::FinishSessionGracefully}));
  const auto setup = daemon_.calls(Op::SetSessionInfo)[0].arguments;
  EXPECT_EQ(setup[0][kTelvaneSessionInfoClientType], Value(7));
  EXPECT_EQ(setup[0][kTelvaneSessionInfoSessionID], Value(12));
  EXPECT_EQ(setup[0][kTelvaneSessionInfoRequireUserInfo], Value(true));
  EXPECT_EQ(setup[0][kTelvaneSessionInfoBatchEvent], Value(false));
  EXPECT_EQ(setup[1], test::clientUserInfo("app", "svc"));
  const auto event = daemon_.calls(Op::SendMessageWithDictionary)[0].arguments[0];
  EXPECT_EQ(event, Value(Dictionary{{kTelvaneMessageParametersCategory, Value(3)},
                                    {kTelvaneMessageParametersType, Value(4)},
                                    {kTelvaneMessageParametersFlag, Value(0)},
                                    {kTelvaneMessageParametersPayload,
                                     Value(Dictionary{{"a", Value(1)}, {"b", Value("x")}})}}));
}

TEST_F(TelvaneToolTest, LocallyFilteredEventsNeverReachTheDaemon) {
  daemon_.setReply(Op::StartConfig, Array{Value(Array{Value("brindle")}), numbers({1}), Value()});
  ToolRun r = run({"send", "--component-type", "7", "--category", "3", "--type", "4", "--count", "3", "--flag", "1",
                   "--batch", "--hierarchy-token", "ABC", "--hierarchy-level", "2"});
  EXPECT_EQ(r.exitCode, 0) << r.err;
  EXPECT_NE(r.out.find("whitelist: 1\n"), std::string::npos) << r.out;
  EXPECT_NE(r.out.find("events: 0 sent, 3 filtered\n"), std::string::npos) << r.out;
  ASSERT_TRUE(daemon_.waitForDisconnect(0));
  EXPECT_TRUE(daemon_.calls(Op::SendMessageWithDictionary).empty());
  const auto info = daemon_.calls(Op::SetSessionInfo)[0].arguments[0];
  EXPECT_EQ(info[kTelvaneSessionInfoBatchEvent], Value(true));
  EXPECT_EQ(info[kTelvaneSessionInfoRequireUserInfo], Value(false));
  EXPECT_EQ(info[kTelvaneSessionInfoHierarchyToken], Value(Dictionary{{"token", Value("ABC")}, {"level", Value(2)}}));
}

TEST_F(TelvaneToolTest, FlushErrorIsReportedWithAFailingStatus) {
  daemon_.setReply(Op::FlushMessages,
                   Array{Value(), Value(Dictionary{{"domain", Value("TelvaneErrorDomain")},
                                                   {"code", Value(-1)},
                                                   {"description", Value("No backends available to send message")}})});
  ToolRun r = run({"send", "--component-type", "7", "--category", "3", "--type", "4"});
  EXPECT_EQ(r.exitCode, 1);
  EXPECT_NE(r.out.find("start: not configured\nenabled backends: none\n"), std::string::npos) << r.out;
  // The daemon answers the event of a session without configuration, and drops it.
  EXPECT_NE(r.out.find("events: 0 sent, 0 filtered, 1 not accepted\n"), std::string::npos) << r.out;
  EXPECT_EQ(r.err, "telvane: 1 of 1 events not accepted: the session is not configured\n");
  EXPECT_NE(r.out.find("flush: failed: No backends available to send message (TelvaneErrorDomain, code -1)\n"),
            std::string::npos)
      << r.out;
  EXPECT_NE(r.out.find("session: finished\n"), std::string::npos);
}

TEST_F(TelvaneToolTest, UnansweredEventsAreNotCountedAsSent) {
  daemon_.setReply(Op::StartConfig, Array{Value(Array{Value("brindle")}), Value(), Value()});
  auto answered = std::make_shared<std::atomic<int>>(0);
  daemon_.setResponder(Op::SendMessageWithDictionary, [answered](const FakeDaemon::Call&) -> std::optional<Array> {
    // The first event is answered (without a text, as a batched one is), the second not.
    if (answered->fetch_add(1) == 0) return Array{Value()};
    return std::nullopt;
  });
  ToolRun r = run({"send", "--component-type", "7", "--category", "3", "--type", "4", "--count", "2", "--timeout",
                   "1"});
  EXPECT_EQ(r.exitCode, 1);
  EXPECT_EQ(r.out,
            "start: configured\n"
            "enabled backends: brindle\n"
            "whitelist: none\n"
            "blacklist: none\n"
            "events: 1 sent, 0 filtered, 1 not accepted\n"
            "flush: ok\n"
            "reply: URL not available\n"
            "session: finished\n");
  EXPECT_EQ(r.err, "telvane: 1 of 2 events not accepted: no answer from the daemon\n");
}

TEST_F(TelvaneToolTest, SessionRefusedAtConnectionPrintsTheDaemonsReason) {
  daemon_.refuseNewConnections(std::string("missing the entitlement com.zembra.private.telvaned"));
  const std::vector<std::vector<std::string>> commands = {
      {"states", "--component-type", "7"},
      {"send", "--component-type", "7", "--category", "3", "--type", "4"},
  };
  for (const auto& arguments : commands) {
    SCOPED_TRACE(arguments[0]);
    ToolRun r = run(arguments);
    EXPECT_EQ(r.exitCode, 1);
    EXPECT_EQ(r.err, "telvane: the daemon refused the session: missing the entitlement com.zembra.private.telvaned\n");
    EXPECT_EQ(r.out, "") << "neither a start result nor a sent event";
  }
  EXPECT_EQ(daemon_.connectionCount(), 2u) << "one connection per run, none made again";
  EXPECT_TRUE(daemon_.calls().empty());
}

TEST_F(TelvaneToolTest, SessionRefusedAtItsSessionInfoPrintsTheDaemonsReason) {
  daemon_.refuseOnCall(Op::SetSessionInfo, "too many active sessions for client type 7 (at most 5)");
  ToolRun r = run({"send", "--component-type", "7", "--category", "3", "--type", "4"});
  EXPECT_EQ(r.exitCode, 1);
  EXPECT_EQ(r.err, "telvane: the daemon refused the session: too many active sessions for client type 7 (at most 5)\n");
  EXPECT_EQ(r.out, "");
  EXPECT_TRUE(daemon_.calls(Op::SendMessageWithDictionary).empty());
}

TEST_F(TelvaneToolTest, StatesPrintsTheLists) {
  daemon_.setReply(Op::StartConfig, Array{Value(Array{Value("dashboard")}), numbers({7, 8}), numbers({})});
  daemon_.setReply(Op::FetchDisplayURL, Array{Value("https://dash.example/1")});
  ToolRun r = run({"states", "--component-type", "12"});
  EXPECT_EQ(r.exitCode, 0) << r.err;
  EXPECT_EQ(r.out,
            "start: configured\n"
            "enabled backends: dashboard\n"
            "whitelist: 7, 8\n"
            "blacklist: none\n"
            "reply: URL for the session is: https://dash.example/1\n"
            "session: finished\n");
}

TEST_F(TelvaneToolTest, OneShotPrintsTheReply) {
  ToolRun r = run({"oneshot", "--component-type", "9", "--session-id", "5", "--category", "2", "--type", "1",
                   "--payload", "{\"k\":true}"});
  EXPECT_EQ(r.exitCode, 0) << r.err;
  EXPECT_EQ(r.out, "reply: finished\n");
  auto sends = daemon_.calls(Op::SendMessageWithSessionInfo);
  ASSERT_EQ(sends.size(), 1u);
  EXPECT_EQ(sends[0].arguments[0][kTelvaneSessionInfoBatchEvent], Value(false));
  EXPECT_EQ(sends[0].arguments[2], Value(2));
  EXPECT_EQ(sends[0].arguments[4], Value(Dictionary{{"k", Value(true)}}));
}

TEST_F(TelvaneToolTest, UploadPassesTheFile) {
  test::TempDir dir;
  test::writeFile(dir / "log.txt", "payload bytes");
  daemon_.setReply(Op::StartConfig, Array{Value(Array{Value("upload_server")}), Value(), Value()});
  ToolRun r = run({"upload", "--component-type", "7", (dir / "log.txt").string()});
  EXPECT_EQ(r.exitCode, 0) << r.err;
  EXPECT_NE(r.out.find("file upload supported: yes\nupload: succeeded\n"), std::string::npos) << r.out;
  auto uploads = daemon_.calls(Op::UploadFileAtPath);
  ASSERT_EQ(uploads.size(), 1u);
  EXPECT_EQ(uploads[0].descriptorContents, std::vector<std::string>{"payload bytes"});

  ToolRun missing = run({"upload", "--component-type", "7", (dir / "absent.txt").string()});
  EXPECT_EQ(missing.exitCode, 1);
  EXPECT_EQ(missing.err, "telvane: cannot open " + (dir / "absent.txt").string() + " for reading\n");
}

TEST_F(TelvaneToolTest, RefusedClientAndUnreachableDaemon) {
  ToolRun refused = run({"states", "--component-type", "4"});
  EXPECT_EQ(refused.exitCode, 1);
  EXPECT_EQ(refused.err, "telvane: client creation refused: clientType is invalid (TelvaneErrorDomain, code 3)\n");
  EXPECT_EQ(daemon_.connectionCount(), 0u);

  test::TempDir dir;
  const std::string absent = (dir / "nobody.sock").string();
  ToolRun unreachable = run({"states", "--component-type", "7", "--timeout", "0.3"}, {"TELVANED_SOCKET=" + absent});
  EXPECT_EQ(unreachable.exitCode, 1);
  EXPECT_EQ(unreachable.err, "telvane: the daemon is not reachable at " + absent + "\n");
  EXPECT_EQ(unreachable.out, "");
}

TEST_F(TelvaneToolTest, LibraryLogLinesOnlyWithVerbose) {
  ToolRun quiet = run({"states", "--component-type", "7"});
  EXPECT_EQ(quiet.exitCode, 0);
  EXPECT_EQ(quiet.err, "");
  ToolRun verbose = run({"states", "--component-type", "7", "--verbose"});
  EXPECT_EQ(verbose.exitCode, 0);
  EXPECT_NE(verbose.err.find("startLogging: Client starts logging..."), std::string::npos) << verbose.err;
  EXPECT_NE(verbose.err.find("Cached 0 enabled backends, ((null), (null)) listed events"), std::string::npos);
}

}  // namespace
}  // namespace telvane
