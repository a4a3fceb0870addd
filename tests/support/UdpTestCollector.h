// UdpTestCollector: a UDP collector on 127.0.0.1 for the dashboard tests. It records
// every datagram that arrives and, depending on its mode, answers each with its first
// 64 bytes (the acknowledgement a dashboard collector sends) or stays silent. Tests
// can also send it arbitrary bytes to the last sender (garbage answers).
#pragma once

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <cstdint>
#include <mutex>
#include <optional>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "support/WaitUntil.h"
#include "telvane/Value.h"

namespace telvane::test {

class UdpTestCollector {
 public:
  enum class Mode { Acknowledge, Silent };

  // Binds 127.0.0.1 on the given port (0: any free one) and starts receiving.
  explicit UdpTestCollector(Mode mode, std::uint16_t port = 0) : mode_(mode) {
    fd_ = ::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    if (fd_ < 0) throw std::runtime_error("socket");
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(port);
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    if (::bind(fd_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
      ::close(fd_);
      throw std::runtime_error("bind");
    }
    socklen_t length = sizeof address;
    ::getsockname(fd_, reinterpret_cast<sockaddr*>(&address), &length);
    port_ = ntohs(address.sin_port);
    thread_ = std::thread([this] { run(); });
  }
  ~UdpTestCollector() {
    stop_.store(true);
    thread_.join();
    ::close(fd_);
  }
  UdpTestCollector(const UdpTestCollector&) = delete;
  UdpTestCollector& operator=(const UdpTestCollector&) = delete;

  std::uint16_t port() const { return port_; }
  void setMode(Mode mode) { mode_.store(mode); }

  std::vector<Bytes> datagrams() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return datagrams_;
  }
  std::size_t count() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return datagrams_.size();
  }
  bool waitForCount(std::size_t n, std::chrono::milliseconds timeout = kDefaultWaitMs) const {
    return waitUntil([&] { return count() >= n; }, timeout);
  }

  // Sends the bytes to the given local port of 127.0.0.1 from the collector's socket.
  bool sendTo(std::uint16_t port, const Bytes& bytes) const {
    sockaddr_in to{};
    to.sin_family = AF_INET;
    to.sin_port = htons(port);
    to.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    return ::sendto(fd_, bytes.data(), bytes.size(), 0, reinterpret_cast<sockaddr*>(&to), sizeof to) ==
           static_cast<ssize_t>(bytes.size());
  }
  // An acknowledgement of the event id: 64 bytes with the id at bytes 60-61.
  static Bytes acknowledgement(std::uint16_t eventID) {
    Bytes bytes(64, 0);
    bytes[60] = static_cast<std::uint8_t>(eventID >> 8);
    bytes[61] = static_cast<std::uint8_t>(eventID);
    return bytes;
  }

 private:
  void run() {
    std::vector<std::uint8_t> buffer(65536);
    while (!stop_.load()) {
      pollfd watched{fd_, POLLIN, 0};
      if (::poll(&watched, 1, 20) <= 0) continue;
      sockaddr_in from{};
      socklen_t fromLength = sizeof from;
      const ssize_t n =
          ::recvfrom(fd_, buffer.data(), buffer.size(), 0, reinterpret_cast<sockaddr*>(&from), &fromLength);
      if (n < 0) continue;
      Bytes datagram(buffer.begin(), buffer.begin() + n);
      if (mode_.load() == Mode::Acknowledge && datagram.size() >= 64) {
        ::sendto(fd_, datagram.data(), 64, 0, reinterpret_cast<sockaddr*>(&from), fromLength);
      }
      std::lock_guard<std::mutex> lock(mutex_);
      datagrams_.push_back(std::move(datagram));
    }
  }

  std::atomic<Mode> mode_;
  int fd_ = -1;
  std::uint16_t port_ = 0;
  std::atomic<bool> stop_{false};
  std::thread thread_;
  mutable std::mutex mutex_;
  std::vector<Bytes> datagrams_;  // guarded by mutex_
};

// The number of descriptors the process has open (entries of /proc/self/fd).
std::size_t openDescriptorCount();

}  // namespace telvane::test
