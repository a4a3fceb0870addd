#include <fcntl.h>
#include <gtest/gtest.h>

#include <thread>

#include "platform/Log.h"
#include "session/TelvanedSession.h"
#include "support/SessionTestHarness.h"
#include "support/TempDir.h"

using namespace telvane;
using namespace telvane::test;

namespace {

Value message(std::optional<long> category, std::optional<long> type, Value payload = Value(),
              std::optional<long> flag = std::nullopt) {
  Dictionary m;
  if (category) m.set("ParametersCategory", Value(*category));
  if (type) m.set("ParametersType", Value(*type));
  if (!payload.isNull()) m.set("ParametersPayload", payload);
  if (flag) m.set("ParametersFlag", Value(*flag));
  return Value(std::move(m));
}

Value userInfoMap(const std::string& client, const std::string& service) {
  return Value(Dictionary{{"_clientName", Value(client)}, {"_serviceName", Value(service)}});
}

class MessagePathTest : public SessionTest {
 protected:
  // Configures and starts the session (the start message reaches the backends).
  void start(SessionTestHarness& h, bool aggregator = false, Dictionary extraInfo = {}) {
    h.delegate()->setStorebag(Value::dictionary());
    h.client().send(ipc::Operation::SetSessionInfo,
                    Array{sessionInfoMap(9, 4, std::move(extraInfo)), Value(), Value::array(), Value(aggregator)});
    ASSERT_TRUE(h.client().call(ipc::Operation::StartConfig, {}));
  }

