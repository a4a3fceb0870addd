#include "platform/ReadSource.h"

#include "platform/Log.h"
#include "support/Counter.h"

#include <gtest/gtest.h>

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <cstring>
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

std::string receiveOne(int fd) {
  char buffer[256];
  ssize_t n = ::recv(fd, buffer, sizeof buffer, MSG_DONTWAIT);
  return n > 0 ? std::string(buffer, static_cast<std::size_t>(n)) : std::string();
}

void sendText(int fd, const std::string& text) {
  ASSERT_EQ(::send(fd, text.data(), text.size(), 0), static_cast<ssize_t>(text.size()));
}

bool isOpen(int fd) { return ::fcntl(fd, F_GETFD) != -1; }

class ReadSourceTest : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_EQ(::socketpair(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0, fds_), 0); }
  void TearDown() override {
    for (int fd : fds_) {
      if (fd >= 0) ::close(fd);
    }
  }

  void drain(std::chrono::milliseconds span) {
    Counter probe;
    queue_->after(span, [&] { probe.add(); });
    ASSERT_TRUE(probe.waitFor(1));
  }

  Executor executor_{"read-test", 2};
  std::shared_ptr<SerialQueue> queue_ = SerialQueue::create("reads", executor_);
  int fds_[2] = {-1, -1};
  std::vector<std::string> received_;  // touched only on the queue
};

TEST_F(ReadSourceTest, HandlerRunsOnTheQueueForEachWrite) {
  Counter reads;
  bool onQueue = false;
  auto source = ReadSource::create(queue_, fds_[0], [&] {
    onQueue = queue_->isCurrent();
    received_.push_back(receiveOne(fds_[0]));
    reads.add();
  });
  ASSERT_NE(source, nullptr);
  EXPECT_EQ(source->descriptor(), fds_[0]);
  source->resume();
  sendText(fds_[1], "first");
  ASSERT_TRUE(reads.waitFor(1));
  sendText(fds_[1], "second");
  ASSERT_TRUE(reads.waitFor(2));
  drain(30ms);
  EXPECT_EQ(reads.value(), 2);
  std::vector<std::string> copy;
  queue_->sync([&] { copy = received_; });
  EXPECT_EQ(copy, (std::vector<std::string>{"first", "second"}));
  EXPECT_TRUE(onQueue);
  source->cancel();
}

TEST_F(ReadSourceTest, DataWaitingBeforeResumeIsDeliveredOneReadAtATime) {
  sendText(fds_[1], "a");
  sendText(fds_[1], "b");
  sendText(fds_[1], "c");
  Counter reads;
  auto source = ReadSource::create(queue_, fds_[0], [&] {
    received_.push_back(receiveOne(fds_[0]));
    reads.add();
  });
  ASSERT_NE(source, nullptr);
  drain(20ms);
  EXPECT_EQ(reads.value(), 0);  // suspended until resumed
  source->resume();
  ASSERT_TRUE(reads.waitFor(3));
  drain(30ms);
  EXPECT_EQ(reads.value(), 3);
  std::vector<std::string> copy;
  queue_->sync([&] { copy = received_; });
  EXPECT_EQ(copy, (std::vector<std::string>{"a", "b", "c"}));
  source->cancel();
}

TEST_F(ReadSourceTest, CancelActionRunsOnceOnTheQueueAndClosesTheDescriptor) {
  Counter reads;
  Counter cancelled;
  bool onQueue = false;
  int closeResult = -1;
  std::shared_ptr<ReadSource> source;
  source = ReadSource::create(queue_, fds_[0], [&] {
    reads.add();
    // Leaves the data unread and cancels: without the cancel the source would be
    // called again at once, since the descriptor stays readable.
    source->cancel();
    source->cancel();
  });
  ASSERT_NE(source, nullptr);
  source->setCancelHandler([&] {
    onQueue = queue_->isCurrent();
    closeResult = ::close(fds_[0]);
    fds_[0] = -1;
    cancelled.add();
  });
  sendText(fds_[1], "one");
  sendText(fds_[1], "two");
  source->resume();
  ASSERT_TRUE(cancelled.waitFor(1));
  source->cancel();
  drain(30ms);
  EXPECT_EQ(reads.value(), 1);
  EXPECT_EQ(cancelled.value(), 1);
  EXPECT_TRUE(onQueue);
  EXPECT_EQ(closeResult, 0);
  EXPECT_TRUE(source->isCanceled());
}

