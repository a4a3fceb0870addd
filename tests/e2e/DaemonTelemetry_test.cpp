// Events from the real client library through the real daemon to the platform
// telemetry backends, under a signed storebag whose section has a "metrix" and a
// "power" backend: the example wireless-diagnostics adaptor (loaded by the daemon
// from $TELVANED_METRIX_ADAPTOR) writes what it receives to a file that the test
// reads; a missing adaptor turns each event into an error line while the daemon keeps
// serving; the power-log backend exists but records nothing from session events.
#include <gtest/gtest.h>

#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <future>
#include <sstream>

#include "e2e/E2eHelpers.h"
#include "platform/Json.h"
#include "platform/Random.h"
#include "platform/SqliteSettingsStore.h"
#include "support/DaemonProcess.h"
#include "support/SignedEnvelope.h"
#include "support/StorebagBuilder.h"
#include "support/TempDir.h"
#include "support/TestCertificates.h"
#include "support/TlsTestServer.h"
#include "support/WaitUntil.h"
#include "telvane/Telvane.h"
#include "telvane/TelvaneKeys.h"

using namespace telvane;
using namespace telvane::test;
using namespace std::chrono_literals;

namespace {

constexpr const char* kClient = "com.example.conference";
constexpr const char* kMissingSelectorLine =
    "MetrixBackend(sendMessage): Metrix adaptor (null) does not respond to forwarding selector "
    "sendMessageWithMethod:respCode:dict:";

// One line the example adaptor wrote: "<method> <respCode> <JSON>".
struct AdaptorLine {
  unsigned method = 0;
  unsigned respCode = 0;
  std::string json;
  Value dictionary;
};

bool journalRuns() {
  if (!std::filesystem::exists("/run/systemd/journal/socket")) return false;
  return std::system("journalctl -n 0 --output=json >/dev/null 2>&1") == 0;
}

class DaemonTelemetry : public ::testing::Test {
 protected:
  void SetUp() override {
    keyPath_ = dir_.path() / "storebag-key.der";
    TestKeyPair::shared().writePublicKey(keyPath_);
    settings_ = SqliteSettingsStore::open(dir_.str() + "/defaults.sqlite3");
    ASSERT_TRUE(settings_);
    ASSERT_TRUE(settings_->write("com.zembra.telvane", "telvane_storebag_url", Value(server_.url("/bags"))));
    // A fixed device model (the wireless-diagnostics backend is never made on one).
    writeFile(dir_.path() / "device-info.conf", "ProductType=Board9\n");
  }

  void TearDown() override {
    sessions_.clear();
    if (daemon_) {
      EXPECT_EQ(daemon_->stop(), 0) << daemon_->log();
    }
  }

  static std::string exampleAdaptor() { return builtBinary("examples/metrix_adaptor_file.so"); }

  void startDaemon(const std::string& adaptorPath) {
    StorebagBuilder builder;
    builder.version("telemetry-1");
    for (const char* section : {"zembra_internal", "development", "seed", "release"}) {
      builder.backend(section, "metrix", Value(Dictionary{{"active", Value(true)}}));
      builder.backend(section, "power", Value::dictionary());
    }
    serveConferaStorebag(server_, builder);

    DaemonOptions options;
    options.environment = {{"TELVANED_CA_FILE", TestCertificates::shared().caFile()},
                           {"TELVANED_PUBLIC_KEY", keyPath_.string()},
                           {"TELVANED_METRIX_ADAPTOR", adaptorPath},
                           {"METRIX_ADAPTOR_OUTPUT", output_.string()},
                           {"LC_ALL", "en_US.UTF-8"}};
    daemon_ = std::make_unique<DaemonProcess>(dir_.str(), options);
    ASSERT_TRUE(daemon_->start());
    useDaemon(*daemon_);
  }

  Telvane& open(unsigned sessionID = 1) {
    sessions_.push_back(startedSession(
        Value(Dictionary{{kTelvaneSessionInfoClientType, Value(7)},
                         {kTelvaneSessionInfoSessionID, Value(sessionID)},
                         {kTelvaneSessionInfoClientVersion, Value(12)},
                         {kTelvaneSessionInfoHierarchyToken, Telvane::newHierarchyTokenFromParentToken(Value())}}),
        Value(Dictionary{{kTelvaneUserInfoClientName, Value(kClient)}, {kTelvaneUserInfoServiceName, Value("calls")}})));
    return *sessions_.back();
  }

