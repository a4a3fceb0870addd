// Telvane's session operations against a fake daemon: start and state fetches, the
// local filter, sends, flushes, finishing, shared data, the delegate and the logging
// block, and reconnection after the daemon went away.
#include "client/TelvaneImpl.h"

#include <gtest/gtest.h>

#include <mutex>
#include <vector>

#include "platform/Log.h"
#include "support/ClientTestHelpers.h"
#include "support/FakeDaemon.h"

namespace telvane {
namespace {

using test::Awaited;
using test::FakeDaemon;
using Op = ipc::Operation;

Array statesReply(Array backends, Value whitelist, Value blacklist) {
  return Array{Value(std::move(backends)), std::move(whitelist), std::move(blacklist)};
}

Value numbers(std::initializer_list<int> values) {
  Array list;
  for (int v : values) list.emplace_back(v);
  return Value(std::move(list));
}

// Collects the texts given to a logging block.
class TextSink {
 public:
  Telvane::LoggingBlock block() {
    return [this](const std::string& text) {
      std::lock_guard<std::mutex> lock(mutex_);
      texts_.push_back(text);
      changed_.notify_all();
    };
  }
  bool waitFor(const std::string& text) {
    std::unique_lock<std::mutex> lock(mutex_);
    return changed_.wait_for(lock, test::kClientWaitSeconds,
                             [&] { return std::find(texts_.begin(), texts_.end(), text) != texts_.end(); });
  }
  std::vector<std::string> texts() {
    std::lock_guard<std::mutex> lock(mutex_);
    return texts_;
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<std::string> texts_;
};

class TelvaneSessionTest : public ::testing::Test {
 protected:
  std::unique_ptr<Telvane> makeClient() {
    auto telvane = Telvane::create(test::clientSessionInfo(), test::clientUserInfo(), Value());
    EXPECT_NE(telvane, nullptr);
    return telvane;
  }
  // Starts the client and waits for the start completion.
  std::optional<bool> start(Telvane& telvane) {
    Awaited<bool> started;
    telvane.startConfigurationWithCompletionHandler(started.setter());
    return started.wait();
  }
  FakeDaemon daemon_;
};

TEST_F(TelvaneSessionTest, StartCachesTheListsOfTheReply) {
  daemon_.setReply(Op::StartConfig, statesReply({Value("brindle"), Value("upload_server")}, numbers({1, 2}),
                                                numbers({5})));
  auto telvane = makeClient();
  log::LogCapture capture;
  EXPECT_EQ(start(*telvane), std::optional<bool>(true));
  EXPECT_EQ(telvane->enabledBackendNames(), (std::vector<std::string>{"brindle", "upload_server"}));
  EXPECT_EQ(telvane->whitelistedEvents(), (std::vector<std::int64_t>{1, 2}));
  EXPECT_EQ(telvane->blacklistedEvents(), (std::vector<std::int64_t>{5}));
  EXPECT_TRUE(capture.contains("Cached 2 enabled backends, ([1, 2], [5]) listed events"));
  ASSERT_TRUE(daemon_.waitForCalls(Op::FetchDisplayURL, 1));
  auto calls = daemon_.calls();
  ASSERT_EQ(calls.size(), 3u);
  EXPECT_EQ(calls[1].operation, Op::StartConfig);
  EXPECT_EQ(calls[2].operation, Op::FetchDisplayURL);
}

TEST_F(TelvaneSessionTest, StartWithoutConfigurationCompletesWithFalse) {
  auto telvane = makeClient();
  log::LogCapture capture;
  EXPECT_EQ(start(*telvane), std::optional<bool>(false));
  EXPECT_TRUE(telvane->enabledBackendNames().empty());
  EXPECT_TRUE(capture.contains("Cached 0 enabled backends, ((null), (null)) listed events"));
}

TEST_F(TelvaneSessionTest, DisplayURLGoesToTheLoggingBlock) {
  daemon_.setReply(Op::FetchDisplayURL, Array{Value("https://dash.example/s/1")});
  TextSink sink;  // outlives the client, whose last replies may still reach it
  auto telvane = makeClient();
  telvane->setMessageLoggingBlock(sink.block());
  start(*telvane);
  EXPECT_TRUE(sink.waitFor("URL for the session is: https://dash.example/s/1"));

  daemon_.setReply(Op::FetchDisplayURL, Array{Value("URL not available")});
  Awaited<bool> fetched;
  telvane->fetchReportingStatesWithUserInfo(test::clientUserInfo("other", "svc"), fetched.setter());
  EXPECT_TRUE(fetched.wait().has_value());
  EXPECT_TRUE(sink.waitFor("URL not available"));
}

TEST_F(TelvaneSessionTest, FetchStatesSendsTheUserInfoAndReplacesTheLists) {
  daemon_.setReply(Op::StartConfig, statesReply({Value("brindle")}, numbers({1}), numbers({})));
  daemon_.setReply(Op::FetchStates, statesReply({Value("dashboard")}, numbers({}), numbers({9})));
  auto telvane = makeClient();
  start(*telvane);
  Awaited<bool> fetched;
  telvane->fetchReportingStatesWithUserInfo(test::clientUserInfo("other", "svc"), fetched.setter());
  EXPECT_EQ(fetched.wait(), std::optional<bool>(true));
  EXPECT_EQ(telvane->enabledBackendNames(), std::vector<std::string>{"dashboard"});
  EXPECT_TRUE(telvane->whitelistedEvents().empty());
  EXPECT_EQ(telvane->blacklistedEvents(), std::vector<std::int64_t>{9});
  auto fetches = daemon_.calls(Op::FetchStates);
  ASSERT_EQ(fetches.size(), 1u);
  EXPECT_EQ(fetches[0].arguments, Array{test::clientUserInfo("other", "svc")});
}

TEST_F(TelvaneSessionTest, CategoryOutsideANonEmptyWhitelistNeverLeavesTheClient) {
  daemon_.setReply(Op::StartConfig, statesReply({Value("brindle")}, numbers({1, 2}), numbers({})));
  auto telvane = makeClient();
  ASSERT_EQ(start(*telvane), std::optional<bool>(true));
  log::LogCapture capture;
  Error error{"untouched", 99, "", Value()};
  Value message(Dictionary{{kTelvaneMessageParametersCategory, Value(9)}, {kTelvaneMessageParametersType, Value(1)}});
  EXPECT_FALSE(telvane->sendMessageWithDictionary(message, &error));
  EXPECT_EQ(error.domain, "untouched");
  EXPECT_TRUE(capture.contains("Event 9 is filtered by storebag"));
  EXPECT_FALSE(telvane->isWhitelistedEvent(9));
  EXPECT_TRUE(telvane->isWhitelistedEvent(2));
  // sendMessageWithCategory reports success for a filtered event.
  EXPECT_TRUE(telvane->sendMessageWithCategory(9, 1, Value()));
  // A whitelisted event sent afterwards is the only one the daemon sees.
  EXPECT_TRUE(telvane->sendMessageWithCategory(2, 1, Value()));
  ASSERT_TRUE(daemon_.waitForCalls(Op::SendMessageWithDictionary, 1));
  telvane.reset();
  ASSERT_TRUE(daemon_.waitForDisconnect(0));
  auto sends = daemon_.calls(Op::SendMessageWithDictionary);
  ASSERT_EQ(sends.size(), 1u);
  EXPECT_EQ(sends[0].arguments[0][kTelvaneMessageParametersCategory], Value(2));
}

TEST_F(TelvaneSessionTest, BlacklistedCategoryIsDropped) {
  daemon_.setReply(Op::StartConfig, statesReply({Value("brindle")}, numbers({}), numbers({4, 5})));
  auto telvane = makeClient();
  ASSERT_EQ(start(*telvane), std::optional<bool>(true));
  log::LogCapture capture;
  EXPECT_TRUE(telvane->isBlacklistedEvent(5));
  EXPECT_FALSE(telvane->isBlacklistedEvent(6));
  EXPECT_TRUE(telvane->isWhitelistedEvent(5));  // an empty whitelist lets everything through
  EXPECT_FALSE(telvane->sendMessageWithDictionary(
      Value(Dictionary{{kTelvaneMessageParametersCategory, Value(5)}, {kTelvaneMessageParametersType, Value(0)}})));
  EXPECT_TRUE(capture.contains("Event 5 is filtered by storebag"));
  EXPECT_TRUE(telvane->sendMessageWithCategory(6, 0, Value()));
  telvane.reset();
  ASSERT_TRUE(daemon_.waitForDisconnect(0));
  auto sends = daemon_.calls(Op::SendMessageWithDictionary);
  ASSERT_EQ(sends.size(), 1u);
  EXPECT_EQ(sends[0].arguments[0][kTelvaneMessageParametersCategory], Value(6));
}

TEST_F(TelvaneSessionTest, BeforeTheStartReplyEveryNonZeroCategoryPasses) {
  daemon_.setResponder(Op::StartConfig, [](const FakeDaemon::Call&) { return std::optional<Array>(); });
  auto telvane = makeClient();
  telvane->startConfigurationWithCompletionHandler(nullptr);
  for (std::uint16_t category : {1, 500, 65535}) {
    EXPECT_TRUE(telvane->isWhitelistedEvent(category));
    EXPECT_FALSE(telvane->isBlacklistedEvent(category));
    EXPECT_TRUE(telvane->sendMessageWithDictionary(Value(Dictionary{
        {kTelvaneMessageParametersCategory, Value(category)}, {kTelvaneMessageParametersType, Value(3)}})));
  }
  EXPECT_TRUE(daemon_.waitForCalls(Op::SendMessageWithDictionary, 3));
}

TEST_F(TelvaneSessionTest, MissingParametersAndCategoryZeroAreErrors) {
  auto telvane = makeClient();
  Error error;
  EXPECT_FALSE(telvane->sendMessageWithDictionary(Value(Dictionary{{kTelvaneMessageParametersType, Value(1)}}), &error));
  EXPECT_EQ(error.domain, "Missing mandatory parameter 'category'");
  EXPECT_EQ(error.code, 7);

  EXPECT_FALSE(
      telvane->sendMessageWithDictionary(Value(Dictionary{{kTelvaneMessageParametersCategory, Value(3)}}), &error));
  EXPECT_EQ(error.domain, "Missing mandatory parameter 'type'");
  EXPECT_EQ(error.code, 7);

  error = Error{};
  EXPECT_FALSE(telvane->sendMessageWithDictionary(
      Value(Dictionary{{kTelvaneMessageParametersCategory, Value(0)}, {kTelvaneMessageParametersType, Value(1)}}),
      &error));
  EXPECT_EQ(error.domain, "TelvaneErrorDomain");
  EXPECT_EQ(error.code, 4);

  error = Error{};
  EXPECT_FALSE(telvane->sendMessageWithCategory(0, 1, Value(), &error));
  EXPECT_EQ(error.domain, "TelvaneErrorDomain");
  EXPECT_EQ(error.code, 4);

  telvane.reset();
  ASSERT_TRUE(daemon_.waitForDisconnect(0));
  EXPECT_TRUE(daemon_.calls(Op::SendMessageWithDictionary).empty());
}

TEST_F(TelvaneSessionTest, SendCarriesTheMessageMapAndLogsTheReply) {
  daemon_.setResponder(Op::SendMessageWithDictionary, [](const FakeDaemon::Call& call) {
    auto category = call.arguments[0][kTelvaneMessageParametersCategory].integerValue();
    return std::optional<Array>(category == 7 ? Array{Value("accepted 7")} : Array{Value()});
  });
  TextSink sink;  // outlives the client, whose last replies may still reach it
  auto telvane = makeClient();
  telvane->setMessageLoggingBlock(sink.block());
  log::LogCapture capture;
  Value payload(Dictionary{{"duration", Value(12)}});
  EXPECT_TRUE(telvane->sendMessageWithCategory(9, 1, Value()));
  EXPECT_TRUE(telvane->sendMessageWithCategory(7, 8, payload));
  // Replies come in order: once the second is here, so is the first.
  ASSERT_TRUE(sink.waitFor("accepted 7"));
  telvane.reset();
  ASSERT_TRUE(daemon_.waitForDisconnect(0));
  auto sends = daemon_.calls(Op::SendMessageWithDictionary);
  ASSERT_EQ(sends.size(), 2u);
  EXPECT_EQ(sends[1].arguments[0], Value(Dictionary{{kTelvaneMessageParametersCategory, Value(7)},
                                                    {kTelvaneMessageParametersType, Value(8)},
                                                    {kTelvaneMessageParametersPayload, payload},
                                                    {kTelvaneMessageParametersFlag, Value(0)}}));
  EXPECT_FALSE(sends[0].arguments[0].asDictionary()->contains(kTelvaneMessageParametersPayload));
  EXPECT_TRUE(capture.contains("sendMessageWithDictionary: accepted 7"));
  EXPECT_TRUE(capture.contains("sendMessageWithDictionary: (null)"));
  EXPECT_EQ(sink.texts(), std::vector<std::string>{"accepted 7"});
}

class RecordingDelegate : public TelvaneMessageSentDelegate {
 public:
  void didSendMessageForReportingClient(Telvane& client, const Value& event) override {
    std::lock_guard<std::mutex> lock(mutex);
    clients.push_back(&client);
    events.push_back(event);
    changed.notify_all();
  }
  std::mutex mutex;
  std::condition_variable changed;
  std::vector<Telvane*> clients;
  std::vector<Value> events;
};

TEST_F(TelvaneSessionTest, DelegateHearsOfEveryLocallyAcceptedEvent) {
  daemon_.setReply(Op::StartConfig, statesReply({Value("brindle")}, numbers({1}), numbers({})));
  auto delegate = std::make_shared<RecordingDelegate>();
  auto telvane = makeClient();
  start(*telvane);
  telvane->setMessageSentDelegate(delegate);
  EXPECT_EQ(telvane->messageSentDelegate(), delegate);
  telvane->sendMessageWithCategory(1, 2, Value());
  telvane->sendMessageWithCategory(3, 4, Value());  // filtered, but told all the same
  EXPECT_FALSE(telvane->sendMessageWithCategory(0, 4, Value()));  // refused: not told
  std::unique_lock<std::mutex> lock(delegate->mutex);
  ASSERT_TRUE(
      delegate->changed.wait_for(lock, test::kClientWaitSeconds, [&] { return delegate->events.size() == 2; }));
  EXPECT_EQ(delegate->clients[0], telvane.get());
  EXPECT_EQ(delegate->events[0][kTelvaneMessageParametersCategory], Value(1));
  EXPECT_EQ(delegate->events[1][kTelvaneMessageParametersCategory], Value(3));
}

TEST_F(TelvaneSessionTest, DelegateIsHeldWeakly) {
  auto telvane = makeClient();
  auto delegate = std::make_shared<RecordingDelegate>();
  std::weak_ptr<RecordingDelegate> weak = delegate;
  telvane->setMessageSentDelegate(delegate);
  delegate.reset();
  EXPECT_TRUE(weak.expired());
  EXPECT_EQ(telvane->messageSentDelegate(), nullptr);
}

TEST_F(TelvaneSessionTest, FlushCompletionReceivesTheDaemonsError) {
  daemon_.setReply(Op::FlushMessages,
                   Array{Value(), Value(Dictionary{{"domain", Value("TelvaneErrorDomain")},
                                                   {"code", Value(-1)},
                                                   {"description", Value("No backends available to send message")}})});
  auto telvane = makeClient();
  log::LogCapture capture;
  Awaited<std::optional<Error>> flushed;
  telvane->flushMessagesWithCompletion(flushed.setter());
  auto error = flushed.wait();
  ASSERT_TRUE(error.has_value());
  ASSERT_TRUE(error->has_value());
  EXPECT_EQ((*error)->domain, "TelvaneErrorDomain");
  EXPECT_EQ((*error)->code, -1);
  EXPECT_EQ((*error)->description, "No backends available to send message");
  EXPECT_TRUE(capture.contains(
      "flushMessagesWithCompletion: flush failed with error 'No backends available to send message'"));
}

TEST_F(TelvaneSessionTest, SuccessfulFlushPassesTheReplyText) {
  daemon_.setReply(Op::FlushMessages, Array{Value("flushed 3 events"), Value()});
  TextSink sink;  // outlives the client, whose last replies may still reach it
  auto telvane = makeClient();
  telvane->setMessageLoggingBlock(sink.block());
  log::LogCapture capture;
  Awaited<std::optional<Error>> flushed;
  telvane->flushMessagesWithCompletion(flushed.setter());
  auto error = flushed.wait();
  ASSERT_TRUE(error.has_value());
  EXPECT_FALSE(error->has_value());
  EXPECT_TRUE(capture.contains("flushMessagesWithCompletion: flushed session successfully with reply flushed 3 events"));
  EXPECT_EQ(sink.texts(), std::vector<std::string>{"flushed 3 events"});

  EXPECT_TRUE(telvane->flushMessages());
  EXPECT_TRUE(capture.contains("flushMessages:"));
  EXPECT_TRUE(daemon_.waitForCalls(Op::FlushMessages, 2));
}

TEST_F(TelvaneSessionTest, FinishAndSharedDataAreForwarded) {
  auto telvane = makeClient();
  telvane->updateSharedDataWithDictionary(Value(Dictionary{{"call", Value("abc")}}));
  telvane->updateSharedDataForKey("room", Value(12));
  telvane->updateSharedDataForKey("room", Value());
  telvane->finishSession();
  ASSERT_TRUE(daemon_.waitForCalls(Op::FinishSessionGracefully, 1));
  auto calls = daemon_.calls();
  ASSERT_EQ(calls.size(), 5u);
  EXPECT_EQ(calls[1].operation, Op::UpdateSharedDataWithDictionary);
  EXPECT_EQ(calls[1].arguments, Array{Value(Dictionary{{"call", Value("abc")}})});
  EXPECT_EQ(calls[2].operation, Op::UpdateSharedDataForKey);
  EXPECT_EQ(calls[2].arguments, (Array{Value("room"), Value(12)}));
  EXPECT_EQ(calls[3].arguments, (Array{Value("room"), Value()}));
  EXPECT_EQ(calls[4].operation, Op::FinishSessionGracefully);
  EXPECT_FALSE(calls[4].expectsReply);
}

TEST_F(TelvaneSessionTest, NextCallAfterTheDaemonWentAwayReconnectsAndRestoresTheSession) {
  daemon_.setReply(Op::StartConfig, statesReply({Value("brindle")}, numbers({}), numbers({})));
  auto telvane = makeClient();
  ASSERT_EQ(start(*telvane), std::optional<bool>(true));
  // A flush the daemon never answers tells when the client has noticed the end.
  daemon_.setResponder(Op::FlushMessages, [](const FakeDaemon::Call&) { return std::optional<Array>(); });
  Awaited<std::optional<Error>> flushed;
  telvane->flushMessagesWithCompletion(flushed.setter());
  ASSERT_TRUE(daemon_.waitForCalls(Op::FlushMessages, 1));
  log::LogCapture capture;
  daemon_.dropConnections();
  auto lost = flushed.wait();
  ASSERT_TRUE(lost.has_value() && lost->has_value());
  EXPECT_EQ((*lost)->code, -1);
  EXPECT_EQ((*lost)->description, "IPC connection interrupted");
  EXPECT_TRUE(capture.contains("initWithSessionInfo: IPC connection interrupted"));

  EXPECT_TRUE(telvane->sendMessageWithCategory(3, 1, Value()));
  ASSERT_TRUE(daemon_.waitForCalls(Op::SendMessageWithDictionary, 1));
  std::vector<Op> onNewConnection;
  Array sessionInfoArguments;
  for (const auto& call : daemon_.calls()) {
    if (call.connection != 1) continue;
    onNewConnection.push_back(call.operation);
    if (call.operation == Op::SetSessionInfo) sessionInfoArguments = call.arguments;
  }
  EXPECT_EQ(onNewConnection, (std::vector<Op>{Op::SetSessionInfo, Op::StartConfig, Op::SendMessageWithDictionary}));
  EXPECT_EQ(sessionInfoArguments, daemon_.calls(Op::SetSessionInfo)[0].arguments);
  EXPECT_EQ(daemon_.connectionCount(), 2u);
}

TEST_F(TelvaneSessionTest, StartInterruptedBeforeItsReplyCompletesWithFalse) {
  daemon_.setResponder(Op::StartConfig, [](const FakeDaemon::Call&) { return std::optional<Array>(); });
  auto telvane = makeClient();
  Awaited<bool> started;
  telvane->startConfigurationWithCompletionHandler(started.setter());
  ASSERT_TRUE(daemon_.waitForCalls(Op::StartConfig, 1));
  daemon_.dropConnections();
  EXPECT_EQ(started.wait(), std::optional<bool>(false));

  // Starting again on the new connection does not send the start twice.
  daemon_.setReply(Op::StartConfig, statesReply({Value("brindle")}, numbers({}), numbers({})));
  EXPECT_EQ(start(*telvane), std::optional<bool>(true));
  std::size_t startsOnNewConnection = 0;
  for (const auto& call : daemon_.calls(Op::StartConfig)) startsOnNewConnection += call.connection == 1 ? 1 : 0;
  EXPECT_EQ(startsOnNewConnection, 1u);
}

}  // namespace
}  // namespace telvane
