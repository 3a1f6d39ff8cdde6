#include "foundation/DashboardDatagram.h"

#include <algorithm>

namespace velk::dashboard {
namespace {

// Offsets within the header. Numbers are big-endian.
constexpr std::size_t kMajorVersion = 0;
constexpr std::size_t kComponent = 1;
constexpr std::size_t kConstant = 2;
constexpr std::size_t kFraction = 3;
constexpr std::size_t kSeconds = 4;
constexpr std::size_t kSessionID = 8;
constexpr std::size_t kClientVersion = 12;
constexpr std::size_t kLength = 14;
constexpr std::size_t kMethod = 16;
constexpr std::size_t kRespCode = 18;
constexpr std::size_t kDeviceIdentifier = 20;
constexpr std::size_t kEventNumber = 60;
constexpr std::size_t kFlags = 62;

constexpr std::uint8_t kConstantValue = 1;

void write16(std::span<std::uint8_t> bytes, std::size_t at, std::uint16_t value) noexcept {
  bytes[at] = static_cast<std::uint8_t>(value >> 8);
  bytes[at + 1] = static_cast<std::uint8_t>(value);
}

void write32(std::span<std::uint8_t> bytes, std::size_t at, std::uint32_t value) noexcept {
  write16(bytes, at, static_cast<std::uint16_t>(value >> 16));
  write16(bytes, at + 2, static_cast<std::uint16_t>(value));
}

std::uint16_t read16(std::span<const std::uint8_t> bytes, std::size_t at) noexcept {
  return static_cast<std::uint16_t>(bytes[at] << 8 | bytes[at + 1]);
}

std::uint32_t read32(std::span<const std::uint8_t> bytes, std::size_t at) noexcept {
  return static_cast<std::uint32_t>(read16(bytes, at)) << 16 | read16(bytes, at + 2);
}

std::uint16_t complement(std::uint16_t value) noexcept { return static_cast<std::uint16_t>(~value); }

}  // namespace

void writeHeader(const Header& header, std::span<std::uint8_t, kHeaderBytes> bytes) noexcept {
  bytes[kMajorVersion] = header.majorVersion;
  bytes[kComponent] = header.component;
  bytes[kConstant] = kConstantValue;
  bytes[kFraction] = header.fourMilliseconds;
  write32(bytes, kSeconds, header.seconds);
  write32(bytes, kSessionID, ~header.sessionID);
  write16(bytes, kClientVersion, complement(header.clientVersion));
  write16(bytes, kLength, complement(header.length));
  write16(bytes, kMethod, header.method);
  write16(bytes, kRespCode, header.respCode);
  std::copy(header.deviceIdentifier.begin(), header.deviceIdentifier.end(), bytes.begin() + kDeviceIdentifier);
  write16(bytes, kEventNumber, header.eventNumber);
  write16(bytes, kFlags, header.flags);
}

std::optional<Header> readHeader(std::span<const std::uint8_t> datagram) noexcept {
  if (datagram.size() < kHeaderBytes) return std::nullopt;
  Header header;
  header.majorVersion = datagram[kMajorVersion];
  header.component = datagram[kComponent];
  header.fourMilliseconds = datagram[kFraction];
  header.seconds = read32(datagram, kSeconds);
  header.sessionID = ~read32(datagram, kSessionID);
  header.clientVersion = complement(read16(datagram, kClientVersion));
  header.length = complement(read16(datagram, kLength));
  header.method = read16(datagram, kMethod);
  header.respCode = read16(datagram, kRespCode);
  const auto identifier = datagram.subspan(kDeviceIdentifier, kDeviceIdentifierBytes);
  std::copy(identifier.begin(), identifier.end(), header.deviceIdentifier.begin());
  header.eventNumber = read16(datagram, kEventNumber);
  header.flags = read16(datagram, kFlags);
  return header;
}

std::optional<std::uint16_t> acknowledgedEventNumber(std::span<const std::uint8_t> bytes) noexcept {
  if (bytes.size() < kFewestAcknowledgementBytes) return std::nullopt;
  return read16(bytes, kEventNumber);
}

}  // namespace velk::dashboard
