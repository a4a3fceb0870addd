// StorebagRetrieval against the real GET helper and a loopback HTTPS storebag server:
// first use, disk cache freshness, conditional refreshes, the server's caching
// metrics, signature failures, server failures and the once-per-URL rule of the
// shared helper.
#include "storebag/StorebagRetrieval.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <chrono>
#include <cmath>
#include <ctime>
#include <filesystem>
#include <functional>
#include <memory>
#include <ostream>
#include <string>
#include <vector>

#include "connectivity/ReportingSessionConnectivityHelperImpl.h"
#include "platform/Log.h"
#include "platform/MemorySettingsStore.h"
#include "platform/SystemInfo.h"
#include "support/ManualClock.h"
#include "support/ScriptedRandom.h"
#include "support/SignedEnvelope.h"
#include "support/StorebagBuilder.h"
#include "support/StorebagTestServer.h"
#include "support/TempDir.h"
#include "support/TestCertificates.h"
#include "support/WaitUntil.h"

namespace telvane {
namespace {

using test::bytesOf;
using test::SignedEnvelopeBuilder;
using test::StorebagBuilder;
using test::StorebagHeaders;
using test::TestKeyPair;
using test::waitUntil;

constexpr const char* kVersion = "4.2.1";
constexpr const char* kLastModified1 = "Tue, 14 Nov 2023 22:13:20 GMT";
constexpr const char* kLastModified2 = "Wed, 15 Nov 2023 08:00:00 GMT";

// The typographic quote that closes the name in the zero-length line.
constexpr const char* kClosingQuote = "\u2018";

Value documentWithVersion(const std::string& version) {
  return StorebagBuilder()
      .version(version)
      .sharedValue("==hosts", Value("a.example,b.example"))
      .backend("release", "metrix", Value(Dictionary{{"active", Value(true)}, {"hosts", Value("==hosts")}}))
      .backend("zembra_internal", "metrix", Value(Dictionary{{"active", Value(false)}}))
      .build();
}

// The document as the retrieval hands it out: macros expanded, no "shared_values".
void expectDocumentOfVersion(const std::optional<Value>& document, const std::string& version) {
  ASSERT_TRUE(document.has_value());
  EXPECT_EQ((*document)["version"], Value(version));
  EXPECT_EQ((*document)["release"]["metrix"]["hosts"], Value(Array{Value("a.example"), Value("b.example")}));
  EXPECT_FALSE(document->asDictionary()->contains("shared_values"));
}

bool endsWith(const std::string& text, const std::string& tail) {
  return text.size() >= tail.size() && text.compare(text.size() - tail.size(), tail.size(), tail) == 0;
}

double realNowSeconds() {
  return std::floor(std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count());
}

void setFileTime(const std::filesystem::path& path, double seconds) {
  struct timespec times[2];
  times[0].tv_sec = static_cast<time_t>(seconds);
  times[0].tv_nsec = 0;
  times[1] = times[0];
  ASSERT_EQ(::utimensat(AT_FDCWD, path.c_str(), times, 0), 0) << path;
}

double fileTime(const std::filesystem::path& path) {
  struct stat info {};
  if (::stat(path.c_str(), &info) != 0) return -1;
  return static_cast<double>(info.st_mtim.tv_sec) + static_cast<double>(info.st_mtim.tv_nsec) / 1e9;
}

class StorebagRetrievalTest : public ::testing::Test {
 protected:
  using Helper = ReportingSessionConnectivityHelperImpl;

  void SetUp() override {
    ::setenv("TELVANED_CA_FILE", test::TestCertificates::shared().caFile().c_str(), 1);
    settings->write(kTelvaneSettingsDomain, kStorebagURLSettingsKey, Value(server.baseURL()));
  }
  void TearDown() override { ::unsetenv("TELVANED_CA_FILE"); }

  // The real helper (made by the retrieval itself); requests go to the test server.
  StorebagRetrieval::Options options() {
    StorebagRetrieval::Options o;
    o.settings = settings;
    o.diskCache = StorebagDiskCache(dir.str(), false);
    o.publicKey = TestKeyPair::shared().publicKeyLoader();
    o.internalBuild = false;
    o.daemonVersion = kVersion;
    o.clock = &clock;
    return o;
  }
  // A real helper whose delayed pulls wait the scripted number of "seconds" of 1 ms.
  StorebagRetrieval::Options quickRefreshOptions() {
    StorebagRetrieval::Options o = options();
    o.makeHelper = [this] {
      Helper::Options helperOptions;
      helperOptions.random = random;
      helperOptions.secondDuration = std::chrono::milliseconds(1);
      auto helper = Helper::create(std::weak_ptr<TelvanedSessionDelegate>(), Helper::kGETRequestMode,
                                   Value(Dictionary{{"_clientName", Value("storebag")},
                                                    {"_serviceName", Value("shared")}}),
                                   helperOptions);
      helper->activate(kStorebagHelperReleaseTimeoutSeconds);
      ++helpersMade;
      lastHelper = helper;
      return helper;
    };
    return o;
  }

  std::string url(const std::string& name) const { return server.requestURL(name, kVersion); }
  std::filesystem::path cacheFile(const std::string& name) const { return dir.path() / "storebags" / name; }
  Bytes cachedBytes(const std::string& name) const { return bytesOf(test::readFile(cacheFile(name))); }
  bool hasCacheFile(const std::string& name) const { return std::filesystem::exists(cacheFile(name)); }

  // An envelope in the disk cache with its metrics, as an earlier run left them.
  void putInCache(const std::string& name, const Bytes& envelope, double modified, std::optional<int> maxAge,
                  std::optional<std::string> lastModified) {
    std::filesystem::create_directories(cacheFile(name).parent_path());
    test::writeFile(cacheFile(name), std::string(envelope.begin(), envelope.end()));
    setFileTime(cacheFile(name), modified);
    if (maxAge) settings->write(kTelvaneSettingsDomain, StorebagMetrics::maxAgeKey(name), Value(*maxAge));
    if (lastModified) {
      settings->write(kTelvaneSettingsDomain, StorebagMetrics::lastModifiedKey(name), Value(*lastModified));
    }
  }

  std::optional<Value> storedMetric(const std::string& key) { return settings->read(kTelvaneSettingsDomain, key); }

