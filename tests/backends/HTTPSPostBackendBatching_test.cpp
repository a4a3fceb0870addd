// What the HTTPS post backend does with each event: drop, post at once or batch, and
// how batches are flushed.
#include <gtest/gtest.h>

#include <thread>

#include "backends/BackendTestSupport.h"

namespace telvane {
namespace {

using test::enablingRule;
using test::numbers;
using test::profileWithRules;
using test::userInfo;

struct FlushOutcome {
  int calls = 0;
  std::optional<std::string> result;
  std::optional<TelvaneError> error;

  TelvaneBackend::FlushCompletion completion() {
    return [this](std::optional<std::string> r, std::optional<TelvaneError> e) {
      ++calls;
      result = std::move(r);
      error = std::move(e);
    };
  }
};

class HTTPSPostBackendBatchingTest : public test::BackendTestBase {
 protected:
  std::shared_ptr<HTTPSPostBackend> makeBatchingBackend(Dictionary rule = enablingRule()) {
    auto backend = makeEnabledBackend(std::move(rule));
    backend->setBatchEvents(true);
    return backend;
  }

  std::optional<std::string> send(HTTPSPostBackend& backend, std::uint16_t method, std::uint32_t flag,
                                  Dictionary payload = {}) {
    return backend.sendMessage(blob(std::move(payload)), at(1'700'000'010), method, 0, flag);
  }

  std::vector<Value> postedEvents(std::size_t index) {
    Value document = test::documentOf(helper->postedRequest(index));
    const Array* events = document["events"].asArray();
    return events ? *events : std::vector<Value>{};
  }
};

TEST_F(HTTPSPostBackendBatchingTest, ADisabledBackendNeitherSendsNorBatches) {
  auto backend = makeBatchingBackend();
  backend->setState(kBackendStateDisabled);
  EXPECT_FALSE(send(*backend, 1, kMessageFlagRealtime).has_value());
  EXPECT_FALSE(send(*backend, 1, kMessageFlagOrdinary).has_value());
  EXPECT_EQ(helper->postCount(), 0u);
  EXPECT_TRUE(backend->batchedEvents().empty());
  EXPECT_FALSE(capture.containsPrefix("HTTPSPostBackend(sendMessage)"));
}

TEST_F(HTTPSPostBackendBatchingTest, ADeferredBackendBatchesUntilPromotedThenFlushesBeforeARealtimeEvent) {
  auto backend = makeBatchingBackend();
  backend->setState(kBackendStateDeferred);
  EXPECT_FALSE(send(*backend, 1, kMessageFlagOrdinary).has_value());
  EXPECT_FALSE(send(*backend, 2, kMessageFlagRealtime).has_value());
  EXPECT_TRUE(capture.contains("HTTPSPostBackend(sendMessage): realtime is 1"));
  EXPECT_TRUE(capture.contains("HTTPSPostBackend(sendMessage): Batching 3, 1, 1"));
  EXPECT_EQ(backend->state(), kBackendStateDeferred);
  // The promoting event is still batched; it moves the state for later events.
  EXPECT_FALSE(send(*backend, 3, kMessageFlagPromote).has_value());
  EXPECT_EQ(backend->state(), kBackendStateEnabled);
  EXPECT_EQ(backend->batchedEvents().size(), 3u);
  EXPECT_EQ(helper->postCount(), 0u);

  capture.clear();
  std::optional<std::string> text = send(*backend, 4, kMessageFlagRealtime);
  EXPECT_TRUE(capture.contains(
      "HTTPSPostBackend(sendMessage): Got a realtime event and some events have already been batched. Forcing Flush "
      "here to keep events in order."));
  EXPECT_TRUE(capture.contains("HTTPSPostBackend(flushMessagesWithCompletion): called"));
  EXPECT_TRUE(capture.contains("HTTPSPostBackend(sendMessage): Sending 2, 1, 1"));
  ASSERT_EQ(helper->postCount(), 2u);
  std::vector<Value> flushed = postedEvents(0);
  ASSERT_EQ(flushed.size(), 3u);
  EXPECT_EQ(flushed[0]["_method"], Value(1));
  EXPECT_EQ(flushed[1]["_method"], Value(2));
  EXPECT_EQ(flushed[2]["_method"], Value(3));
  EXPECT_EQ(helper->postedRequest(0).url, "https://collector.test/batch");
  std::vector<Value> alone = postedEvents(1);
  ASSERT_EQ(alone.size(), 1u);
  EXPECT_EQ(alone[0]["_method"], Value(4));
  EXPECT_EQ(helper->postedRequest(1).url, "https://collector.test/realtime");
  EXPECT_EQ(test::headerOf(helper->postedRequest(1), "X-TVX-Event-Map"), std::optional<std::string>("4 0"));

  ASSERT_TRUE(text.has_value());
  std::string flushedText = *json::write(test::documentOf(helper->postedRequest(0)), true);
  EXPECT_EQ(text->rfind("Flushed events:\n", 0), 0u);
  std::size_t standalone = text->find("\nStandalone event:\n");
  ASSERT_NE(standalone, std::string::npos);
  EXPECT_EQ(json::parse(text->substr(16, standalone - 16)).value()["events"].asArray()->size(), 3u);
  EXPECT_EQ(json::parse(text->substr(standalone + 19)).value()["events"].asArray()->size(), 1u);
  EXPECT_TRUE(backend->isImmutable());
  EXPECT_TRUE(backend->batchedEvents().empty());
}

TEST_F(HTTPSPostBackendBatchingTest, TheFiftyFirstEventOfAMethodFlushesTheFiftyBeforeIt) {
  auto backend = makeBatchingBackend();
  ASSERT_EQ(backend->eventThreshold(), 49);
  for (int i = 0; i < 50; ++i) EXPECT_FALSE(send(*backend, 7, kMessageFlagOrdinary).has_value());
  EXPECT_EQ(helper->postCount(), 0u);
  EXPECT_EQ(backend->eventMethodCounts()[7], 50);

  std::optional<std::string> text = send(*backend, 7, kMessageFlagOrdinary);
  EXPECT_TRUE(text.has_value());
  EXPECT_TRUE(capture.contains(
      "HTTPSPostBackend(batchEvent): Flushing all batched events as we reached event threshold for method 7"));
  ASSERT_EQ(helper->postCount(), 1u);
  std::vector<Value> flushed = postedEvents(0);
  ASSERT_EQ(flushed.size(), 50u);
  EXPECT_EQ(flushed.front()["_eventNumber"], Value(1));
  EXPECT_EQ(flushed.back()["_eventNumber"], Value(50));
  // The 51st opens the next batch.
  std::vector<Value> batched = backend->batchedEvents();
  ASSERT_EQ(batched.size(), 1u);
  EXPECT_EQ(batched[0]["_eventNumber"], Value(51u));
}

TEST_F(HTTPSPostBackendBatchingTest, TheFlushClearsTheCountsSoTheNextThresholdFlushCarriesOneMore) {
  auto backend = makeBatchingBackend(
      [] {
        Dictionary rule = enablingRule();
        rule.set("event_threshold", Value(2));
        return rule;
      }());
  for (int i = 0; i < 4; ++i) send(*backend, 7, kMessageFlagOrdinary);  // the 4th flushes 3
  ASSERT_EQ(helper->postCount(), 1u);
  EXPECT_EQ(postedEvents(0).size(), 3u);
  // The flush cleared every count, also the one the 4th event set; it is in the batch
  // but not counted, so the next flush comes with the 8th event and carries four.
  for (int i = 0; i < 3; ++i) send(*backend, 7, kMessageFlagOrdinary);
  EXPECT_EQ(helper->postCount(), 1u);
  send(*backend, 7, kMessageFlagOrdinary);
  ASSERT_EQ(helper->postCount(), 2u);
  EXPECT_EQ(postedEvents(1).size(), 4u);
}

TEST_F(HTTPSPostBackendBatchingTest, CountsArePerMethodAndTheFlushCarriesEveryMethod) {
  auto backend = makeBatchingBackend(
      [] {
        Dictionary rule = enablingRule();
        rule.set("event_threshold", Value(1));
        return rule;
      }());
  send(*backend, 1, kMessageFlagOrdinary);
  send(*backend, 2, kMessageFlagOrdinary);
  send(*backend, 1, kMessageFlagOrdinary);
  send(*backend, 2, kMessageFlagOrdinary);
  EXPECT_EQ(helper->postCount(), 0u);
  send(*backend, 2, kMessageFlagOrdinary);
  ASSERT_EQ(helper->postCount(), 1u);
  EXPECT_EQ(postedEvents(0).size(), 4u);
}

TEST_F(HTTPSPostBackendBatchingTest, BlacklistedEventsAreBatchedButNeverPosted) {
  auto backend = makeBatchingBackend(
      [] {
        Dictionary rule = enablingRule();
        rule.set("event_blacklist", numbers({9}));
        return rule;
      }());
  send(*backend, 9, kMessageFlagOrdinary);
  send(*backend, 9, kMessageFlagOrdinary);
  EXPECT_EQ(backend->batchedEvents().size(), 2u);
  FlushOutcome outcome;
  EXPECT_FALSE(backend->flushMessages(outcome.completion()).has_value());
  EXPECT_EQ(outcome.calls, 1);
  EXPECT_EQ(outcome.error, std::optional<TelvaneError>(makeTelvaneError(
                               -1, "Nothing to flush: batched events were completely filtered out")));
  EXPECT_EQ(capture.count(
                "flushMessagesWithCompletion: Dropping event with category 9 as it is blacklisted for backend splunk"),
            2u);
  EXPECT_EQ(helper->postCount(), 0u);
  EXPECT_TRUE(backend->batchedEvents().empty());
  EXPECT_FALSE(backend->isImmutable());

  // Mixed with others, only the blacklisted ones stay behind.
  send(*backend, 9, kMessageFlagOrdinary);
  send(*backend, 3, kMessageFlagOrdinary);
  EXPECT_TRUE(backend->flushMessages(nullptr).has_value());
  ASSERT_EQ(helper->postCount(), 1u);
  ASSERT_EQ(postedEvents(0).size(), 1u);
  EXPECT_EQ(postedEvents(0)[0]["_method"], Value(3));
}

TEST_F(HTTPSPostBackendBatchingTest, EventsOutsideTheWhitelistAreDroppedAtTheFlush) {
  auto backend = makeBatchingBackend(
      [] {
        Dictionary rule = enablingRule();
        rule.set("event_whitelist", numbers({3}));
        return rule;
      }());
  send(*backend, 4, kMessageFlagOrdinary);
  send(*backend, 3, kMessageFlagOrdinary);
  backend->flushMessages(nullptr);
  EXPECT_TRUE(capture.contains(
      "flushMessagesWithCompletion: Dropping event with category 4 as it is not whitelisted for backend splunk"));
  ASSERT_EQ(helper->postCount(), 1u);
  ASSERT_EQ(postedEvents(0).size(), 1u);
}

TEST_F(HTTPSPostBackendBatchingTest, APendingBackendLosesItsBatchAtAFlush) {
  auto backend = makeBackend(profileWithRules({enablingRule()}));
  ASSERT_EQ(backend->updateState(), kBackendStatePending);  // user information required, none yet
  send(*backend, 1, kMessageFlagRealtime);
  send(*backend, 2, kMessageFlagOrdinary);
  EXPECT_TRUE(capture.contains("HTTPSPostBackend(sendMessage): Batching 0, 0, 1"));
  EXPECT_EQ(backend->batchedEvents().size(), 2u);
  FlushOutcome outcome;
  backend->flushMessages(outcome.completion());
  EXPECT_EQ(outcome.error, std::optional<TelvaneError>(makeTelvaneError(-1, "Nothing to flush")));
  EXPECT_TRUE(backend->batchedEvents().empty());
  FlushOutcome again;
  backend->flushMessages(again.completion());
  EXPECT_EQ(again.error, std::optional<TelvaneError>(makeTelvaneError(-1, "Nothing to flush")));
  EXPECT_EQ(helper->postCount(), 0u);
}

TEST_F(HTTPSPostBackendBatchingTest, AFlushWithoutRequiredUserInfoKeepsTheBatch) {
  auto backend = makeBackend(profileWithRules({enablingRule()}));
  backend->setState(kBackendStateEnabled);  // as a parent session would set it
  send(*backend, 1, kMessageFlagRealtime);  // realtime, but user information is missing: batched
  FlushOutcome outcome;
  backend->flushMessages(outcome.completion());
  EXPECT_EQ(outcome.error,
            std::optional<TelvaneError>(makeTelvaneError(-1, "Can not flush: userInfo is required")));
  EXPECT_EQ(backend->batchedEvents().size(), 1u);
  EXPECT_EQ(helper->postCount(), 0u);
}

TEST_F(HTTPSPostBackendBatchingTest, BatchedEventsGetFilteredUserInfoWhileRealtimeEventsDoNot) {
  Dictionary rule = enablingRule();
  rule.set("filters", Value(Array{Value(Dictionary{{"key", Value("Email")}, {"action", Value("remove")}}),
                                  Value(Dictionary{{"key", Value("name")}, {"action", Value("sha256")}})}));
  auto backend = makeBackend(profileWithRules({rule}));
  backend->setBatchEvents(true);
  ASSERT_EQ(backend->updateState(), kBackendStatePending);
  send(*backend, 1, kMessageFlagOrdinary);  // batched before the user information arrives

  backend->setUserInfoDict(Value(Dictionary{{"_clientName", Value("app")},
                                            {"_serviceName", Value("svc")},
                                            {"email", Value("a@b.test")},
                                            {"name", Value("abc")}}));
  ASSERT_EQ(backend->updateState(), kBackendStateEnabled);
  send(*backend, 2, kMessageFlagRealtime);  // forces the flush, then goes alone
  ASSERT_EQ(helper->postCount(), 2u);
  Value batched = postedEvents(0).at(0);
  EXPECT_FALSE(batched.asDictionary()->contains("email"));
  EXPECT_EQ(batched["name"], Value(TelvaneBackendBase::convertIntoSHA256("abc")));
  EXPECT_EQ(batched["_clientName"], Value("app"));
  Value realtime = postedEvents(1).at(0);
  EXPECT_EQ(realtime["email"], Value("a@b.test"));
  EXPECT_EQ(realtime["name"], Value("abc"));
}

TEST_F(HTTPSPostBackendBatchingTest, TheFlushGivesBatchedRecordsTheUserInfoOfTheFlush) {
  auto backend = makeBatchingBackend();
  backend->setUserInfoDict(Value(Dictionary{{"_clientName", Value("app")}, {"_serviceName", Value("svc")},
                                            {"team", Value("a")}}));
  send(*backend, 1, kMessageFlagOrdinary);
  // Shared data replaces a user-information value when the event arrives...
  backend->sendMessage(Value(Dictionary{{"ClientData", Value::dictionary()},
                                        {"SharedData", Value(Dictionary{{"team", Value("shared")}})}}),
                       at(1'700'000'010), 2, 0, kMessageFlagOrdinary);
  EXPECT_EQ(backend->batchedEvents().at(1)["team"], Value("shared"));
  send(*backend, 3, kMessageFlagOrdinary);
  // ...and the user information changes before the flush.
  backend->setUserInfoDict(Value(Dictionary{{"_clientName", Value("app")}, {"_serviceName", Value("svc")},
                                            {"team", Value("b")}, {"extra", Value(Bytes{1})}}));
  ASSERT_TRUE(backend->flushMessages(nullptr).has_value());
  std::vector<Value> posted = postedEvents(0);
  ASSERT_EQ(posted.size(), 3u);
  for (const Value& record : posted) {
    EXPECT_EQ(record["team"], Value("b"));
    EXPECT_FALSE(record.asDictionary()->contains("extra"));  // bytes cannot go into JSON
  }
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "HTTPSPostBackend(createMessageForPostAndLogging): JSON serializer unable to handle "
                               "key: extra, value: <01>"));
}

TEST_F(HTTPSPostBackendBatchingTest, RecordsMadeWithTheFlushUserInfoGoOutAsTheyWereWritten) {
  auto backend = makeBatchingBackend();
  send(*backend, 1, kMessageFlagOrdinary, Dictionary{{"n", Value(2.5)}, {"s", Value("x\ty")}});
  std::vector<Value> batched = backend->batchedEvents();
  ASSERT_TRUE(backend->flushMessages(nullptr).has_value());
  std::vector<Value> posted = postedEvents(0);
  ASSERT_EQ(posted.size(), 1u);
  EXPECT_EQ(posted[0], batched[0]);
  EXPECT_EQ(posted[0]["_clientName"], Value("app"));
}

TEST_F(HTTPSPostBackendBatchingTest, CorrelatedSessionIdentifierRewritesEveryBatchedRecord) {
  auto backend = makeBatchingBackend();
  backend->setCombinedSessionIDString("4242");
  for (int i = 0; i < 3; ++i) send(*backend, 1, kMessageFlagOrdinary);
  backend->setCorrelatedSessionID("17.4242");
  std::vector<Value> batched = backend->batchedEvents();
  ASSERT_EQ(batched.size(), 3u);
  for (const Value& record : batched) EXPECT_EQ(record["_sessionID"], Value("17.4242"));
  EXPECT_EQ(backend->combinedSessionIDString(), std::optional<std::string>("17.4242"));
  send(*backend, 1, kMessageFlagOrdinary);
  EXPECT_EQ(backend->batchedEvents().back()["_sessionID"], Value("17.4242"));
}

TEST_F(HTTPSPostBackendBatchingTest, WithoutBatchingEachEventIsPostedAtOnce) {
  auto backend = makeEnabledBackend();
  std::optional<std::string> text = send(*backend, 6, kMessageFlagOrdinary, Dictionary{{"n", Value(1)}});
  ASSERT_TRUE(text.has_value());
  EXPECT_EQ(text->rfind("Flushed events:", 0), std::string::npos);
  EXPECT_EQ(json::parse(*text).value()["events"].asArray()->size(), 1u);
  ASSERT_EQ(helper->postCount(), 1u);
  EXPECT_EQ(helper->postedRequest(0).url, "https://collector.test/batch");
  EXPECT_EQ(test::headerOf(helper->postedRequest(0), "X-TVX-Event-Map"), std::optional<std::string>("6 0"));
  EXPECT_TRUE(backend->batchedEvents().empty());
  EXPECT_FALSE(backend->isImmutable());  // only a flush of batched events freezes
}

TEST_F(HTTPSPostBackendBatchingTest, ARealtimeEventWithoutABatchGoesAloneWithoutAFlush) {
  auto backend = makeBatchingBackend();
  std::optional<std::string> text = send(*backend, 2, kMessageFlagRealtimeAndPromote);
  ASSERT_TRUE(text.has_value());
  EXPECT_EQ(text->rfind("Flushed events:", 0), std::string::npos);
  EXPECT_FALSE(capture.contains("HTTPSPostBackend(flushMessagesWithCompletion): called"));
  ASSERT_EQ(helper->postCount(), 1u);
  EXPECT_EQ(helper->postedRequest(0).url, "https://collector.test/realtime");
}

TEST_F(HTTPSPostBackendBatchingTest, TheStopMessageCarriesConsentAndSamplingSettings) {
  auto backend = makeEnabledBackend();
  backend->setBatchEvents(false);
  backend->sendMessage(blob(Dictionary{{"GracefulTermination", Value(1)}}), at(1'700'000'010), 0, 1,
                       kMessageFlagOrdinary);
  EXPECT_TRUE(capture.contains(
      "HTTPSPostBackend(sendMessage): Adding dnu type and sampling threshold to SESSION_TYPE_STOP message "
      "dictionary"));
  Value stop = postedEvents(0).at(0);
  EXPECT_EQ(stop["Opt"], Value(0));
  EXPECT_EQ(stop["SamplingThreshold"], Value(1.0));
  EXPECT_EQ(stop["OverrideSampling"], Value(-1));
  EXPECT_EQ(stop["Batch"], Value(0));
  EXPECT_EQ(stop["_totalBytesSent"], Value(0));
  EXPECT_EQ(stop["GracefulTermination"], Value(1));
}

TEST_F(HTTPSPostBackendBatchingTest, AMissingMessageIsLoggedAndSentEmpty) {
  auto backend = makeEnabledBackend();
  backend->setBatchEvents(false);
  EXPECT_TRUE(backend->sendMessage(Value(), at(1'700'000'010), 0, 1, kMessageFlagOrdinary).has_value());
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "HTTPSPostBackend(sendMessage): SESSION_TYPE_STOP message dictionary is nil"));
  Value record = postedEvents(0).at(0);
  EXPECT_EQ(record["_method"], Value(0));
  EXPECT_EQ(record["_status"], Value(1));
}

TEST_F(HTTPSPostBackendBatchingTest, WithoutClientDataTheMessageItselfIsThePayload) {
  auto backend = makeEnabledBackend();
  backend->setBatchEvents(false);
  // As a one-shot send hands it over; shared data is merged, and its map itself is
  // nested data that this session may not send.
  Value message(Dictionary{{"plain", Value(5)}, {"SharedData", Value(Dictionary{{"team", Value("x")}})}});
  backend->sendMessage(message, at(1'700'000'010), 3, 3, kMessageFlagOrdinary);
  Value record = postedEvents(0).at(0);
  EXPECT_EQ(record["plain"], Value(5));
  EXPECT_EQ(record["team"], Value("x"));
  EXPECT_FALSE(record.asDictionary()->contains("SharedData"));
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "HTTPSPostBackend(createMessageForPostAndLogging): JSON serializer unable to handle "
                               "key: SharedData, value: {\"team\": \"x\"}"));
  // A message that is not a map gives an empty payload.
  backend->sendMessage(Value("junk"), at(1'700'000'010), 3, 3, kMessageFlagOrdinary);
  EXPECT_EQ(helper->postCount(), 2u);
}

TEST_F(HTTPSPostBackendBatchingTest, TheFlushCompletionGetsTheReadableTextWhenThePostIsAnswered) {
  auto backend = makeBatchingBackend();
  send(*backend, 1, kMessageFlagOrdinary);
  FlushOutcome outcome;
  std::optional<std::string> readable = backend->flushMessages(outcome.completion());
  ASSERT_TRUE(readable.has_value());
  EXPECT_EQ(outcome.calls, 0);  // not before the server answered
  helper->answerPost(0, 200);
  EXPECT_EQ(outcome.calls, 1);
  EXPECT_EQ(outcome.result, readable);
  EXPECT_FALSE(outcome.error.has_value());

  // The interface's flush takes the same path.
  send(*backend, 1, kMessageFlagOrdinary);
  FlushOutcome viaInterface;
  static_cast<TelvaneBackend&>(*backend).flushMessagesWithCompletion(viaInterface.completion());
  helper->answerPost(1, 200);
  EXPECT_EQ(viaInterface.calls, 1);
  EXPECT_TRUE(viaInterface.result.has_value());
}

TEST_F(HTTPSPostBackendBatchingTest, WithoutConsentToLogAFlushGivesNoTextAndDoesNotFreeze) {
  consent = false;
  auto backend = makeBatchingBackend(
      [] {
        Dictionary rule = enablingRule();
        rule.set("override_dnu", Value(1));
        return rule;
      }());
  send(*backend, 1, kMessageFlagOrdinary);
  EXPECT_FALSE(backend->flushMessages(nullptr).has_value());
  EXPECT_EQ(helper->postCount(), 1u);
  EXPECT_FALSE(backend->isImmutable());
}

TEST_F(HTTPSPostBackendBatchingTest, AfterAFlushWithTextTheStateIsFrozen) {
  auto backend = makeBatchingBackend();
  send(*backend, 1, kMessageFlagOrdinary);
  ASSERT_TRUE(backend->flushMessages(nullptr).has_value());
  ASSERT_TRUE(backend->isImmutable());
  consent = false;
  backend->setUserInfoDict(userInfo("someone-else", "svc"));
  EXPECT_EQ(backend->updateState(), kBackendStateEnabled);
  backend->setState(kBackendStateDeferred);
  EXPECT_EQ(backend->updateState(), kBackendStateDeferred);
}

TEST_F(HTTPSPostBackendBatchingTest, AFlushWithNothingBatchedReportsNothingToFlush) {
  auto backend = makeBatchingBackend();
  FlushOutcome outcome;
  EXPECT_FALSE(backend->flushMessages(outcome.completion()).has_value());
  EXPECT_EQ(outcome.calls, 1);
  EXPECT_EQ(outcome.error, std::optional<TelvaneError>(makeTelvaneError(-1, "Nothing to flush")));
}

TEST_F(HTTPSPostBackendBatchingTest, BatchedSizeIsTheEstimateOfTheBatchedRecordTexts) {
  auto backend = makeBatchingBackend();
  EXPECT_EQ(backend->batchedEventsSize(), 0);
  send(*backend, 1, kMessageFlagOrdinary, Dictionary{{"n", Value(1)}});
  send(*backend, 2, kMessageFlagOrdinary, Dictionary{{"text", Value(std::string(1000, 'q'))}});
  // Records wait as their compact JSON; the estimate is the allocation size of that
  // text by the value type's rule.
  std::int64_t sum = 0;
  for (const Value& record : backend->batchedEvents()) sum += Value(*json::write(record)).allocationSize();
  EXPECT_EQ(backend->batchedEventsSize(), sum);
  EXPECT_GT(sum, 1000);
  backend->flushMessages(nullptr);
  EXPECT_EQ(backend->batchedEventsSize(), 0);
}

TEST_F(HTTPSPostBackendBatchingTest, OtherSessionsMayTouchTheBackendWhileItSends) {
  auto backend = makeBatchingBackend(
      [] {
        Dictionary rule = enablingRule();
        rule.set("event_threshold", Value(20));
        return rule;
      }());
  std::atomic<bool> stop{false};
  std::thread other([&] {
    while (!stop.load()) {
      backend->setSamplingThreshold(0.5);
      backend->setCorrelatedSessionID("1.4242");
      backend->batchedEventsSize();
      backend->state();
    }
  });
  for (int i = 0; i < 500; ++i) send(*backend, static_cast<std::uint16_t>(i % 3), kMessageFlagOrdinary);
  stop = true;
  other.join();
  std::size_t posted = 0;
  for (std::size_t i = 0; i < helper->postCount(); ++i) posted += postedEvents(i).size();
  EXPECT_EQ(posted + backend->batchedEvents().size(), 500u);
}

}  // namespace
}  // namespace telvane
