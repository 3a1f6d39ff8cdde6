// The event that every benchmark sends: twelve entries of the usual kinds, posted as about 560 bytes of JSON.
#pragma once

#include <cstdint>

#include "foundation/PropertyValue.h"

namespace velk::bench {

inline constexpr int kEventCategory = 101;
inline constexpr int kEventType = 1;

/// The monotonic clock, which all processes of a machine share, in seconds.
[[nodiscard]] double steadySeconds();

/// What the application reports. `client` and `sequence` tell events apart at the far end; `sentAt` is in
/// `steadySeconds`.
[[nodiscard]] PropertyDictionary samplePayload(std::uint32_t client, std::uint64_t sequence, double sentAt);

/// The payload as a message dictionary, as `VelkReporting::sendMessageWithDictionary` takes it.
[[nodiscard]] PropertyDictionary sampleMessage(std::uint32_t client, std::uint64_t sequence, double sentAt);

/// How a client of that number describes its session.
[[nodiscard]] PropertyDictionary sampleSessionInfo(std::uint32_t client);
[[nodiscard]] PropertyDictionary sampleUserInfo();

}  // namespace velk::bench
