#include "connectivity/ReportingSessionConnectivityHelperImpl.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <atomic>
#include <cstdio>
#include <filesystem>

#include "platform/Executors.h"
#include "platform/Log.h"
#include "support/FakeSessionDelegate.h"
#include "support/ScriptedRandom.h"
#include "support/TempDir.h"
#include "support/TestCertificates.h"
#include "support/TlsTestServer.h"
#include "support/WaitUntil.h"

namespace telvane {
namespace {

using Helper = ReportingSessionConnectivityHelperImpl;
using test::ScriptedAnswer;
using test::waitUntil;

struct Outcome {
  std::mutex mutex;
  int calls = 0;
  std::optional<std::string> data;
  std::optional<HttpResponse> response;
  std::optional<TelvaneError> error;
  bool onStateQueue = false;

  ConnectivityCompletion completion(std::shared_ptr<SerialQueue> stateQueue = nullptr) {
    return [this, stateQueue](std::optional<std::string> d, std::optional<HttpResponse> r,
                              std::optional<TelvaneError> e) {
      std::lock_guard<std::mutex> lock(mutex);
      ++calls;
      data = std::move(d);
      response = std::move(r);
      error = std::move(e);
      onStateQueue = stateQueue && stateQueue->isCurrent();
    };
  }
  int callCount() {
    std::lock_guard<std::mutex> lock(mutex);
    return calls;
  }
};

class ConnectivityHelperTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ::setenv("TELVANED_CA_FILE", test::TestCertificates::shared().caFile().c_str(), 1);
    ::setenv("TELVANED_STORAGE_DIR", storage.str().c_str(), 1);
  }
  void TearDown() override {
    ::unsetenv("TELVANED_CA_FILE");
    ::unsetenv("TELVANED_STORAGE_DIR");
  }

  std::shared_ptr<Helper> makeHelper(std::int32_t mode, bool withDelegate = true) {
    Helper::Options options;
    options.random = random;
    options.secondDuration = std::chrono::milliseconds(10);
    std::weak_ptr<TelvanedSessionDelegate> weak;
    if (withDelegate) weak = delegate;
    return Helper::create(weak, mode, userInfo, options);
  }
  // Waits until the helper's queue has run everything submitted so far.
  static void drain(const std::shared_ptr<Helper>& helper) { helper->stateQueue()->sync([] {}); }
  HttpRequest get(const std::string& path) {
    HttpRequest request;
    request.url = server.url(path);
    return request;
  }
  HttpRequest post(const std::string& path, std::string body) {
    HttpRequest request;
    request.method = "POST";
    request.url = server.url(path);
    request.body = std::move(body);
    return request;
  }

  log::LogCapture capture;
  test::TempDir storage;
  test::TlsTestServer server;
  std::shared_ptr<test::ScriptedRandom> random = std::make_shared<test::ScriptedRandom>();
  std::shared_ptr<test::FakeSessionDelegate> delegate = std::make_shared<test::FakeSessionDelegate>();
  Value userInfo = Value(Dictionary{{"_clientName", "MediaKit"}, {"_serviceName", "Playback"}});
};

// ---- Creation and activation ----

TEST_F(ConnectivityHelperTest, CreationLogsDelegateAndStaysInactiveUntilActivated) {
  auto helper = makeHelper(Helper::kPOSTRequestMode);
  EXPECT_TRUE(capture.contains("ReportingSessionConnectivityHelper created with delegate 1"));
  EXPECT_EQ(helper->webSessionDescription(), "inactive");
  EXPECT_FALSE(helper->isActive());
  auto orphan = makeHelper(Helper::kGETRequestMode, false);
  EXPECT_TRUE(capture.contains("ReportingSessionConnectivityHelper created with delegate 0"));
}

TEST_F(ConnectivityHelperTest, ActivateCreatesTheSessionOnceAndKeepsTheNewTimeout) {
  auto helper = makeHelper(Helper::kPOSTRequestMode);
  helper->activate(30);
  drain(helper);
  const std::string id = helper->webSessionDescription();
  EXPECT_EQ(id.size(), 36u);  // a UUID
  EXPECT_TRUE(capture.contains("WebSession created and activated with ID <" + id + ">, delegate 1"));
  helper->activate(0);
  drain(helper);
  EXPECT_EQ(helper->webSessionDescription(), id);
  EXPECT_TRUE(capture.contains("activate: connectivity helper is already active for WebSession with ID <" + id + ">"));
  // The second activation's timeout (0) stands: the helper is now ever-lasting.
  std::atomic<int> told{-1};
  helper->ownerDecrementUsageCountWithBlock([&](std::uint32_t count) { told = static_cast<int>(count); }, nullptr);
  ASSERT_TRUE(waitUntil([&] { return told.load() == 1; }));
}

