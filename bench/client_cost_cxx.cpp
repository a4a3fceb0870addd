// telvane_client_cost_cxx: the C++ client of telvane_client_cost_bench. A reporting
// application in miniature, built against libtelvane.so and its public headers only:
// it opens one session, starts it, tells the driver it is ready, waits for the go,
// then sends its events through telvane::Telvane, flushes, waits for the flush reply
// and prints the CPU time and wall time this process spent from just before the first
// send to just after that reply.
//
// The driver (client_cost_bench.cpp) runs it with key=value arguments and speaks to
// it over standard input and output (see there for the protocol); the C program
// client_cost_c.c and the Python script client_cost.py do exactly the same through
// the C interface and the Python package.
//
// Threading: the main thread sends; completions run on the library's threads and only
// fulfil a promise.
#include <sys/resource.h>
#include <time.h>

#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <future>
#include <iostream>
#include <memory>
#include <optional>
#include <string>

#include "telvane/Telvane.h"
#include "telvane/TelvaneKeys.h"

using namespace telvane;

namespace {

struct Arguments {
  long events = 20'000;
  bool realtime = false;
  long componentType = 7;
  long sessionID = 2000;
  long index = 0;
  long category = 12;
  long type = 3;
  std::string clientName = "benchclient";
  std::string serviceName = "com.zembra.bench.delivery";
  int timeoutSeconds = 600;
};

std::optional<Arguments> parseArguments(int argc, char** argv) {
  Arguments a;
  for (int i = 1; i < argc; ++i) {
    const char* equals = std::strchr(argv[i], '=');
    if (!equals) return std::nullopt;
    const std::string key(argv[i], static_cast<std::size_t>(equals - argv[i]));
    const std::string value(equals + 1);
    const long number = std::atol(value.c_str());
    if (key == "events") {
      a.events = number;
    } else if (key == "mode") {
      if (value != "batched" && value != "realtime") return std::nullopt;
      a.realtime = value == "realtime";
    } else if (key == "component-type") {
      a.componentType = number;
    } else if (key == "session-id") {
      a.sessionID = number;
    } else if (key == "index") {
      a.index = number;
    } else if (key == "category") {
      a.category = number;
    } else if (key == "type") {
      a.type = number;
    } else if (key == "client-name") {
      a.clientName = value;
    } else if (key == "service-name") {
      a.serviceName = value;
    } else if (key == "timeout") {
      a.timeoutSeconds = static_cast<int>(number);
    } else {
      return std::nullopt;
    }
  }
  if (a.events <= 0 || a.timeoutSeconds <= 0) return std::nullopt;
  return a;
}

std::int64_t microseconds(const timeval& t) { return std::int64_t(t.tv_sec) * 1'000'000 + t.tv_usec; }

std::int64_t monotonicMicroseconds() {
  timespec now{};
  ::clock_gettime(CLOCK_MONOTONIC, &now);
  return std::int64_t(now.tv_sec) * 1'000'000 + now.tv_nsec / 1'000;
}

// One line without spaces or line breaks, for the result line.
std::string oneWord(std::string text) {
  for (char& c : text) {
    if (c == ' ' || c == '\n' || c == '\r' || c == '\t') c = '_';
  }
  return text.empty() ? "-" : text;
}

// The event's payload: ten keys, four strings, five integers and a double; the
// sequence number changes with every event. Built afresh for every event, as an
// application does.
Value payload(long index, long sequence) {
  return Value(Dictionary{{"name", Value("call.quality")},
                          {"bundle", Value("com.example.conference")},
                          {"state", Value("foreground")},
                          {"reason", Value("periodic")},
                          {"count", Value(42)},
                          {"bytes", Value(123456)},
                          {"durationMs", Value(1500)},
                          {"clientIndex", Value(index)},
                          {"sequence", Value(sequence)},
                          {"ratio", Value(0.875)}});
}

}  // namespace

