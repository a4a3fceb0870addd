// telvane_delivery_load_bench: events per second delivered end to end, from client
// processes through the client library and the real telvaned to an HTTPS collector,
// with the daemon's CPU time per event, its memory at full load and with 100 idle
// sessions, the send-to-arrival latency of realtime events, and what gzip alone costs
// for the same posted documents.
//
// Usage (Release build, no sanitizers):
//   cmake -S . -B build/bench-delivery -G Ninja -DCMAKE_BUILD_TYPE=Release -DTELVANE_WERROR=OFF
//   cmake --build build/bench-delivery --target telvane_delivery_load_bench
//   build/bench-delivery/bench/telvane_delivery_load_bench [--clients 1,4] [--events-multi N] [--level error] ...
// (--help lists every option.)
//
// At start it makes a self-signed certificate and a storebag signing key, signs a
// storebag whose sections carry one HTTPS post backend ("brindle") for the
// benchmark's clients, and starts a loopback HTTPS server in this process that serves
// the storebag and collects the posts. Each run starts a fresh telvaned that trusts the
// certificate and the key, and client processes (this program again, with
// --delivery-client):
// - load runs: K clients send M events each as fast as they can and flush; a run ends
//   when every event has arrived at the collector. Unless M is given, a calibration run
//   (one client, a few thousand events) measures the delivery rate first and M is
//   chosen so that each run takes a few seconds;
// - the realtime run: one client sends realtime events at a moderate rate; the
//   collector measures send-to-arrival latency;
// - the idle run: 100 configured sessions (5 per component type, the daemon's limit)
//   spread over several client processes; the daemon's resident memory is read.
// After each load run, the JSON documents the collector received are compressed again
// with gzipDeflate in this process, which gives the cost of compression alone per event.
//
// When no event arrives (a daemon without the HTTPS post backend, say), a run ends after
// the stall timeout and says "0 events arrived" instead of waiting.
//
// Threading: single-threaded driver; the collector serves on its own threads; the
// clients are separate processes.
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
#include <memory>
#include <optional>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "BenchCertificate.h"
#include "BenchClient.h"
#include "BenchDaemon.h"
#include "BenchResults.h"
#include "BenchText.h"
#include "DeliveryClient.h"
#include "DeliveryCollector.h"
#include "DeliveryResults.h"
#include "DeliveryStorebag.h"
#include "platform/Log.h"
#include "platform/SqliteSettingsStore.h"
#include "util/Compression.h"

#ifndef TELVANE_BENCH_DAEMON_PATH
#define TELVANE_BENCH_DAEMON_PATH "telvaned"
#endif

using namespace telvane;
using namespace telvane::bench;

