// Numbers that several files of this folder share.
#pragma once

#include <cstdint>
#include <string_view>

namespace velk {

/// How long an idle connectivity helper is kept unless the storebag says otherwise, in seconds.
inline constexpr std::uint32_t kDefaultReleaseTimeout = 30;

// The session's own messages.
inline constexpr std::uint16_t kInternalCategory = 0;
inline constexpr std::uint16_t kStartMessageType = 0;
inline constexpr std::uint16_t kHealthMessageType = 1;

/// Stands where the device gives no answer.
inline constexpr std::string_view kUnknown = "Unknown";
inline constexpr std::string_view kSerialNumberKey = "SerialNum";

}  // namespace velk
