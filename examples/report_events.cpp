// report_events: a reporting client written the way a component of the device would
// use the telvane client library (only the public headers, linked with -ltelvane).
//
// A conferencing component reports one call: it opens a session with its user
// information, starts it, sends ordinary events (batched by the daemon) and a realtime
// one (sent at once), lets a periodic task sample the call's statistics and report
// them as one realtime event, opens a child session for the call's media stream that
// shares the call's data through the hierarchy token, flushes and finishes both
// sessions.
//
//   report_events [--component-type N] [--events N]
//
// The component type defaults to 7, whose storebag is "confera". The daemon is found
// at $TELVANED_SOCKET, else at its installed socket. Exit status 0 when every step was
// answered, 1 otherwise.
#include <telvane/Error.h>
#include <telvane/Telvane.h>
#include <telvane/TelvaneKeys.h>
#include <telvane/Value.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <future>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

using telvane::Dictionary;
using telvane::Error;
using telvane::Telvane;
using telvane::Value;

namespace {

constexpr std::chrono::seconds kReplyTimeout{15};

// Event categories and types of this component.
constexpr std::uint16_t kCategoryCall = 12;
constexpr std::uint16_t kTypeCallQuality = 1;
constexpr std::uint16_t kTypeCallDropped = 2;
constexpr std::uint16_t kTypeCallStats = 3;
constexpr std::uint16_t kCategoryMedia = 13;
constexpr std::uint16_t kTypeMediaStats = 1;
// Event flag: sent at once instead of waiting for the next batch.
constexpr std::uint32_t kFlagRealtime = 1;
// The periodic call-statistics module: sampled every second, reported every second tick.
constexpr std::uint32_t kModuleCallStats = 1;
constexpr std::uint32_t kStatsIntervalSeconds = 1;
constexpr std::uint32_t kStatsReportingMultiplier = 2;

std::string joined(const std::vector<std::string>& names) {
  std::string text;
  for (const auto& name : names) text += (text.empty() ? "" : ", ") + name;
  return text.empty() ? "none" : text;
}

// Starts a session and waits for the daemon's answer.
bool start(Telvane& session, const char* what) {
  auto started = std::make_shared<std::promise<bool>>();
  auto answer = started->get_future();
  session.startConfigurationWithCompletionHandler([started](bool configured) { started->set_value(configured); });
  if (answer.wait_for(kReplyTimeout) != std::future_status::ready) {
    std::printf("%s: no start reply from the daemon\n", what);
    return false;
  }
  bool configured = answer.get();
  std::printf("%s: %s, backends: %s\n", what, configured ? "configured" : "not configured",
              joined(session.enabledBackendNames()).c_str());
  return true;
}

// A periodic module that samples the call on every tick of the log timer. Its block
// cannot tell update ticks from report ticks, so it always hands over its latest
// samples, as many as there are ticks per report; on a report tick they become the
// event's "samples". The state is shared with the block, which the timer calls on the
// library's own threads.
class CallStatsModule {
 public:
  telvane::Telvane::PeriodicServiceBlock block() {
    return [state = state_](Value& dictionary) {
      std::lock_guard<std::mutex> lock(state->mutex);
      ++state->ticks;
      // Invented figures that change a little from tick to tick.
      state->latest.push_back(Value(Dictionary{{"roundTripMs", Value(38 + 3 * state->ticks)},
                                               {"jitterMs", Value(4.5 + 0.5 * state->ticks)}}));
      if (state->latest.size() > kStatsReportingMultiplier) state->latest.pop_front();
      telvane::Array samples(state->latest.begin(), state->latest.end());
      dictionary.asDictionary()->set("samples", Value(std::move(samples)));
      if (state->ticks == kStatsReportingMultiplier) state->reported.set_value(state->latest.size());
    };
  }
  // The number of samples of the first report, or none when it did not come in time.
  std::optional<std::size_t> waitForFirstReport() {
    if (firstReport_.wait_for(kReplyTimeout) != std::future_status::ready) return std::nullopt;
    return firstReport_.get();
  }

 private:
  struct State {
    std::mutex mutex;
    long ticks = 0;
    std::deque<Value> latest;
    std::promise<std::size_t> reported;
  };
  std::shared_ptr<State> state_ = std::make_shared<State>();
  std::future<std::size_t> firstReport_ = state_->reported.get_future();
};

// Flushes a session and waits for the daemon's answer.
bool flush(Telvane& session, const char* what) {
  auto flushed = std::make_shared<std::promise<std::optional<Error>>>();
  auto answer = flushed->get_future();
  session.flushMessagesWithCompletion([flushed](const std::optional<Error>& error) { flushed->set_value(error); });
  if (answer.wait_for(kReplyTimeout) != std::future_status::ready) {
    std::printf("%s: no flush reply from the daemon\n", what);
    return false;
  }
  std::optional<Error> error = answer.get();
  if (error) {
    std::printf("%s: flush: %s (%s %ld)\n", what, error->description.c_str(), error->domain.c_str(), error->code);
  } else {
    std::printf("%s: flushed\n", what);
  }
  return true;
}

}  // namespace

