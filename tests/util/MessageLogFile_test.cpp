#include "util/MessageLogFile.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstdlib>
#include <filesystem>
#include <set>
#include <thread>
#include <vector>

#include "support/ManualClock.h"
#include "support/TempDir.h"

namespace telvane {
namespace {

namespace fs = std::filesystem;
using test::ManualClock;
using test::readFile;
using test::TempDir;
using test::writeFile;

constexpr double kStart = 1'700'000'000.0;  // 2023-11-14 22:13:20 UTC
const std::string kStartName = "telvaned_2023-11-14-22-13-20_messageLog.ips";
const std::string kStartDate = "2023-11-14 22:13:20 +0000";

void setModified(const fs::path& path, double seconds) {
  timespec times[2];
  times[0].tv_sec = times[1].tv_sec = static_cast<time_t>(seconds);
  times[0].tv_nsec = times[1].tv_nsec = 0;
  ASSERT_EQ(utimensat(AT_FDCWD, path.c_str(), times, 0), 0) << path;
}

std::set<std::string> namesIn(const fs::path& dir) {
  std::set<std::string> out;
  std::error_code ec;
  for (const auto& e : fs::directory_iterator(dir, ec)) out.insert(e.path().filename().string());
  return out;
}

// The lines at the default and error levels (what a deployment sees).
std::vector<std::string> shown(const log::LogCapture& capture) {
  std::vector<std::string> out;
  for (const auto& line : capture.lines()) {
    if (line.level != log::Level::Debug) out.push_back(line.text);
  }
  return out;
}

class MessageLogFileTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (const char* tz = std::getenv("TZ")) savedTz_ = tz;
    setenv("TZ", "UTC0", 1);
    tzset();
    logDir_ = dir_ / "Retired";
    queueDir_ = dir_ / "queue";
    fs::create_directories(logDir_);
    clock_ = std::make_shared<ManualClock>(kStart);
  }
  void TearDown() override {
    if (savedTz_) setenv("TZ", savedTz_->c_str(), 1); else unsetenv("TZ");
    tzset();
  }

  // A log that submits into queueDir_ (or refuses submissions).
  std::unique_ptr<MessageLogFile> makeLog(bool submissionWorks = true) {
    auto service = makeDiagnosticLogService(submissionWorks ? std::optional<std::string>(queueDir_.string())
                                                            : std::nullopt);
    return std::make_unique<MessageLogFile>(logDir_.string(), clock_, service);
  }
  std::string logPath(const std::string& name) const { return (logDir_ / name).string(); }

  TempDir dir_;
  fs::path logDir_;
  fs::path queueDir_;
  std::shared_ptr<ManualClock> clock_;
  std::optional<std::string> savedTz_;
};

TEST_F(MessageLogFileTest, FirstCallWithEmptyFolderCreatesAFileAndWritesOneLine) {
  auto log = makeLog();
  log::LogCapture capture;
  log->writeToLogFile("[Conferal -> flushMessages] 3 messages");
  EXPECT_EQ(namesIn(logDir_), std::set<std::string>{kStartName});
  EXPECT_EQ(readFile(logDir_ / kStartName), "(" + kStartDate + ") [Conferal -> flushMessages] 3 messages\n");
  std::vector<std::string> expected = {
      "writeToLogFile: Created new telvaned log file " + logPath(kStartName) + " (" + kStartDate + ")",
      "writeToLogFile: Saved log message to " + logPath(kStartName)};
  EXPECT_EQ(shown(capture), expected);
  EXPECT_EQ(log->currentPath(), logPath(kStartName));
}

TEST_F(MessageLogFileTest, LaterCallsAppendToTheCurrentFile) {
  auto log = makeLog();
  log->writeToLogFile("one");
  clock_->advance(61.5);
  log::LogCapture capture;
  log->writeToLogFile("two");
  EXPECT_EQ(readFile(logDir_ / kStartName),
            "(" + kStartDate + ") one\n(2023-11-14 22:14:21 +0000) two\n");
  EXPECT_EQ(shown(capture), std::vector<std::string>{"writeToLogFile: Saved log message to " + logPath(kStartName)});
}

