// BenchDaemon: one run of the real telvaned for the load benchmarks, on a socket and
// with settings, cache, log and storage directories under a scratch folder, with an
// entitlement for the benchmark's own uid. Without extra settings it has no storebag
// server (so its sessions have no backends); a benchmark that wants backends adds the
// environment of its storebag server and writes the settings database before start().
// It reads the daemon's CPU time and memory from /proc.
//
// Threading: used by the benchmark's main thread only.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <map>
#include <optional>
#include <string>
#include <vector>

namespace telvane::bench {

class BenchDaemon {
 public:
  // `binary` is the telvaned executable; `logLevel` goes to TELVANE_LOG_LEVEL;
  // `wrapper` (may be empty) is a command line put in front of the binary, such as
  // "valgrind --tool=callgrind"; it must run the daemon in its own process (exec).
  BenchDaemon(std::string binary, std::string directory, std::string logLevel, std::vector<std::string> wrapper);
  ~BenchDaemon();
  BenchDaemon(const BenchDaemon&) = delete;
  BenchDaemon& operator=(const BenchDaemon&) = delete;

  // An extra environment variable for the daemon, set before start(); it wins over the
  // defaults above (an empty value is passed as empty, not removed).
  void setEnvironment(const std::string& key, const std::string& value);

  // Starts the daemon and waits until its socket accepts connections.
  bool start(std::chrono::milliseconds timeout);
  // SIGTERM and wait; the exit status, or -1 when it had to be killed.
  int stop(std::chrono::milliseconds timeout);

  pid_t pid() const { return pid_; }
  const std::string& socketPath() const { return socketPath_; }
  const std::string& logPath() const { return logPath_; }
  // The settings database the daemon is given (TELVANE_DEFAULTS_DB); it may be
  // written before start().
  std::string defaultsPath() const { return directory_ + "/defaults.sqlite3"; }

  // User plus system CPU time of all the daemon's threads, in seconds (clock-tick
  // resolution), or nullopt when /proc cannot be read.
  std::optional<double> cpuSeconds() const;
  // VmHWM (peak resident set) in KiB.
  std::optional<long> peakResidentKiB() const;
  // VmRSS (resident set now) in KiB.
  std::optional<long> residentKiB() const;
  // Lines of the daemon's log that contain the text.
  std::size_t countLogLinesContaining(const std::string& text) const;

 private:
  bool connectable() const;

  std::string binary_;
  std::string directory_;
  std::string logLevel_;
  std::vector<std::string> wrapper_;
  std::map<std::string, std::string> extraEnvironment_;
  std::string socketPath_;
  std::string logPath_;
  pid_t pid_ = -1;
};

// What a load benchmark does before its runs: finds this program (the clients are
// this program run again) and the daemon, makes the scratch folder
// "/tmp/<scratchPrefix>-XXXXXX", makes the clients log only errors to standard error
// (their logging would compete with the daemon for the CPU) and ignores SIGPIPE.
// Nothing, after a message on standard error, when something is missing.
struct BenchPrelude {
  std::string self;     // this program's path
  std::string scratch;  // the new scratch folder
};
std::optional<BenchPrelude> prepareBenchRun(const std::string& daemonPath, const std::string& scratchPrefix);

}  // namespace telvane::bench
