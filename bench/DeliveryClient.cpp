#include "DeliveryClient.h"

#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <future>
#include <memory>

#include "BenchClient.h"
#include "DeliveryCollector.h"
#include "DeliveryStorebag.h"
#include "telvane/Telvane.h"
#include "telvane/TelvaneKeys.h"

namespace telvane::bench {

namespace {

constexpr std::uint16_t kDeliveryCategory = 12;
constexpr std::uint16_t kLoadType = 3;
constexpr std::uint16_t kRealtimeType = 4;
constexpr long kRealtimeFlag = 1;
constexpr auto kStartReplyTimeout = std::chrono::seconds(60);
constexpr const char* kNoBackendsReply = "No backends available to send message";

int fail(const DeliveryClientOptions& options, FailedStage stage) {
  writeReport(options.reportFd, Report{options.index, ReportKind::Failed, static_cast<std::int64_t>(stage), 0});
  return 1;
}

// Waits for end of file on the pipe, then closes it.
void waitForClose(int fd) {
  char byte = 0;
  while (::read(fd, &byte, 1) < 0 && errno == EINTR) {
  }
  ::close(fd);
}

Value sessionInfo(long componentType, long sessionID) {
  return Value(Dictionary{{kTelvaneSessionInfoClientType, Value(componentType)},
                          {kTelvaneSessionInfoSessionID, Value(sessionID)},
                          {kTelvaneSessionInfoClientVersion, Value(1)},
                          {kTelvaneSessionInfoBatchEvent, Value(true)},
                          {kTelvaneSessionInfoRequireUserInfo, Value(true)}});
}

Value userInfo() {
  return Value(Dictionary{{kTelvaneUserInfoClientName, Value(kDeliveryClientName)},
                          {kTelvaneUserInfoServiceName, Value(kDeliveryServiceName)}});
}

std::unique_ptr<Telvane> openSession(const DeliveryClientOptions& options, long componentType, long sessionID) {
  Error error;
  auto client = Telvane::create(sessionInfo(componentType, sessionID), userInfo(), Value(), nullptr, &error);
  if (!client) {
    std::fprintf(stderr, "delivery client %d: cannot create a session of type %ld: %s (code %ld)\n", options.index,
                 componentType, error.description.c_str(), error.code);
  }
  return client;
}

// Starts the session's configuration and waits for the reply; nothing when none came.
// True when the storebag's HTTPS post backend is enabled for the session.
std::optional<bool> startSession(Telvane& client) {
  auto started = std::make_shared<std::promise<bool>>();
  auto future = started->get_future();
  client.startConfigurationWithCompletionHandler([started](bool received) { started->set_value(received); });
  if (future.wait_for(kStartReplyTimeout) != std::future_status::ready) return std::nullopt;
  future.get();
  const auto names = client.enabledBackendNames();
  return std::find(names.begin(), names.end(), kDeliveryBackendName) != names.end();
}

// Ten keys: four strings, five integers and a double; the sequence number changes with
// every event. The marker key carries the client's index.
Value loadPayload(int index) {
  return Value(Dictionary{{"name", Value("bench.event")},
                          {"bundle", Value("com.zembra.bench")},
                          {"state", Value("foreground")},
                          {"reason", Value("periodic")},
                          {"count", Value(42)},
                          {"bytes", Value(123456)},
                          {"durationMs", Value(1500)},
                          {kDeliveryMarkerKey, Value(index)},
                          {"sequence", Value(0)},
                          {"ratio", Value(0.875)}});
}

int runLoad(const DeliveryClientOptions& options) {
  auto client = openSession(options, kDeliveryComponentType, kDeliveryFirstSessionID + options.index);
  if (!client) return fail(options, FailedStage::Create);
  auto enabled = startSession(*client);
  if (!enabled) return fail(options, FailedStage::StartReply);
  writeReport(options.reportFd, Report{options.index, ReportKind::Ready, *enabled ? 1 : 0, 1});
  waitForClose(options.goFd);

  const Value base = loadPayload(options.index);
  long refused = 0;
  for (long i = 0; i < options.events; ++i) {
    Value payload = base.copy();
    payload.asDictionary()->set("sequence", Value(static_cast<long long>(i)));
    if (!client->sendMessageWithCategory(kDeliveryCategory, kLoadType, payload)) ++refused;
  }
  writeReport(options.reportFd, Report{options.index, ReportKind::Info,
                                       static_cast<std::int64_t>(DeliveryInfo::AllSent), refused});

  std::optional<FlushReply> reply = flushAndWait(*client, options.timeoutSeconds);
  if (!reply) {
    std::fprintf(stderr, "delivery client %d: no flush reply within %d s\n", options.index, options.timeoutSeconds);
    return fail(options, FailedStage::FlushReply);
  }
  const FlushReply& outcome = *reply;
  FlushOutcome code = FlushOutcome::Succeeded;
  if (outcome.error) {
    code = outcome.error->description == kNoBackendsReply ? FlushOutcome::NoBackends : FlushOutcome::OtherError;
    if (code == FlushOutcome::OtherError) {
      std::fprintf(stderr, "delivery client %d: flush reply: %s (code %ld)\n", options.index,
                   outcome.error->description.c_str(), outcome.error->code);
    }
  }
  writeReport(options.reportFd, Report{options.index, ReportKind::Info,
                                       static_cast<std::int64_t>(DeliveryInfo::FlushReplied),
                                       static_cast<std::int64_t>(code)});
  writeReport(options.reportFd, Report{options.index, ReportKind::Done, outcome.repliedAtNs, refused});
  waitForClose(options.releaseFd);
  ::close(options.reportFd);
  client.reset();
  return 0;
}

int runRealtime(const DeliveryClientOptions& options) {
  auto client = openSession(options, kDeliveryComponentType, kDeliveryFirstSessionID + options.index);
  if (!client) return fail(options, FailedStage::Create);
  auto enabled = startSession(*client);
  if (!enabled) return fail(options, FailedStage::StartReply);
  writeReport(options.reportFd, Report{options.index, ReportKind::Ready, *enabled ? 1 : 0, 1});
  waitForClose(options.goFd);

  Value base = loadPayload(options.index);
  base.asDictionary()->erase("durationMs");  // still ten keys with the send time
  const std::int64_t intervalNs = 1'000'000'000LL / std::max<long>(options.ratePerSecond, 1);
  timespec next{};
  ::clock_gettime(CLOCK_MONOTONIC, &next);
  long refused = 0;
  std::int64_t lastSentNs = 0;
  for (long i = 0; i < options.events; ++i) {
    Value payload = base.copy();
    payload.asDictionary()->set("sequence", Value(static_cast<long long>(i)));
    lastSentNs = monotonicNowNs();
    payload.asDictionary()->set(kDeliverySentTimeKey, Value(static_cast<long long>(lastSentNs)));
    const Value message(Dictionary{{kTelvaneMessageParametersCategory, Value(kDeliveryCategory)},
                                   {kTelvaneMessageParametersType, Value(kRealtimeType)},
                                   {kTelvaneMessageParametersPayload, payload},
                                   {kTelvaneMessageParametersFlag, Value(kRealtimeFlag)}});
    if (!client->sendMessageWithDictionary(message)) ++refused;
    // An absolute schedule: a late wake-up does not delay the events after it.
    next.tv_nsec += intervalNs;
    while (next.tv_nsec >= 1'000'000'000) {
      next.tv_nsec -= 1'000'000'000;
      ++next.tv_sec;
    }
    while (::clock_nanosleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &next, nullptr) == EINTR) {
    }
  }
  writeReport(options.reportFd, Report{options.index, ReportKind::Info,
                                       static_cast<std::int64_t>(DeliveryInfo::AllSent), refused});
  writeReport(options.reportFd, Report{options.index, ReportKind::Done, lastSentNs, refused});
  waitForClose(options.releaseFd);
  ::close(options.reportFd);
  client.reset();
  return 0;
}

int runIdle(const DeliveryClientOptions& options) {
  std::vector<std::unique_ptr<Telvane>> clients;
  long enabled = 0;
  for (int i = 0; i < options.sessions; ++i) {
    const long componentType = options.firstComponentType + i;
    auto client = openSession(options, componentType, kDeliveryFirstSessionID + options.index * 100 + i);
    if (!client) return fail(options, FailedStage::Create);
    auto started = startSession(*client);
    if (!started) return fail(options, FailedStage::StartReply);
    enabled += *started;
    clients.push_back(std::move(client));
  }
  writeReport(options.reportFd, Report{options.index, ReportKind::Ready, enabled, options.sessions});
  waitForClose(options.goFd);
  writeReport(options.reportFd, Report{options.index, ReportKind::Done, monotonicNowNs(), 0});
  waitForClose(options.releaseFd);
  ::close(options.reportFd);
  clients.clear();
  return 0;
}

}  // namespace