TEST_F(ReadSourceTest, CancelFromAnotherThreadStopsDelivery) {
  Counter reads;
  Counter cancelled;
  auto source = ReadSource::create(queue_, fds_[0], [&] {
    received_.push_back(receiveOne(fds_[0]));
    reads.add();
  });
  ASSERT_NE(source, nullptr);
  source->setCancelHandler([&] { cancelled.add(); });
  source->resume();
  sendText(fds_[1], "before");
  ASSERT_TRUE(reads.waitFor(1));
  source->cancel();
  ASSERT_TRUE(cancelled.waitFor(1));
  sendText(fds_[1], "after");
  drain(40ms);
  EXPECT_EQ(reads.value(), 1);
  EXPECT_EQ(receiveOne(fds_[0]), "after");  // still open and unread: the source let go of it
}

TEST_F(ReadSourceTest, ReleaseWithoutCancelLeavesTheDescriptorOpenAndUnwatched) {
  Counter reads;
  Counter cancelled;
  auto source = ReadSource::create(queue_, fds_[0], [&] {
    receiveOne(fds_[0]);
    reads.add();
  });
  ASSERT_NE(source, nullptr);
  source->setCancelHandler([&] { cancelled.add(); });
  source->resume();
  sendText(fds_[1], "x");
  ASSERT_TRUE(reads.waitFor(1));
  source.reset();
  queue_->sync([] {});
  sendText(fds_[1], "y");
  drain(40ms);
  EXPECT_EQ(reads.value(), 1);
  EXPECT_EQ(cancelled.value(), 0);
  EXPECT_TRUE(isOpen(fds_[0]));

  // The descriptor left the event loop, so a new source can watch it.
  Counter again;
  // A readiness report may find nothing left to read (the descriptor is non-blocking):
  // only what was read counts.
  auto second = ReadSource::create(queue_, fds_[0], [&] {
    std::string text = receiveOne(fds_[0]);
    if (text.empty()) return;
    received_.push_back(std::move(text));
    again.add();
  });
  ASSERT_NE(second, nullptr);
  second->resume();
  ASSERT_TRUE(again.waitFor(1));
  std::vector<std::string> copy;
  queue_->sync([&] { copy = received_; });
  EXPECT_EQ(copy, (std::vector<std::string>{"y"}));
  second->cancel();
}

TEST_F(ReadSourceTest, UdpSocketOnLoopback) {
  int receiver = ::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  int sender = ::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  ASSERT_GE(receiver, 0);
  ASSERT_GE(sender, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  address.sin_port = 0;
  ASSERT_EQ(::bind(receiver, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  socklen_t length = sizeof address;
  ASSERT_EQ(::getsockname(receiver, reinterpret_cast<sockaddr*>(&address), &length), 0);

  Counter reads;
  Counter closed;
  auto source = ReadSource::create(queue_, receiver, [&] {
    received_.push_back(receiveOne(receiver));
    reads.add();
  });
  ASSERT_NE(source, nullptr);
  source->setCancelHandler([&] {
    ::close(receiver);
    closed.add();
  });
  source->resume();
  for (const char* text : {"ack 1", "ack 2"}) {
    ASSERT_EQ(::sendto(sender, text, std::strlen(text), 0, reinterpret_cast<sockaddr*>(&address), sizeof address),
              static_cast<ssize_t>(std::strlen(text)));
  }
  ASSERT_TRUE(reads.waitFor(2));
  source->cancel();
  ASSERT_TRUE(closed.waitFor(1));
  std::vector<std::string> copy;
  queue_->sync([&] { copy = received_; });
  EXPECT_EQ(copy, (std::vector<std::string>{"ack 1", "ack 2"}));
  ::close(sender);
}

TEST_F(ReadSourceTest, InvalidDescriptorGivesNoSource) {
  log::LogCapture capture;
  EXPECT_EQ(ReadSource::create(queue_, -1, [] {}), nullptr);
  EXPECT_TRUE(capture.contains(log::Level::Error, "ReadSource: invalid descriptor -1"));
}

TEST_F(ReadSourceTest, DescriptorAlreadyWatchedGivesNoSource) {
  auto first = ReadSource::create(queue_, fds_[0], [] {});
  ASSERT_NE(first, nullptr);
  log::LogCapture capture;
  EXPECT_EQ(ReadSource::create(queue_, fds_[0], [] {}), nullptr);
  EXPECT_TRUE(capture.containsPrefix("ReadSource: can't watch descriptor "));
  first->cancel();
  EXPECT_TRUE(isOpen(fds_[0]));
}

}  // namespace
