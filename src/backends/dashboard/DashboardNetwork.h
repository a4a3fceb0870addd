// DashboardBackend::Network: the dashboard backend's socket, message queue and sources.
//
// Everything here except the constants is touched only on the network queue (the
// set-up during creation happens before any work is queued). Work queued there, the
// timer and the read source hold the object weakly, so a backend that is released
// without clean-up takes it down; the backend's destructor then cancels the sources,
// whose cancel actions close the socket. While a requested clean-up waits for
// acknowledgements, the object holds itself (`keepAlive`) until the sources are
// cancelled.
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <deque>
#include <memory>

#include "backends/dashboard/DashboardBackend.h"
#include "backends/dashboard/UDPPacketToSend.h"
#include "platform/ReadSource.h"
#include "platform/SerialQueue.h"
#include "platform/TimerSource.h"

namespace telvane {

class DashboardBackend::Network : public std::enable_shared_from_this<DashboardBackend::Network> {
 public:
  static constexpr std::int32_t kCleanupRunning = 0;
  static constexpr std::int32_t kCleanupRequested = 1;
  static constexpr std::int32_t kCleanupLastResortScheduled = 2;

  Network(int socketDescriptor, std::shared_ptr<SerialQueue> queue, DashboardOptions options);

  // ---- Set-up, on the creating thread before any queue work ----
  // Binds the socket to any local address and port 0 and watches it for
  // acknowledgements. A bind failure leaves reliable mode off.
  void useReliableUDP();
  // The repeating timer running myPeriodicTask every period; false when it could not
  // be made.
  bool startTimer(std::chrono::milliseconds period);
  // Closes the socket of a backend that could not be made.
  void closeSocketDirectly();

  // ---- On the network queue ----
  void tryToSendMsg(const std::uint8_t* bytes, std::size_t length, std::uint16_t eventNumber);
  void processSocketRead();
  void myPeriodicTask();
  // The backend's cleanup operation.
  void cleanup();
  // Cancels and drops the timer and the read source; their cancel actions close the
  // socket.
  void cleanupSources();

  // Constant after construction.
  const std::shared_ptr<SerialQueue> queue;
  const DashboardOptions options;
  // Set during set-up only; read from any thread (the header flag).
  std::atomic<bool> reliableUDP{false};

  // Guarded by the network queue.
  int socketDescriptor = -1;
  std::deque<UDPPacketToSend> messageQueue;
  std::int32_t cleanupState = kCleanupRunning;
  std::shared_ptr<TimerSource> timer;
  std::shared_ptr<ReadSource> readSource;
  std::shared_ptr<Network> keepAlive;

 private:
  // Sends the bytes once; true when all of them went out.
  bool sendFully(const Bytes& data) const;
  void closeSocket();
};

}  // namespace telvane
