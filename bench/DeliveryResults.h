// DeliveryResults: what the delivery benchmark measured, the printed report and the
// verdicts against its targets. The common per-run numbers live in BenchResults'
// RunResult; the delivery-specific ones (what the collector saw, latencies, the gzip
// comparison, idle memory) are added here. Plain data and printing; used by the
// benchmark's main thread only.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "BenchResults.h"
#include "DeliveryCollector.h"

namespace telvane::bench {

// Targets.
inline constexpr double kTargetEventsPerSecondWithFourClients = 100'000;
inline constexpr double kTargetCpuPerEventOverGzip = 2.0;
inline constexpr double kTargetRealtimeP99Ms = 2.0;
inline constexpr double kTargetIdleResidentMiB = 30;
inline constexpr int kTargetIdleSessions = 100;
inline constexpr double kTargetPeakResidentMiB = 64;

// gzipDeflate alone over the JSON batches the collector received.
struct GzipCost {
  long events = 0;               // benchmark events in the compressed documents
  long documents = 0;
  long long inputBytes = 0;
  long long outputBytes = 0;
  double cpuSeconds = 0;         // CPU time of the compressing thread

  bool measured() const { return events > 0; }
  double microsecondsPerEvent() const { return cpuSeconds * 1e6 / static_cast<double>(events); }
};

struct DeliveryLoadResult {
  RunResult run;  // wallSeconds: start signal to the arrival of the last event
  long sessionsEnabled = 0;     // start replies that listed the HTTPS post backend
  long flushSucceeded = 0;
  long flushNoBackends = 0;
  long flushOtherErrors = 0;
  double lastFlushReplySeconds = 0;  // after the start signal
  double collectorCpuSeconds = 0;    // this process (collector and driver) during the window
  DeliveryCollector::Counts counts;
  int collectorThreads = 0;
  GzipCost gzip;
  std::vector<std::string> firstErrorLines;  // of the daemon's log

  bool allArrived() const { return counts.benchEvents >= run.totalEvents(); }
  double cpuOverGzip() const {
    return gzip.measured() && gzip.microsecondsPerEvent() > 0
               ? run.daemonCpuMicrosecondsPerEvent() / gzip.microsecondsPerEvent()
               : 0;
  }
};

struct DeliveryRealtimeResult {
  RunResult run;  // eventsPerClient: realtime events sent; wallSeconds: start to last arrival
  long sessionsEnabled = 0;
  long ratePerSecond = 0;
  DeliveryCollector::Counts counts;
  int collectorThreads = 0;
  std::vector<std::int64_t> latenciesNs;  // sorted
  std::vector<std::string> firstErrorLines;

  bool allArrived() const { return counts.benchEvents >= run.totalEvents(); }
  // The latency below which the given fraction of the events arrived (nearest rank).
  double percentileMs(double fraction) const;
};

struct DeliveryIdleResult {
  bool ok = false;
  std::string problem;
  std::string level;
  int processes = 0;
  int sessions = 0;
  long sessionsEnabled = 0;
  long baselineResidentKiB = -1;  // VmRSS before the first session
  long residentKiB = -1;          // VmRSS with every session open and idle
  long peakResidentKiB = -1;      // VmHWM then
  int daemonExitStatus = -1;
  std::size_t errorLines = 0;
};

struct DeliveryReportHeader {
  std::string daemon;
  std::string level;
  std::string collectorURL;
  bool consent = false;
  int eventThreshold = -1;  // -1: the backend's default
  int collectorThreads = 0;
};

void printDeliveryHeader(const DeliveryReportHeader& header);
void printLoadRun(const DeliveryLoadResult& result);
void printRealtimeRun(const DeliveryRealtimeResult& result);
void printIdleRun(const DeliveryIdleResult& result);
// The table of the runs and the verdicts against the targets; false when a run failed
// or events did not arrive.
bool printDeliverySummary(const std::vector<DeliveryLoadResult>& loads,
                          const std::vector<DeliveryRealtimeResult>& realtimes,
                          const std::vector<DeliveryIdleResult>& idles);

}  // namespace telvane::bench