int main(int argc, char** argv) {
  auto arguments = parseArguments(argc, argv);
  if (!arguments) {
    std::fprintf(stderr, "usage: telvane_client_cost_cxx events=N mode=batched|realtime [key=value ...]\n");
    return 2;
  }
  const Arguments& a = *arguments;
  const Value sessionInfo(Dictionary{{kTelvaneSessionInfoClientType, Value(a.componentType)},
                                     {kTelvaneSessionInfoSessionID, Value(a.sessionID)},
                                     {kTelvaneSessionInfoClientVersion, Value(1)},
                                     {kTelvaneSessionInfoBatchEvent, Value(true)},
                                     {kTelvaneSessionInfoRequireUserInfo, Value(true)}});
  const Value userInfo(Dictionary{{kTelvaneUserInfoClientName, Value(a.clientName)},
                                  {kTelvaneUserInfoServiceName, Value(a.serviceName)}});
  Error error;
  auto client = Telvane::create(sessionInfo, userInfo, Value(), nullptr, &error);
  if (!client) {
    std::fprintf(stderr, "cannot create the session: %s (code %ld)\n", error.description.c_str(), error.code);
    return 1;
  }
  auto started = std::make_shared<std::promise<bool>>();
  auto startedFuture = started->get_future();
  client->startConfigurationWithCompletionHandler([started](bool configured) { started->set_value(configured); });
  if (startedFuture.wait_for(std::chrono::seconds(60)) != std::future_status::ready) {
    std::fprintf(stderr, "no start reply\n");
    return 1;
  }
  const bool configured = startedFuture.get();
  std::string backends;
  for (const auto& name : client->enabledBackendNames()) backends += (backends.empty() ? "" : ",") + name;
  std::printf("ready configured=%d backends=%s\n", configured ? 1 : 0, oneWord(backends).c_str());
  std::fflush(stdout);
  std::string go;
  if (!std::getline(std::cin, go)) return 1;

  const auto category = static_cast<std::uint16_t>(a.category);
  const auto type = static_cast<std::uint16_t>(a.type);
  rusage selfBefore{}, threadBefore{};
  ::getrusage(RUSAGE_SELF, &selfBefore);
  ::getrusage(RUSAGE_THREAD, &threadBefore);
  const std::int64_t startUs = monotonicMicroseconds();
  long refused = 0;
  for (long i = 0; i < a.events; ++i) {
    if (a.realtime) {
      const Value message(Dictionary{{kTelvaneMessageParametersCategory, Value(a.category)},
                                     {kTelvaneMessageParametersType, Value(a.type)},
                                     {kTelvaneMessageParametersFlag, Value(1)},
                                     {kTelvaneMessageParametersPayload, payload(a.index, i)}});
      if (!client->sendMessageWithDictionary(message)) ++refused;
    } else {
      if (!client->sendMessageWithCategory(category, type, payload(a.index, i))) ++refused;
    }
  }
  const std::int64_t sentUs = monotonicMicroseconds();
  // One connection's calls are answered in order, and completions run in order on the
  // session's queue: the flush reply comes after the reply to every event.
  auto flushed = std::make_shared<std::promise<std::optional<Error>>>();
  auto flushedFuture = flushed->get_future();
  client->flushMessagesWithCompletion([flushed](const std::optional<Error>& e) { flushed->set_value(e); });
  const bool answered = flushedFuture.wait_for(std::chrono::seconds(a.timeoutSeconds)) == std::future_status::ready;
  const std::int64_t doneUs = monotonicMicroseconds();
  rusage selfAfter{}, threadAfter{};
  ::getrusage(RUSAGE_THREAD, &threadAfter);
  ::getrusage(RUSAGE_SELF, &selfAfter);

  std::string flush = "timeout";
  std::string flushText = "-";
  if (answered) {
    const std::optional<Error> outcome = flushedFuture.get();
    flush = outcome ? "error" : "ok";
    if (outcome) flushText = oneWord(outcome->description);
  }
  std::printf(
      "result events=%ld refused=%ld user_us=%lld sys_us=%lld caller_us=%lld wall_us=%lld send_wall_us=%lld "
      "flush=%s flush_text=%s start_rss_kib=%ld peak_rss_kib=%ld\n",
      a.events, refused, static_cast<long long>(microseconds(selfAfter.ru_utime) - microseconds(selfBefore.ru_utime)),
      static_cast<long long>(microseconds(selfAfter.ru_stime) - microseconds(selfBefore.ru_stime)),
      static_cast<long long>(microseconds(threadAfter.ru_utime) + microseconds(threadAfter.ru_stime) -
                             microseconds(threadBefore.ru_utime) - microseconds(threadBefore.ru_stime)),
      static_cast<long long>(doneUs - startUs), static_cast<long long>(sentUs - startUs), flush.c_str(),
      flushText.c_str(), selfBefore.ru_maxrss, selfAfter.ru_maxrss);
  std::fflush(stdout);
  // The driver closes our standard input when it has read the result.
  while (std::getline(std::cin, go)) {
  }
  client->finishSession();
  client.reset();
  return answered ? 0 : 1;
}
