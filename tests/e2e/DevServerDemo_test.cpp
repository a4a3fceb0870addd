// The demo's set-up as a test: the development server with its sample storebag, the
// real daemon pointed at it (storebag URL setting, its CA file and signing key), and
// events sent with the `telvane` tool and with the example client, checked where they
// land: in the development server's events file.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <memory>

#include "e2e/DevServerProcess.h"
#include "platform/Crypto.h"
#include "platform/SettingsStore.h"
#include "support/DaemonProcess.h"
#include "support/TempDir.h"
#include "support/ToolRunner.h"

using namespace telvane;
using namespace telvane::test;
using namespace std::chrono_literals;

namespace {

constexpr auto kArrivalTimeout = 40s;

// The last lines of a long text, for failure messages.
std::string tail(const std::string& text, std::size_t lines = 60) {
  std::size_t at = text.size();
  for (std::size_t n = 0; n <= lines && at != std::string::npos && at > 0; ++n) at = text.rfind('\n', at - 1);
  return at == std::string::npos ? text : text.substr(at + 1);
}

bool isEventOf(const Value& arrival, const std::string& client, std::int64_t category, std::int64_t type) {
  return arrival["kind"].stringOrEmpty() == "event" && arrival["client"].stringOrEmpty() == client &&
         arrival["category"].integerValue() == category && arrival["type"].integerValue() == type;
}

class DevServerDemo : public ::testing::Test {
 protected:
  void SetUp() override {
    server_ = std::make_unique<DevServerProcess>((dir_ / "devserver").string());
    ASSERT_TRUE(server_->start()) << server_->errors();
    // The daemon's settings: the development server as storebag server, and the
    // development section of the storebag.
    const std::string daemonDir = (dir_ / "daemon").string();
    std::filesystem::create_directories(daemonDir);
    auto settings = openSqliteSettingsStore(daemonDir + "/defaults.sqlite3");
    ASSERT_TRUE(settings);
    ASSERT_TRUE(settings->write("com.zembra.telvane", "telvane_storebag_url", Value(server_->storebagURL())));
    ASSERT_TRUE(settings->write("com.zembra.telvane", "environmentType", Value(1)));
    DaemonOptions options;
    options.environment = {{"TELVANED_CA_FILE", server_->caFile()},
                           {"TELVANED_PUBLIC_KEY", server_->publicKeyFile()},
                           // A country the sample storebag's rule lists.
                           {"LC_ALL", "en_US.UTF-8"}};
    daemon_ = std::make_unique<DaemonProcess>(daemonDir, options);
    ASSERT_TRUE(daemon_->start()) << daemon_->log();
  }

  void TearDown() override {
    if (daemon_) {
      EXPECT_EQ(daemon_->stop(), 0) << tail(daemon_->log());
    }
    if (server_) {
      EXPECT_EQ(server_->stop(), 0) << server_->errors();
    }
  }

  ToolRun telvane(const std::vector<std::string>& arguments) {
    return runTool(builtToolPath("telvane"), arguments, {"TELVANED_SOCKET=" + daemon_->socketPath()});
  }

  std::string diagnostics() const {
    return "\n--- devserver ---\n" + server_->output() + "\n--- daemon (last lines) ---\n" + tail(daemon_->log());
  }

  TempDir dir_;
  std::unique_ptr<DevServerProcess> server_;
  std::unique_ptr<DaemonProcess> daemon_;
};

}  // namespace

