// GET requests of the connectivity helper: modes, per-URL suppression, the delayed
// pull and inactive helpers.
#include <gtest/gtest.h>
#include <stdlib.h>

#include <atomic>
#include <cstdlib>

#include "connectivity/ReportingSessionConnectivityHelperImpl.h"
#include "platform/Log.h"
#include "support/FakeSessionDelegate.h"
#include "support/ScriptedRandom.h"
#include "support/TestCertificates.h"
#include "support/TlsTestServer.h"
#include "support/WaitUntil.h"

namespace telvane {
namespace {

using Helper = ReportingSessionConnectivityHelperImpl;
using test::ScriptedAnswer;
using test::waitUntil;

struct GetOutcome {
  std::mutex mutex;
  int calls = 0;
  std::optional<std::string> data;
  std::optional<HttpResponse> response;
  std::optional<TelvaneError> error;

  ConnectivityCompletion completion() {
    return [this](std::optional<std::string> d, std::optional<HttpResponse> r, std::optional<TelvaneError> e) {
      std::lock_guard<std::mutex> lock(mutex);
      ++calls;
      data = std::move(d);
      response = std::move(r);
      error = std::move(e);
    };
  }
  int callCount() {
    std::lock_guard<std::mutex> lock(mutex);
    return calls;
  }
};

class ConnectivityHelperGetTest : public ::testing::Test {
 protected:
  void SetUp() override { ::setenv("TELVANED_CA_FILE", test::TestCertificates::shared().caFile().c_str(), 1); }
  void TearDown() override { ::unsetenv("TELVANED_CA_FILE"); }

  std::shared_ptr<Helper> makeHelper(std::int32_t mode) {
    Helper::Options options;
    options.random = random;
    options.secondDuration = std::chrono::milliseconds(10);
    return Helper::create(std::weak_ptr<TelvanedSessionDelegate>(), mode,
                          Value(Dictionary{{"_clientName", "storebag"}, {"_serviceName", "shared"}}), options);
  }
  HttpRequest get(const std::string& path) {
    HttpRequest request;
    request.url = server.url(path);
    return request;
  }

  log::LogCapture capture;
  test::TlsTestServer server;
  std::shared_ptr<test::ScriptedRandom> random = std::make_shared<test::ScriptedRandom>();
};

TEST_F(ConnectivityHelperGetTest, WrongModeFailsAtOnceWithTheModeAsCode) {
  auto helper = makeHelper(Helper::kPOSTRequestMode);
  GetOutcome outcome;
  helper->getURLRequestWithCompletionHandler(get("/bag"), true, outcome.completion());
  ASSERT_EQ(outcome.callCount(), 1);  // called before returning
  EXPECT_FALSE(outcome.data.has_value());
  EXPECT_FALSE(outcome.response.has_value());
  ASSERT_TRUE(outcome.error.has_value());
  EXPECT_EQ(*outcome.error, makeTelvaneError(4, "getURLRequestWithCompletionHandler: unrecognized mode"));
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "getURLRequestWithCompletionHandler: wrong mode for GET operation detected 4"));
  EXPECT_EQ(server.requestCount(), 0u);
}

TEST_F(ConnectivityHelperGetTest, UrgentGetFetchesAndLogsTheCompletedPull) {
  ScriptedAnswer answer;
  answer.body = "bag";
  answer.headers = {{"Cache-Control", "max-age=60"}};
  server.setAnswer("/bag", answer);
  auto helper = makeHelper(Helper::kGETRequestMode);
  helper->activate(0);
  GetOutcome outcome;
  const std::string url = server.url("/bag");
  helper->getURLRequestWithCompletionHandler(get("/bag"), true, outcome.completion());
  ASSERT_TRUE(waitUntil([&] { return outcome.callCount() == 1; }));
  EXPECT_EQ(outcome.data, "bag");
  ASSERT_TRUE(outcome.response.has_value());
  EXPECT_EQ(outcome.response->header("Cache-Control"), "max-age=60");
  EXPECT_FALSE(outcome.error.has_value());
  EXPECT_TRUE(capture.contains("getURLRequestWithCompletionHandler: storebag immediate pull for '" + url +
                               "' has been initiated"));
  ASSERT_TRUE(waitUntil([&] {
    return capture.contains("getURLRequestWithCompletionHandler: new storebag pull for '" + url +
                            "' has been completed with error (null)");
  }));
}

TEST_F(ConnectivityHelperGetTest, SameUrlIsFetchedOnceInTheHelpersLifetime) {
  ScriptedAnswer answer;
  answer.delay = std::chrono::milliseconds(100);
  server.setAnswer("/bag", answer);
  server.setAnswer("/other", ScriptedAnswer{});
  auto helper = makeHelper(Helper::kGETRequestMode);
  helper->activate(0);
  const std::string url = server.url("/bag");
  const std::string duplicate = "getURLRequestWithCompletionHandler: ignored duplicate request for storebag '" + url + "'";
  GetOutcome first, second, third;
  helper->getURLRequestWithCompletionHandler(get("/bag"), true, first.completion());
  helper->getURLRequestWithCompletionHandler(get("/bag"), true, second.completion());
  EXPECT_EQ(capture.count(duplicate), 1u);
  ASSERT_TRUE(waitUntil([&] { return first.callCount() == 1; }));
  // After the first has finished, the URL is still refused.
  helper->getURLRequestWithCompletionHandler(get("/bag"), true, third.completion());
  EXPECT_EQ(capture.count(duplicate), 2u);
  // Another URL still goes out, and by its end the refused ones have not run.
  GetOutcome other;
  helper->getURLRequestWithCompletionHandler(get("/other"), true, other.completion());
  ASSERT_TRUE(waitUntil([&] { return other.callCount() == 1; }));
  EXPECT_EQ(second.callCount(), 0);
  EXPECT_EQ(third.callCount(), 0);
  EXPECT_EQ(server.requestsForPath("/bag").size(), 1u);
}

