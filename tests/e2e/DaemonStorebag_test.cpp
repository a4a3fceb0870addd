// The real daemon fetching its signed configuration from an HTTPS storebag server on
// loopback: one fetch shared by the client types of one storebag, the disk cache
// across daemon runs, and a tampered answer that leaves the cache as it was.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>

#include "platform/SqliteSettingsStore.h"
#include "support/DaemonProcess.h"
#include "support/SignedEnvelope.h"
#include "support/StorebagBuilder.h"
#include "support/TempDir.h"
#include "support/TestCertificates.h"
#include "support/TlsTestServer.h"
#include "support/ToolRunner.h"

using namespace telvane;
using namespace telvane::test;
using namespace std::chrono_literals;

namespace {

constexpr const char* kLastModified = "Tue, 17 Nov 2026 10:00:00 GMT";

// A document with one backend entry in every environment, so that the session is
// configured whichever environment the daemon chooses.
Value sampleDocument(const std::string& version) {
  StorebagBuilder builder;
  builder.version(version).refreshCycle(3600);
  for (const char* section : {"zembra_internal", "development", "seed", "release"}) {
    builder.backend(section, "release_timeout", Value(30));
  }
  return builder.build();
}

std::string readFile(const std::filesystem::path& path) {
  std::ifstream in(path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

class DaemonStorebag : public ::testing::Test {
 protected:
  void SetUp() override {
    keyPath_ = dir_.path() / "storebag-key.der";
    TestKeyPair::shared().writePublicKey(keyPath_);
    auto settings = SqliteSettingsStore::open(dir_.str() + "/defaults.sqlite3");
    ASSERT_TRUE(settings);
    ASSERT_TRUE(settings->write("com.zembra.telvane", "telvane_storebag_url", Value(server_.url("/bags"))));
    envelope_ = SignedEnvelopeBuilder().sign(sampleDocument("5.0"));
    serve(envelope_);
  }

  void serve(const Bytes& envelope) {
    ScriptedAnswer answer;
    answer.headers = {{"Cache-Control", "private, max-age=3600"}, {"Last-Modified", kLastModified}};
    answer.body.assign(envelope.begin(), envelope.end());
    server_.setAnswer("/bags/confera", answer);
  }

  DaemonOptions options() const {
    DaemonOptions options;
    options.environment = {{"TELVANED_CA_FILE", TestCertificates::shared().caFile()},
                           {"TELVANED_PUBLIC_KEY", keyPath_.string()},
                           {"TELVANED_STOREBAG_REFRESH_SPREAD_SECONDS", "1"}};
    return options;
  }

  ToolRun states(const DaemonProcess& daemon, int componentType) {
    return runTool(builtToolPath("telvane"), {"states", "--component-type", std::to_string(componentType)},
                   {"TELVANED_SOCKET=" + daemon.socketPath()});
  }

  std::filesystem::path cacheFile() const { return dir_.path() / "cache" / "storebags" / "confera"; }

  TempDir dir_;
  TlsTestServer server_;
  std::filesystem::path keyPath_;
  Bytes envelope_;
};

TEST_F(DaemonStorebag, ClientTypesOfOneStorebagShareOneFetchAndALaterRunUsesTheDiskCache) {
  {
    DaemonProcess daemon(dir_.str(), options());
    ASSERT_TRUE(daemon.start());
    ToolRun first = states(daemon, 7);
    EXPECT_EQ(first.exitCode, 0) << first.err;
    EXPECT_NE(first.out.find("start: configured"), std::string::npos) << first.out;
    ToolRun second = states(daemon, 11);
    EXPECT_EQ(second.exitCode, 0) << second.err;
    EXPECT_NE(second.out.find("start: configured"), std::string::npos) << second.out;

    const auto requests = server_.requestsForPath("/bags/confera");
    ASSERT_EQ(requests.size(), 1u) << "client types 7 and 11 share the storebag \"confera\"";
    EXPECT_EQ(requests[0].query.rfind("version=", 0), 0u) << requests[0].query;
    EXPECT_EQ(requests[0].header("If-Modified-Since"), "") << "the first fetch is not conditional";
    EXPECT_TRUE(daemon.waitForLogLine("fetchStorebagWithName: storebag 'confera' has been saved to disk cache"));
    EXPECT_TRUE(daemon.waitForLogLine("saveLastLoadedStorebagMetricsWithName: New storebag 'confera' received: "
                                      "maxAge 3600, Last-Modified '" +
                                      std::string(kLastModified) + "'"));
    EXPECT_TRUE(daemon.waitForLogLine("storebagForSession: Cached storebag found for client type 11"));
    EXPECT_EQ(daemon.countLogLines("fetchAndCacheStorebag: Fetching storebag for client type 7"), 1u);
    EXPECT_EQ(daemon.countLogLines("fetchAndCacheStorebag: Fetching storebag for client type 11"), 0u);
    EXPECT_EQ(daemon.stop(), 0);
  }
  ASSERT_TRUE(std::filesystem::exists(cacheFile()));
  EXPECT_EQ(readFile(cacheFile()), std::string(envelope_.begin(), envelope_.end()));

  DaemonProcess again(dir_.str(), options());
  ASSERT_TRUE(again.start());
  ToolRun run = states(again, 7);
  EXPECT_EQ(run.exitCode, 0) << run.err;
  EXPECT_NE(run.out.find("start: configured"), std::string::npos) << run.out;
  EXPECT_TRUE(again.waitForLogLine(
      "fetchStorebagWithName: storebag 'confera' loaded from disk cache. Disk cache is valid and will not be "
      "refreshed"));
  EXPECT_EQ(server_.requestsForPath("/bags/confera").size(), 1u) << "a fresh disk cache needs no request";
  EXPECT_EQ(again.stop(), 0);
}

TEST_F(DaemonStorebag, TamperedRefreshLeavesThePreviousCacheFileUntouched) {
  {
    DaemonProcess daemon(dir_.str(), options());
    ASSERT_TRUE(daemon.start());
    EXPECT_EQ(states(daemon, 7).exitCode, 0);
    EXPECT_EQ(daemon.stop(), 0);
  }
  ASSERT_TRUE(std::filesystem::exists(cacheFile()));
  // Two hours old: past the max age of 3600 the server gave.
  const auto oldTime = std::filesystem::last_write_time(cacheFile()) - 2h;
  std::filesystem::last_write_time(cacheFile(), oldTime);
  serve(tamper::changeBagByte(envelope_, 10));

  DaemonProcess daemon(dir_.str(), options());
  ASSERT_TRUE(daemon.start());
  ToolRun run = states(daemon, 7);
  EXPECT_EQ(run.exitCode, 0) << run.err;
  EXPECT_NE(run.out.find("start: configured"), std::string::npos) << "the stale envelope still serves";
  EXPECT_TRUE(daemon.waitForLogLine(
      "fetchStorebagWithName: storebag 'confera' loaded from disk cache. Disk cache expired and will be refreshed"));
  ASSERT_TRUE(server_.waitForRequests(2));
  const auto requests = server_.requestsForPath("/bags/confera");
  ASSERT_EQ(requests.size(), 2u);
  EXPECT_EQ(requests[1].header("If-Modified-Since"), kLastModified);
  EXPECT_TRUE(daemon.waitForLogPrefix("fetchStorebagWithName: Signature can not be verified, ").has_value());
  EXPECT_EQ(daemon.stop(), 0);

  EXPECT_EQ(readFile(cacheFile()), std::string(envelope_.begin(), envelope_.end()));
  EXPECT_EQ(std::filesystem::last_write_time(cacheFile()), oldTime);
}

TEST_F(DaemonStorebag, UnreachableServerLeavesTheSessionUnconfiguredAndTheDaemonServing) {
  ScriptedAnswer closing;
  closing.closeWithoutAnswer = true;
  server_.setAnswer("/bags/confera", closing);
  DaemonProcess daemon(dir_.str(), options());
  ASSERT_TRUE(daemon.start());
  ToolRun run = states(daemon, 7);
  EXPECT_NE(run.out.find("start: not configured"), std::string::npos) << run.out << run.err;
  EXPECT_TRUE(daemon.waitForLogPrefix(
                        "fetchNetworkStorebag: Error resolving with lookup server " + server_.url("/bags/confera"))
                  .has_value());
  EXPECT_TRUE(daemon.waitForLogLine("fetchNetworkStorebag: Loading default storebag 'confera'"));
  EXPECT_TRUE(daemon.waitForLogLine("fetchAndCacheStorebag: Unable to fetch storebag for client type 7"));
  // Within the retry interval the next session gets no fetch.
  ToolRun next = states(daemon, 11);
  EXPECT_NE(next.out.find("start: not configured"), std::string::npos) << next.out;
  EXPECT_TRUE(daemon.waitForLogLine(
      "storebagForSession: Not fetching storebag for client type 11 - must wait 900 seconds between attempts"));
  EXPECT_FALSE(std::filesystem::exists(cacheFile()));
  EXPECT_EQ(daemon.stop(), 0);
}

}  // namespace