  // Both metrics of the name as stored: the max age, and the Last-Modified value
  // (nothing: the key is absent).
  void expectMetrics(const std::string& name, std::int64_t maxAge, const std::optional<std::string>& lastModified) {
    EXPECT_EQ(storedMetric(StorebagMetrics::maxAgeKey(name)), std::optional<Value>(Value(maxAge)));
    const std::optional<Value> stored = storedMetric(StorebagMetrics::lastModifiedKey(name));
    if (lastModified) {
      EXPECT_EQ(stored, std::optional<Value>(Value(*lastModified)));
    } else {
      EXPECT_FALSE(stored.has_value());
    }
  }

  // Waits until the helper reports the end of the pull of the name's URL.
  bool waitForPullEnd(const std::string& name) {
    const std::string prefix =
        "getURLRequestWithCompletionHandler: new storebag pull for '" + url(name) + "' has been completed with error ";
    return waitUntil([&] { return capture.containsPrefix(prefix); });
  }

  // Position of the first line equal to the text, or -1.
  long lineIndex(const std::string& text) const {
    auto texts = capture.texts();
    for (std::size_t i = 0; i < texts.size(); ++i) {
      if (texts[i] == text) return static_cast<long>(i);
    }
    return -1;
  }
  std::size_t countPrefix(const std::string& prefix) const {
    std::size_t n = 0;
    for (const auto& text : capture.texts()) n += text.rfind(prefix, 0) == 0 ? 1 : 0;
    return n;
  }

  std::string loadFailureLine(const std::string& name) const {
    return "loadStorebagFromDisk: could not load storebag '" + name + "' from file '" + cacheFile(name).string() +
           "'. Error is 'No such file or directory'";
  }
  std::string errorResolvingLine(const std::string& name, const std::string& errorText) const {
    return "fetchNetworkStorebag: Error resolving with lookup server " + url(name) +
           ", sendSynchronousRequest error " + errorText;
  }
  std::string notNeededLine(const std::string& name) const {
    return "fetchNetworkStorebag: storebag '" + name +
           "' does not need update as its content has not changed on the server";
  }

