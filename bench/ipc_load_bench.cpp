// telvane_ipc_load_bench: events per second through the client library and the socket
// into daemon sessions that have no backends (the pure IPC and dispatch cost), and the
// daemon's CPU time per event.
//
// For each daemon log level and each number of client processes it starts a fresh
// telvaned on a scratch socket, starts the clients (this program run again with
// --client), lets them all go at once, and measures from the start signal to the last
// client's flush reply. Since one connection's calls are handled in order, a flush
// reply means the daemon has handled every event that client sent before it.
//
// Threading: single-threaded driver; the clients are separate processes.
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
#include <optional>
#include <sstream>
#include <string>
#include <vector>

#include "BenchClient.h"
#include "BenchDaemon.h"
#include "BenchResults.h"
#include "BenchText.h"

#ifndef TELVANE_BENCH_DAEMON_PATH
#define TELVANE_BENCH_DAEMON_PATH "telvaned"
#endif

using namespace telvane::bench;

namespace {

constexpr int kClientGoFd = 100;
constexpr int kClientReportFd = 101;
constexpr auto kDaemonStartTimeout = std::chrono::seconds(30);
constexpr auto kDaemonStopTimeout = std::chrono::seconds(30);
constexpr useconds_t kAttachSettleMicroseconds = 500'000;

struct Options {
  std::string daemon = TELVANE_BENCH_DAEMON_PATH;
  long eventsSingle = 200'000;
  long eventsMulti = 100'000;
  std::vector<int> clients = {1, 4};
  std::vector<std::string> levels = {"error", "info"};
  std::vector<std::string> wrapper;
  std::vector<std::string> attach;
  int timeoutSeconds = 600;
  bool keep = false;
};

void printUsage() {
  std::printf(
      "usage: telvane_ipc_load_bench [options]\n"
      "  --daemon PATH          telvaned to run (default %s)\n"
      "  --events-single N      events per client with one client (default 200000)\n"
      "  --events-multi N       events per client with several clients (default 100000)\n"
      "  --clients LIST         numbers of client processes, e.g. 1,4 (default 1,4)\n"
      "  --levels LIST          daemon log levels, e.g. error,info (default error,info)\n"
      "  --daemon-wrapper CMD   run the daemon under CMD (words split at spaces), e.g.\n"
      "                         \"valgrind --tool=callgrind --callgrind-out-file=/tmp/cg.out\"\n"
      "  --attach CMD           run CMD -p <daemon pid> during each measured window and end\n"
      "                         it with SIGINT; \"{run}\" in CMD becomes <level>-<clients>, e.g.\n"
      "                         \"perf record -e cpu-clock -F 2000 -g -o /tmp/p-{run}.data\"\n"
      "  --timeout S            give up on a run after S seconds (default 600)\n"
      "  --keep                 keep the scratch directory (daemon logs)\n",
      TELVANE_BENCH_DAEMON_PATH);
}

std::optional<Options> parseOptions(int argc, char** argv) {
  Options options;
  for (int i = 1; i < argc; ++i) {
    std::string arg = argv[i];
    auto next = [&]() -> std::optional<std::string> {
      if (i + 1 >= argc) return std::nullopt;
      return std::string(argv[++i]);
    };
    std::optional<std::string> value;
    if (arg == "--keep") {
      options.keep = true;
      continue;
    }
    if (arg == "--help" || arg == "-h" || !(value = next())) return std::nullopt;
    if (arg == "--daemon") {
      options.daemon = *value;
    } else if (arg == "--events-single") {
      options.eventsSingle = std::atol(value->c_str());
    } else if (arg == "--events-multi") {
      options.eventsMulti = std::atol(value->c_str());
    } else if (arg == "--clients") {
      options.clients.clear();
      for (const auto& k : split(*value, ',')) options.clients.push_back(std::atoi(k.c_str()));
    } else if (arg == "--levels") {
      options.levels = split(*value, ',');
    } else if (arg == "--daemon-wrapper") {
      options.wrapper = split(*value, ' ');
    } else if (arg == "--attach") {
      options.attach = split(*value, ' ');
    } else if (arg == "--timeout") {
      options.timeoutSeconds = std::atoi(value->c_str());
    } else {
      return std::nullopt;
    }
  }
  if (options.eventsSingle <= 0 || options.eventsMulti <= 0 || options.timeoutSeconds <= 0) return std::nullopt;
  for (int k : options.clients) {
    // The daemon accepts five active sessions of one component type.
    if (k < 1 || k > 5) return std::nullopt;
  }
  return options;
}

std::int64_t monotonicNanoseconds() {
  timespec now{};
  ::clock_gettime(CLOCK_MONOTONIC, &now);
  return static_cast<std::int64_t>(now.tv_sec) * 1'000'000'000 + now.tv_nsec;
}

// Reads one report, waiting at most until the deadline; nullopt on timeout or when
// every client has closed its end.
std::optional<Report> readReport(int fd, std::int64_t deadlineNs) {
  Report report;
  char* data = reinterpret_cast<char*>(&report);
  std::size_t done = 0;
  while (done < sizeof report) {
    std::int64_t left = (deadlineNs - monotonicNanoseconds()) / 1'000'000;
    if (left <= 0) return std::nullopt;
    pollfd p{fd, POLLIN, 0};
    int ready = ::poll(&p, 1, static_cast<int>(std::min<std::int64_t>(left, 1000)));
    if (ready < 0 && errno != EINTR) return std::nullopt;
    if (ready <= 0) continue;
    ssize_t n = ::read(fd, data + done, sizeof report - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return std::nullopt;
    done += static_cast<std::size_t>(n);
  }
  return report;
}

struct ClientProcesses {
  std::vector<pid_t> pids;
  double cpuSeconds = 0;  // of the clients that were reaped
  int failures = 0;       // clients that did not exit with 0

  void killAll() {
    for (pid_t pid : pids) ::kill(pid, SIGKILL);
  }
  void reapAll() {
    for (pid_t pid : pids) {
      int status = 0;
      rusage usage{};
      if (::wait4(pid, &status, 0, &usage) != pid) continue;
      cpuSeconds += static_cast<double>(usage.ru_utime.tv_sec + usage.ru_stime.tv_sec) +
                    static_cast<double>(usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) / 1e6;
      if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) ++failures;
    }
    pids.clear();
  }
};

std::optional<ClientProcesses> spawnClients(const std::string& self, int count, long events, int timeoutSeconds,
                                            int goFd, int reportFd) {
  ClientProcesses clients;
  for (int index = 0; index < count; ++index) {
    std::vector<std::string> args = {self,
                                     "--client",
                                     std::to_string(index),
                                     std::to_string(events),
                                     std::to_string(kClientGoFd),
                                     std::to_string(kClientReportFd),
                                     std::to_string(timeoutSeconds)};
    std::vector<char*> argv;
    for (auto& a : args) argv.push_back(a.data());
    argv.push_back(nullptr);
    pid_t pid = ::fork();
    if (pid < 0) {
      clients.killAll();
      clients.reapAll();
      return std::nullopt;
    }
    if (pid == 0) {
      // dup2 clears close-on-exec on the copies; everything else of ours closes.
      if (::dup2(goFd, kClientGoFd) < 0 || ::dup2(reportFd, kClientReportFd) < 0) ::_exit(126);
      ::execv(self.c_str(), argv.data());
      ::_exit(127);
    }
    clients.pids.push_back(pid);
  }
  return clients;
}

// Starts the attach command on the daemon, or returns -1 when there is none.
// "{run}" in the command becomes the run's name ("<level>-<clients>").
pid_t startAttached(const std::vector<std::string>& command, pid_t daemon, const std::string& run) {
  if (command.empty()) return -1;
  std::vector<std::string> args = command;
  for (auto& a : args) {
    if (auto at = a.find("{run}"); at != std::string::npos) a.replace(at, 5, run);
  }
  args.push_back("-p");
  args.push_back(std::to_string(daemon));
  std::vector<char*> argv;
  for (auto& a : args) argv.push_back(a.data());
  argv.push_back(nullptr);
  pid_t pid = ::fork();
  if (pid == 0) {
    ::execvp(argv[0], argv.data());
    ::_exit(127);
  }
  // A profiler needs a moment to attach; only profiling runs pay this.
  if (pid > 0) ::usleep(kAttachSettleMicroseconds);
  return pid;
}

void stopAttached(pid_t pid) {
  if (pid <= 0) return;
  ::kill(pid, SIGINT);
  ::waitpid(pid, nullptr, 0);
}

// One configuration: a fresh daemon at the log level, `clientCount` clients.
RunResult runOnce(const Options& options, const std::string& self, const std::string& scratch,
                  const std::string& level, int clientCount) {
  RunResult result;
  result.level = level;
  result.clients = clientCount;
  result.eventsPerClient = clientCount == 1 ? options.eventsSingle : options.eventsMulti;
  const std::string directory = scratch + "/" + level + "-" + std::to_string(clientCount);

  BenchDaemon daemon(options.daemon, directory, level, options.wrapper);
  if (!daemon.start(kDaemonStartTimeout)) {
    result.problem = "the daemon did not start (log: " + daemon.logPath() + ")";
    return result;
  }
  ::setenv("TELVANED_SOCKET", daemon.socketPath().c_str(), 1);

  int goPipe[2], reportPipe[2];
  if (::pipe2(goPipe, O_CLOEXEC) < 0 || ::pipe2(reportPipe, O_CLOEXEC) < 0) {
    result.problem = std::string("pipe: ") + std::strerror(errno);
    return result;
  }
  auto clients =
      spawnClients(self, clientCount, result.eventsPerClient, options.timeoutSeconds, goPipe[0], reportPipe[1]);
  ::close(goPipe[0]);
  ::close(reportPipe[1]);
  if (!clients) {
    ::close(goPipe[1]);
    ::close(reportPipe[0]);
    result.problem = "cannot start the client processes";
    return result;
  }
  const std::int64_t deadline = monotonicNanoseconds() + std::int64_t(options.timeoutSeconds) * 1'000'000'000;

  auto collect = [&](ReportKind wanted) -> bool {
    for (int received = 0; received < clientCount;) {
      auto report = readReport(reportPipe[0], deadline);
      if (!report) {
        result.problem = "a client did not report in time or ended early";
        return false;
      }
      if (report->kind == ReportKind::Failed) {
        result.problem = "client " + std::to_string(report->client) + " failed at stage " +
                         std::to_string(report->a) + " (1 create, 2 start reply, 3 flush reply, 4 flush error)";
        return false;
      }
      if (report->kind != wanted) continue;
      ++received;
      if (wanted == ReportKind::Ready) result.startRepliesWithBackends += report->a != 0;
      if (wanted == ReportKind::Done) {
        result.lastFlushReplyNs = std::max(result.lastFlushReplyNs, report->a);
        result.refusedSends += report->b;
      }
    }
    return true;
  };

  bool ok = collect(ReportKind::Ready);
  const std::string runName = level + "-" + std::to_string(clientCount);
  const pid_t attached = ok ? startAttached(options.attach, daemon.pid(), runName) : -1;
  std::optional<double> cpuBefore = daemon.cpuSeconds();
  const std::int64_t startNs = monotonicNanoseconds();
  ::close(goPipe[1]);  // the start signal
  ok = ok && collect(ReportKind::Done);
  std::optional<double> cpuAfter = daemon.cpuSeconds();
  result.peakResidentKiB = daemon.peakResidentKiB().value_or(-1);
  stopAttached(attached);
  ::close(reportPipe[0]);
  if (!ok) clients->killAll();
  clients->reapAll();
  result.clientCpuSeconds = clients->cpuSeconds;
  if (ok && clients->failures > 0) {
    ok = false;
    result.problem = std::to_string(clients->failures) + " client process(es) did not exit cleanly";
  }
  if (ok && (!cpuBefore || !cpuAfter)) {
    ok = false;
    result.problem = "cannot read the daemon's CPU time from /proc";
  }
  if (ok) {
    result.wallSeconds = static_cast<double>(result.lastFlushReplyNs - startNs) / 1e9;
    result.daemonCpuSeconds = *cpuAfter - *cpuBefore;
  }
  result.daemonExitStatus = daemon.stop(kDaemonStopTimeout);
  result.noBackendLines =
      daemon.countLogLinesContaining("sendMessageWithDictionary: No backends available to send message");
  result.errorLines = daemon.countLogLinesContaining("<error>");
  result.ok = ok;
  return result;
}

int runClientMode(int argc, char** argv) {
  if (argc < 7) return 2;
  BenchClientOptions options;
  options.index = std::atoi(argv[2]);
  options.events = std::atol(argv[3]);
  options.goFd = std::atoi(argv[4]);
  options.reportFd = std::atoi(argv[5]);
  options.timeoutSeconds = std::atoi(argv[6]);
  return runBenchClient(options);
}

}  // namespace

int main(int argc, char** argv) {
  if (argc > 1 && std::strcmp(argv[1], "--client") == 0) return runClientMode(argc, argv);
  auto options = parseOptions(argc, argv);
  if (!options) {
    printUsage();
    return 2;
  }
  auto prelude = prepareBenchRun(options->daemon, "telvane-ipc-bench");
  if (!prelude) return 1;
  const std::string& self = prelude->self;
  const std::string& scratch = prelude->scratch;

  printHeader(options->daemon, options->wrapper, options->attach);
  std::vector<RunResult> results;
  for (const auto& level : options->levels) {
    for (int clientCount : options->clients) {
      results.push_back(runOnce(*options, self, scratch, level, clientCount));
      verifyRun(results.back());
      printRun(results.back());
    }
  }
  const bool allOk = printSummary(results, !options->wrapper.empty());
  if (options->keep) {
    std::printf("scratch directory kept: %s\n", scratch.c_str());
  } else {
    std::error_code ignored;
    std::filesystem::remove_all(scratch, ignored);
  }
  return allOk ? 0 : 1;
}
