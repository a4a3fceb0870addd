// AgentStorebagCache: one entry per storebag name, freshness by max age and by the disk
// file's time, the 900-second wait after a failure, the entry's fields, the copies
// handed to the health report, and concurrent sessions of several client families.
#include "storebag/AgentStorebagCache.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <atomic>
#include <chrono>
#include <cmath>
#include <deque>
#include <filesystem>
#include <future>
#include <map>
#include <mutex>
#include <thread>
#include <vector>

#include "connectivity/ReportingSessionConnectivityHelperImpl.h"
#include "platform/Log.h"
#include "platform/MemorySettingsStore.h"
#include "storebag/StorebagRetrieval.h"
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

using test::ManualClock;

// 2023-11-14 22:13:20 +0000
constexpr double kStart = 1'700'000'000.0;

Value sectionNamed(const std::string& label) {
  return Value(Dictionary{{"metrix", Value(Dictionary{{"active", Value(true)}, {"label", Value(label)}})}});
}

StorebagSelectionResult success(const std::string& version, std::int32_t maxAge) {
  StorebagSelectionResult result;
  StorebagSelection selection;
  selection.section = sectionNamed(version);
  selection.version = version;
  selection.maxAgeSeconds = maxAge;
  result.selection = std::move(selection);
  result.maxAgeSeconds = maxAge;
  return result;
}

StorebagSelectionResult failure(std::int32_t maxAge) {
  StorebagSelectionResult result;
  result.maxAgeSeconds = maxAge;
  return result;
}

StorebagSelectionResult notModified(std::int32_t maxAge) {
  StorebagSelectionResult result;
  result.notModified = true;
  result.maxAgeSeconds = maxAge;
  return result;
}

// The selector of the tests: answers from a script (then with a default) and records
// every client type it was called with.
class ScriptedSelector {
 public:
  void push(StorebagSelectionResult result) {
    std::lock_guard<std::mutex> lock(mutex_);
    script_.push_back(std::move(result));
  }
  StorebagSelectionResult operator()(std::int32_t clientType) {
    std::lock_guard<std::mutex> lock(mutex_);
    calls_.push_back(clientType);
    if (script_.empty()) return failure(0);
    StorebagSelectionResult result = std::move(script_.front());
    script_.pop_front();
    return result;
  }
  std::vector<std::int32_t> calls() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return calls_;
  }
  std::size_t callCount() const { return calls().size(); }

 private:
  mutable std::mutex mutex_;
  std::deque<StorebagSelectionResult> script_;
  std::vector<std::int32_t> calls_;
};

class AgentStorebagCacheTest : public ::testing::Test {
 protected:
  void setFileTime(const std::string& name, std::optional<double> time) {
    std::lock_guard<std::mutex> lock(fileTimesMutex);
    fileTimes[name] = time;
  }
  const Value& entry(const std::string& name) {
    entriesCopy = cache.copyCachedStorebags();
    return entriesCopy[name];
  }
  std::string label(const std::optional<Value>& section) const {
    return section ? (*section)["metrix"]["label"].stringOrEmpty() : std::string("<none>");
  }

  log::LogCapture capture;
  std::recursive_mutex agentLock;
  std::shared_ptr<ManualClock> clock = std::make_shared<ManualClock>(kStart);
  ScriptedSelector selector;
  std::mutex fileTimesMutex;
  std::map<std::string, std::optional<double>> fileTimes;  // guarded by fileTimesMutex
  AgentStorebagCache cache{agentLock, [this](std::int32_t clientType) { return selector(clientType); },
                           [this](const std::string& name) -> std::optional<double> {
                             std::lock_guard<std::mutex> lock(fileTimesMutex);
                             auto it = fileTimes.find(name);
                             return it == fileTimes.end() ? std::nullopt : it->second;
                           },
                           clock};
  Value entriesCopy;
};

