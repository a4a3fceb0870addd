// Logging: one process-wide logger with three levels.
//
// Lines are single lines, formatted printf-style (the texts of the system are printf
// formats). They go to standard error ("2026-01-02 03:04:05.678 [pid:tid] <info> text")
// unless an output is set: the daemon sets the one of LogOutput.h, which writes to the
// journal under systemd. The client library keeps standard error, so that it needs no
// logging library at run time. The level comes from TELVANE_LOG_LEVEL ("debug",
// "info", "error"; default info).
//
// LogCapture collects every line written while it lives, whatever the level, so that
// tests can assert exact texts. All functions here are thread-safe.
#pragma once

#include <fmt/printf.h>

#include <mutex>
#include <string>
#include <string_view>
#include <vector>

namespace telvane::log {

enum class Level { Debug = 0, Info = 1, Error = 2 };

// True when a line of this level reaches the output or a capture.
bool enabled(Level level);
void write(Level level, std::string line);
void setLevel(Level level);
// Where lines that pass the level go; null means standard error.
using Output = void (*)(Level level, const std::string& line);
void setOutput(Output output);
// Sends lines to standard error again (for command-line tools).
void useStandardError();
// The standard-error output.
void writeStandardError(Level level, const std::string& line);

template <typename... Args>
void debug(const char* format, const Args&... args) {
  if (enabled(Level::Debug)) write(Level::Debug, fmt::sprintf(format, args...));
}
template <typename... Args>
void info(const char* format, const Args&... args) {
  if (enabled(Level::Info)) write(Level::Info, fmt::sprintf(format, args...));
}
template <typename... Args>
void error(const char* format, const Args&... args) {
  if (enabled(Level::Error)) write(Level::Error, fmt::sprintf(format, args...));
}

struct CapturedLine {
  Level level;
  std::string text;
};

class LogCapture {
 public:
  LogCapture();
  ~LogCapture();
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;

  std::vector<CapturedLine> lines() const;
  std::vector<std::string> texts() const;
  // True when some line equals the text exactly (at the given level, when one is given).
  bool contains(std::string_view text) const;
  bool contains(Level level, std::string_view text) const;
  // True when some line starts with the prefix.
  bool containsPrefix(std::string_view prefix) const;
  std::size_t count(std::string_view text) const;
  void clear();

  // Called by the logger.
  void append(Level level, const std::string& text);

 private:
  mutable std::mutex mutex_;
  std::vector<CapturedLine> lines_;  // guarded by mutex_
};

}  // namespace telvane::log
