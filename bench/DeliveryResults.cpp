#include "DeliveryResults.h"

#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <thread>

namespace telvane::bench {

namespace {

double mib(long kib) { return static_cast<double>(kib) / 1024.0; }

void printArrivals(const DeliveryCollector::Counts& c, long expected, int collectorThreads) {
  std::printf("  events arrived at the collector:             %ld of %ld%s\n", c.benchEvents, expected,
              c.benchEvents == 0         ? "  <-- 0 events arrived"
              : c.benchEvents < expected ? "  <-- INCOMPLETE"
                                         : "");
  std::printf(
      "  posts: %ld batched, %ld realtime (%ld gzip) over %ld connections, %ld records, %lld bytes posted,\n"
      "         %lld bytes of JSON%s\n",
      c.batchPosts, c.realtimePosts, c.gzipPosts, c.connections, c.records, c.wireBytes, c.jsonBytes,
      c.badBodies ? " (some bodies did not decompress)" : "");
  // The count is of the whole run, not of connections open at once; near the number of
  // workers it may mean that posts waited for a worker.
  if (c.connections >= collectorThreads / 2) {
    std::printf(
        "  WARNING: the daemon opened %ld connections, the collector has %d workers (one per open\n"
        "  connection): posts may have waited for a worker (raise --collector-threads)\n",
        c.connections, collectorThreads);
  }
  if (c.benchEvents > 0) {
    std::printf("  per event: %.1f bytes posted, %.1f bytes of JSON; %.1f events per post\n",
                static_cast<double>(c.wireBytes) / static_cast<double>(c.benchEvents),
                static_cast<double>(c.jsonBytes) / static_cast<double>(c.benchEvents),
                static_cast<double>(c.benchEvents) / static_cast<double>(std::max(1L, c.batchPosts + c.realtimePosts)));
  }
}

void printNothingArrived(long sessionsEnabled, const std::vector<std::string>& errors) {
  if (sessionsEnabled == 0) {
    std::printf(
        "  no start reply listed the HTTPS post backend \"brindle\": the daemon made no backend of the\n"
        "  storebag entry (is the HTTPS post backend built into telvaned and its factory in use?)\n");
  }
  for (const auto& line : errors) std::printf("  daemon error: %s\n", line.c_str());
}

std::string fixed(double value, int decimals) {
  char text[32];
  std::snprintf(text, sizeof text, "%.*f", decimals, value);
  return text;
}

// "ok" only when the run worked and every event arrived.
std::string outcome(bool ok, const std::string& problem, long arrived, long expected) {
  if (!ok) return "FAILED: " + problem;
  if (arrived >= expected) return "ok";
  if (arrived == 0) return "0 events arrived";
  return "INCOMPLETE: " + std::to_string(arrived) + " of " + std::to_string(expected) + " events arrived";
}

const char* verdict(bool measured, bool within) { return !measured ? "not measured" : within ? "yes" : "NO"; }

void printTarget(const char* label, const char* verdictText, const std::string& detail) {
  std::printf("  %-52s %s%s%s%s\n", label, verdictText, detail.empty() ? "" : " (", detail.c_str(),
              detail.empty() ? "" : ")");
}

}  // namespace

double DeliveryRealtimeResult::percentileMs(double fraction) const {
  if (latenciesNs.empty()) return 0;
  const std::size_t rank = static_cast<std::size_t>(std::ceil(fraction * static_cast<double>(latenciesNs.size())));
  const std::size_t index = std::min(latenciesNs.size() - 1, rank == 0 ? 0 : rank - 1);
  return static_cast<double>(latenciesNs[index]) / 1e6;
}

void printDeliveryHeader(const DeliveryReportHeader& h) {
  std::printf("telvane delivery load benchmark\n");
  std::printf("  daemon:        %s\n", h.daemon.c_str());
  std::printf("  daemon log:    level %s\n", h.level.c_str());
  std::printf("  collector:     %s (storebag server and event collector, %d worker threads, in this process)\n",
              h.collectorURL.c_str(), h.collectorThreads);
  std::printf(
      "  storebag:      \"confera\" (and every other name), backend \"brindle\" in all four environments,\n"
      "                 one client rule, sampling threshold 1, batching on (expedite 0), event threshold %s,\n"
      "                 %s\n",
      h.eventThreshold < 0 ? "default (49)" : std::to_string(h.eventThreshold).c_str(),
      h.consent ? "diagnostics consent given (readable copies and the message log are written)"
                : "no diagnostics consent, override_dnu 1 (no readable copies, no message log)");
  std::printf("  CPUs online:   %ld, clock ticks per second: %ld\n", ::sysconf(_SC_NPROCESSORS_ONLN),
              ::sysconf(_SC_CLK_TCK));
  std::printf(
      "  event:         payload of 10 keys (4 strings, 5 integers, 1 double; realtime: the send time\n"
      "                 instead of one integer), component type 7, user information set\n\n");
  std::fflush(stdout);
}

void printLoadRun(const DeliveryLoadResult& r) {
  const RunResult& run = r.run;
  std::printf("load run: %d client process%s x %ld events (daemon log level %s)\n", run.clients,
              run.clients == 1 ? "" : "es", run.eventsPerClient, run.level.c_str());
  std::printf("  sessions with the HTTPS post backend enabled: %ld of %d\n", r.sessionsEnabled, run.clients);
  const long missing = run.clients - (r.flushSucceeded + r.flushNoBackends + r.flushOtherErrors);
  std::printf("  flush replies: %ld ok, %ld \"No backends\", %ld other errors", r.flushSucceeded, r.flushNoBackends,
              r.flushOtherErrors);
  if (missing > 0) std::printf(", %ld never came", missing);
  if (r.lastFlushReplySeconds > 0) std::printf("; last after %.3f s", r.lastFlushReplySeconds);
  std::printf("\n");
  printArrivals(r.counts, run.totalEvents(), r.collectorThreads);
  if (r.allArrived() && run.wallSeconds > 0) {
    std::printf("  wall time, start signal to last arrival:     %.3f s\n", run.wallSeconds);
    std::printf("  events per second delivered:                 %.0f\n", run.eventsPerSecond());
    std::printf("  daemon CPU during the run:                   %.2f s\n", run.daemonCpuSeconds);
    std::printf("  daemon CPU per event:                        %.2f us\n", run.daemonCpuMicrosecondsPerEvent());
    std::printf("  collector (this process) CPU per event:      %.2f us\n",
                r.collectorCpuSeconds * 1e6 / static_cast<double>(run.totalEvents()));
    std::printf("  client CPU per event (whole processes):      %.2f us\n", run.clientCpuMicrosecondsPerEvent());
  } else if (r.counts.benchEvents == 0) {
    printNothingArrived(r.sessionsEnabled, r.firstErrorLines);
  }
  std::printf("  daemon peak RSS (VmHWM):                     %ld KiB (%.1f MiB)\n", run.peakResidentKiB,
              mib(run.peakResidentKiB));
  if (r.gzip.measured()) {
    std::printf("  gzipDeflate alone on %ld of the posted JSON documents (%lld -> %lld bytes, %ld events):\n",
                r.gzip.documents, r.gzip.inputBytes, r.gzip.outputBytes, r.gzip.events);
    std::printf("    %.3f us CPU per event", r.gzip.microsecondsPerEvent());
    if (r.allArrived() && run.wallSeconds > 0) std::printf("; daemon CPU per event is %.1f x that", r.cpuOverGzip());
    std::printf("\n");
  }
  std::printf("  daemon log: %zu error lines; exit status %d\n", run.errorLines, run.daemonExitStatus);
  std::printf("  result: %s\n\n", outcome(run.ok, run.problem, r.counts.benchEvents, run.totalEvents()).c_str());
  std::fflush(stdout);
}

void printRealtimeRun(const DeliveryRealtimeResult& r) {
  const RunResult& run = r.run;
  std::printf("realtime run: 1 client process x %ld realtime events at %ld per second (daemon log level %s)\n",
              run.eventsPerClient, r.ratePerSecond, run.level.c_str());
  std::printf("  sessions with the HTTPS post backend enabled: %ld of 1\n", r.sessionsEnabled);
  printArrivals(r.counts, run.totalEvents(), r.collectorThreads);
  if (!r.latenciesNs.empty()) {
    std::printf("  send-to-arrival latency (%zu events): p50 %.3f ms, p90 %.3f ms, p99 %.3f ms, max %.3f ms\n",
                r.latenciesNs.size(), r.percentileMs(0.5), r.percentileMs(0.9), r.percentileMs(0.99),
                static_cast<double>(r.latenciesNs.back()) / 1e6);
  }
  if (r.allArrived() && run.wallSeconds > 0) {
    std::printf("  daemon CPU per realtime event:               %.2f us\n", run.daemonCpuMicrosecondsPerEvent());
  } else if (r.counts.benchEvents == 0) {
    printNothingArrived(r.sessionsEnabled, r.firstErrorLines);
  }
  std::printf("  daemon peak RSS (VmHWM):                     %ld KiB (%.1f MiB)\n", run.peakResidentKiB,
              mib(run.peakResidentKiB));
  std::printf("  daemon log: %zu error lines; exit status %d\n", run.errorLines, run.daemonExitStatus);
  std::printf("  result: %s\n\n", outcome(run.ok, run.problem, r.counts.benchEvents, run.totalEvents()).c_str());
  std::fflush(stdout);
}

void printIdleRun(const DeliveryIdleResult& r) {
  std::printf("idle run: %d sessions in %d client processes, configured and idle (daemon log level %s)\n", r.sessions,
              r.processes, r.level.c_str());
  std::printf("  sessions with the HTTPS post backend enabled: %ld of %d\n", r.sessionsEnabled, r.sessions);
  std::printf("  daemon RSS before the first session:         %ld KiB (%.1f MiB)\n", r.baselineResidentKiB,
              mib(r.baselineResidentKiB));
  std::printf("  daemon RSS (VmRSS) with the sessions idle:   %ld KiB (%.1f MiB)\n", r.residentKiB, mib(r.residentKiB));
  std::printf("  daemon peak RSS (VmHWM) by then:             %ld KiB (%.1f MiB)\n", r.peakResidentKiB,
              mib(r.peakResidentKiB));
  if (r.sessions > 0 && r.residentKiB >= 0 && r.baselineResidentKiB >= 0) {
    std::printf("  per session:                                 %.1f KiB\n",
                static_cast<double>(r.residentKiB - r.baselineResidentKiB) / r.sessions);
  }
  std::printf("  daemon log: %zu error lines; exit status %d\n", r.errorLines, r.daemonExitStatus);
  std::printf("  result: %s%s\n\n", r.ok ? "ok" : "FAILED: ", r.ok ? "" : r.problem.c_str());
  std::fflush(stdout);
}

bool printDeliverySummary(const std::vector<DeliveryLoadResult>& loads,
                          const std::vector<DeliveryRealtimeResult>& realtimes,
                          const std::vector<DeliveryIdleResult>& idles) {
  bool allOk = true;
  std::printf("summary\n");
  std::printf("%-9s %7s %9s %9s %9s %10s %9s %10s %9s %9s  %s\n", "run", "clients", "events", "arrived", "wall s",
              "events/s", "dCPU us", "gzip us", "dCPU/gz", "dRSS MiB", "result");
  const DeliveryLoadResult* four = nullptr;
  for (const auto& r : loads) {
    const bool delivered = r.run.ok && r.allArrived();
    allOk = allOk && delivered;
    if (r.run.clients == 4) four = &r;
    if (delivered) {
      std::printf("%-9s %7d %9ld %9ld %9.3f %10.0f %9.2f %10.3f %9.1f %9.1f  ok\n", "load", r.run.clients,
                  r.run.totalEvents(), r.counts.benchEvents, r.run.wallSeconds, r.run.eventsPerSecond(),
                  r.run.daemonCpuMicrosecondsPerEvent(), r.gzip.measured() ? r.gzip.microsecondsPerEvent() : 0.0,
                  r.cpuOverGzip(), mib(r.run.peakResidentKiB));
    } else {
      std::printf("%-9s %7d %9ld %9ld %9s %10s %9s %10s %9s %9.1f  %s\n", "load", r.run.clients, r.run.totalEvents(),
                  r.counts.benchEvents, "-", "-", "-", "-", "-", mib(r.run.peakResidentKiB),
                  r.counts.benchEvents == 0 ? "0 events arrived"
                  : r.run.ok                ? "INCOMPLETE"
                                            : "FAILED");
    }
  }
  const DeliveryRealtimeResult* realtime = realtimes.empty() ? nullptr : &realtimes.front();
  for (const auto& r : realtimes) {
    const bool delivered = r.run.ok && r.allArrived();
    allOk = allOk && delivered;
    std::printf("%-9s %7d %9ld %9ld %9s %10s %9s %10s %9s %9.1f  %s", "realtime", r.run.clients, r.run.totalEvents(),
                r.counts.benchEvents, "-", "-",
                delivered ? fixed(r.run.daemonCpuMicrosecondsPerEvent(), 2).c_str() : "-", "-", "-",
                mib(r.run.peakResidentKiB),
                delivered                   ? "ok"
                : r.counts.benchEvents == 0 ? "0 events arrived"
                : r.run.ok                  ? "INCOMPLETE"
                                            : "FAILED");
    if (!r.latenciesNs.empty()) std::printf(" (p50 %.3f ms, p99 %.3f ms)", r.percentileMs(0.5), r.percentileMs(0.99));
    std::printf("\n");
  }
  const DeliveryIdleResult* idle = idles.empty() ? nullptr : &idles.front();
  for (const auto& r : idles) {
    allOk = allOk && r.ok;
    std::printf("%-9s %7d %9s %9s %9s %10s %9s %10s %9s %9.1f  %s (%d sessions, %ld with the backend)\n", "idle",
                r.processes, "-", "-", "-", "-", "-", "-", "-", mib(r.residentKiB), r.ok ? "ok" : "FAILED", r.sessions,
                r.sessionsEnabled);
  }
  std::printf(
      "(dCPU: daemon user+system CPU per event during the window; gzip: gzipDeflate alone per event on the\n"
      " same JSON documents; dRSS: VmHWM for load and realtime runs, VmRSS for the idle run; MiB = 2^20 bytes)\n");

  std::printf("targets\n");
  char label[96];
  const bool fourDelivered = four && four->run.ok && four->allArrived();
  std::snprintf(label, sizeof label, ">= %.0f events/s delivered with 4 clients",
                kTargetEventsPerSecondWithFourClients);
  printTarget(
      label,
      verdict(fourDelivered, fourDelivered && four->run.eventsPerSecond() >= kTargetEventsPerSecondWithFourClients),
      fourDelivered ? fixed(four->run.eventsPerSecond(), 0) + " events/s" : "");
  const bool ratioMeasured = fourDelivered && four->gzip.measured();
  std::snprintf(label, sizeof label, "daemon CPU per event <= %.0f x gzip alone (4 clients)",
                kTargetCpuPerEventOverGzip);
  printTarget(label, verdict(ratioMeasured, ratioMeasured && four->cpuOverGzip() <= kTargetCpuPerEventOverGzip),
              ratioMeasured
                  ? fixed(four->run.daemonCpuMicrosecondsPerEvent(), 2) + " us vs " +
                        fixed(four->gzip.microsecondsPerEvent(), 3) + " us: " + fixed(four->cpuOverGzip(), 1) + " x"
                  : "");
  const bool realtimeMeasured = realtime && realtime->run.ok && realtime->allArrived();
  std::snprintf(label, sizeof label, "realtime p99 < %.0f ms", kTargetRealtimeP99Ms);
  printTarget(label, verdict(realtimeMeasured, realtimeMeasured && realtime->percentileMs(0.99) < kTargetRealtimeP99Ms),
              realtimeMeasured ? fixed(realtime->percentileMs(0.99), 3) + " ms at " +
                                     std::to_string(realtime->ratePerSecond) + " events/s"
                               : "");
  // Sessions without the backend hold less: only a run where every session got it counts.
  const bool idleMeasured =
      idle && idle->ok && idle->sessions >= kTargetIdleSessions && idle->sessionsEnabled == idle->sessions;
  std::snprintf(label, sizeof label, "RSS < %.0f MiB with %d idle sessions", kTargetIdleResidentMiB,
                kTargetIdleSessions);
  printTarget(label, verdict(idleMeasured, idleMeasured && mib(idle->residentKiB) < kTargetIdleResidentMiB),
              idleMeasured ? fixed(mib(idle->residentKiB), 1) + " MiB, " + std::to_string(idle->sessionsEnabled) +
                                 " of the sessions with the backend"
                           : "");
  std::snprintf(label, sizeof label, "peak RSS < %.0f MiB at full load (4 clients)", kTargetPeakResidentMiB);
  printTarget(label, verdict(fourDelivered, fourDelivered && mib(four->run.peakResidentKiB) < kTargetPeakResidentMiB),
              fourDelivered ? fixed(mib(four->run.peakResidentKiB), 1) + " MiB" : "");
  std::printf(
      "machine: %u hardware threads shared by the daemon, the clients and the collector; events/s and\n"
      "latencies are bounded by all three\n",
      std::thread::hardware_concurrency());
  std::fflush(stdout);
  return allOk;
}

}  // namespace telvane::bench
