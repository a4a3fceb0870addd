// The concurrent work queue of the periodic tasks: items run in parallel on an elastic
// pool of workers, a blocked item never holds the others, the pool has a ceiling, and
// work submitted before the queue was released still runs.
#include "client/ConcurrentQueue.h"

#include <gtest/gtest.h>

#include <atomic>
#include <latch>
#include <memory>

#include "support/ClientTestHelpers.h"
#include "support/WaitUntil.h"

namespace telvane {
namespace {

TEST(ConcurrentQueueTest, ItemsRunAtTheSameTime) {
  auto queue = ConcurrentQueue::create("com.example.Test.Parallel");
  // Each item waits until all three have started: only parallel items get there.
  auto started = std::make_shared<std::latch>(3);
  auto finished = std::make_shared<std::atomic<int>>(0);
  for (int i = 0; i < 3; ++i) {
    queue->async([started, finished] {
      started->arrive_and_wait();
      ++*finished;
    });
  }
  EXPECT_TRUE(test::waitUntil([&] { return finished->load() == 3; }));
  EXPECT_EQ(queue->label(), "com.example.Test.Parallel");
}

TEST(ConcurrentQueueTest, AnItemThatBlocksDoesNotHoldTheOthers) {
  auto queue = ConcurrentQueue::create("com.example.Test.Blocked");
  auto gate = std::make_shared<std::latch>(1);
  queue->async([gate] { gate->wait(); });
  auto ran = std::make_shared<std::atomic<int>>(0);
  for (int i = 0; i < 5; ++i) queue->async([ran] { ++*ran; });
  EXPECT_TRUE(test::waitUntil([&] { return ran->load() == 5; }));
  gate->count_down();
}

TEST(ConcurrentQueueTest, AtTheCeilingWorkWaitsForAWorker) {
  auto queue = ConcurrentQueue::create("com.example.Test.Ceiling", 2);
  auto gate = std::make_shared<std::latch>(1);
  auto blocked = std::make_shared<std::atomic<int>>(0);
  for (int i = 0; i < 2; ++i) {
    queue->async([gate, blocked] {
      ++*blocked;
      gate->wait();
    });
  }
  ASSERT_TRUE(test::waitUntil([&] { return blocked->load() == 2; }));
  auto third = std::make_shared<std::atomic<bool>>(false);
  queue->async([third] { *third = true; });
  EXPECT_EQ(queue->threadCount(), 2u);
  EXPECT_FALSE(third->load());
  gate->count_down();
  EXPECT_TRUE(test::waitUntil([&] { return third->load(); }));
}

TEST(ConcurrentQueueTest, WorkSubmittedBeforeTheReleaseStillRuns) {
  auto queue = ConcurrentQueue::create("com.example.Test.Release", 1);
  auto gate = std::make_shared<std::latch>(1);
  auto ran = std::make_shared<std::atomic<int>>(0);
  queue->async([gate, ran] {
    gate->wait();
    ++*ran;
  });
  queue->async([ran] { ++*ran; });
  queue.reset();
  gate->count_down();
  EXPECT_TRUE(test::waitUntil([&] { return ran->load() == 2; }));
}

}  // namespace
}  // namespace telvane
