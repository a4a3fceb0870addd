#include <gtest/gtest.h>

#include <cerrno>
#include <future>
#include <random>
#include <thread>

#include "backends/DashboardTestSupport.h"
#include "backends/dashboard/DashboardBackend.h"

namespace telvane {
namespace {

using test::UdpTestCollector;

class DashboardBackendReliableTest : public test::DashboardTestBase {
 protected:
  // A reliable backend whose timer never fires during the test.
  std::shared_ptr<DashboardBackend> makeManualBackend(const UdpTestCollector& collector, DashboardOptions options = {}) {
    auto backend = makeDashboard(profileFor(collector.port(), test::kNeverMs), std::move(options));
    EXPECT_NE(backend, nullptr);
    if (backend) {
      EXPECT_TRUE(backend->reliableUDP());
    }
    return backend;
  }
  // Sends the answer and waits until the backend's queue shrank to `expectedSize`.
  static bool answerAndWait(const UdpTestCollector& collector, DashboardBackend& backend, const Bytes& answer,
                            std::size_t expectedSize) {
    if (!collector.sendTo(backend.localPort(), answer)) return false;
    return test::waitUntil([&] { return backend.messageQueueSnapshot().size() == expectedSize; });
  }
};

TEST_F(DashboardBackendReliableTest, AnAcknowledgingCollectorEmptiesTheQueue) {
  UdpTestCollector collector(UdpTestCollector::Mode::Acknowledge);
  auto backend = makeDashboard(profileFor(collector.port(), 20));
  ASSERT_NE(backend, nullptr);
  for (std::uint16_t id = 1; id <= 5; ++id) send(*backend, id);
  ASSERT_TRUE(collector.waitForCount(5));
  EXPECT_TRUE(test::waitUntil([&] { return backend->messageQueueSnapshot().empty(); }));
  backend->cleanup();
  EXPECT_TRUE(test::waitUntil([&] { return backend->socketDescriptor() == -1; }));
}

TEST_F(DashboardBackendReliableTest, ASilentCollectorSeesRetransmissionsAfter2_3_5And9ChecksThenThePacketIsDropped) {
  UdpTestCollector collector(UdpTestCollector::Mode::Silent);
  auto backend = makeManualBackend(collector);
  ASSERT_NE(backend, nullptr);
  send(*backend, 42);
  ASSERT_TRUE(collector.waitForCount(1));
  backend->waitForNetworkQueue();
  ASSERT_EQ(queuedIDs(*backend), std::vector<std::uint16_t>{42});
  EXPECT_EQ(backend->messageQueueSnapshot()[0].state(), UDPPacketToSend::kStateAwaitingAcknowledgement);

  // Checks 2, 2+3, 2+3+5 and 2+3+5+9 resend; the 20th drops the packet.
  const std::vector<int> resendAt = {2, 5, 10, 19};
  std::size_t expected = 1;
  for (int check = 1; check <= 19; ++check) {
    backend->runPeriodicTaskForTesting();
    const bool resends = std::find(resendAt.begin(), resendAt.end(), check) != resendAt.end();
    if (resends) ++expected;
    ASSERT_TRUE(collector.waitForCount(expected)) << "check " << check;
    EXPECT_EQ(collector.count(), expected) << "check " << check;
    std::vector<UDPPacketToSend> queued = backend->messageQueueSnapshot();
    ASSERT_EQ(queued.size(), 1u) << "check " << check;
    EXPECT_EQ(queued[0].numberOfRetransmits(), static_cast<int>(expected - 1)) << "check " << check;
  }
  backend->runPeriodicTaskForTesting();
  EXPECT_TRUE(backend->messageQueueSnapshot().empty());
  backend->runPeriodicTaskForTesting();
  EXPECT_EQ(collector.count(), 5u);
  for (const Bytes& datagram : collector.datagrams()) EXPECT_EQ(datagram, collector.datagrams()[0]);
}

TEST_F(DashboardBackendReliableTest, The51stQueuedPacketEvictsTheOldest) {
  UdpTestCollector collector(UdpTestCollector::Mode::Silent);
  auto backend = makeManualBackend(collector);
  ASSERT_NE(backend, nullptr);
  for (std::uint16_t id = 1; id <= 50; ++id) send(*backend, id);
  backend->waitForNetworkQueue();
  EXPECT_EQ(queuedIDs(*backend).size(), 50u);
  EXPECT_EQ(queuedIDs(*backend).front(), 1u);
  send(*backend, 51);
  backend->waitForNetworkQueue();
  std::vector<std::uint16_t> ids = queuedIDs(*backend);
  ASSERT_EQ(ids.size(), 50u);
  EXPECT_EQ(ids.front(), 2u);
  EXPECT_EQ(ids.back(), 51u);
}

TEST_F(DashboardBackendReliableTest, AnAcknowledgementRemovesOnlyTheFirstPacketWithItsIdAndUnknownIdsAreIgnored) {
  UdpTestCollector collector(UdpTestCollector::Mode::Silent);
  auto backend = makeManualBackend(collector);
  ASSERT_NE(backend, nullptr);
  send(*backend, 7, {{"n", Value(1)}});
  send(*backend, 8);
  send(*backend, 7, {{"n", Value(2)}});
  ASSERT_TRUE(collector.waitForCount(3));
  backend->waitForNetworkQueue();
  ASSERT_EQ(queuedIDs(*backend), (std::vector<std::uint16_t>{7, 8, 7}));

  // An id that is not queued changes nothing; the answers are read in order, so once
  // the acknowledgement of 8 took effect the one of 99 was read before it.
  ASSERT_TRUE(collector.sendTo(backend->localPort(), UdpTestCollector::acknowledgement(99)));
  ASSERT_TRUE(answerAndWait(collector, *backend, UdpTestCollector::acknowledgement(8), 2));
  EXPECT_EQ(queuedIDs(*backend), (std::vector<std::uint16_t>{7, 7}));

  ASSERT_TRUE(answerAndWait(collector, *backend, UdpTestCollector::acknowledgement(7), 1));
  std::vector<UDPPacketToSend> left = backend->messageQueueSnapshot();
  ASSERT_EQ(left.size(), 1u);
  EXPECT_EQ(test::readDatagram(left[0].data())->text, " n=2");  // the first one went
  ASSERT_TRUE(answerAndWait(collector, *backend, UdpTestCollector::acknowledgement(7), 0));
}

TEST_F(DashboardBackendReliableTest, GarbageAnswersAreReadAndIgnored) {
  UdpTestCollector collector(UdpTestCollector::Mode::Silent);
  auto backend = makeManualBackend(collector);
  ASSERT_NE(backend, nullptr);
  send(*backend, 1);
  send(*backend, 2);
  send(*backend, 3);
  ASSERT_TRUE(collector.waitForCount(3));
  backend->waitForNetworkQueue();
  const std::uint16_t port = backend->localPort();

  // Empty, one byte, and a short answer whose bytes cannot reach offset 60.
  ASSERT_TRUE(collector.sendTo(port, Bytes{}));
  ASSERT_TRUE(collector.sendTo(port, Bytes{0x01}));
  ASSERT_TRUE(collector.sendTo(port, Bytes(61, 0x00)));
  // Random bytes (fixed seed) with an id that is not queued at 60-61.
  std::mt19937 generator(20261123);
  Bytes random(300);
  for (auto& byte : random) byte = static_cast<std::uint8_t>(generator());
  random[60] = 0xAB;
  random[61] = 0xCD;
  ASSERT_TRUE(collector.sendTo(port, random));
  // After all of them, a real acknowledgement of 3: only that one goes.
  ASSERT_TRUE(answerAndWait(collector, *backend, UdpTestCollector::acknowledgement(3), 2));
  EXPECT_EQ(queuedIDs(*backend), (std::vector<std::uint16_t>{1, 2}));

  // A 2,000-byte answer is read up to the buffer's size; its bytes 60-61 count.
  Bytes large(2000, 0xEE);
  large[60] = 0;
  large[61] = 1;
  ASSERT_TRUE(answerAndWait(collector, *backend, large, 1));
  EXPECT_EQ(queuedIDs(*backend), (std::vector<std::uint16_t>{2}));
}

TEST_F(DashboardBackendReliableTest, ABindFailureLeavesTheBackendWorkingWithoutReliability) {
  UdpTestCollector collector(UdpTestCollector::Mode::Acknowledge);
  DashboardOptions options;
  options.bindForAcknowledgements = [](int) {
    errno = EADDRINUSE;
    return -1;
  };
  auto backend = makeDashboard(profileFor(collector.port(), 200), options);
  ASSERT_NE(backend, nullptr);
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "DashboardBackend(useReliableUDP): can't bind socket, " + std::to_string(EADDRINUSE)));
  EXPECT_FALSE(backend->reliableUDP());
  send(*backend, 1);
  send(*backend, 2);
  ASSERT_TRUE(collector.waitForCount(2));
  backend->waitForNetworkQueue();
  EXPECT_TRUE(backend->messageQueueSnapshot().empty());  // sent datagrams are not kept
  for (const Bytes& datagram : collector.datagrams()) EXPECT_EQ(test::readDatagram(datagram)->flags, 0u);
  const std::size_t before = test::openDescriptorCount();
  backend->cleanup();
  // Without a read source the timer's cancel action closes the socket.
  EXPECT_TRUE(test::waitUntil([&] { return backend->socketDescriptor() == -1; }));
  EXPECT_EQ(test::openDescriptorCount(), before - 1);
}