TEST_F(ConnectivityHelperTest, DestructionLogsTheSessionId) {
  auto helper = makeHelper(Helper::kPOSTRequestMode);
  helper->activate(30);
  drain(helper);
  const std::string id = helper->webSessionDescription();
  helper.reset();
  ASSERT_TRUE(waitUntil([&] { return capture.contains("ReportingSessionConnectivityHelper dealloced with ID <" + id + ">"); }));
}

// ---- POST ----

TEST_F(ConnectivityHelperTest, PostDeliversDataAndResponseOnTheStateQueueWithItsLogLines) {
  ScriptedAnswer answer;
  answer.body = "accepted";
  server.setAnswer("/post", answer);
  auto helper = makeHelper(Helper::kPOSTRequestMode);
  helper->activate(30);
  Outcome outcome;
  helper->postURLRequestWithCompletionHandler(post("/post", "{\"events\":[]}"), outcome.completion(helper->stateQueue()));
  ASSERT_TRUE(waitUntil([&] { return outcome.callCount() == 1; }));
  EXPECT_EQ(outcome.data, "accepted");
  ASSERT_TRUE(outcome.response.has_value());
  EXPECT_EQ(outcome.response->statusCode, 200);
  EXPECT_FALSE(outcome.error.has_value());
  EXPECT_TRUE(outcome.onStateQueue);
  auto received = server.requestsForPath("/post");
  ASSERT_EQ(received.size(), 1u);
  EXPECT_EQ(received[0].body, "{\"events\":[]}");

  const std::string id = helper->webSessionDescription();
  char task[32];
  std::snprintf(task, sizeof task, "Task_%08x", Helper::taskCounter());
  const std::string pair = "<" + id + ">:<" + task + ">";
  EXPECT_TRUE(capture.contains(std::string("createHelperForTask: created helperTask for task <") + task + ">"));
  EXPECT_TRUE(capture.contains(std::string("ConnectivityHelperTask with ID <") + task + "> created"));
  EXPECT_TRUE(capture.contains("didReceiveResponse: for <session>:<task> " + pair));
  EXPECT_TRUE(capture.contains("didReceiveData: received 8 bytes for <session>:<task> " + pair));
  EXPECT_TRUE(capture.contains("didSendBodyData: for <session>:<task> " + pair + ": Sent 13 out of 13"));
  EXPECT_TRUE(capture.contains("didCompleteWithError: for <session>:<task> " + pair +
                               " with response { Status Code: 200 }, error (null)"));
  ASSERT_TRUE(waitUntil([&] { return helper->runningTaskCount() == 0; }));
  EXPECT_TRUE(capture.contains(std::string("ConnectivityHelperTask with ID <") + task + "> dealloced"));
}

TEST_F(ConnectivityHelperTest, PostOnAnInactiveHelperOrInAWrongModeNeverCompletes) {
  server.setAnswer("/post", ScriptedAnswer{});
  auto inactive = makeHelper(Helper::kPOSTRequestMode);
  Outcome dropped;
  inactive->postURLRequestWithCompletionHandler(post("/post", "a"), dropped.completion());
  auto getMode = makeHelper(Helper::kGETRequestMode);
  getMode->activate(30);
  Outcome wrongMode;
  getMode->postURLRequestWithCompletionHandler(post("/post", "b"), wrongMode.completion());
  drain(inactive);
  drain(getMode);
  EXPECT_TRUE(capture.contains(log::Level::Error, "postURLRequestWithCompletionHandler: wrong mode for POST operation detected 8"));

  // A request that does go out completes; the two above never do.
  inactive->activate(30);
  Outcome sent;
  inactive->postURLRequestWithCompletionHandler(post("/post", "c"), sent.completion());
  ASSERT_TRUE(waitUntil([&] { return sent.callCount() == 1; }));
  EXPECT_EQ(server.requestCount(), 1u);
  EXPECT_EQ(server.requests()[0].body, "c");
  EXPECT_EQ(dropped.callCount(), 0);
  EXPECT_EQ(wrongMode.callCount(), 0);
}

TEST_F(ConnectivityHelperTest, PostAfterInvalidationIsIgnored) {
  auto helper = makeHelper(Helper::kPOSTRequestMode);
  helper->activate(30);
  helper->invalidate();
  Outcome outcome;
  helper->postURLRequestWithCompletionHandler(post("/post", "x"), outcome.completion());
  drain(helper);
  EXPECT_EQ(outcome.callCount(), 0);
  EXPECT_EQ(server.requestCount(), 0u);
}

