#include "platform/HttpEngine.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <atomic>
#include <filesystem>
#include <mutex>
#include <vector>

#include "platform/Executors.h"
#include "support/TempDir.h"
#include "support/TestCertificates.h"
#include "support/TlsTestServer.h"
#include "support/WaitUntil.h"

namespace telvane {
namespace {

using test::ScriptedAnswer;
using test::TestCertificates;
using test::TlsTestServer;
using test::waitUntil;

// What one request reported, in order, with the queue it ran on.
struct Recorder {
  std::mutex mutex;
  std::vector<std::string> events;
  std::optional<HttpResponse> completed;
  std::optional<HttpResponse> head;
  std::string chunks;
  std::int64_t lastSent = -1;
  std::int64_t lastTotal = -1;
  bool offQueue = false;

  HttpTaskCallbacks callbacks(const std::shared_ptr<SerialQueue>& queue) {
    HttpTaskCallbacks calls;
    calls.didReceiveResponse = [this, queue](const HttpResponse& response) {
      std::lock_guard<std::mutex> lock(mutex);
      if (!queue->isCurrent()) offQueue = true;
      events.push_back("response");
      head = response;
    };
    calls.didReceiveData = [this, queue](const std::string& chunk) {
      std::lock_guard<std::mutex> lock(mutex);
      if (!queue->isCurrent()) offQueue = true;
      if (events.empty() || events.back() != "data") events.push_back("data");
      chunks += chunk;
    };
    calls.didSendBodyData = [this](std::int64_t sent, std::int64_t total) {
      std::lock_guard<std::mutex> lock(mutex);
      lastSent = sent;
      lastTotal = total;
    };
    calls.didComplete = [this, queue](HttpResponse response) {
      std::lock_guard<std::mutex> lock(mutex);
      if (!queue->isCurrent()) offQueue = true;
      events.push_back("complete");
      completed = std::move(response);
    };
    return calls;
  }
  bool done() {
    std::lock_guard<std::mutex> lock(mutex);
    return completed.has_value();
  }
  HttpResponse result() {
    std::lock_guard<std::mutex> lock(mutex);
    return *completed;
  }
  std::vector<std::string> eventList() {
    std::lock_guard<std::mutex> lock(mutex);
    return events;
  }
};

class HttpEngineTest : public ::testing::Test {
 protected:
  void SetUp() override { ::setenv("TELVANED_CA_FILE", TestCertificates::shared().caFile().c_str(), 1); }
  void TearDown() override { ::unsetenv("TELVANED_CA_FILE"); }