TEST_F(DashboardBackendReliableTest, WithoutReliabilityAnUnsentDatagramIsKeptAndSentByThePeriodicTask) {
  // A port nobody listens on: the refusal of one datagram makes a later send fail.
  std::uint16_t port = 0;
  { UdpTestCollector probe(UdpTestCollector::Mode::Silent); port = probe.port(); }
  auto backend = makeDashboard(profileFor(port));
  ASSERT_NE(backend, nullptr);
  ASSERT_FALSE(backend->reliableUDP());
  std::uint16_t id = 0;
  while (backend->messageQueueSnapshot().empty() && id < 200) {
    send(*backend, ++id);
    backend->waitForNetworkQueue();
  }
  std::vector<UDPPacketToSend> queued = backend->messageQueueSnapshot();
  ASSERT_EQ(queued.size(), 1u);
  EXPECT_EQ(queued[0].state(), UDPPacketToSend::kStateNotSent);
  EXPECT_EQ(queued[0].eventNumber(), id);

  UdpTestCollector collector(UdpTestCollector::Mode::Silent, port);
  backend->runPeriodicTaskForTesting();
  ASSERT_TRUE(collector.waitForCount(1));
  EXPECT_EQ(test::readDatagram(collector.datagrams()[0])->eventID, id);
  EXPECT_TRUE(backend->messageQueueSnapshot().empty());  // sent, and nobody acknowledges without reliability
}

