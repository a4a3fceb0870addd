#include "platform/SerialQueue.h"

#include "platform/Log.h"
#include "support/Counter.h"

#include <asio/bind_executor.hpp>
#include <asio/dispatch.hpp>
#include <asio/post.hpp>
#include <asio/steady_timer.hpp>

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <future>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

using namespace telvane;
using namespace std::chrono_literals;

namespace {

constexpr auto kDeadline = 10s;

using test::Counter;

class SerialQueueTest : public ::testing::Test {
 protected:
  Executor executor_{"sq-test", 4};
};

TEST_F(SerialQueueTest, AsyncWorkRunsOneAtATimeInSubmissionOrder) {
  auto queue = SerialQueue::create("com.zembra.Telvane.test", executor_);
  std::vector<int> order;  // touched only on the queue
  std::atomic<int> inFlight{0};
  std::atomic<int> maxInFlight{0};
  for (int i = 0; i < 2000; ++i) {
    queue->async([&, i] {
      int now = ++inFlight;
      int seen = maxInFlight.load();
      while (now > seen && !maxInFlight.compare_exchange_weak(seen, now)) {
      }
      order.push_back(i);
      --inFlight;
    });
  }
  std::vector<int> copy;
  queue->sync([&] { copy = order; });
  ASSERT_EQ(copy.size(), 2000u);
  for (int i = 0; i < 2000; ++i) ASSERT_EQ(copy[i], i);
  EXPECT_EQ(maxInFlight.load(), 1);
}

TEST_F(SerialQueueTest, SyncWaitsForTheWorkAndSeesItsEffects) {
  auto queue = SerialQueue::create("sync", executor_);
  int value = 0;  // plain int: the sync must order the write before the read
  bool ranOnQueue = false;
  queue->async([&] { value = 1; });
  queue->sync([&] {
    ranOnQueue = queue->isCurrent();
    value = value * 10 + 2;
  });
  EXPECT_EQ(value, 12);
  EXPECT_TRUE(ranOnQueue);
}

TEST_F(SerialQueueTest, SyncFromManyThreadsIsSerialised) {
  auto queue = SerialQueue::create("sync-many", executor_);
  long total = 0;  // touched only on the queue
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&] {
      for (int i = 0; i < 200; ++i) queue->sync([&] { ++total; });
    });
  }
  for (auto& t : threads) t.join();
  long seen = 0;
  queue->sync([&] { seen = total; });
  EXPECT_EQ(seen, 800);
}

TEST_F(SerialQueueTest, AsyncFromTheQueueNeverRunsInline) {
  auto queue = SerialQueue::create("inline", executor_);
  std::vector<std::string> events;  // touched only on the queue
  Counter done;
  queue->async([&] {
    queue->async([&] {
      events.push_back("inner");
      done.add();
    });
    events.push_back("outer end");
  });
  ASSERT_TRUE(done.waitFor(1));
  std::vector<std::string> copy;
  queue->sync([&] { copy = events; });
  EXPECT_EQ(copy, (std::vector<std::string>{"outer end", "inner"}));
}

TEST_F(SerialQueueTest, IsCurrentAndLabel) {
  auto queue = SerialQueue::create("com.zembra.Telvane.main", executor_);
  auto other = SerialQueue::create("other", executor_);
  EXPECT_EQ(queue->label(), "com.zembra.Telvane.main");
  EXPECT_EQ(&queue->executor(), &executor_);
  EXPECT_FALSE(queue->isCurrent());
  bool onQueue = false;
  bool onOther = true;
  queue->sync([&] {
    onQueue = queue->isCurrent();
    onOther = other->isCurrent();
  });
  EXPECT_TRUE(onQueue);
  EXPECT_FALSE(onOther);
}

TEST_F(SerialQueueTest, QueuesOnTheMainExecutorByDefault) {
  auto queue = SerialQueue::create("default");
  EXPECT_EQ(&queue->executor(), &Executors::main());
  std::promise<bool> onMain;
  queue->async([&] { onMain.set_value(Executors::main().runsInThisThread()); });
  auto result = onMain.get_future();
  ASSERT_EQ(result.wait_for(kDeadline), std::future_status::ready);
  EXPECT_TRUE(result.get());
}