  log::LogCapture capture;
  test::TempDir dir;
  std::shared_ptr<MemorySettingsStore> settings = std::make_shared<MemorySettingsStore>();
  test::ManualClock clock{realNowSeconds() - 10};
  std::shared_ptr<test::ScriptedRandom> random = std::make_shared<test::ScriptedRandom>();
  int helpersMade = 0;
  // The helper made last by quickRefreshOptions(); it outlives the retrieval.
  std::shared_ptr<Helper> lastHelper;
  test::StorebagTestServer server;
};

// ---- First use and the disk cache ----

TEST_F(StorebagRetrievalTest, FirstUseFetchesBlockingSavesAndLaterCallsReadTheDisk) {
  Bytes envelope = server.serveDocument("vantor", documentWithVersion("1.0"),
                                        StorebagHeaders{"max-age=3600", std::string(kLastModified1)});
  StorebagRetrieval retrieval(options());

  std::int32_t maxAge = -1;
  bool notModified = true;
  std::optional<Value> document = retrieval.fetchStorebagWithName("vantor", maxAge, notModified);
  expectDocumentOfVersion(document, "1.0");
  EXPECT_EQ(maxAge, 3600);
  EXPECT_FALSE(notModified);

  // One urgent request, without If-Modified-Since, carrying the daemon version.
  auto requests = server.requestsFor("vantor");
  ASSERT_EQ(requests.size(), 1u);
  EXPECT_EQ(requests[0].method, "GET");
  EXPECT_EQ(requests[0].query, std::string("version=") + kVersion);
  EXPECT_EQ(requests[0].header("If-Modified-Since"), "");

  // The completion saved the metrics and the envelope as received.
  EXPECT_TRUE(capture.contains(log::Level::Error, loadFailureLine("vantor")));
  const long urlLine = lineIndex("fetchNetworkStorebag: Storebag Server URL: " + url("vantor"));
  const long pullLine =
      lineIndex("getURLRequestWithCompletionHandler: storebag immediate pull for '" + url("vantor") + "' has been initiated");
  const long metricsLine = lineIndex("saveLastLoadedStorebagMetricsWithName: New storebag 'vantor' received: maxAge "
                                     "3600, Last-Modified '" + std::string(kLastModified1) + "'");
  const long savedLine = lineIndex("fetchStorebagWithName: storebag 'vantor' has been saved to disk cache");
  const long maxAgeLine = lineIndex("getLastLoadedStorebagMetricsWithName: maxAge is 3600 for storebag vantor");
  ASSERT_GE(urlLine, 0);
  ASSERT_GE(pullLine, 0);
  ASSERT_GE(metricsLine, 0);
  ASSERT_GE(savedLine, 0);
  ASSERT_GE(maxAgeLine, 0);
  EXPECT_LT(urlLine, pullLine);
  EXPECT_LT(pullLine, metricsLine);
  EXPECT_LT(metricsLine, savedLine);
  EXPECT_LT(savedLine, maxAgeLine) << "the caller reads the metrics after the completion";
  EXPECT_EQ(cachedBytes("vantor"), envelope);
  expectMetrics("vantor", 3600, kLastModified1);

  // Later calls read the disk: the server's newer document is not seen, nothing is sent.
  server.serveDocument("vantor", documentWithVersion("2.0"), StorebagHeaders{"max-age=3600", std::nullopt});
  capture.clear();
  document = retrieval.fetchStorebagWithName("vantor", maxAge, notModified);
  expectDocumentOfVersion(document, "1.0");
  EXPECT_EQ(maxAge, 3600);
  EXPECT_TRUE(capture.contains(log::Level::Info,
                               "fetchStorebagWithName: storebag 'vantor' loaded from disk cache. Disk cache is valid "
                               "and will not be refreshed"));
  EXPECT_FALSE(capture.containsPrefix("fetchNetworkStorebag:"));
  EXPECT_EQ(server.requestCountFor("vantor"), 1u);
}

TEST_F(StorebagRetrievalTest, FreshCacheMakesNoRequest) {
  Bytes envelope = SignedEnvelopeBuilder().sign(documentWithVersion("1.0"));
  putInCache("vantor", envelope, clock.now() - 100, 3600, std::string(kLastModified1));
  server.serveDocument("vantor", documentWithVersion("2.0"));
  StorebagRetrieval retrieval(quickRefreshOptions());

  std::int32_t maxAge = 0;
  bool notModified = true;
  expectDocumentOfVersion(retrieval.fetchStorebagWithName("vantor", maxAge, notModified), "1.0");
  EXPECT_EQ(maxAge, 3600);
  EXPECT_FALSE(notModified);
  EXPECT_TRUE(capture.contains(log::Level::Info, "getLastLoadedStorebagMetricsWithName: maxAge is 3600 for storebag vantor"));
  // The local value starts empty, so the stored one is reported as changed.
  EXPECT_TRUE(capture.contains(log::Level::Info, "getLastLoadedStorebagMetricsWithName: 'Last-Modified' has changed to '" +
                                                     std::string(kLastModified1) + "' for storebag 'vantor'"));
  EXPECT_TRUE(capture.contains(log::Level::Info,
                               "fetchStorebagWithName: storebag 'vantor' loaded from disk cache. Disk cache is valid "
                               "and will not be refreshed"));
  // No request was even started: the URL line comes before any request.
  EXPECT_FALSE(capture.containsPrefix("fetchNetworkStorebag:"));
  EXPECT_EQ(helpersMade, 0);
  EXPECT_EQ(server.tls().requestCount(), 0u);
}

TEST_F(StorebagRetrievalTest, AgeEqualToMaxAgeIsStillFresh) {
  putInCache("vantor", SignedEnvelopeBuilder().sign(documentWithVersion("1.0")), clock.now() - 3600, 3600,
             std::nullopt);
  StorebagRetrieval retrieval(quickRefreshOptions());
  std::int32_t maxAge = 0;
  bool notModified = false;
  expectDocumentOfVersion(retrieval.fetchStorebagWithName("vantor", maxAge, notModified), "1.0");
  EXPECT_TRUE(capture.contains("fetchStorebagWithName: storebag 'vantor' loaded from disk cache. Disk cache is valid "
                               "and will not be refreshed"));
  EXPECT_FALSE(capture.containsPrefix("fetchNetworkStorebag:"));

  // One second more and it is stale.
  clock.advance(1);
  server.serveNotModified("vantor");
  expectDocumentOfVersion(retrieval.fetchStorebagWithName("vantor", maxAge, notModified), "1.0");
  EXPECT_TRUE(capture.contains("fetchStorebagWithName: storebag 'vantor' loaded from disk cache. Disk cache expired "
                               "and will be refreshed"));
  ASSERT_TRUE(waitForPullEnd("vantor"));
}

TEST_F(StorebagRetrievalTest, StaleCacheStartsOneConditionalRefreshAndServesTheCachedEnvelope) {
  Bytes oldEnvelope = SignedEnvelopeBuilder().sign(documentWithVersion("1.0"));
  putInCache("vantor", oldEnvelope, clock.now() - 3601, 3600, std::string(kLastModified1));
  Bytes newEnvelope = server.serveDocument("vantor", documentWithVersion("2.0"),
                                           StorebagHeaders{"public, max-age=7200", std::string(kLastModified2)});
  random->pushUniform(3);
  StorebagRetrieval retrieval(quickRefreshOptions());

  std::int32_t maxAge = 0;
  bool notModified = true;
  // The cached envelope serves this call; the refresh only helps later ones.
  expectDocumentOfVersion(retrieval.fetchStorebagWithName("vantor", maxAge, notModified), "1.0");
  EXPECT_EQ(maxAge, 3600);
  EXPECT_FALSE(notModified);
  EXPECT_TRUE(capture.contains(log::Level::Info,
                               "fetchStorebagWithName: storebag 'vantor' loaded from disk cache. Disk cache expired "
                               "and will be refreshed"));
  EXPECT_TRUE(capture.contains(log::Level::Info, "fetchNetworkStorebag: Adding 'Last-Modified: " +
                                                     std::string(kLastModified1) + "' to the header"));
  // Not urgent: the helper's delayed pull, with the drawn delay.
  EXPECT_TRUE(capture.containsPrefix("getURLRequestWithCompletionHandler: storebag delayed pull for '" + url("vantor") +
                                     "' delayed by 3 seconds has been initiated. Time now "));
  EXPECT_FALSE(capture.containsPrefix("getURLRequestWithCompletionHandler: storebag immediate pull"));

  ASSERT_TRUE(waitForPullEnd("vantor"));
  auto requests = server.requestsFor("vantor");
  ASSERT_EQ(requests.size(), 1u);
  EXPECT_EQ(requests[0].header("If-Modified-Since"), kLastModified1);
  EXPECT_EQ(requests[0].query, std::string("version=") + kVersion);

  // The completion saved the new envelope and moved the metrics forward.
  EXPECT_TRUE(capture.contains("fetchStorebagWithName: storebag 'vantor' has been saved to disk cache"));
  EXPECT_EQ(cachedBytes("vantor"), newEnvelope);
  expectMetrics("vantor", 7200, kLastModified2);

  // The next call finds the new file fresh and reads it without another request.
  capture.clear();
  expectDocumentOfVersion(retrieval.fetchStorebagWithName("vantor", maxAge, notModified), "2.0");
  EXPECT_EQ(maxAge, 7200);
  EXPECT_FALSE(capture.containsPrefix("fetchNetworkStorebag:"));
  EXPECT_EQ(server.requestCountFor("vantor"), 1u);
}

TEST_F(StorebagRetrievalTest, MissingMaxAgeMakesEveryCachedEnvelopeStale) {
  putInCache("vantor", SignedEnvelopeBuilder().sign(documentWithVersion("1.0")), clock.now() - 1, std::nullopt,
             std::nullopt);
  server.serveNotModified("vantor");
  StorebagRetrieval retrieval(quickRefreshOptions());
  std::int32_t maxAge = -1;
  bool notModified = false;
  expectDocumentOfVersion(retrieval.fetchStorebagWithName("vantor", maxAge, notModified), "1.0");
  EXPECT_EQ(maxAge, 0);
  EXPECT_TRUE(capture.contains("getLastLoadedStorebagMetricsWithName: maxAge is 0 for storebag vantor"));
  EXPECT_TRUE(capture.contains("fetchStorebagWithName: storebag 'vantor' loaded from disk cache. Disk cache expired "
                               "and will be refreshed"));
  // Nothing stored, nothing to send back.
  EXPECT_FALSE(capture.containsPrefix("fetchNetworkStorebag: Adding"));
  EXPECT_FALSE(capture.containsPrefix("getLastLoadedStorebagMetricsWithName: 'Last-Modified'"));
  ASSERT_TRUE(waitForPullEnd("vantor"));
  auto requests = server.requestsFor("vantor");
  ASSERT_EQ(requests.size(), 1u);
  EXPECT_EQ(requests[0].header("If-Modified-Since"), "");
}

// ---- The server's caching metrics ----

struct CacheControlCase {
  const char* label;
  std::optional<std::string> header;
  std::int32_t maxAge;
};

void PrintTo(const CacheControlCase& c, std::ostream* os) { *os << (c.header ? *c.header : "no Cache-Control"); }

class StorebagCacheControlTest : public StorebagRetrievalTest,
                                 public ::testing::WithParamInterface<CacheControlCase> {};

TEST_P(StorebagCacheControlTest, MaxAgeComesFromCacheControl) {
  const CacheControlCase& param = GetParam();
  server.serveDocument("vantor", documentWithVersion("1.0"), StorebagHeaders{param.header, std::nullopt});
  StorebagRetrieval retrieval(options());
  std::int32_t maxAge = -1;
  bool notModified = false;
  expectDocumentOfVersion(retrieval.fetchStorebagWithName("vantor", maxAge, notModified), "1.0");
  EXPECT_EQ(maxAge, param.maxAge);
  // Without a Last-Modified header the key stays absent.
  expectMetrics("vantor", param.maxAge, std::nullopt);
  EXPECT_TRUE(capture.contains(log::Level::Info, "saveLastLoadedStorebagMetricsWithName: New storebag 'vantor' "
                                                 "received: maxAge " +
                                                     std::to_string(param.maxAge) + ", Last-Modified '(null)'"));
}

INSTANTIATE_TEST_SUITE_P(Headers, StorebagCacheControlTest,
                         ::testing::Values(CacheControlCase{"PrivateMaxAge", std::string("private, max-age=600"), 600},
                                           CacheControlCase{"NoCache", std::string("no-cache"), 86400},
                                           CacheControlCase{"NoHeader", std::nullopt, 86400},
                                           CacheControlCase{"MaxAgeFollowedByComma",
                                                            std::string("max-age=3600, public"), 3600},
                                           CacheControlCase{"MaxAgeWithoutValue", std::string("max-age"), 86400}),
                         [](const ::testing::TestParamInfo<CacheControlCase>& info) {
                           return std::string(info.param.label);
                         });

TEST_F(StorebagRetrievalTest, AnswerWithoutLastModifiedRemovesTheStoredOne) {
  putInCache("vantor", SignedEnvelopeBuilder().sign(documentWithVersion("1.0")), clock.now() - 700, 600,
             std::string(kLastModified1));
  Bytes newEnvelope =
      server.serveDocument("vantor", documentWithVersion("2.0"), StorebagHeaders{"max-age=900", std::nullopt});
  StorebagRetrieval retrieval(quickRefreshOptions());
  std::int32_t maxAge = 0;
  bool notModified = false;
  expectDocumentOfVersion(retrieval.fetchStorebagWithName("vantor", maxAge, notModified), "1.0");
  ASSERT_TRUE(waitForPullEnd("vantor"));
  EXPECT_EQ(server.requestsFor("vantor").at(0).header("If-Modified-Since"), kLastModified1);
  expectMetrics("vantor", 900, std::nullopt);
  EXPECT_EQ(cachedBytes("vantor"), newEnvelope);
}

// ---- Signature failures ----

TEST_F(StorebagRetrievalTest, TamperedRefreshIsNotSavedButMovesTheMetrics) {
  Bytes goodEnvelope = SignedEnvelopeBuilder().sign(documentWithVersion("1.0"));
  putInCache("vantor", goodEnvelope, clock.now() - 120, 60, std::string(kLastModified1));
  const double modifiedBefore = fileTime(cacheFile("vantor"));
  server.serveTampered("vantor", documentWithVersion("2.0"),
                       StorebagHeaders{"max-age=1200", std::string(kLastModified2)});
  StorebagRetrieval retrieval(quickRefreshOptions());

  std::int32_t maxAge = 0;
  bool notModified = false;
  expectDocumentOfVersion(retrieval.fetchStorebagWithName("vantor", maxAge, notModified), "1.0");
  ASSERT_TRUE(waitForPullEnd("vantor"));

  EXPECT_TRUE(capture.containsPrefix("fetchStorebagWithName: Signature can not be verified, "));
  EXPECT_FALSE(capture.containsPrefix("fetchStorebagWithName: storebag 'vantor' has been saved"));
  EXPECT_EQ(cachedBytes("vantor"), goodEnvelope) << "the previous file stays byte for byte";
  EXPECT_EQ(fileTime(cacheFile("vantor")), modifiedBefore);
  // The metrics of a 200 answer are saved before the signature is checked.
  expectMetrics("vantor", 1200, kLastModified2);
}

TEST_F(StorebagRetrievalTest, TamperedEnvelopeOnFirstUseYieldsNothing) {
  server.serveTampered("vantor", documentWithVersion("1.0"), StorebagHeaders{"max-age=600", std::nullopt});
  StorebagRetrieval retrieval(options());
  std::int32_t maxAge = 0;
  bool notModified = false;
  EXPECT_FALSE(retrieval.fetchStorebagWithName("vantor", maxAge, notModified).has_value());
  // Checked by the completion (and not saved), then again by the caller.
  EXPECT_EQ(countPrefix("fetchStorebagWithName: Signature can not be verified, "), 2u);
  EXPECT_FALSE(hasCacheFile("vantor"));
  EXPECT_EQ(maxAge, 600);
}

TEST_F(StorebagRetrievalTest, EnvelopeSignedByAnotherKeyIsRefused) {
  TestKeyPair otherKeys;
  server.serveEnvelope("vantor", SignedEnvelopeBuilder(otherKeys).sign(documentWithVersion("1.0")));
  StorebagRetrieval retrieval(options());
  std::int32_t maxAge = 0;
  bool notModified = false;
  EXPECT_FALSE(retrieval.fetchStorebagWithName("vantor", maxAge, notModified).has_value());
  EXPECT_EQ(countPrefix("fetchStorebagWithName: Signature can not be verified, "), 2u);
  EXPECT_FALSE(hasCacheFile("vantor"));
}

TEST_F(StorebagRetrievalTest, EnvelopeThatIsNotAPropertyListIsRefused) {
  server.serveEnvelope("vantor", bytesOf("signature = abc; bag = def;"));
  StorebagRetrieval retrieval(options());
  std::int32_t maxAge = 0;
  bool notModified = false;
  EXPECT_FALSE(retrieval.fetchStorebagWithName("vantor", maxAge, notModified).has_value());
  EXPECT_EQ(countPrefix("fetchStorebagWithName: propertyListWithData error "), 2u);
  EXPECT_EQ(capture.count("fetchStorebagWithName: Signature is missing"), 2u);
  EXPECT_FALSE(hasCacheFile("vantor"));
}

TEST_F(StorebagRetrievalTest, EnvelopeWithoutSignatureIsRefused) {
  server.serveEnvelope("vantor",
                       test::tamper::removeKey(SignedEnvelopeBuilder().sign(documentWithVersion("1.0")), "signature"));
  StorebagRetrieval retrieval(options());
  std::int32_t maxAge = 0;
  bool notModified = false;
  EXPECT_FALSE(retrieval.fetchStorebagWithName("vantor", maxAge, notModified).has_value());
  EXPECT_EQ(capture.count("fetchStorebagWithName: Signature is missing"), 2u);
  EXPECT_FALSE(capture.containsPrefix("fetchStorebagWithName: propertyListWithData error"));
  EXPECT_FALSE(hasCacheFile("vantor"));
}

// Failures of the verification that have no message of their own.
struct SilentRefusalCase {
  const char* label;
  std::function<Bytes(const Bytes& goodEnvelope)> damage;
};

void PrintTo(const SilentRefusalCase& c, std::ostream* os) { *os << c.label; }

class StorebagSilentRefusalTest : public StorebagRetrievalTest,
                                  public ::testing::WithParamInterface<SilentRefusalCase> {};

TEST_P(StorebagSilentRefusalTest, RefusedWithoutMessageAndNotSaved) {
  Bytes good = SignedEnvelopeBuilder().sign(documentWithVersion("1.0"));
  server.serveEnvelope("vantor", GetParam().damage(good));
  StorebagRetrieval retrieval(options());
  std::int32_t maxAge = 0;
  bool notModified = false;
  EXPECT_FALSE(retrieval.fetchStorebagWithName("vantor", maxAge, notModified).has_value());
  EXPECT_FALSE(capture.containsPrefix("fetchStorebagWithName:"));
  EXPECT_FALSE(hasCacheFile("vantor"));
  EXPECT_TRUE(capture.containsPrefix("saveLastLoadedStorebagMetricsWithName: New storebag 'vantor' received"));
}

INSTANTIATE_TEST_SUITE_P(
    Damage, StorebagSilentRefusalTest,
    ::testing::Values(
        SilentRefusalCase{"NoBag", [](const Bytes& e) { return test::tamper::removeKey(e, "bag"); }},
        SilentRefusalCase{"SignatureNotBase64",
                          [](const Bytes& e) { return test::tamper::setKey(e, "signature", Value("AAAAA")); }},
        SilentRefusalCase{"BagNotBase64", [](const Bytes& e) { return test::tamper::setKey(e, "bag", Value("QUJD!R")); }},
        SilentRefusalCase{"SignatureNotText",
                          [](const Bytes& e) { return test::tamper::setKey(e, "signature", Value(42)); }}),
    [](const ::testing::TestParamInfo<SilentRefusalCase>& info) { return std::string(info.param.label); });

TEST_F(StorebagRetrievalTest, WithoutPublicKeyEverythingIsRefusedSilently) {
  server.serveDocument("vantor", documentWithVersion("1.0"));
  StorebagRetrieval::Options o = options();
  o.publicKey = [] { return std::optional<Bytes>(); };
  StorebagRetrieval retrieval(std::move(o));
  std::int32_t maxAge = 0;
  bool notModified = false;
  EXPECT_FALSE(retrieval.fetchStorebagWithName("vantor", maxAge, notModified).has_value());
  EXPECT_FALSE(capture.containsPrefix("fetchStorebagWithName:"));
  EXPECT_FALSE(hasCacheFile("vantor"));
}

TEST_F(StorebagRetrievalTest, GoodSignatureOverABagThatIsNoDocumentIsSavedButYieldsNothing) {
  Bytes envelope = SignedEnvelopeBuilder().signBag(bytesOf("this bag is not a property list"));
  server.serveEnvelope("vantor", envelope);
  StorebagRetrieval retrieval(options());
  std::int32_t maxAge = 0;
  bool notModified = false;
  EXPECT_FALSE(retrieval.fetchStorebagWithName("vantor", maxAge, notModified).has_value());
  // The signature is good, so the completion keeps the envelope.
  EXPECT_TRUE(capture.contains("fetchStorebagWithName: storebag 'vantor' has been saved to disk cache"));
  EXPECT_EQ(cachedBytes("vantor"), envelope);
  EXPECT_FALSE(capture.containsPrefix("fetchStorebagWithName: Signature"));
}

// ---- Server failures ----

TEST_F(StorebagRetrievalTest, BlockingFailureForConferaEndsWithoutDocument) {
  server.serveStatus("confera", 500);
  StorebagRetrieval retrieval(options());
  std::int32_t maxAge = -1;
  bool notModified = true;
  EXPECT_FALSE(retrieval.fetchStorebagWithName("confera", maxAge, notModified).has_value());
  EXPECT_EQ(maxAge, 0);
  EXPECT_FALSE(notModified);

  const long notNeeded = lineIndex(notNeededLine("confera"));
  const long resolving = lineIndex(errorResolvingLine("confera", "HTTP status 500"));
  const long fallback = lineIndex("fetchNetworkStorebag: Loading default storebag 'confera'");
  const long missing = lineIndex("fetchStorebagWithName: Signature is missing");
  ASSERT_GE(notNeeded, 0);
  ASSERT_GE(resolving, 0);
  ASSERT_GE(fallback, 0);
  ASSERT_GE(missing, 0);
  EXPECT_LT(notNeeded, resolving);
  EXPECT_LT(resolving, fallback);
  EXPECT_LT(fallback, missing) << "the fallback document is refused for want of a signature";
  EXPECT_TRUE(capture.contains(log::Level::Info, "fetchNetworkStorebag: Loading default storebag 'confera'"));
  // Nothing of a failed answer is kept.
  EXPECT_FALSE(storedMetric(StorebagMetrics::maxAgeKey("confera")).has_value());
  EXPECT_FALSE(hasCacheFile("confera"));
}

TEST_F(StorebagRetrievalTest, BlockingFailureHandsOutTheFallbackOnlyForConfera) {
  server.serveStatus("confera", 500);
  server.serveStatus("vantor", 500);
  StorebagRetrieval retrieval(options());
  EXPECT_EQ(retrieval.fetchNetworkStorebag("confera", true, std::nullopt), std::optional<Bytes>(defaultStorebagData()));
  EXPECT_FALSE(retrieval.fetchNetworkStorebag("vantor", true, std::nullopt).has_value());
  EXPECT_EQ(capture.count("fetchNetworkStorebag: Loading default storebag 'confera'"), 1u);
  EXPECT_FALSE(capture.containsPrefix("fetchNetworkStorebag: Loading default storebag 'vantor'"));
  EXPECT_TRUE(capture.contains(errorResolvingLine("vantor", "HTTP status 500")));
}

TEST_F(StorebagRetrievalTest, NotModifiedOnFirstUseIsAFailure) {
  server.serveNotModified("vantor");
  StorebagRetrieval retrieval(options());
  std::int32_t maxAge = 0;
  bool notModified = true;
  EXPECT_FALSE(retrieval.fetchStorebagWithName("vantor", maxAge, notModified).has_value());
  EXPECT_FALSE(notModified);
  EXPECT_TRUE(capture.contains(notNeededLine("vantor")));
  EXPECT_TRUE(capture.contains(errorResolvingLine("vantor", "HTTP status 304")));
  EXPECT_FALSE(capture.containsPrefix("saveLastLoadedStorebagMetricsWithName:"));
}

TEST_F(StorebagRetrievalTest, NotModifiedRefreshKeepsTheCacheAndTheMetrics) {
  Bytes envelope = SignedEnvelopeBuilder().sign(documentWithVersion("1.0"));
  putInCache("vantor", envelope, clock.now() - 4000, 3600, std::string(kLastModified1));
  const double modifiedBefore = fileTime(cacheFile("vantor"));
  server.serveNotModified("vantor", StorebagHeaders{"max-age=10", std::string(kLastModified2)});
  StorebagRetrieval retrieval(quickRefreshOptions());
  std::int32_t maxAge = 0;
  bool notModified = false;
  expectDocumentOfVersion(retrieval.fetchStorebagWithName("vantor", maxAge, notModified), "1.0");
  ASSERT_TRUE(waitForPullEnd("vantor"));
  EXPECT_EQ(server.requestsFor("vantor").at(0).header("If-Modified-Since"), kLastModified1);
  EXPECT_TRUE(capture.contains(log::Level::Info, notNeededLine("vantor")));
  EXPECT_FALSE(capture.containsPrefix("saveLastLoadedStorebagMetricsWithName:"));
  EXPECT_EQ(cachedBytes("vantor"), envelope);
  EXPECT_EQ(fileTime(cacheFile("vantor")), modifiedBefore);
  expectMetrics("vantor", 3600, kLastModified1);
}

TEST_F(StorebagRetrievalTest, ServerErrorInRefreshKeepsTheCacheAndTheMetrics) {
  Bytes envelope = SignedEnvelopeBuilder().sign(documentWithVersion("1.0"));
  putInCache("vantor", envelope, clock.now() - 4000, 3600, std::string(kLastModified1));
  server.serveStatus("vantor", 500);
  StorebagRetrieval retrieval(quickRefreshOptions());
  std::int32_t maxAge = 0;
  bool notModified = false;
  expectDocumentOfVersion(retrieval.fetchStorebagWithName("vantor", maxAge, notModified), "1.0");
  ASSERT_TRUE(waitForPullEnd("vantor"));
  EXPECT_TRUE(capture.contains(notNeededLine("vantor")));
  // A refresh is not waited for, so its failure is not an error of the call.
  EXPECT_FALSE(capture.containsPrefix("fetchNetworkStorebag: Error resolving"));
  EXPECT_EQ(cachedBytes("vantor"), envelope);
  expectMetrics("vantor", 3600, kLastModified1);
}

TEST_F(StorebagRetrievalTest, EmptyRefreshSavesTheMetricsAndKeepsTheCache) {
  Bytes envelope = SignedEnvelopeBuilder().sign(documentWithVersion("1.0"));
  putInCache("vantor", envelope, clock.now() - 4000, 3600, std::string(kLastModified1));
  server.serveEmpty("vantor", StorebagHeaders{"max-age=900", std::string(kLastModified2)});
  StorebagRetrieval retrieval(quickRefreshOptions());
  std::int32_t maxAge = 0;
  bool notModified = false;
  expectDocumentOfVersion(retrieval.fetchStorebagWithName("vantor", maxAge, notModified), "1.0");
  ASSERT_TRUE(waitForPullEnd("vantor"));
  EXPECT_TRUE(capture.contains(log::Level::Info, std::string("fetchNetworkStorebag: received zero-length storebag for "
                                                             "'vantor") +
                                                     kClosingQuote + ", treat as unchanged"));
  EXPECT_EQ(cachedBytes("vantor"), envelope);
  expectMetrics("vantor", 900, kLastModified2);
}

TEST_F(StorebagRetrievalTest, EmptyAnswerOnFirstUseSavesTheMetricsButYieldsNothing) {
  server.serveEmpty("vantor", StorebagHeaders{"max-age=300", std::nullopt});
  StorebagRetrieval retrieval(options());
  std::int32_t maxAge = 0;
  bool notModified = true;
  // 200 counts as success: the empty bytes go to the verification, which finds no
  // property list in them.
  EXPECT_FALSE(retrieval.fetchStorebagWithName("vantor", maxAge, notModified).has_value());
  EXPECT_EQ(maxAge, 300);
  EXPECT_FALSE(notModified);
  EXPECT_TRUE(capture.contains(std::string("fetchNetworkStorebag: received zero-length storebag for 'vantor") +
                               kClosingQuote + ", treat as unchanged"));
  EXPECT_FALSE(capture.containsPrefix("fetchNetworkStorebag: Error resolving"));
  EXPECT_EQ(countPrefix("fetchStorebagWithName: propertyListWithData error "), 1u);
  EXPECT_EQ(capture.count("fetchStorebagWithName: Signature is missing"), 1u);
  EXPECT_EQ(storedMetric(StorebagMetrics::maxAgeKey("vantor")), std::optional<Value>(Value(300)));
  EXPECT_FALSE(hasCacheFile("vantor"));
}

TEST_F(StorebagRetrievalTest, ServerThatClosesTheConnectionIsABlockingFailure) {
  server.serveCloseWithoutAnswer("vantor");
  StorebagRetrieval retrieval(options());
  std::int32_t maxAge = 0;
  bool notModified = false;
  EXPECT_FALSE(retrieval.fetchStorebagWithName("vantor", maxAge, notModified).has_value());
  EXPECT_EQ(server.requestCountFor("vantor"), 1u);
  EXPECT_TRUE(capture.contains(notNeededLine("vantor")));
  EXPECT_TRUE(capture.containsPrefix("fetchNetworkStorebag: Error resolving with lookup server " + url("vantor") +
                                     ", sendSynchronousRequest error "));
  EXPECT_FALSE(capture.containsPrefix("saveLastLoadedStorebagMetricsWithName:"));
  EXPECT_FALSE(capture.containsPrefix("fetchNetworkStorebag: Loading default storebag"));
  EXPECT_FALSE(hasCacheFile("vantor"));
}

TEST_F(StorebagRetrievalTest, GarbageAnswerIsRefusedButItsMetricsAreKept) {
  server.serveGarbage("vantor", StorebagHeaders{"max-age=450", std::string(kLastModified1)});
  StorebagRetrieval retrieval(options());
  std::int32_t maxAge = 0;
  bool notModified = false;
  EXPECT_FALSE(retrieval.fetchStorebagWithName("vantor", maxAge, notModified).has_value());
  EXPECT_EQ(maxAge, 450);
  EXPECT_EQ(countPrefix("fetchStorebagWithName: propertyListWithData error "), 2u);
  EXPECT_EQ(capture.count("fetchStorebagWithName: Signature is missing"), 2u);
  EXPECT_EQ(storedMetric(StorebagMetrics::lastModifiedKey("vantor")),
            std::optional<Value>(Value(std::string(kLastModified1))));
  EXPECT_FALSE(hasCacheFile("vantor"));
}

TEST_F(StorebagRetrievalTest, SlowAnswerWithinTheWaitIsTaken) {
  server.serveEnvelope("vantor", SignedEnvelopeBuilder().sign(documentWithVersion("1.0")),
                       StorebagHeaders{"max-age=600", std::nullopt}, std::chrono::milliseconds(300));
  StorebagRetrieval retrieval(options());
  std::int32_t maxAge = 0;
  bool notModified = false;
  expectDocumentOfVersion(retrieval.fetchStorebagWithName("vantor", maxAge, notModified), "1.0");
  EXPECT_EQ(maxAge, 600);
}

TEST_F(StorebagRetrievalTest, ServerThatNeverAnswersEndsTheBlockingWaitAsFailure) {
  server.serveNoAnswerFor("vantor", std::chrono::minutes(2));
  StorebagRetrieval::Options o = options();
  o.blockingWaitLimit = std::chrono::milliseconds(200);
  StorebagRetrieval retrieval(std::move(o));
  std::int32_t maxAge = 0;
  bool notModified = false;
  const auto start = std::chrono::steady_clock::now();
  EXPECT_FALSE(retrieval.fetchStorebagWithName("vantor", maxAge, notModified).has_value());
  // Returned without the server's answer, which would have taken two minutes.
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(60));
  EXPECT_TRUE(capture.contains(errorResolvingLine("vantor", "no answer in time")));
  EXPECT_FALSE(capture.contains(notNeededLine("vantor"))) << "the request is still out";
  ASSERT_TRUE(server.waitForRequestsFor("vantor", 1));

