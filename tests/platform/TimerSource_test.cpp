#include "platform/TimerSource.h"
#include "support/Counter.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <thread>
#include <vector>

using namespace telvane;
using namespace std::chrono_literals;

namespace {

constexpr auto kDeadline = 10s;

using test::Counter;

class TimerSourceTest : public ::testing::Test {
 protected:
  // Lets the queue run for `span` more and returns once that work has run, so that a
  // firing that should not come would have come by then.
  void drain(std::chrono::milliseconds span) {
    Counter probe;
    queue_->after(span, [&] { probe.add(); });
    ASSERT_TRUE(probe.waitFor(1));
  }

  Executor executor_{"timer-test", 2};
  std::shared_ptr<SerialQueue> queue_ = SerialQueue::create("timers", executor_);
};

TEST_F(TimerSourceTest, OneShotFiresOnceOnTheQueueAfterItsDelay) {
  Counter fired;
  bool onQueue = false;
  auto start = std::chrono::steady_clock::now();
  std::chrono::steady_clock::time_point firedAt;
  auto timer = TimerSource::create(queue_, [&] {
    onQueue = queue_->isCurrent();
    firedAt = std::chrono::steady_clock::now();
    fired.add();
  });
  timer->schedule(40ms);
  timer->resume();
  ASSERT_TRUE(fired.waitFor(1));
  drain(100ms);
  EXPECT_EQ(fired.value(), 1);
  EXPECT_TRUE(onQueue);
  EXPECT_GE(firedAt - start, 40ms);
  timer->cancel();
}

TEST_F(TimerSourceTest, NothingFiresBeforeResume) {
  Counter fired;
  auto timer = TimerSource::create(queue_, [&] { fired.add(); });
  timer->schedule(0ms);
  drain(60ms);
  EXPECT_EQ(fired.value(), 0);
  timer->resume();
  EXPECT_TRUE(fired.waitFor(1));
  timer->cancel();
}

TEST_F(TimerSourceTest, ScheduleAfterResumeArmsTheTimer) {
  Counter fired;
  auto timer = TimerSource::create(queue_, [&] { fired.add(); });
  timer->resume();
  drain(30ms);
  EXPECT_EQ(fired.value(), 0);  // resumed without a schedule: never fires
  timer->schedule(10ms);
  EXPECT_TRUE(fired.waitFor(1));
  timer->cancel();
}

TEST_F(TimerSourceTest, RescheduleReplacesTheEarlierSchedule) {
  Counter fired;
  auto timer = TimerSource::create(queue_, [&] { fired.add(); });
  timer->schedule(std::chrono::hours(1));
  timer->resume();
  timer->schedule(20ms);
  EXPECT_TRUE(fired.waitFor(1, 5s));
  drain(60ms);
  EXPECT_EQ(fired.value(), 1);
  timer->cancel();
}

TEST_F(TimerSourceTest, RepeatingTimerFiresUntilCancelled) {
  Counter fired;
  Counter cancelled;
  int firingsAtCancel = -1;
  auto timer = TimerSource::create(queue_, [&] { fired.add(); });
  timer->setCancelHandler([&] {
    firingsAtCancel = fired.value();
    cancelled.add();
  });
  timer->schedule(5ms, 5ms);
  timer->resume();
  ASSERT_TRUE(fired.waitFor(5));
  queue_->sync([&] { timer->cancel(); });  // on the queue: no firing after this
  int atCancel = fired.value();
  ASSERT_TRUE(cancelled.waitFor(1));
  drain(50ms);
  EXPECT_EQ(fired.value(), atCancel);
  EXPECT_EQ(firingsAtCancel, atCancel);
  EXPECT_TRUE(timer->isCanceled());
}

TEST_F(TimerSourceTest, CancelFromTheHandlerStopsAtOnce) {
  Counter fired;
  Counter cancelled;
  std::shared_ptr<TimerSource> timer;
  timer = TimerSource::create(queue_, [&] {
    fired.add();
    if (fired.value() == 3) timer->cancel();
  });
  timer->setCancelHandler([&] { cancelled.add(); });
  timer->schedule(1ms, 1ms);
  timer->resume();
  ASSERT_TRUE(cancelled.waitFor(1));
  drain(40ms);
  EXPECT_EQ(fired.value(), 3);
  EXPECT_EQ(cancelled.value(), 1);
}

TEST_F(TimerSourceTest, CancelActionRunsExactlyOnceOnTheQueue) {
  Counter cancelled;
  std::atomic<bool> onQueue{false};
  auto timer = TimerSource::create(queue_, [] {});
  timer->setCancelHandler([&] {
    onQueue = queue_->isCurrent();
    cancelled.add();
  });
  timer->schedule(1ms, 1ms);
  timer->resume();
  std::vector<std::thread> threads;
  for (int i = 0; i < 4; ++i) threads.emplace_back([&] { timer->cancel(); });
  for (auto& t : threads) t.join();
  timer->cancel();
  ASSERT_TRUE(cancelled.waitFor(1));
  drain(20ms);
  EXPECT_EQ(cancelled.value(), 1);
  EXPECT_TRUE(onQueue);
}

TEST_F(TimerSourceTest, CancelOfANeverResumedSourceStillRunsTheCancelAction) {
  Counter fired;
  Counter cancelled;
  auto timer = TimerSource::create(queue_, [&] { fired.add(); });
  timer->setCancelHandler([&] { cancelled.add(); });
  timer->schedule(0ms);
  timer->cancel();
  timer->resume();  // too late: a cancelled source stays quiet
  ASSERT_TRUE(cancelled.waitFor(1));
  drain(30ms);
  EXPECT_EQ(fired.value(), 0);
}

TEST_F(TimerSourceTest, HandlersAreReleasedAfterTheCancelAction) {
  auto token = std::make_shared<int>(7);
  Counter cancelled;
  auto timer = TimerSource::create(queue_, [token] {});
  timer->setCancelHandler([token, &cancelled] { cancelled.add(); });
  EXPECT_EQ(token.use_count(), 3);
  timer->resume();
  timer->cancel();
  ASSERT_TRUE(cancelled.waitFor(1));
  queue_->sync([] {});
  EXPECT_EQ(token.use_count(), 1);
}

TEST_F(TimerSourceTest, ReleasedWithoutCancelStopsSilently) {
  Counter fired;
  Counter cancelled;
  auto timer = TimerSource::create(queue_, [&] { fired.add(); });
  timer->setCancelHandler([&] { cancelled.add(); });
  timer->schedule(2ms, 2ms);
  timer->resume();
  ASSERT_TRUE(fired.waitFor(2));
  std::weak_ptr<TimerSource> weak = timer;
  timer.reset();
  queue_->sync([] {});  // a firing that held the source meanwhile has ended
  EXPECT_TRUE(weak.expired());
  int atRelease = fired.value();
  drain(40ms);
  EXPECT_EQ(fired.value(), atRelease);
  EXPECT_EQ(cancelled.value(), 0);
}

// A repeating timer whose queue was busy for many periods fires once for all of them
// and then keeps its period, instead of firing back to back for each missed one.
TEST_F(TimerSourceTest, MissedPeriodsCollapseIntoOneFiring) {
  std::mutex mutex;
  std::vector<std::chrono::steady_clock::time_point> firings;  // guarded by mutex
  Counter fired;
  auto timer = TimerSource::create(queue_, [&] {
    {
      std::lock_guard<std::mutex> lock(mutex);
      firings.push_back(std::chrono::steady_clock::now());
    }
    fired.add();
  });
  timer->schedule(20ms, 20ms);
  timer->resume();
  ASSERT_TRUE(fired.waitFor(1));
  // Keep the queue busy for about ten periods.
  std::chrono::steady_clock::time_point busyUntil;
  int before = 0;
  queue_->sync([&] {
    busyUntil = std::chrono::steady_clock::now() + 200ms;
    std::mutex idle;
    std::condition_variable never;
    std::unique_lock<std::mutex> lock(idle);
    never.wait_until(lock, busyUntil, [] { return false; });
    before = fired.value();  // firings only happen on this queue
  });
  ASSERT_TRUE(fired.waitFor(before + 3));
  timer->cancel();
  std::lock_guard<std::mutex> lock(mutex);
  // The late firing comes first; the next one falls on the following period boundary
  // (somewhere in the next 20 ms) and the one after a full period later. Firing once
  // per missed period would instead bunch them up right after the busy spell.
  auto firstAfter = firings[before];
  auto thirdAfter = firings[before + 2];
  EXPECT_GE(firstAfter, busyUntil);
  EXPECT_GE(thirdAfter - firstAfter, 20ms);
}

}  // namespace