TEST_F(MessageLogFileTest, FileNameUsesLocalTime) {
  setenv("TZ", "EST5", 1);
  tzset();
  EXPECT_EQ(MessageLogFile::logFileName(kStart), "telvaned_2023-11-14-17-13-20_messageLog.ips");
  auto log = makeLog();
  log->writeToLogFile("x");
  EXPECT_EQ(namesIn(logDir_), std::set<std::string>{"telvaned_2023-11-14-17-13-20_messageLog.ips"});
  // The line's date is the default textual form, in UTC.
  EXPECT_EQ(readFile(logDir_ / "telvaned_2023-11-14-17-13-20_messageLog.ips"), "(" + kStartDate + ") x\n");
}

TEST_F(MessageLogFileTest, AFileOfExactlyOneDayIsStillUsed) {
  auto log = makeLog();
  log->writeToLogFile("a");
  // An expired file that appears later: only a scan would hand it over.
  const std::string stray = "telvaned_stray_messageLog.ips";
  writeFile(logDir_ / stray, "");
  setModified(logDir_ / stray, kStart - 100000);
  clock_->advance(86400);
  log->writeToLogFile("b");
  EXPECT_EQ(namesIn(logDir_), (std::set<std::string>{kStartName, stray}));
  EXPECT_EQ(readFile(logDir_ / kStartName), "(" + kStartDate + ") a\n(2023-11-15 22:13:20 +0000) b\n");
  EXPECT_FALSE(fs::exists(queueDir_));
  // One second later the file is old: the scan hands over both.
  clock_->advance(1);
  log->writeToLogFile("c");
  EXPECT_TRUE(fs::exists(queueDir_ / stray));
  EXPECT_TRUE(fs::exists(queueDir_ / kStartName));
}

TEST_F(MessageLogFileTest, ACallAfterMoreThanADaySubmitsTheOldFileAndStartsANewOne) {
  auto log = makeLog();
  log->writeToLogFile("old message");
  clock_->advance(86401);
  log::LogCapture capture;
  log->writeToLogFile("new message");
  const std::string newName = "telvaned_2023-11-15-22-13-21_messageLog.ips";
  EXPECT_EQ(namesIn(logDir_), std::set<std::string>{newName});
  EXPECT_EQ(readFile(queueDir_ / kStartName), "(" + kStartDate + ") old message\n");
  EXPECT_EQ(readFile(logDir_ / newName), "(2023-11-15 22:13:21 +0000) new message\n");
  std::vector<std::string> expected = {
      "deleteExpiredLogFile: moveLogForSubmission succesfully submitted log file " + logPath(kStartName) + " (" +
          kStartDate + ")",
      "writeToLogFile: Created new telvaned log file " + logPath(newName) + " (2023-11-15 22:13:21 +0000)",
      "writeToLogFile: Saved log message to " + logPath(newName)};
  EXPECT_EQ(shown(capture), expected);
}

TEST_F(MessageLogFileTest, TwoYoungFilesAtStartKeepTheNewerAndSubmitTheOlder) {
  // Names sort the other way round from their ages, so the choice is by date.
  const std::string newer = "telvaned_2023-11-14-21-00-00_messageLog.ips";
  const std::string older = "telvaned_2023-11-14-22-00-00_messageLog.ips";
  writeFile(logDir_ / newer, "newer\n");
  writeFile(logDir_ / older, "older\n");
  setModified(logDir_ / newer, kStart - 600);
  setModified(logDir_ / older, kStart - 7200);
  auto log = makeLog();
  log::LogCapture capture;
  log->writeToLogFile("m");
  EXPECT_EQ(namesIn(logDir_), std::set<std::string>{newer});
  EXPECT_EQ(readFile(logDir_ / newer), "newer\n(" + kStartDate + ") m\n");
  EXPECT_EQ(readFile(queueDir_ / older), "older\n");
  EXPECT_TRUE(capture.contains("deleteExpiredLogFile: moveLogForSubmission succesfully submitted log file " +
                               logPath(older) + " (2023-11-14 20:13:20 +0000)"));
  EXPECT_FALSE(capture.containsPrefix("writeToLogFile: Created new telvaned log file"));
}

TEST_F(MessageLogFileTest, TwoYoungFilesInNameOrderKeepTheNewer) {
  const std::string older = "telvaned_2023-11-14-21-00-00_messageLog.ips";
  const std::string newer = "telvaned_2023-11-14-22-00-00_messageLog.ips";
  writeFile(logDir_ / older, "");
  writeFile(logDir_ / newer, "");
  setModified(logDir_ / older, kStart - 7200);
  setModified(logDir_ / newer, kStart - 600);
  auto log = makeLog();
  log::LogCapture capture;
  log->writeToLogFile("m");
  EXPECT_EQ(namesIn(logDir_), std::set<std::string>{newer});
  EXPECT_EQ(readFile(logDir_ / newer), "(" + kStartDate + ") m\n");
  EXPECT_TRUE(fs::exists(queueDir_ / older));
  EXPECT_TRUE(capture.contains("deleteExpiredLogFile: moveLogForSubmission succesfully submitted log file " +
                               logPath(older) + " (2023-11-14 20:13:20 +0000)"));
}

