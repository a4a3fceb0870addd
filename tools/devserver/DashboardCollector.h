// DashboardCollector: the development server's UDP side. It receives the dashboard
// backend's datagrams on 127.0.0.1, answers each well-formed one at once with its
// acknowledgement (the received 64-byte header, whose bytes 60-61 carry the event
// ID) and reports it to the arrival log. A datagram shorter than the header is
// reported as ignored and not acknowledged.
//
// Threading: start() and stop() are called from the owning thread; datagrams are read
// and answered on the collector's own thread, which stop() joins.
#pragma once

#include <cstdint>
#include <string>
#include <thread>

#include "devserver/ArrivalLog.h"
#include "platform/Result.h"
#include "platform/UniqueFd.h"

namespace telvane::devserver {

class DashboardCollector {
 public:
  explicit DashboardCollector(ArrivalLog& log) : log_(log) {}
  ~DashboardCollector() { stop(); }
  DashboardCollector(const DashboardCollector&) = delete;
  DashboardCollector& operator=(const DashboardCollector&) = delete;

  // Binds 127.0.0.1:port (0: any free port) and starts reading; the bound port.
  Result<std::uint16_t> start(std::uint16_t port);
  void stop();

 private:
  void run();
  void handle(const std::string& datagram, const std::string& from, const void* address, unsigned addressLength);

  ArrivalLog& log_;
  UniqueFd socket_;
  UniqueFd wakeup_;  // an eventfd that stop() signals
  std::thread thread_;
};

}  // namespace telvane::devserver
