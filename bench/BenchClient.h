// BenchClient: the client side of the IPC load benchmark, run in its own process (the
// benchmark executes itself with --client). It opens one reporting session through
// the client library, starts its configuration, tells the driver it is ready, waits
// for the start signal, sends its events, flushes and reports the moment the flush
// reply arrived. Reports are fixed-size records written to one pipe shared by all
// clients (each write is smaller than PIPE_BUF, so records never interleave).
//
// Threading: runBenchClient() runs on the process's main thread; the library's
// completions run on its own threads and only touch synchronised state.
#pragma once

#include <cstdint>
#include <optional>

#include "telvane/Error.h"

namespace telvane {
class Telvane;
}

namespace telvane::bench {

enum class ReportKind : std::int32_t {
  Ready = 1,   // started; a = 1 when the start reply carried a list of backends
  Done = 2,    // a = CLOCK_MONOTONIC nanoseconds of the flush reply, b = refused sends
  Failed = 3,  // a = the stage that failed (FailedStage)
  Info = 4,    // a, b: details a benchmark defines for itself (others skip it)
};

enum class FailedStage : std::int64_t {
  Create = 1,
  StartReply = 2,
  FlushReply = 3,
  FlushError = 4,
};

struct Report {
  std::int32_t client = 0;
  ReportKind kind = ReportKind::Ready;
  std::int64_t a = 0;
  std::int64_t b = 0;
};

struct BenchClientOptions {
  int index = 0;
  long events = 0;
  int goFd = -1;      // read end: end of file is the start signal
  int reportFd = -1;  // write end of the report pipe
  int timeoutSeconds = 600;
};

// Writes one report whole to the pipe; nothing when the reader is gone.
void writeReport(int fd, const Report& report);
// CLOCK_MONOTONIC in nanoseconds: the clock of the reports' time stamps, the same in
// every process of the machine.
std::int64_t monotonicNowNs();

// What a flush reply said and when it arrived.
struct FlushReply {
  std::int64_t repliedAtNs = 0;  // monotonicNowNs() at the reply
  std::optional<Error> error;
};
// Flushes the session and waits for the daemon's reply; nothing when none came within
// the time. One connection's calls are handled in order, so the reply comes after the
// daemon has handled every event sent before the flush.
std::optional<FlushReply> flushAndWait(Telvane& client, int timeoutSeconds);

// Runs one client; the process's exit code.
int runBenchClient(const BenchClientOptions& options);

// The component type and the first session identifier the clients use.
inline constexpr long kBenchComponentType = 9;
inline constexpr long kBenchFirstSessionID = 1000;

}  // namespace telvane::bench
