// UDPPacketToSend: one datagram of the dashboard backend waiting in its message queue,
// either for a first successful send (state 0) or for the collector's acknowledgement
// of its event number (state 1).
//
// A plain value: it owns a copy of the datagram bytes and carries the counters of the
// retransmission schedule. The dashboard backend keeps its packets on its network queue
// and touches them only there; the class itself has no synchronisation.
#pragma once

#include <cstddef>
#include <cstdint>

#include "telvane/Value.h"

namespace telvane {

class UDPPacketToSend {
 public:
  static constexpr std::int32_t kStateNotSent = 0;
  static constexpr std::int32_t kStateAwaitingAcknowledgement = 1;

  // initWithBytes:length:eventNum:: copies the bytes. State, checks and retransmissions
  // start at 0.
  UDPPacketToSend(const std::uint8_t* bytes, std::size_t length, std::uint16_t eventNum);

  std::int32_t state() const { return state_; }
  void setState(std::int32_t state) { state_ = state; }
  // Periodic checks since the last (re)transmission.
  std::int32_t numberOfChecks() const { return numberOfChecks_; }
  void setNumberOfChecks(std::int32_t checks) { numberOfChecks_ = checks; }
  std::int32_t numberOfRetransmits() const { return numberOfRetransmits_; }
  void setNumberOfRetransmits(std::int32_t retransmits) { numberOfRetransmits_ = retransmits; }
  std::uint16_t eventNumber() const { return eventNumber_; }
  void setEventNumber(std::uint16_t eventNumber) { eventNumber_ = eventNumber; }
  const Bytes& data() const { return data_; }
  void setData(Bytes data) { data_ = std::move(data); }

 private:
  std::int32_t state_ = kStateNotSent;
  std::int32_t numberOfChecks_ = 0;
  std::int32_t numberOfRetransmits_ = 0;
  std::uint16_t eventNumber_ = 0;
  Bytes data_;
};

}  // namespace telvane
