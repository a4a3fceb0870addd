#include "storebag/StorebagDocument.h"

#include <gtest/gtest.h>

#include "support/StorebagBuilder.h"
#include "platform/Log.h"
#include "platform/PropertyList.h"

namespace telvane {
namespace {

using test::StorebagBuilder;

class UserDefaultsEnvironmentTest : public ::testing::Test {
 protected:
  std::shared_ptr<SettingsStore> settings_ = makeMemorySettingsStore();
  log::LogCapture capture_;
};

TEST_F(UserDefaultsEnvironmentTest, FourSelectsRelease) {
  settings_->write(kTelvaneSettingsDomain, kEnvironmentTypeSettingsKey, Value(4));
  std::uint32_t environment = userDefaultsEnvironment(*settings_, true);
  EXPECT_EQ(environment, 4u);
  EXPECT_EQ(environmentSectionName(environment), std::optional<std::string>("release"));
  EXPECT_TRUE(capture_.contains(log::Level::Info, "userDefaultsEnvironment: Environment type 4"));
  EXPECT_EQ(lastUserDefaultsEnvironment(), 4u);
}

TEST_F(UserDefaultsEnvironmentTest, SevenIsInvalidAndSelectsInternal) {
  settings_->write(kTelvaneSettingsDomain, kEnvironmentTypeSettingsKey, Value(7));
  EXPECT_EQ(userDefaultsEnvironment(*settings_, false), 2u);
  EXPECT_TRUE(capture_.contains(log::Level::Error, "userDefaultsEnvironment: Invalid environment type 7"));
  EXPECT_TRUE(capture_.contains(log::Level::Info, "userDefaultsEnvironment: Environment type 2"));
}

TEST_F(UserDefaultsEnvironmentTest, NegativeCountsAsLargeUnsigned) {
  settings_->write(kTelvaneSettingsDomain, kEnvironmentTypeSettingsKey, Value(-1));
  EXPECT_EQ(userDefaultsEnvironment(*settings_, false), 2u);
  EXPECT_TRUE(capture_.contains(log::Level::Error, "userDefaultsEnvironment: Invalid environment type 4294967295"));
}

TEST_F(UserDefaultsEnvironmentTest, ZeroIsKeptAndNamesNoSection) {
  settings_->write(kTelvaneSettingsDomain, kEnvironmentTypeSettingsKey, Value(0));
  EXPECT_EQ(userDefaultsEnvironment(*settings_, true), 0u);
  EXPECT_EQ(environmentSectionName(0), std::nullopt);
}

TEST_F(UserDefaultsEnvironmentTest, AbsentKeyDependsOnBuildKind) {
  EXPECT_EQ(userDefaultsEnvironment(*settings_, true), 2u);
  EXPECT_EQ(userDefaultsEnvironment(*settings_, false), 3u);
}

TEST_F(UserDefaultsEnvironmentTest, ReadAfreshOnEveryCall) {
  settings_->write(kTelvaneSettingsDomain, kEnvironmentTypeSettingsKey, Value(1));
  EXPECT_EQ(userDefaultsEnvironment(*settings_, false), 1u);
  settings_->write(kTelvaneSettingsDomain, kEnvironmentTypeSettingsKey, Value("4"));
  EXPECT_EQ(userDefaultsEnvironment(*settings_, false), 4u);
}

TEST(EnvironmentSectionNameTest, Table) {
  EXPECT_EQ(environmentSectionName(1), std::optional<std::string>("development"));
  EXPECT_EQ(environmentSectionName(2), std::optional<std::string>("zembra_internal"));
  EXPECT_EQ(environmentSectionName(3), std::optional<std::string>("seed"));
  EXPECT_EQ(environmentSectionName(4), std::optional<std::string>("release"));
  EXPECT_EQ(environmentSectionName(5), std::nullopt);
}

TEST(StorebagNameForClientTypeTest, WholeTable) {
  const std::pair<int, const char*> expected[] = {
      {5, "quillon"},   {6, "vantor"},    {7, "confera"},    {8, "brisklet"}, {9, "hollowind"}, {10, "marrowby"},
      {11, "confera"},  {12, "pendrake"}, {13, "confera"},   {14, "vantor"},  {15, "vantor"},   {16, "tessary"},
      {17, "glimmerd"}, {18, "corvale"},  {19, "sonvique"},  {20, "confera"}, {21, "dunmere"},  {22, "prescia"},
      {23, "cloudbrim"}, {24, "feathon"}, {25, "mettling"},  {26, "vaultry"}, {27, "rill"},     {28, "speckle"},
      {29, "auguring"}, {30, "twine"}};
  for (const auto& [clientType, name] : expected) {
    EXPECT_EQ(storebagNameForClientType(clientType), std::optional<std::string>(name)) << clientType;
  }
  for (int clientType : {-1, 0, 1, 2, 3, 4, 31, 1000}) {
    EXPECT_EQ(storebagNameForClientType(clientType), std::nullopt) << clientType;
  }
}

TEST(DefaultStorebagDataTest, IsTheFallbackDocumentAsBinaryPropertyList) {
  Bytes data = defaultStorebagData();
  ASSERT_GE(data.size(), 8u);
  EXPECT_EQ(std::string(data.begin(), data.begin() + 8), "bplist00");
  Result<Value> decoded = plist::decode(data);
  ASSERT_TRUE(decoded.ok());
  Value active(Dictionary{{"metrix", Value(Dictionary{{"active", Value(true)}})}});
  Value expected(Dictionary{{"zembra_internal", active},
                            {"development", active},
                            {"release", active},
                            {"version", Value("1.0.0-Confera-Fallback")},
                            {"refresh_cycle", Value(3600)}});
  EXPECT_EQ(*decoded, expected);
  EXPECT_FALSE(decoded->asDictionary()->contains("seed"));
  EXPECT_FALSE(decoded->asDictionary()->contains("signature"));
}

// Selection over a fetcher that hands out a fixed document.
class SelectionTest : public ::testing::Test {
 protected:
  StorebagSelectionResult select(std::int32_t clientType, std::uint32_t environment) {
    StorebagFetcher fetcher = [this](const std::string& name, std::int32_t& maxAge, bool& notModified) {
      fetchedNames_.push_back(name);
      maxAge = httpMaxAge_;
      notModified = notModified_;
      return document_;
    };
    return fetchStorebagForEnvironmentAndClientType(clientType, fetcher, [environment] { return environment; });
  }

