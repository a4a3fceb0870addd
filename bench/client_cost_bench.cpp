// telvane_client_cost_bench: the client library's CPU cost per event as the reporting
// application sees it, for the C++ API, the C interface and the Python package, each
// with batched events (session information "BatchEvents" true, flag 0) and realtime
// events (flag 1).
//
// Usage (Release build, no sanitizers):
//   cmake -S . -B build/rel -G Ninja -DCMAKE_BUILD_TYPE=Release -DTELVANE_BUILD_TESTS=OFF
//   cmake --build build/rel --target telvane_client_cost_bench
//   build/rel/bench/telvane_client_cost_bench [--events N] [--python-events N] [--repeat K] ...
// (--help lists every option; building the target builds the daemon, libtelvane.so and
// the C++ and C clients too.)
//
// Set-up: as telvane_delivery_load_bench does, it makes a self-signed certificate and a
// storebag signing key, signs a storebag whose sections carry one HTTPS post backend
// ("brindle") for the benchmark's client, and serves the storebag and collects the
// posts on a loopback HTTPS server in this process. So every session is configured:
// the start reply carries the enabled backend and the (empty) white- and blacklists,
// the client library filters every event locally, and the daemon answers every event
// and posts it to the collector, batched or at once.
//
// Each run starts a fresh telvaned (scratch socket and folders, an entitlement for our
// uid) and one client process, which opens one session with the library, starts it and
// says "ready"; then (outside the measured window) the driver reads the daemon's CPU
// time and says "go". The client sends N events of a ten-key payload, flushes and waits
// for the flush reply, which the daemon gives after it answered every event (one
// connection's calls are answered in order), and prints its own user and system CPU
// time (getrusage RUSAGE_SELF, all its threads), its calling thread's CPU time
// (RUSAGE_THREAD) and the wall time from just before the first send to just after the
// flush reply. Process start-up, the library's connection and the session's start are
// outside the window; building each event's payload (a Value dictionary, JSON text with
// snprintf, a Python dict) is inside it, as it is part of what the application pays.
// After the client is done, the driver waits briefly for the events to arrive at the
// collector (shown as "arrived"), and stops the daemon.
//
// The clients, all linked to the same libtelvane.so:
//   C++     telvane_client_cost_cxx (client_cost_cxx.cpp), public headers only
//   C       telvane_client_cost_c (client_cost_c.c), compiled as C
//   Python  client_cost.py with the package of python/ (PYTHONPATH) and
//           TELVANE_LIBRARY naming the built libtelvane.so
// They speak to the driver over their standard input and output:
//   client: "ready configured=0|1 backends=NAMES"
//   driver: "go"
//   client: "result events=N refused=N user_us=N sys_us=N caller_us=N wall_us=N
//            send_wall_us=N flush=ok|error|timeout flush_text=WORDS start_rss_kib=N
//            peak_rss_kib=N"
//   driver: closes the client's standard input; the client finishes and frees its
//           session and exits.
// The two resident-memory figures are the client's peak (ru_maxrss) just before the first
// send and after the flush reply: what the events queued inside the library cost.
// Their standard error goes to client.log in the run's scratch folder.
//
// Profiling a client: --client-wrapper puts a command in front of the client, e.g.
//   --apis cxx --modes batched --client-wrapper "perf record -g -o /tmp/cxx-{run}.data"
// ("{run}" becomes <api>-<mode>-<repetition>). The wrapper's own CPU time is not the
// client's, so the numbers stay meaningful, apart from the sampling's overhead.
//
// Threading: single-threaded driver; the collector serves on its own threads; the
// daemon and the clients are separate processes.
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <memory>
#include <optional>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "BenchCertificate.h"
#include "BenchClient.h"
#include "BenchDaemon.h"
#include "BenchText.h"
#include "DeliveryClient.h"
#include "DeliveryCollector.h"
#include "DeliveryStorebag.h"
#include "platform/Log.h"
#include "platform/SqliteSettingsStore.h"

#ifndef TELVANE_BENCH_DAEMON_PATH
#define TELVANE_BENCH_DAEMON_PATH "telvaned"
#endif
#ifndef TELVANE_BENCH_CXX_CLIENT_PATH
#define TELVANE_BENCH_CXX_CLIENT_PATH "telvane_client_cost_cxx"
#endif
#ifndef TELVANE_BENCH_C_CLIENT_PATH
#define TELVANE_BENCH_C_CLIENT_PATH "telvane_client_cost_c"
#endif
#ifndef TELVANE_BENCH_PYTHON_CLIENT_PATH
#define TELVANE_BENCH_PYTHON_CLIENT_PATH "client_cost.py"
#endif
#ifndef TELVANE_BENCH_PYTHON_PACKAGE_DIR
#define TELVANE_BENCH_PYTHON_PACKAGE_DIR "python"
#endif
#ifndef TELVANE_BENCH_LIBRARY_PATH
#define TELVANE_BENCH_LIBRARY_PATH "libtelvane.so"
#endif

