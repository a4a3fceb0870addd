#include "platform/KeepAlive.h"

#include <gtest/gtest.h>

#include <chrono>
#include <future>

#include "platform/Log.h"

using namespace telvane;
using namespace std::chrono_literals;

TEST(IdleExitKeepAlive, FiresAfterTheIdlePeriodWithNoTransaction) {
  log::LogCapture capture;
  std::promise<void> idle;
  auto keepAlive = IdleExitKeepAlive::create(SerialQueue::create("test.keepalive"), 20ms, [&] { idle.set_value(); });
  auto f = idle.get_future();
  ASSERT_EQ(f.wait_for(10s), std::future_status::ready);
  EXPECT_TRUE(capture.contains("main: No IPC transaction for 0 seconds, exiting while idle"));
}

TEST(IdleExitKeepAlive, OpenTransactionKeepsItAliveAndTheLastEndRearms) {
  std::promise<void> idle;
  std::atomic<bool> fired{false};
  auto keepAlive = IdleExitKeepAlive::create(SerialQueue::create("test.keepalive"), 30ms, [&] {
    fired = true;
    idle.set_value();
  });
  keepAlive->beginTransaction();
  keepAlive->beginTransaction();
  EXPECT_EQ(keepAlive->openTransactions(), 2);
  // Wait well past the idle period on a queue of our own: it must not fire meanwhile.
  std::promise<void> waited;
  SerialQueue::create("test.wait")->after(150ms, [&] { waited.set_value(); });
  waited.get_future().wait();
  EXPECT_FALSE(fired.load());
  keepAlive->endTransaction();
  EXPECT_EQ(keepAlive->openTransactions(), 1);
  keepAlive->endTransaction();
  keepAlive->endTransaction();  // below zero is ignored
  EXPECT_EQ(keepAlive->openTransactions(), 0);
  auto f = idle.get_future();
  ASSERT_EQ(f.wait_for(10s), std::future_status::ready);
}

TEST(IdleExitKeepAlive, WithoutAnIdlePeriodItNeverFires) {
  std::atomic<bool> fired{false};
  auto keepAlive = IdleExitKeepAlive::create(SerialQueue::create("test.keepalive"), std::nullopt, [&] { fired = true; });
  keepAlive->beginTransaction();
  keepAlive->endTransaction();
  std::promise<void> waited;
  SerialQueue::create("test.wait")->after(100ms, [&] { waited.set_value(); });
  waited.get_future().wait();
  EXPECT_FALSE(fired.load());
}

TEST(IdleExitKeepAlive, IdlePeriodFromTheEnvironment) {
  ::unsetenv("TELVANED_IDLE_EXIT_SECONDS");
  EXPECT_EQ(IdleExitKeepAlive::idlePeriodFromEnvironment(true), std::optional<std::chrono::milliseconds>(60s));
  EXPECT_EQ(IdleExitKeepAlive::idlePeriodFromEnvironment(false), std::nullopt);
  ::setenv("TELVANED_IDLE_EXIT_SECONDS", "2.5", 1);
  EXPECT_EQ(IdleExitKeepAlive::idlePeriodFromEnvironment(false), std::optional<std::chrono::milliseconds>(2500ms));
  ::setenv("TELVANED_IDLE_EXIT_SECONDS", "0", 1);
  EXPECT_EQ(IdleExitKeepAlive::idlePeriodFromEnvironment(true), std::nullopt);
  {
    log::LogCapture capture;
    ::setenv("TELVANED_IDLE_EXIT_SECONDS", "soon", 1);
    EXPECT_EQ(IdleExitKeepAlive::idlePeriodFromEnvironment(true), std::optional<std::chrono::milliseconds>(60s));
    EXPECT_TRUE(capture.contains(log::Level::Error,
                                 "main: ignoring TELVANED_IDLE_EXIT_SECONDS='soon': not a number of seconds"));
  }
  ::unsetenv("TELVANED_IDLE_EXIT_SECONDS");
}