namespace {

constexpr int kClientGoFd = 100;
constexpr int kClientReleaseFd = 101;
constexpr int kClientReportFd = 102;
constexpr auto kDaemonStartTimeout = std::chrono::seconds(30);
constexpr auto kDaemonStopTimeout = std::chrono::seconds(30);
constexpr std::int64_t kReadyTimeoutNs = 180'000'000'000;
constexpr std::int64_t kPollIntervalMs = 20;
// A run whose sessions have no backend cannot deliver anything: it waits this long at
// most for arrivals after the last client is done.
constexpr std::int64_t kNoBackendGraceNs = 3'000'000'000;
// gzipDeflate is repeated over the kept documents until it has run this long.
constexpr double kGzipMinimumCpuSeconds = 0.3;
constexpr std::size_t kFirstErrorLines = 3;
constexpr const char* kFirstFetchErrorLine = "loadStorebagFromDisk: could not load storebag";
// The calibration run and the bounds of what it may choose.
constexpr long kCalibrationEvents = 2'000;
constexpr long kMinimumEventsPerClient = 1'000;
constexpr long kMaximumEventsPerRun = 2'000'000;
constexpr const char* kCountryLocale = "en_US.UTF-8";
constexpr const char* kCountryCode = "US";

struct Options {
  std::string daemon = TELVANE_BENCH_DAEMON_PATH;
  // Unset: sized from a calibration run so that a run takes about runSeconds.
  std::optional<long> eventsSingle;
  std::optional<long> eventsMulti;
  int runSeconds = 4;
  std::vector<int> clients = {1, 4};
  std::string level = "error";
  long realtimeEvents = 300;
  long realtimeRate = 50;
  int idleSessions = kTargetIdleSessions;
  int idleProcesses = 5;
  std::optional<int> eventThreshold;
  bool consent = false;
  int stallSeconds = 15;
  int timeoutSeconds = 600;
  long keepMiB = 64;
  int collectorThreads = 512;
  std::set<std::string> runs = {"load", "realtime", "idle"};
  bool keep = false;
};

void printUsage() {
  std::printf(
      "usage: telvane_delivery_load_bench [options]\n"
      "  --daemon PATH            telvaned to run (default %s)\n"
      "  --runs LIST              which runs: load,realtime,idle (default all)\n"
      "  --clients LIST           client processes of the load runs, each 1 to 5 (default 1,4)\n"
      "  --events-single N        events per client with one client\n"
      "  --events-multi N         events per client with several clients\n"
      "  --run-seconds S          without the two options above, a calibration run (1 client x %ld\n"
      "                           events) sizes the load runs to take about S seconds (default 4)\n"
      "  --level LEVEL            the daemon's log level: error, info or debug (default error)\n"
      "  --realtime-events N      realtime events of the realtime run (default 300)\n"
      "  --realtime-rate N        realtime events per second (default 50)\n"
      "  --idle-sessions N        sessions of the idle run (default 100)\n"
      "  --idle-processes N       client processes of the idle run, 1 to 5 (default 5)\n"
      "  --event-threshold N      the rule's \"event_threshold\" (default: none, the backend's 49)\n"
      "  --consent                give diagnostics consent instead of \"override_dnu\" 1 (the backend\n"
      "                           then writes readable copies and the session the message log)\n"
      "  --stall-timeout S        end a run when nothing arrived for S seconds (default 15)\n"
      "  --timeout S              give up on a run after S seconds (default 600)\n"
      "  --keep-mib N             JSON kept for the gzip comparison, MiB per run (default 64)\n"
      "  --collector-threads N    worker threads of the HTTPS collector, one per open connection\n"
      "                           (default 512)\n"
      "  --keep                   keep the scratch directory (daemon logs)\n",
      TELVANE_BENCH_DAEMON_PATH, kCalibrationEvents);
}

std::optional<Options> parseOptions(int argc, char** argv) {
  Options o;
  for (int i = 1; i < argc; ++i) {
    const std::string arg = argv[i];
    if (arg == "--keep") {
      o.keep = true;
      continue;
    }
    if (arg == "--consent") {
      o.consent = true;
      continue;
    }
    if (arg == "--help" || arg == "-h" || i + 1 >= argc) return std::nullopt;
    const std::string value = argv[++i];
    const long number = std::atol(value.c_str());
    if (arg == "--daemon") {
      o.daemon = value;
    } else if (arg == "--runs") {
      o.runs.clear();
      for (const auto& run : split(value, ',')) {
        if (run != "load" && run != "realtime" && run != "idle") return std::nullopt;
        o.runs.insert(run);
      }
    } else if (arg == "--clients") {
      o.clients.clear();
      for (const auto& k : split(value, ',')) o.clients.push_back(std::atoi(k.c_str()));
    } else if (arg == "--events-single") {
      o.eventsSingle = number;
    } else if (arg == "--events-multi") {
      o.eventsMulti = number;
    } else if (arg == "--run-seconds") {
      o.runSeconds = static_cast<int>(number);
    } else if (arg == "--level") {
      o.level = value;
    } else if (arg == "--realtime-events") {
      o.realtimeEvents = number;
    } else if (arg == "--realtime-rate") {
      o.realtimeRate = number;
    } else if (arg == "--idle-sessions") {
      o.idleSessions = static_cast<int>(number);
    } else if (arg == "--idle-processes") {
      o.idleProcesses = static_cast<int>(number);
    } else if (arg == "--event-threshold") {
      o.eventThreshold = static_cast<int>(number);
    } else if (arg == "--stall-timeout") {
      o.stallSeconds = static_cast<int>(number);
    } else if (arg == "--timeout") {
      o.timeoutSeconds = static_cast<int>(number);
    } else if (arg == "--keep-mib") {
      o.keepMiB = number;
    } else if (arg == "--collector-threads") {
      o.collectorThreads = static_cast<int>(number);
    } else {
      return std::nullopt;
    }
  }
  if ((o.eventsSingle && *o.eventsSingle <= 0) || (o.eventsMulti && *o.eventsMulti <= 0) || o.runSeconds <= 0 ||
      o.realtimeEvents <= 0 || o.realtimeRate <= 0 || o.stallSeconds <= 0 || o.timeoutSeconds <= 0 || o.keepMiB < 0 ||
      o.collectorThreads <= 0 || o.idleSessions <= 0 || o.idleProcesses <= 0) {
    return std::nullopt;
  }
  if (o.level != "error" && o.level != "info" && o.level != "debug") return std::nullopt;
  // The daemon accepts five live sessions of one component type: the load clients all
  // use one type, and each idle process opens one session per type.
  for (int k : o.clients) {
    if (k < 1 || k > kMaxSessionsPerComponentType) return std::nullopt;
  }
  if (o.idleProcesses > kMaxSessionsPerComponentType) return std::nullopt;
  const int perProcess = (o.idleSessions + o.idleProcesses - 1) / o.idleProcesses;
  if (perProcess > kLastClientComponentType - kFirstClientComponentType + 1) return std::nullopt;
  return o;
}

double secondsBetween(std::int64_t fromNs, std::int64_t toNs) { return static_cast<double>(toNs - fromNs) / 1e9; }

double processCpuSeconds(int who) {
  rusage usage{};
  ::getrusage(who, &usage);
  return static_cast<double>(usage.ru_utime.tv_sec + usage.ru_stime.tv_sec) +
         static_cast<double>(usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) / 1e6;
}

// Reads the fixed-size reports of the clients from the shared pipe without blocking
// longer than asked.
class ReportReader {
 public:
  explicit ReportReader(int fd) : fd_(fd) {}
  ~ReportReader() {
    if (fd_ >= 0) ::close(fd_);
  }
  ReportReader(const ReportReader&) = delete;
  ReportReader& operator=(const ReportReader&) = delete;

