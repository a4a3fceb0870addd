// Requests of the HTTPS post backend (URL, body, headers, digest) and the server's
// answers, against the fake helper and, at the end, the real helper and a loopback
// HTTPS server.
#include <gtest/gtest.h>
#include <stdlib.h>

#include "backends/BackendTestSupport.h"
#include "connectivity/ReportingSessionConnectivityHelperImpl.h"
#include "platform/Crypto.h"
#include "support/Counter.h"
#include "support/TestCertificates.h"
#include "support/TlsTestServer.h"
#include "support/WaitUntil.h"
#include "util/Compression.h"

namespace telvane {
namespace {

using test::enablingRule;
using test::headerOf;
using test::profileWithRules;

struct CompletionRecord {
  std::mutex mutex;
  int calls = 0;
  std::optional<std::string> result;
  std::optional<TelvaneError> error;
  test::Counter done;

  TelvaneBackend::FlushCompletion completion() {
    return [this](std::optional<std::string> r, std::optional<TelvaneError> e) {
      {
        std::lock_guard<std::mutex> lock(mutex);
        ++calls;
        result = std::move(r);
        error = std::move(e);
      }
      done.add();
    };
  }
  int callCount() {
    std::lock_guard<std::mutex> lock(mutex);
    return calls;
  }
};

class HTTPSPostBackendPostingTest : public test::BackendTestBase {
 protected:
  // A JSON text of n bytes that compresses well.
  static std::string compressibleJson(std::size_t n) {
    std::string text = "{\"a\":\"";
    text.append(n - 8, 'z');
    text += "\"}";
    return text;
  }
};

TEST_F(HTTPSPostBackendPostingTest, PlainHttpIsForcedOntoHttpsOutsideInternalReleases) {
  auto backend = makeEnabledBackend();
  const std::pair<const char*, const char*> cases[] = {
      {"http://collector.test/p?x=1", "https://collector.test/p?x=1"},
      {"HTTP://collector.test/p", "https://collector.test/p"},
      {"ftp://a://b", "https://a"},
      {"HTTPS://collector.test/p", "HTTPS://collector.test/p"},
      {"collector.test/p", "collector.test/p"}};
  for (const auto& [given, sent] : cases) {
    backend->setPostURL(std::string(given));
    backend->postJSONMessage("{}", kMessageFlagOrdinary, std::nullopt, std::nullopt, nullptr);
    EXPECT_EQ(helper->postedRequests().back().url, sent) << given;
  }

  internalRelease = true;
  auto internal = makeEnabledBackend();
  internal->setPostURL(std::string("http://collector.test/p"));
  internal->postJSONMessage("{}", kMessageFlagOrdinary, std::nullopt, std::nullopt, nullptr);
  EXPECT_EQ(helper->postedRequests().back().url, "http://collector.test/p");
}

TEST_F(HTTPSPostBackendPostingTest, ABodyWhoseGzipFormIsLongerGoesOutUncompressed) {
  auto backend = makeEnabledBackend();
  std::string json = "{\"key\":\"abcdefghijklmnopqrstuvwxyz0123\"}";
  ASSERT_EQ(json.size(), 40u);
  ASSERT_GT(gzipDeflate(json)->size(), json.size());
  backend->postJSONMessage(json, kMessageFlagOrdinary, std::nullopt, std::nullopt, nullptr);
  HttpRequest request = helper->postedRequest(0);
  EXPECT_EQ(request.body, json);
  EXPECT_FALSE(headerOf(request, "Content-Encoding").has_value());
  EXPECT_EQ(headerOf(request, "Content-Length"), std::optional<std::string>("40"));
  EXPECT_EQ(backend->totalBytesSent(), 40u);
  EXPECT_EQ(backend->bytesSentSinceLastReport(), 40u);
}

TEST_F(HTTPSPostBackendPostingTest, ACompressibleBodyIsSentGzipped) {
  auto backend = makeEnabledBackend();
  std::string json = compressibleJson(2000);
  backend->postJSONMessage(json, kMessageFlagOrdinary, std::nullopt, std::nullopt, nullptr);
  HttpRequest request = helper->postedRequest(0);
  EXPECT_EQ(headerOf(request, "Content-Encoding"), std::optional<std::string>("gzip"));
  EXPECT_LT(request.body.size(), json.size());
  EXPECT_EQ(test::gunzip(request.body), std::optional<std::string>(json));
  EXPECT_EQ(headerOf(request, "Content-Length"), std::optional<std::string>(std::to_string(request.body.size())));
  EXPECT_EQ(backend->totalBytesSent(), request.body.size());
}

TEST_F(HTTPSPostBackendPostingTest, HeadersInOrder) {
  auto backend = makeEnabledBackend();
  backend->setIsInternal(true);
  backend->setDigestKey(Bytes{'k', 'e', 'y'});
  std::string json = compressibleJson(300);
  backend->postJSONMessage(json, kMessageFlagRealtime, std::uint16_t{7}, std::uint16_t{3}, nullptr);
  HttpRequest request = helper->postedRequest(0);
  EXPECT_EQ(request.method, "POST");
  EXPECT_EQ(request.url, "https://collector.test/realtime");
  std::vector<std::string> names;
  for (const auto& [name, value] : request.headers) names.push_back(name);
  EXPECT_EQ(names, (std::vector<std::string>{"X-TVX-Client-Name", "X-TVX-Service-Name", "X-TVX-Internal-Build",
                                             "User-Agent", "X-TVX-Client-Version", "X-TVX-Sender", "X-TVX-Event-Map",
                                             "Accept", "Content-Type", "Content-Length", "Content-Encoding",
                                             "X-TVX-DIGEST"}));
  EXPECT_EQ(headerOf(request, "X-TVX-Client-Name"), std::optional<std::string>("app"));
  EXPECT_EQ(headerOf(request, "X-TVX-Service-Name"), std::optional<std::string>("svc"));
  EXPECT_EQ(headerOf(request, "X-TVX-Internal-Build"), std::optional<std::string>("1"));
  EXPECT_EQ(headerOf(request, "User-Agent"), std::optional<std::string>("Telvane/8.1.2 (Board9; 12.4)"));
  EXPECT_EQ(headerOf(request, "X-TVX-Client-Version"), std::optional<std::string>("12"));
  EXPECT_EQ(headerOf(request, "X-TVX-Sender"), std::optional<std::string>("CNF"));
  EXPECT_EQ(headerOf(request, "X-TVX-Event-Map"), std::optional<std::string>("7 3"));
  EXPECT_EQ(headerOf(request, "Accept"), std::optional<std::string>("application/json"));
  EXPECT_EQ(headerOf(request, "Content-Type"), std::optional<std::string>("application/json"));

  // HMAC-SHA1 of the uncompressed JSON in the platform's form of byte data.
  std::string hex = crypto::hex(crypto::hmacSha1(Bytes{'k', 'e', 'y'}, json));
  std::string expected = "<" + hex.substr(0, 8) + " " + hex.substr(8, 8) + " " + hex.substr(16, 8) + " " +
                         hex.substr(24, 8) + " " + hex.substr(32, 8) + ">";
  EXPECT_EQ(headerOf(request, "X-TVX-DIGEST"), std::optional<std::string>(expected));
}

TEST_F(HTTPSPostBackendPostingTest, APresentButEmptyDigestKeyStillSignsAndNoKeySendsNoDigest) {
  auto backend = makeEnabledBackend();
  backend->setDigestKey(Bytes{});
  backend->postJSONMessage("{}", kMessageFlagRealtime, std::uint16_t{7}, std::uint16_t{3}, nullptr);
  std::string hex = crypto::hex(crypto::hmacSha1(Bytes{}, std::string("{}")));
  std::string expected = "<" + hex.substr(0, 8) + " " + hex.substr(8, 8) + " " + hex.substr(16, 8) + " " +
                         hex.substr(24, 8) + " " + hex.substr(32, 8) + ">";
  EXPECT_EQ(headerOf(helper->postedRequest(0), "X-TVX-DIGEST"), std::optional<std::string>(expected));

  backend->setDigestKey(std::nullopt);
  backend->postJSONMessage("{}", kMessageFlagRealtime, std::uint16_t{7}, std::uint16_t{3}, nullptr);
  EXPECT_FALSE(headerOf(helper->postedRequest(1), "X-TVX-DIGEST").has_value());
}

TEST_F(HTTPSPostBackendPostingTest, OptionalHeadersStayAwayWhenTheirSourceIsMissing) {
  auto backend = makeEnabledBackend();
  backend->setUserInfoDict(test::userInfo(nullptr, "svc"));
  backend->setHardwareType(std::nullopt);
  backend->setDigestKey(Bytes{1});
  backend->setDigestAlgorithm(1);  // no digest for other algorithms
  backend->postJSONMessage("{}", kMessageFlagOrdinary, std::uint16_t{7}, std::nullopt, nullptr);
  HttpRequest request = helper->postedRequest(0);
  EXPECT_FALSE(headerOf(request, "X-TVX-Client-Name").has_value());
  EXPECT_EQ(headerOf(request, "X-TVX-Service-Name"), std::optional<std::string>("svc"));
  EXPECT_FALSE(headerOf(request, "X-TVX-Internal-Build").has_value());
  EXPECT_FALSE(headerOf(request, "X-TVX-Event-Map").has_value());  // needs both numbers
  EXPECT_FALSE(headerOf(request, "X-TVX-DIGEST").has_value());
  EXPECT_EQ(headerOf(request, "User-Agent"), std::optional<std::string>("Telvane/8.1.2 ((null); 12.4)"));
  EXPECT_EQ(request.url, "https://collector.test/batch");
}

TEST_F(HTTPSPostBackendPostingTest, WithoutAURLTheCompletionGetsAnError) {
  auto backend = makeBackend(profileWithRules({enablingRule()}));
  CompletionRecord record;
  backend->postJSONMessage("{}", kMessageFlagOrdinary, std::nullopt, std::nullopt, record.completion());
  ASSERT_EQ(record.callCount(), 1);
  EXPECT_EQ(record.error, std::optional<TelvaneError>(makeTelvaneError(-1, "postURL is nil")));
  EXPECT_EQ(helper->postCount(), 0u);
  EXPECT_EQ(backend->totalBytesSent(), 0u);
}

TEST_F(HTTPSPostBackendPostingTest, WithoutAHelperNothingIsSentAndTheCompletionNeverRuns) {
  auto backend = makeEnabledBackend();
  helper.reset();
  CompletionRecord record;
  backend->postJSONMessage("{}", kMessageFlagOrdinary, std::nullopt, std::nullopt, record.completion());
  EXPECT_EQ(record.callCount(), 0);
  EXPECT_EQ(backend->reportingSessionConnectivityDelegate(), nullptr);
}

TEST_F(HTTPSPostBackendPostingTest, AServerErrorDisablesTheBackend) {
  auto backend = makeEnabledBackend();
  CompletionRecord record;
  backend->postJSONMessage("{}", kMessageFlagOrdinary, std::nullopt, std::nullopt, record.completion());
  helper->answerPost(0, 503);
  ASSERT_EQ(record.callCount(), 1);
  EXPECT_EQ(record.error,
            std::optional<TelvaneError>(makeTelvaneError(503, "backend splunk disabled by server 503 return code")));
  EXPECT_TRUE(capture.contains("postJSONMessage: backend splunk disabled by server 503 return code"));
  EXPECT_EQ(backend->state(), kBackendStateDisabled);
  // A disabled backend drops events at once.
  EXPECT_FALSE(backend->sendMessage(blob({}), at(1'700'000'010), 1, 1, kMessageFlagRealtime).has_value());
  EXPECT_EQ(helper->postCount(), 1u);
}

TEST_F(HTTPSPostBackendPostingTest, AClientErrorOrATransportErrorLeavesTheBackendEnabled) {
  auto backend = makeEnabledBackend();
  CompletionRecord notFound, failed, fine;
  backend->postJSONMessage("{}", kMessageFlagOrdinary, std::nullopt, std::nullopt, notFound.completion());
  backend->postJSONMessage("{}", kMessageFlagOrdinary, std::nullopt, std::nullopt, failed.completion());
  backend->postJSONMessage("{}", kMessageFlagOrdinary, std::nullopt, std::nullopt, fine.completion());
  helper->answerPost(0, 404);
  helper->answerPost(1, 0, makeTelvaneError(-1, "connection refused"));
  helper->answerPost(2, 200);
  EXPECT_EQ(notFound.callCount(), 1);
  EXPECT_FALSE(notFound.error.has_value());
  EXPECT_EQ(failed.error, std::optional<TelvaneError>(makeTelvaneError(-1, "connection refused")));
  EXPECT_TRUE(capture.contains("HTTPSPostBackend(postJsonMessage): post error: connection refused"));
  EXPECT_EQ(fine.callCount(), 1);
  EXPECT_FALSE(fine.error.has_value());
  EXPECT_EQ(backend->state(), kBackendStateEnabled);
}

TEST_F(HTTPSPostBackendPostingTest, ByteCountersAreReportedAndCleared) {
  internalRelease = true;
  auto backend = makeEnabledBackend();
  backend->setBatchEvents(false);
  backend->postJSONMessage("{\"x\":1}", kMessageFlagOrdinary, std::nullopt, std::nullopt, nullptr);
  ASSERT_EQ(backend->bytesSentSinceLastReport(), 7u);
  // A health report carries what was sent since the last one.
  backend->sendMessage(blob({}), at(1'700'000'010), 1, 1, kMessageFlagHealthReport);
  Value health = (*test::documentOf(helper->postedRequest(1))["events"].asArray())[0];
  EXPECT_EQ(health["_bytesSentSinceLastReport"], Value(7));
  std::uint32_t afterHealth = backend->bytesSentSinceLastReport();
  EXPECT_EQ(afterHealth, helper->postedRequest(1).body.size());
  // The stop message carries and clears the total.
  std::uint32_t total = backend->totalBytesSent();
  backend->sendMessage(blob({}), at(1'700'000'011), 0, 1, kMessageFlagOrdinary);
  Value stop = (*test::documentOf(helper->postedRequest(2))["events"].asArray())[0];
  EXPECT_EQ(stop["_totalBytesSent"], Value(total));
  EXPECT_EQ(backend->totalBytesSent(), helper->postedRequest(2).body.size());
}

TEST_F(HTTPSPostBackendPostingTest, HealthReportsOutsideInternalReleasesCarryNoByteCount) {
  auto backend = makeEnabledBackend();
  backend->setBatchEvents(false);
  backend->sendMessage(blob({}), at(1'700'000'010), 1, 1, kMessageFlagHealthReport);
  Value health = (*test::documentOf(helper->postedRequest(0))["events"].asArray())[0];
  EXPECT_FALSE(health.asDictionary()->contains("_bytesSentSinceLastReport"));
}

// ---- The real helper against a loopback HTTPS server ----

class HTTPSPostBackendLoopbackTest : public HTTPSPostBackendPostingTest {
 protected:
  void SetUp() override { ::setenv("TELVANED_CA_FILE", test::TestCertificates::shared().caFile().c_str(), 1); }
  void TearDown() override { ::unsetenv("TELVANED_CA_FILE"); }

  std::shared_ptr<HTTPSPostBackend> makeLoopbackBackend() {
    realHelper = ReportingSessionConnectivityHelperImpl::create(
        std::weak_ptr<TelvanedSessionDelegate>(), ReportingSessionConnectivityHelper::POSTRequestMode(),
        test::userInfo("app", "svc"));
    realHelper->activate(30);
    Dictionary rule = enablingRule();
    rule.set("post_url", Value(server.url("/batch")));
    rule.set("realtime_post_url", Value(server.url("/realtime")));
    auto backend = makeEnabledBackend(rule);
    backend->setReportingSessionConnectivityDelegate(realHelper);
    backend->setBatchEvents(true);
    backend->setDigestKey(Bytes{'s', 'e', 'c', 'r', 'e', 't'});
    return backend;
  }

  test::TlsTestServer server;
  std::shared_ptr<ReportingSessionConnectivityHelperImpl> realHelper;
};

TEST_F(HTTPSPostBackendLoopbackTest, BatchAndRealtimeEventsReachTheServer) {
  server.setAnswer("/batch", test::ScriptedAnswer{});
  server.setAnswer("/realtime", test::ScriptedAnswer{});
  auto backend = makeLoopbackBackend();
  for (int i = 0; i < 3; ++i) {
    EXPECT_FALSE(backend->sendMessage(blob(Dictionary{{"n", Value(i)}}), at(1'700'000'010 + i), 4, 0,
                                      kMessageFlagOrdinary)
                     .has_value());
  }
  // The realtime event flushes the batch first, then goes alone.
  auto text = backend->sendMessage(blob(Dictionary{{"n", Value(99)}}), at(1'700'000'020), 5, 1, kMessageFlagRealtime);
  ASSERT_TRUE(text.has_value());
  EXPECT_EQ(text->rfind("Flushed events:\n", 0), 0u);
  ASSERT_TRUE(server.waitForRequests(2));
  ASSERT_TRUE(test::waitUntil([&] { return server.requestsForPath("/realtime").size() == 1; }));

  test::ReceivedRequest batch = server.requestsForPath("/batch").at(0);
  EXPECT_EQ(batch.method, "POST");
  EXPECT_EQ(batch.header("Content-Encoding"), "gzip");
  EXPECT_EQ(batch.header("X-TVX-Sender"), "CNF");
  EXPECT_EQ(batch.header("X-TVX-Event-Map"), "");
  // The test server inflates gzip request bodies itself.
  std::optional<std::string> json = test::gunzip(batch.body);
  if (!json) json = batch.body;
  Value document = json::parse(*json).value();
  ASSERT_EQ(document["events"].asArray()->size(), 3u);
  EXPECT_EQ((*document["events"].asArray())[2]["n"], Value(2));
  std::string hex = crypto::hex(crypto::hmacSha1(Bytes{'s', 'e', 'c', 'r', 'e', 't'}, *json));
  EXPECT_EQ(batch.header("X-TVX-DIGEST").substr(0, 9), "<" + hex.substr(0, 8));

  test::ReceivedRequest realtime = server.requestsForPath("/realtime").at(0);
  EXPECT_EQ(realtime.header("X-TVX-Event-Map"), "5 1");
  std::string body = test::gunzip(realtime.body).value_or(realtime.body);
  EXPECT_EQ((*json::parse(body).value()["events"].asArray())[0]["n"], Value(99));
}

TEST_F(HTTPSPostBackendLoopbackTest, AServerErrorDisablesTheBackendThroughTheRealHelper) {
  test::ScriptedAnswer failing;
  failing.status = 500;
  server.setAnswer("/batch", failing);
  auto backend = makeLoopbackBackend();
  backend->sendMessage(blob(Dictionary{{"n", Value(1)}}), at(1'700'000'010), 4, 0, kMessageFlagOrdinary);
  CompletionRecord record;
  std::optional<std::string> readable = backend->flushMessages(record.completion());
  ASSERT_TRUE(readable.has_value());
  ASSERT_TRUE(record.done.waitFor(1));
  EXPECT_EQ(record.result, readable);
  EXPECT_EQ(record.error,
            std::optional<TelvaneError>(makeTelvaneError(500, "backend splunk disabled by server 500 return code")));
  EXPECT_EQ(backend->state(), kBackendStateDisabled);
}

}  // namespace
}  // namespace telvane