  // The request ends later (here cut short by the server's stop) and is only logged.
  server.stop();
  ASSERT_TRUE(waitForPullEnd("vantor"));
  EXPECT_TRUE(capture.contains(notNeededLine("vantor")));
  EXPECT_FALSE(hasCacheFile("vantor"));
}

TEST_F(StorebagRetrievalTest, LateAnswerAfterTheRetrievalHasGoneIsStillHandled) {
  // The helper lives on (this fixture holds it), so the request is still out when the
  // retrieval that asked for it is gone.
  server.serveEnvelope("vantor", SignedEnvelopeBuilder().sign(documentWithVersion("1.0")),
                       StorebagHeaders{"max-age=600", std::nullopt}, std::chrono::minutes(2));
  {
    StorebagRetrieval::Options o = quickRefreshOptions();
    o.blockingWaitLimit = std::chrono::milliseconds(100);
    StorebagRetrieval retrieval(std::move(o));
    std::int32_t maxAge = 0;
    bool notModified = false;
    EXPECT_FALSE(retrieval.fetchStorebagWithName("vantor", maxAge, notModified).has_value());
    ASSERT_TRUE(server.waitForRequestsFor("vantor", 1));
  }
  // The answer arrives once the retrieval is gone; its completion still saves it.
  server.stop();
  ASSERT_TRUE(waitForPullEnd("vantor"));
  EXPECT_TRUE(capture.contains("fetchStorebagWithName: storebag 'vantor' has been saved to disk cache"));
  EXPECT_TRUE(hasCacheFile("vantor"));
}

// ---- The shared helper fetches each URL once ----

TEST_F(StorebagRetrievalTest, SecondBlockingFetchOfARequestedURLFailsAtOnce) {
  server.serveStatus("vantor", 500);
  StorebagRetrieval::Options o = options();
  o.blockingWaitLimit = std::chrono::minutes(10);
  StorebagRetrieval retrieval(std::move(o));
  std::int32_t maxAge = 0;
  bool notModified = false;
  EXPECT_FALSE(retrieval.fetchStorebagWithName("vantor", maxAge, notModified).has_value());
  ASSERT_EQ(server.requestCountFor("vantor"), 1u);

  // The server is fine now, but the helper never asks for that URL again.
  server.serveDocument("vantor", documentWithVersion("1.0"));
  capture.clear();
  const auto start = std::chrono::steady_clock::now();
  EXPECT_FALSE(retrieval.fetchStorebagWithName("vantor", maxAge, notModified).has_value());
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(60)) << "did not wait for a completion";
  EXPECT_TRUE(capture.contains(log::Level::Info, "getURLRequestWithCompletionHandler: ignored duplicate request for "
                                                 "storebag '" + url("vantor") + "'"));
  EXPECT_TRUE(capture.contains(errorResolvingLine("vantor", "request already made by this process")));
  EXPECT_FALSE(capture.containsPrefix("getURLRequestWithCompletionHandler: storebag immediate pull"));
  EXPECT_EQ(server.requestCountFor("vantor"), 1u);
  EXPECT_FALSE(hasCacheFile("vantor"));
}