TEST_F(DashboardBackendReliableTest, InReliableModeAnUnsentDatagramWaitsForItsAcknowledgementOnceSent) {
  std::uint16_t port = 0;
  { UdpTestCollector probe(UdpTestCollector::Mode::Silent); port = probe.port(); }
  auto backend = makeDashboard(profileFor(port, test::kNeverMs));
  ASSERT_NE(backend, nullptr);
  auto countInState = [&](std::int32_t state) {
    std::size_t n = 0;
    for (const UDPPacketToSend& packet : backend->messageQueueSnapshot()) n += packet.state() == state ? 1 : 0;
    return n;
  };
  // The sends wait behind a held network queue and then run back to back, before the
  // read source can take the refusal of the first one: the next send reports it.
  std::promise<void> release;
  std::shared_future<void> released = release.get_future().share();
  backend->networkProcQueue()->async([released] { released.wait(); });
  for (std::uint16_t id = 1; id <= 10; ++id) send(*backend, id);
  release.set_value();
  backend->waitForNetworkQueue();
  ASSERT_EQ(backend->messageQueueSnapshot().size(), 10u);  // reliable mode keeps every packet
  ASSERT_GT(countInState(UDPPacketToSend::kStateNotSent), 0u);

  UdpTestCollector collector(UdpTestCollector::Mode::Silent, port);
  // A refusal still pending from before the collector listened may fail one more send.
  for (int check = 0; check < 5 && countInState(UDPPacketToSend::kStateNotSent) > 0; ++check) {
    backend->runPeriodicTaskForTesting();
  }
  EXPECT_EQ(countInState(UDPPacketToSend::kStateNotSent), 0u);
  EXPECT_EQ(countInState(UDPPacketToSend::kStateAwaitingAcknowledgement), 10u);
  EXPECT_TRUE(collector.waitForCount(1));
}

