// MessageLogFile: the daemon's daily log of flushed messages, kept in the folder of
// retired diagnostic logs so that the diagnostic-log service can pick the files up.
//
// A file serves for one day (86400 s from its creation). When the current file is
// older, or none is known, the folder is scanned: the newest young file
// "telvaned_<local time>_messageLog.ips" becomes current, every other one is handed to
// the diagnostic-log service (and deleted when the service refuses it). When none is
// left a new file is created. Each message becomes one line
// "(<date>) <message>\n", the date in its default textual form
// ("2026-11-16 05:27:49 +0000").
//
// File ages: Linux has no portable creation time. A file this object created has the
// clock's time at its creation. For any other file the creation time is the earlier
// of its birth time (statx, when the file system keeps one) and its modification time,
// so a file whose birth time is unknown ages from its last write.
//
// Threading: every call takes one process-wide lock (shared by all instances) and holds
// it for its whole duration, scan and write included.
#pragma once

#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Clock.h"
#include "platform/DiagnosticLogService.h"
#include "platform/Log.h"

namespace telvane {

class MessageLogFile {
 public:
  static constexpr double kMaxLogFileAgeSeconds = 86400;
  // The diagnostic log type under which the files are created and submitted.
  static constexpr const char* kLogType = "224";

  MessageLogFile(std::string directory, std::shared_ptr<Clock> clock, std::shared_ptr<DiagnosticLogService> service);

  // The process's log over messageLogDir(), the system clock and the system's
  // diagnostic-log service.
  static MessageLogFile& shared();

  // Appends one line with the message to the current file (see above).
  void writeToLogFile(const std::string& message);

  // Creates a new file named after the clock's local time and sets path and creation
  // time; clears both when the file cannot be created. Either pointer null: an error
  // line and nothing else.
  void createNewLogFile(std::optional<std::string>* logFilePath, std::optional<double>* logFileCreationDate);
  // Hands the file to the diagnostic-log service; deletes it when that fails.
  void deleteExpiredLogFile(const std::string& path, double creationDate);

  // True for names of three "_"-separated parts: "telvaned", anything, "messageLog.ips".
  static bool countsAsMessageLog(std::string_view fileName);
  // "telvaned_<yyyy-MM-dd-HH-mm-ss in local time>_messageLog.ips".
  static std::string logFileName(double secondsSince1970);

  const std::string& directory() const { return directory_; }
  std::optional<std::string> currentPath() const;

 private:
  static std::recursive_mutex& processLock();
  void scanDirectoryLocked(double now);
  std::optional<double> creationDateLocked(const std::string& path) const;

  // Constant after construction.
  const std::string directory_;
  const std::shared_ptr<Clock> clock_;
  const std::shared_ptr<DiagnosticLogService> service_;

  // Guarded by processLock().
  std::optional<std::string> logFilePath_;
  std::optional<double> logFileCreationDate_;
  std::map<std::string, double> createdHere_;  // files this object made → creation time
};

// Formats the message printf-style and appends it to the process's message log.
template <typename... Args>
void writeToLogFile(const char* format, const Args&... args) {
  MessageLogFile::shared().writeToLogFile(fmt::sprintf(format, args...));
}

}  // namespace telvane
