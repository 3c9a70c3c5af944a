#include "backends/UDPPacketToSend.h"

namespace zerith {

UDPPacketToSend::UDPPacketToSend(std::span<const std::uint8_t> bytes, std::uint16_t eventNum)
    : eventNumber_(eventNum), data_(bytes.begin(), bytes.end()) {}

}  // namespace zerith