// ---- Clean-up ----

TEST_F(DashboardBackendReliableTest, CleanupWithAnEmptyQueueClosesTheSocketAtOnce) {
  UdpTestCollector collector(UdpTestCollector::Mode::Silent);
  warmUp();
  const std::size_t before = test::openDescriptorCount();
  auto backend = makeManualBackend(collector);
  ASSERT_NE(backend, nullptr);
  EXPECT_EQ(test::openDescriptorCount(), before + 1);
  backend->cleanup();
  EXPECT_TRUE(test::waitUntil([&] { return backend->socketDescriptor() == -1; }));
  EXPECT_EQ(backend->cleanupState(), 0);
  EXPECT_EQ(test::openDescriptorCount(), before);
}

TEST_F(DashboardBackendReliableTest, CleanupWithQueuedPacketsSchedulesTheLastResortCleanup) {
  UdpTestCollector collector(UdpTestCollector::Mode::Silent);
  DashboardOptions options;
  options.lastResortCleanupDelay = std::chrono::milliseconds(30);
  warmUp();
  const std::size_t before = test::openDescriptorCount();
  auto backend = makeManualBackend(collector, options);
  ASSERT_NE(backend, nullptr);
  send(*backend, 1);
  backend->waitForNetworkQueue();
  backend->cleanup();
  EXPECT_EQ(backend->cleanupState(), 1);
  EXPECT_GE(backend->socketDescriptor(), 0);
  backend->runPeriodicTaskForTesting();
  EXPECT_EQ(backend->cleanupState(), 2);
  EXPECT_TRUE(capture.contains("DashboardBackend(myPeriodicTask): scheduled last resort clean-up in 30 ms."));
  // Another check while it is scheduled only waits.
  backend->runPeriodicTaskForTesting();
  EXPECT_EQ(capture.count("DashboardBackend(myPeriodicTask): scheduled last resort clean-up in 30 ms."), 1u);
  EXPECT_TRUE(test::waitUntil([&] { return backend->socketDescriptor() == -1; }));
  EXPECT_EQ(backend->messageQueueSnapshot().size(), 1u);  // given up, not sent
  EXPECT_EQ(test::openDescriptorCount(), before);
}

TEST_F(DashboardBackendReliableTest, TheLastResortDelayIs9500MsUnlessReplaced) {
  EXPECT_EQ(DashboardOptions{}.lastResortCleanupDelay, std::chrono::milliseconds(9500));
}