  Value send(SessionTestHarness& h, const Value& m) {
    auto reply = h.client().call(ipc::Operation::SendMessageWithDictionary, {m});
    return reply ? (*reply)[0] : Value("no reply");
  }
};

TEST_F(MessagePathTest, SendWithoutBackendsRepliesNothing) {
  SessionTestHarness h(env);
  EXPECT_TRUE(send(h, message(1, 2)).isNull());
  EXPECT_TRUE(capture.contains("sendMessageWithDictionary: Sending message for session 0"));
  EXPECT_TRUE(capture.contains("sendMessageWithDictionary: No backends available to send message"));
}

TEST_F(MessagePathTest, MissingParametersAreRefusedBeforeAggregation) {
  auto backend = addBackend("a-splunk");
  backend->setSendResult(std::string("ok"));
  SessionTestHarness h(env);
  start(h, /*aggregator=*/true);
  std::size_t afterStart = backend->sent().size();
  ASSERT_TRUE(h.client().waitForAggregatedMessages(1));  // the start message

  EXPECT_TRUE(send(h, message(std::nullopt, 2)).isNull());
  EXPECT_TRUE(capture.contains("sendMessageWithDictionary: Missing mandatory parameter 'category'"));
  EXPECT_TRUE(send(h, message(1, std::nullopt)).isNull());
  EXPECT_TRUE(capture.contains("sendMessageWithDictionary: Missing mandatory parameter 'type'"));
  EXPECT_EQ(backend->sent().size(), afterStart);

  // A complete event afterwards is aggregated: only it follows the start message.
  EXPECT_EQ(send(h, message(1, 2)), Value("ok"));
  ASSERT_TRUE(h.client().waitForAggregatedMessages(2));
  auto aggregated = h.client().aggregatedMessages();
  ASSERT_EQ(aggregated.size(), 2u);
  EXPECT_EQ(aggregated[1][2].integerValue(), 1);
  EXPECT_EQ(aggregated[1][3].integerValue(), 2);
}

TEST_F(MessagePathTest, EventBlobCarriesSharedDataPayloadTimeAndParameters) {
  auto backend = addBackend("a-splunk");
  SessionTestHarness h(env);
  start(h);
  h.delegate()->setSharedData(Value(Dictionary{{"k", Value("v")}}));
  env.clock->set(1'700'000'123.25);
  Value payload(Dictionary{{"x", Value(1)}});
  send(h, message(65536 + 5, 6, payload, 3));
  auto sent = backend->sent();
  ASSERT_EQ(sent.size(), 2u);
  EXPECT_EQ(sent[1].method, 5);  // cut to 16 bits
  EXPECT_EQ(sent[1].respCode, 6);
  EXPECT_EQ(sent[1].flag, 3u);
  EXPECT_EQ(sent[1].timestamp, (TimeValue{1'700'000'123, 250000}));
  EXPECT_EQ(sent[1].blob, Value(Dictionary{{"SharedData", Value(Dictionary{{"k", Value("v")}})},
                                           {"ClientData", payload}}));
}

TEST_F(MessagePathTest, FiltersLogAndStillAggregate) {
  auto refusing = addBackend("a-splunk");
  refusing->setWhitelist(Array{Value(3)});
  auto blacklisting = addBackend("b-splunk");
  blacklisting->setBlacklist(Array{Value(1)});
  SessionTestHarness h(env);
  start(h, /*aggregator=*/true);
  ASSERT_TRUE(h.client().waitForAggregatedMessages(1));
  send(h, message(1, 2, Value(Dictionary{{"x", Value(1)}})));
  EXPECT_TRUE(capture.contains(
      "sendMessageWithDictionary: Dropping event with category 1 as it is not whitelisted for backend a-splunk"));
  EXPECT_TRUE(capture.contains(
      "sendMessageWithDictionary: Dropping event with category 1 as it is blacklisted for backend b-splunk"));
  EXPECT_EQ(refusing->sent().size(), 0u);  // the start message (category 0) was refused too
  EXPECT_EQ(blacklisting->sent().size(), 1u);
  ASSERT_TRUE(h.client().waitForAggregatedMessages(2));
  auto aggregated = h.client().aggregatedMessages();
  EXPECT_EQ(aggregated[1][0], h.session()->sessionInfo());
  EXPECT_EQ(aggregated[1][4], Value(Dictionary{{"x", Value(1)}}));
}

TEST_F(MessagePathTest, HTTPSAnswerWinsOverTheDashboardWhateverTheOrder) {
  auto dashboard = addBackend("dashboard", BackendKind::Dashboard);
  auto splunk = addBackend("z-splunk");
  auto other = addBackend("quarl");
  dashboard->setSendResult(std::string("dashboard-answer"));
  splunk->setSendResult(std::string("splunk-answer"));
  other->setSendResult(std::string("quarl-answer"));
  SessionTestHarness h(env);
  start(h);
  EXPECT_EQ(send(h, message(1, 2)), Value("splunk-answer"));
  EXPECT_TRUE(env.messageLog->contains("[dashboard -> sendMessageWithDictionary] dashboard-answer"));
  EXPECT_TRUE(env.messageLog->contains("[z-splunk -> sendMessageWithDictionary] splunk-answer"));
  EXPECT_TRUE(env.messageLog->contains("[quarl -> sendMessageWithDictionary] quarl-answer"));

  // Without an HTTPS answer the dashboard's is taken; other backends never answer.
  splunk->setSendResult(std::nullopt);
  EXPECT_EQ(send(h, message(1, 2)), Value("dashboard-answer"));
  dashboard->setSendResult(std::nullopt);
  EXPECT_TRUE(send(h, message(1, 2)).isNull());
}

TEST_F(MessagePathTest, BrindleAnswersLikeSplunk) {
  auto dashboard = addBackend("dashboard", BackendKind::Dashboard);
  auto brindle = addBackend("brindle");
  dashboard->setSendResult(std::string("d"));
  brindle->setSendResult(std::string("b"));
  SessionTestHarness h(env);
  start(h);
  EXPECT_EQ(send(h, message(1, 2)), Value("b"));
}

TEST_F(MessagePathTest, FlushWithoutBackendsRepliesTheError) {
  SessionTestHarness h(env);
  auto reply = h.client().call(ipc::Operation::FlushMessages, {});
  ASSERT_TRUE(reply);
  EXPECT_TRUE((*reply)[0].isNull());
  EXPECT_EQ((*reply)[1], Value(Dictionary{{"domain", Value("TelvaneErrorDomain")},
                                          {"code", Value(-1)},
                                          {"description", Value("No backends available to send message")}}));
  EXPECT_TRUE(capture.contains("flushMessagesWithCompletion: Flushing messages for session 0"));
  EXPECT_TRUE(capture.contains("internalFlushMessagesWithCompletion: No backends available to send message"));
}

TEST_F(MessagePathTest, FlushRepliesOnceWithTheFirstError) {
  auto first = addBackend("a");
  auto second = addBackend("b");
  auto third = addBackend("c");
  first->setFlushAnswer(std::string("first"), std::nullopt);
  second->setFlushAnswer(std::nullopt, makeTelvaneError(503, "server refused"));
  third->setFlushAnswer(std::string("third"), std::nullopt);
  third->setDeferFlush(true);
  SessionTestHarness h(env);
  start(h);

  int replies = 0;
  std::optional<std::string> result;
  std::optional<TelvaneError> error;
  h.run([&] {
    h.session()->flushMessagesWithCompletion([&](std::optional<std::string> r, std::optional<TelvaneError> e) {
      ++replies;
      result = r;
      error = e;
    });
  });
  EXPECT_EQ(replies, 1);
  EXPECT_FALSE(result);
  EXPECT_EQ(error, makeTelvaneError(503, "server refused"));
  third->completeDeferredFlushes();
  EXPECT_EQ(replies, 1);
  EXPECT_TRUE(env.messageLog->contains("[a -> flushMessages] first"));
  EXPECT_TRUE(env.messageLog->contains("[c -> flushMessages] third"));
  EXPECT_TRUE(capture.contains("internalFlushMessagesWithCompletion: b"));
  EXPECT_TRUE(capture.contains("internalFlushMessagesWithCompletion: c"));
}

TEST_F(MessagePathTest, FlushWithoutErrorRepliesTheLastBackendsResultOverIpc) {
  auto first = addBackend("a");
  auto second = addBackend("b");
  first->setFlushAnswer(std::string("first"), std::nullopt);
  second->setFlushAnswer(std::string("second"), std::nullopt);
  second->setDeferFlush(true);
  SessionTestHarness h(env);
  start(h);
  std::optional<Array> reply;
  std::thread caller([&] { reply = h.client().call(ipc::Operation::FlushMessages, {}); });
  ASSERT_TRUE(waitUntil([&] { return second->flushCount() == 1; }));
  second->completeDeferredFlushes();
  caller.join();
  ASSERT_TRUE(reply);
  EXPECT_EQ(*reply, (Array{Value("second"), Value()}));
}

TEST_F(MessagePathTest, OneShotRefusedByTheLimit) {
  SessionTestHarness h(env);
  h.delegate()->setLimitReached(true);
  std::vector<std::optional<std::string>> replies;
  h.run([&] {
    h.session()->sendMessageWithSessionInfo(sessionInfoMap(9, 4), userInfoMap("c", "s"), 1, 2, Value(),
                                            [&](std::optional<std::string> text) { replies.push_back(text); });
  });
  ASSERT_EQ(replies.size(), 1u);
  EXPECT_EQ(replies[0], "Exceeded maximum active reporting session limit for userInfo='" +
                            userInfoMap("c", "s").description() + "'");
  EXPECT_EQ(h.session()->sessionInfo()["SessionID"].integerValue(), 4);
  EXPECT_EQ(h.session()->sessionID(), 0u);
  EXPECT_TRUE(h.client().waitUntilDisconnected());
}

TEST_F(MessagePathTest, OneShotWithoutIdentifiers) {
  SessionTestHarness h(env);
  auto reply = h.client().call(ipc::Operation::SendMessageWithSessionInfo,
                               {Value(Dictionary{{"ComponentType", Value(9)}}), userInfoMap("c", "s"), Value(1),
                                Value(2), Value()});
  ASSERT_TRUE(reply);
  EXPECT_EQ((*reply)[0], Value("Could not retrieve identifiers from sessionInfo"));
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "sendMessageWithSessionInfo: Could not retrieve identifiers from sessionInfo"));
}

TEST_F(MessagePathTest, OneShotWithoutStorebag) {
  auto backend = addBackend("a-splunk");
  SessionTestHarness h(env);
  auto reply = h.client().call(ipc::Operation::SendMessageWithSessionInfo,
                               {sessionInfoMap(9, 4), userInfoMap("c", "s"), Value(1), Value(2), Value()});
  ASSERT_TRUE(reply);
  EXPECT_EQ((*reply)[0], Value("storebag not available"));
  EXPECT_TRUE(capture.contains("sendMessageWithSessionInfo: Sending message with session info for session 4"));
  EXPECT_EQ(env.backends->calls(), 0);
  EXPECT_TRUE(backend->sent().empty());
}

TEST_F(MessagePathTest, OneShotRepliesFinishedEvenWhenEveryBackendDropsTheEvent) {
  auto backend = addBackend("a-splunk");
  backend->setWhitelist(Array{Value(99)});
  SessionTestHarness h(env);
  h.delegate()->setStorebag(Value::dictionary());
  auto reply = h.client().call(ipc::Operation::SendMessageWithSessionInfo,
                               {sessionInfoMap(9, 4), userInfoMap("c", "s"), Value(1), Value(2), Value()});
  ASSERT_TRUE(reply);
  EXPECT_EQ((*reply)[0], Value("finished"));
  EXPECT_TRUE(backend->sent().empty());
  EXPECT_TRUE(capture.contains(
      "sendOneMessageWithSessionInfo: Dropping event with category 1 as it is not whitelisted for backend a-splunk"));
  EXPECT_TRUE(capture.contains("sendOneMessageWithSessionInfo: Sending single message with sessionID 4"));
}

TEST_F(MessagePathTest, OneShotSendsTheBarePayloadWithTheSerialOnInternalBuilds) {
  env.internalBuild = true;
  auto backend = addBackend("a-splunk");
  backend->setSendResult(std::string("posted"));
  SessionTestHarness h(env);
  h.delegate()->setStorebag(Value::dictionary());
  auto reply = h.client().call(ipc::Operation::SendMessageWithSessionInfo,
                               {sessionInfoMap(9, 4), userInfoMap("c", "s"), Value(7), Value(8),
                                Value(Dictionary{{"p", Value(1)}})});
  ASSERT_TRUE(reply);
  EXPECT_EQ((*reply)[0], Value("finished"));
  auto sent = backend->sent();
  ASSERT_EQ(sent.size(), 1u);
  EXPECT_EQ(sent[0].blob, Value(Dictionary{{"p", Value(1)}, {"SerialNum", Value("SN-42")}}));
  EXPECT_EQ(sent[0].method, 7);
  EXPECT_EQ(sent[0].respCode, 8);
  EXPECT_EQ(sent[0].flag, 0u);
  EXPECT_EQ(backend->updateStateCount(), 2);  // receivedUserInfo's update, then the per-event one
  EXPECT_TRUE(env.messageLog->contains("[a-splunk -> sendOneMessageWithSessionInfo] posted"));
}

TEST_F(MessagePathTest, OneShotWithoutBackendsLogsIt) {
  SessionTestHarness h(env);
  h.delegate()->setStorebag(Value::dictionary());
  auto reply = h.client().call(ipc::Operation::SendMessageWithSessionInfo,
                               {sessionInfoMap(9, 4), userInfoMap("c", "s"), Value(1), Value(2), Value()});
  ASSERT_TRUE(reply);
  EXPECT_EQ((*reply)[0], Value("finished"));
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "sendOneMessageWithSessionInfo: No backends available to send single message"));
}

TEST_F(MessagePathTest, UploadLogDataWithoutBackendsRepliesFalse) {
  SessionTestHarness h(env);
  auto reply = h.client().call(ipc::Operation::UploadLogData, {Value(Array{Value("x")})});
  ASSERT_TRUE(reply);
  EXPECT_EQ(*reply, (Array{Value(false), Value()}));
  EXPECT_TRUE(capture.contains(log::Level::Error, "uploadLogData: Log data array upload failed"));
}

TEST_F(MessagePathTest, UploadLogDataSucceedsWhenAnyBackendDoes) {
  auto a = addBackend("a");
  auto b = addBackend("b");
  a->setLogDataResult(true);
  SessionTestHarness h(env);
  start(h);
  Array logData{Value(Dictionary{{"LogData", Value(Bytes{1, 2})}})};
  auto reply = h.client().call(ipc::Operation::UploadLogData, {Value(logData)});
  ASSERT_TRUE(reply);
  EXPECT_EQ(*reply, (Array{Value(true), Value()}));
  EXPECT_EQ(b->logData().size(), 1u);  // every backend is asked
  EXPECT_TRUE(capture.contains("uploadLogData: Log data array upload successful"));
}

TEST_F(MessagePathTest, UploadReadsThroughTheClientsDescriptor) {
  TempDir dir;
  writeFile(dir / "report.log", "file contents");
  auto a = addBackend("a");
  auto b = addBackend("upload_server", BackendKind::Upload);
  b->setUploadResult(true);
  SessionTestHarness h(env);
  start(h);
  std::string url = "file://" + (dir / "report.log").string();
  std::vector<UniqueFd> fds;
  fds.emplace_back(::open((dir / "report.log").c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
  auto reply = h.client().call(ipc::Operation::UploadFileAtPath, {Value(url), Value(Bytes{'t', 0})}, std::move(fds));
  ASSERT_TRUE(reply);
  EXPECT_EQ(*reply, (Array{Value(true), Value(false)}));
  ASSERT_EQ(a->uploads().size(), 1u);
  EXPECT_EQ(a->uploads()[0].path, (dir / "report.log").string());
  EXPECT_EQ(a->uploads()[0].contents, "file contents");
  EXPECT_EQ(b->uploads()[0].token, (Bytes{'t', 0}));
  EXPECT_TRUE(capture.contains("uploadFileAtPath: Uploading file for session 4"));
  EXPECT_TRUE(capture.contains("uploadFileWithURL: File upload successful for " + (dir / "report.log").string()));
  EXPECT_TRUE(env.messageLog->contains("[uploadFileWithURL] Upload succeeded for file " + url));
}

TEST_F(MessagePathTest, UploadWithoutBackendsFails) {
  SessionTestHarness h(env);
  auto reply = h.client().call(ipc::Operation::UploadFileAtPath, {Value("/tmp/none%20such"), Value()});
  ASSERT_TRUE(reply);
  EXPECT_EQ(*reply, (Array{Value(false), Value(false)}));
  EXPECT_TRUE(capture.contains(log::Level::Error, "uploadFileWithURL: File upload failed for /tmp/none%20such"));
  EXPECT_TRUE(env.messageLog->contains("[uploadFileWithURL] Upload failed for file /tmp/none%20such"));
}

TEST_F(MessagePathTest, BatchedEventsSizeSumsTheBackends) {
  auto a = addBackend("a");
  auto b = addBackend("b");
  a->setBatchedSize(100);
  b->setBatchedSize(23);
  SessionTestHarness h(env);
  EXPECT_EQ(h.session()->batchedEventsSize(), 0);
  start(h);
  EXPECT_EQ(h.session()->batchedEventsSize(), 123);
}

}  // namespace