TEST_F(StorebagRetrievalTest, RefreshOfAnAlreadyFetchedURLIsIgnored) {
  server.serveDocument("vantor", documentWithVersion("1.0"), StorebagHeaders{"max-age=600", std::nullopt});
  StorebagRetrieval retrieval(quickRefreshOptions());
  std::int32_t maxAge = 0;
  bool notModified = false;
  expectDocumentOfVersion(retrieval.fetchStorebagWithName("vantor", maxAge, notModified), "1.0");
  ASSERT_TRUE(waitForPullEnd("vantor"));

  // Stale later: the cached envelope is used and the refresh is dropped by the helper.
  setFileTime(cacheFile("vantor"), clock.now() - 601);
  capture.clear();
  expectDocumentOfVersion(retrieval.fetchStorebagWithName("vantor", maxAge, notModified), "1.0");
  EXPECT_TRUE(capture.contains("fetchStorebagWithName: storebag 'vantor' loaded from disk cache. Disk cache expired "
                               "and will be refreshed"));
  EXPECT_TRUE(capture.contains("getURLRequestWithCompletionHandler: ignored duplicate request for storebag '" +
                               url("vantor") + "'"));
  EXPECT_EQ(server.requestCountFor("vantor"), 1u);
  EXPECT_EQ(helpersMade, 1) << "one helper for the retrieval's whole life";
}