extern char** environ;

using namespace telvane;
using namespace telvane::bench;

namespace {

constexpr auto kDaemonStartTimeout = std::chrono::seconds(30);
constexpr auto kDaemonStopTimeout = std::chrono::seconds(30);
constexpr std::int64_t kReadyTimeoutMs = 120'000;
constexpr std::int64_t kExitTimeoutMs = 30'000;
// After the client is done: how long to wait for the events to reach the collector.
constexpr std::int64_t kArrivalStallMs = 2'000;
constexpr std::int64_t kArrivalMaximumMs = 30'000;
constexpr const char* kCountryLocale = "en_US.UTF-8";
constexpr const char* kCountryCode = "US";
constexpr long kCategory = 12;
constexpr long kBatchedType = 3;
constexpr long kRealtimeType = 4;
constexpr const char* kFirstFetchErrorLine = "loadStorebagFromDisk: could not load storebag";

struct Options {
  std::string daemon = TELVANE_BENCH_DAEMON_PATH;
  std::string cxxClient = TELVANE_BENCH_CXX_CLIENT_PATH;
  std::string cClient = TELVANE_BENCH_C_CLIENT_PATH;
  std::string pythonClient = TELVANE_BENCH_PYTHON_CLIENT_PATH;
  std::string pythonPackageDir = TELVANE_BENCH_PYTHON_PACKAGE_DIR;
  std::string library = TELVANE_BENCH_LIBRARY_PATH;
  std::string python = "python3";
  long events = 20'000;
  long pythonEvents = 20'000;
  int repeat = 1;
  std::vector<std::string> apis = {"cxx", "c", "python"};
  std::vector<std::string> modes = {"batched", "realtime"};
  std::string level = "error";
  std::vector<std::string> wrapper;
  int timeoutSeconds = 600;
  bool keep = false;
};

void printUsage() {
  std::printf(
      "usage: telvane_client_cost_bench [options]\n"
      "  --events N             events per run of the C++ and C clients (default 20000)\n"
      "  --python-events N      events per run of the Python client (default 20000)\n"
      "  --repeat K             run every combination K times, interleaved (default 1); with K > 1\n"
      "                         a table of medians follows\n"
      "  --apis LIST            cxx,c,python (default all)\n"
      "  --modes LIST           batched,realtime (default both)\n"
      "  --level LEVEL          the daemon's log level (default error; the clients log at error)\n"
      "  --client-wrapper CMD   run each client under CMD (words split at spaces); \"{run}\" in it\n"
      "                         becomes <api>-<mode>-<repetition>, e.g.\n"
      "                         \"perf record -g -o /tmp/client-{run}.data\"\n"
      "  --python PATH          the Python interpreter (default python3)\n"
      "  --daemon PATH          telvaned (default %s)\n"
      "  --cxx-client PATH      the C++ client (default %s)\n"
      "  --c-client PATH        the C client (default %s)\n"
      "  --python-client PATH   the Python client script (default %s)\n"
      "  --python-dir DIR       the folder that holds the package telvane (default %s)\n"
      "  --library PATH         libtelvane.so for Python (default %s)\n"
      "  --timeout S            give up on a run after S seconds (default 600)\n"
      "  --keep                 keep the scratch directory (daemon and client logs)\n",
      TELVANE_BENCH_DAEMON_PATH, TELVANE_BENCH_CXX_CLIENT_PATH, TELVANE_BENCH_C_CLIENT_PATH,
      TELVANE_BENCH_PYTHON_CLIENT_PATH, TELVANE_BENCH_PYTHON_PACKAGE_DIR, TELVANE_BENCH_LIBRARY_PATH);
}

std::optional<Options> parseOptions(int argc, char** argv) {
  Options o;
  for (int i = 1; i < argc; ++i) {
    const std::string arg = argv[i];
    if (arg == "--keep") {
      o.keep = true;
      continue;
    }
    if (arg == "--help" || arg == "-h" || i + 1 >= argc) return std::nullopt;
    const std::string value = argv[++i];
    const long number = std::atol(value.c_str());
    if (arg == "--events") {
      o.events = number;
    } else if (arg == "--python-events") {
      o.pythonEvents = number;
    } else if (arg == "--repeat") {
      o.repeat = static_cast<int>(number);
    } else if (arg == "--apis") {
      o.apis = split(value, ',');
      for (const auto& api : o.apis) {
        if (api != "cxx" && api != "c" && api != "python") return std::nullopt;
      }
    } else if (arg == "--modes") {
      o.modes = split(value, ',');
      for (const auto& mode : o.modes) {
        if (mode != "batched" && mode != "realtime") return std::nullopt;
      }
    } else if (arg == "--level") {
      o.level = value;
    } else if (arg == "--client-wrapper") {
      o.wrapper = split(value, ' ');
    } else if (arg == "--python") {
      o.python = value;
    } else if (arg == "--daemon") {
      o.daemon = value;
    } else if (arg == "--cxx-client") {
      o.cxxClient = value;
    } else if (arg == "--c-client") {
      o.cClient = value;
    } else if (arg == "--python-client") {
      o.pythonClient = value;
    } else if (arg == "--python-dir") {
      o.pythonPackageDir = value;
    } else if (arg == "--library") {
      o.library = value;
    } else if (arg == "--timeout") {
      o.timeoutSeconds = static_cast<int>(number);
    } else {
      return std::nullopt;
    }
  }
  if (o.events <= 0 || o.pythonEvents <= 0 || o.repeat <= 0 || o.timeoutSeconds <= 0 || o.apis.empty() ||
      o.modes.empty()) {
    return std::nullopt;
  }
  if (o.level != "error" && o.level != "info" && o.level != "debug") return std::nullopt;
  return o;
}

std::string loadAverage() {
  std::ifstream in("/proc/loadavg");
  std::string line;
  std::getline(in, line);
  return line.empty() ? "?" : line;
}

double firstLoadAverage() {
  std::ifstream in("/proc/loadavg");
  double value = -1;
  in >> value;
  return value;
}

std::string apiName(const std::string& api) {
  if (api == "cxx") return "C++";
  if (api == "c") return "C";
  return "Python";
}

// key=value words of a client's line.
std::map<std::string, std::string> parseWords(const std::string& line) {
  std::map<std::string, std::string> words;
  std::istringstream in(line);
  std::string word;
  while (in >> word) {
    auto equals = word.find('=');
    if (equals != std::string::npos) words[word.substr(0, equals)] = word.substr(equals + 1);
  }
  return words;
}

long long wordNumber(const std::map<std::string, std::string>& words, const std::string& key) {
  auto it = words.find(key);
  return it == words.end() ? -1 : std::atoll(it->second.c_str());
}

std::string wordText(const std::map<std::string, std::string>& words, const std::string& key) {
  auto it = words.find(key);
  return it == words.end() ? "" : it->second;
}

// One client process, its standard input and output on pipes, its standard error in a file.
class ClientProcess {
 public:
  ~ClientProcess() {
    closeInput();
    if (outFd_ >= 0) ::close(outFd_);
    if (pid_ > 0) {
      ::kill(pid_, SIGKILL);
      ::waitpid(pid_, nullptr, 0);
    }
  }