TEST_F(MessageLogFileTest, ExpiredFileAtStartIsSubmitted) {
  const std::string name = "telvaned_2023-11-13-00-00-00_messageLog.ips";
  writeFile(logDir_ / name, "stale\n");
  setModified(logDir_ / name, kStart - 86401);
  auto log = makeLog();
  log->writeToLogFile("fresh");
  EXPECT_EQ(namesIn(logDir_), std::set<std::string>{kStartName});
  EXPECT_EQ(readFile(queueDir_ / name), "stale\n");
}

TEST_F(MessageLogFileTest, SubmissionFailureDeletesTheFile) {
  const std::string name = "telvaned_2023-11-13-00-00-00_messageLog.ips";
  writeFile(logDir_ / name, "stale\n");
  setModified(logDir_ / name, kStart - 90000);
  auto log = makeLog(false);
  log::LogCapture capture;
  log->writeToLogFile("fresh");
  EXPECT_EQ(namesIn(logDir_), std::set<std::string>{kStartName});
  EXPECT_FALSE(fs::exists(queueDir_));
  EXPECT_TRUE(capture.contains(log::Level::Info, "deleteExpiredLogFile: Deleted expired telvaned log file " +
                                                     logPath(name) + " (2023-11-13 21:13:20 +0000)"));
}

TEST_F(MessageLogFileTest, NamesOfOtherShapesAreIgnored) {
  std::vector<std::string> others = {"telvaned_x_y_messageLog.ips", "other_x_messageLog.ips",
                                     "telvaned_x_messageLog.txt", "telvaned_messageLog.ips", "notes.txt"};
  for (const auto& name : others) {
    writeFile(logDir_ / name, "keep\n");
    setModified(logDir_ / name, kStart - 200000);
  }
  auto log = makeLog();
  log->writeToLogFile("m");
  for (const auto& name : others) EXPECT_EQ(readFile(logDir_ / name), "keep\n") << name;
  EXPECT_EQ(log->currentPath(), logPath(kStartName));
  EXPECT_FALSE(fs::exists(queueDir_));
}

TEST_F(MessageLogFileTest, MissingFolderIsCreated) {
  logDir_ = dir_ / "a" / "b" / "Retired";
  auto log = makeLog();
  log::LogCapture capture;
  log->writeToLogFile("m");
  std::vector<std::string> expected = {
      "writeToLogFile: Creating telvaned log directory at " + logDir_.string(),
      "writeToLogFile: Created new telvaned log file " + logPath(kStartName) + " (" + kStartDate + ")",
      "writeToLogFile: Saved log message to " + logPath(kStartName)};
  EXPECT_EQ(shown(capture), expected);
  EXPECT_EQ(readFile(logDir_ / kStartName), "(" + kStartDate + ") m\n");
}

TEST_F(MessageLogFileTest, UnreadableFolderLeavesTheMessageUnwritten) {
  writeFile(dir_ / "plain-file", "");
  logDir_ = dir_ / "plain-file";
  auto log = makeLog();
  log::LogCapture capture;
  log->writeToLogFile("m");
  std::vector<std::string> expected = {"writeToLogFile: Error reading from log directory: Not a directory",
                                       "writeToLogFile: Failed to create new telvaned log file " +
                                           logPath(kStartName)};
  EXPECT_EQ(shown(capture), expected);
  EXPECT_TRUE(capture.contains(log::Level::Error, expected[0]));
  EXPECT_TRUE(capture.contains(log::Level::Error, expected[1]));
  EXPECT_FALSE(log->currentPath().has_value());
}