// ---- Where requests go ----

TEST_F(StorebagRetrievalTest, StorebagURLSettingSendsEveryNameToThatBase) {
  test::StorebagTestServer other("/deploy/storebags");
  settings->write(kTelvaneSettingsDomain, kStorebagURLSettingsKey, Value(other.baseURL()));
  other.serveDocument("vantor", documentWithVersion("1.0"));
  other.serveDocument("quillon", documentWithVersion("1.1"));
  other.serveDocument("confera", documentWithVersion("1.2"));
  StorebagRetrieval retrieval(options());
  for (const char* name : {"vantor", "quillon", "confera"}) {
    EXPECT_EQ(retrieval.storebagRequestURL(name), other.baseURL() + "/" + name + "?version=" + kVersion);
    std::int32_t maxAge = 0;
    bool notModified = false;
    EXPECT_TRUE(retrieval.fetchStorebagWithName(name, maxAge, notModified).has_value()) << name;
    auto requests = other.requestsFor(name);
    ASSERT_EQ(requests.size(), 1u) << name;
    EXPECT_EQ(requests[0].path, "/deploy/storebags/" + std::string(name));
    EXPECT_EQ(requests[0].query, std::string("version=") + kVersion);
  }
  EXPECT_EQ(server.tls().requestCount(), 0u);
}