  bool spawn(const std::vector<std::string>& command, const std::vector<std::string>& environment,
             const std::string& errorFile) {
    int in[2], out[2];
    if (::pipe2(in, O_CLOEXEC) < 0) return false;
    if (::pipe2(out, O_CLOEXEC) < 0) {
      ::close(in[0]);
      ::close(in[1]);
      return false;
    }
    int errorFd = ::open(errorFile.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    // Everything exec needs is made before fork: the collector's threads may hold locks.
    std::vector<std::string> args = command, env = environment;
    std::vector<char*> argv, envp;
    for (auto& a : args) argv.push_back(a.data());
    argv.push_back(nullptr);
    for (auto& e : env) envp.push_back(e.data());
    envp.push_back(nullptr);
    pid_t pid = ::fork();
    if (pid == 0) {
      // dup2 clears close-on-exec on the copies.
      if (::dup2(in[0], STDIN_FILENO) < 0 || ::dup2(out[1], STDOUT_FILENO) < 0 ||
          (errorFd >= 0 && ::dup2(errorFd, STDERR_FILENO) < 0)) {
        ::_exit(126);
      }
      ::execvpe(argv[0], argv.data(), envp.data());
      ::_exit(127);
    }
    ::close(in[0]);
    ::close(out[1]);
    if (errorFd >= 0) ::close(errorFd);
    if (pid < 0) {
      ::close(in[1]);
      ::close(out[0]);
      return false;
    }
    pid_ = pid;
    inFd_ = in[1];
    outFd_ = out[0];
    return true;
  }

  // The next line of the client's output; nothing on time-out or end of output.
  std::optional<std::string> readLine(std::int64_t timeoutMs) {
    const std::int64_t deadline = monotonicNowNs() + timeoutMs * 1'000'000;
    for (;;) {
      auto newline = buffer_.find('\n');
      if (newline != std::string::npos) {
        std::string line = buffer_.substr(0, newline);
        buffer_.erase(0, newline + 1);
        return line;
      }
      const std::int64_t left = (deadline - monotonicNowNs()) / 1'000'000;
      if (left <= 0) return std::nullopt;
      pollfd p{outFd_, POLLIN, 0};
      int ready = ::poll(&p, 1, static_cast<int>(std::min<std::int64_t>(left, 1000)));
      if (ready < 0 && errno != EINTR) return std::nullopt;
      if (ready <= 0) continue;
      char chunk[4096];
      ssize_t n = ::read(outFd_, chunk, sizeof chunk);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) return std::nullopt;
      buffer_.append(chunk, static_cast<std::size_t>(n));
    }
  }

