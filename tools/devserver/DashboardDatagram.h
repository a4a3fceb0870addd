// DashboardDatagram: one datagram of the dashboard backend as the collector reads it:
// a 64-byte big-endian header followed by a text of " key=value" pairs.
//
// Header: 0 the daemon's major version; 1 the component type; 2 the constant 1; 3 the
// event time's milliseconds in units of 4 ms; 4-7 the event time's whole seconds;
// 8-11 the complemented session ID; 12-13 the complemented client version; 14-15 the
// complemented total length; 16-17 method (the event's category); 18-19 response
// code (its type); 20-59 the 40-character device identifier; 60-61 the event ID;
// 62-63 flags (bit 0 reliable UDP, bit 1 address not from a profile).
//
// In the text every value was sanitised by the sender (newlines removed, backslashes
// doubled, "=" written as "\="); keys were not. A pair therefore ends at the last
// blank before the next unescaped "=". The acknowledgement is a datagram whose bytes
// 60-61 hold the event ID; the collector returns the received header.
//
// Plain data and pure functions; safe from any thread.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace telvane::devserver {

inline constexpr std::size_t kDashboardHeaderSize = 64;
inline constexpr std::size_t kDashboardDeviceIdSize = 40;

struct DashboardDatagram {
  std::uint8_t majorVersion = 0;
  std::uint8_t componentType = 0;
  std::uint8_t constantOne = 0;
  std::uint32_t seconds = 0;
  std::uint32_t milliseconds = 0;  // byte 3 times 4
  std::uint32_t sessionID = 0;
  std::uint16_t clientVersion = 0;
  std::uint16_t declaredLength = 0;  // the total length the sender wrote
  std::uint16_t method = 0;
  std::uint16_t responseCode = 0;
  std::string deviceID;
  std::uint16_t eventID = 0;
  std::uint16_t flags = 0;
  std::string text;
  // The pairs of the text, in order, values unescaped.
  std::vector<std::pair<std::string, std::string>> fields;

  bool reliable() const { return (flags & 1) != 0; }
  bool addressFromProfile() const { return (flags & 2) == 0; }
};

// Nothing when the datagram is shorter than its header.
std::optional<DashboardDatagram> parseDashboardDatagram(std::string_view bytes);

// The pairs of a datagram text (see above).
std::vector<std::pair<std::string, std::string>> parseDashboardText(std::string_view text);

// A sanitised value back as it was ("\=" → "=", "\\" → "\").
std::string unescapeDashboardValue(std::string_view value);

}  // namespace telvane::devserver
