#include "devserver/DashboardDatagram.h"

namespace telvane::devserver {

namespace {

std::uint16_t read16(std::string_view bytes, std::size_t at) {
  return static_cast<std::uint16_t>((static_cast<unsigned char>(bytes[at]) << 8) |
                                    static_cast<unsigned char>(bytes[at + 1]));
}

std::uint32_t read32(std::string_view bytes, std::size_t at) {
  return (static_cast<std::uint32_t>(read16(bytes, at)) << 16) | read16(bytes, at + 2);
}

// True when the "=" at `at` is escaped: an odd number of backslashes precedes it.
bool isEscaped(std::string_view text, std::size_t at) {
  std::size_t backslashes = 0;
  while (at > backslashes && text[at - backslashes - 1] == '\\') ++backslashes;
  return backslashes % 2 == 1;
}

}  // namespace

std::string unescapeDashboardValue(std::string_view value) {
  std::string out;
  out.reserve(value.size());
  for (std::size_t i = 0; i < value.size(); ++i) {
    if (value[i] == '\\' && i + 1 < value.size() && (value[i + 1] == '\\' || value[i + 1] == '=')) {
      out += value[++i];
    } else {
      out += value[i];
    }
  }
  return out;
}

std::vector<std::pair<std::string, std::string>> parseDashboardText(std::string_view text) {
  // The unescaped "=" signs separate keys from values.
  std::vector<std::size_t> equals;
  for (std::size_t i = 0; i < text.size(); ++i) {
    if (text[i] == '=' && !isEscaped(text, i)) equals.push_back(i);
  }
  std::vector<std::pair<std::string, std::string>> fields;
  std::size_t keyStart = 0;
  for (std::size_t n = 0; n < equals.size(); ++n) {
    std::size_t sign = equals[n];
    // The key starts after the last blank before its "=".
    std::size_t blank = text.rfind(' ', sign);
    std::size_t start = blank == std::string_view::npos || blank < keyStart ? keyStart : blank + 1;
    std::string key(text.substr(start, sign - start));
    // The value runs to the blank before the next key.
    std::size_t end = text.size();
    if (n + 1 < equals.size()) {
      std::size_t nextBlank = text.rfind(' ', equals[n + 1]);
      if (nextBlank != std::string_view::npos && nextBlank > sign) end = nextBlank;
    }
    fields.emplace_back(std::move(key), unescapeDashboardValue(text.substr(sign + 1, end - sign - 1)));
    keyStart = end + 1;
  }
  return fields;
}

std::optional<DashboardDatagram> parseDashboardDatagram(std::string_view bytes) {
  if (bytes.size() < kDashboardHeaderSize) return std::nullopt;
  DashboardDatagram datagram;
  datagram.majorVersion = static_cast<std::uint8_t>(bytes[0]);
  datagram.componentType = static_cast<std::uint8_t>(bytes[1]);
  datagram.constantOne = static_cast<std::uint8_t>(bytes[2]);
  datagram.milliseconds = static_cast<std::uint32_t>(static_cast<unsigned char>(bytes[3])) * 4;
  datagram.seconds = read32(bytes, 4);
  datagram.sessionID = ~read32(bytes, 8);
  datagram.clientVersion = static_cast<std::uint16_t>(~read16(bytes, 12));
  datagram.declaredLength = static_cast<std::uint16_t>(~read16(bytes, 14));
  datagram.method = read16(bytes, 16);
  datagram.responseCode = read16(bytes, 18);
  datagram.deviceID = std::string(bytes.substr(20, kDashboardDeviceIdSize));
  // A shorter identifier leaves zero bytes behind it.
  if (auto zero = datagram.deviceID.find('\0'); zero != std::string::npos) datagram.deviceID.resize(zero);
  datagram.eventID = read16(bytes, 60);
  datagram.flags = read16(bytes, 62);
  datagram.text = std::string(bytes.substr(kDashboardHeaderSize));
  datagram.fields = parseDashboardText(datagram.text);
  return datagram;
}

}  // namespace telvane::devserver
