// StorebagDaemonTest: the fixture of end-to-end tests that run the real daemon under a
// signed storebag served by a loopback HTTPS server, with a known device identifier,
// and open client-type-7 sessions through the real client library.
//
// The daemon gets its own copy of the test CA in its folder, so that it can read it
// also when it runs as another user (DaemonOptions::runAsUid).
#pragma once

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "e2e/E2eHelpers.h"
#include "platform/SqliteSettingsStore.h"
#include "support/DaemonProcess.h"
#include "support/StorebagBuilder.h"
#include "support/TempDir.h"
#include "support/TestCertificates.h"
#include "support/TlsTestServer.h"
#include "telvane/Telvane.h"
#include "telvane/TelvaneKeys.h"

namespace telvane::test {

class StorebagDaemonTest : public ::testing::Test {
 public:
  // The device identifier the daemon reports (its device-information file says so).
  static constexpr const char* kDeviceID = "0123456789abcdef0123456789abcdef01234567";

 protected:
  void SetUp() override {
    keyPath_ = dir_.path() / "storebag-key.der";
    TestKeyPair::shared().writePublicKey(keyPath_);
    caPath_ = dir_.path() / "ca.pem";
    std::filesystem::copy_file(TestCertificates::shared().caFile(), caPath_);
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

  // Makes the server answer POSTs to the path with the status and a text body.
  void answerPath(const std::string& path, const std::string& body, int status = 200) {
    ScriptedAnswer reply;
    reply.status = status;
    reply.body = body;
    reply.contentType = "text/plain";
    server_.setAnswer(path, reply);
  }

  // Serves the storebag and starts the daemon, trusting the test CA and signing key.
  void startDaemonWith(const StorebagBuilder& storebag, DaemonOptions options = {}) {
    serveConferaStorebag(server_, storebag);
    std::ofstream(dir_.path() / "device-info.conf") << "UniqueDeviceID=" << kDeviceID << "\n";
    options.environment["TELVANED_CA_FILE"] = caPath_.string();
    options.environment["TELVANED_PUBLIC_KEY"] = keyPath_.string();
    daemon_ = std::make_unique<DaemonProcess>(dir_.str(), options);
    ASSERT_TRUE(daemon_->start());
    useDaemon(*daemon_);
  }

  // A started session of client type 7 ("com.example.conference", service "calls").
  Telvane& open(unsigned sessionID) {
    sessions_.push_back(startedSession(Value(Dictionary{{kTelvaneSessionInfoClientType, Value(7)},
                                                        {kTelvaneSessionInfoSessionID, Value(sessionID)},
                                                        {kTelvaneSessionInfoClientVersion, Value(3)}}),
                                       Value(Dictionary{{kTelvaneUserInfoClientName, Value("com.example.conference")},
                                                        {kTelvaneUserInfoServiceName, Value("calls")}})));
    return *sessions_.back();
  }

  TempDir dir_;
  TlsTestServer server_;
  std::filesystem::path keyPath_;
  std::filesystem::path caPath_;
  std::shared_ptr<SqliteSettingsStore> settings_;
  std::unique_ptr<DaemonProcess> daemon_;
  std::vector<std::unique_ptr<Telvane>> sessions_;
};

}  // namespace telvane::test