int main(int argc, char** argv) {
  long componentType = 7;
  long eventCount = 5;
  for (int i = 1; i < argc; ++i) {
    std::string option = argv[i];
    if (option == "--component-type" && i + 1 < argc) {
      componentType = std::strtol(argv[++i], nullptr, 10);
    } else if (option == "--events" && i + 1 < argc) {
      eventCount = std::strtol(argv[++i], nullptr, 10);
    } else {
      std::fprintf(stderr, "usage: report_events [--component-type N] [--events N]\n");
      return 2;
    }
  }

  // The call's session is the root of a hierarchy; its token goes to the child.
  const Value callToken = Telvane::newHierarchyTokenFromParentToken(Value());
  const unsigned callSessionID = static_cast<unsigned>(::getpid());
  Value sessionInfo(Dictionary{
      {telvane::kTelvaneSessionInfoClientType, Value(componentType)},
      {telvane::kTelvaneSessionInfoClientVersion, Value(3)},
      {telvane::kTelvaneSessionInfoSessionID, Value(callSessionID)},
      {telvane::kTelvaneSessionInfoBatchEvent, Value(true)},
      {telvane::kTelvaneSessionInfoRequireUserInfo, Value(true)},
      {telvane::kTelvaneSessionInfoHierarchyToken, callToken},
  });
  // "accountEmail" is one of this client's own keys; the sample storebag hashes it in
  // batched events.
  Value userInfo(Dictionary{
      {telvane::kTelvaneUserInfoClientName, Value("com.example.conference")},
      {telvane::kTelvaneUserInfoServiceName, Value("calls")},
      {"accountEmail", Value("alex@example.com")},
  });

  Error error;
  std::unique_ptr<Telvane> call = Telvane::create(sessionInfo, userInfo, Value(), nullptr, &error);
  if (!call) {
    std::printf("call: no session (%s, code %ld): is telvaned running?\n",
                error.description.empty() ? "not reachable" : error.description.c_str(), error.code);
    return 1;
  }
  call->setMessageLoggingBlock([](const std::string& text) { std::printf("call: daemon says: %s\n", text.c_str()); });
  // Shared data reaches every session of the hierarchy and travels with their events.
  // It is set before the start: the start's reply then also confirms that the daemon
  // has it, so the child session below, on a connection of its own, cannot overtake it.
  call->updateSharedDataWithDictionary(Value(Dictionary{{"callID", Value("C-2041")}, {"network", Value("wifi")}}));
  bool answered = start(*call, "call");

  for (long i = 0; i < eventCount; ++i) {
    Value payload(Dictionary{{"codec", Value("opus")},
                             {"jitterMs", Value(12.5 + static_cast<double>(i))},
                             {"packetLossPercent", Value(0.4 * static_cast<double>(i))}});
    if (!call->sendMessageWithCategory(kCategoryCall, kTypeCallQuality, payload, &error)) {
      std::printf("call: event refused: %s\n", error.description.c_str());
    }
  }
  std::printf("call: sent %ld call-quality events\n", eventCount);

  // A realtime event leaves at once; events batched before it are sent first.
  Value dropped(Dictionary{
      {telvane::kTelvaneMessageParametersCategory, Value(kCategoryCall)},
      {telvane::kTelvaneMessageParametersType, Value(kTypeCallDropped)},
      {telvane::kTelvaneMessageParametersFlag, Value(kFlagRealtime)},
      {telvane::kTelvaneMessageParametersPayload, Value(Dictionary{{"reason", Value("network lost")}})},
  });
  if (call->sendMessageWithDictionary(dropped, &error)) {
    std::printf("call: sent a realtime call-dropped event\n");
  } else if (!error.domain.empty()) {
    std::printf("call: realtime event refused: %s\n", error.description.c_str());
  } else {
    std::printf("call: the realtime event is filtered by the storebag\n");
  }

  {
    // Call statistics from a periodic task: the first tick of the log timer comes at
    // once and only updates, the second reports the module's samples as one realtime
    // event of the call's category. The timer stops before the session finishes.
    CallStatsModule stats;
    call->registerPeriodicTaskForModule(kModuleCallStats, true, true, stats.block());
    call->startLogTimerWithInterval(kStatsIntervalSeconds, kStatsReportingMultiplier, kCategoryCall, kTypeCallStats);
    std::optional<std::size_t> samples = stats.waitForFirstReport();
    call->stopLogTimer();
    call->unregisterPeriodTaskForModule(kModuleCallStats);
    if (samples) {
      std::printf("call: a periodic task reported %zu call-stats samples as a realtime event\n", *samples);
    } else {
      std::printf("call: the periodic task did not report\n");
      answered = false;
    }
  }

  {
    // The media stream of the call: a child session in the call's hierarchy.
    Value mediaInfo(Dictionary{
        {telvane::kTelvaneSessionInfoClientType, Value(componentType)},
        {telvane::kTelvaneSessionInfoClientVersion, Value(3)},
        {telvane::kTelvaneSessionInfoSessionID, Value(callSessionID + 1)},
        {telvane::kTelvaneSessionInfoBatchEvent, Value(true)},
        {telvane::kTelvaneSessionInfoRequireUserInfo, Value(true)},
        {telvane::kTelvaneSessionInfoHierarchyToken, Telvane::newHierarchyTokenFromParentToken(callToken)},
    });
    Value mediaUser(Dictionary{{telvane::kTelvaneUserInfoClientName, Value("com.example.conference")},
                               {telvane::kTelvaneUserInfoServiceName, Value("media")}});
    std::unique_ptr<Telvane> media = Telvane::create(mediaInfo, mediaUser, Value(), nullptr, &error);
    if (!media) {
      std::printf("media: no session\n");
      return 1;
    }
    answered = start(*media, "media") && answered;
    media->updateSharedDataForKey("videoCodec", Value("h264"));
    media->sendMessageWithCategory(kCategoryMedia, kTypeMediaStats,
                                   Value(Dictionary{{"framesDropped", Value(3)}, {"bitrateKbps", Value(1800)}}));
    std::printf("media: sent a media-stats event with the call's shared data\n");
    answered = flush(*media, "media") && answered;
    media->finishSession();
  }

  answered = flush(*call, "call") && answered;
  call->finishSession();
  // Destroying the object hands the finish to the daemon before the connection closes.
  call.reset();
  std::printf("call: finished\n");
  return answered ? 0 : 1;
}