TEST_F(AgentStorebagCacheTest, FirstRequestFetchesAndCachesTheSection) {
  selector.push(success("1.0", 3600));
  std::optional<Value> section = cache.storebagForSession(42, 7);
  EXPECT_EQ(label(section), "1.0");
  EXPECT_EQ(selector.calls(), std::vector<std::int32_t>{7});
  EXPECT_EQ(capture.texts(), (std::vector<std::string>{
                                 "storebagForSession: Retrieving storebag for session 42 with client type 7",
                                 "fetchAndCacheStorebag: Fetching storebag for client type 7",
                                 "fetchAndCacheStorebag: Storebag max age: 3600 seconds",
                             }));
  EXPECT_EQ(cache.entryCount(), 1u);
}

TEST_F(AgentStorebagCacheTest, ClientTypesSharingAStorebagShareOneEntry) {
  selector.push(success("1.0", 3600));
  std::optional<Value> first = cache.storebagForSession(1, 7);
  clock->advance(3599);
  capture.clear();
  std::optional<Value> second = cache.storebagForSession(2, 11);
  ASSERT_TRUE(first && second);
  EXPECT_TRUE(second->sharesContainerWith(*first)) << "the cached section itself";
  EXPECT_EQ(selector.callCount(), 1u);
  EXPECT_EQ(capture.texts(), (std::vector<std::string>{
                                 "storebagForSession: Retrieving storebag for session 2 with client type 11",
                                 "storebagForSession: Cached storebag found for client type 11",
                             }));
  Value copy = cache.copyCachedStorebags();
  ASSERT_TRUE(copy.isDictionary());
  EXPECT_EQ(copy.asDictionary()->size(), 1u);
  EXPECT_TRUE(copy.asDictionary()->contains("confera"));

  // Client types 13 and 20 read it too; version lookups agree.
  EXPECT_EQ(label(cache.storebagForSession(3, 13)), "1.0");
  EXPECT_EQ(label(cache.storebagForSession(4, 20)), "1.0");
  EXPECT_EQ(selector.callCount(), 1u);
  EXPECT_EQ(cache.storebagVersionForSession(11), std::optional<std::string>("1.0"));
}

TEST_F(AgentStorebagCacheTest, ExpiredSuccessIsFetchedAgainAtOnce) {
  selector.push(success("1.0", 100));
  selector.push(success("2.0", 100));
  EXPECT_EQ(label(cache.storebagForSession(1, 7)), "1.0");
  clock->advance(99);
  EXPECT_EQ(label(cache.storebagForSession(1, 7)), "1.0");
  EXPECT_EQ(selector.callCount(), 1u);
  // Elapsed equal to the max age is expired; no 900-second wait after a success.
  clock->advance(1);
  capture.clear();
  EXPECT_EQ(label(cache.storebagForSession(1, 7)), "2.0");
  EXPECT_EQ(selector.callCount(), 2u);
  EXPECT_EQ(capture.texts(), (std::vector<std::string>{
                                 "storebagForSession: Retrieving storebag for session 1 with client type 7",
                                 "fetchAndCacheStorebag: Fetching storebag for client type 7",
                                 "fetchAndCacheStorebag: Storebag max age: 100 seconds",
                             }));
}

TEST_F(AgentStorebagCacheTest, FailureHoldsFurtherAttemptsOffFor900Seconds) {
  selector.push(failure(0));
  EXPECT_FALSE(cache.storebagForSession(5, 7).has_value());
  EXPECT_TRUE(capture.contains(log::Level::Error, "fetchAndCacheStorebag: Unable to fetch storebag for client type 7"));
  EXPECT_EQ(entry("confera")[kStorebagEntryFetchState], Value(kStorebagFetchFailure));

  clock->advance(899);
  capture.clear();
  EXPECT_FALSE(cache.storebagForSession(5, 11).has_value());
  EXPECT_EQ(selector.callCount(), 1u);
  EXPECT_EQ(capture.texts(),
            (std::vector<std::string>{
                "storebagForSession: Retrieving storebag for session 5 with client type 11",
                "storebagForSession: Not fetching storebag for client type 11 - must wait 900 seconds between attempts",
            }));

  clock->advance(1);
  selector.push(success("1.0", 3600));
  capture.clear();
  EXPECT_EQ(label(cache.storebagForSession(5, 7)), "1.0");
  EXPECT_EQ(selector.callCount(), 2u);
  EXPECT_TRUE(capture.contains("fetchAndCacheStorebag: Fetching storebag for client type 7"));
  EXPECT_EQ(entry("confera")[kStorebagEntryFetchState], Value(kStorebagFetchSuccessful));
}