  // Flushes and waits for the daemon's answer: every event sent before has then been
  // through the backends. False when no answer came.
  bool flush(Telvane& session) {
    auto promise = std::make_shared<std::promise<void>>();
    session.flushMessagesWithCompletion([promise](const std::optional<Error>&) { promise->set_value(); });
    return promise->get_future().wait_for(30s) == std::future_status::ready;
  }

  std::vector<AdaptorLine> adaptorLines() const {
    std::vector<AdaptorLine> lines;
    if (!std::filesystem::exists(output_)) return lines;
    std::istringstream in(readFile(output_));
    std::string text;
    while (std::getline(in, text)) {
      AdaptorLine line;
      std::istringstream fields(text);
      fields >> line.method >> line.respCode;
      fields.get();
      std::getline(fields, line.json);
      auto parsed = json::parse(line.json);
      if (parsed.ok()) line.dictionary = parsed.value();
      lines.push_back(std::move(line));
    }
    return lines;
  }

  std::optional<AdaptorLine> waitForAdaptorLine(unsigned method, unsigned respCode,
                                                 std::chrono::milliseconds timeout = 20s) const {
    std::optional<AdaptorLine> found;
    waitUntil(
        [&] {
          for (const AdaptorLine& line : adaptorLines()) {
            if (line.method == method && line.respCode == respCode) {
              found = line;
              return true;
            }
          }
          return false;
        },
        timeout);
    return found;
  }

