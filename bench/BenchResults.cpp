#include "BenchResults.h"

#include <unistd.h>

#include <cstdio>
#include <thread>

namespace telvane::bench {

namespace {

constexpr const char* kNoBackendsLine = "sendMessageWithDictionary: No backends available to send message";

void markFailed(RunResult& result, const std::string& problem) {
  if (result.ok || result.problem.empty()) result.problem = problem;
  result.ok = false;
}

}  // namespace

void verifyRun(RunResult& result) {
  if (!result.ok) return;
  if (result.refusedSends != 0) {
    markFailed(result, std::to_string(result.refusedSends) + " sends were refused by the client library");
  }
  if (result.startRepliesWithBackends != 0) {
    markFailed(result, "a start reply listed backends: the sessions are not backend-free");
  }
  if (result.daemonExitStatus != 0) {
    markFailed(result, "the daemon exited with status " + std::to_string(result.daemonExitStatus));
  }
  // The line is an info line: a daemon at level info or debug writes it for every
  // event, one at level error never.
  const std::size_t expectedLines = result.level == "error" ? 0 : static_cast<std::size_t>(result.totalEvents());
  if (result.noBackendLines != expectedLines) {
    markFailed(result, "the daemon logged " + std::to_string(result.noBackendLines) + " \"" + kNoBackendsLine +
                           "\" lines, expected " + std::to_string(expectedLines));
  }
}

void printHeader(const std::string& daemon, const std::vector<std::string>& wrapper,
                 const std::vector<std::string>& attach) {
  std::printf("telvane IPC load benchmark\n");
  std::printf("  daemon:        %s\n", daemon.c_str());
  if (!wrapper.empty()) {
    std::string line;
    for (const auto& w : wrapper) line += w + " ";
    std::printf("  wrapper:       %s(CPU and memory are read from the wrapper's process: right only for a\n"
                "                 wrapper that runs the daemon in its own process, like valgrind)\n",
                line.c_str());
  }
  if (!attach.empty()) {
    std::string line;
    for (const auto& a : attach) line += a + " ";
    std::printf("  attached:      %s-p <daemon> (it competes for the CPUs: events/s is lower)\n", line.c_str());
  }
  std::printf("  CPUs online:   %ld, clock ticks per second: %ld\n", ::sysconf(_SC_NPROCESSORS_ONLN),
              ::sysconf(_SC_CLK_TCK));
  std::printf("  sessions:      component type 9, no storebag (no backends); clients log at error level\n");
  std::printf("  event:         sendMessageWithCategory, payload of 10 keys (4 strings, 5 integers, 1 double)\n\n");
  std::fflush(stdout);
}

void printRun(const RunResult& r) {
  std::printf("run: daemon log level %s, %d client process%s x %ld events\n", r.level.c_str(), r.clients,
              r.clients == 1 ? "" : "es", r.eventsPerClient);
  if (r.wallSeconds > 0) {
    std::printf("  wall time, start signal to last flush reply: %.3f s\n", r.wallSeconds);
    std::printf("  events per second (all clients):             %.0f\n", r.eventsPerSecond());
    std::printf("  daemon CPU during the run:                   %.2f s\n", r.daemonCpuSeconds);
    std::printf("  daemon CPU per 100,000 events:               %.3f s\n",
                r.daemonCpuSeconds * 100'000.0 / static_cast<double>(r.totalEvents()));
    std::printf("  daemon CPU per event:                        %.2f us\n", r.daemonCpuMicrosecondsPerEvent());
  }
  std::printf("  daemon peak RSS (VmHWM):                     %ld KiB\n", r.peakResidentKiB);
  std::printf("  client CPU per event (whole client process): %.2f us\n", r.clientCpuMicrosecondsPerEvent());
  std::printf("  daemon log: %zu \"No backends\" lines, %zu error lines; exit status %d\n", r.noBackendLines,
              r.errorLines, r.daemonExitStatus);
  std::printf("  result: %s%s\n\n", r.ok ? "ok" : "FAILED: ", r.ok ? "" : r.problem.c_str());
  std::fflush(stdout);
}

bool printSummary(const std::vector<RunResult>& results, bool wrapped) {
  std::printf("summary\n");
  std::printf("%-6s %7s %9s %8s %10s %9s %12s %9s %9s %10s  %s\n", "level", "clients", "events", "wall s",
              "events/s", "dCPU s", "dCPU s/100k", "dCPU us", "dRSS MiB", "cCPU us", "result");
  bool allOk = true;
  bool withinBudget = true;
  for (const auto& r : results) {
    allOk = allOk && r.ok;
    if (!r.ok) {
      std::printf("%-6s %7d %9ld %8s %10s %9s %12s %9s %9s %10s  FAILED\n", r.level.c_str(), r.clients,
                  r.totalEvents(), "-", "-", "-", "-", "-", "-", "-");
      continue;
    }
    const double perEvent = r.daemonCpuMicrosecondsPerEvent();
    if (r.level == "error") withinBudget = withinBudget && perEvent < kDaemonCpuBudgetMicrosecondsPerEvent;
    std::printf("%-6s %7d %9ld %8.3f %10.0f %9.2f %12.3f %9.2f %9.1f %10.2f  ok\n", r.level.c_str(), r.clients,
                r.totalEvents(), r.wallSeconds, r.eventsPerSecond(), r.daemonCpuSeconds,
                r.daemonCpuSeconds * 100'000.0 / static_cast<double>(r.totalEvents()), perEvent,
                static_cast<double>(r.peakResidentKiB) / 1024.0, r.clientCpuMicrosecondsPerEvent());
  }
  std::printf("(dCPU: daemon user+system CPU during the run; cCPU: client processes' CPU, whole lifetime)\n");
  if (wrapped) {
    std::printf("budget: not judged, the daemon ran under a wrapper\n");
    std::fflush(stdout);
    return allOk;
  }
  std::printf("budget: daemon CPU per event below %.0f us at log level error: %s\n",
              kDaemonCpuBudgetMicrosecondsPerEvent, !allOk ? "unknown (a run failed)" : withinBudget ? "yes" : "NO");
  for (const auto& r : results) {
    if (r.ok && r.level != "error") {
      std::printf("        at log level %s with %d client(s): %.2f us per event, %s\n", r.level.c_str(), r.clients,
                  r.daemonCpuMicrosecondsPerEvent(),
                  r.daemonCpuMicrosecondsPerEvent() < kDaemonCpuBudgetMicrosecondsPerEvent ? "within" : "OVER");
    }
  }
  std::printf("machine: %u hardware threads; clients and daemon share them, so events/s is bounded by both\n",
              std::thread::hardware_concurrency());
  std::fflush(stdout);
  return allOk;
}

}  // namespace telvane::bench