TEST_F(AgentStorebagCacheTest, FailureKeepsThePreviousSectionAndVersion) {
  selector.push(success("1.0", 60));
  selector.push(failure(86400));
  EXPECT_EQ(label(cache.storebagForSession(1, 7)), "1.0");
  clock->advance(61);
  // The failed refresh still hands out the section of the earlier success.
  EXPECT_EQ(label(cache.storebagForSession(1, 7)), "1.0");
  EXPECT_EQ(selector.callCount(), 2u);
  EXPECT_EQ(cache.storebagVersionForSession(7), std::optional<std::string>("1.0"));
  const Value& fields = entry("confera");
  EXPECT_EQ(fields[kStorebagEntryFetchState], Value(kStorebagFetchFailure));
  EXPECT_EQ(fields[kStorebagEntryFetchTime], Value::date(kStart + 61));
  EXPECT_EQ(fields[kStorebagEntryMaxAge], Value(86400));
  EXPECT_EQ(label(fields[kStorebagEntryData]), "1.0");

  // And goes on doing so during the wait, without fetching.
  clock->advance(899);
  capture.clear();
  EXPECT_EQ(label(cache.storebagForSession(1, 11)), "1.0");
  EXPECT_EQ(selector.callCount(), 2u);
  EXPECT_TRUE(capture.contains(
      "storebagForSession: Not fetching storebag for client type 11 - must wait 900 seconds between attempts"));
}

TEST_F(AgentStorebagCacheTest, NotModifiedCountsAsSuccessAndKeepsTheSection) {
  selector.push(success("1.0", 10));
  selector.push(notModified(20));
  EXPECT_EQ(label(cache.storebagForSession(1, 7)), "1.0");
  clock->advance(10);
  capture.clear();
  EXPECT_EQ(label(cache.storebagForSession(1, 7)), "1.0");
  EXPECT_FALSE(capture.containsPrefix("fetchAndCacheStorebag: Unable"));
  const Value& fields = entry("confera");
  EXPECT_EQ(fields[kStorebagEntryFetchState], Value(kStorebagFetchSuccessful));
  EXPECT_EQ(fields[kStorebagEntryMaxAge], Value(20));
  EXPECT_EQ(fields[kStorebagEntryVersion], Value("1.0"));
  clock->advance(19);
  EXPECT_EQ(label(cache.storebagForSession(1, 7)), "1.0");
  EXPECT_EQ(selector.callCount(), 2u);
}

TEST_F(AgentStorebagCacheTest, MaxAgeZeroIsFetchedOnEveryRequest) {
  for (int i = 0; i < 3; ++i) selector.push(success("v" + std::to_string(i), 0));
  EXPECT_EQ(label(cache.storebagForSession(1, 7)), "v0");
  EXPECT_EQ(label(cache.storebagForSession(1, 7)), "v1");
  EXPECT_EQ(label(cache.storebagForSession(1, 11)), "v2");
  EXPECT_EQ(selector.callCount(), 3u);
  EXPECT_FALSE(capture.containsPrefix("storebagForSession: Cached storebag found"));
  EXPECT_EQ(capture.count("fetchAndCacheStorebag: Storebag max age: 0 seconds"), 3u);
}