std::vector<std::string> deliveryClientArguments(const DeliveryClientOptions& o) {
  return {"mode=" + std::to_string(static_cast<int>(o.mode)),
          "index=" + std::to_string(o.index),
          "events=" + std::to_string(o.events),
          "rate=" + std::to_string(o.ratePerSecond),
          "sessions=" + std::to_string(o.sessions),
          "first-type=" + std::to_string(o.firstComponentType),
          "go-fd=" + std::to_string(o.goFd),
          "release-fd=" + std::to_string(o.releaseFd),
          "report-fd=" + std::to_string(o.reportFd),
          "timeout=" + std::to_string(o.timeoutSeconds)};
}

std::optional<DeliveryClientOptions> parseDeliveryClientArguments(int argc, char** argv, int first) {
  DeliveryClientOptions o;
  for (int i = first; i < argc; ++i) {
    const char* arg = argv[i];
    const char* equals = std::strchr(arg, '=');
    if (!equals) return std::nullopt;
    const std::string key(arg, equals);
    const long value = std::atol(equals + 1);
    if (key == "mode") {
      if (value < 1 || value > 3) return std::nullopt;
      o.mode = static_cast<DeliveryClientMode>(value);
    } else if (key == "index") {
      o.index = static_cast<int>(value);
    } else if (key == "events") {
      o.events = value;
    } else if (key == "rate") {
      o.ratePerSecond = value;
    } else if (key == "sessions") {
      o.sessions = static_cast<int>(value);
    } else if (key == "first-type") {
      o.firstComponentType = value;
    } else if (key == "go-fd") {
      o.goFd = static_cast<int>(value);
    } else if (key == "release-fd") {
      o.releaseFd = static_cast<int>(value);
    } else if (key == "report-fd") {
      o.reportFd = static_cast<int>(value);
    } else if (key == "timeout") {
      o.timeoutSeconds = static_cast<int>(value);
    } else {
      return std::nullopt;
    }
  }
  if (o.goFd < 0 || o.releaseFd < 0 || o.reportFd < 0) return std::nullopt;
  return o;
}

int runDeliveryClient(const DeliveryClientOptions& options) {
  switch (options.mode) {
    case DeliveryClientMode::Load:
      return runLoad(options);
    case DeliveryClientMode::Realtime:
      return runRealtime(options);
    case DeliveryClientMode::Idle:
      return runIdle(options);
  }
  return 2;
}

}  // namespace telvane::bench
