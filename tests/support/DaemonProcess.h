// DaemonProcess: runs the real telvaned binary for end-to-end tests, on a socket and
// with directories under a test's temporary folder, and reads what it logs.
//
// With `socketActivated` the test plays the service manager: it binds the listening
// socket itself and hands it to the daemon as descriptor 3 with LISTEN_FDS and
// LISTEN_PID, so that the daemon can exit while idle and be started again for the
// next connection (respawnWhenConnectionPending()).
#pragma once

#include <sys/types.h>

#include <chrono>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "platform/UniqueFd.h"

namespace telvane::test {

struct DaemonOptions {
  bool socketActivated = false;
  // TELVANED_IDLE_EXIT_SECONDS; unset leaves the daemon's default.
  std::optional<double> idleExitSeconds;
  // Lines of the entitlement policy file; by default the test's own uid is granted.
  std::optional<std::vector<std::string>> entitlementLines;
  // Further environment variables for the daemon.
  std::map<std::string, std::string> environment;
  // Runs the daemon under this user and group id (as the installed service runs under a
  // dynamic user); the daemon's directory is given to that user. Needs root.
  std::optional<unsigned> runAsUid;
};

class DaemonProcess {
 public:
  // `directory` holds the socket, the settings database, the policy and the logs.
  DaemonProcess(std::string directory, DaemonOptions options = {});
  ~DaemonProcess();
  DaemonProcess(const DaemonProcess&) = delete;
  DaemonProcess& operator=(const DaemonProcess&) = delete;

  // Starts the daemon and waits until it accepts connections. False on failure.
  bool start();
  // SIGTERM and wait; returns the exit status (-1 when it did not end in time).
  int stop(std::chrono::milliseconds timeout = std::chrono::seconds(20));
  // Waits for the daemon to end by itself; the exit status, or nullopt on timeout.
  std::optional<int> waitForExit(std::chrono::milliseconds timeout);
  bool running() const { return pid_ > 0; }
  pid_t pid() const { return pid_; }

  // Socket activation only: waits until a connection is pending on the listening
  // socket and then starts the daemon again. False on timeout.
  bool respawnWhenConnectionPending(std::chrono::milliseconds timeout);

  const std::string& socketPath() const { return socketPath_; }
  const std::string& directory() const { return directory_; }
  // Everything the daemon (all its runs) wrote to standard error.
  std::string log() const;
  // The texts of the log lines (what follows the level tag), in order.
  std::vector<std::string> logTexts() const;
  // Waits until a line with exactly this text (at least `count` of them) appears.
  bool waitForLogLine(const std::string& text, std::chrono::milliseconds timeout = std::chrono::seconds(20),
                      std::size_t count = 1) const;
  // Waits until a line starting with the prefix appears; returns its text.
  std::optional<std::string> waitForLogPrefix(const std::string& prefix,
                                              std::chrono::milliseconds timeout = std::chrono::seconds(20)) const;
  // Waits until a line starting with the prefix and containing the fragment appears.
  bool waitForLogContaining(const std::string& prefix, const std::string& fragment,
                            std::chrono::milliseconds timeout = std::chrono::seconds(20)) const;
  std::size_t countLogLines(const std::string& text) const;
  std::size_t countLogPrefix(const std::string& prefix) const;

  // The environment the daemon runs with (the test process uses the same socket).
  const std::map<std::string, std::string>& environment() const { return environment_; }

 private:
  bool spawn();
  bool waitUntilConnectable(std::chrono::milliseconds timeout);

  std::string directory_;
  DaemonOptions options_;
  std::string socketPath_;
  std::string logPath_;
  std::map<std::string, std::string> environment_;
  UniqueFd listenSocket_;  // socket activation only
  pid_t pid_ = -1;
};

// The path of a binary built by this project (TELVANE_TEST_BINARY_DIR/relative).
std::string builtBinary(const std::string& relative);

}  // namespace telvane::test