TEST_F(AgentStorebagCacheTest, NewerDiskFileForcesAFetchInsideTheMaxAge) {
  selector.push(success("1.0", 86400));
  selector.push(success("2.0", 86400));
  EXPECT_EQ(label(cache.storebagForSession(1, 7)), "1.0");

  // A file no newer than the fetch, or none, leaves the entry fresh.
  setFileTime("confera", kStart);
  clock->advance(50);
  EXPECT_EQ(label(cache.storebagForSession(1, 7)), "1.0");
  setFileTime("confera", std::nullopt);
  EXPECT_EQ(label(cache.storebagForSession(1, 7)), "1.0");
  EXPECT_EQ(selector.callCount(), 1u);

  // A background refresh wrote the file after the fetch.
  setFileTime("confera", kStart + 100);
  clock->advance(150);
  capture.clear();
  EXPECT_EQ(label(cache.storebagForSession(1, 11)), "2.0");
  EXPECT_EQ(selector.callCount(), 2u);
  EXPECT_EQ(capture.texts(), (std::vector<std::string>{
                                 "storebagForSession: Retrieving storebag for session 1 with client type 11",
                                 "storebagForSession: Override maxAge as disk cache for storebag 'confera' was "
                                 "updated: modification time '2023-11-14 22:15:00 +0000' is greater than last fetch "
                                 "time '2023-11-14 22:13:20 +0000",
                                 "fetchAndCacheStorebag: Fetching storebag for client type 11",
                                 "fetchAndCacheStorebag: Storebag max age: 86400 seconds",
                             }));
  // Fetched after the file was written: fresh again.
  EXPECT_EQ(label(cache.storebagForSession(1, 7)), "2.0");
  EXPECT_EQ(selector.callCount(), 2u);
}

TEST_F(AgentStorebagCacheTest, NewerDiskFileEndsTheWaitAfterAFailure) {
  selector.push(failure(0));
  selector.push(success("1.0", 3600));
  EXPECT_FALSE(cache.storebagForSession(1, 7).has_value());
  setFileTime("confera", kStart + 10);
  clock->advance(20);
  EXPECT_EQ(label(cache.storebagForSession(1, 7)), "1.0");
  EXPECT_EQ(selector.callCount(), 2u);
  EXPECT_FALSE(capture.containsPrefix("storebagForSession: Not fetching"));
}

TEST_F(AgentStorebagCacheTest, VersionBeforeAnyRequestIsNothing) {
  EXPECT_FALSE(cache.storebagVersionForSession(7).has_value());
  EXPECT_EQ(selector.callCount(), 0u) << "a version lookup never fetches";
  EXPECT_EQ(cache.entryCount(), 0u);

  selector.push(success("2.5", 3600));
  cache.storebagForSession(1, 11);
  EXPECT_EQ(cache.storebagVersionForSession(7), std::optional<std::string>("2.5"));
  EXPECT_EQ(cache.storebagVersionForSession(20), std::optional<std::string>("2.5"));
  // Another family has no entry yet.
  EXPECT_FALSE(cache.storebagVersionForSession(5).has_value());
  EXPECT_FALSE(cache.storebagVersionForSession(4).has_value());
  EXPECT_EQ(selector.callCount(), 1u);
}

TEST_F(AgentStorebagCacheTest, FailedFirstFetchLeavesNoVersion) {
  selector.push(failure(0));
  cache.storebagForSession(1, 7);
  EXPECT_FALSE(cache.storebagVersionForSession(7).has_value());
  EXPECT_EQ(cache.entryCount(), 1u) << "the entry exists from the first attempt";
  EXPECT_FALSE(entry("confera").asDictionary()->contains(kStorebagEntryData));
}

TEST_F(AgentStorebagCacheTest, InvalidClientTypeYieldsNothing) {
  for (std::int32_t clientType : {0, 4, 31, -1}) {
    EXPECT_FALSE(cache.storebagForSession(1, clientType).has_value()) << clientType;
  }
  EXPECT_TRUE(capture.texts().empty()) << "silently";
  EXPECT_EQ(selector.callCount(), 0u);

  cache.fetchAndCacheStorebag(4);
  EXPECT_EQ(capture.texts(), (std::vector<std::string>{
                                 "fetchAndCacheStorebag: Fetching storebag for client type 4",
                                 "fetchAndCacheStorebag: clientType 4 is invalid",
                             }));
  EXPECT_TRUE(capture.contains(log::Level::Error, "fetchAndCacheStorebag: clientType 4 is invalid"));
  EXPECT_EQ(selector.callCount(), 0u);
  EXPECT_EQ(cache.entryCount(), 0u);
}