TEST_F(ConnectivityHelperGetTest, SuppressionIsPerHelper) {
  server.setAnswer("/bag", ScriptedAnswer{});
  auto first = makeHelper(Helper::kGETRequestMode);
  auto second = makeHelper(Helper::kGETRequestMode);
  first->activate(0);
  second->activate(0);
  GetOutcome a, b;
  first->getURLRequestWithCompletionHandler(get("/bag"), true, a.completion());
  second->getURLRequestWithCompletionHandler(get("/bag"), true, b.completion());
  ASSERT_TRUE(waitUntil([&] { return a.callCount() == 1 && b.callCount() == 1; }));
  EXPECT_EQ(server.requestsForPath("/bag").size(), 2u);
}

TEST_F(ConnectivityHelperGetTest, PullOnAnInactiveHelperFailsAndLogsTheCancellation) {
  auto helper = makeHelper(Helper::kGETRequestMode);
  GetOutcome outcome;
  const std::string url = server.url("/bag");
  helper->getURLRequestWithCompletionHandler(get("/bag"), true, outcome.completion());
  ASSERT_TRUE(waitUntil([&] { return outcome.callCount() == 1; }));
  EXPECT_EQ(outcome.error, makeTelvaneError(-1, "ConnectivityHelper is not ative"));
  EXPECT_FALSE(outcome.data.has_value());
  ASSERT_TRUE(waitUntil([&] {
    return capture.contains("getURLRequestWithCompletionHandler: new storebag pull for '" + url +
                            "' has been cancelled as WebSession is not active");
  }));
  EXPECT_EQ(server.requestCount(), 0u);
}

TEST_F(ConnectivityHelperGetTest, BackgroundGetModeIsAcceptedLikeGet) {
  server.setAnswer("/bag", ScriptedAnswer{});
  auto helper = makeHelper(Helper::kBackgroundGETRequestMode);
  helper->activate(0);
  GetOutcome outcome;
  helper->getURLRequestWithCompletionHandler(get("/bag"), true, outcome.completion());
  ASSERT_TRUE(waitUntil([&] { return outcome.callCount() == 1; }));
  EXPECT_FALSE(outcome.error.has_value());
}

TEST_F(ConnectivityHelperGetTest, DelayedPullWaitsTheDrawnNumberOfSeconds) {
  server.setAnswer("/bag", ScriptedAnswer{});
  auto helper = makeHelper(Helper::kGETRequestMode);
  helper->activate(0);
  random->pushUniform(7200 + 12);  // the draw is below 7200: 12
  GetOutcome outcome;
  const std::string url = server.url("/bag");
  const std::string prefix = "getURLRequestWithCompletionHandler: storebag delayed pull for '" + url +
                             "' delayed by 12 seconds has been initiated. Time now ";
  helper->getURLRequestWithCompletionHandler(get("/bag"), false, outcome.completion());
  ASSERT_TRUE(capture.containsPrefix(prefix));
  ASSERT_TRUE(waitUntil([&] { return outcome.callCount() == 1; }));
  EXPECT_FALSE(outcome.error.has_value());
  // The two monotonic times are 12 helper seconds (here 10 ms each) apart.
  for (const auto& text : capture.texts()) {
    if (text.rfind(prefix, 0) != 0) continue;
    unsigned long long now = 0, scheduled = 0;
    ASSERT_EQ(std::sscanf(text.c_str() + prefix.size(), "%llu, scheduled time to pull %llu", &now, &scheduled), 2);
    EXPECT_EQ(scheduled - now, 120ull * 1000 * 1000);
  }
}

TEST_F(ConnectivityHelperGetTest, FailedExchangeReachesTheCompletionAsAnError) {
  ScriptedAnswer answer;
  answer.closeWithoutAnswer = true;
  server.setAnswer("/drop", answer);
  auto helper = makeHelper(Helper::kGETRequestMode);
  helper->activate(0);
  GetOutcome outcome;
  helper->getURLRequestWithCompletionHandler(get("/drop"), true, outcome.completion());
  ASSERT_TRUE(waitUntil([&] { return outcome.callCount() == 1; }));
  ASSERT_TRUE(outcome.error.has_value());
  EXPECT_EQ(outcome.error->domain, "TelvaneHTTPErrorDomain");
  EXPECT_FALSE(outcome.response.has_value());
  EXPECT_FALSE(outcome.data.has_value());
}

}  // namespace
}  // namespace telvane
