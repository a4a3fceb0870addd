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

#include "e2e/E2eHelpers.h"
#include "platform/PropertyList.h"
#include "platform/SqliteSettingsStore.h"
#include "support/DaemonProcess.h"
#include "support/StorebagBuilder.h"
#include "support/TempDir.h"
#include "support/TestCertificates.h"
#include "support/TlsTestServer.h"
#include "support/UdpTestCollector.h"
#include "support/WaitUntil.h"
#include "telvane/Telvane.h"
#include "telvane/TelvaneKeys.h"

using namespace telvane;
using namespace telvane::test;
using namespace std::chrono_literals;
namespace fs = std::filesystem;

namespace {

constexpr const char* kDeviceID = "0123456789abcdef0123456789abcdef01234567";

class DaemonDashboard : public ::testing::Test {
 protected:
  void SetUp() override {
    keyPath_ = dir_.path() / "storebag-key.der";
    TestKeyPair::shared().writePublicKey(keyPath_);
    caPath_ = dir_.path() / "ca.pem";
    fs::copy_file(TestCertificates::shared().caFile(), caPath_);
    settings_ = SqliteSettingsStore::open(dir_.str() + "/defaults.sqlite3");
    ASSERT_TRUE(settings_);
    ASSERT_TRUE(settings_->write("com.zembra.telvane", "telvane_storebag_url", Value(server_.url("/bags"))));
  }

  void TearDown() override {
    sessions_.clear();
    if (daemon_) {
      EXPECT_EQ(daemon_->stop(), 0) << daemon_->log();
    }
  }

  void answer(const std::string& body, int status = 200) {
    ScriptedAnswer reply;
    reply.status = status;
    reply.body = body;
    reply.contentType = "text/plain";
    server_.setAnswer("/logdata", reply);
  }

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
    serveConferaStorebag(server_, builder);
    std::ofstream(dir_.path() / "device-info.conf") << "UniqueDeviceID=" << kDeviceID << "\n";
    DaemonOptions options;
    options.environment["TELVANED_CA_FILE"] = caPath_.string();
    options.environment["TELVANED_PUBLIC_KEY"] = keyPath_.string();
    daemon_ = std::make_unique<DaemonProcess>(dir_.str(), options);
    ASSERT_TRUE(daemon_->start());
    useDaemon(*daemon_);
  }

  Telvane& open() {
    sessions_.push_back(startedSession(Value(Dictionary{{kTelvaneSessionInfoClientType, Value(7)},
                                                        {kTelvaneSessionInfoSessionID, Value(2718u)},
                                                        {kTelvaneSessionInfoClientVersion, Value(3)}}),
                                       Value(Dictionary{{kTelvaneUserInfoClientName, Value("com.example.conference")},
                                                        {kTelvaneUserInfoServiceName, Value("calls")}})));
    return *sessions_.back();
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

  TempDir dir_;
  TlsTestServer server_;
  UdpTestCollector collector_{UdpTestCollector::Mode::Acknowledge};
  fs::path keyPath_;
  fs::path caPath_;
  std::shared_ptr<SqliteSettingsStore> settings_;
  std::unique_ptr<DaemonProcess> daemon_;
  std::vector<std::unique_ptr<Telvane>> sessions_;
};

TEST_F(DaemonDashboard, LogDataArrivesAsABinaryPropertyListAndTheLocationIsLogged) {
  answer("https://dashboard.test/logs/42");
  startDaemon();
  Telvane& session = open();
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
  Telvane& session = open();
  EXPECT_EQ(upload(session), std::optional<bool>(false)) << daemon_->log();
  EXPECT_TRUE(daemon_->waitForLogLine("DashboardBackend(uploadLogData): Error uploading log data array (no response data)"));
  EXPECT_TRUE(daemon_->waitForLogLine("uploadLogData: Log data array upload failed"));
}

TEST_F(DaemonDashboard, SessionEventsAreNotSentAsDatagrams) {
  answer("https://dashboard.test/logs/1");
  startDaemon();
  Telvane& session = open();
  EXPECT_TRUE(session.sendMessageWithCategory(1, 2, Value(Dictionary{{"k", Value("v")}})));
  // The upload's location event goes through the same path; neither makes a datagram.
  EXPECT_EQ(upload(session), std::optional<bool>(true)) << daemon_->log();
  EXPECT_TRUE(daemon_->waitForLogLine("uploadLogData: Log data array upload successful"));
  // A bridged event would be on its way by now; give it a moment to arrive.
  EXPECT_FALSE(collector_.waitForCount(1, 500ms));
}

}  // namespace