TEST_F(AgentStorebagCacheTest, EntryFieldsRecordEveryAttempt) {
  selector.push(success("3.1", 1234));
  cache.storebagForSession(1, 16);
  Value fields = entry("tessary");
  ASSERT_TRUE(fields.isDictionary());
  EXPECT_EQ(fields[kStorebagEntryVersion], Value("3.1"));
  EXPECT_EQ(label(fields[kStorebagEntryData]), "3.1");
  ASSERT_TRUE(fields[kStorebagEntryFetchTime].isDate());
  EXPECT_EQ(fields[kStorebagEntryFetchTime].asDate()->secondsSince1970, kStart);
  EXPECT_EQ(fields[kStorebagEntryFetchState], Value("Fetch Successful"));
  EXPECT_TRUE(fields[kStorebagEntryMaxAge].isInteger());
  EXPECT_EQ(fields[kStorebagEntryMaxAge].integerValue(), 1234);

  clock->advance(2000);
  selector.push(failure(77));
  cache.fetchAndCacheStorebag(16);
  fields = entry("tessary");
  EXPECT_EQ(fields[kStorebagEntryFetchTime], Value::date(kStart + 2000));
  EXPECT_EQ(fields[kStorebagEntryFetchState], Value("Fetch Failure"));
  EXPECT_EQ(fields[kStorebagEntryMaxAge].integerValue(), 77);
  EXPECT_EQ(fields[kStorebagEntryVersion], Value("3.1"));
  EXPECT_TRUE(capture.contains("fetchAndCacheStorebag: Storebag max age: 77 seconds"));
}

TEST_F(AgentStorebagCacheTest, FetchAndCacheStorebagRefreshesAFreshEntry) {
  selector.push(success("1.0", 3600));
  selector.push(success("2.0", 3600));
  cache.storebagForSession(1, 7);
  cache.fetchAndCacheStorebag(13);
  EXPECT_EQ(selector.calls(), (std::vector<std::int32_t>{7, 13}));
  EXPECT_EQ(label(cache.storebagForSession(1, 7)), "2.0");
  EXPECT_EQ(selector.callCount(), 2u);
}

TEST_F(AgentStorebagCacheTest, CopyIsANewDictionarySharingTheEntries) {
  selector.push(success("1.0", 3600));
  selector.push(success("5.0", 3600));
  cache.storebagForSession(1, 7);
  cache.storebagForSession(1, 5);

  Value first = cache.copyCachedStorebags();
  Value second = cache.copyCachedStorebags();
  ASSERT_EQ(first.asDictionary()->size(), 2u);
  EXPECT_FALSE(first.sharesContainerWith(second));
  EXPECT_TRUE(first["confera"].sharesContainerWith(second["confera"]));
  EXPECT_TRUE(first["quillon"].sharesContainerWith(second["quillon"]));

  // The caller owns its dictionary.
  first.asDictionary()->erase("quillon");
  first.asDictionary()->set("extra", Value(1));
  EXPECT_EQ(cache.entryCount(), 2u);
  EXPECT_TRUE(cache.copyCachedStorebags().asDictionary()->contains("quillon"));

  // A later attempt gives the cache a new entry; what a copy holds stays as it was.
  Value before = second["confera"];
  clock->advance(5000);
  selector.push(success("2.0", 3600));
  cache.fetchAndCacheStorebag(7);
  EXPECT_EQ(before[kStorebagEntryVersion], Value("1.0"));
  EXPECT_EQ(before[kStorebagEntryFetchTime], Value::date(kStart));
  EXPECT_EQ(cache.copyCachedStorebags()["confera"][kStorebagEntryVersion], Value("2.0"));
}

TEST_F(AgentStorebagCacheTest, TheFetchRunsUnderTheAgentLock) {
  bool lockedElsewhere = true;
  AgentStorebagCache locked(
      agentLock,
      [&](std::int32_t) {
        // Another thread cannot take the agent's lock while the fetch runs.
        lockedElsewhere = !std::async(std::launch::async, [&] {
                             bool taken = agentLock.try_lock();
                             if (taken) agentLock.unlock();
                             return taken;
                           }).get();
        return success("1.0", 3600);
      },
      nullptr, clock);
  EXPECT_EQ(label(locked.storebagForSession(1, 7)), "1.0");
  EXPECT_TRUE(lockedElsewhere);
}

