// The datagrams of the dashboard: 64 bytes of header and a line of text. The backend writes them and the collector
// reads them with this header; docs/dashboard.md is for those who want to do it in another language.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>

namespace velk::dashboard {

inline constexpr std::size_t kHeaderBytes = 64;
/// What follows the header; longer texts are cut.
inline constexpr std::size_t kMostTextBytes = 1023;
inline constexpr std::size_t kMostDatagramBytes = kHeaderBytes + kMostTextBytes;
/// A collector acknowledges by sending the header back, at least up to the end of the event number.
inline constexpr std::size_t kFewestAcknowledgementBytes = 62;

inline constexpr std::uint16_t kFlagReliable = 1;          ///< the sender waits for an acknowledgement
inline constexpr std::uint16_t kFlagWithoutProfile = 2;    ///< the address did not come from a storebag
inline constexpr std::uint8_t kFourMilliseconds = 4;       ///< the unit of `fourMilliseconds`
inline constexpr std::size_t kDeviceIdentifierBytes = 40;  ///< not terminated; padded with zeros

/// The header's values as people know them: session number, client version and length travel complemented.
struct Header {
  std::uint8_t majorVersion = 0;  ///< of the reporting component
  std::uint8_t component = 0;     ///< row of the component table
  std::uint8_t fourMilliseconds = 0;
  std::uint32_t seconds = 0;
  std::uint32_t sessionID = 0;
  std::uint16_t clientVersion = 0;
  std::uint16_t length = 0;  ///< of the whole datagram
  std::uint16_t method = 0;
  std::uint16_t respCode = 0;
  std::array<char, kDeviceIdentifierBytes> deviceIdentifier{};
  std::uint16_t eventNumber = 0;
  std::uint16_t flags = 0;

  bool operator==(const Header&) const = default;
};

void writeHeader(const Header& header, std::span<std::uint8_t, kHeaderBytes> bytes) noexcept;

/// Nothing when there are fewer than 64 bytes. Checks nothing else.
[[nodiscard]] std::optional<Header> readHeader(std::span<const std::uint8_t> datagram) noexcept;

/// The event number that an acknowledgement names; nothing when it is too short to name one.
[[nodiscard]] std::optional<std::uint16_t> acknowledgedEventNumber(std::span<const std::uint8_t> bytes) noexcept;

}  // namespace velk::dashboard