TEST_F(DashboardBackendReliableTest, CleanupFinishesAtThePeriodicTaskOnceTheQueueIsAcknowledged) {
  UdpTestCollector collector(UdpTestCollector::Mode::Silent);
  auto backend = makeManualBackend(collector);
  ASSERT_NE(backend, nullptr);
  send(*backend, 9);
  backend->waitForNetworkQueue();
  backend->cleanup();
  EXPECT_EQ(backend->cleanupState(), 1);
  ASSERT_TRUE(answerAndWait(collector, *backend, UdpTestCollector::acknowledgement(9), 0));
  backend->runPeriodicTaskForTesting();
  EXPECT_TRUE(capture.contains("DashboardBackend(myPeriodicTask): clean up at myPeriodicTask."));
  EXPECT_TRUE(test::waitUntil([&] { return backend->socketDescriptor() == -1; }));
}

TEST_F(DashboardBackendReliableTest, ABackendReleasedWithoutCleanupLeavesNoSocketOpen) {
  UdpTestCollector collector(UdpTestCollector::Mode::Silent);
  warmUp();
  const std::size_t before = test::openDescriptorCount();
  {
    auto reliable = makeManualBackend(collector);
    auto plain = makeDashboard(profileFor(collector.port()));
    ASSERT_NE(plain, nullptr);
    send(*reliable, 1);
    EXPECT_EQ(test::openDescriptorCount(), before + 2);
  }
  EXPECT_TRUE(test::waitUntil([&] { return test::openDescriptorCount() == before; }));
}

TEST_F(DashboardBackendReliableTest, TheTimerRunsTheScheduleOnItsOwn) {
  UdpTestCollector collector(UdpTestCollector::Mode::Silent);
  auto backend = makeDashboard(profileFor(collector.port(), 2));
  ASSERT_NE(backend, nullptr);
  send(*backend, 11);
  // The first send and four retransmissions, then the packet is dropped.
  EXPECT_TRUE(collector.waitForCount(5));
  EXPECT_TRUE(test::waitUntil([&] { return backend->messageQueueSnapshot().empty(); }));
  EXPECT_EQ(collector.count(), 5u);
  backend->cleanup();
}

TEST_F(DashboardBackendReliableTest, ABackendReleasedAfterCleanupStillEndsItsSourcesByItself) {
  UdpTestCollector collector(UdpTestCollector::Mode::Silent);
  warmUp();
  const std::size_t before = test::openDescriptorCount();
  DashboardOptions options;
  options.lastResortCleanupDelay = std::chrono::milliseconds(30);
  {
    auto backend = makeDashboard(profileFor(collector.port(), 5), options);
    ASSERT_NE(backend, nullptr);
    send(*backend, 1);
    backend->waitForNetworkQueue();
    backend->cleanup();
  }
  // The periodic task goes on without the backend, schedules the last resort and it
  // closes the socket.
  EXPECT_TRUE(test::waitUntil(
      [&] { return capture.contains("DashboardBackend(myPeriodicTask): scheduled last resort clean-up in 30 ms."); }));
  EXPECT_TRUE(test::waitUntil([&] { return test::openDescriptorCount() == before; }));
}

TEST_F(DashboardBackendReliableTest, SeveralThreadsSendingAtOnceWhileAcknowledgementsAndTimerRun) {
  UdpTestCollector collector(UdpTestCollector::Mode::Acknowledge);
  auto backend = makeDashboard(profileFor(collector.port(), 2));
  ASSERT_NE(backend, nullptr);
  constexpr int kThreads = 4;
  constexpr int kEach = 25;
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < kEach; ++i) {
        send(*backend, static_cast<std::uint16_t>(t * 1000 + i), {{"thread", Value(t)}, {"i", Value(i)}});
        if (i % 10 == 0) (void)backend->messageQueueSnapshot();
      }
    });
  }
  for (auto& thread : threads) thread.join();
  ASSERT_TRUE(collector.waitForCount(kThreads * kEach));
  EXPECT_TRUE(test::waitUntil([&] { return backend->messageQueueSnapshot().empty(); }));
  backend->cleanup();
  EXPECT_TRUE(test::waitUntil([&] { return backend->socketDescriptor() == -1; }));
}

}  // namespace
}  // namespace telvane