  std::optional<Value> document_;
  std::int32_t httpMaxAge_ = 600;
  bool notModified_ = false;
  std::vector<std::string> fetchedNames_;
  log::LogCapture capture_;
};

TEST_F(SelectionTest, ClientTypeWithoutNameFetchesNothing) {
  document_ = StorebagBuilder().version("1").build();
  StorebagSelectionResult result = select(4, 4);
  EXPECT_FALSE(result.selection);
  EXPECT_TRUE(fetchedNames_.empty());
  EXPECT_TRUE(capture_.contains(log::Level::Error,
                                "fetchStorebagForEnvironmentAndClientType: Could not find storebag name for client type 4"));
}

TEST_F(SelectionTest, SharedStorebagNameForConferaClientTypes) {
  document_ = StorebagBuilder().version("1").build();
  for (int clientType : {7, 11, 13, 20}) select(clientType, 4);
  EXPECT_EQ(fetchedNames_, (std::vector<std::string>{"confera", "confera", "confera", "confera"}));
}

TEST_F(SelectionTest, NoDocumentIsLoggedUnlessNotModified) {
  StorebagSelectionResult result = select(7, 4);
  EXPECT_FALSE(result.selection);
  EXPECT_FALSE(result.notModified);
  EXPECT_TRUE(capture_.contains(log::Level::Error,
                                "fetchStorebagForEnvironmentAndClientType: Could not fetch storebag for client type 7"));
  capture_.clear();
  notModified_ = true;
  result = select(7, 4);
  EXPECT_FALSE(result.selection);
  EXPECT_TRUE(result.notModified);
  EXPECT_TRUE(capture_.texts().empty());
}

TEST_F(SelectionTest, ReleaseEnvironmentGetsReleaseSectionVersionAndTimeout) {
  document_ = StorebagBuilder()
                  .version("5.2")
                  .releaseTimeout(Value(45))
                  .backend("release", "metrix", Value(Dictionary{{"active", Value(true)}}))
                  .backend("zembra_internal", "other", Value(Dictionary{}))
                  .build();
  StorebagSelectionResult result = select(5, 4);
  ASSERT_TRUE(result.selection);
  Value expected(Dictionary{{"metrix", Value(Dictionary{{"active", Value(true)}})}, {"release_timeout", Value(45)}});
  EXPECT_EQ(result.selection->section, expected);
  EXPECT_EQ(result.selection->version, "5.2");
  EXPECT_EQ(result.selection->maxAgeSeconds, 600);
}

TEST_F(SelectionTest, SectionIsAFreshCopy) {
  document_ = StorebagBuilder().version("1").backend("release", "metrix", Value(1)).build();
  StorebagSelectionResult result = select(5, 4);
  ASSERT_TRUE(result.selection);
  result.selection->section.asDictionary()->set("added", Value(2));
  EXPECT_FALSE((*document_)["release"].asDictionary()->contains("added"));
}

TEST_F(SelectionTest, InvalidEnvironmentTypeSelectsInternalSection) {
  auto settings = makeMemorySettingsStore();
  settings->write(kTelvaneSettingsDomain, kEnvironmentTypeSettingsKey, Value(7));
  document_ = StorebagBuilder()
                  .version("1")
                  .backend("zembra_internal", "inside", Value(1))
                  .backend("release", "outside", Value(1))
                  .build();
  StorebagFetcher fetcher = [this](const std::string&, std::int32_t&, bool&) { return document_; };
  StorebagSelectionResult result = fetchStorebagForEnvironmentAndClientType(
      5, fetcher, [&] { return userDefaultsEnvironment(*settings, false); });
  ASSERT_TRUE(result.selection);
  EXPECT_EQ(result.selection->section, Value(Dictionary{{"inside", Value(1)}}));
  EXPECT_TRUE(capture_.contains(log::Level::Error, "userDefaultsEnvironment: Invalid environment type 7"));
}

TEST_F(SelectionTest, EnvironmentZeroYieldsEmptySection) {
  document_ = StorebagBuilder().version("1").backend("release", "metrix", Value(1)).build();
  StorebagSelectionResult result = select(5, 0);
  ASSERT_TRUE(result.selection);
  EXPECT_EQ(result.selection->section, Value::dictionary());
}

TEST_F(SelectionTest, SeedDeviceWithoutSeedSectionGetsEmptySectionNotRelease) {
  document_ = StorebagBuilder().version("1").backend("release", "metrix", Value(1)).build();
  StorebagSelectionResult result = select(5, 3);
  ASSERT_TRUE(result.selection);
  EXPECT_EQ(result.selection->section, Value::dictionary());
  EXPECT_FALSE(capture_.containsPrefix("fetchStorebagForEnvironmentAndClientType: Seed section is missing"));
}

TEST_F(SelectionTest, NonDictionarySectionYieldsEmptySection) {
  document_ = StorebagBuilder().version("1").set("release", Value("not a section")).build();
  StorebagSelectionResult result = select(5, 4);
  ASSERT_TRUE(result.selection);
  EXPECT_EQ(result.selection->section, Value::dictionary());
}

TEST_F(SelectionTest, RefreshCycleIsCappedAtOneDay) {
  document_ = StorebagBuilder().version("1").refreshCycle(100000).emptySection("release").build();
  StorebagSelectionResult result = select(5, 4);
  ASSERT_TRUE(result.selection);
  EXPECT_EQ(result.selection->maxAgeSeconds, 86400);
  EXPECT_EQ(result.maxAgeSeconds, 86400);
  EXPECT_TRUE(capture_.contains("fetchStorebagForEnvironmentAndClientType: Store bag override MaxAge=86400"));
}

TEST_F(SelectionTest, RefreshCycleBelowCapIsTakenAsItIs) {
  for (std::int64_t cycle : {3600, 0, -5}) {
    document_ = StorebagBuilder().version("1").refreshCycle(cycle).emptySection("release").build();
    StorebagSelectionResult result = select(5, 4);
    ASSERT_TRUE(result.selection);
    EXPECT_EQ(result.selection->maxAgeSeconds, cycle);
  }
}

TEST_F(SelectionTest, WithoutRefreshCycleTheHttpMaxAgeStands) {
  httpMaxAge_ = 1234;
  document_ = StorebagBuilder().version("1").emptySection("release").build();
  StorebagSelectionResult result = select(5, 4);
  ASSERT_TRUE(result.selection);
  EXPECT_EQ(result.selection->maxAgeSeconds, 1234);
  EXPECT_FALSE(capture_.containsPrefix("fetchStorebagForEnvironmentAndClientType: Store bag override"));
}

}  // namespace
}  // namespace telvane
