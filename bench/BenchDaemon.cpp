#include "BenchDaemon.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <sstream>
#include <thread>

extern char** environ;

namespace telvane::bench {

namespace {

using SteadyClock = std::chrono::steady_clock;

constexpr auto kPollInterval = std::chrono::milliseconds(10);

}  // namespace

BenchDaemon::BenchDaemon(std::string binary, std::string directory, std::string logLevel,
                         std::vector<std::string> wrapper)
    : binary_(std::move(binary)),
      directory_(std::move(directory)),
      logLevel_(std::move(logLevel)),
      wrapper_(std::move(wrapper)),
      socketPath_(directory_ + "/telvaned.sock"),
      logPath_(directory_ + "/telvaned.log") {}

BenchDaemon::~BenchDaemon() {
  if (pid_ > 0) {
    ::kill(pid_, SIGKILL);
    ::waitpid(pid_, nullptr, 0);
  }
}

void BenchDaemon::setEnvironment(const std::string& key, const std::string& value) {
  extraEnvironment_[key] = value;
}

bool BenchDaemon::start(std::chrono::milliseconds timeout) {
  namespace fs = std::filesystem;
  std::error_code ignored;
  fs::create_directories(directory_ + "/entitlements.d", ignored);
  {
    std::ofstream policy(directory_ + "/entitlements.d/bench.conf");
    policy << "com.zembra.private.telvaned uid:" << ::getuid() << "\n";
    if (!policy) return false;
  }
  std::map<std::string, std::string> settings = {
      {"TELVANED_SOCKET", socketPath_},
      {"TELVANED_ENTITLEMENTS_DIR", directory_ + "/entitlements.d"},
      {"TELVANE_DEFAULTS_DB", defaultsPath()},
      {"TELVANED_CACHE_DIR", directory_ + "/cache"},
      {"TELVANED_MESSAGE_LOG_DIR", directory_ + "/messagelogs"},
      {"TELVANED_STORAGE_DIR", directory_ + "/storage"},
      {"TELVANED_DEVICE_INFO", directory_ + "/device-info.conf"},
      {"TELVANED_IDLE_EXIT_SECONDS", "0"},
      {"TELVANE_LOG_LEVEL", logLevel_},
  };
  for (const auto& [key, value] : extraEnvironment_) settings[key] = value;
  // Our environment minus anything of a service manager (JOURNAL_STREAM would send
  // the daemon's log to the journal), plus the daemon's settings.
  std::vector<std::string> env;
  for (char** e = environ; *e; ++e) {
    std::string entry(*e);
    std::string key = entry.substr(0, entry.find('='));
    if (key == "LISTEN_FDS" || key == "LISTEN_PID" || key == "LISTEN_FDNAMES" || key == "NOTIFY_SOCKET" ||
        key == "JOURNAL_STREAM" || settings.count(key)) {
      continue;
    }
    env.push_back(entry);
  }
  for (const auto& [k, v] : settings) env.push_back(k + "=" + v);
  std::vector<char*> envp;
  for (auto& e : env) envp.push_back(e.data());
  envp.push_back(nullptr);

  std::vector<std::string> args = wrapper_;
  args.push_back(binary_);
  std::vector<char*> argv;
  for (auto& a : args) argv.push_back(a.data());
  argv.push_back(nullptr);

  int logFd = ::open(logPath_.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  if (logFd < 0) return false;
  pid_t pid = ::fork();
  if (pid < 0) {
    ::close(logFd);
    return false;
  }
  if (pid == 0) {
    ::dup2(logFd, STDERR_FILENO);
    ::dup2(logFd, STDOUT_FILENO);
    ::execvpe(argv[0], argv.data(), envp.data());
    ::_exit(127);
  }
  ::close(logFd);
  pid_ = pid;

  auto deadline = SteadyClock::now() + timeout;
  while (SteadyClock::now() < deadline) {
    int status = 0;
    if (::waitpid(pid_, &status, WNOHANG) == pid_) {
      pid_ = -1;
      return false;
    }
    if (connectable()) return true;
    std::this_thread::sleep_for(kPollInterval);
  }
  return false;
}

bool BenchDaemon::connectable() const {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (socketPath_.size() >= sizeof address.sun_path) return false;
  std::memcpy(address.sun_path, socketPath_.c_str(), socketPath_.size() + 1);
  int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return false;
  bool ok = ::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0;
  ::close(fd);
  return ok;
}

int BenchDaemon::stop(std::chrono::milliseconds timeout) {
  if (pid_ <= 0) return -1;
  ::kill(pid_, SIGTERM);
  auto deadline = SteadyClock::now() + timeout;
  while (SteadyClock::now() < deadline) {
    int status = 0;
    if (::waitpid(pid_, &status, WNOHANG) == pid_) {
      pid_ = -1;
      if (WIFEXITED(status)) return WEXITSTATUS(status);
      return 128 + WTERMSIG(status);
    }
    std::this_thread::sleep_for(kPollInterval);
  }
  ::kill(pid_, SIGKILL);
  ::waitpid(pid_, nullptr, 0);
  pid_ = -1;
  return -1;
}

std::optional<double> BenchDaemon::cpuSeconds() const {
  if (pid_ <= 0) return std::nullopt;
  std::ifstream in("/proc/" + std::to_string(pid_) + "/stat");
  std::string line;
  if (!std::getline(in, line)) return std::nullopt;
  // The command name (field 2) may hold spaces; the fields after its ')' are fixed:
  // state is field 3, utime field 14 and stime field 15.
  auto close = line.rfind(')');
  if (close == std::string::npos) return std::nullopt;
  std::istringstream fields(line.substr(close + 2));
  std::string field;
  unsigned long long utime = 0, stime = 0;
  for (int index = 3; index <= 15 && fields >> field; ++index) {
    if (index == 14) utime = std::stoull(field);
    if (index == 15) stime = std::stoull(field);
  }
  if (!fields) return std::nullopt;
  long ticks = ::sysconf(_SC_CLK_TCK);
  if (ticks <= 0) return std::nullopt;
  return static_cast<double>(utime + stime) / static_cast<double>(ticks);
}

std::optional<long> BenchDaemon::peakResidentKiB() const {
  if (pid_ <= 0) return std::nullopt;
  std::ifstream in("/proc/" + std::to_string(pid_) + "/status");
  std::string line;
  while (std::getline(in, line)) {
    if (line.rfind("VmHWM:", 0) == 0) return std::stol(line.substr(6));
  }
  return std::nullopt;
}

std::optional<long> BenchDaemon::residentKiB() const {
  if (pid_ <= 0) return std::nullopt;
  std::ifstream in("/proc/" + std::to_string(pid_) + "/status");
  std::string line;
  while (std::getline(in, line)) {
    if (line.rfind("VmRSS:", 0) == 0) return std::stol(line.substr(6));
  }
  return std::nullopt;
}

std::size_t BenchDaemon::countLogLinesContaining(const std::string& text) const {
  std::ifstream in(logPath_);
  std::string line;
  std::size_t count = 0;
  while (std::getline(in, line)) count += line.find(text) != std::string::npos;
  return count;
}

std::optional<BenchPrelude> prepareBenchRun(const std::string& daemonPath, const std::string& scratchPrefix) {
  BenchPrelude prelude;
  std::error_code error;
  prelude.self = std::filesystem::read_symlink("/proc/self/exe", error).string();
  if (error || !std::filesystem::exists(daemonPath)) {
    std::fprintf(stderr, "cannot find %s\n", error ? "/proc/self/exe" : daemonPath.c_str());
    return std::nullopt;
  }
  std::string scratchTemplate = "/tmp/" + scratchPrefix + "-XXXXXX";
  if (!::mkdtemp(scratchTemplate.data())) {
    std::perror("mkdtemp");
    return std::nullopt;
  }
  prelude.scratch = scratchTemplate;
  ::setenv("TELVANE_LOG_LEVEL", "error", 1);
  ::unsetenv("JOURNAL_STREAM");
  ::signal(SIGPIPE, SIG_IGN);
  return prelude;
}

}  // namespace telvane::bench
