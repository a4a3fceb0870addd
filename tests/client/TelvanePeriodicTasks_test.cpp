// The periodic metrics tasks of a Telvane object against a fake daemon: registration,
// the log timer, update and report ticks, the four-at-a-time limit, the merge rule, the
// time-outs and what the daemon receives; and what going away does to a running tick.
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <future>
#include <latch>
#include <limits>
#include <memory>
#include <mutex>
#include <stdexcept>
#include <string>
#include <vector>

#include "client/PeriodicTaskRun.h"
#include "client/TelvaneImpl.h"
#include "platform/Log.h"
#include "support/ClientTestHelpers.h"
#include "support/FakeDaemon.h"
#include "support/WaitUntil.h"

namespace telvane {
namespace {

using namespace std::chrono_literals;
using test::Awaited;
using test::FakeDaemon;
using Op = ipc::Operation;

constexpr std::uint16_t kCategory = 12;
constexpr std::uint16_t kType = 3;
// A tick time-out that no test waits for: each wait may last 9.5 s.
constexpr std::uint64_t kGenerousTimeoutSeconds = 10;
// A log timer interval whose second firing never comes during a test: the first
// firing comes at once, the test fires the others itself.
constexpr std::uint32_t kLongIntervalSeconds = 3600;

constexpr const char* kStarted = "_myPeriodicTask: Started RT periodic task";
constexpr const char* kUpdatesFinished = "_myPeriodicTask: Finished RT updates for all registered modules.";
constexpr const char* kAllCollected = "_myPeriodicTask: All RT metrics collected";
constexpr const char* kSent = "_myPeriodicTask: Sent realtime event after collection all RT metrics";
constexpr const char* kCollectionFinished = "_myPeriodicTask: Finished RT metrics collection";
constexpr const char* kCollectionTimeout =
    "_myPeriodicTask: Timeout during periodic tasks metrics collection. Not all stats will be reported";

Value array(std::initializer_list<Value> elements) { return Value(Array(elements)); }

// The lines the ticks logged, in order.
std::vector<std::string> tickLines(const log::LogCapture& capture) {
  std::vector<std::string> lines;
  for (const std::string& text : capture.texts()) {
    if (text.rfind("_myPeriodicTask:", 0) == 0) lines.push_back(text);
  }
  return lines;
}

// A block that puts the contribution into its dictionary and counts its calls.
Telvane::PeriodicServiceBlock contributing(Value contribution, std::shared_ptr<std::atomic<int>> calls = nullptr) {
  return [contribution, calls](Value& dictionary) {
    if (calls) ++*calls;
    for (const auto& [key, value] : *contribution.asDictionary()) dictionary.asDictionary()->set(key, value);
  };
}

// In a module block: waits until the running tick has merged `count` contributions,
// so that this module finishes after them.
void waitForMerges(const std::weak_ptr<Telvane::Impl>& weak, std::size_t count) {
  test::waitUntil([&] {
    auto impl = weak.lock();
    auto run = impl ? impl->runningPeriodicTaskForTesting() : nullptr;
    return run && run->mergeCount() >= count;
  });
}

// Module blocks that record when they enter and wait for the test to let them go, so
// that the test sees which modules run at the same time and in which order they start.
// The state is shared with the blocks, which may outlive the test's objects.
class ModuleGate {
 public:
  ModuleGate() : state_(std::make_shared<State>()) {}
  ~ModuleGate() { openAll(); }

  Telvane::PeriodicServiceBlock block(std::uint32_t module) {
    return [state = state_, module](Value& dictionary) {
      std::unique_lock<std::mutex> lock(state->mutex);
      state->entered.push_back(module);
      state->maxRunning = std::max(state->maxRunning, ++state->running);
      state->changed.notify_all();
      state->changed.wait_for(lock, test::kClientWaitSeconds, [&] { return state->open || state->permits > 0; });
      if (!state->open && state->permits > 0) --state->permits;
      --state->running;
      dictionary.asDictionary()->set("module" + std::to_string(module), Value(module));
    };
  }
  bool waitForEntered(std::size_t count) {
    std::unique_lock<std::mutex> lock(state_->mutex);
    return state_->changed.wait_for(lock, test::kClientWaitSeconds, [&] { return state_->entered.size() >= count; });
  }
  // Lets one waiting block go.
  void release() {
    std::lock_guard<std::mutex> lock(state_->mutex);
    ++state_->permits;
    state_->changed.notify_all();
  }
  void openAll() {
    std::lock_guard<std::mutex> lock(state_->mutex);
    state_->open = true;
    state_->changed.notify_all();
  }
  std::vector<std::uint32_t> entered() const {
    std::lock_guard<std::mutex> lock(state_->mutex);
    return state_->entered;
  }
  int running() const {
    std::lock_guard<std::mutex> lock(state_->mutex);
    return state_->running;
  }
  int maxRunning() const {
    std::lock_guard<std::mutex> lock(state_->mutex);
    return state_->maxRunning;
  }

