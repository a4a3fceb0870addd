// Log-data uploads from the real client library through the real daemon and its
// dashboard backend to a loopback HTTPS server, under a signed storebag whose only
// backend is "dashboard" (pointing at a loopback UDP collector): the archive arrives
// as a binary property list of the array, the location the server answers is logged,
// and a server that answers nothing makes the upload fail. Session events never become
// dashboard datagrams.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <future>

#include "e2e/StorebagDaemonTest.h"
#include "platform/PropertyList.h"
#include "support/UdpTestCollector.h"
#include "support/WaitUntil.h"
#include "telvane/TelvaneKeys.h"

using namespace telvane;
using namespace telvane::test;
using namespace std::chrono_literals;
namespace fs = std::filesystem;

namespace {

class DaemonDashboard : public StorebagDaemonTest {
 protected:
  void answer(const std::string& body, int status = 200) { answerPath("/logdata", body, status); }

  void startDaemon() {
    StorebagBuilder builder;
    builder.version("dashboard-1");
    for (const char* section : {"zembra_internal", "development", "seed", "release"}) {
      builder.backend(section, "dashboard",
                      Value(Dictionary{{"ip", Value("127.0.0.1")},
                                       {"port", Value(static_cast<long long>(collector_.port()))},
                                       {"reliable", Value(200)},
                                       {"post_url", Value(server_.url("/logdata"))},
                                       {"display_url", Value("dashboard.test")}}));
    }
    startDaemonWith(builder);
  }

  static Value logData() {
    return Value(Array{Value(Dictionary{{kTelvaneLogDataData, Value(Bytes{'G', 'a', 'd', 'g', 'e', 't', '1'})},
                                        {kTelvaneLogDataStartTime, Value::date(1'700'000'000.0)},
                                        {kTelvaneLogDataEndTime, Value::date(1'700'000'030.0)}})});
  }

  std::optional<bool> upload(Telvane& session) {
    auto promise = std::make_shared<std::promise<bool>>();
    if (!session.uploadDataArray(logData(), [promise](bool ok, const auto&) { promise->set_value(ok); })) {
      return std::nullopt;
    }
    auto future = promise->get_future();
    if (future.wait_for(60s) != std::future_status::ready) return std::nullopt;
    return future.get();
  }

  UdpTestCollector collector_{UdpTestCollector::Mode::Acknowledge};
};

TEST_F(DaemonDashboard, LogDataArrivesAsABinaryPropertyListAndTheLocationIsLogged) {
  answer("https://dashboard.test/logs/42");
  startDaemon();
  Telvane& session = open(2718);
  EXPECT_EQ(session.enabledBackendNames(), std::vector<std::string>{"dashboard"});
  EXPECT_EQ(upload(session), std::optional<bool>(true)) << daemon_->log();

  auto requests = server_.requestsForPath("/logdata");
  ASSERT_EQ(requests.size(), 1u);
  EXPECT_EQ(requests[0].method, "POST");
  EXPECT_EQ(requests[0].header("Content-Type"), "application/octet-stream");
  Result<Value> archive = plist::decode(requests[0].body);
  ASSERT_TRUE(archive.ok()) << archive.error();
  EXPECT_EQ(archive.value(), logData());
  EXPECT_TRUE(daemon_->waitForLogLine("DashboardBackend(uploadLogData): Log data uploaded to https://dashboard.test/logs/42"));
  EXPECT_TRUE(daemon_->waitForLogLine("uploadLogData: Log data array upload successful"));
}

TEST_F(DaemonDashboard, AnAnswerWithoutBodyFailsTheUpload) {
  answer("", 500);
  startDaemon();
  Telvane& session = open(2718);
  EXPECT_EQ(upload(session), std::optional<bool>(false)) << daemon_->log();
  EXPECT_TRUE(daemon_->waitForLogLine("DashboardBackend(uploadLogData): Error uploading log data array (no response data)"));
  EXPECT_TRUE(daemon_->waitForLogLine("uploadLogData: Log data array upload failed"));
}

TEST_F(DaemonDashboard, SessionEventsAreNotSentAsDatagrams) {
  answer("https://dashboard.test/logs/1");
  startDaemon();
  Telvane& session = open(2718);
  EXPECT_TRUE(session.sendMessageWithCategory(1, 2, Value(Dictionary{{"k", Value("v")}})));
  // The upload's location event goes through the same path; neither makes a datagram.
  EXPECT_EQ(upload(session), std::optional<bool>(true)) << daemon_->log();
  EXPECT_TRUE(daemon_->waitForLogLine("uploadLogData: Log data array upload successful"));
  // A bridged event would be on its way by now; give it a moment to arrive.
  EXPECT_FALSE(collector_.waitForCount(1, 500ms));
}

}  // namespace