TEST_F(MessageLogFileTest, FileDeletedUnderUsLosesTheMessageAndTheNextCallWritesTheNewFile) {
  auto log = makeLog();
  log->writeToLogFile("first");
  fs::remove(logDir_ / kStartName);
  clock_->advance(5);
  const std::string newName = "telvaned_2023-11-14-22-13-25_messageLog.ips";
  log::LogCapture capture;
  log->writeToLogFile("lost");
  std::vector<std::string> expected = {
      "writeToLogFile: Created new telvaned log file " + logPath(newName) + " (2023-11-14 22:13:25 +0000)",
      "writeToLogFile: Saved log message to " + logPath(newName)};
  EXPECT_EQ(shown(capture), expected);
  EXPECT_EQ(readFile(logDir_ / newName), "");
  clock_->advance(1);
  log->writeToLogFile("kept");
  EXPECT_EQ(readFile(logDir_ / newName), "(2023-11-14 22:13:26 +0000) kept\n");
  EXPECT_EQ(namesIn(logDir_), std::set<std::string>{newName});
}

TEST_F(MessageLogFileTest, CreateNewLogFileNeedsBothArguments) {
  auto log = makeLog();
  log::LogCapture capture;
  std::optional<std::string> path;
  log->createNewLogFile(&path, nullptr);
  log->createNewLogFile(nullptr, nullptr);
  EXPECT_EQ(capture.count("createNewLogFile: both logFilePath and logFileCreationDate must not be nil"), 2u);
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "createNewLogFile: both logFilePath and logFileCreationDate must not be nil"));
  EXPECT_FALSE(path.has_value());
  EXPECT_TRUE(namesIn(logDir_).empty());
}

TEST_F(MessageLogFileTest, CreateNewLogFileReplacesThePreviousValues) {
  auto log = makeLog();
  std::optional<std::string> path = "previous";
  std::optional<double> created = 1.0;
  log->createNewLogFile(&path, &created);
  EXPECT_EQ(path, logPath(kStartName));
  EXPECT_EQ(created, kStart);
  EXPECT_TRUE(fs::exists(logDir_ / kStartName));
}

TEST_F(MessageLogFileTest, CountsAsMessageLog) {
  EXPECT_TRUE(MessageLogFile::countsAsMessageLog(kStartName));
  EXPECT_TRUE(MessageLogFile::countsAsMessageLog("telvaned_anything_messageLog.ips"));
  EXPECT_TRUE(MessageLogFile::countsAsMessageLog("telvaned__messageLog.ips"));
  EXPECT_FALSE(MessageLogFile::countsAsMessageLog("telvaned_x_y_messageLog.ips"));
  EXPECT_FALSE(MessageLogFile::countsAsMessageLog("telvaned_x_messageLog.ips.bak"));
  EXPECT_FALSE(MessageLogFile::countsAsMessageLog("Telvaned_x_messageLog.ips"));
  EXPECT_FALSE(MessageLogFile::countsAsMessageLog("telvaned_messageLog.ips"));
}

TEST_F(MessageLogFileTest, ConcurrentWritersEachGetOneWholeLine) {
  auto log = makeLog();
  constexpr int kThreads = 4;
  constexpr int kLinesEach = 50;
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < kLinesEach; ++i) log->writeToLogFile("thread " + std::to_string(t) + " line " + std::to_string(i));
    });
  }
  for (auto& th : threads) th.join();
  EXPECT_EQ(namesIn(logDir_), std::set<std::string>{kStartName});
  std::string content = readFile(logDir_ / kStartName);
  std::set<std::string> lines;
  std::size_t start = 0;
  while (start < content.size()) {
    auto end = content.find('\n', start);
    ASSERT_NE(end, std::string::npos);
    lines.insert(content.substr(start, end - start));
    start = end + 1;
  }
  EXPECT_EQ(lines.size(), static_cast<std::size_t>(kThreads * kLinesEach));
  EXPECT_TRUE(lines.count("(" + kStartDate + ") thread 3 line 49"));
}

TEST_F(MessageLogFileTest, PlainFunctionFormatsIntoTheSharedLog) {
  // The shared log reads its folder once, at first use; nothing else in this test
  // program touches it.
  setenv("TELVANED_MESSAGE_LOG_DIR", logDir_.c_str(), 1);
  writeToLogFile("[%s -> flushMessages] %s", "Music", "flushed 2");
  unsetenv("TELVANED_MESSAGE_LOG_DIR");
  EXPECT_EQ(MessageLogFile::shared().directory(), logDir_.string());
  auto names = namesIn(logDir_);
  ASSERT_EQ(names.size(), 1u);
  std::string content = readFile(logDir_ / *names.begin());
  EXPECT_EQ(content.front(), '(');
  EXPECT_NE(content.find(" +0000) [Music -> flushMessages] flushed 2\n"), std::string::npos) << content;
}

}  // namespace
}  // namespace telvane