  // The reports complete within the wait; `ended()` tells whether every writer has
  // closed its end.
  std::vector<Report> poll(std::int64_t waitMs) {
    std::vector<Report> reports;
    if (ended_) return reports;
    pollfd p{fd_, POLLIN, 0};
    int ready = ::poll(&p, 1, static_cast<int>(waitMs));
    if (ready <= 0) return reports;
    char chunk[sizeof(Report) * 16];
    ssize_t n = ::read(fd_, chunk, sizeof chunk);
    if (n < 0 && errno == EINTR) return reports;
    if (n <= 0) {
      ended_ = true;
      return reports;
    }
    buffer_.append(chunk, static_cast<std::size_t>(n));
    while (buffer_.size() >= sizeof(Report)) {
      Report report;
      std::memcpy(&report, buffer_.data(), sizeof report);
      buffer_.erase(0, sizeof report);
      reports.push_back(report);
    }
    return reports;
  }
  bool ended() const { return ended_; }

 private:
  int fd_;
  std::string buffer_;
  bool ended_ = false;
};

// The client processes of one run and the pipes they share with the driver.
class ClientGroup {
 public:
  ~ClientGroup() {
    closeGo();
    release();
    killAll();
    reapAll();
  }

  bool openPipes() {
    int go[2], releasePipe[2], report[2];
    if (::pipe2(go, O_CLOEXEC) < 0) return false;
    if (::pipe2(releasePipe, O_CLOEXEC) < 0) return false;
    if (::pipe2(report, O_CLOEXEC) < 0) return false;
    goRead_ = go[0];
    goWrite_ = go[1];
    releaseRead_ = releasePipe[0];
    releaseWrite_ = releasePipe[1];
    reportWrite_ = report[1];
    reader_ = std::make_unique<ReportReader>(report[0]);
    return true;
  }

  bool spawn(const std::string& self, DeliveryClientOptions options) {
    options.goFd = kClientGoFd;
    options.releaseFd = kClientReleaseFd;
    options.reportFd = kClientReportFd;
    std::vector<std::string> args = {self, "--delivery-client"};
    for (auto& a : deliveryClientArguments(options)) args.push_back(a);
    std::vector<char*> argv;
    for (auto& a : args) argv.push_back(a.data());
    argv.push_back(nullptr);
    pid_t pid = ::fork();
    if (pid < 0) return false;
    if (pid == 0) {
      // dup2 clears close-on-exec on the copies; everything else of ours closes.
      if (::dup2(goRead_, kClientGoFd) < 0 || ::dup2(releaseRead_, kClientReleaseFd) < 0 ||
          ::dup2(reportWrite_, kClientReportFd) < 0) {
        ::_exit(126);
      }
      ::execv(self.c_str(), argv.data());
      ::_exit(127);
    }
    pids_.push_back(pid);
    return true;
  }