 private:
  struct State {
    std::mutex mutex;
    std::condition_variable changed;
    std::vector<std::uint32_t> entered;
    int running = 0;
    int maxRunning = 0;
    int permits = 0;
    bool open = false;
  };
  std::shared_ptr<State> state_;
};

// A block that never returns while the test runs: it waits on a latch that the
// holder's destructor releases, so that a failing test does not leave it stuck.
class StuckModule {
 public:
  ~StuckModule() { latch_->count_down(); }
  Telvane::PeriodicServiceBlock block() {
    return [latch = latch_, entered = entered_](Value&) {
      *entered = true;
      latch->wait();
    };
  }
  bool waitUntilEntered() const {
    return test::waitUntil([&] { return entered_->load(); });
  }

 private:
  std::shared_ptr<std::latch> latch_ = std::make_shared<std::latch>(1);
  std::shared_ptr<std::atomic<bool>> entered_ = std::make_shared<std::atomic<bool>>(false);
};

// An Impl on its own reporting queue, connected to the fake daemon, so that the tests
// can run ticks directly on the queue and fire the log timer at will.
class PeriodicTasksTest : public ::testing::Test {
 protected:
  void SetUp() override {
    queue_ = SerialQueue::create("com.zembra.Telvane.main");
    auto aggregation = std::make_shared<TelvaneAggregationObject>(nullptr);
    TelvaneConnection::SessionSetup setup;
    setup.sessionInfo = test::clientSessionInfo();
    setup.userInfo = test::clientUserInfo();
    auto connection = TelvaneConnection::create(std::move(setup), queue_, aggregation);
    Status opened = connection->open();
    ASSERT_TRUE(opened.ok()) << opened.error();
    impl_ = std::make_shared<Telvane::Impl>(queue_, connection, aggregation);
  }
  void TearDown() override {
    if (impl_) impl_->teardown();
  }

  void tick(std::uint32_t multiplier, std::uint64_t timeoutSeconds = kGenerousTimeoutSeconds) {
    queue_->sync([&] { impl_->myPeriodicTask(kCategory, kType, multiplier, timeoutSeconds); });
  }
  // Registers and waits until the registration is in place.
  void registerModule(std::uint32_t module, bool update, bool report, Telvane::PeriodicServiceBlock block) {
    ASSERT_TRUE(impl_->registerPeriodicTaskForModule(module, update, report, std::move(block)));
    queue_->sync([] {});
  }
  // Returns once the daemon has received everything the client sent so far.
  void syncWithDaemon() {
    Awaited<std::optional<Error>> flushed;
    impl_->flushMessagesWithCompletion(flushed.setter());
    ASSERT_TRUE(flushed.wait().has_value());
  }
  std::vector<Value> sentEvents() const {
    std::vector<Value> events;
    for (const auto& call : daemon_.calls(Op::SendMessageWithDictionary)) events.push_back(call.arguments.at(0));
    return events;
  }
  Value sentPayload(std::size_t index = 0) const {
    auto events = sentEvents();
    return index < events.size() ? events[index][kTelvaneMessageParametersPayload] : Value();
  }
  bool waitForTickLine(const log::LogCapture& capture, const char* text, std::size_t count = 1) const {
    return test::waitUntil([&] { return capture.count(text) >= count; });
  }