// Sessions of several families on several threads: one fetch per storebag name while
// the entries are fresh, fetches never overlap, and the copies the health report
// reads stay consistent while entries are replaced (meaningful under ThreadSanitizer).
TEST_F(AgentStorebagCacheTest, ConcurrentSessionsOfSeveralFamilies) {
  const std::vector<std::int32_t> clientTypes = {5, 6, 7, 8, 9, 11, 14, 20};  // five storebag names
  std::atomic<std::int32_t> maxAge{86400};
  std::atomic<int> inside{0};
  std::atomic<bool> overlapped{false};
  std::mutex callsMutex;
  std::map<std::string, int> callsPerName;  // guarded by callsMutex
  AgentStorebagCache shared(
      agentLock,
      [&](std::int32_t clientType) {
        if (inside.fetch_add(1) != 0) overlapped = true;
        const std::string name = *storebagNameForClientType(clientType);
        {
          std::lock_guard<std::mutex> lock(callsMutex);
          ++callsPerName[name];
        }
        StorebagSelectionResult result = success(name, maxAge.load());
        inside.fetch_sub(1);
        return result;
      },
      [](const std::string&) { return std::optional<double>(); }, clock);

  auto runSessions = [&](int iterations) {
    std::atomic<bool> wrongSection{false};
    std::atomic<bool> done{false};
    std::vector<std::thread> threads;
    for (std::size_t t = 0; t < clientTypes.size(); ++t) {
      threads.emplace_back([&, t] {
        for (int i = 0; i < iterations; ++i) {
          const std::int32_t clientType = clientTypes[(t + static_cast<std::size_t>(i)) % clientTypes.size()];
          std::optional<Value> section = shared.storebagForSession(static_cast<std::uint32_t>(t), clientType);
          if (!section || (*section)["metrix"]["label"].stringOrEmpty() != *storebagNameForClientType(clientType)) {
            wrongSection = true;
          }
          shared.storebagVersionForSession(clientType);
        }
      });
    }
    // The health report's reader: copies of the cache, read without the lock.
    std::int64_t observed = 0;
    std::thread reader([&] {
      while (!done.load()) {
        Value copy = shared.copyCachedStorebags();
        observed += copy.sizeEstimate();
        for (const auto& [name, fields] : *copy.asDictionary()) {
          observed += fields[kStorebagEntryMaxAge].integerValue();
          observed += static_cast<std::int64_t>(fields[kStorebagEntryVersion].stringOrEmpty().size());
        }
      }
    });
    for (auto& thread : threads) thread.join();
    done = true;
    reader.join();
    EXPECT_GE(observed, 0);
    return !wrongSection.load();
  };

  EXPECT_TRUE(runSessions(200));
  EXPECT_FALSE(overlapped.load());
  {
    std::lock_guard<std::mutex> lock(callsMutex);
    EXPECT_EQ(callsPerName, (std::map<std::string, int>{
                                {"brisklet", 1}, {"confera", 1}, {"hollowind", 1}, {"quillon", 1}, {"vantor", 1}}));
  }
  EXPECT_EQ(shared.entryCount(), 5u);

  // Max age 0: every request fetches and replaces its entry while the reader copies.
  maxAge = 0;
  clock->advance(86400);
  EXPECT_TRUE(runSessions(100));
  EXPECT_FALSE(overlapped.load());
  std::lock_guard<std::mutex> lock(callsMutex);
  int total = 0;
  for (const auto& [name, count] : callsPerName) total += count;
  EXPECT_EQ(total, 5 + static_cast<int>(clientTypes.size()) * 100);
}

// ---- With the real retrieval and disk cache ----