  // After spawning: the driver keeps only its own ends.
  void closeChildEnds() {
    closeFd(goRead_);
    closeFd(releaseRead_);
    closeFd(reportWrite_);
  }
  void closeGo() { closeFd(goWrite_); }
  void release() { closeFd(releaseWrite_); }
  ReportReader& reader() { return *reader_; }

  void killAll() {
    for (pid_t pid : pids_) ::kill(pid, SIGKILL);
  }
  // Waits for every client; their CPU time and how many did not exit with 0.
  void reapAll() {
    for (pid_t pid : pids_) {
      int status = 0;
      rusage usage{};
      if (::wait4(pid, &status, 0, &usage) != pid) continue;
      cpuSeconds_ += static_cast<double>(usage.ru_utime.tv_sec + usage.ru_stime.tv_sec) +
                     static_cast<double>(usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) / 1e6;
      if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) ++failures_;
    }
    pids_.clear();
  }
  double cpuSeconds() const { return cpuSeconds_; }
  int failures() const { return failures_; }

 private:
  static void closeFd(int& fd) {
    if (fd >= 0) ::close(fd);
    fd = -1;
  }

  std::vector<pid_t> pids_;
  int goRead_ = -1, goWrite_ = -1, releaseRead_ = -1, releaseWrite_ = -1, reportWrite_ = -1;
  std::unique_ptr<ReportReader> reader_;
  double cpuSeconds_ = 0;
  int failures_ = 0;
};

// What every run shares: the options, the collector and the files the daemons are given.
struct Harness {
  const Options& options;
  std::string self;
  std::string scratch;
  DeliveryCollector& collector;
  std::string certificateFile;
  std::string publicKeyFile;
};

std::string failedStageText(std::int64_t stage) {
  return "client failed at stage " + std::to_string(stage) + " (1 create, 2 start reply, 3 flush reply)";
}