  FakeDaemon daemon_;
  std::shared_ptr<SerialQueue> queue_;
  std::shared_ptr<Telvane::Impl> impl_;
};

// ---- registration ----

TEST_F(PeriodicTasksTest, RegistrationLogsTheModuleAndItsFlags) {
  log::LogCapture capture;
  registerModule(7, true, true, contributing(Value::dictionary()));
  registerModule(8, false, true, contributing(Value::dictionary()));
  registerModule(9, true, false, contributing(Value::dictionary()));
  registerModule(10, false, false, contributing(Value::dictionary()));
  EXPECT_TRUE(capture.contains(log::Level::Info, "registerPeriodicTaskForModule: 7, update, reporting"));
  EXPECT_TRUE(capture.contains("registerPeriodicTaskForModule: 8, no update, reporting"));
  EXPECT_TRUE(capture.contains("registerPeriodicTaskForModule: 9, update, no reporting"));
  EXPECT_TRUE(capture.contains("registerPeriodicTaskForModule: 10, no update, no reporting"));
}

TEST_F(PeriodicTasksTest, RegistrationWithoutABlockIsRefused) {
  log::LogCapture capture;
  EXPECT_FALSE(impl_->registerPeriodicTaskForModule(4, true, true, nullptr));
  queue_->sync([] {});
  EXPECT_FALSE(capture.containsPrefix("registerPeriodicTaskForModule:"));
  EXPECT_FALSE(impl_->unregisterPeriodTaskForModule(4));
}

TEST_F(PeriodicTasksTest, UnregistrationSaysWhetherTheModuleWasThere) {
  auto calls = std::make_shared<std::atomic<int>>(0);
  log::LogCapture capture;
  EXPECT_FALSE(impl_->unregisterPeriodTaskForModule(3));
  EXPECT_TRUE(capture.contains("unregisterPeriodTaskForModule: 3 doesn't exist"));
  registerModule(3, true, true, contributing(Value(Dictionary{{"n", Value(1)}}), calls));
  EXPECT_TRUE(impl_->unregisterPeriodTaskForModule(3));
  EXPECT_TRUE(capture.contains("unregisterPeriodTaskForModule: 3 removed"));
  EXPECT_FALSE(impl_->unregisterPeriodTaskForModule(3));
  EXPECT_EQ(capture.count("unregisterPeriodTaskForModule: 3 doesn't exist"), 2u);

  tick(1);
  EXPECT_EQ(calls->load(), 0);
  EXPECT_FALSE(capture.contains(kSent));
}

TEST_F(PeriodicTasksTest, RegisteringTheSameNumberTwiceKeepsOnlyTheSecond) {
  auto firstCalls = std::make_shared<std::atomic<int>>(0);
  auto secondCalls = std::make_shared<std::atomic<int>>(0);
  registerModule(5, true, true, contributing(Value(Dictionary{{"from", Value("first")}}), firstCalls));
  registerModule(5, true, true, contributing(Value(Dictionary{{"from", Value("second")}}), secondCalls));
  tick(2);  // an update tick
  tick(2);  // the report tick
  syncWithDaemon();
  EXPECT_EQ(firstCalls->load(), 0);
  EXPECT_EQ(secondCalls->load(), 2);
  ASSERT_EQ(sentEvents().size(), 1u);
  EXPECT_EQ(sentPayload(), Value(Dictionary{{"from", Value("second")}}));
}

// ---- ticks ----

TEST_F(PeriodicTasksTest, MultiplierOneMakesEveryTickAReportTick) {
  auto calls = std::make_shared<std::atomic<int>>(0);
  registerModule(1, true, true, contributing(Value(Dictionary{{"samples", array({Value(1)})}}), calls));
  log::LogCapture capture;
  for (int i = 0; i < 3; ++i) {
    tick(1);
    EXPECT_EQ(impl_->periodicTaskCounterForTesting(), 0u);
  }
  syncWithDaemon();
  EXPECT_EQ(calls->load(), 3);
  EXPECT_EQ(sentEvents().size(), 3u);
  EXPECT_EQ(capture.count(kAllCollected), 3u);
  EXPECT_EQ(capture.count(kUpdatesFinished), 0u);
}

TEST_F(PeriodicTasksTest, WithMultiplierNTheNthTickReportsAndTheCountStartsAgain) {
  auto updateOnly = std::make_shared<std::atomic<int>>(0);
  auto reportOnly = std::make_shared<std::atomic<int>>(0);
  auto both = std::make_shared<std::atomic<int>>(0);
  registerModule(1, true, false, contributing(Value(Dictionary{{"u", Value(1)}}), updateOnly));
  registerModule(2, false, true, contributing(Value(Dictionary{{"r", Value(2)}}), reportOnly));
  registerModule(3, true, true, contributing(Value(Dictionary{{"b", Value(3)}}), both));
  log::LogCapture capture;

  tick(3);
  EXPECT_EQ(impl_->periodicTaskCounterForTesting(), 1u);
  tick(3);
  EXPECT_EQ(impl_->periodicTaskCounterForTesting(), 2u);
  EXPECT_EQ(tickLines(capture), (std::vector<std::string>{kStarted, kUpdatesFinished, kStarted, kUpdatesFinished}));
  EXPECT_EQ(updateOnly->load(), 2);
  EXPECT_EQ(reportOnly->load(), 0);
  EXPECT_EQ(both->load(), 2);

  capture.clear();
  tick(3);
  EXPECT_EQ(impl_->periodicTaskCounterForTesting(), 0u);
  EXPECT_EQ(tickLines(capture), (std::vector<std::string>{kStarted, kAllCollected, kSent, kCollectionFinished}));
  EXPECT_EQ(updateOnly->load(), 2);
  EXPECT_EQ(reportOnly->load(), 1);
  EXPECT_EQ(both->load(), 3);

  tick(3);
  EXPECT_EQ(impl_->periodicTaskCounterForTesting(), 1u);
  EXPECT_EQ(updateOnly->load(), 3);
  syncWithDaemon();
  ASSERT_EQ(sentEvents().size(), 1u);
  // Only the report tick's contributions, of the reporting modules.
  EXPECT_EQ(sentPayload(), Value(Dictionary{{"b", Value(3)}, {"r", Value(2)}}));
}

TEST_F(PeriodicTasksTest, TheDaemonReceivesOneRealtimeEventWithTheMergedContributions) {
  registerModule(1, false, true, contributing(Value(Dictionary{{"jitterMs", Value(12.5)}})));
  registerModule(2, false, true, contributing(Value(Dictionary{{"packetsLost", Value(3)}})));
  tick(1);
  syncWithDaemon();
  auto events = sentEvents();
  ASSERT_EQ(events.size(), 1u);
  EXPECT_EQ(events[0], Value(Dictionary{{"ParametersFlag", Value(1)},
                                        {"ParametersCategory", Value(kCategory)},
                                        {"ParametersType", Value(kType)},
                                        {"ParametersPayload", Value(Dictionary{{"jitterMs", Value(12.5)},
                                                                               {"packetsLost", Value(3)}})}}));
}

TEST_F(PeriodicTasksTest, ATickWithOnlyEmptyContributionsSendsNothing) {
  auto calls = std::make_shared<std::atomic<int>>(0);
  registerModule(1, true, true, contributing(Value::dictionary(), calls));
  registerModule(2, true, true, contributing(Value::dictionary(), calls));
  log::LogCapture capture;
  tick(1);
  syncWithDaemon();
  EXPECT_EQ(calls->load(), 2);
  EXPECT_EQ(tickLines(capture), (std::vector<std::string>{kStarted, kAllCollected, kCollectionFinished}));
  EXPECT_TRUE(sentEvents().empty());
  EXPECT_EQ(daemon_.calls(Op::FlushMessages).size(), 1u);
}

TEST_F(PeriodicTasksTest, TheLocalFilterAppliesToTheRealtimeEvent) {
  // A start reply whose whitelist leaves out the event's category.
  daemon_.setReply(Op::StartConfig, Array{array({Value("brindle")}), array({Value(99)}), array({})});
  Awaited<bool> started;
  impl_->startConfiguration(started.setter());
  ASSERT_EQ(started.wait(), std::optional<bool>(true));
  registerModule(1, false, true, contributing(Value(Dictionary{{"n", Value(1)}})));
  log::LogCapture capture;
  tick(1);
  syncWithDaemon();
  EXPECT_TRUE(capture.contains(kSent));
  EXPECT_TRUE(capture.contains("Event 12 is filtered by storebag"));
  EXPECT_TRUE(sentEvents().empty());
}

TEST_F(PeriodicTasksTest, TwoArraysUnderSamplesBecomeOneInTheOrderTheModulesFinished) {
  // Module 1 is scheduled first but finishes only once module 2's contribution is in.
  std::weak_ptr<Telvane::Impl> impl = impl_;  // the block is kept by the object
  registerModule(1, false, true, [impl](Value& dictionary) {
    waitForMerges(impl, 1);
    dictionary.asDictionary()->set("samples", array({Value("first module")}));
  });
  registerModule(2, false, true, contributing(Value(Dictionary{{"samples", array({Value("a"), Value("b")})}})));
  tick(1);
  syncWithDaemon();
  EXPECT_EQ(sentPayload(), Value(Dictionary{{"samples", array({Value("a"), Value("b"), Value("first module")})}}));
}

TEST_F(PeriodicTasksTest, ContributionsMergeByTheRule) {
  std::weak_ptr<Telvane::Impl> impl = impl_;  // the block is kept by the object
  registerModule(1, false, true, [impl](Value& dictionary) {
    waitForMerges(impl, 1);
    Dictionary& entries = *dictionary.asDictionary();
    entries.set("stats", Value(Dictionary{{"b", Value(30)}, {"c", Value(4)}}));
    entries.set("samples", array({Value(2)}));
    entries.set("peak", Value(7));
    entries.set("mixed", array({Value("now a list")}));
  });
  registerModule(2, false, true, [](Value& dictionary) {
    Dictionary& entries = *dictionary.asDictionary();
    entries.set("stats", Value(Dictionary{{"a", Value(1)}, {"b", Value(2)}}));
    entries.set("samples", array({Value(1)}));
    entries.set("peak", Value(5));
    entries.set("mixed", Value(Dictionary{{"was", Value("a dictionary")}}));
  });
  tick(1);
  syncWithDaemon();
  EXPECT_EQ(sentPayload(),
            Value(Dictionary{{"mixed", array({Value("now a list")})},
                             {"peak", Value(7)},
                             {"samples", array({Value(1), Value(2)})},
                             {"stats", Value(Dictionary{{"a", Value(1)}, {"b", Value(30)}, {"c", Value(4)}})}}));
}

TEST_F(PeriodicTasksTest, AtMostFourBlocksRunAtOnce) {
  ModuleGate gate;
  constexpr std::size_t kModules = 10;
  for (std::uint32_t module = 1; module <= kModules; ++module) registerModule(module, true, false, gate.block(module));
  auto ticked = std::async(std::launch::async, [this] { tick(2); });  // an update tick
  for (std::size_t released = 0; released < kModules; ++released) {
    ASSERT_TRUE(gate.waitForEntered(std::min(released + 4, kModules)));
    EXPECT_LE(gate.running(), 4);
    gate.release();
  }
  ASSERT_EQ(ticked.wait_for(test::kClientWaitSeconds), std::future_status::ready);
  EXPECT_EQ(gate.entered().size(), kModules);
  EXPECT_EQ(gate.maxRunning(), 4);
}

TEST_F(PeriodicTasksTest, ReportTasksAreScheduledInAscendingModuleOrder) {
  ModuleGate gate;
  const std::vector<std::uint32_t> modules{300, 4, 1000, 17, 2, 65, 9, 120};
  for (std::uint32_t module : modules) registerModule(module, false, true, gate.block(module));
  log::LogCapture capture;
  auto ticked = std::async(std::launch::async, [this] { tick(1); });
  // The four smallest start first, in any order; then each freed slot goes to the next.
  ASSERT_TRUE(gate.waitForEntered(4));
  auto firstFour = gate.entered();
  std::sort(firstFour.begin(), firstFour.end());
  EXPECT_EQ(firstFour, (std::vector<std::uint32_t>{2, 4, 9, 17}));
  for (std::size_t count = 5; count <= modules.size(); ++count) {
    gate.release();
    ASSERT_TRUE(gate.waitForEntered(count));
  }
  gate.openAll();
  ASSERT_EQ(ticked.wait_for(test::kClientWaitSeconds), std::future_status::ready);
  auto entered = gate.entered();
  EXPECT_EQ(std::vector<std::uint32_t>(entered.begin() + 4, entered.end()),
            (std::vector<std::uint32_t>{65, 120, 300, 1000}));
  EXPECT_EQ(gate.maxRunning(), 4);
  syncWithDaemon();
  EXPECT_EQ(sentPayload().asDictionary()->size(), modules.size());
}

TEST_F(PeriodicTasksTest, ABlockThatThrowsContributesNothing) {
  registerModule(1, false, true, [](Value& dictionary) {
    dictionary.asDictionary()->set("partial", Value(1));
    throw std::runtime_error("sensor gone");
  });
  registerModule(2, false, true, contributing(Value(Dictionary{{"n", Value(2)}})));
  log::LogCapture capture;
  tick(1);
  syncWithDaemon();
  EXPECT_TRUE(capture.contains(log::Level::Error, "periodic task of module 1 threw: sensor gone"));
  EXPECT_TRUE(capture.contains(kAllCollected));
  EXPECT_EQ(sentPayload(), Value(Dictionary{{"n", Value(2)}}));
}

// ---- time-outs (these run in real time) ----

TEST_F(PeriodicTasksTest, AModuleThatNeverReturnsEndsTheCollectionAfterNinetyFivePercentOfTheTimeout) {
  StuckModule stuck;
  registerModule(1, true, true, stuck.block());
  registerModule(2, true, true, contributing(Value(Dictionary{{"samples", array({Value(42)})}})));
  log::LogCapture capture;
  const auto began = std::chrono::steady_clock::now();
  tick(1, 2);
  const auto took = std::chrono::steady_clock::now() - began;
  EXPECT_GE(took, 1900ms);
  EXPECT_LT(took, 1900ms + test::kClientWaitSeconds);
  EXPECT_EQ(tickLines(capture), (std::vector<std::string>{kStarted, kCollectionTimeout, kSent, kCollectionFinished}));
  EXPECT_EQ(impl_->periodicTaskCounterForTesting(), 0u);
  syncWithDaemon();
  ASSERT_EQ(sentEvents().size(), 1u);
  EXPECT_EQ(sentPayload(), Value(Dictionary{{"samples", array({Value(42)})}}));
}

TEST_F(PeriodicTasksTest, AnUpdateThatNeverReturnsIsLoggedAsAnError) {
  StuckModule stuck;
  registerModule(1, true, true, stuck.block());
  log::LogCapture capture;
  tick(2, 1);
  EXPECT_TRUE(capture.contains(log::Level::Error, "_myPeriodicTask: Timeout during RT metrics update"));
  EXPECT_TRUE(capture.contains(kUpdatesFinished));
  EXPECT_EQ(impl_->periodicTaskCounterForTesting(), 1u);
}

TEST_F(PeriodicTasksTest, NoFreeSlotWithinTheTimeoutStopsTheScheduling) {
  // Four modules that never return take every slot; the fifth is never started.
  StuckModule stuck[4];
  for (std::uint32_t module = 1; module <= 4; ++module) registerModule(module, true, true, stuck[module - 1].block());
  auto fifthCalls = std::make_shared<std::atomic<int>>(0);
  registerModule(5, true, true, contributing(Value(Dictionary{{"n", Value(5)}}), fifthCalls));
  log::LogCapture capture;
  tick(1, 1);
  EXPECT_EQ(tickLines(capture),
            (std::vector<std::string>{kStarted, "_myPeriodicTask: Timeout scheduling RT metrics report tasks",
                                      kCollectionTimeout, kCollectionFinished}));
  EXPECT_EQ(fifthCalls->load(), 0);

  capture.clear();
  tick(2, 1);  // an update tick: the four are still stuck, so no slot is free at all
  EXPECT_TRUE(capture.contains("_myPeriodicTask: Timeout scheduling RT metrics update tasks"));
  EXPECT_EQ(fifthCalls->load(), 0);
}

TEST(PeriodicTaskWait, TheTimeoutBecomesNinetyFivePercentOfItsNanoseconds) {
  EXPECT_EQ(periodicTaskWaitNanoseconds(0), 0);
  EXPECT_EQ(periodicTaskWaitNanoseconds(2), 1'900'000'000);
  // The log timer hands over its interval in nanoseconds: one second waits decades.
  EXPECT_EQ(periodicTaskWaitNanoseconds(1'000'000'000), 950'000'000'000'000'000);
  // Ten seconds lie beyond the signed range and wait without a limit.
  EXPECT_EQ(periodicTaskWaitNanoseconds(10'000'000'000), std::numeric_limits<std::int64_t>::max());
  EXPECT_FALSE(PeriodicTaskRun::deadlineAfter(std::numeric_limits<std::int64_t>::max()).has_value());
  // Nineteen seconds wrap around in the multiplication: 553255926290448384 ns, times 0.95.
  EXPECT_EQ(periodicTaskWaitNanoseconds(19'000'000'000), 525'593'129'975'925'952);
}

// ---- the log timer ----

TEST_F(PeriodicTasksTest, TheLogTimerFiresAtOnceAndThenEveryInterval) {
  registerModule(1, true, true, contributing(Value(Dictionary{{"n", Value(1)}})));
  log::LogCapture capture;
  impl_->startLogTimerWithInterval(kLongIntervalSeconds, 2, kCategory, kType);
  ASSERT_TRUE(waitForTickLine(capture, kUpdatesFinished));
  EXPECT_TRUE(capture.contains("startLogTimerWithInterval: 3600, 2"));
  EXPECT_EQ(impl_->periodicTaskCounterForTesting(), 1u);
  impl_->fireLogTimerForTesting();
  EXPECT_EQ(impl_->periodicTaskCounterForTesting(), 0u);
  EXPECT_EQ(capture.count(kSent), 1u);
  syncWithDaemon();
  auto events = sentEvents();
  ASSERT_EQ(events.size(), 1u);
  EXPECT_EQ(events[0][kTelvaneMessageParametersCategory].integerValue(), kCategory);
  EXPECT_EQ(events[0][kTelvaneMessageParametersType].integerValue(), kType);
}

TEST_F(PeriodicTasksTest, ASecondStartWhileTheTimerRunsDoesNothing) {
  registerModule(1, false, true, contributing(Value(Dictionary{{"n", Value(1)}})));
  log::LogCapture capture;
  impl_->startLogTimerWithInterval(kLongIntervalSeconds, 1, kCategory, kType);
  ASSERT_TRUE(waitForTickLine(capture, kCollectionFinished));
  impl_->startLogTimerWithInterval(60, 5, 40, 41);
  queue_->sync([] {});
  EXPECT_EQ(capture.count("startLogTimerWithInterval: 3600, 1"), 1u);
  EXPECT_FALSE(capture.contains("startLogTimerWithInterval: 60, 5"));
  impl_->fireLogTimerForTesting();
  EXPECT_EQ(impl_->periodicTaskCounterForTesting(), 0u);  // still multiplier 1
  syncWithDaemon();
  auto events = sentEvents();
  ASSERT_EQ(events.size(), 2u);
  for (const Value& event : events) EXPECT_EQ(event[kTelvaneMessageParametersCategory].integerValue(), kCategory);
}

TEST_F(PeriodicTasksTest, StoppingTheTimerResetsTheCount) {
  log::LogCapture capture;
  impl_->stopLogTimer();
  queue_->sync([] {});
  EXPECT_TRUE(capture.contains("stopLogTimer: No timer is present."));

  impl_->startLogTimerWithInterval(kLongIntervalSeconds, 3, kCategory, kType);
  ASSERT_TRUE(waitForTickLine(capture, kUpdatesFinished));
  impl_->fireLogTimerForTesting();
  EXPECT_EQ(impl_->periodicTaskCounterForTesting(), 2u);
  impl_->stopLogTimer();
  EXPECT_EQ(impl_->periodicTaskCounterForTesting(), 0u);
  EXPECT_TRUE(capture.contains("stopLogTimer."));
  // Without a timer nothing fires.
  impl_->fireLogTimerForTesting();
  EXPECT_EQ(impl_->periodicTaskCounterForTesting(), 0u);
  EXPECT_EQ(capture.count(kStarted), 2u);

  // A new timer counts from the start: its first two firings update, the third reports.
  impl_->startLogTimerWithInterval(kLongIntervalSeconds, 3, kCategory, kType);
  ASSERT_TRUE(waitForTickLine(capture, kStarted, 3));
  EXPECT_EQ(impl_->periodicTaskCounterForTesting(), 1u);
  EXPECT_EQ(capture.count(kCollectionFinished), 0u);
}

TEST_F(PeriodicTasksTest, GoingAwayStopsTheTimerAndReleasesTheObject) {
  registerModule(1, true, true, contributing(Value(Dictionary{{"n", Value(1)}})));
  log::LogCapture capture;
  impl_->startLogTimerWithInterval(kLongIntervalSeconds, 1, kCategory, kType);
  ASSERT_TRUE(waitForTickLine(capture, kCollectionFinished));
  impl_->teardown();
  std::weak_ptr<Telvane::Impl> weak = impl_;
  impl_.reset();
  // Neither the cancelled timer nor a module task keeps the object.
  EXPECT_TRUE(weak.expired());
}

// ---- through the public object ----

class PeriodicTasksClientTest : public ::testing::Test {
 protected:
  std::vector<Value> sentEvents() const {
    std::vector<Value> events;
    for (const auto& call : daemon_.calls(Op::SendMessageWithDictionary)) events.push_back(call.arguments.at(0));
    return events;
  }
  FakeDaemon daemon_;
};

TEST_F(PeriodicTasksClientTest, ARealOneSecondTimerUpdatesThenReports) {
  auto telvane = Telvane::create(test::clientSessionInfo(), test::clientUserInfo(), Value());
  ASSERT_NE(telvane, nullptr);
  auto calls = std::make_shared<std::atomic<int>>(0);
  log::LogCapture capture;
  EXPECT_TRUE(telvane->registerPeriodicTaskForModule(21, true, true, [calls](Value& dictionary) {
    dictionary.asDictionary()->set("samples", array({Value(++*calls)}));
  }));
  EXPECT_FALSE(telvane->registerPeriodicTaskForModule(22, true, true, nullptr));
  telvane->startLogTimerWithInterval(1, 2, kCategory, kType);
  // At once an update tick, a second later the report tick.
  ASSERT_TRUE(daemon_.waitForCalls(Op::SendMessageWithDictionary, 1));
  telvane->stopLogTimer();
  EXPECT_TRUE(telvane->unregisterPeriodTaskForModule(21));
  EXPECT_TRUE(capture.contains("stopLogTimer."));
  // A slow machine may fit a third firing (an update) before the stop.
  EXPECT_GE(capture.count(kUpdatesFinished), 1u);
  auto events = sentEvents();
  ASSERT_EQ(events.size(), 1u);
  EXPECT_EQ(events[0][kTelvaneMessageParametersPayload], Value(Dictionary{{"samples", array({Value(2)})}}));
  EXPECT_EQ(events[0][kTelvaneMessageParametersFlag].integerValue(), 1);
}

TEST_F(PeriodicTasksClientTest, GoingAwayEndsATickThatWaitsForAModuleThatNeverReturns) {
  StuckModule stuck;
  auto telvane = Telvane::create(test::clientSessionInfo(), test::clientUserInfo(), Value());
  ASSERT_NE(telvane, nullptr);
  telvane->registerPeriodicTaskForModule(1, true, true, stuck.block());
  telvane->registerPeriodicTaskForModule(2, true, true,
                                         contributing(Value(Dictionary{{"samples", array({Value(7)})}})));
  log::LogCapture capture;
  // Under the log timer the tick would wait for the stuck module for decades.
  telvane->startLogTimerWithInterval(1, 1, kCategory, kType);
  ASSERT_TRUE(stuck.waitUntilEntered());

  auto destroyed = std::async(std::launch::async, [&telvane] { telvane.reset(); });
  ASSERT_EQ(destroyed.wait_for(test::kClientWaitSeconds), std::future_status::ready) << "the destructor hangs";
  EXPECT_TRUE(capture.contains(kCollectionTimeout));
  EXPECT_TRUE(capture.contains(kCollectionFinished));
  // What the other module gave went out before the connection closed.
  ASSERT_TRUE(daemon_.waitForDisconnect(0));
  auto events = sentEvents();
  ASSERT_EQ(events.size(), 1u);
  EXPECT_EQ(events[0][kTelvaneMessageParametersPayload], Value(Dictionary{{"samples", array({Value(7)})}}));
}

// ---- the merge rule and the run ----

TEST(PeriodicContributionMerge, DictionariesGainEntriesArraysGrowAndOtherValuesAreReplaced) {
  Dictionary result;
  Value stats(Dictionary{{"a", Value(1)}});
  Value samples = array({Value(1)});
  mergePeriodicContribution(result, Dictionary{{"stats", stats}, {"samples", samples}, {"name", Value("x")}});
  mergePeriodicContribution(result, Dictionary{{"stats", Value(Dictionary{{"a", Value(9)}, {"b", Value(2)}})},
                                               {"samples", array({Value(2), Value(3)})},
                                               {"name", Value("y")}});
  EXPECT_EQ(Value(result), Value(Dictionary{{"name", Value("y")},
                                            {"samples", array({Value(1), Value(2), Value(3)})},
                                            {"stats", Value(Dictionary{{"a", Value(9)}, {"b", Value(2)}})}}));
  // The first module's own containers are as it made them.
  EXPECT_EQ(stats, Value(Dictionary{{"a", Value(1)}}));
  EXPECT_EQ(samples, array({Value(1)}));

  // A value of another kind than the one in place replaces it.
  mergePeriodicContribution(result, Dictionary{{"samples", Value(Dictionary{{"k", Value(1)}})}, {"name", array({})}});
  EXPECT_EQ(result.get("samples"), Value(Dictionary{{"k", Value(1)}}));
  EXPECT_EQ(result.get("name"), array({}));
}

TEST(PeriodicTaskRunTest, ACutOffEndsWaitsThatHadNoLimit) {
  PeriodicTaskRun run;
  for (int i = 0; i < PeriodicTaskRun::kMaxConcurrentModules; ++i) ASSERT_TRUE(run.acquireSlot(std::nullopt));
  run.enter();
  auto slot = std::async(std::launch::async, [&run] { return run.acquireSlot(std::nullopt); });
  auto tasks = std::async(std::launch::async, [&run] { return run.waitForTasks(std::nullopt); });
  run.cutOffAt(PeriodicTaskRun::Clock::now() + 50ms);
  ASSERT_EQ(slot.wait_for(test::kClientWaitSeconds), std::future_status::ready);
  ASSERT_EQ(tasks.wait_for(test::kClientWaitSeconds), std::future_status::ready);
  EXPECT_FALSE(slot.get());
  EXPECT_FALSE(tasks.get());
  EXPECT_TRUE(run.isCutOff());
  run.leave();
  EXPECT_TRUE(run.waitForTasks(std::nullopt));
}

TEST(PeriodicTaskRunTest, TasksThatEndBeforeTheCutOffAreWaitedFor) {
  PeriodicTaskRun run;
  ASSERT_TRUE(run.acquireSlot(std::nullopt));
  run.enter();
  run.cutOffAt(PeriodicTaskRun::Clock::now() + test::kClientWaitSeconds);
  // The wake-up of the cut-off is not a slot: three are left.
  for (int i = 1; i < PeriodicTaskRun::kMaxConcurrentModules; ++i) EXPECT_TRUE(run.acquireSlot(std::nullopt));
  EXPECT_FALSE(run.acquireSlot(PeriodicTaskRun::Clock::now() + 20ms));
  auto tasks = std::async(std::launch::async, [&run] { return run.waitForTasks(std::nullopt); });
  run.releaseSlot();
  run.leave();
  ASSERT_EQ(tasks.wait_for(test::kClientWaitSeconds), std::future_status::ready);
  EXPECT_TRUE(tasks.get());
}

}  // namespace
}  // namespace telvane