  TempDir dir_;
  TlsTestServer server_;
  std::filesystem::path keyPath_;
  std::filesystem::path output_ = dir_.path() / "adaptor.out";
  std::shared_ptr<SqliteSettingsStore> settings_;
  std::unique_ptr<DaemonProcess> daemon_;
  std::vector<std::unique_ptr<Telvane>> sessions_;
};

TEST_F(DaemonTelemetry, TheAdaptorReceivesMethodResponseCodeAndTheEventDictionary) {
  ASSERT_TRUE(std::filesystem::exists(exampleAdaptor())) << exampleAdaptor();
  startDaemon(exampleAdaptor());
  Telvane& session = open();
  EXPECT_EQ(session.enabledBackendNames(), (std::vector<std::string>{"metrix", "power"}));
  EXPECT_TRUE(daemon_->waitForLogLine("MetrixBackend(initWithName): Loading Metrix adaptor class for client type 7"));

  session.updateSharedDataWithDictionary(Value(Dictionary{{"callID", Value("C-2041")}}));
  const Value payload(Dictionary{{"codec", Value("opus")}, {"jitterMs", Value(12)}, {"ratio", Value(0.5)}});
  ASSERT_TRUE(session.sendMessageWithCategory(12, 3, payload));
  ASSERT_TRUE(flush(session));

  std::optional<AdaptorLine> line = waitForAdaptorLine(12, 3);
  ASSERT_TRUE(line) << daemon_->log();
  ASSERT_TRUE(line->dictionary.isDictionary()) << line->json;
  EXPECT_EQ(line->dictionary["ClientData"], payload);
  EXPECT_EQ(line->dictionary["SharedData"]["callID"], Value("C-2041"));
  EXPECT_EQ(line->dictionary.asDictionary()->size(), 2u) << "nothing but the event dictionary: " << line->json;
  EXPECT_EQ(daemon_->countLogPrefix("MetrixBackend(sendMessage)"), 0u) << daemon_->log();

  // The session's own start message reaches the adaptor as well (method 0, code 0).
  std::optional<AdaptorLine> start = waitForAdaptorLine(0, 0);
  ASSERT_TRUE(start);
  EXPECT_TRUE(start->dictionary["ClientData"].asDictionary()->contains("Locale")) << start->json;
}

TEST_F(DaemonTelemetry, ValuesJsonCannotCarryNeverBreakTheAdaptorsText) {
  startDaemon(exampleAdaptor());
  Telvane& session = open();
  ASSERT_TRUE(session.sendMessageWithCategory(
      20, 1,
      Value(Dictionary{{"when", Value::date(1'700'000'000.5)},
                       {"raw", Value(Bytes{'h', 'i'})},
                       {"nan", Value(std::nan(""))},
                       {"nested", Value(Dictionary{{"list", Value(Array{Value(1), Value("two")})}})}})));
  ASSERT_TRUE(flush(session));
  std::optional<AdaptorLine> line = waitForAdaptorLine(20, 1);
  ASSERT_TRUE(line) << daemon_->log();
  EXPECT_EQ(line->dictionary["ClientData"],
            Value(Dictionary{{"nested", Value(Dictionary{{"list", Value(Array{Value(1), Value("two")})}})},
                             {"raw", Value("aGk=")},
                             {"when", Value(1'700'000'000.5)}}))
      << line->json;
  EXPECT_TRUE(daemon_->waitForLogLine(
      "MetrixBackend(sendMessage): JSON can't carry the value of ClientData.nan; left out"));
}

TEST_F(DaemonTelemetry, AOneShotEventReachesTheAdaptorWithItsPayloadUnwrapped) {
  startDaemon(exampleAdaptor());
  bool replied = false;
  std::promise<std::optional<std::string>> reply;
  ASSERT_TRUE(Telvane::sendOneMessageWithSessionInfo(
      Value(Dictionary{{kTelvaneSessionInfoClientType, Value(7)}, {kTelvaneSessionInfoSessionID, Value(77)}}),
      Value(Dictionary{{kTelvaneUserInfoClientName, Value(kClient)}, {kTelvaneUserInfoServiceName, Value("calls")}}),
      30, 2, Value(Dictionary{{"single", Value("yes")}}), nullptr,
      [&reply](const std::optional<std::string>& text) { reply.set_value(text); }));
  auto future = reply.get_future();
  ASSERT_EQ(future.wait_for(20s), std::future_status::ready);
  replied = future.get().has_value();
  EXPECT_TRUE(replied);
  std::optional<AdaptorLine> line = waitForAdaptorLine(30, 2);
  ASSERT_TRUE(line) << daemon_->log();
  EXPECT_EQ(line->dictionary["single"], Value("yes")) << line->json;
  EXPECT_FALSE(line->dictionary.asDictionary()->contains("ClientData")) << line->json;
}

TEST_F(DaemonTelemetry, AMissingAdaptorGivesAnErrorLinePerEventAndTheDaemonKeepsServing) {
  startDaemon((dir_.path() / "no-such-adaptor.so").string());
  Telvane& session = open();
  EXPECT_EQ(session.enabledBackendNames(), (std::vector<std::string>{"metrix", "power"}))
      << "the backend is made without its adaptor";
  // The session's start message went through the backend before the start answered.
  ASSERT_TRUE(daemon_->waitForLogLine(kMissingSelectorLine, 20s, 1)) << daemon_->log();
  for (std::uint16_t i = 1; i <= 3; ++i) {
    ASSERT_TRUE(session.sendMessageWithCategory(12, i, Value(Dictionary{{"n", Value(i)}})));
  }
  ASSERT_TRUE(flush(session)) << "the daemon still answers";
  EXPECT_EQ(daemon_->countLogLines(kMissingSelectorLine), 4u) << daemon_->log();
  EXPECT_FALSE(std::filesystem::exists(output_));

  // A second session is served as well.
  Telvane& second = open(2);
  ASSERT_TRUE(second.sendMessageWithCategory(13, 1, Value(Dictionary{{"n", Value(1)}})));
  ASSERT_TRUE(flush(second));
  EXPECT_EQ(daemon_->countLogLines(kMissingSelectorLine), 6u) << "start message and event of the second session";
}

TEST_F(DaemonTelemetry, ThePowerBackendRecordsNothingFromSessionEvents) {
  startDaemon(exampleAdaptor());
  Telvane& session = open();
  ASSERT_EQ(session.enabledBackendNames(), (std::vector<std::string>{"metrix", "power"}));
  const std::string marker = Random::system()->uuidString();
  ASSERT_TRUE(session.sendMessageWithCategory(40, 2, Value(Dictionary{{"marker", Value(marker)}})));
  ASSERT_TRUE(flush(session));
  // The event went through the session's backends: the adaptor, next to the power
  // backend, received it.
  std::optional<AdaptorLine> line = waitForAdaptorLine(40, 2);
  ASSERT_TRUE(line) << daemon_->log();
  EXPECT_EQ(line->dictionary["ClientData"]["marker"], Value(marker));

  if (!journalRuns()) {
    GTEST_SKIP() << "no journal on this machine to look for power-log entries in";
  }
  // The power log is the journal: no entry carries the event's marker. An entry would
  // have been sent before the flush answered; give the journal a moment to show it.
  const std::string command =
      "journalctl --output=json --no-pager TELVANE_EVENT_MARKER=" + marker + " 2>/dev/null";
  auto journalHasMarker = [&] {
    FILE* pipe = ::popen(command.c_str(), "r");
    if (!pipe) return false;
    std::string out;
    char buffer[4096];
    std::size_t n;
    while ((n = std::fread(buffer, 1, sizeof buffer, pipe)) > 0) out.append(buffer, n);
    ::pclose(pipe);
    return out.find(marker) != std::string::npos;
  };
  EXPECT_FALSE(waitUntil(journalHasMarker, 2s));
}

}  // namespace
