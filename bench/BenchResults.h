// BenchResults: what one run of the IPC load benchmark measured, the checks that make
// a run count, and the printed report. Plain data and printing; used by the
// benchmark's main thread only.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace telvane::bench {

// The daemon CPU time one event may cost on the pure IPC and dispatch path.
inline constexpr double kDaemonCpuBudgetMicrosecondsPerEvent = 5.0;

struct RunResult {
  std::string level;  // the daemon's TELVANE_LOG_LEVEL
  int clients = 0;
  long eventsPerClient = 0;

  bool ok = false;
  std::string problem;

  std::int64_t lastFlushReplyNs = 0;
  double wallSeconds = 0;
  double daemonCpuSeconds = 0;
  long peakResidentKiB = -1;
  double clientCpuSeconds = 0;  // whole lifetimes of all client processes
  int startRepliesWithBackends = 0;
  long refusedSends = 0;
  int daemonExitStatus = -1;
  std::size_t noBackendLines = 0;  // "sendMessageWithDictionary: No backends ..." in the daemon log
  std::size_t errorLines = 0;      // error lines in the daemon log

  long totalEvents() const { return eventsPerClient * clients; }
  double eventsPerSecond() const { return wallSeconds > 0 ? static_cast<double>(totalEvents()) / wallSeconds : 0; }
  double daemonCpuMicrosecondsPerEvent() const { return daemonCpuSeconds * 1e6 / static_cast<double>(totalEvents()); }
  double clientCpuMicrosecondsPerEvent() const { return clientCpuSeconds * 1e6 / static_cast<double>(totalEvents()); }
};

// Checks what the run must show to count (clean exits, nothing refused, every event
// logged by an info-level daemon) and marks the run failed otherwise.
void verifyRun(RunResult& result);

void printHeader(const std::string& daemon, const std::vector<std::string>& wrapper,
                 const std::vector<std::string>& attach);
void printRun(const RunResult& result);
// The table of all runs and the verdict on the CPU budget (none for a daemon run
// under a wrapper, whose CPU time says nothing about the daemon's own); false when a
// run failed.
bool printSummary(const std::vector<RunResult>& results, bool wrapped);

}  // namespace telvane::bench
