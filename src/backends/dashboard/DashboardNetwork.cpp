#include "backends/dashboard/DashboardNetwork.h"

#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <utility>

#include "platform/Log.h"

namespace telvane {

namespace {

// Offset and size of the event id in a datagram and in an acknowledgement.
constexpr std::size_t kEventIDOffset = 60;
constexpr std::size_t kEventIDEnd = kEventIDOffset + 2;

}  // namespace

DashboardBackend::Network::Network(int descriptor, std::shared_ptr<SerialQueue> networkQueue,
                                   DashboardOptions networkOptions)
    : queue(std::move(networkQueue)), options(std::move(networkOptions)), socketDescriptor(descriptor) {}

void DashboardBackend::Network::useReliableUDP() {
  sockaddr_in any{};
  any.sin_family = AF_INET;
  any.sin_addr.s_addr = htonl(INADDR_ANY);
  any.sin_port = 0;
  const int bound = options.bindForAcknowledgements
                        ? options.bindForAcknowledgements(socketDescriptor)
                        : ::bind(socketDescriptor, reinterpret_cast<sockaddr*>(&any), sizeof any);
  if (bound != 0) {
    log::error("DashboardBackend(useReliableUDP): can't bind socket, %d", errno);
    return;
  }
  reliableUDP.store(true);
  std::weak_ptr<Network> weak = weak_from_this();
  readSource = ReadSource::create(queue, socketDescriptor, [weak] {
    if (auto self = weak.lock()) self->processSocketRead();
  });
  if (!readSource) {
    log::error("DashboardBackend(useReliableUDP): can't create read source");
    return;
  }
  // The read source owns the socket from here on: its cancel action closes it.
  readSource->setCancelHandler([self = shared_from_this()] { self->closeSocket(); });
  readSource->resume();
}

bool DashboardBackend::Network::startTimer(std::chrono::milliseconds period) {
  std::weak_ptr<Network> weak = weak_from_this();
  timer = TimerSource::create(queue, [weak] {
    if (auto self = weak.lock()) self->myPeriodicTask();
  });
  if (!timer) return false;
  // Without a read source (reliable mode off, or its source could not be made) the
  // timer's cancel action is the one that closes the socket. In reliable mode the read
  // source's action, queued first, has closed it already; closing is idempotent.
  timer->setCancelHandler([self = shared_from_this()] { self->closeSocket(); });
  timer->schedule(period, period);
  timer->resume();
  return true;
}

void DashboardBackend::Network::closeSocketDirectly() { closeSocket(); }

void DashboardBackend::Network::closeSocket() {
  if (socketDescriptor >= 0) ::close(socketDescriptor);
  socketDescriptor = -1;
}

bool DashboardBackend::Network::sendFully(const Bytes& data) const {
  if (socketDescriptor < 0) return false;
  // MSG_NOSIGNAL: a send never raises the broken-pipe signal.
  const ssize_t sent = ::send(socketDescriptor, data.data(), data.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
  return sent >= 0 && static_cast<std::size_t>(sent) == data.size();
}

void DashboardBackend::Network::tryToSendMsg(const std::uint8_t* bytes, std::size_t length,
                                             std::uint16_t eventNumber) {
  assertOnQueue(queue);
  UDPPacketToSend packet(bytes, length, eventNumber);
  const bool sent = sendFully(packet.data());
  if (sent && !reliableUDP.load()) return;
  // Kept also without reliability when the send failed: the periodic task retries it.
  packet.setState(sent ? UDPPacketToSend::kStateAwaitingAcknowledgement : UDPPacketToSend::kStateNotSent);
  messageQueue.push_back(std::move(packet));
  if (messageQueue.size() > kMaxQueuedPackets) messageQueue.pop_front();
}

void DashboardBackend::Network::processSocketRead() {
  assertOnQueue(queue);
  std::uint8_t buffer[kBufferSize] = {};
  const ssize_t received = ::recv(socketDescriptor, buffer, sizeof buffer, MSG_DONTWAIT);
  if (received < 1) return;
  // Only the event id at bytes 60-61 is read. An answer too short to hold it carries
  // no event id and is ignored.
  if (static_cast<std::size_t>(received) < kEventIDEnd) return;
  const auto acknowledged =
      static_cast<std::uint16_t>((buffer[kEventIDOffset] << 8) | buffer[kEventIDOffset + 1]);
  for (auto it = messageQueue.begin(); it != messageQueue.end(); ++it) {
    if (it->eventNumber() == acknowledged) {
      messageQueue.erase(it);
      return;
    }
  }
}

void DashboardBackend::Network::myPeriodicTask() {
  assertOnQueue(queue);
  const bool reliable = reliableUDP.load();
  std::size_t index = 0;
  while (index < messageQueue.size()) {
    UDPPacketToSend& packet = messageQueue[index];
    if (packet.state() == UDPPacketToSend::kStateAwaitingAcknowledgement) {
      if (packet.numberOfRetransmits() > kMaxRetransmits) {
        messageQueue.erase(messageQueue.begin() + static_cast<std::ptrdiff_t>(index));
        continue;  // the next packet moved into this index
      }
      const std::int32_t checks = packet.numberOfChecks() + 1;
      if (checks < kRetransmitThresholds[packet.numberOfRetransmits()]) {
        packet.setNumberOfChecks(checks);
      } else if (sendFully(packet.data())) {
        packet.setNumberOfChecks(0);
        packet.setNumberOfRetransmits(packet.numberOfRetransmits() + 1);
      }
      // A failed resend changes nothing: the next check tries again.
    } else if (packet.state() == UDPPacketToSend::kStateNotSent) {
      if (sendFully(packet.data())) {
        if (!reliable) {
          messageQueue.erase(messageQueue.begin() + static_cast<std::ptrdiff_t>(index));
          continue;
        }
        packet.setState(UDPPacketToSend::kStateAwaitingAcknowledgement);
      }
    }
    ++index;
  }

  if (cleanupState == kCleanupRunning) return;
  if (messageQueue.empty()) {
    log::info("DashboardBackend(myPeriodicTask): clean up at myPeriodicTask.");
    cleanupSources();
  } else if (cleanupState == kCleanupRequested) {
    cleanupState = kCleanupLastResortScheduled;
    log::info("DashboardBackend(myPeriodicTask): scheduled last resort clean-up in %d ms.",
              static_cast<int>(options.lastResortCleanupDelay.count()));
    queue->after(options.lastResortCleanupDelay, [self = shared_from_this()] { self->cleanupSources(); });
  }
  // Last-resort clean-up already scheduled: wait for it.
}

void DashboardBackend::Network::cleanup() {
  assertOnQueue(queue);
  if (messageQueue.empty()) {
    cleanupSources();
    return;
  }
  if (cleanupState == kCleanupRunning) {
    cleanupState = kCleanupRequested;
    // Finish the retransmissions even if the backend goes away meanwhile.
    keepAlive = shared_from_this();
  }
}

void DashboardBackend::Network::cleanupSources() {
  assertOnQueue(queue);
  // Both cancel actions run later on this queue; the first one closes the socket.
  if (readSource) readSource->cancel();
  if (timer) timer->cancel();
  readSource.reset();
  timer.reset();
  keepAlive.reset();
}

}  // namespace telvane