TEST_F(ConnectivityHelperTest, FileModePostUploadsThroughAContainerThatIsRemovedAtOnce) {
  server.setAnswer("/upload", ScriptedAnswer{});
  auto helper = makeHelper(Helper::kFileUploadRequestMode);
  helper->activate(30);
  Outcome outcome;
  helper->postURLRequestWithCompletionHandler(post("/upload", "from-a-file"), outcome.completion());
  drain(helper);
  EXPECT_TRUE(std::filesystem::is_empty(storage.path()));
  ASSERT_TRUE(waitUntil([&] { return outcome.callCount() == 1; }));
  auto received = server.requestsForPath("/upload");
  ASSERT_EQ(received.size(), 1u);
  EXPECT_EQ(received[0].body, "from-a-file");
}

TEST_F(ConnectivityHelperTest, FileModePostWithAnUnwritableContainerStopsSilently) {
  ::setenv("TELVANED_STORAGE_DIR", (storage.path() / "missing" / "folder").c_str(), 1);
  auto helper = makeHelper(Helper::kFileUploadRequestMode);
  helper->activate(30);
  Outcome outcome;
  const std::uint32_t before = Helper::taskCounter();
  helper->postURLRequestWithCompletionHandler(post("/upload", "x"), outcome.completion());
  drain(helper);
  EXPECT_EQ(Helper::taskCounter(), before);
  EXPECT_EQ(outcome.callCount(), 0);
  EXPECT_EQ(server.requestCount(), 0u);
}

// ---- Task numbering ----

TEST_F(ConnectivityHelperTest, TaskNumberingContinuesAcrossHelpersInHexadecimal) {
  server.setAnswer("/post", ScriptedAnswer{});
  auto first = makeHelper(Helper::kPOSTRequestMode);
  auto second = makeHelper(Helper::kPOSTRequestMode);
  first->activate(30);
  second->activate(30);
  // Run requests, alternating helpers, until a number ending in 9 has been followed.
  std::uint32_t start = Helper::taskCounter();
  std::vector<std::unique_ptr<Outcome>> outcomes;
  for (int i = 0; i < 17; ++i) {
    outcomes.push_back(std::make_unique<Outcome>());
    auto& helper = (i % 2 == 0) ? first : second;
    helper->postURLRequestWithCompletionHandler(post("/post", "n"), outcomes.back()->completion());
    drain(helper);
  }
  for (auto& outcome : outcomes) ASSERT_TRUE(waitUntil([&] { return outcome->callCount() == 1; }));
  EXPECT_EQ(Helper::taskCounter(), start + 17);
  std::uint32_t nine = start + 1;
  while ((nine & 0xf) != 9) ++nine;
  char expectedNine[128], expectedNext[128];
  std::snprintf(expectedNine, sizeof expectedNine, "createHelperForTask: created helperTask for task <Task_%08x>", nine);
  std::snprintf(expectedNext, sizeof expectedNext, "createHelperForTask: created helperTask for task <Task_%08x>",
                nine + 1);
  EXPECT_TRUE(capture.contains(expectedNine));
  EXPECT_TRUE(capture.contains(expectedNext));
  EXPECT_EQ(std::string(expectedNext).substr(std::string(expectedNext).size() - 2), "a>");
}


// ---- Usage counting and release ----

struct OwnerCalls {
  std::mutex mutex;
  std::vector<std::uint32_t> counts;
  bool onGivenQueue = true;
  Helper::OwnerBlock block(std::shared_ptr<SerialQueue> queue) {
    return [this, queue](std::uint32_t count) {
      std::lock_guard<std::mutex> lock(mutex);
      counts.push_back(count);
      if (queue && !queue->isCurrent()) onGivenQueue = false;
    };
  }
  std::vector<std::uint32_t> seen() {
    std::lock_guard<std::mutex> lock(mutex);
    return counts;
  }
};

