// DashboardDatagramReader: reads a dashboard datagram back into its fields for tests,
// written apart from the backend's own code: a 64-byte big-endian header (session ID,
// client version and total length complemented) and the text after it.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "telvane/Value.h"

namespace telvane::test {

struct ReadDatagram {
  unsigned majorVersion = 0;
  unsigned componentType = 0;
  unsigned constantOne = 0;
  unsigned timeQuarterMs = 0;  // byte 3: milliseconds in units of 4 ms
  std::uint32_t seconds = 0;
  std::uint32_t sessionID = 0;
  std::uint16_t clientVersion = 0;
  std::uint16_t totalLength = 0;
  std::uint16_t method = 0;
  std::uint16_t responseCode = 0;
  std::string deviceID;
  std::uint16_t eventID = 0;
  std::uint16_t flags = 0;
  std::string text;
};

inline std::optional<ReadDatagram> readDatagram(const Bytes& bytes) {
  if (bytes.size() < 64) return std::nullopt;
  auto u16 = [&](std::size_t at) { return static_cast<std::uint16_t>(bytes[at] * 256u + bytes[at + 1]); };
  auto u32 = [&](std::size_t at) {
    return static_cast<std::uint32_t>(bytes[at]) * 16777216u + bytes[at + 1] * 65536u + bytes[at + 2] * 256u +
           bytes[at + 3];
  };
  ReadDatagram d;
  d.majorVersion = bytes[0];
  d.componentType = bytes[1];
  d.constantOne = bytes[2];
  d.timeQuarterMs = bytes[3];
  d.seconds = u32(4);
  d.sessionID = 0xFFFFFFFFu - u32(8);
  d.clientVersion = static_cast<std::uint16_t>(0xFFFFu - u16(12));
  d.totalLength = static_cast<std::uint16_t>(0xFFFFu - u16(14));
  d.method = u16(16);
  d.responseCode = u16(18);
  d.deviceID.assign(bytes.begin() + 20, bytes.begin() + 60);
  d.eventID = u16(60);
  d.flags = u16(62);
  d.text.assign(bytes.begin() + 64, bytes.end());
  return d;
}

}  // namespace telvane::test
