#include "BenchClient.h"

#include <time.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <future>
#include <memory>
#include <optional>

#include "telvane/Telvane.h"
#include "telvane/TelvaneKeys.h"

namespace telvane::bench {

namespace {

constexpr std::uint16_t kBenchCategory = 12;
constexpr std::uint16_t kBenchType = 3;
constexpr auto kStartReplyTimeout = std::chrono::seconds(30);
// The daemon's answer to a flush of a session that has no backends.
constexpr const char* kNoBackendsReply = "No backends available to send message";

std::int64_t monotonicNanoseconds() {
  timespec now{};
  ::clock_gettime(CLOCK_MONOTONIC, &now);
  return static_cast<std::int64_t>(now.tv_sec) * 1'000'000'000 + now.tv_nsec;
}

void sendReport(int fd, const Report& report) {
  const char* data = reinterpret_cast<const char*>(&report);
  std::size_t done = 0;
  while (done < sizeof report) {
    ssize_t n = ::write(fd, data + done, sizeof report - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return;  // the driver is gone; nothing more to tell
    done += static_cast<std::size_t>(n);
  }
}

int fail(const BenchClientOptions& options, FailedStage stage) {
  sendReport(options.reportFd, Report{options.index, ReportKind::Failed, static_cast<std::int64_t>(stage), 0});
  return 1;
}

// Ten keys: four strings, five integers and a double; the sequence number changes
// with every event.
Value eventPayload(const Value& base, long sequence) {
  Value payload = base.copy();
  payload.asDictionary()->set("sequence", Value(static_cast<long long>(sequence)));
  return payload;
}

}  // namespace

void writeReport(int fd, const Report& report) { sendReport(fd, report); }

std::int64_t monotonicNowNs() { return monotonicNanoseconds(); }

std::optional<FlushReply> flushAndWait(Telvane& client, int timeoutSeconds) {
  auto flushed = std::make_shared<std::promise<FlushReply>>();
  auto future = flushed->get_future();
  client.flushMessagesWithCompletion([flushed](const std::optional<Error>& error) {
    flushed->set_value(FlushReply{monotonicNanoseconds(), error});
  });
  if (future.wait_for(std::chrono::seconds(timeoutSeconds)) != std::future_status::ready) return std::nullopt;
  return future.get();
}

int runBenchClient(const BenchClientOptions& options) {
  const Value sessionInfo(Dictionary{{kTelvaneSessionInfoClientType, Value(kBenchComponentType)},
                                     {kTelvaneSessionInfoSessionID, Value(kBenchFirstSessionID + options.index)}});
  // No user information: the session does not ask for any.
  Error error;
  auto client = Telvane::create(sessionInfo, Value(), Value(), nullptr, &error);
  if (!client) {
    std::fprintf(stderr, "client %d: cannot create the session: %s (code %ld)\n", options.index,
                 error.description.c_str(), error.code);
    return fail(options, FailedStage::Create);
  }

  auto started = std::make_shared<std::promise<bool>>();
  auto startedFuture = started->get_future();
  client->startConfigurationWithCompletionHandler([started](bool received) { started->set_value(received); });
  if (startedFuture.wait_for(kStartReplyTimeout) != std::future_status::ready) {
    std::fprintf(stderr, "client %d: no start reply\n", options.index);
    return fail(options, FailedStage::StartReply);
  }
  sendReport(options.reportFd, Report{options.index, ReportKind::Ready, startedFuture.get() ? 1 : 0, 0});

  // The driver closes its end of the start pipe to let every client go at once.
  char byte = 0;
  while (::read(options.goFd, &byte, 1) < 0 && errno == EINTR) {
  }
  ::close(options.goFd);

  const Value base(Dictionary{{"name", Value("bench.event")},
                              {"bundle", Value("com.zembra.bench")},
                              {"state", Value("foreground")},
                              {"reason", Value("periodic")},
                              {"count", Value(42)},
                              {"bytes", Value(123456)},
                              {"durationMs", Value(1500)},
                              {"clientIndex", Value(options.index)},
                              {"sequence", Value(0)},
                              {"ratio", Value(0.875)}});
  long refused = 0;
  for (long i = 0; i < options.events; ++i) {
    if (!client->sendMessageWithCategory(kBenchCategory, kBenchType, eventPayload(base, i))) ++refused;
  }

  std::optional<FlushReply> outcome = flushAndWait(*client, options.timeoutSeconds);
  if (!outcome) {
    std::fprintf(stderr, "client %d: no flush reply within %d s\n", options.index, options.timeoutSeconds);
    return fail(options, FailedStage::FlushReply);
  }
  // A session without backends answers the flush with exactly this refusal; any other
  // error (the connection broke, no proxy) means the daemon did not answer.
  if (outcome->error && outcome->error->description != kNoBackendsReply) {
    std::fprintf(stderr, "client %d: flush failed: %s\n", options.index, outcome->error->description.c_str());
    return fail(options, FailedStage::FlushError);
  }
  sendReport(options.reportFd, Report{options.index, ReportKind::Done, outcome->repliedAtNs, refused});
  ::close(options.reportFd);
  client.reset();
  return 0;
}

}  // namespace telvane::bench