  bool writeLine(const std::string& line) {
    std::string text = line + "\n";
    return ::write(inFd_, text.data(), text.size()) == static_cast<ssize_t>(text.size());
  }

  void closeInput() {
    if (inFd_ >= 0) ::close(inFd_);
    inFd_ = -1;
  }

  // The exit status after at most the time-out (killed then); -1 when it did not exit.
  int wait(std::int64_t timeoutMs) {
    if (pid_ <= 0) return -1;
    const std::int64_t deadline = monotonicNowNs() + timeoutMs * 1'000'000;
    int status = 0;
    while (monotonicNowNs() < deadline) {
      if (::waitpid(pid_, &status, WNOHANG) == pid_) {
        pid_ = -1;
        return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
      }
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    ::kill(pid_, SIGKILL);
    ::waitpid(pid_, nullptr, 0);
    pid_ = -1;
    return -1;
  }

 private:
  pid_t pid_ = -1;
  int inFd_ = -1;
  int outFd_ = -1;
  std::string buffer_;
};

struct Row {
  std::string api;
  std::string mode;
  int repetition = 0;
  long events = 0;
  bool ok = false;
  std::string problem;
  bool configured = false;
  std::string backends;
  long refused = 0;
  double userSeconds = 0;
  double systemSeconds = 0;
  double callerSeconds = 0;
  double wallSeconds = 0;
  double sendWallSeconds = 0;
  std::string flush;
  std::string flushText;
  long startRssKiB = -1;         // the client's peak resident memory before the first send
  long peakRssKiB = -1;          // and after the flush reply
  double daemonCpuSeconds = -1;  // during the client's window (go to result)
  long arrived = 0;              // at the collector, after the settling wait
  long batchPosts = 0;           // posts the collector received for the run
  long realtimePosts = 0;
  long connections = 0;  // distinct connections the posts came over
  double loadAtStart = -1;
  int clientExit = -1;
  int daemonExit = -1;
  std::size_t daemonErrorLines = 0;