TEST_F(SerialQueueTest, AfterRunsOnTheQueueOnceTheDelayHasPassed) {
  auto queue = SerialQueue::create("after", executor_);
  Counter done;
  std::vector<int> order;  // touched only on the queue
  bool onQueue = false;
  auto start = std::chrono::steady_clock::now();
  std::chrono::steady_clock::time_point ranAt;
  queue->after(120ms, [&] {
    order.push_back(120);
    done.add();
  });
  queue->after(30ms, [&] {
    onQueue = queue->isCurrent();
    ranAt = std::chrono::steady_clock::now();
    order.push_back(30);
    done.add();
  });
  ASSERT_TRUE(done.waitFor(2));
  std::vector<int> copy;
  queue->sync([&] { copy = order; });
  EXPECT_EQ(copy, (std::vector<int>{30, 120}));
  EXPECT_TRUE(onQueue);
  EXPECT_GE(ranAt - start, 30ms);
}

TEST_F(SerialQueueTest, AfterWithZeroDelayRunsAfterWorkAlreadySubmitted) {
  auto queue = SerialQueue::create("after-zero", executor_);
  std::vector<int> order;  // touched only on the queue
  Counter done;
  std::mutex gateMutex;
  std::condition_variable gateCv;
  bool open = false;
  // Hold the queue so that both submissions are pending at once.
  queue->async([&] {
    std::unique_lock<std::mutex> lock(gateMutex);
    gateCv.wait_for(lock, kDeadline, [&] { return open; });
  });
  queue->async([&] { order.push_back(1); });
  queue->after(0ms, [&] {
    order.push_back(2);
    done.add();
  });
  {
    std::lock_guard<std::mutex> lock(gateMutex);
    open = true;
    gateCv.notify_all();
  }
  ASSERT_TRUE(done.waitFor(1));
  std::vector<int> copy;
  queue->sync([&] { copy = order; });
  EXPECT_EQ(copy, (std::vector<int>{1, 2}));
}

// Each queue is serial, but two queues on one pool run at the same time: each side
// waits, inside its task, until the other side's task has started.
TEST_F(SerialQueueTest, TwoQueuesOnOnePoolRunConcurrentlyButEachIsSerial) {
  Executor pool("sq-two", 2);
  auto a = SerialQueue::create("a", pool);
  auto b = SerialQueue::create("b", pool);

  std::mutex mutex;
  std::condition_variable cv;
  bool aStarted = false;
  bool bStarted = false;
  bool aSawB = false;
  bool bSawA = false;
  a->async([&] {
    std::unique_lock<std::mutex> lock(mutex);
    aStarted = true;
    cv.notify_all();
    aSawB = cv.wait_for(lock, kDeadline, [&] { return bStarted; });
  });
  b->async([&] {
    std::unique_lock<std::mutex> lock(mutex);
    bStarted = true;
    cv.notify_all();
    bSawA = cv.wait_for(lock, kDeadline, [&] { return aStarted; });
  });

  std::atomic<int> inFlightA{0}, inFlightB{0}, maxA{0}, maxB{0}, maxTotal{0}, total{0};
  auto track = [](std::atomic<int>& inFlight, std::atomic<int>& max) {
    int now = ++inFlight;
    int seen = max.load();
    while (now > seen && !max.compare_exchange_weak(seen, now)) {
    }
  };
  for (int i = 0; i < 500; ++i) {
    a->async([&] {
      track(inFlightA, maxA);
      track(total, maxTotal);
      std::this_thread::yield();
      --total;
      --inFlightA;
    });
    b->async([&] {
      track(inFlightB, maxB);
      track(total, maxTotal);
      std::this_thread::yield();
      --total;
      --inFlightB;
    });
  }
  a->sync([] {});
  b->sync([] {});
  EXPECT_TRUE(aSawB);
  EXPECT_TRUE(bSawA);
  EXPECT_EQ(maxA.load(), 1);
  EXPECT_EQ(maxB.load(), 1);
  EXPECT_LE(maxTotal.load(), 2);
}

TEST_F(SerialQueueTest, SubmittedWorkStillRunsAfterTheQueueObjectIsGone) {
  auto queue = SerialQueue::create("released", executor_);
  Counter done;
  std::mutex gateMutex;
  std::condition_variable gateCv;
  bool open = false;
  queue->async([&] {
    std::unique_lock<std::mutex> lock(gateMutex);
    gateCv.wait_for(lock, kDeadline, [&] { return open; });
  });
  queue->async([&] { done.add(); });
  queue->after(10ms, [&] { done.add(); });
  std::weak_ptr<SerialQueue> weak = queue;
  queue.reset();
  EXPECT_FALSE(weak.expired());  // kept by the work it still has to run
  {
    std::lock_guard<std::mutex> lock(gateMutex);
    open = true;
    gateCv.notify_all();
  }
  EXPECT_TRUE(done.waitFor(2));
  // And let go once that work has run.
  for (auto until = std::chrono::steady_clock::now() + kDeadline;
       !weak.expired() && std::chrono::steady_clock::now() < until;) {
    std::this_thread::yield();
  }
  EXPECT_TRUE(weak.expired());
}