TEST_F(ConnectivityHelperTest, DecrementAboveZeroNotifiesTheOwnerWithTheCount) {
  auto helper = makeHelper(Helper::kPOSTRequestMode);
  helper->ownerIncrementUsageCount();
  helper->ownerIncrementUsageCount();
  auto ownerQueue = SerialQueue::create("owner");
  OwnerCalls owner;
  helper->ownerDecrementUsageCountWithBlock(owner.block(ownerQueue), ownerQueue);
  ASSERT_TRUE(waitUntil([&] { return owner.seen().size() == 1; }));
  EXPECT_EQ(owner.seen()[0], 1u);
  EXPECT_TRUE(owner.onGivenQueue);
  EXPECT_FALSE(helper->hasReleaseTimer());
  EXPECT_TRUE(capture.contains("ownerIncrementUsageCount: connectivity helper incremented usage count for WebSession "
                               "with ID <inactive>. _usageCount=2, _totalSessionsServedCount=0"));
  EXPECT_TRUE(capture.contains("ownerDecrementUsageCountWithBlock: connectivity helper decremented usage count for "
                               "WebSession with ID <inactive>. _usageCount=1, _totalSessionsServedCount=0"));
  EXPECT_TRUE(capture.contains("ownerDecrementUsageCountWithBlock: Usage count for WebSession with ID <inactive> is "
                               "greater than 0. Notifying owner that _usageCount=1, _totalSessionsServedCount=0"));
}

TEST_F(ConnectivityHelperTest, ReleaseTimerFiresAfterTheTimeoutAndTellsTheOwnerZero) {
  auto helper = makeHelper(Helper::kPOSTRequestMode);
  helper->setReleaseTimeout(5);
  helper->ownerIncrementUsageCount();
  auto ownerQueue = SerialQueue::create("owner");
  OwnerCalls owner;
  auto started = std::chrono::steady_clock::now();
  helper->ownerDecrementUsageCountWithBlock(owner.block(ownerQueue), ownerQueue);
  ASSERT_TRUE(waitUntil([&] { return owner.seen().size() == 1; }));
  EXPECT_GE(std::chrono::steady_clock::now() - started, std::chrono::milliseconds(50));  // 5 helper seconds
  EXPECT_EQ(owner.seen()[0], 0u);
  EXPECT_TRUE(owner.onGivenQueue);
  EXPECT_FALSE(helper->hasReleaseTimer());
  const std::vector<std::string> expected = {
      "ownerDecrementUsageCountWithBlock: Usage count for WebSession with ID <inactive> is equal to 0. Starting "
      "connectivity helper release timer",
      "startConnectivityHelperReleaseTimerWithBlock: started connectivity helper release timer for WebSession with ID "
      "<inactive>",
      "startConnectivityHelperReleaseTimerWithBlock: Connectivity helper release timer fired for WebSession with ID "
      "<inactive>, timeout 5s",
      "startConnectivityHelperReleaseTimerWithBlock: Calling back owner of Connectivity helper with _usageCount=0"};
  for (const auto& line : expected) EXPECT_TRUE(capture.contains(line)) << line;
  // Nothing more reaches the owner afterwards.
  drain(helper);
  ownerQueue->sync([] {});
  EXPECT_EQ(owner.seen().size(), 1u);
}

TEST_F(ConnectivityHelperTest, DecrementAtZeroKeepsZeroAndStartsTheTimer) {
  auto helper = makeHelper(Helper::kPOSTRequestMode);
  helper->setReleaseTimeout(1000);
  OwnerCalls owner;
  helper->ownerDecrementUsageCountWithBlock(owner.block(nullptr), nullptr);
  drain(helper);
  EXPECT_EQ(helper->usageCount(), 0u);
  EXPECT_TRUE(helper->hasReleaseTimer());
  EXPECT_FALSE(capture.containsPrefix("ownerDecrementUsageCountWithBlock: connectivity helper decremented"));
  EXPECT_TRUE(capture.contains("startConnectivityHelperReleaseTimerWithBlock: started connectivity helper release "
                               "timer for WebSession with ID <inactive>"));
  EXPECT_TRUE(owner.seen().empty());
  // Destruction stops the timer, which hands the kept block the count.
  helper.reset();
  ASSERT_TRUE(waitUntil([&] { return owner.seen().size() == 1; }));
  EXPECT_EQ(owner.seen()[0], 0u);
}

TEST_F(ConnectivityHelperTest, IncrementDuringTheReleasePeriodStopsTheTimerAndHandsTheOwnerTheCount) {
  auto helper = makeHelper(Helper::kPOSTRequestMode);
  helper->setReleaseTimeout(1000);  // 10 s: far beyond the test
  helper->ownerIncrementUsageCount();
  auto ownerQueue = SerialQueue::create("owner");
  OwnerCalls owner;
  helper->ownerDecrementUsageCountWithBlock(owner.block(ownerQueue), ownerQueue);
  drain(helper);
  ASSERT_TRUE(helper->hasReleaseTimer());
  helper->ownerIncrementUsageCount();
  ASSERT_TRUE(waitUntil([&] { return owner.seen().size() == 1; }));
  EXPECT_EQ(owner.seen()[0], 1u);  // non-zero: the owner keeps the helper
  EXPECT_FALSE(helper->hasReleaseTimer());
  EXPECT_TRUE(capture.contains("stopConnectivityHelperReleaseTimer: stopping connectivity helper release timer for "
                               "WebSession with ID <inactive>"));
  EXPECT_FALSE(capture.containsPrefix("startConnectivityHelperReleaseTimerWithBlock: Connectivity helper release timer fired"));
}