  double cpuMicrosecondsPerEvent() const { return (userSeconds + systemSeconds) * 1e6 / static_cast<double>(events); }
  double callerMicrosecondsPerEvent() const { return callerSeconds * 1e6 / static_cast<double>(events); }
  double eventsPerSecond() const { return wallSeconds > 0 ? static_cast<double>(events) / wallSeconds : 0; }
  double sendEventsPerSecond() const { return sendWallSeconds > 0 ? static_cast<double>(events) / sendWallSeconds : 0; }
};

struct Harness {
  const Options& options;
  std::string scratch;
  DeliveryCollector& collector;
  std::string certificateFile;
  std::string publicKeyFile;
};

std::unique_ptr<BenchDaemon> startDaemon(const Harness& h, const std::string& directory, std::string* problem) {
  std::error_code ignored;
  std::filesystem::create_directories(directory, ignored);
  auto daemon = std::make_unique<BenchDaemon>(h.options.daemon, directory, h.options.level, std::vector<std::string>{});
  {
    auto settings = SqliteSettingsStore::open(daemon->defaultsPath());
    if (!settings || !settings->write("com.zembra.telvane", "telvane_storebag_url", Value(h.collector.url("/bags")))) {
      *problem = "cannot write the daemon's settings database " + daemon->defaultsPath();
      return nullptr;
    }
  }
  daemon->setEnvironment("TELVANED_CA_FILE", h.certificateFile);
  daemon->setEnvironment("TELVANED_PUBLIC_KEY", h.publicKeyFile);
  daemon->setEnvironment("TELVANED_STOREBAG_REFRESH_SPREAD_SECONDS", "1");
  // The country the storebag rule allows.
  daemon->setEnvironment("LC_ALL", kCountryLocale);
  if (!daemon->start(kDaemonStartTimeout)) {
    *problem = "the daemon did not start (log: " + daemon->logPath() + ")";
    return nullptr;
  }
  return daemon;
}

std::size_t countErrorLines(const BenchDaemon& daemon) {
  std::ifstream in(daemon.logPath());
  std::string line;
  std::size_t count = 0;
  while (std::getline(in, line)) {
    // A fresh daemon has no storebag on disk yet: its first fetch logs that, always.
    count += line.find("<error>") != std::string::npos && line.find(kFirstFetchErrorLine) == std::string::npos;
  }
  return count;
}

std::vector<std::string> clientCommand(const Options& o, const std::string& api, const std::string& mode, long events,
                                       int repetition) {
  std::vector<std::string> command;
  const std::string run = api + "-" + mode + "-" + std::to_string(repetition);
  for (std::string word : o.wrapper) {
    if (auto at = word.find("{run}"); at != std::string::npos) word.replace(at, 5, run);
    command.push_back(word);
  }
  if (api == "cxx") {
    command.push_back(o.cxxClient);
  } else if (api == "c") {
    command.push_back(o.cClient);
  } else {
    command.push_back(o.python);
    command.push_back(o.pythonClient);
  }
  const std::vector<std::string> arguments = {
      "events=" + std::to_string(events),
      "mode=" + mode,
      "component-type=" + std::to_string(kDeliveryComponentType),
      "session-id=" + std::to_string(kDeliveryFirstSessionID + repetition),
      "index=" + std::to_string(repetition),
      "category=" + std::to_string(kCategory),
      "type=" + std::to_string(mode == "realtime" ? kRealtimeType : kBatchedType),
      "client-name=" + std::string(kDeliveryClientName),
      "service-name=" + std::string(kDeliveryServiceName),
      "timeout=" + std::to_string(o.timeoutSeconds)};
  command.insert(command.end(), arguments.begin(), arguments.end());
  return command;
}

std::vector<std::string> clientEnvironment(const Options& o, const BenchDaemon& daemon) {
  std::map<std::string, std::string> settings = {
      {"TELVANED_SOCKET", daemon.socketPath()},
      {"TELVANE_LIBRARY", o.library},
      {"TELVANE_LOG_LEVEL", "error"},
      {"PYTHONPATH", o.pythonPackageDir},
      // No .pyc files in the source tree.
      {"PYTHONDONTWRITEBYTECODE", "1"},
  };
  std::vector<std::string> env;
  for (char** e = environ; *e; ++e) {
    std::string entry(*e);
    if (!settings.count(entry.substr(0, entry.find('=')))) env.push_back(entry);
  }
  for (const auto& [key, value] : settings) env.push_back(key + "=" + value);
  return env;
}

Row runOnce(const Harness& h, const std::string& api, const std::string& mode, int repetition) {
  const Options& o = h.options;
  Row row;
  row.api = api;
  row.mode = mode;
  row.repetition = repetition;
  row.events = api == "python" ? o.pythonEvents : o.events;
  const std::string directory = h.scratch + "/" + api + "-" + mode + "-" + std::to_string(repetition);
  auto daemon = startDaemon(h, directory, &row.problem);
  if (!daemon) return row;
  h.collector.beginRun(row.events, 0);

  ClientProcess client;
  if (!client.spawn(clientCommand(o, api, mode, row.events, repetition), clientEnvironment(o, *daemon),
                    directory + "/client.log")) {
    row.problem = "cannot start the client";
    return row;
  }
  auto fail = [&](const std::string& problem) {
    row.problem = problem + " (client log: " + directory + "/client.log)";
    client.closeInput();
    row.clientExit = client.wait(1'000);
    row.daemonExit = daemon->stop(kDaemonStopTimeout);
    return row;
  };
  auto ready = client.readLine(kReadyTimeoutMs);
  if (!ready || ready->rfind("ready ", 0) != 0) return fail("the client did not get ready");
  const auto readyWords = parseWords(*ready);
  row.configured = wordNumber(readyWords, "configured") == 1;
  row.backends = wordText(readyWords, "backends");

  row.loadAtStart = firstLoadAverage();
  const std::optional<double> daemonBefore = daemon->cpuSeconds();
  if (!client.writeLine("go")) return fail("the client went away before the go");
  auto result = client.readLine(static_cast<std::int64_t>(o.timeoutSeconds) * 1000);
  const std::optional<double> daemonAfter = daemon->cpuSeconds();
  if (!result || result->rfind("result ", 0) != 0) return fail("the client gave no result");
  const auto words = parseWords(*result);
  row.refused = wordNumber(words, "refused");
  row.userSeconds = static_cast<double>(wordNumber(words, "user_us")) / 1e6;
  row.systemSeconds = static_cast<double>(wordNumber(words, "sys_us")) / 1e6;
  row.callerSeconds = static_cast<double>(wordNumber(words, "caller_us")) / 1e6;
  row.wallSeconds = static_cast<double>(wordNumber(words, "wall_us")) / 1e6;
  row.sendWallSeconds = static_cast<double>(wordNumber(words, "send_wall_us")) / 1e6;
  row.flush = wordText(words, "flush");
  row.flushText = wordText(words, "flush_text");
  row.startRssKiB = static_cast<long>(wordNumber(words, "start_rss_kib"));
  row.peakRssKiB = static_cast<long>(wordNumber(words, "peak_rss_kib"));
  if (daemonBefore && daemonAfter) row.daemonCpuSeconds = *daemonAfter - *daemonBefore;

  // Let the events reach the collector (the daemon may still be posting them).
  const std::int64_t settleStart = monotonicNowNs();
  std::int64_t lastChange = settleStart;
  long arrived = h.collector.counts().benchEvents;
  while (arrived < row.events) {
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
    const std::int64_t now = monotonicNowNs();
    const long current = h.collector.counts().benchEvents;
    if (current != arrived) {
      arrived = current;
      lastChange = now;
    }
    if (now - lastChange > kArrivalStallMs * 1'000'000 || now - settleStart > kArrivalMaximumMs * 1'000'000) break;
  }
  row.arrived = arrived;
  const auto counts = h.collector.counts();
  row.batchPosts = counts.batchPosts;
  row.realtimePosts = counts.realtimePosts;
  row.connections = counts.connections;

  client.closeInput();
  row.clientExit = client.wait(kExitTimeoutMs);
  row.daemonExit = daemon->stop(kDaemonStopTimeout);
  row.daemonErrorLines = countErrorLines(*daemon);

  row.ok = true;
  if (!row.configured || row.backends.find(kDeliveryBackendName) == std::string::npos) {
    row.ok = false;
    row.problem = "the session was not configured with the backend " + std::string(kDeliveryBackendName);
  } else if (row.refused != 0) {
    row.ok = false;
    row.problem = std::to_string(row.refused) + " sends refused";
  } else if (row.flush == "timeout") {
    row.ok = false;
    row.problem = "no flush reply";
  } else if (row.clientExit != 0) {
    row.ok = false;
    row.problem = "the client exited with " + std::to_string(row.clientExit);
  }
  return row;
}

void printRowLine(const Row& r) {
  std::printf("  %-6s %-8s #%d: ", apiName(r.api).c_str(), r.mode.c_str(), r.repetition);
  if (r.wallSeconds <= 0) {
    std::printf("FAILED: %s\n", r.problem.c_str());
    std::fflush(stdout);
    return;
  }
  std::printf(
      "%ld events, client CPU %.3f s (user %.3f, sys %.3f, calling thread %.3f), wall %.3f s (send loop %.3f s), "
      "flush %s%s%s, peak RSS %.1f MiB (%.1f before the first send), daemon CPU %.3f s, arrived %ld in %ld batch and "
      "%ld realtime posts over %ld connection(s), load %.2f%s%s\n",
      r.events, r.userSeconds + r.systemSeconds, r.userSeconds, r.systemSeconds, r.callerSeconds, r.wallSeconds,
      r.sendWallSeconds, r.flush.c_str(), r.flush == "ok" ? "" : " ", r.flush == "ok" ? "" : r.flushText.c_str(),
      static_cast<double>(r.peakRssKiB) / 1024, static_cast<double>(r.startRssKiB) / 1024, r.daemonCpuSeconds,
      r.arrived, r.batchPosts, r.realtimePosts, r.connections, r.loadAtStart,
      r.ok ? "" : "  PROBLEM: ", r.ok ? "" : r.problem.c_str());
  if (r.daemonErrorLines > 0) std::printf("         (%zu error lines in the daemon log)\n", r.daemonErrorLines);
  std::fflush(stdout);
}

void printTableHeader() {
  std::printf("%-7s %-9s %7s %9s %8s %8s %9s %8s %10s %10s %9s %7s %7s\n", "API", "mode", "events", "CPU us/ev", "user",
              "sys", "caller", "wall s", "events/s", "send ev/s", "daemon", "RSS", "arrived");
  std::printf("%-7s %-9s %7s %9s %8s %8s %9s %8s %10s %10s %9s %7s %7s\n", "", "", "", "(u+s)", "us/ev", "us/ev",
              "us/ev", "", "", "", "us/ev", "+MiB", "");
}

void printTableRow(const Row& r, const std::string& mark = "") {
  if (r.wallSeconds <= 0) {
    std::printf("%-7s %-9s %7ld  failed: %s\n", apiName(r.api).c_str(), r.mode.c_str(), r.events, r.problem.c_str());
    return;
  }
  const double perEvent = 1e6 / static_cast<double>(r.events);
  std::printf("%-7s %-9s %7ld %9.2f %8.2f %8.2f %9.2f %8.3f %10.0f %10.0f %9.2f %7.1f %7ld%s%s\n",
              apiName(r.api).c_str(), r.mode.c_str(), r.events, r.cpuMicrosecondsPerEvent(), r.userSeconds * perEvent,
              r.systemSeconds * perEvent, r.callerMicrosecondsPerEvent(), r.wallSeconds, r.eventsPerSecond(),
              r.sendEventsPerSecond(), r.daemonCpuSeconds >= 0 ? r.daemonCpuSeconds * perEvent : -1.0,
              static_cast<double>(r.peakRssKiB - r.startRssKiB) / 1024, r.arrived, mark.c_str(), r.ok ? "" : " !");
}

double median(std::vector<double> values) {
  if (values.empty()) return 0;
  std::sort(values.begin(), values.end());
  const std::size_t middle = values.size() / 2;
  return values.size() % 2 ? values[middle] : (values[middle - 1] + values[middle]) / 2;
}

}  // namespace

int main(int argc, char** argv) {
  auto options = parseOptions(argc, argv);
  if (!options) {
    printUsage();
    return 2;
  }
  for (const auto& api : options->apis) {
    const std::string& path = api == "cxx" ? options->cxxClient : api == "c" ? options->cClient : options->pythonClient;
    if (!std::filesystem::exists(path)) {
      std::fprintf(stderr, "cannot find the %s client %s\n", apiName(api).c_str(), path.c_str());
      return 1;
    }
  }
  auto prelude = prepareBenchRun(options->daemon, "telvane-client-cost-bench");
  if (!prelude) return 1;
  const std::string& scratch = prelude->scratch;
  // This process's own use of the libraries (signing) logs at info level.
  log::setLevel(log::Level::Error);
  const std::string loadBefore = loadAverage();

  const std::string certificateFile = scratch + "/collector-cert.pem";
  const std::string keyFile = scratch + "/collector-key.pem";
  std::string problem;
  if (!writeSelfSignedCertificate(certificateFile, keyFile, &problem)) {
    std::fprintf(stderr, "certificate: %s\n", problem.c_str());
    return 1;
  }
  // The daemon posts over a few kept-alive connections; realtime posts may use more.
  auto collector = DeliveryCollector::start(certificateFile, keyFile, 64, &problem);
  if (!collector) {
    std::fprintf(stderr, "collector: %s\n", problem.c_str());
    return 1;
  }
  DeliveryStorebagSettings storebag;
  storebag.batchPostURL = collector->url("/post/batch");
  storebag.realtimePostURL = collector->url("/post/realtime");
  storebag.displayURL = collector->url("/");
  storebag.clientName = kDeliveryClientName;
  storebag.serviceName = "bench.delivery";
  storebag.countryCode = kCountryCode;
  auto signedStorebag = signDeliveryStorebag(makeDeliveryStorebagDocument(storebag), &problem);
  if (!signedStorebag) {
    std::fprintf(stderr, "storebag: %s\n", problem.c_str());
    return 1;
  }
  const std::string publicKeyFile = scratch + "/storebag-key.der";
  {
    std::ofstream out(publicKeyFile, std::ios::binary);
    out.write(reinterpret_cast<const char*>(signedStorebag->publicKeyDer.data()),
              static_cast<std::streamsize>(signedStorebag->publicKeyDer.size()));
    if (!out) {
      std::fprintf(stderr, "cannot write %s\n", publicKeyFile.c_str());
      return 1;
    }
  }
  collector->setStorebagEnvelope(std::string(signedStorebag->envelope.begin(), signedStorebag->envelope.end()));

  std::printf("telvane client CPU cost per event\n");
  std::printf("  daemon:    %s (log level %s), a fresh one per run\n", options->daemon.c_str(), options->level.c_str());
  std::printf("  clients:   C++ %s, C %s, Python %s %s (TELVANE_LIBRARY=%s)\n", options->cxxClient.c_str(),
              options->cClient.c_str(), options->python.c_str(), options->pythonClient.c_str(),
              options->library.c_str());
  std::printf(
      "  sessions:  component type %ld, BatchEvents true, configured by a signed storebag with the HTTPS\n"
      "             post backend \"%s\" posting to %s; ten-key payloads, category %ld\n",
      kDeliveryComponentType, kDeliveryBackendName, collector->url("").c_str(), kCategory);
  std::printf("  events:    %ld per C++ and C run, %ld per Python run; %d repetition(s)\n", options->events,
              options->pythonEvents, options->repeat);
  if (!options->wrapper.empty()) {
    std::string joined;
    for (const auto& w : options->wrapper) joined += (joined.empty() ? "" : " ") + w;
    std::printf("  wrapper:   %s\n", joined.c_str());
  }
  std::printf("  CPUs:      %u online\n", std::thread::hardware_concurrency());
  std::printf("  load average before: %s\n\n", loadBefore.c_str());
  std::fflush(stdout);

  Harness harness{*options, scratch, *collector, certificateFile, publicKeyFile};
  std::vector<Row> rows;
  for (int repetition = 1; repetition <= options->repeat; ++repetition) {
    for (const auto& api : options->apis) {
      for (const auto& mode : options->modes) {
        rows.push_back(runOnce(harness, api, mode, repetition));
        printRowLine(rows.back());
      }
    }
  }
  collector->stop();

  std::printf(
      "\nClient CPU is the client process's user+system time (all its threads: the caller and the library's)\n"
      "from just before the first send to just after the flush reply; \"caller\" is the sending thread's\n"
      "share; wall is the same window; \"send ev/s\" counts the send loop alone; daemon is telvaned's CPU in\n"
      "the window; RSS is how much the client's peak resident memory grew in the window; arrived is what\n"
      "reached the collector by the end of the run.\n\n");
  printTableHeader();
  for (const auto& row : rows) printTableRow(row, options->repeat > 1 ? "  #" + std::to_string(row.repetition) : "");
  if (options->repeat > 1) {
    std::printf("\nmedians of %d repetitions:\n", options->repeat);
    printTableHeader();
    for (const auto& api : options->apis) {
      for (const auto& mode : options->modes) {
        std::vector<double> cpu, user, sys, caller, wall, sendWall, daemonCpu, rssGrowth;
        Row m;
        m.api = api;
        m.mode = mode;
        m.ok = true;
        for (const auto& r : rows) {
          if (r.api != api || r.mode != mode || r.wallSeconds <= 0) continue;
          m.events = r.events;
          m.ok = m.ok && r.ok;
          user.push_back(r.userSeconds);
          sys.push_back(r.systemSeconds);
          caller.push_back(r.callerSeconds);
          wall.push_back(r.wallSeconds);
          sendWall.push_back(r.sendWallSeconds);
          daemonCpu.push_back(r.daemonCpuSeconds);
          rssGrowth.push_back(static_cast<double>(r.peakRssKiB - r.startRssKiB));
          m.arrived = std::min(m.arrived == 0 ? r.arrived : m.arrived, r.arrived);
        }
        if (user.empty()) continue;
        // The median of user+system per run, split in the medians' proportion.
        std::vector<double> total;
        for (std::size_t i = 0; i < user.size(); ++i) total.push_back(user[i] + sys[i]);
        const double t = median(total), u = median(user), s = median(sys);
        m.userSeconds = u + s > 0 ? t * u / (u + s) : t;
        m.systemSeconds = t - m.userSeconds;
        m.callerSeconds = median(caller);
        m.wallSeconds = median(wall);
        m.sendWallSeconds = median(sendWall);
        m.daemonCpuSeconds = median(daemonCpu);
        m.startRssKiB = 0;
        m.peakRssKiB = static_cast<long>(median(rssGrowth));
        printTableRow(m);
      }
    }
  }
  bool allOk = true;
  for (const auto& row : rows) allOk = allOk && row.ok;
  std::printf("\nload average before: %s\nload average after:  %s\n", loadBefore.c_str(), loadAverage().c_str());
  if (!allOk) std::printf("some runs had problems (marked !)\n");
  if (options->keep) {
    std::printf("scratch directory kept: %s\n", scratch.c_str());
  } else {
    std::error_code ignored;
    std::filesystem::remove_all(scratch, ignored);
  }
  return allOk ? 0 : 1;
}