// A fresh daemon for the run, pointed at the collector's storebag server; nothing (and
// the reason in `problem`) when it does not start.
std::unique_ptr<BenchDaemon> startDaemon(const Harness& h, const std::string& name, std::string* problem) {
  const std::string directory = h.scratch + "/" + name;
  std::error_code ignored;
  std::filesystem::create_directories(directory, ignored);
  auto daemon = std::make_unique<BenchDaemon>(h.options.daemon, directory, h.options.level, std::vector<std::string>{});
  {
    auto settings = SqliteSettingsStore::open(daemon->defaultsPath());
    if (!settings || !settings->write("com.zembra.telvane", "telvane_storebag_url", Value(h.collector.url("/bags"))) ||
        (h.options.consent && !settings->write("com.zembra.diagnostics", "SubmitDiagnostics", Value(true)))) {
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
  ::setenv("TELVANED_SOCKET", daemon->socketPath().c_str(), 1);
  return daemon;
}

std::vector<std::string> firstErrorLines(const BenchDaemon& daemon) {
  std::vector<std::string> lines;
  std::ifstream in(daemon.logPath());
  std::string line;
  while (lines.size() < kFirstErrorLines && std::getline(in, line)) {
    // A fresh daemon has no storebag on disk yet: its first fetch logs that, always.
    if (line.find("<error>") != std::string::npos && line.find(kFirstFetchErrorLine) == std::string::npos) {
      lines.push_back(line);
    }
  }
  return lines;
}

// Waits until every client reported Ready; the sum of their `a` (sessions with the
// backend enabled), or nothing with the problem set.
std::optional<long> waitForReady(ClientGroup& group, int clients, std::string* problem) {
  const std::int64_t deadline = monotonicNowNs() + kReadyTimeoutNs;
  long enabled = 0;
  for (int ready = 0; ready < clients;) {
    if (monotonicNowNs() > deadline) {
      *problem = "the clients did not get their start replies in time";
      return std::nullopt;
    }
    if (group.reader().ended()) {
      *problem = "a client ended before it was ready";
      return std::nullopt;
    }
    for (const Report& report : group.reader().poll(kPollIntervalMs)) {
      if (report.kind == ReportKind::Failed) {
        *problem = failedStageText(report.a);
        return std::nullopt;
      }
      if (report.kind == ReportKind::Ready) {
        ++ready;
        enabled += report.a;
      }
    }
  }
  return enabled;
}

// What happened in the measured window of a sending run.
struct Window {
  std::string problem;
  int allSent = 0;
  int done = 0;
  long refused = 0;
  std::int64_t lastDoneNs = 0;
  long flushSucceeded = 0, flushNoBackends = 0, flushOtherErrors = 0;
};

// From the start signal until every client is done and every event arrived, or, once
// every client has sent everything, until nothing happened for the stall time (no
// arrival, no report), or until the run's time is up.
Window runWindow(const Harness& h, ClientGroup& group, int clients, long expected, long sessionsEnabled,
                 std::int64_t startNs) {
  Window w;
  const std::int64_t deadline = startNs + std::int64_t(h.options.timeoutSeconds) * 1'000'000'000;
  const std::int64_t stallNs = std::int64_t(h.options.stallSeconds) * 1'000'000'000;
  const std::int64_t stall = sessionsEnabled > 0 ? stallNs : std::min(kNoBackendGraceNs, stallNs);
  std::int64_t lastProgressNs = startNs;
  long lastArrived = 0;
  for (;;) {
    for (const Report& report : group.reader().poll(kPollIntervalMs)) {
      lastProgressNs = monotonicNowNs();
      if (report.kind == ReportKind::Failed) {
        w.problem = failedStageText(report.a);
      } else if (report.kind == ReportKind::Info && report.a == static_cast<std::int64_t>(DeliveryInfo::AllSent)) {
        ++w.allSent;
      } else if (report.kind == ReportKind::Info && report.a == static_cast<std::int64_t>(DeliveryInfo::FlushReplied)) {
        switch (static_cast<FlushOutcome>(report.b)) {
          case FlushOutcome::Succeeded:
            ++w.flushSucceeded;
            break;
          case FlushOutcome::NoBackends:
            ++w.flushNoBackends;
            break;
          case FlushOutcome::OtherError:
            ++w.flushOtherErrors;
            break;
        }
      } else if (report.kind == ReportKind::Done) {
        ++w.done;
        w.refused += report.b;
        w.lastDoneNs = std::max(w.lastDoneNs, report.a);
      }
    }
    if (!w.problem.empty()) return w;
    const auto counts = h.collector.counts();
    if (counts.benchEvents != lastArrived) {
      lastArrived = counts.benchEvents;
      lastProgressNs = std::max(lastProgressNs, counts.lastArrivalNs);
    }
    const std::int64_t now = monotonicNowNs();
    if (w.done == clients && counts.benchEvents >= expected) return w;
    // Incomplete (nothing or not everything arrived, or a flush reply is missing): the
    // caller reports what arrived.
    if (w.allSent == clients && now - lastProgressNs > stall) return w;
    if (w.done < clients && group.reader().ended()) {
      w.problem = "a client ended before it was done";
      return w;
    }
    if (now > deadline) {
      w.problem = "the run took longer than " + std::to_string(h.options.timeoutSeconds) + " s";
      return w;
    }
  }
}

// gzipDeflate alone over the kept documents, repeated until it has run long enough to
// time; CPU time of this thread.
GzipCost measureGzip(const DeliveryCollector::KeptBodies& kept) {
  GzipCost cost;
  if (kept.bodies.empty() || kept.benchEvents == 0) return cost;
  auto threadCpu = [] {
    timespec t{};
    ::clock_gettime(CLOCK_THREAD_CPUTIME_ID, &t);
    return static_cast<double>(t.tv_sec) + static_cast<double>(t.tv_nsec) / 1e9;
  };
  int passes = 0;
  const double start = threadCpu();
  double elapsed = 0;
  do {
    long long in = 0, out = 0;
    for (const auto& body : kept.bodies) {
      auto compressed = gzipDeflate(std::string_view(body));
      in += static_cast<long long>(body.size());
      out += compressed ? static_cast<long long>(compressed->size()) : 0;
    }
    cost.inputBytes = in;
    cost.outputBytes = out;
    ++passes;
    elapsed = threadCpu() - start;
  } while (elapsed < kGzipMinimumCpuSeconds);
  cost.documents = static_cast<long>(kept.bodies.size());
  cost.events = kept.benchEvents;
  cost.cpuSeconds = elapsed / passes;
  return cost;
}

// Ends the clients (killing those that are still waiting, for a flush reply say) and
// the daemon, and reads what they leave behind.
void finishRun(RunResult& run, BenchDaemon& daemon, ClientGroup& group, bool clientsDone,
               std::vector<std::string>* errors) {
  group.closeGo();
  group.release();
  if (!clientsDone) group.killAll();
  group.reapAll();
  run.clientCpuSeconds = group.cpuSeconds();
  if (run.ok && clientsDone && group.failures() > 0) {
    run.ok = false;
    run.problem = std::to_string(group.failures()) + " client process(es) did not exit cleanly";
  }
  run.daemonExitStatus = daemon.stop(kDaemonStopTimeout);
  if (run.ok && run.daemonExitStatus != 0) {
    run.ok = false;
    run.problem = "the daemon exited with status " + std::to_string(run.daemonExitStatus);
  }
  run.errorLines = daemon.countLogLinesContaining("<error>");
  if (errors) *errors = firstErrorLines(daemon);
}

DeliveryLoadResult runLoad(const Harness& h, const std::string& name, int clients, long eventsPerClient) {
  DeliveryLoadResult result;
  RunResult& run = result.run;
  run.level = h.options.level;
  run.clients = clients;
  run.eventsPerClient = eventsPerClient;
  std::string problem;
  auto daemon = startDaemon(h, name, &problem);
  if (!daemon) {
    run.problem = problem;
    return result;
  }
  h.collector.beginRun(run.totalEvents(), static_cast<std::size_t>(h.options.keepMiB) << 20);
  ClientGroup group;
  if (!group.openPipes()) {
    run.problem = std::string("pipe: ") + std::strerror(errno);
    return result;
  }
  for (int index = 0; index < clients; ++index) {
    DeliveryClientOptions o;
    o.mode = DeliveryClientMode::Load;
    o.index = index;
    o.events = run.eventsPerClient;
    o.timeoutSeconds = h.options.timeoutSeconds;
    if (!group.spawn(h.self, o)) {
      run.problem = "cannot start the client processes";
      return result;
    }
  }
  group.closeChildEnds();
  auto enabled = waitForReady(group, clients, &problem);
  if (!enabled) {
    run.problem = problem;
    finishRun(run, *daemon, group, false, &result.firstErrorLines);
    return result;
  }
  result.sessionsEnabled = *enabled;
  run.startRepliesWithBackends = static_cast<int>(*enabled);

  const std::optional<double> cpuBefore = daemon->cpuSeconds();
  const double selfBefore = processCpuSeconds(RUSAGE_SELF);
  const std::int64_t startNs = monotonicNowNs();
  group.closeGo();
  Window w = runWindow(h, group, clients, run.totalEvents(), result.sessionsEnabled, startNs);
  const std::optional<double> cpuAfter = daemon->cpuSeconds();
  result.collectorCpuSeconds = processCpuSeconds(RUSAGE_SELF) - selfBefore;
  run.peakResidentKiB = daemon->peakResidentKiB().value_or(-1);
  result.counts = h.collector.counts();
  result.collectorThreads = h.options.collectorThreads;
  result.flushSucceeded = w.flushSucceeded;
  result.flushNoBackends = w.flushNoBackends;
  result.flushOtherErrors = w.flushOtherErrors;
  run.refusedSends = w.refused;
  if (w.lastDoneNs > 0) result.lastFlushReplySeconds = secondsBetween(startNs, w.lastDoneNs);
  run.ok = w.problem.empty();
  run.problem = w.problem;
  if (run.ok && run.refusedSends > 0) {
    run.ok = false;
    run.problem = std::to_string(run.refusedSends) + " sends were refused by the client library";
  }
  if (run.ok && (!cpuBefore || !cpuAfter)) {
    run.ok = false;
    run.problem = "cannot read the daemon's CPU time from /proc";
  }
  if (run.ok && result.allArrived()) {
    run.wallSeconds = secondsBetween(startNs, result.counts.targetReachedNs);
    run.daemonCpuSeconds = *cpuAfter - *cpuBefore;
  }
  finishRun(run, *daemon, group, w.done == clients, &result.firstErrorLines);
  result.gzip = measureGzip(h.collector.takeKeptBodies());
  return result;
}

DeliveryRealtimeResult runRealtime(const Harness& h) {
  DeliveryRealtimeResult result;
  RunResult& run = result.run;
  run.level = h.options.level;
  run.clients = 1;
  run.eventsPerClient = h.options.realtimeEvents;
  result.ratePerSecond = h.options.realtimeRate;
  std::string problem;
  auto daemon = startDaemon(h, "realtime", &problem);
  if (!daemon) {
    run.problem = problem;
    return result;
  }
  h.collector.beginRun(run.totalEvents(), 0);
  ClientGroup group;
  if (!group.openPipes()) {
    run.problem = std::string("pipe: ") + std::strerror(errno);
    return result;
  }
  DeliveryClientOptions o;
  o.mode = DeliveryClientMode::Realtime;
  o.events = run.eventsPerClient;
  o.ratePerSecond = h.options.realtimeRate;
  o.timeoutSeconds = h.options.timeoutSeconds;
  if (!group.spawn(h.self, o)) {
    run.problem = "cannot start the client process";
    return result;
  }
  group.closeChildEnds();
  auto enabled = waitForReady(group, 1, &problem);
  if (!enabled) {
    run.problem = problem;
    finishRun(run, *daemon, group, false, &result.firstErrorLines);
    return result;
  }
  result.sessionsEnabled = *enabled;
  run.startRepliesWithBackends = static_cast<int>(*enabled);

  const std::optional<double> cpuBefore = daemon->cpuSeconds();
  const std::int64_t startNs = monotonicNowNs();
  group.closeGo();
  Window w = runWindow(h, group, 1, run.totalEvents(), result.sessionsEnabled, startNs);
  const std::optional<double> cpuAfter = daemon->cpuSeconds();
  run.peakResidentKiB = daemon->peakResidentKiB().value_or(-1);
  result.counts = h.collector.counts();
  result.collectorThreads = h.options.collectorThreads;
  result.latenciesNs = h.collector.realtimeLatenciesNs();
  std::sort(result.latenciesNs.begin(), result.latenciesNs.end());
  run.refusedSends = w.refused;
  run.ok = w.problem.empty();
  run.problem = w.problem;
  if (run.ok && run.refusedSends > 0) {
    run.ok = false;
    run.problem = std::to_string(run.refusedSends) + " sends were refused by the client library";
  }
  if (run.ok && result.allArrived() && cpuBefore && cpuAfter) {
    run.wallSeconds = secondsBetween(startNs, result.counts.targetReachedNs);
    run.daemonCpuSeconds = *cpuAfter - *cpuBefore;
  }
  finishRun(run, *daemon, group, w.done == 1, &result.firstErrorLines);
  return result;
}

DeliveryIdleResult runIdle(const Harness& h) {
  DeliveryIdleResult result;
  result.level = h.options.level;
  result.processes = h.options.idleProcesses;
  result.sessions = h.options.idleSessions;
  std::string problem;
  auto daemon = startDaemon(h, "idle", &problem);
  if (!daemon) {
    result.problem = problem;
    return result;
  }
  h.collector.beginRun(0, 0);
  result.baselineResidentKiB = daemon->residentKiB().value_or(-1);
  ClientGroup group;
  if (!group.openPipes()) {
    result.problem = std::string("pipe: ") + std::strerror(errno);
    return result;
  }
  // Each process opens one session per component type, from the first type the client
  // library accepts: with at most five processes no type has more than five sessions.
  const int perProcess = (result.sessions + result.processes - 1) / result.processes;
  int processes = 0;
  for (int index = 0, left = result.sessions; left > 0; ++index) {
    DeliveryClientOptions o;
    o.mode = DeliveryClientMode::Idle;
    o.index = index;
    o.sessions = std::min(perProcess, left);
    o.firstComponentType = kFirstClientComponentType;
    o.timeoutSeconds = h.options.timeoutSeconds;
    left -= o.sessions;
    if (!group.spawn(h.self, o)) {
      result.problem = "cannot start the client processes";
      return result;
    }
    ++processes;
  }
  result.processes = processes;
  group.closeChildEnds();
  RunResult run;
  run.ok = true;
  auto enabled = waitForReady(group, processes, &problem);
  if (!enabled) {
    run.ok = false;
    run.problem = problem;
  } else {
    result.sessionsEnabled = *enabled;
    // Let the configuration's after-work (storebag saves, helper start) settle.
    std::this_thread::sleep_for(std::chrono::seconds(1));
    result.residentKiB = daemon->residentKiB().value_or(-1);
    result.peakResidentKiB = daemon->peakResidentKiB().value_or(-1);
  }
  finishRun(run, *daemon, group, run.ok, nullptr);
  result.ok = run.ok;
  result.problem = run.problem;
  result.daemonExitStatus = run.daemonExitStatus;
  result.errorLines = run.errorLines;
  return result;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc > 1 && std::strcmp(argv[1], "--delivery-client") == 0) {
    auto clientOptions = parseDeliveryClientArguments(argc, argv, 2);
    return clientOptions ? runDeliveryClient(*clientOptions) : 2;
  }
  auto options = parseOptions(argc, argv);
  if (!options) {
    printUsage();
    return 2;
  }
  auto prelude = prepareBenchRun(options->daemon, "telvane-delivery-bench");
  if (!prelude) return 1;
  const std::string& self = prelude->self;
  const std::string& scratch = prelude->scratch;
  // This process's own use of the libraries (signing, gzipDeflate for the comparison)
  // logs at info level; those lines would be timed with the compression.
  log::setLevel(log::Level::Error);

  const std::string certificateFile = scratch + "/collector-cert.pem";
  const std::string keyFile = scratch + "/collector-key.pem";
  std::string problem;
  if (!writeSelfSignedCertificate(certificateFile, keyFile, &problem)) {
    std::fprintf(stderr, "certificate: %s\n", problem.c_str());
    return 1;
  }
  auto collector = DeliveryCollector::start(certificateFile, keyFile, options->collectorThreads, &problem);
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
  storebag.eventThreshold = options->eventThreshold;
  storebag.overrideConsent = !options->consent;
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

  DeliveryReportHeader header;
  header.daemon = options->daemon;
  header.level = options->level;
  header.collectorURL = collector->url("");
  header.consent = options->consent;
  header.eventThreshold = options->eventThreshold.value_or(-1);
  header.collectorThreads = options->collectorThreads;
  printDeliveryHeader(header);

  Harness harness{*options, self, scratch, *collector, certificateFile, publicKeyFile};
  std::vector<DeliveryLoadResult> loads;
  std::vector<DeliveryRealtimeResult> realtimes;
  std::vector<DeliveryIdleResult> idles;
  if (options->runs.count("load")) {
    long single = options->eventsSingle.value_or(kCalibrationEvents);
    long multi = options->eventsMulti.value_or(kCalibrationEvents / 2);
    if (!options->eventsSingle || !options->eventsMulti) {
      std::printf("calibration ");
      DeliveryLoadResult calibration = runLoad(harness, "calibration", 1, kCalibrationEvents);
      printLoadRun(calibration);
      if (calibration.run.ok && calibration.allArrived() && calibration.run.wallSeconds > 0) {
        const double perRun = calibration.run.eventsPerSecond() * options->runSeconds;
        const long total = std::clamp(static_cast<long>(perRun), kCalibrationEvents, kMaximumEventsPerRun);
        const int most = *std::max_element(options->clients.begin(), options->clients.end());
        single = options->eventsSingle.value_or(total);
        multi = options->eventsMulti.value_or(std::max(kMinimumEventsPerClient, total / std::max(most, 1)));
        std::printf(
            "sized from the calibration (%.0f events/s, runs of about %d s): %ld events with one client,\n"
            "%ld per client with several\n\n",
            calibration.run.eventsPerSecond(), options->runSeconds, single, multi);
      } else {
        std::printf(
            "the calibration delivered nothing measurable: the load runs keep %ld and %ld events per client\n\n",
            single, multi);
      }
    }
    for (int clients : options->clients) {
      loads.push_back(runLoad(harness, "load-" + std::to_string(clients), clients, clients == 1 ? single : multi));
      printLoadRun(loads.back());
    }
  }
  if (options->runs.count("realtime")) {
    realtimes.push_back(runRealtime(harness));
    printRealtimeRun(realtimes.back());
  }
  if (options->runs.count("idle")) {
    idles.push_back(runIdle(harness));
    printIdleRun(idles.back());
  }
  const bool allOk = printDeliverySummary(loads, realtimes, idles);
  collector->stop();
  if (options->keep) {
    std::printf("scratch directory kept: %s\n", scratch.c_str());
  } else {
    std::error_code ignored;
    std::filesystem::remove_all(scratch, ignored);
  }
  return allOk ? 0 : 1;
}
