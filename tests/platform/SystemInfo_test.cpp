#include "platform/SystemInfo.h"

#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

#include <cstdlib>
#include <map>
#include <thread>

#include "support/TempDir.h"

namespace telvane {
namespace {

EnvironmentLookup envFrom(std::map<std::string, std::string> vars) {
  return [vars = std::move(vars)](const char* name) -> std::optional<std::string> {
    auto it = vars.find(name);
    if (it == vars.end()) return std::nullopt;
    return it->second;
  };
}

TEST(SystemInfo, RegionOfLocale) {
  EXPECT_EQ(regionOfLocale("en_US.UTF-8"), "US");
  EXPECT_EQ(regionOfLocale("de_DE@euro"), "DE");
  EXPECT_EQ(regionOfLocale("fr_CA"), "CA");
  EXPECT_EQ(regionOfLocale("sr_RS.UTF-8@latin"), "RS");
  EXPECT_EQ(regionOfLocale("es_419.UTF-8"), "419");
  EXPECT_EQ(regionOfLocale("en_gb"), "GB");
  EXPECT_FALSE(regionOfLocale("C").has_value());
  EXPECT_FALSE(regionOfLocale("C.UTF-8").has_value());
  EXPECT_FALSE(regionOfLocale("POSIX").has_value());
  EXPECT_FALSE(regionOfLocale("").has_value());
  EXPECT_FALSE(regionOfLocale("en").has_value());
  EXPECT_FALSE(regionOfLocale("en_.UTF-8").has_value());
}

TEST(SystemInfo, LocaleCountryCodePrecedence) {
  EXPECT_EQ(localeCountryCode(envFrom({{"LC_ALL", "fr_FR.UTF-8"}, {"LC_MESSAGES", "de_DE"}, {"LANG", "en_US"}})),
            "FR");
  EXPECT_EQ(localeCountryCode(envFrom({{"LC_MESSAGES", "de_DE"}, {"LANG", "en_US"}})), "DE");
  EXPECT_EQ(localeCountryCode(envFrom({{"LANG", "en_US.UTF-8"}})), "US");
  // An empty variable counts as unset.
  EXPECT_EQ(localeCountryCode(envFrom({{"LC_ALL", ""}, {"LANG", "pt_BR"}})), "BR");
  // The first set variable decides, even when it names no region.
  EXPECT_FALSE(localeCountryCode(envFrom({{"LC_ALL", "C"}, {"LANG", "en_US"}})).has_value());
  EXPECT_FALSE(localeCountryCode(envFrom({{"LC_MESSAGES", "POSIX"}, {"LANG", "en_US"}})).has_value());
  EXPECT_FALSE(localeCountryCode(envFrom({})).has_value());
}

TEST(SystemInfo, LocaleCountryCodeReadsTheEnvironment) {
  const char* saved = std::getenv("LC_ALL");
  std::string savedValue = saved ? saved : "";
  setenv("LC_ALL", "nb_NO.UTF-8", 1);
  EXPECT_EQ(localeCountryCode(), "NO");
  if (saved) setenv("LC_ALL", savedValue.c_str(), 1); else unsetenv("LC_ALL");
}

class TimeZone {
 public:
  explicit TimeZone(const char* tz) {
    const char* old = std::getenv("TZ");
    had_ = old != nullptr;
    if (old) old_ = old;
    setenv("TZ", tz, 1);
    tzset();
  }
  ~TimeZone() {
    if (had_) setenv("TZ", old_.c_str(), 1); else unsetenv("TZ");
    tzset();
  }

 private:
  bool had_ = false;
  std::string old_;
};

TEST(SystemInfo, TimeZoneOffset) {
  {
    TimeZone tz("UTC0");
    EXPECT_EQ(timeZoneOffsetSeconds(), 0);
  }
  {
    TimeZone tz("EST5");
    EXPECT_EQ(timeZoneOffsetSeconds(), -5 * 3600);
  }
  {
    TimeZone tz("IST-5:30");
    EXPECT_EQ(timeZoneOffsetSeconds(1'700'000'000), 5 * 3600 + 30 * 60);
  }
  {
    // Daylight saving time follows the given moment.
    TimeZone tz("CET-1CEST,M3.5.0,M10.5.0/3");
    EXPECT_EQ(timeZoneOffsetSeconds(1'700'000'000), 3600);  // November
    EXPECT_EQ(timeZoneOffsetSeconds(1'690'000'000), 7200);  // July
  }
}

TEST(SystemInfo, TaskMemoryFromStatusFile) {
  test::TempDir dir;
  auto path = dir / "status";
  test::writeFile(path, "Name:\ttelvaned\nVmRSS:\t   9000 kB\nRssAnon:\t    4321 kB\nRssFile:\t 100 kB\n");
  EXPECT_EQ(taskMemoryBytes(path.string()), 4321u * 1024u);
  test::writeFile(path, "Name:\ttelvaned\n");
  EXPECT_EQ(taskMemoryBytes(path.string()), 0u);
  test::writeFile(path, "RssAnon:\tgarbage\n");
  EXPECT_EQ(taskMemoryBytes(path.string()), 0u);
  EXPECT_EQ(taskMemoryBytes((dir / "missing").string()), 0u);
}

TEST(SystemInfo, TaskMemoryOfThisProcess) {
  EXPECT_GT(taskMemoryBytes(), 0u);
  EXPECT_EQ(taskMemoryBytes() % 1024, 0u);
}

int threadNice() {
  errno = 0;
  return getpriority(PRIO_PROCESS, static_cast<id_t>(gettid()));
}

TEST(SystemInfo, UtilityQualityOfServiceRaisesNiceToFive) {
  int before = 0, after = 0;
  std::thread t([&] {
    before = threadNice();
    setUtilityQualityOfService();
    after = threadNice();
  });
  t.join();
  if (before >= kUtilityNiceValue) GTEST_SKIP() << "test process already runs at nice " << before;
  EXPECT_EQ(after, kUtilityNiceValue);
  // Only the calling thread moved.
  EXPECT_EQ(threadNice(), before);
}

TEST(SystemInfo, UtilityQualityOfServiceNeverLowersNice) {
  int after = 0;
  std::thread t([&] {
    ASSERT_EQ(setpriority(PRIO_PROCESS, static_cast<id_t>(gettid()), 10), 0);
    setUtilityQualityOfService();
    after = threadNice();
  });
  t.join();
  EXPECT_EQ(after, 10);
}

TEST(SystemInfo, FrameworkBundleVersion) {
  EXPECT_EQ(bundleVersionOr(""), "8.0");
  EXPECT_EQ(bundleVersionOr("1.2.3"), "1.2.3");
  EXPECT_EQ(frameworkBundleVersion(), bundleVersionOr(TELVANE_VERSION));
  EXPECT_FALSE(frameworkBundleVersion().empty());
}

}  // namespace
}  // namespace telvane