TEST_F(DevServerDemo, TheDaemonFetchesTheSignedSampleStorebagAndTheToolsEventsArrive) {
  ToolRun run = telvane({"send", "--component-type", "7", "--client", "com.example.e2e", "--service", "calls",
                         "--batch", "--category", "12", "--type", "3", "--payload",
                         R"({"codec":"opus","jitterMs":12})", "--count", "3", "--timeout", "30"});
  EXPECT_EQ(run.exitCode, 0) << run.out << run.err << diagnostics();
  EXPECT_NE(run.out.find("start: configured\n"), std::string::npos) << run.out << diagnostics();
  EXPECT_NE(run.out.find("enabled backends: "), std::string::npos);
  EXPECT_NE(run.out.find("brindle"), std::string::npos) << run.out;
  EXPECT_NE(run.out.find("events: 3 sent, 0 filtered\n"), std::string::npos) << run.out;
  EXPECT_NE(run.out.find("flush: ok\n"), std::string::npos) << run.out;

  // The daemon asked for the storebag of client type 7 with its version and got it.
  auto storebags = server_->waitForEvents(
      [](const Value& a) { return a["kind"].stringOrEmpty() == "storebag" && a["status"].integerValue() == 200; });
  ASSERT_FALSE(storebags.empty()) << diagnostics();
  EXPECT_EQ(storebags[0]["name"].stringOrEmpty(), "confera");
  EXPECT_EQ(storebags[0]["daemonVersion"].stringOrEmpty(), TELVANE_VERSION);

  auto events = server_->waitForEvents([](const Value& a) { return isEventOf(a, "com.example.e2e", 12, 3); }, 3,
                                       kArrivalTimeout);
  ASSERT_EQ(events.size(), 3u) << diagnostics();
  for (const Value& event : events) {
    EXPECT_EQ(event["path"].stringOrEmpty(), "/events");
    EXPECT_EQ(event["service"].stringOrEmpty(), "calls");
    EXPECT_FALSE(event["sender"].stringOrEmpty().empty());
    EXPECT_EQ(event["record"]["codec"].stringOrEmpty(), "opus");
    EXPECT_EQ(event["record"]["jitterMs"].integerValue(), 12);
    EXPECT_FALSE(event["clientId"].stringOrEmpty().empty());
    EXPECT_EQ(event["headers"]["X-TVX-Client-Name"].stringOrEmpty(), "com.example.e2e");
    EXPECT_EQ(event["headers"]["X-TVX-Service-Name"].stringOrEmpty(), "calls");
    EXPECT_EQ(event["headers"]["User-Agent"].stringOrEmpty().rfind("Telvane/", 0), 0u);
  }
  EXPECT_EQ(events[0]["record"]["_eventNumber"].integerValue() + 1, events[1]["record"]["_eventNumber"].integerValue());

  // Finishing the session sends its end message, which names the storebag version.
  auto ends = server_->waitForEvents([](const Value& a) { return isEventOf(a, "com.example.e2e", 0, 1); }, 1,
                                     kArrivalTimeout);
  ASSERT_EQ(ends.size(), 1u) << diagnostics();
  EXPECT_EQ(ends[0]["record"]["StorebagVersion"].stringOrEmpty(), "devserver-sample-1");
}

TEST_F(DevServerDemo, ARealtimeEventIsPostedAtOnceToTheRealtimeURL) {
  ToolRun run = telvane({"send", "--component-type", "11", "--client", "com.example.e2e", "--service", "alerts",
                         "--batch", "--category", "14", "--type", "2", "--flag", "1", "--payload",
                         R"({"reason":"network lost"})", "--timeout", "30"});
  // The event left at once, so the tool's closing flush finds nothing batched.
  EXPECT_NE(run.out.find("events: 1 sent, 0 filtered\n"), std::string::npos) << run.out << diagnostics();
  EXPECT_NE(run.out.find("flush: failed: Nothing to flush (TelvaneErrorDomain, code -1)\n"), std::string::npos)
      << run.out;
  auto events = server_->waitForEvents([](const Value& a) { return isEventOf(a, "com.example.e2e", 14, 2); }, 1,
                                       kArrivalTimeout);
  ASSERT_EQ(events.size(), 1u) << diagnostics();
  EXPECT_EQ(events[0]["path"].stringOrEmpty(), "/events/realtime");
  EXPECT_EQ(events[0]["count"].integerValue(), 1) << "a realtime event travels alone";
  EXPECT_EQ(events[0]["headers"]["X-TVX-Event-Map"].stringOrEmpty(), "14 2");
  EXPECT_EQ(events[0]["record"]["reason"].stringOrEmpty(), "network lost");
}