  std::shared_ptr<SerialQueue> queue = SerialQueue::create("HttpEngineTest", Executors::network());
  TlsTestServer server;
};

TEST_F(HttpEngineTest, GetDeliversHeadDataAndCompletionInOrderOnTheQueue) {
  ScriptedAnswer answer;
  answer.body = "storebag-bytes";
  answer.headers = {{"Cache-Control", "max-age=300"}, {"Last-Modified", "Wed, 21 Oct 2015 07:28:00 GMT"}};
  server.setAnswer("/bag", answer);
  auto session = HttpSession::create(queue);
  Recorder recorder;
  HttpRequest request;
  request.url = server.url("/bag?ix=5&v=2");
  request.headers = {{"X-Telvane-Test", "yes"}};
  EXPECT_GT(session->startTask(request, recorder.callbacks(queue)), 0u);
  ASSERT_TRUE(waitUntil([&] { return recorder.done(); }));

  HttpResponse response = recorder.result();
  EXPECT_EQ(response.error, "");
  EXPECT_FALSE(response.failed());
  EXPECT_EQ(response.statusCode, 200);
  EXPECT_EQ(response.body, "storebag-bytes");
  EXPECT_EQ(response.header("cache-control"), "max-age=300");
  EXPECT_EQ(response.header("LAST-MODIFIED"), "Wed, 21 Oct 2015 07:28:00 GMT");
  EXPECT_FALSE(response.header("X-Absent").has_value());
  EXPECT_EQ(recorder.eventList(), (std::vector<std::string>{"response", "data", "complete"}));
  EXPECT_EQ(recorder.chunks, "storebag-bytes");
  ASSERT_TRUE(recorder.head.has_value());
  EXPECT_EQ(recorder.head->statusCode, 200);
  EXPECT_FALSE(recorder.offQueue);

  auto received = server.requestsForPath("/bag");
  ASSERT_EQ(received.size(), 1u);
  EXPECT_EQ(received[0].method, "GET");
  EXPECT_EQ(received[0].query, "ix=5&v=2");
  EXPECT_EQ(received[0].header("X-Telvane-Test"), "yes");
}

TEST_F(HttpEngineTest, ServerErrorStatusIsAResponseNotAFailure) {
  ScriptedAnswer answer;
  answer.status = 503;
  answer.body = "busy";
  server.setAnswer("/busy", answer);
  auto session = HttpSession::create(queue);
  Recorder recorder;
  HttpRequest request;
  request.url = server.url("/busy");
  session->startTask(request, recorder.callbacks(queue));
  ASSERT_TRUE(waitUntil([&] { return recorder.done(); }));
  EXPECT_EQ(recorder.result().statusCode, 503);
  EXPECT_EQ(recorder.result().body, "busy");
  EXPECT_FALSE(recorder.result().failed());
}

TEST_F(HttpEngineTest, ServerIsNotTrustedWithoutTheExtraCaFile) {
  server.setAnswer("/x", ScriptedAnswer{});
  ::setenv("TELVANED_CA_FILE", TestCertificates::shared().otherCaFile().c_str(), 1);
  auto session = HttpSession::create(queue);
  Recorder recorder;
  HttpRequest request;
  request.url = server.url("/x");
  session->startTask(request, recorder.callbacks(queue));
  ASSERT_TRUE(waitUntil([&] { return recorder.done(); }));
  EXPECT_TRUE(recorder.result().failed());
  EXPECT_EQ(recorder.result().statusCode, 0);
  EXPECT_EQ(server.requestCount(), 0u);

  // The same request succeeds once the test CA is trusted again.
  ::setenv("TELVANED_CA_FILE", TestCertificates::shared().caFile().c_str(), 1);
  Recorder second;
  session->startTask(request, second.callbacks(queue));
  ASSERT_TRUE(waitUntil([&] { return second.done(); }));
  EXPECT_EQ(second.result().error, "");
  EXPECT_EQ(second.result().statusCode, 200);
}

TEST_F(HttpEngineTest, PostSendsBodyAndHeaders) {
  ScriptedAnswer answer;
  answer.body = "ok";
  server.setAnswer("/post", answer);
  auto session = HttpSession::create(queue);
  Recorder recorder;
  HttpRequest request;
  request.method = "POST";
  request.url = server.url("/post");
  request.headers = {{"Content-Type", "application/json"}, {"X-Telvane-Sender", "MDIA"}};
  request.body = std::string(100000, 'e');
  session->startTask(request, recorder.callbacks(queue));
  ASSERT_TRUE(waitUntil([&] { return recorder.done(); }));
  EXPECT_EQ(recorder.result().statusCode, 200);
  auto received = server.requestsForPath("/post");
  ASSERT_EQ(received.size(), 1u);
  EXPECT_EQ(received[0].method, "POST");
  EXPECT_EQ(received[0].body, request.body);
  EXPECT_EQ(received[0].header("Content-Type"), "application/json");
  EXPECT_EQ(received[0].header("X-Telvane-Sender"), "MDIA");
  EXPECT_EQ(recorder.lastSent, 100000);
  EXPECT_EQ(recorder.lastTotal, 100000);
}

TEST_F(HttpEngineTest, UploadReadsTheFileOpenedAtStartEvenWhenItIsRemovedAtOnce) {
  server.setAnswer("/upload", ScriptedAnswer{});
  test::TempDir dir;
  auto path = dir / "body.tvxdiag";
  test::writeFile(path, "file-content-123");
  auto session = HttpSession::create(queue);
  Recorder recorder;
  HttpRequest request;
  request.method = "POST";
  request.url = server.url("/upload");
  request.uploadFilePath = path.string();
  session->startTask(request, recorder.callbacks(queue));
  std::filesystem::remove(path);
  ASSERT_TRUE(waitUntil([&] { return recorder.done(); }));
  EXPECT_EQ(recorder.result().error, "");
  auto received = server.requestsForPath("/upload");
  ASSERT_EQ(received.size(), 1u);
  EXPECT_EQ(received[0].body, "file-content-123");
}

TEST_F(HttpEngineTest, MissingUploadFileCompletesWithAnError) {
  auto session = HttpSession::create(queue);
  Recorder recorder;
  HttpRequest request;
  request.method = "POST";
  request.url = server.url("/upload");
  request.uploadFilePath = "/nonexistent/telvane/body";
  EXPECT_GT(session->startTask(request, recorder.callbacks(queue)), 0u);
  ASSERT_TRUE(waitUntil([&] { return recorder.done(); }));
  EXPECT_EQ(recorder.result().error.rfind("cannot open /nonexistent/telvane/body", 0), 0u);
  EXPECT_EQ(server.requestCount(), 0u);
}

TEST_F(HttpEngineTest, IdleTimeoutEndsARequestTheServerDoesNotAnswer) {
  ScriptedAnswer answer;
  answer.delay = std::chrono::seconds(20);
  server.setAnswer("/slow", answer);
  auto session = HttpSession::create(queue);
  Recorder recorder;
  HttpRequest request;
  request.url = server.url("/slow");
  request.idleTimeout = std::chrono::milliseconds(300);
  auto started = std::chrono::steady_clock::now();
  session->startTask(request, recorder.callbacks(queue));
  ASSERT_TRUE(waitUntil([&] { return recorder.done(); }));
  EXPECT_EQ(recorder.result().error, "The request timed out.");
  EXPECT_EQ(recorder.result().statusCode, 0);
  EXPECT_LT(std::chrono::steady_clock::now() - started, std::chrono::seconds(10));
  server.stop();  // cuts the server's delay short
}

TEST_F(HttpEngineTest, ConnectionClosedWithoutAnswerIsAFailure) {
  ScriptedAnswer answer;
  answer.closeWithoutAnswer = true;
  server.setAnswer("/drop", answer);
  auto session = HttpSession::create(queue);
  Recorder recorder;
  HttpRequest request;
  request.url = server.url("/drop");
  session->startTask(request, recorder.callbacks(queue));
  ASSERT_TRUE(waitUntil([&] { return recorder.done(); }));
  EXPECT_TRUE(recorder.result().failed());
  EXPECT_EQ(recorder.result().statusCode, 0);
}

TEST_F(HttpEngineTest, CancelledRequestNeverCallsBack) {
  ScriptedAnswer slow;
  slow.delay = std::chrono::milliseconds(500);
  server.setAnswer("/slow", slow);
  server.setAnswer("/fast", ScriptedAnswer{});
  auto session = HttpSession::create(queue);
  Recorder cancelled;
  HttpRequest request;
  request.url = server.url("/slow");
  auto id = session->startTask(request, cancelled.callbacks(queue));
  ASSERT_TRUE(server.waitForRequests(1));
  queue->sync([&] { session->cancelTask(id); });

  // A later request on the same session completes; the cancelled one stays silent even
  // after the server's answer would have come.
  Recorder later;
  request.url = server.url("/fast");
  request.idleTimeout = std::chrono::seconds(5);
  session->startTask(request, later.callbacks(queue));
  ASSERT_TRUE(waitUntil([&] { return later.done(); }));
  Recorder afterSlow;
  request.url = server.url("/slow");
  session->startTask(request, afterSlow.callbacks(queue));
  ASSERT_TRUE(waitUntil([&] { return afterSlow.done(); }));
  EXPECT_TRUE(cancelled.eventList().empty());
}

TEST_F(HttpEngineTest, FinishTasksAndInvalidateLetsRunningRequestsEndThenCallsTheBlock) {
  ScriptedAnswer slow;
  slow.delay = std::chrono::milliseconds(200);
  slow.body = "late";
  server.setAnswer("/slow", slow);
  auto session = HttpSession::create(queue);
  Recorder recorder;
  HttpRequest request;
  request.url = server.url("/slow");
  session->startTask(request, recorder.callbacks(queue));
  std::atomic<bool> invalid{false};
  std::atomic<bool> completedBeforeInvalid{false};
  session->finishTasksAndInvalidate([&] {
    completedBeforeInvalid = recorder.done();
    invalid = true;
  });
  EXPECT_TRUE(session->isInvalidated());
  Recorder refused;
  EXPECT_EQ(session->startTask(request, refused.callbacks(queue)), 0u);
  ASSERT_TRUE(waitUntil([&] { return invalid.load(); }));
  EXPECT_TRUE(completedBeforeInvalid.load());
  EXPECT_EQ(recorder.result().body, "late");
  EXPECT_TRUE(refused.eventList().empty());
}

TEST_F(HttpEngineTest, FinishingSessionStillCallsTheBlockWhenTheObjectIsGone) {
  server.setAnswer("/x", ScriptedAnswer{});
  auto session = HttpSession::create(queue);
  Recorder recorder;
  HttpRequest request;
  request.url = server.url("/x");
  session->startTask(request, recorder.callbacks(queue));
  std::atomic<bool> invalid{false};
  session->finishTasksAndInvalidate([&] { invalid = true; });
  session.reset();
  ASSERT_TRUE(waitUntil([&] { return invalid.load(); }));
  EXPECT_TRUE(recorder.done());
}

TEST_F(HttpEngineTest, InvalidateAndCancelSilencesRunningRequests) {
  ScriptedAnswer slow;
  slow.delay = std::chrono::milliseconds(300);
  server.setAnswer("/slow", slow);
  server.setAnswer("/fast", ScriptedAnswer{});
  auto session = HttpSession::create(queue);
  Recorder recorder;
  HttpRequest request;
  request.url = server.url("/slow");
  session->startTask(request, recorder.callbacks(queue));
  ASSERT_TRUE(server.waitForRequests(1));
  queue->sync([&] { session->invalidateAndCancel(); });
  EXPECT_EQ(session->startTask(request, recorder.callbacks(queue)), 0u);
  // Another session's request after the slow answer's time: the first stays silent.
  auto other = HttpSession::create(queue);
  Recorder afterSlow;
  other->startTask(request, afterSlow.callbacks(queue));
  ASSERT_TRUE(waitUntil([&] { return afterSlow.done(); }));
  EXPECT_TRUE(recorder.eventList().empty());
}

TEST_F(HttpEngineTest, SessionDestroyedWithRunningRequestsIsSafe) {
  ScriptedAnswer slow;
  slow.delay = std::chrono::milliseconds(200);
  server.setAnswer("/slow", slow);
  Recorder recorder;
  {
    auto session = HttpSession::create(queue);
    HttpRequest request;
    request.url = server.url("/slow");
    for (int i = 0; i < 3; ++i) session->startTask(request, recorder.callbacks(queue));
    ASSERT_TRUE(server.waitForRequests(1));
  }
  queue->sync([] {});
  auto other = HttpSession::create(queue);
  Recorder afterSlow;
  HttpRequest request;
  request.url = server.url("/slow");
  other->startTask(request, afterSlow.callbacks(queue));
  ASSERT_TRUE(waitUntil([&] { return afterSlow.done(); }));
  EXPECT_TRUE(recorder.eventList().empty());
}

TEST_F(HttpEngineTest, ManySessionsRunAtOnce) {
  ScriptedAnswer answer;
  answer.body = "b";
  server.setAnswer("/many", answer);
  // The recorders outlive the sessions, so that no callback can reach a freed one.
  // The count stays within the test server's worker threads, which each hold a kept-
  // alive connection until it times out.
  std::vector<std::unique_ptr<Recorder>> recorders;
  std::vector<std::shared_ptr<HttpSession>> sessions;
  HttpRequest request;
  request.url = server.url("/many");
  for (int i = 0; i < 4; ++i) {
    sessions.push_back(HttpSession::create(queue));
    for (int j = 0; j < 2; ++j) {
      recorders.push_back(std::make_unique<Recorder>());
      sessions.back()->startTask(request, recorders.back()->callbacks(queue));
    }
  }
  for (auto& recorder : recorders) {
    ASSERT_TRUE(waitUntil([&] { return recorder->done(); }));
    EXPECT_EQ(recorder->result().body, "b");
  }
  EXPECT_EQ(server.requestCount(), 8u);
}

}  // namespace
}  // namespace telvane
