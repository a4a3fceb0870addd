#include "support/DaemonProcess.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <thread>

extern char** environ;

namespace telvane::test {

namespace {

using Clock = std::chrono::steady_clock;

// What follows "<level> " on a log line of the standard-error format.
std::optional<std::string> lineText(const std::string& line) {
  auto open = line.find("] <");
  if (open == std::string::npos) return std::nullopt;
  auto close = line.find("> ", open);
  if (close == std::string::npos) return std::nullopt;
  return line.substr(close + 2);
}

template <typename Predicate>
bool pollUntil(std::chrono::milliseconds timeout, Predicate predicate) {
  auto deadline = Clock::now() + timeout;
  while (true) {
    if (predicate()) return true;
    if (Clock::now() >= deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
}

}  // namespace

std::string builtBinary(const std::string& relative) {
  const char* dir = std::getenv("TELVANE_TEST_BINARY_DIR");
  return std::string(dir ? dir : ".") + "/" + relative;
}

DaemonProcess::DaemonProcess(std::string directory, DaemonOptions options)
    : directory_(std::move(directory)), options_(std::move(options)) {
  namespace fs = std::filesystem;
  socketPath_ = directory_ + "/telvaned.sock";
  logPath_ = directory_ + "/telvaned.log";
  fs::create_directories(directory_ + "/entitlements.d");
  std::ofstream policy(directory_ + "/entitlements.d/test.conf");
  if (options_.entitlementLines) {
    for (const auto& line : *options_.entitlementLines) policy << line << "\n";
  } else {
    policy << "com.zembra.private.telvaned uid:" << ::getuid() << "\n";
  }
  environment_ = {
      {"TELVANED_SOCKET", socketPath_},
      {"TELVANED_ENTITLEMENTS_DIR", directory_ + "/entitlements.d"},
      {"TELVANE_DEFAULTS_DB", directory_ + "/defaults.sqlite3"},
      {"TELVANED_CACHE_DIR", directory_ + "/cache"},
      {"TELVANED_MESSAGE_LOG_DIR", directory_ + "/messagelogs"},
      {"TELVANED_STORAGE_DIR", directory_ + "/storage"},
      {"TELVANED_DEVICE_INFO", directory_ + "/device-info.conf"},
      {"TELVANE_LOG_LEVEL", "debug"},
  };
  if (options_.idleExitSeconds) {
    std::ostringstream s;
    s << *options_.idleExitSeconds;
    environment_["TELVANED_IDLE_EXIT_SECONDS"] = s.str();
  }
  for (const auto& [k, v] : options_.environment) environment_[k] = v;
}

DaemonProcess::~DaemonProcess() {
  if (pid_ > 0) {
    ::kill(pid_, SIGKILL);
    ::waitpid(pid_, nullptr, 0);
  }
}

bool DaemonProcess::spawn() {
  // The child's environment: ours, minus anything of a service manager, plus the
  // daemon's settings.
  std::vector<std::string> env;
  for (char** e = environ; *e; ++e) {
    std::string entry(*e);
    std::string key = entry.substr(0, entry.find('='));
    if (key == "LISTEN_FDS" || key == "LISTEN_PID" || key == "LISTEN_FDNAMES" || key == "NOTIFY_SOCKET" ||
        key == "JOURNAL_STREAM" || environment_.count(key)) {
      continue;
    }
    env.push_back(entry);
  }
  for (const auto& [k, v] : environment_) env.push_back(k + "=" + v);
  if (options_.socketActivated) env.push_back("LISTEN_FDS=1");
  std::vector<char*> envp;
  for (auto& e : env) envp.push_back(e.data());
  envp.push_back(nullptr);

  std::string binary = builtBinary("telvaned");
  // LISTEN_PID must be the daemon's own pid: a shell sets it to its $$ and then
  // replaces itself with the daemon, which keeps the pid.
  std::string script = options_.socketActivated ? "LISTEN_PID=$$ exec \"$0\"" : "exec \"$0\"";
  if (options_.runAsUid) {
    const std::string id = std::to_string(*options_.runAsUid);
    script = "exec setpriv --reuid=" + id + " --regid=" + id + " --clear-groups \"$0\"";
  }
  std::vector<std::string> args = {"/bin/sh", "-c", script, binary};
  std::vector<char*> argv;
  for (auto& a : args) argv.push_back(a.data());
  argv.push_back(nullptr);

  int logFd = ::open(logPath_.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
  if (logFd < 0) return false;
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_adddup2(&actions, logFd, STDERR_FILENO);
  posix_spawn_file_actions_adddup2(&actions, logFd, STDOUT_FILENO);
  if (options_.socketActivated) posix_spawn_file_actions_adddup2(&actions, listenSocket_.get(), 3);
  int rc = ::posix_spawn(&pid_, "/bin/sh", &actions, nullptr, argv.data(), envp.data());
  posix_spawn_file_actions_destroy(&actions);
  ::close(logFd);
  if (rc != 0) {
    pid_ = -1;
    return false;
  }
  return true;
}

bool DaemonProcess::start() {
  if (options_.socketActivated && !listenSocket_) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, socketPath_.c_str(), sizeof address.sun_path - 1);
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    // Descriptor 3 is where the daemon expects it; keep ours elsewhere so that the
    // duplication in the child clears close-on-exec.
    if (fd == 3) {
      int other = ::fcntl(fd, F_DUPFD_CLOEXEC, 10);
      ::close(fd);
      fd = other;
    }
    listenSocket_.reset(fd);
    ::unlink(socketPath_.c_str());
    if (::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) < 0 || ::listen(fd, 64) < 0) return false;
  }
  if (options_.runAsUid) {
    namespace fs = std::filesystem;
    const uid_t id = *options_.runAsUid;
    if (::chown(directory_.c_str(), id, id) != 0) return false;
    for (const auto& entry : fs::recursive_directory_iterator(directory_)) {
      if (::lchown(entry.path().c_str(), id, id) != 0) return false;
    }
  }
  if (!spawn()) return false;
  if (options_.socketActivated) {
    return waitForLogLine("main: Listener resumes with sandbox, start loop.", std::chrono::seconds(20),
                          countLogLines("main: Listener resumes with sandbox, start loop.") + 1);
  }
  return waitUntilConnectable(std::chrono::seconds(20));
}

bool DaemonProcess::waitUntilConnectable(std::chrono::milliseconds timeout) {
  return pollUntil(timeout, [&] {
    if (pid_ > 0) {
      int status = 0;
      if (::waitpid(pid_, &status, WNOHANG) == pid_) {
        pid_ = -1;
        return true;  // ended early; the caller's next steps will fail visibly
      }
    }
    return countLogLines("main: Listener resumes with sandbox, start loop.") > 0;
  }) && pid_ > 0;
}

int DaemonProcess::stop(std::chrono::milliseconds timeout) {
  if (pid_ <= 0) return -1;
  ::kill(pid_, SIGTERM);
  auto status = waitForExit(timeout);
  if (!status) {
    ::kill(pid_, SIGKILL);
    ::waitpid(pid_, nullptr, 0);
    pid_ = -1;
    return -1;
  }
  return *status;
}

std::optional<int> DaemonProcess::waitForExit(std::chrono::milliseconds timeout) {
  if (pid_ <= 0) return std::nullopt;
  int status = 0;
  bool ended = pollUntil(timeout, [&] { return ::waitpid(pid_, &status, WNOHANG) == pid_; });
  if (!ended) return std::nullopt;
  pid_ = -1;
  if (WIFEXITED(status)) return WEXITSTATUS(status);
  return 128 + WTERMSIG(status);
}

bool DaemonProcess::respawnWhenConnectionPending(std::chrono::milliseconds timeout) {
  if (!listenSocket_) return false;
  pollfd p{listenSocket_.get(), POLLIN, 0};
  if (::poll(&p, 1, static_cast<int>(timeout.count())) <= 0) return false;
  return start();
}

std::string DaemonProcess::log() const {
  std::ifstream in(logPath_);
  std::stringstream s;
  s << in.rdbuf();
  return s.str();
}

std::vector<std::string> DaemonProcess::logTexts() const {
  std::vector<std::string> texts;
  std::istringstream lines(log());
  std::string line;
  while (std::getline(lines, line)) {
    if (auto text = lineText(line)) texts.push_back(*text);
  }
  return texts;
}

std::size_t DaemonProcess::countLogLines(const std::string& text) const {
  std::size_t n = 0;
  for (const auto& t : logTexts()) n += t == text;
  return n;
}

std::size_t DaemonProcess::countLogPrefix(const std::string& prefix) const {
  std::size_t n = 0;
  for (const auto& t : logTexts()) n += t.compare(0, prefix.size(), prefix) == 0;
  return n;
}

bool DaemonProcess::waitForLogLine(const std::string& text, std::chrono::milliseconds timeout,
                                   std::size_t count) const {
  return pollUntil(timeout, [&] { return countLogLines(text) >= count; });
}

bool DaemonProcess::waitForLogContaining(const std::string& prefix, const std::string& fragment,
                                         std::chrono::milliseconds timeout) const {
  return pollUntil(timeout, [&] {
    for (const auto& t : logTexts()) {
      if (t.compare(0, prefix.size(), prefix) == 0 && t.find(fragment, prefix.size()) != std::string::npos) return true;
    }
    return false;
  });
}

std::optional<std::string> DaemonProcess::waitForLogPrefix(const std::string& prefix,
                                                           std::chrono::milliseconds timeout) const {
  std::optional<std::string> found;
  pollUntil(timeout, [&] {
    for (const auto& t : logTexts()) {
      if (t.compare(0, prefix.size(), prefix) == 0) {
        found = t;
        return true;
      }
    }
    return false;
  });
  return found;
}

}  // namespace telvane::test