TEST_F(SerialQueueTest, WorkOfADeadOwnerIsSkippedThroughAWeakReference) {
  auto queue = SerialQueue::create("owner", executor_);
  struct Owner {
    int calls = 0;
  };
  auto owner = std::make_shared<Owner>();
  Counter done;
  std::mutex gateMutex;
  std::condition_variable gateCv;
  bool open = false;
  queue->async([&] {
    std::unique_lock<std::mutex> lock(gateMutex);
    gateCv.wait_for(lock, kDeadline, [&] { return open; });
  });
  bool sawOwner = true;
  queue->async([weak = std::weak_ptr<Owner>(owner), &sawOwner, &done] {
    auto strong = weak.lock();
    sawOwner = strong != nullptr;
    if (strong) ++strong->calls;
    done.add();
  });
  owner.reset();
  {
    std::lock_guard<std::mutex> lock(gateMutex);
    open = true;
    gateCv.notify_all();
  }
  ASSERT_TRUE(done.waitFor(1));
  queue->sync([] {});
  EXPECT_FALSE(sawOwner);
}

TEST_F(SerialQueueTest, SyncOnAnIdleQueueRunsOnTheCallingThread) {
  auto queue = SerialQueue::create("idle", executor_);
  std::thread::id ranOn;
  bool onQueue = false;
  queue->sync([&] {
    ranOn = std::this_thread::get_id();
    onQueue = queue->isCurrent();
  });
  EXPECT_EQ(ranOn, std::this_thread::get_id());
  EXPECT_TRUE(onQueue);
  EXPECT_FALSE(queue->isCurrent());
}

TEST_F(SerialQueueTest, SyncWaitsWhileAnotherThreadRunsTheQueue) {
  auto queue = SerialQueue::create("busy", executor_);
  Counter started;
  std::mutex gateMutex;
  std::condition_variable gateCv;
  bool open = false;
  std::vector<int> order;  // touched only on the queue
  std::thread::id busyThread;
  queue->async([&] {
    busyThread = std::this_thread::get_id();
    started.add();
    std::unique_lock<std::mutex> lock(gateMutex);
    gateCv.wait_for(lock, kDeadline, [&] { return open; });
    order.push_back(1);
  });
  ASSERT_TRUE(started.waitFor(1));
  std::thread opener([&] {
    // Opens the gate only once the sync below has had its chance to run too early.
    queue->executor().post([&] {
      std::lock_guard<std::mutex> lock(gateMutex);
      open = true;
      gateCv.notify_all();
    });
  });
  queue->sync([&] { order.push_back(2); });
  opener.join();
  std::vector<int> copy;
  queue->sync([&] { copy = order; });
  EXPECT_EQ(copy, (std::vector<int>{1, 2}));
}

TEST_F(SerialQueueTest, SyncRunsWaitingWorkFirstEvenWhenTheExecutorIsStopped) {
  Executor stopped("sq-stopped", 1);
  auto queue = SerialQueue::create("late", stopped);
  stopped.stop();
  std::vector<int> order;
  queue->async([&] { order.push_back(1); });
  queue->async([&] { order.push_back(2); });
  queue->sync([&] { order.push_back(3); });
  EXPECT_EQ(order, (std::vector<int>{1, 2, 3}));
  queue->async([&] { order.push_back(4); });  // no worker left to run it
  EXPECT_EQ(order.size(), 3u);
}

