// DeliveryClient: the client processes of the delivery benchmark (the benchmark runs
// itself with --delivery-client). Each opens reporting sessions through the client
// library, with the user information the benchmark's storebag rule names, and reports
// to the driver over the shared report pipe of BenchClient.h:
//
// - load: one session (batching on); Ready, then on the start signal it sends its
//   events as fast as the library takes them (Info AllSent), flushes (Info
//   FlushReplied with the outcome) and reports Done with the moment the flush reply
//   came;
// - realtime: one session; on the start signal it sends realtime events at a steady
//   rate, each carrying its send time, and reports Info AllSent and Done after the
//   last one;
// - idle: several sessions of consecutive component types, all configured; Ready
//   with how many of them got backends, then nothing until released.
//
// Every mode keeps its sessions open until the driver closes the release pipe, so that
// session teardown (final flushes, end messages) stays out of the measured window.
//
// Threading: runDeliveryClient() runs on the process's main thread; the library's
// completions run on its own threads and only touch synchronised state.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace telvane::bench {

enum class DeliveryClientMode { Load = 1, Realtime = 2, Idle = 3 };

// What an Info report says (in `a`); `b` carries the details.
enum class DeliveryInfo : std::int64_t {
  AllSent = 1,       // b = sends the library refused
  FlushReplied = 2,  // b = the FlushOutcome
};

// The flush reply of a load client.
enum class FlushOutcome : std::int64_t {
  Succeeded = 1,
  NoBackends = 2,  // the daemon's session has no backends
  OtherError = 3,
};

// User information the storebag rule names.
inline constexpr const char* kDeliveryClientName = "benchclient";
inline constexpr const char* kDeliveryServiceName = "com.zembra.bench.delivery";
// Component type of the load and realtime sessions: a client family of the storebag
// "confera". The daemon allows five live sessions of one component type.
inline constexpr long kDeliveryComponentType = 7;
inline constexpr int kMaxSessionsPerComponentType = 5;
// The component types the client library accepts.
inline constexpr long kFirstClientComponentType = 5;
inline constexpr long kLastClientComponentType = 30;
inline constexpr long kDeliveryFirstSessionID = 2000;

struct DeliveryClientOptions {
  DeliveryClientMode mode = DeliveryClientMode::Load;
  int index = 0;
  long events = 0;           // load and realtime
  long ratePerSecond = 0;    // realtime
  int sessions = 1;          // idle
  long firstComponentType = kDeliveryComponentType;  // idle: one session per type from here
  int goFd = -1;             // read end: end of file is the start signal
  int releaseFd = -1;        // read end: end of file lets the client end its sessions
  int reportFd = -1;         // write end of the report pipe
  int timeoutSeconds = 600;
};

// The command-line words that carry the options, and back.
std::vector<std::string> deliveryClientArguments(const DeliveryClientOptions& options);
std::optional<DeliveryClientOptions> parseDeliveryClientArguments(int argc, char** argv, int first);

// Runs one client process; its exit code.
int runDeliveryClient(const DeliveryClientOptions& options);

}  // namespace telvane::bench