TEST_F(DevServerDemo, TheExampleClientReportsACallAndItsMediaStream) {
  ToolRun run = runTool(builtBinary("examples/report_events"), {"--events", "5"},
                        {"TELVANED_SOCKET=" + daemon_->socketPath()});
  EXPECT_EQ(run.exitCode, 0) << run.out << run.err << diagnostics();
  EXPECT_NE(run.out.find("call: configured, backends: "), std::string::npos) << run.out;
  EXPECT_NE(run.out.find("media: configured, backends: "), std::string::npos) << run.out;
  EXPECT_NE(run.out.find("call: finished\n"), std::string::npos) << run.out;

  const std::string client = "com.example.conference";
  auto quality = server_->waitForEvents([&](const Value& a) { return isEventOf(a, client, 12, 1); }, 5,
                                        kArrivalTimeout);
  ASSERT_EQ(quality.size(), 5u) << diagnostics();
  // The rule's filter hashes the user-information key in batched events.
  const std::string hashedEmail = crypto::hex(crypto::sha256("alex@example.com"));
  for (const Value& event : quality) {
    EXPECT_EQ(event["path"].stringOrEmpty(), "/events");
    EXPECT_EQ(event["service"].stringOrEmpty(), "calls");
    EXPECT_EQ(event["record"]["codec"].stringOrEmpty(), "opus");
    EXPECT_EQ(event["record"]["callID"].stringOrEmpty(), "C-2041") << "the shared data travels with the event";
    EXPECT_EQ(event["record"]["accountEmail"].stringOrEmpty(), hashedEmail);
  }

  // The realtime event follows the batch it overtook, alone, with the user
  // information as it is (only batched events get filtered user information).
  auto dropped = server_->waitForEvents([&](const Value& a) { return isEventOf(a, client, 12, 2); }, 1,
                                        kArrivalTimeout);
  ASSERT_EQ(dropped.size(), 1u) << diagnostics();
  EXPECT_EQ(dropped[0]["path"].stringOrEmpty(), "/events/realtime");
  EXPECT_EQ(dropped[0]["record"]["reason"].stringOrEmpty(), "network lost");
  EXPECT_EQ(dropped[0]["record"]["accountEmail"].stringOrEmpty(), "alex@example.com");

  // The child session of the media stream sees the call's shared data.
  auto media = server_->waitForEvents([&](const Value& a) { return isEventOf(a, client, 13, 1); }, 1,
                                      kArrivalTimeout);
  ASSERT_EQ(media.size(), 1u) << diagnostics();
  EXPECT_EQ(media[0]["service"].stringOrEmpty(), "media");
  EXPECT_EQ(media[0]["record"]["callID"].stringOrEmpty(), "C-2041");
  EXPECT_EQ(media[0]["record"]["videoCodec"].stringOrEmpty(), "h264");
  EXPECT_EQ(media[0]["record"]["framesDropped"].integerValue(), 3);
}

TEST_F(DevServerDemo, TheToolsUploadArrivesAndTheFileIsRemovedAfterTheServersSuccess) {
  const std::filesystem::path file = dir_ / "call log.txt";
  writeFile(file, "12:00:01 call started\n12:04:09 call ended\n");
  ToolRun run = telvane({"upload", "--component-type", "7", "--client", "com.example.e2e", "--service", "calls",
                         "--session-id", "41", "--timeout", "30", file.string()});
  EXPECT_EQ(run.exitCode, 0) << run.out << run.err << diagnostics();
  EXPECT_NE(run.out.find("file upload supported: yes\n"), std::string::npos) << run.out;
  EXPECT_NE(run.out.find("upload: succeeded\n"), std::string::npos) << run.out << diagnostics();
  EXPECT_FALSE(std::filesystem::exists(file));

  auto uploads = server_->waitForEvents([](const Value& a) { return a["kind"].stringOrEmpty() == "upload"; }, 1,
                                        kArrivalTimeout);
  ASSERT_EQ(uploads.size(), 1u) << diagnostics();
  EXPECT_EQ(uploads[0]["filename"].stringOrEmpty(), "call log.txt.gz");
  EXPECT_EQ(uploads[0]["sequence"].stringOrEmpty(), "41");
  EXPECT_EQ(uploads[0]["description"].stringOrEmpty(), "Callwave AFRC log (Uploaded by VTR)");
  EXPECT_EQ(uploads[0]["query"]["raw"].stringOrEmpty(), "true");
  EXPECT_TRUE(uploads[0]["gzip"].boolValue());
  std::ifstream saved(uploads[0]["savedAs"].stringOrEmpty(), std::ios::binary);
  std::string contents((std::istreambuf_iterator<char>(saved)), std::istreambuf_iterator<char>());
  EXPECT_EQ(contents, "12:00:01 call started\n12:04:09 call ended\n");
}