// A background refresh of the retrieval rewrites the disk file; the agent's next
// request for that family refetches although its entry is well inside its max age.
TEST(AgentStorebagCacheWithRetrievalTest, BackgroundRefreshMakesTheNextRequestFetchAgain) {
  ::setenv("TELVANED_CA_FILE", test::TestCertificates::shared().caFile().c_str(), 1);
  log::LogCapture capture;
  test::TempDir dir;
  test::StorebagTestServer server;
  auto settings = std::make_shared<MemorySettingsStore>();
  settings->write(kTelvaneSettingsDomain, kStorebagURLSettingsKey, Value(server.baseURL()));
  const double realNow =
      std::floor(std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count());
  auto clock = std::make_shared<ManualClock>(realNow - 10);

  auto document = [](const std::string& version) {
    return test::StorebagBuilder()
        .version(version)
        .refreshCycle(86400)
        .backend("release", "metrix", Value(Dictionary{{"label", Value(version)}}))
        .build();
  };
  // A stale envelope on disk (older than the server's max age).
  StorebagDiskCache disk(dir.str(), false);
  ASSERT_TRUE(disk.save("confera", test::SignedEnvelopeBuilder().sign(document("1.0"))));
  struct timespec times[2] = {{static_cast<time_t>(clock->now() - 5000), 0},
                              {static_cast<time_t>(clock->now() - 5000), 0}};
  ASSERT_EQ(::utimensat(AT_FDCWD, disk.cacheFilePath("confera").c_str(), times, 0), 0);
  settings->write(kTelvaneSettingsDomain, StorebagMetrics::maxAgeKey("confera"), Value(3600));
  server.serveDocument("confera", document("2.0"), test::StorebagHeaders{"max-age=3600", std::nullopt});

  StorebagRetrieval::Options options;
  options.settings = settings;
  options.diskCache = disk;
  options.publicKey = test::TestKeyPair::shared().publicKeyLoader();
  options.internalBuild = false;
  options.daemonVersion = "4.2.1";
  options.clock = clock.get();
  auto random = std::make_shared<test::ScriptedRandom>();
  options.makeHelper = [random] {
    ReportingSessionConnectivityHelperImpl::Options helperOptions;
    helperOptions.random = random;
    helperOptions.secondDuration = std::chrono::milliseconds(1);
    auto helper = ReportingSessionConnectivityHelperImpl::create(
        std::weak_ptr<TelvanedSessionDelegate>(), ReportingSessionConnectivityHelper::kGETRequestMode,
        Value(Dictionary{{"_clientName", Value("storebag")}, {"_serviceName", Value("shared")}}), helperOptions);
    helper->activate(kStorebagHelperReleaseTimeoutSeconds);
    return helper;
  };
  StorebagRetrieval retrieval(std::move(options));

  std::recursive_mutex agentLock;
  AgentStorebagCache cache(
      agentLock,
      [&](std::int32_t clientType) {
        return fetchStorebagForEnvironmentAndClientType(clientType, retrieval.fetcher(),
                                                        [] { return kStorebagEnvironmentRelease; });
      },
      [&](const std::string& name) { return retrieval.diskCache().modificationTime(name); }, clock);

  // The stale envelope serves the first request and starts the background refresh.
  std::optional<Value> section = cache.storebagForSession(1, 7);
  ASSERT_TRUE(section.has_value());
  EXPECT_EQ((*section)["metrix"]["label"], Value("1.0"));
  EXPECT_EQ(cache.copyCachedStorebags()["confera"][kStorebagEntryMaxAge], Value(86400));
  ASSERT_TRUE(test::waitUntil([&] {
    return capture.contains("fetchStorebagWithName: storebag 'confera' has been saved to disk cache");
  }));

  // A minute later, far inside the entry's max age: the newer file forces a fetch,
  // which reads the refreshed envelope from the disk.
  clock->advance(60);
  section = cache.storebagForSession(2, 11);
  ASSERT_TRUE(section.has_value());
  EXPECT_EQ((*section)["metrix"]["label"], Value("2.0"));
  EXPECT_TRUE(capture.containsPrefix(
      "storebagForSession: Override maxAge as disk cache for storebag 'confera' was updated: modification time '"));
  EXPECT_EQ(cache.storebagVersionForSession(7), std::optional<std::string>("2.0"));
  EXPECT_EQ(server.requestCountFor("confera"), 1u);
  ::unsetenv("TELVANED_CA_FILE");
}

}  // namespace
}  // namespace telvane
