#include <gtest/gtest.h>

#include <future>

#include "backends/DashboardTestSupport.h"
#include "backends/dashboard/DashboardBackend.h"
#include "platform/PropertyList.h"

namespace telvane {
namespace {

using test::UdpTestCollector;

class DashboardBackendUploadTest : public test::DashboardTestBase {
 protected:
  void SetUp() override {
    backend = makeDashboard(profileFor(collector.port()));
    ASSERT_NE(backend, nullptr);
    backend->setReportingSessionConnectivityDelegate(helper);
  }

  static Array logData() {
    return Array{Value(Dictionary{{"LogData", Value(Bytes{0x4c, 0x4f, 0x47})},
                                  {"StartTime", Value::date(1'700'000'000.0)},
                                  {"EndTime", Value::date(1'700'000'060.0)}})};
  }

  // Runs uploadLogData on another thread (it blocks), waits for its POST and answers it.
  bool uploadAnswering(long status, std::optional<std::string> data, std::optional<TelvaneError> error = std::nullopt) {
    std::future<bool> result = std::async(std::launch::async, [this] { return backend->uploadLogData(logData()); });
    EXPECT_TRUE(test::waitUntil([&] { return helper->postCount() == 1; }));
    EXPECT_EQ(result.wait_for(std::chrono::milliseconds(0)), std::future_status::timeout);  // still blocked
    helper->answerPostWithData(0, status, std::move(data), std::move(error));
    return result.get();
  }

  UdpTestCollector collector{UdpTestCollector::Mode::Silent};
  std::shared_ptr<DashboardBackend> backend;
};

TEST_F(DashboardBackendUploadTest, TheArchiveIsPostedAsABinaryPropertyListAndTheLocationIsLogged) {
  EXPECT_TRUE(uploadAnswering(200, std::string("https://logs.example/stored/77")));
  HttpRequest request = helper->postedRequest(0);
  EXPECT_EQ(request.method, "POST");
  EXPECT_EQ(request.url, "https://logs.example/upload");
  EXPECT_EQ(test::headerOf(request, "Content-Type"), std::optional<std::string>("application/octet-stream"));
  EXPECT_EQ(request.body.rfind("bplist00", 0), 0u);
  Result<Value> decoded = plist::decode(request.body);
  ASSERT_TRUE(decoded.ok()) << decoded.error();
  EXPECT_EQ(decoded.value(), Value(logData()));
  EXPECT_TRUE(capture.contains(log::Level::Info,
                               "DashboardBackend(uploadLogData): Log data uploaded to https://logs.example/stored/77"));
}

TEST_F(DashboardBackendUploadTest, TheLocationEventGoesThroughTheBasePathAndMakesNoDatagram) {
  ASSERT_EQ(backend->eventID(), 0u);
  EXPECT_TRUE(uploadAnswering(200, std::string("https://logs.example/stored/1")));
  EXPECT_EQ(backend->eventID(), 1u);  // counted by the base's send
  // The only datagram is the one sent directly afterwards.
  send(*backend, 500);
  ASSERT_TRUE(collector.waitForCount(1));
  backend->waitForNetworkQueue();
  ASSERT_EQ(collector.count(), 1u);
  EXPECT_EQ(test::readDatagram(collector.datagrams()[0])->eventID, 500u);
}

TEST_F(DashboardBackendUploadTest, WithoutPostURLNothingIsUploaded) {
  Value profile = profileFor(collector.port());
  profile.asDictionary()->erase("post_url");
  auto withoutURL = makeDashboard(profile);
  ASSERT_NE(withoutURL, nullptr);
  withoutURL->setReportingSessionConnectivityDelegate(helper);
  EXPECT_FALSE(withoutURL->uploadLogData(logData()));
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "DashboardBackend(uploadLogData): Post URL for log data array is nil"));
  EXPECT_EQ(helper->postCount(), 0u);
}

TEST_F(DashboardBackendUploadTest, AnArrayWithoutPropertyListFormIsRefused) {
  EXPECT_FALSE(backend->uploadLogData(Array{Value(Dictionary{{"LogData", Value()}})}));
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "DashboardBackend(uploadLogData): Failed to serialize log data array for upload"));
  EXPECT_EQ(helper->postCount(), 0u);
}

TEST_F(DashboardBackendUploadTest, WithoutConnectivityHelperTheUploadCountsAsDone) {
  auto alone = makeDashboard(profileFor(collector.port()));
  ASSERT_NE(alone, nullptr);
  EXPECT_TRUE(alone->uploadLogData(logData()));
  EXPECT_EQ(helper->postCount(), 0u);
  EXPECT_FALSE(capture.containsPrefix("DashboardBackend(uploadLogData)"));
}

TEST_F(DashboardBackendUploadTest, AnErrorFailsTheUploadWithItsDescription) {
  EXPECT_FALSE(uploadAnswering(0, std::nullopt, makeTelvaneError(-1, "connection refused")));
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "DashboardBackend(uploadLogData): Error uploading log data array (connection refused)"));
  EXPECT_EQ(backend->eventID(), 0u);
}

TEST_F(DashboardBackendUploadTest, AnAnswerWithoutBodyFails) {
  EXPECT_FALSE(uploadAnswering(200, std::nullopt));
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "DashboardBackend(uploadLogData): Error uploading log data array (no response data)"));
  helper = std::make_shared<test::FakeConnectivityHelper>();
  backend->setReportingSessionConnectivityDelegate(helper);
  capture.clear();
  EXPECT_FALSE(uploadAnswering(200, std::string()));
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "DashboardBackend(uploadLogData): Error uploading log data array (no response data)"));
  EXPECT_EQ(backend->eventID(), 0u);
}

TEST_F(DashboardBackendUploadTest, ABodyThatIsNotUTF8TextFails) {
  EXPECT_FALSE(uploadAnswering(200, std::string("\xff\xfe", 2)));
  EXPECT_TRUE(capture.contains(
      log::Level::Error,
      "DashboardBackend(uploadLogData): Error uploading log data array (response data is not UTF-8 text)"));
}

TEST_F(DashboardBackendUploadTest, TheStatusCodeIsNotLookedAt) {
  // Only an error or a missing body fail; a server's refusal with a body still counts.
  EXPECT_TRUE(uploadAnswering(500, std::string("busy")));
  EXPECT_TRUE(capture.contains("DashboardBackend(uploadLogData): Log data uploaded to busy"));
}

TEST_F(DashboardBackendUploadTest, TheWaitForTheHelperIsBounded) {
  EXPECT_EQ(DashboardOptions{}.uploadAnswerWaitLimit, std::chrono::seconds(600));
  DashboardOptions options;
  options.uploadAnswerWaitLimit = std::chrono::milliseconds(20);
  auto impatient = makeDashboard(profileFor(collector.port()), options);
  ASSERT_NE(impatient, nullptr);
  impatient->setReportingSessionConnectivityDelegate(helper);
  // The helper never answers.
  EXPECT_FALSE(impatient->uploadLogData(logData()));
  EXPECT_EQ(helper->postCount(), 1u);
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "DashboardBackend(uploadLogData): Error uploading log data array (no answer within 20 ms)"));
  // A late answer finds nobody waiting and does no harm.
  helper->answerPostWithData(0, 200, std::string("late"));
  EXPECT_EQ(impatient->eventID(), 0u);
}

}  // namespace
}  // namespace telvane
