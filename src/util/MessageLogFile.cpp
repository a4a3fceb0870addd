#include "util/MessageLogFile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <ctime>
#include <filesystem>
#include <system_error>
#include <vector>

#include "platform/Paths.h"
#include "telvane/Value.h"

namespace telvane {

namespace {

namespace fs = std::filesystem;

constexpr std::string_view kLogNamePrefix = "telvaned";
constexpr std::string_view kLogNameSuffix = "messageLog.ips";
constexpr double kNanosecondsPerSecond = 1e9;

// The platform's default textual form of a date.
std::string dateDescription(double secondsSince1970) { return Value::date(secondsSince1970).description(); }

std::string pathText(const std::optional<std::string>& path) { return path ? *path : std::string("(null)"); }

bool writeAll(int fd, const std::string& data) {
  std::size_t done = 0;
  while (done < data.size()) {
    ssize_t n = ::write(fd, data.data() + done, data.size() - done);
    if (n < 0) {
      if (errno == EINTR) continue;
      return false;
    }
    done += static_cast<std::size_t>(n);
  }
  return true;
}

}  // namespace

MessageLogFile::MessageLogFile(std::string directory, std::shared_ptr<Clock> clock,
                               std::shared_ptr<DiagnosticLogService> service)
    : directory_(expandTilde(std::move(directory))), clock_(std::move(clock)), service_(std::move(service)) {}

MessageLogFile& MessageLogFile::shared() {
  static MessageLogFile* log =  // lives for the process
      new MessageLogFile(messageLogDir(), Clock::system(), DiagnosticLogService::system());
  return *log;
}

std::recursive_mutex& MessageLogFile::processLock() {
  static std::recursive_mutex* lock = new std::recursive_mutex();
  return *lock;
}

std::optional<std::string> MessageLogFile::currentPath() const {
  std::lock_guard<std::recursive_mutex> lock(processLock());
  return logFilePath_;
}

bool MessageLogFile::countsAsMessageLog(std::string_view fileName) {
  auto first = fileName.find('_');
  if (first == std::string_view::npos) return false;
  auto second = fileName.find('_', first + 1);
  if (second == std::string_view::npos) return false;
  if (fileName.find('_', second + 1) != std::string_view::npos) return false;
  return fileName.substr(0, first) == kLogNamePrefix && fileName.substr(second + 1) == kLogNameSuffix;
}

std::string MessageLogFile::logFileName(double secondsSince1970) {
  std::time_t seconds = static_cast<std::time_t>(std::floor(secondsSince1970));
  std::tm local{};
  localtime_r(&seconds, &local);
  char stamp[32];
  std::strftime(stamp, sizeof stamp, "%Y-%m-%d-%H-%M-%S", &local);
  return std::string(kLogNamePrefix) + "_" + stamp + "_" + std::string(kLogNameSuffix);
}

std::optional<double> MessageLogFile::creationDateLocked(const std::string& path) const {
  if (auto it = createdHere_.find(path); it != createdHere_.end()) return it->second;
  struct statx info {};
  if (statx(AT_FDCWD, path.c_str(), 0, STATX_BTIME | STATX_MTIME, &info) != 0) return std::nullopt;
  double modified = static_cast<double>(info.stx_mtime.tv_sec) + info.stx_mtime.tv_nsec / kNanosecondsPerSecond;
  if (!(info.stx_mask & STATX_BTIME)) return modified;
  double born = static_cast<double>(info.stx_btime.tv_sec) + info.stx_btime.tv_nsec / kNanosecondsPerSecond;
  return std::min(born, modified);
}

void MessageLogFile::writeToLogFile(const std::string& message) {
  std::lock_guard<std::recursive_mutex> lock(processLock());
  const double now = clock_->now();
  const bool haveYoungFile =
      logFilePath_ && logFileCreationDate_ && !(now - *logFileCreationDate_ > kMaxLogFileAgeSeconds);
  if (!haveYoungFile) {
    // An expired current file is forgotten here: the scan meets it on disk and hands
    // it over like any other old file.
    logFilePath_.reset();
    logFileCreationDate_.reset();
    scanDirectoryLocked(now);
    if (!logFilePath_) createNewLogFile(&logFilePath_, &logFileCreationDate_);
    if (!logFilePath_) return;
  }

  // Built by appending: GCC 12 warns falsely (-Wrestrict) on the chained operator+.
  std::string line;
  line.reserve(message.size() + 40);
  line.append("(").append(dateDescription(now)).append(") ").append(message).append("\n");
  int fd = ::open(logFilePath_->c_str(), O_WRONLY | O_APPEND | O_CLOEXEC);
  if (fd < 0) {
    // The file went away under us: start a new one. This message is lost; the next
    // call writes into the new file.
    createNewLogFile(&logFilePath_, &logFileCreationDate_);
  } else {
    if (!writeAll(fd, line)) log::debug("writeToLogFile: Write to %s failed", *logFilePath_);
    ::close(fd);
  }
  // Logged whether or not the line reached the file.
  log::info("writeToLogFile: Saved log message to %s", pathText(logFilePath_));
}

void MessageLogFile::scanDirectoryLocked(double now) {
  std::error_code ec;
  fs::directory_iterator it(directory_, ec);
  if (ec) {
    if (ec == std::errc::no_such_file_or_directory) {
      log::info("writeToLogFile: Creating telvaned log directory at %s", directory_);
      std::error_code createError;
      fs::create_directories(directory_, createError);
    } else {
      log::error("writeToLogFile: Error reading from log directory: %s", ec.message());
    }
    return;
  }
  std::vector<std::string> names;
  for (; it != fs::directory_iterator(); it.increment(ec)) {
    std::string name = it->path().filename().string();
    if (countsAsMessageLog(name)) names.push_back(std::move(name));
  }
  if (ec) log::error("writeToLogFile: Error reading from log directory: %s", ec.message());
  std::sort(names.begin(), names.end());  // a stable order; the outcome does not depend on it

  for (const auto& name : names) {
    const std::string path = (fs::path(directory_) / name).string();
    auto created = creationDateLocked(path);
    if (!created) continue;  // gone since the listing
    if (now - *created > kMaxLogFileAgeSeconds) {
      deleteExpiredLogFile(path, *created);
    } else if (!logFilePath_) {
      logFilePath_ = path;
      logFileCreationDate_ = *created;
    } else if (*created > *logFileCreationDate_) {
      deleteExpiredLogFile(*logFilePath_, *logFileCreationDate_);
      logFilePath_ = path;
      logFileCreationDate_ = *created;
    } else {
      deleteExpiredLogFile(path, *created);
    }
  }
}

void MessageLogFile::createNewLogFile(std::optional<std::string>* logFilePath,
                                      std::optional<double>* logFileCreationDate) {
  if (!logFilePath || !logFileCreationDate) {
    log::error("createNewLogFile: both logFilePath and logFileCreationDate must not be nil");
    return;
  }
  std::lock_guard<std::recursive_mutex> lock(processLock());
  logFilePath->reset();
  logFileCreationDate->reset();

  const double now = clock_->now();
  const std::string path = (fs::path(directory_) / logFileName(now)).string();
  int fd = service_->createLogFile(path, kLogType);
  if (fd >= 0) ::close(fd);

  struct stat info {};
  if (::stat(path.c_str(), &info) != 0) {
    log::error("writeToLogFile: Failed to create new telvaned log file %s", path);
    return;
  }
  *logFilePath = path;
  *logFileCreationDate = now;
  createdHere_[path] = now;
  log::info("writeToLogFile: Created new telvaned log file %s (%s)", path, dateDescription(now));
}

void MessageLogFile::deleteExpiredLogFile(const std::string& path, double creationDate) {
  std::lock_guard<std::recursive_mutex> lock(processLock());
  createdHere_.erase(path);
  if (service_->submitLogFile(path, kLogType)) {
    log::info("deleteExpiredLogFile: moveLogForSubmission succesfully submitted log file %s (%s)", path,
              dateDescription(creationDate));
    return;
  }
  std::error_code ec;
  fs::remove(path, ec);
  log::info("deleteExpiredLogFile: Deleted expired telvaned log file %s (%s)", path, dateDescription(creationDate));
}

}  // namespace telvane
