// TelvaneAggregationObject: the client's exported object, directly and through a
// connection to a fake daemon.
#include "client/TelvaneAggregationObject.h"

#include <gtest/gtest.h>

#include <mutex>
#include <stdexcept>
#include <vector>

#include "platform/Log.h"
#include "support/ClientTestHelpers.h"
#include "support/FakeDaemon.h"

namespace telvane {
namespace {

struct Delivered {
  Value message;
  double timestamp = 0;
  std::uint16_t category = 0;
  std::uint16_t type = 0;
  Value payload;
};

// Records what the block receives.
class BlockRecorder {
 public:
  Telvane::AggregationBlock block() {
    return [this](const Value& message, double timestamp, std::uint16_t category, std::uint16_t type,
                  const Value& payload) {
      std::lock_guard<std::mutex> lock(mutex_);
      delivered_.push_back(Delivered{message, timestamp, category, type, payload});
      changed_.notify_all();
    };
  }
  bool waitForCount(std::size_t n) {
    std::unique_lock<std::mutex> lock(mutex_);
    return changed_.wait_for(lock, test::kClientWaitSeconds, [&] { return delivered_.size() >= n; });
  }
  std::vector<Delivered> delivered() {
    std::lock_guard<std::mutex> lock(mutex_);
    return delivered_;
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<Delivered> delivered_;
};

TEST(TelvaneAggregationObject, PassesMessagesToTheBlock) {
  BlockRecorder recorder;
  TelvaneAggregationObject object(recorder.block());
  log::LogCapture capture;
  Value message(Dictionary{{"ComponentType", Value(7)}});
  Value payload(Dictionary{{"rtt", Value(31)}});
  object.sendMessageToClient(message, 1700000000.25, 12, 34, payload);
  EXPECT_TRUE(capture.contains("sendMessageToClient: 12, 34"));
  auto delivered = recorder.delivered();
  ASSERT_EQ(delivered.size(), 1u);
  EXPECT_EQ(delivered[0].message, message);
  EXPECT_DOUBLE_EQ(delivered[0].timestamp, 1700000000.25);
  EXPECT_EQ(delivered[0].category, 12);
  EXPECT_EQ(delivered[0].type, 34);
  EXPECT_EQ(delivered[0].payload, payload);
}

TEST(TelvaneAggregationObject, WithoutABlockMessagesAreOnlyLogged) {
  TelvaneAggregationObject object(nullptr);
  log::LogCapture capture;
  EXPECT_FALSE(object.hasAggregationBlock());
  object.sendMessageToClient(Value(), 0, 1, 2, Value());
  EXPECT_TRUE(capture.contains("sendMessageToClient: 1, 2"));
}

TEST(TelvaneAggregationObject, ThrowingBlockDisablesAggregationForGood) {
  int calls = 0;
  TelvaneAggregationObject object([&](const Value&, double, std::uint16_t, std::uint16_t, const Value&) {
    ++calls;
    throw std::runtime_error("client bug");
  });
  log::LogCapture capture;
  object.sendMessageToClient(Value(), 1, 1, 1, Value());
  EXPECT_TRUE(capture.contains(
      log::Level::Error, "sendMessageToClient: Exception during invocation of aggregation block. Disabling aggregation"));
  EXPECT_FALSE(object.hasAggregationBlock());
  object.sendMessageToClient(Value(), 2, 2, 2, Value());
  EXPECT_EQ(calls, 1);
  EXPECT_TRUE(capture.contains("sendMessageToClient: 2, 2"));
}

TEST(TelvaneAggregationObject, ReceivesTheDaemonsCallsAndTheShutdownMessage) {
  test::FakeDaemon daemon;
  BlockRecorder recorder;
  auto telvane = Telvane::create(test::clientSessionInfo(), Value(), Value(), recorder.block());
  ASSERT_NE(telvane, nullptr);
  ASSERT_TRUE(daemon.waitForCalls(ipc::Operation::SetSessionInfo, 1));
  Value message = test::clientSessionInfo(9, 7);
  Value payload(Dictionary{{"_clientName", Value("app")}, {"jitter", Value(2.5)}});
  daemon.sendMessageToClient(0, Array{message, Value(1234.5), Value(3), Value(4), payload});
  // The daemon's shutdown of aggregation: everything empty and zero.
  daemon.sendMessageToClient(0, Array{Value(), Value(0), Value(0), Value(0), Value()});
  ASSERT_TRUE(recorder.waitForCount(2));
  auto delivered = recorder.delivered();
  EXPECT_EQ(delivered[0].message, message);
  EXPECT_DOUBLE_EQ(delivered[0].timestamp, 1234.5);
  EXPECT_EQ(delivered[0].category, 3);
  EXPECT_EQ(delivered[0].type, 4);
  EXPECT_EQ(delivered[0].payload, payload);
  EXPECT_TRUE(delivered[1].message.isNull());
  EXPECT_EQ(delivered[1].timestamp, 0);
  EXPECT_EQ(delivered[1].category, 0);
  EXPECT_EQ(delivered[1].type, 0);
  EXPECT_TRUE(delivered[1].payload.isNull());
}

}  // namespace
}  // namespace telvane
