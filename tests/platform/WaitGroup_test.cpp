#include "platform/WaitGroup.h"
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

class WaitGroupTest : public ::testing::Test {
 protected:
  Executor executor_{"group-test", 3};
  std::shared_ptr<SerialQueue> queue_ = SerialQueue::create("group", executor_);
};

TEST_F(WaitGroupTest, WaitReturnsOnceEveryPieceHasLeft) {
  WaitGroup group;
  std::atomic<int> done{0};
  std::vector<std::shared_ptr<SerialQueue>> queues;
  for (int i = 0; i < 6; ++i) {
    auto queue = SerialQueue::create("worker", executor_);
    queues.push_back(queue);
    group.enter();
    queue->async([&] {
      ++done;
      group.leave();
    });
  }
  group.wait();
  EXPECT_EQ(done.load(), 6);
  EXPECT_EQ(group.count(), 0u);
}

TEST_F(WaitGroupTest, WaitOnAnEmptyGroupReturnsAtOnce) {
  WaitGroup group;
  group.wait();
  EXPECT_TRUE(group.waitFor(0ms));
  EXPECT_EQ(group.count(), 0u);
}

TEST_F(WaitGroupTest, TimedWaitGivesUpWhileWorkIsOutstanding) {
  WaitGroup group;
  group.enter();
  group.enter();
  auto start = std::chrono::steady_clock::now();
  EXPECT_FALSE(group.waitFor(50ms));
  EXPECT_GE(std::chrono::steady_clock::now() - start, 50ms);
  group.leave();
  EXPECT_FALSE(group.waitUntil(std::chrono::steady_clock::now() + 10ms));
  EXPECT_EQ(group.count(), 1u);
  group.leave();
  EXPECT_TRUE(group.waitFor(0ms));
}

TEST_F(WaitGroupTest, TimedWaitWakesWhenTheCountReachesZero) {
  WaitGroup group;
  group.enter();
  std::thread leaver([&] { queue_->async([&] { group.leave(); }); });
  EXPECT_TRUE(group.waitFor(kDeadline));
  leaver.join();
}

TEST_F(WaitGroupTest, NotifyRunsOnTheQueueWhenTheCountReachesZero) {
  WaitGroup group;
  Counter notified;
  bool onQueue = false;
  group.enter();
  group.enter();
  group.notify(queue_, [&] {
    onQueue = queue_->isCurrent();
    notified.add();
  });
  group.leave();
  queue_->sync([] {});
  EXPECT_EQ(notified.value(), 0);
  group.leave();
  ASSERT_TRUE(notified.waitFor(1));
  EXPECT_TRUE(onQueue);

  // A notification runs once: the group reaching zero again does not repeat it.
  group.enter();
  group.leave();
  queue_->sync([] {});
  EXPECT_EQ(notified.value(), 1);
}

TEST_F(WaitGroupTest, NotifyOnAnEmptyGroupRunsAsynchronously) {
  WaitGroup group;
  Counter notified;
  bool ranInline = true;
  bool returned = false;  // both touched only on the queue
  queue_->sync([&] {
    group.notify(queue_, [&] {
      ranInline = !returned;
      notified.add();
    });
    returned = true;
  });
  ASSERT_TRUE(notified.waitFor(1));
  EXPECT_FALSE(ranInline);
}

TEST_F(WaitGroupTest, WorkOutlivingATimedOutWaitKeepsTheGroupAlive) {
  auto group = std::make_shared<WaitGroup>();
  std::mutex gateMutex;
  std::condition_variable gateCv;
  bool open = false;
  Counter finished;
  group->enter();
  queue_->async([group, &gateMutex, &gateCv, &open, &finished] {
    {
      std::unique_lock<std::mutex> lock(gateMutex);
      gateCv.wait_for(lock, kDeadline, [&] { return open; });
    }
    group->leave();
    finished.add();
  });
  EXPECT_FALSE(group->waitFor(20ms));
  std::weak_ptr<WaitGroup> weak = group;
  group.reset();
  EXPECT_FALSE(weak.expired());
  {
    std::lock_guard<std::mutex> lock(gateMutex);
    open = true;
    gateCv.notify_all();
  }
  ASSERT_TRUE(finished.waitFor(1));
  queue_->sync([] {});
  EXPECT_TRUE(weak.expired());
}

TEST_F(WaitGroupTest, SemaphoreLimitsConcurrency) {
  Semaphore slots(2);
  EXPECT_TRUE(slots.try_acquire());
  EXPECT_TRUE(slots.try_acquire_for(10ms));
  EXPECT_FALSE(slots.try_acquire_for(20ms));
  slots.release();
  EXPECT_TRUE(slots.try_acquire_for(kDeadline));
  slots.release(2);
}

#ifndef NDEBUG
TEST(WaitGroupDeathTest, LeaveWithoutEnterAborts) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(
      {
        WaitGroup group;
        group.leave();
      },
      "WaitGroup::leave without enter");
}
#endif

}  // namespace
