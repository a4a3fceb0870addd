#include "storebag/StorebagDiskCache.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>

#include <filesystem>
#include <gtest/gtest.h>

#include "support/ManualClock.h"
#include "support/SignedEnvelope.h"
#include "support/TempDir.h"
#include "platform/Log.h"

namespace telvane {
namespace {

using test::bytesOf;

void setModificationTime(const std::filesystem::path& path, double secondsSince1970) {
  timespec times[2];
  times[0].tv_sec = static_cast<time_t>(secondsSince1970);
  times[0].tv_nsec = 0;
  times[1] = times[0];
  ASSERT_EQ(::utimensat(AT_FDCWD, path.c_str(), times, 0), 0);
}

class StorebagDiskCacheTest : public ::testing::Test {
 protected:
  test::TempDir dir_;
  StorebagDiskCache cache_{(dir_ / "telvaned").string(), false};
  log::LogCapture capture_;
};

TEST_F(StorebagDiskCacheTest, FileIsNamedAfterTheStorebagBelowStorebags) {
  EXPECT_EQ(cache_.cacheFilePath("confera"), (dir_ / "telvaned" / "storebags" / "confera").string());
  EXPECT_TRUE(std::filesystem::is_directory(dir_ / "telvaned" / "storebags")) << "folders are made on every call";
}

TEST_F(StorebagDiskCacheTest, SystemCacheLivesUnderTheCacheDirOverride) {
  ::setenv("TELVANED_CACHE_DIR", (dir_ / "override").c_str(), 1);
  StorebagDiskCache system = StorebagDiskCache::system();
  ::unsetenv("TELVANED_CACHE_DIR");
  EXPECT_EQ(system.directory(), (dir_ / "override" / "storebags").string());
}

TEST_F(StorebagDiskCacheTest, SaveThenLoadRoundTrips) {
  Bytes envelope = bytesOf("envelope bytes \x01\x02");
  ASSERT_TRUE(cache_.save("vantor", envelope));
  EXPECT_EQ(cache_.load("vantor"), std::optional<Bytes>(envelope));
  ASSERT_TRUE(cache_.save("vantor", bytesOf("second")));
  EXPECT_EQ(cache_.load("vantor"), std::optional<Bytes>(bytesOf("second")));
  // No temporary files stay behind.
  int files = 0;
  for (const auto& entry : std::filesystem::directory_iterator(cache_.directory())) {
    (void)entry;
    ++files;
  }
  EXPECT_EQ(files, 1);
}

TEST_F(StorebagDiskCacheTest, MissingFileIsLoggedAndYieldsNothing) {
  EXPECT_FALSE(cache_.load("rill").has_value());
  std::string path = cache_.cacheFilePath("rill");
  EXPECT_TRUE(capture_.contains(log::Level::Error, "loadStorebagFromDisk: could not load storebag 'rill' from file '" +
                                                       path + "'. Error is 'No such file or directory'"));
}

TEST_F(StorebagDiskCacheTest, InternalBuildLoadsToo) {
  StorebagDiskCache internal((dir_ / "telvaned").string(), true);
  ASSERT_TRUE(internal.save("twine", bytesOf("x")));
  EXPECT_EQ(internal.load("twine"), std::optional<Bytes>(bytesOf("x")));
  EXPECT_TRUE(setStorageClassProtectionLevel(internal.directory()));
}

// A write that fails half-way (the file-size limit, which binds even the superuser)
// leaves the old file as it was and no temporary file behind.
TEST_F(StorebagDiskCacheTest, FailedSaveLeavesOldFileIntact) {
  Bytes old = bytesOf("old envelope");
  ASSERT_TRUE(cache_.save("confera", old));

  rlimit previous{};
  ASSERT_EQ(::getrlimit(RLIMIT_FSIZE, &previous), 0);
  auto previousHandler = ::signal(SIGXFSZ, SIG_IGN);
  rlimit small = previous;
  small.rlim_cur = 1024;
  ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &small), 0);
  bool saved = cache_.save("confera", Bytes(64 * 1024, 0x41));
  ::setrlimit(RLIMIT_FSIZE, &previous);
  ::signal(SIGXFSZ, previousHandler);

  EXPECT_FALSE(saved);
  EXPECT_EQ(cache_.load("confera"), std::optional<Bytes>(old));
  std::string path = cache_.cacheFilePath("confera");
  EXPECT_TRUE(capture_.contains(log::Level::Error, "saveStorebagToDisk: could not save storebag 'confera' to file '" +
                                                       path + "'. Error is 'File too large'"));
  int files = 0;
  for (const auto& entry : std::filesystem::directory_iterator(cache_.directory())) {
    (void)entry;
    ++files;
  }
  EXPECT_EQ(files, 1);
}

TEST_F(StorebagDiskCacheTest, SaveOverADirectoryFails) {
  std::filesystem::create_directories(std::filesystem::path(cache_.cacheFilePath("corvale")) / "inside");
  EXPECT_FALSE(cache_.save("corvale", bytesOf("x")));
  EXPECT_TRUE(capture_.containsPrefix("saveStorebagToDisk: could not save storebag 'corvale' to file '"));
  EXPECT_FALSE(cache_.load("corvale").has_value());
}

TEST_F(StorebagDiskCacheTest, AgeComesFromTheFileModificationTime) {
  test::ManualClock clock(1'700'000'000.0);
  EXPECT_EQ(cache_.modificationTime("feathon"), std::nullopt);
  EXPECT_EQ(cache_.ageSeconds("feathon", clock.now()), std::nullopt);
  ASSERT_TRUE(cache_.save("feathon", bytesOf("x")));
  setModificationTime(cache_.cacheFilePath("feathon"), 1'700'000'000.0 - 600);
  EXPECT_EQ(cache_.modificationTime("feathon"), std::optional<double>(1'700'000'000.0 - 600));
  EXPECT_EQ(cache_.ageSeconds("feathon", clock.now()), std::optional<double>(600));
  clock.advance(400);
  EXPECT_EQ(cache_.ageSeconds("feathon", clock.now()), std::optional<double>(1000));
  // A file time in the future counts by its distance.
  setModificationTime(cache_.cacheFilePath("feathon"), clock.now() + 50);
  EXPECT_EQ(cache_.ageSeconds("feathon", clock.now()), std::optional<double>(50));
}

TEST(StorebagCacheExpiryTest, StaleOnlyWhenStrictlyOlderThanMaxAge) {
  EXPECT_FALSE(isStorebagCacheExpired(600, 600));
  EXPECT_TRUE(isStorebagCacheExpired(600.5, 600));
  EXPECT_FALSE(isStorebagCacheExpired(0, 0));
  EXPECT_TRUE(isStorebagCacheExpired(1, 0));
}

TEST(StorebagLockTest, IsRecursiveAndProcessWide) {
  std::recursive_mutex& lock = storebagLock();
  EXPECT_EQ(&lock, &storebagLock());
  std::lock_guard outer(lock);
  EXPECT_TRUE(lock.try_lock());
  lock.unlock();
}

}  // namespace
}  // namespace telvane