TEST_F(StorebagRetrievalTest, WithoutTheSettingTheBuiltInServerOfTheBuildKindIsUsed) {
  settings->remove(kTelvaneSettingsDomain, kStorebagURLSettingsKey);
  const std::string release = StorebagRetrieval::builtInServerBaseURL(false);
  const std::string internal = StorebagRetrieval::builtInServerBaseURL(true);
  EXPECT_EQ(release.rfind("https://", 0), 0u);
  EXPECT_EQ(internal.rfind("https://", 0), 0u);
  EXPECT_TRUE(endsWith(release, "/bags/larchwood")) << release;
  EXPECT_FALSE(endsWith(release, "/storebags/larchwood")) << release;
  EXPECT_TRUE(endsWith(internal, "/storebags/larchwood")) << internal;

  StorebagRetrieval releaseRetrieval(options());
  EXPECT_EQ(releaseRetrieval.storebagServerBaseURL(), release);
  EXPECT_EQ(releaseRetrieval.storebagRequestURL("rill"), release + "/rill?version=" + kVersion);

  StorebagRetrieval::Options o = options();
  o.internalBuild = true;
  StorebagRetrieval internalRetrieval(std::move(o));
  EXPECT_EQ(internalRetrieval.storebagRequestURL("rill"), internal + "/rill?version=" + kVersion);

  // A setting that is not text does not count.
  settings->write(kTelvaneSettingsDomain, kStorebagURLSettingsKey, Value(7));
  EXPECT_EQ(releaseRetrieval.storebagServerBaseURL(), release);
}

