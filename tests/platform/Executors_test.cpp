#include "platform/Executors.h"

#include "platform/SerialQueue.h"
#include "platform/TimerSource.h"

#include <gtest/gtest.h>

#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <future>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <thread>
#include <vector>

using namespace telvane;
using namespace std::chrono_literals;

namespace {

constexpr auto kDeadline = 10s;

// A gate that tasks wait at (with a deadline) until the test opens it.
class Gate {
 public:
  void open() {
    std::lock_guard<std::mutex> lock(mutex_);
    open_ = true;
    cv_.notify_all();
  }
  bool waitOpen(std::chrono::milliseconds timeout = kDeadline) {
    std::unique_lock<std::mutex> lock(mutex_);
    return cv_.wait_for(lock, timeout, [&] { return open_; });
  }

 private:
  std::mutex mutex_;
  std::condition_variable cv_;
  bool open_ = false;
};

// Sets or clears an environment variable for the life of the object.
class ScopedEnvironment {
 public:
  ScopedEnvironment(const char* name, const char* value) : name_(name) {
    if (const char* old = std::getenv(name)) old_ = old;
    if (value) {
      ::setenv(name, value, 1);
    } else {
      ::unsetenv(name);
    }
  }
  ~ScopedEnvironment() {
    if (old_) {
      ::setenv(name_.c_str(), old_->c_str(), 1);
    } else {
      ::unsetenv(name_.c_str());
    }
  }