// Every worker of the pool runs a session task that waits in sync() for its backend's
// queue on the same pool. That needs no further worker, so none of them starves.
TEST_F(SerialQueueTest, SyncIntoQueuesOfTheSamePoolCannotStarveIt) {
  auto* pool = new Executor("sq-sync-pool", 2);  // left behind if the test fails
  constexpr int kSessions = 6;
  std::mutex mutex;
  std::condition_variable cv;
  int inside = 0;
  int done = 0;
  int maxInside = 0;
  std::vector<std::shared_ptr<SerialQueue>> queues;
  for (int i = 0; i < kSessions; ++i) {
    auto session = SerialQueue::create("session-" + std::to_string(i), *pool);
    auto backend = SerialQueue::create("backend-" + std::to_string(i), *pool);
    queues.push_back(session);
    queues.push_back(backend);
    backend->async([] {});  // work waiting on the backend queue, for the pool to pick up
    session->async([&, backend, i] {
      {
        // Hold on until both workers are inside a session task.
        std::unique_lock<std::mutex> lock(mutex);
        ++inside;
        maxInside = std::max(maxInside, inside);
        cv.notify_all();
        cv.wait_for(lock, kDeadline, [&] { return maxInside >= 2 || i == kSessions - 1; });
      }
      int state = 0;
      backend->sync([&] { state = 2; });
      std::lock_guard<std::mutex> lock(mutex);
      --inside;
      if (state == 2) ++done;
      cv.notify_all();
    });
  }
  bool finished;
  {
    std::unique_lock<std::mutex> lock(mutex);
    finished = cv.wait_for(lock, kDeadline, [&] { return done == kSessions; });
    EXPECT_EQ(maxInside, 2);
  }
  ASSERT_TRUE(finished);
  queues.clear();
  delete pool;
}

TEST_F(SerialQueueTest, AsioHandlersBoundToTheQueueRunOnIt) {
  auto queue = SerialQueue::create("asio", executor_);
  Counter done;
  std::vector<std::string> events;  // touched only on the queue
  asio::steady_timer timer(executor_.context(), 5ms);
  timer.async_wait(asio::bind_executor(queue->strand(), [&](const std::error_code& error) {
    events.push_back(queue->isCurrent() && !error ? "timer on queue" : "timer elsewhere");
    done.add();
  }));
  asio::post(queue->strand(), [&, owned = std::make_unique<int>(7)] {
    events.push_back(queue->isCurrent() && *owned == 7 ? "post on queue" : "post elsewhere");
    done.add();
  });
  asio::dispatch(queue->strand(), [&] {
    events.push_back(queue->isCurrent() ? "dispatch on queue" : "dispatch elsewhere");
    done.add();
  });
  ASSERT_TRUE(done.waitFor(3));
  std::vector<std::string> copy;
  queue->sync([&] { copy = events; });
  // The timer may fire before or after the two posts on a loaded machine; the posts
  // keep their order.
  auto post = std::find(copy.begin(), copy.end(), "post on queue");
  auto dispatch = std::find(copy.begin(), copy.end(), "dispatch on queue");
  EXPECT_TRUE(post < dispatch);
  std::sort(copy.begin(), copy.end());
  EXPECT_EQ(copy, (std::vector<std::string>{"dispatch on queue", "post on queue", "timer on queue"}));
  EXPECT_TRUE(queue->strand() == queue->strand());
  EXPECT_FALSE(queue->strand() == SerialQueue::create("other", executor_)->strand());
  bool running = false;
  queue->sync([&] { running = queue->strand().running_in_this_thread(); });
  EXPECT_TRUE(running);
}

TEST_F(SerialQueueTest, SyncInsideSyncMarksBothQueuesCurrent) {
  auto outer = SerialQueue::create("outer", executor_);
  auto inner = SerialQueue::create("inner", executor_);
  bool outerCurrent = false;
  bool innerCurrent = false;
  outer->sync([&] {
    inner->sync([&] {
      outerCurrent = outer->isCurrent();
      innerCurrent = inner->isCurrent();
    });
  });
  EXPECT_TRUE(outerCurrent);
  EXPECT_TRUE(innerCurrent);
}

TEST_F(SerialQueueTest, AssertOnQueuePassesOnTheQueue) {
  auto queue = SerialQueue::create("assert", executor_);
  bool reached = false;
  queue->sync([&] {
    assertOnQueue(queue);
    assertOnQueue(*queue);
    assertOnQueue(queue.get());
    reached = true;
  });
  EXPECT_TRUE(reached);
}

#ifndef NDEBUG
TEST(SerialQueueDeathTest, AssertOnQueueAbortsOffTheQueue) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(
      {
        Executor executor("sq-death", 1);
        auto queue = SerialQueue::create("com.zembra.Telvane.checked", executor);
        assertOnQueue(queue);
      },
      "assertOnQueue: .*SerialQueue_test.cpp:[0-9]+ .*does not run on queue com.zembra.Telvane.checked");
}

TEST(SerialQueueDeathTest, SyncFromTheQueueItselfAborts) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(
      {
        Executor executor("sq-death", 1);
        auto queue = SerialQueue::create("self", executor);
        queue->sync([&] { queue->sync([] {}); });
      },
      "SerialQueue self: sync called on the queue itself would wait for ever");
}
#endif

}  // namespace
