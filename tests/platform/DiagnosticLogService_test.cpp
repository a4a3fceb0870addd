#include "platform/DiagnosticLogService.h"

#include <gtest/gtest.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "support/TempDir.h"

namespace telvane {
namespace {

namespace fs = std::filesystem;
using test::readFile;
using test::TempDir;
using test::writeFile;

TEST(DiagnosticLogService, CreateMakesAWritableFile) {
  TempDir dir;
  auto service = makeDiagnosticLogService(std::nullopt);
  const std::string path = (dir / "a.ips").string();
  int fd = service->createLogFile(path, "224");
  ASSERT_GE(fd, 0);
  ASSERT_EQ(::write(fd, "hello", 5), 5);
  EXPECT_NE(fcntl(fd, F_GETFD) & FD_CLOEXEC, 0);
  ::close(fd);
  EXPECT_EQ(readFile(path), "hello");
  struct stat info {};
  ASSERT_EQ(::stat(path.c_str(), &info), 0);
  mode_t mask = ::umask(0);
  ::umask(mask);
  EXPECT_EQ(info.st_mode & 0777, 0644 & ~mask);
}

TEST(DiagnosticLogService, CreateFailsInAMissingFolder) {
  TempDir dir;
  auto service = makeDiagnosticLogService(std::nullopt);
  EXPECT_EQ(service->createLogFile((dir / "no" / "a.ips").string(), "224"), -1);
}

TEST(DiagnosticLogService, SubmitWithoutFolderFails) {
  TempDir dir;
  auto path = dir / "a.ips";
  writeFile(path, "x");
  auto service = makeDiagnosticLogService(std::nullopt);
  EXPECT_FALSE(service->submitLogFile(path.string(), "224"));
  EXPECT_TRUE(fs::exists(path));
}

TEST(DiagnosticLogService, SubmitMovesIntoTheFolderCreatingIt) {
  TempDir dir;
  auto path = dir / "a.ips";
  writeFile(path, "content");
  auto queue = dir / "queue" / "nested";
  auto service = makeDiagnosticLogService(queue.string());
  EXPECT_TRUE(service->submitLogFile(path.string(), "224"));
  EXPECT_FALSE(fs::exists(path));
  EXPECT_EQ(readFile(queue / "a.ips"), "content");
}

TEST(DiagnosticLogService, SubmitOfAMissingFileFails) {
  TempDir dir;
  auto service = makeDiagnosticLogService((dir / "queue").string());
  EXPECT_FALSE(service->submitLogFile((dir / "gone.ips").string(), "224"));
}

TEST(DiagnosticLogService, SubmitFailsWhenTheFolderCannotBeMade) {
  TempDir dir;
  auto path = dir / "a.ips";
  writeFile(path, "x");
  writeFile(dir / "blocker", "a file where the folder should be");
  auto service = makeDiagnosticLogService((dir / "blocker" / "queue").string());
  EXPECT_FALSE(service->submitLogFile(path.string(), "224"));
  EXPECT_TRUE(fs::exists(path));
}

TEST(DiagnosticLogService, CopyThenUnlinkMovesTheContent) {
  TempDir dir;
  auto from = dir / "from.ips";
  auto to = dir / "to.ips";
  writeFile(from, std::string(100000, 'z'));
  EXPECT_TRUE(copyThenUnlink(from.string(), to.string()));
  EXPECT_FALSE(fs::exists(from));
  EXPECT_EQ(readFile(to), std::string(100000, 'z'));
  EXPECT_FALSE(fs::exists(dir / "to.ips.partial"));
}

TEST(DiagnosticLogService, CopyThenUnlinkKeepsTheSourceOnFailure) {
  TempDir dir;
  auto from = dir / "from.ips";
  writeFile(from, "x");
  EXPECT_FALSE(copyThenUnlink(from.string(), (dir / "missing" / "to.ips").string()));
  EXPECT_TRUE(fs::exists(from));
}

TEST(DiagnosticLogService, SubmitAcrossFileSystems) {
  // /dev/shm is a tmpfs on most machines; when it and the temporary folder are on
  // different file systems the rename fails with EXDEV and the copy path runs.
  TempDir dir;
  struct stat a {}, b {};
  if (::stat("/dev/shm", &b) != 0 || ::stat(dir.str().c_str(), &a) != 0 || a.st_dev == b.st_dev ||
      ::access("/dev/shm", W_OK) != 0) {
    GTEST_SKIP() << "no second writable file system";
  }
  std::string pattern = "/dev/shm/telvane-test-XXXXXX";
  ASSERT_NE(mkdtemp(pattern.data()), nullptr);
  auto path = dir / "a.ips";
  writeFile(path, "across");
  auto service = makeDiagnosticLogService(pattern);
  EXPECT_TRUE(service->submitLogFile(path.string(), "224"));
  EXPECT_FALSE(fs::exists(path));
  EXPECT_EQ(readFile(fs::path(pattern) / "a.ips"), "across");
  fs::remove_all(pattern);
}

}  // namespace
}  // namespace telvane