 private:
  std::string name_;
  std::optional<std::string> old_;
};

TEST(ExecutorsTest, MainThreadCountComesFromTheEnvironmentWhenValid) {
  const std::size_t fallback = std::max<std::size_t>(2, std::thread::hardware_concurrency());
  {
    ScopedEnvironment env("TELVANED_WORKER_THREADS", nullptr);
    EXPECT_EQ(Executors::mainThreadCount(), fallback);
  }
  {
    ScopedEnvironment env("TELVANED_WORKER_THREADS", "3");
    EXPECT_EQ(Executors::mainThreadCount(), 3u);
  }
  {
    ScopedEnvironment env("TELVANED_WORKER_THREADS", "1");
    EXPECT_EQ(Executors::mainThreadCount(), 1u);
  }
  {
    ScopedEnvironment env("TELVANED_WORKER_THREADS", "256");
    EXPECT_EQ(Executors::mainThreadCount(), 256u);
  }
  for (const char* bad : {"0", "257", "-4", "4x", " 4", "abc", ""}) {
    ScopedEnvironment env("TELVANED_WORKER_THREADS", bad);
    EXPECT_EQ(Executors::mainThreadCount(), fallback) << "value '" << bad << "'";
  }
}

TEST(ExecutorsTest, ProcessWideExecutorsAreMadeOnceAndKeptApart) {
  std::vector<std::thread> threads;
  std::mutex mutex;
  std::set<Executor*> mains;
  std::set<Executor*> networks;
  for (int i = 0; i < 8; ++i) {
    threads.emplace_back([&] {
      Executor* m = &Executors::main();
      Executor* n = &Executors::network();
      std::lock_guard<std::mutex> lock(mutex);
      mains.insert(m);
      networks.insert(n);
    });
  }
  for (auto& t : threads) t.join();
  ASSERT_EQ(mains.size(), 1u);
  ASSERT_EQ(networks.size(), 1u);
  EXPECT_NE(*mains.begin(), *networks.begin());
  EXPECT_GE(Executors::main().threadCount(), 2u);
  EXPECT_EQ(Executors::network().threadCount(), Executors::kNetworkThreads);
  EXPECT_FALSE(Executors::main().stopped());

  std::promise<std::pair<bool, bool>> onMain;
  Executors::main().post([&] {
    onMain.set_value({Executors::main().runsInThisThread(), Executors::network().runsInThisThread()});
  });
  auto mainResult = onMain.get_future();
  ASSERT_EQ(mainResult.wait_for(kDeadline), std::future_status::ready);
  EXPECT_EQ(mainResult.get(), std::make_pair(true, false));

  std::promise<std::pair<bool, bool>> onNetwork;
  Executors::network().post([&] {
    onNetwork.set_value({Executors::main().runsInThisThread(), Executors::network().runsInThisThread()});
  });
  auto networkResult = onNetwork.get_future();
  ASSERT_EQ(networkResult.wait_for(kDeadline), std::future_status::ready);
  EXPECT_EQ(networkResult.get(), std::make_pair(false, true));
  EXPECT_FALSE(Executors::main().runsInThisThread());
}

TEST(ExecutorsTest, PrivateExecutorRunsWorkOnAllItsThreads) {
  Executor executor("private", 3);
  EXPECT_EQ(executor.name(), "private");
  EXPECT_EQ(executor.threadCount(), 3u);
  // Three tasks that each wait until all three have started can only finish when they
  // run on three threads at once.
  std::mutex mutex;
  std::condition_variable cv;
  int started = 0;
  int met = 0;
  std::set<std::thread::id> threads;
  for (int i = 0; i < 3; ++i) {
    executor.post([&] {
      std::unique_lock<std::mutex> lock(mutex);
      ++started;
      threads.insert(std::this_thread::get_id());
      cv.notify_all();
      if (cv.wait_for(lock, kDeadline, [&] { return started == 3; })) ++met;
      cv.notify_all();
    });
  }
  std::unique_lock<std::mutex> lock(mutex);
  ASSERT_TRUE(cv.wait_for(lock, kDeadline, [&] { return met == 3; }));
  EXPECT_EQ(threads.size(), 3u);
}

TEST(ExecutorsTest, AtLeastOneThread) {
  Executor executor("one", 0);
  EXPECT_EQ(executor.threadCount(), 1u);
  std::promise<bool> ran;
  executor.post([&] { ran.set_value(executor.runsInThisThread()); });
  auto result = ran.get_future();
  ASSERT_EQ(result.wait_for(kDeadline), std::future_status::ready);
  EXPECT_TRUE(result.get());
}

TEST(ExecutorsTest, StopWaitsForRunningWorkAndDropsTheRest) {
  auto token = std::make_shared<int>(0);
  std::atomic<int> laterRan{0};
  {
    Executor executor("stopper", 1);
    Gate started;
    Gate release;
    auto queue = SerialQueue::create("pending", executor);
    executor.post([&] {
      started.open();
      release.waitOpen();
    });
    ASSERT_TRUE(started.waitOpen());
    // All of this stays pending behind the busy worker.
    executor.post([&laterRan, token] { ++laterRan; });
    // Work that holds its own queue: dropping it with the executor breaks that cycle.
    queue->async([&laterRan, token, queue] { ++laterRan; });
    queue->after(std::chrono::hours(1), [&laterRan, token] { ++laterRan; });
    auto timer = TimerSource::create(queue, [&laterRan, token] { ++laterRan; });
    timer->schedule(0ms);
    timer->resume();
    EXPECT_EQ(token.use_count(), 5);
    std::weak_ptr<SerialQueue> weakQueue = queue;
    timer.reset();  // sources and queues go before their executor
    queue.reset();
    EXPECT_FALSE(weakQueue.expired());

    std::thread stopper([&] { executor.stop(); });
    for (auto until = std::chrono::steady_clock::now() + kDeadline;
         !executor.stopped() && std::chrono::steady_clock::now() < until;) {
      std::this_thread::yield();
    }
    EXPECT_TRUE(executor.stopped());
    release.open();
    stopper.join();
    executor.post([&laterRan, token] { ++laterRan; });  // kept, never run
    executor.stop();                                     // idempotent
  }
  EXPECT_EQ(laterRan.load(), 0);
  EXPECT_EQ(token.use_count(), 1);  // the executor released the work it never ran
}

TEST(ExecutorsTest, DestroyingTheExecutorReleasesQueuesKeptAliveByTheirOwnWork) {
  std::weak_ptr<SerialQueue> weakQueue;
  {
    Executor executor("cycle", 1);
    Gate started;
    Gate release;
    executor.post([&] {
      started.open();
      release.waitOpen();
    });
    ASSERT_TRUE(started.waitOpen());
    auto queue = SerialQueue::create("self-held", executor);
    queue->async([queue] {});
    queue->after(std::chrono::hours(1), [queue] {});
    weakQueue = queue;
    queue.reset();
    std::thread stopper([&] { executor.stop(); });
    for (auto until = std::chrono::steady_clock::now() + kDeadline;
         !executor.stopped() && std::chrono::steady_clock::now() < until;) {
      std::this_thread::yield();
    }
    release.open();
    stopper.join();
    EXPECT_FALSE(weakQueue.expired());
  }
  EXPECT_TRUE(weakQueue.expired());
}

// The session pool may be full of tasks that each wait for an HTTP completion. The
// completions come from the network executor and need no thread of the session pool,
// so every waiting session finishes. Six sessions wait at once on a pool of two.
struct BlockedSessionsOutcome {
  int completed = 0;
  int timedOut = 0;
  int maxBlockedAtOnce = 0;
};

BlockedSessionsOutcome runBlockedSessions(Executor& mainPool, Executor& networkPool,
                                          std::function<void(std::function<void()>)> deliver,
                                          std::chrono::milliseconds waitLimit) {
  constexpr int kSessions = 6;
  std::mutex mutex;
  std::condition_variable cv;
  int blocked = 0;
  int started = 0;
  int finished = 0;
  BlockedSessionsOutcome outcome;
  std::vector<std::shared_ptr<SerialQueue>> sessions;
  for (int i = 0; i < kSessions; ++i) {
    auto session = SerialQueue::create("session-" + std::to_string(i), mainPool);
    sessions.push_back(session);
    session->async([&] {
      auto reply = std::make_shared<std::promise<void>>();
      auto arrived = reply->get_future();
      {
        std::lock_guard<std::mutex> lock(mutex);
        ++started;
        ++blocked;
        outcome.maxBlockedAtOnce = std::max(outcome.maxBlockedAtOnce, blocked);
        cv.notify_all();
      }
      // The request: its completion is produced on the network executor, and only once
      // every thread of the session pool is blocked (or no more sessions will come).
      networkPool.post([&, reply, deliver] {
        {
          std::unique_lock<std::mutex> lock(mutex);
          cv.wait_for(lock, kDeadline, [&] {
            return blocked >= static_cast<int>(mainPool.threadCount()) || started == kSessions;
          });
        }
        deliver([reply] { reply->set_value(); });
      });
      bool ok = arrived.wait_for(waitLimit) == std::future_status::ready;
      std::lock_guard<std::mutex> lock(mutex);
      --blocked;
      ++finished;
      ++(ok ? outcome.completed : outcome.timedOut);
      cv.notify_all();
    });
  }
  std::unique_lock<std::mutex> lock(mutex);
  cv.wait_for(lock, kDeadline * 2, [&] { return finished == kSessions; });
  return outcome;
}

TEST(ExecutorsTest, SessionsBlockedOnNetworkCompletionsCannotStarveThem) {
  Executor mainPool("starve-main", 2);
  Executor networkPool("starve-net", 1);
  auto outcome = runBlockedSessions(
      mainPool, networkPool, [](std::function<void()> complete) { complete(); }, kDeadline);
  EXPECT_EQ(outcome.completed, 6);
  EXPECT_EQ(outcome.timedOut, 0);
  EXPECT_EQ(outcome.maxBlockedAtOnce, 2);  // the whole pool was blocked at some point
}

// The control case: when the completion has to hop onto a queue of the blocked pool,
// it cannot run while every thread waits, and the waits run into their limit.
TEST(ExecutorsTest, CompletionsNeedingTheBlockedPoolStarve) {
  Executor mainPool("starve-main", 2);
  Executor networkPool("starve-net", 1);
  auto hop = SerialQueue::create("hop", mainPool);
  auto outcome = runBlockedSessions(
      mainPool, networkPool, [hop](std::function<void()> complete) { hop->async(std::move(complete)); }, 200ms);
  EXPECT_GE(outcome.timedOut, 2);
  EXPECT_EQ(outcome.completed + outcome.timedOut, 6);
}

TEST(ExecutorsExitTest, ProcessExitStopsTheProcessWideExecutorsCleanly) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(
      {
        auto queue = SerialQueue::create("com.zembra.Telvane.exit");
        auto network = SerialQueue::create("network", Executors::network());
        std::promise<void> ran;
        queue->async([&] { network->async([&] { ran.set_value(); }); });
        queue->after(std::chrono::hours(1), [] {});
        ran.get_future().wait();
        std::exit(0);
      },
      ::testing::ExitedWithCode(0), "");
}

TEST(ExecutorsExitTest, ProcessExitDoesNotWaitForeverForABusyWorker) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(
      {
        int pipeFds[2];
        if (::pipe(pipeFds) != 0) std::exit(3);
        std::promise<void> started;
        Executors::main().post([&] {
          started.set_value();
          char c;
          (void)!::read(pipeFds[0], &c, 1);  // never gets anything
        });
        started.get_future().wait();
        std::exit(0);
      },
      ::testing::ExitedWithCode(0), "Executor telvane-main: workers still busy after stop; leaving them behind");
}

}  // namespace
