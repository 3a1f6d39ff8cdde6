// One datagram of the dashboard that waits to be sent or to be acknowledged. Made, used and dropped on its backend's
// network queue.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>

#include "foundation/PropertyValue.h"

namespace velk {

struct UDPPacketToSend {
  static constexpr std::int32_t kNotSent = 0;                ///< not yet handed to the network
  static constexpr std::int32_t kAwaitsAcknowledgement = 1;  ///< sent

  /// An owned copy of the whole datagram.
  [[nodiscard]] static UDPPacketToSend initWithBytes(std::span<const std::uint8_t> bytes, std::uint16_t eventNum) {
    UDPPacketToSend packet;
    packet.eventNumber = eventNum;
    packet.data.assign(bytes.begin(), bytes.end());
    return packet;
  }

  std::int32_t state = kNotSent;
  std::int32_t numberOfChecks = 0;        ///< ticks since it was last sent
  std::uint32_t numberOfRetransmits = 0;  ///< the first sending does not count
  std::uint16_t eventNumber = 0;
  ByteData data;
};

}  // namespace velk
