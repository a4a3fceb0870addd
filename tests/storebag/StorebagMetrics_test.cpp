#include "storebag/StorebagMetrics.h"

#include <gtest/gtest.h>

#include "platform/Log.h"
#include "storebag/StorebagDocument.h"

namespace telvane {
namespace {

class StorebagMetricsTest : public ::testing::Test {
 protected:
  std::shared_ptr<SettingsStore> settings_ = makeMemorySettingsStore();
  StorebagMetrics metrics_{settings_};
  log::LogCapture capture_;
};

TEST(StorebagMetricsKeysTest, KeysCarryTheStorebagName) {
  EXPECT_EQ(StorebagMetrics::maxAgeKey("confera"), "CACHED_confera_max-age");
  EXPECT_EQ(StorebagMetrics::lastModifiedKey("confera"), "CACHED_confera_Last-Modified");
}

TEST(StorebagMetricsCacheControlTest, MaxAgeFromHeader) {
  EXPECT_EQ(StorebagMetrics::maxAgeFromCacheControl(std::string("private, max-age=600")), 600);
  EXPECT_EQ(StorebagMetrics::maxAgeFromCacheControl(std::string("no-cache")), 86400);
  EXPECT_EQ(StorebagMetrics::maxAgeFromCacheControl(std::nullopt), 86400);
  EXPECT_EQ(StorebagMetrics::maxAgeFromCacheControl(std::string("max-age=3600, public")), 3600);
  EXPECT_EQ(StorebagMetrics::maxAgeFromCacheControl(std::string("max-age")), 86400);
  // Separators are single characters; an empty piece after "max-age" is 0.
  EXPECT_EQ(StorebagMetrics::maxAgeFromCacheControl(std::string("max-age =600")), 0);
  EXPECT_EQ(StorebagMetrics::maxAgeFromCacheControl(std::string("s-max-age=5 max-age=7")), 7);
}

TEST_F(StorebagMetricsTest, SaveStoresMaxAgeAndLastModified) {
  metrics_.save("confera", std::string("max-age=600"), std::string("Tue, 01 Jan 2030 00:00:00 GMT"));
  EXPECT_EQ(settings_->read(kTelvaneSettingsDomain, "CACHED_confera_max-age"), std::optional<Value>(Value(600)));
  EXPECT_EQ(settings_->read(kTelvaneSettingsDomain, "CACHED_confera_Last-Modified"),
            std::optional<Value>(Value("Tue, 01 Jan 2030 00:00:00 GMT")));
  EXPECT_TRUE(capture_.contains(
      "saveLastLoadedStorebagMetricsWithName: New storebag 'confera' received: maxAge 600, Last-Modified 'Tue, 01 Jan "
      "2030 00:00:00 GMT'"));
}

TEST_F(StorebagMetricsTest, AnswerWithoutLastModifiedRemovesTheKey) {
  metrics_.save("confera", std::nullopt, std::string("then"));
  metrics_.save("confera", std::nullopt, std::nullopt);
  EXPECT_EQ(settings_->read(kTelvaneSettingsDomain, "CACHED_confera_Last-Modified"), std::nullopt);
  EXPECT_EQ(settings_->read(kTelvaneSettingsDomain, "CACHED_confera_max-age"), std::optional<Value>(Value(86400)));
  EXPECT_TRUE(capture_.contains(
      "saveLastLoadedStorebagMetricsWithName: New storebag 'confera' received: maxAge 86400, Last-Modified '(null)'"));
}

TEST_F(StorebagMetricsTest, MissingMaxAgeReadsAsZero) {
  std::int32_t maxAge = -1;
  metrics_.get("rill", &maxAge, nullptr, nullptr);
  EXPECT_EQ(maxAge, 0);
  EXPECT_TRUE(capture_.contains("getLastLoadedStorebagMetricsWithName: maxAge is 0 for storebag rill"));
}

TEST_F(StorebagMetricsTest, EqualLastModifiedSetsNotModified) {
  metrics_.save("rill", std::string("max-age=60"), std::string("T1"));
  std::int32_t maxAge = 0;
  bool notModified = false;
  std::optional<std::string> lastModified = std::string("T1");
  metrics_.get("rill", &maxAge, &notModified, &lastModified);
  EXPECT_EQ(maxAge, 60);
  EXPECT_TRUE(notModified);
  EXPECT_EQ(lastModified, std::optional<std::string>("T1"));
  EXPECT_TRUE(capture_.contains(
      "getLastLoadedStorebagMetricsWithName: 'Last-Modified' has not changed for storebag 'rill': 'T1'"));
}

TEST_F(StorebagMetricsTest, DifferentOrEmptyLastModifiedIsReplacedByStoredValue) {
  metrics_.save("rill", std::nullopt, std::string("T2"));
  bool notModified = false;
  std::optional<std::string> lastModified;  // the retrieval's empty local
  metrics_.get("rill", nullptr, &notModified, &lastModified);
  EXPECT_FALSE(notModified);
  EXPECT_EQ(lastModified, std::optional<std::string>("T2"));
  EXPECT_TRUE(capture_.contains("getLastLoadedStorebagMetricsWithName: 'Last-Modified' has changed to 'T2' for storebag 'rill'"));

  lastModified = std::string("T0");
  metrics_.get("rill", nullptr, nullptr, &lastModified);
  EXPECT_EQ(lastModified, std::optional<std::string>("T2"));
}

TEST_F(StorebagMetricsTest, WithoutStoredLastModifiedNothingChanges) {
  bool notModified = false;
  std::optional<std::string> lastModified = std::string("mine");
  metrics_.get("rill", nullptr, &notModified, &lastModified);
  EXPECT_FALSE(notModified);
  EXPECT_EQ(lastModified, std::optional<std::string>("mine"));
  EXPECT_TRUE(capture_.texts().empty());
}

}  // namespace
}  // namespace telvane