TEST_F(StorebagRetrievalTest, VersionQueryDefaultsToTheBundleVersion) {
  StorebagRetrieval::Options o = options();
  o.daemonVersion.reset();
  StorebagRetrieval retrieval(std::move(o));
  const std::string bundle = frameworkBundleVersion();
  const std::string expected = bundle.empty() ? std::string("8.0") : bundle;
  EXPECT_EQ(retrieval.storebagRequestURL("twine"), server.baseURL() + "/twine?version=" + expected);
}

// ---- Disk failures and the document's fetcher ----

TEST_F(StorebagRetrievalTest, DiskWriteFailureStillReturnsTheDocument) {
  // "storebags" is a file, so nothing can be written below it.
  test::writeFile(dir.path() / "storebags", "in the way");
  server.serveDocument("vantor", documentWithVersion("1.0"));
  StorebagRetrieval retrieval(options());
  std::int32_t maxAge = 0;
  bool notModified = false;
  expectDocumentOfVersion(retrieval.fetchStorebagWithName("vantor", maxAge, notModified), "1.0");
  EXPECT_TRUE(capture.contains(log::Level::Error, "saveStorebagToDisk: could not save storebag 'vantor' to file '" +
                                                      cacheFile("vantor").string() +
                                                      "'. Error is 'Not a directory'"));
  EXPECT_FALSE(capture.containsPrefix("fetchStorebagWithName: storebag 'vantor' has been saved"));
}

TEST_F(StorebagRetrievalTest, FetcherFeedsTheSectionSelection) {
  server.serveDocument("confera", StorebagBuilder()
                                      .version("5.0")
                                      .refreshCycle(100000)
                                      .backend("release", "metrix", Value(Dictionary{{"active", Value(true)}}))
                                      .build());
  StorebagRetrieval retrieval(options());
  StorebagSelectionResult result =
      fetchStorebagForEnvironmentAndClientType(11, retrieval.fetcher(), [] { return kStorebagEnvironmentRelease; });
  ASSERT_TRUE(result.selection.has_value());
  EXPECT_EQ(result.selection->version, "5.0");
  EXPECT_EQ(result.selection->maxAgeSeconds, 86400);
  EXPECT_EQ(result.selection->section["metrix"]["active"], Value(true));
  EXPECT_EQ(server.requestCountFor("confera"), 1u);
}

}  // namespace
}  // namespace telvane
