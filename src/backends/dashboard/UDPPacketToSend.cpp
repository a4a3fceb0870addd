#include "backends/dashboard/UDPPacketToSend.h"

namespace telvane {

UDPPacketToSend::UDPPacketToSend(const std::uint8_t* bytes, std::size_t length, std::uint16_t eventNum)
    : eventNumber_(eventNum), data_(bytes, bytes + length) {}

}  // namespace telvane