TEST_F(ConnectivityHelperTest, EverLastingHelperTellsTheOwnerOneAndReleasesTheTransactionsAtOnce) {
  auto helper = makeHelper(Helper::kPOSTRequestMode);
  helper->activate(0);
  helper->ownerIncrementUsageCount();
  drain(helper);  // the served count is raised on the caller's thread
  helper->incrementTotalSessionsServedCount();
  helper->incrementTotalSessionsServedCount();
  const std::string id = helper->webSessionDescription();
  EXPECT_EQ(capture.count("Total Sessions Served Count is incremented for WebSession with ID <" + id + ">"), 2u);
  OwnerCalls owner;
  helper->ownerDecrementUsageCountWithBlock(owner.block(nullptr), nullptr);
  ASSERT_TRUE(waitUntil([&] { return owner.seen().size() == 1; }));
  EXPECT_EQ(owner.seen()[0], 1u);
  EXPECT_EQ(delegate->releasedTransactions(), std::vector<std::uint32_t>{2});
  EXPECT_EQ(helper->totalSessionsServedCount(), 0u);
  EXPECT_FALSE(helper->hasReleaseTimer());
  EXPECT_TRUE(capture.contains("startConnectivityHelperReleaseTimerWithBlock: Special case of dealing with "
                               "ever-lasting connectivity helper <ReportingSessionConnectivityHelper: " + id + ">"));
  EXPECT_TRUE(capture.contains("startConnectivityHelperReleaseTimerWithBlock: release 2 IPC transactions for "
                               "ever-lasting connectivity helper <ReportingSessionConnectivityHelper: " + id + ">"));
}

TEST_F(ConnectivityHelperTest, InvalidatingAnActiveHelperReleasesTheTransactionsWhenItsSessionIsInvalid) {
  ScriptedAnswer slow;
  slow.delay = std::chrono::milliseconds(150);
  server.setAnswer("/post", slow);
  auto helper = makeHelper(Helper::kPOSTRequestMode);
  helper->activate(30);
  helper->incrementTotalSessionsServedCount();
  helper->incrementTotalSessionsServedCount();
  helper->incrementTotalSessionsServedCount();
  Outcome running;
  helper->postURLRequestWithCompletionHandler(post("/post", "last"), running.completion());
  ASSERT_TRUE(server.waitForRequests(1));
  helper->invalidate();
  drain(helper);
  const std::string id = helper->webSessionDescription();
  EXPECT_TRUE(capture.contains("ReportingSessionConnectivityHelper:invalidate: WebSession with ID <" + id + ">"));
  EXPECT_FALSE(helper->isActive());
  ASSERT_TRUE(waitUntil([&] { return !delegate->releasedTransactions().empty(); }));
  // The running request finished first.
  EXPECT_EQ(running.callCount(), 1);
  EXPECT_EQ(delegate->releasedTransactions(), std::vector<std::uint32_t>{3});
  EXPECT_TRUE(capture.contains("didBecomeInvalidWithError: release 3 IPC transactions for session " + id));
  EXPECT_TRUE(capture.contains("didBecomeInvalidWithError: session <" + id + "> invalidated with error (null)"));
}

TEST_F(ConnectivityHelperTest, InvalidatingAnInactiveHelperReleasesAtOnce) {
  auto helper = makeHelper(Helper::kPOSTRequestMode);
  helper->incrementTotalSessionsServedCount();
  helper->invalidate();
  drain(helper);
  EXPECT_EQ(delegate->releasedTransactions(), std::vector<std::uint32_t>{1});
  EXPECT_TRUE(capture.contains("ReportingSessionConnectivityHelper:invalidate: release 1 IPC transactions for "
                               "inactive connectivity helper"));
}

TEST_F(ConnectivityHelperTest, ReleaseWithoutDelegateStillResetsTheServedCount) {
  auto helper = makeHelper(Helper::kPOSTRequestMode, false);
  helper->incrementTotalSessionsServedCount();
  helper->releaseAllIPCTransactions();
  EXPECT_EQ(helper->totalSessionsServedCount(), 0u);
  EXPECT_TRUE(delegate->releasedTransactions().empty());
}

}  // namespace
}  // namespace telvane
