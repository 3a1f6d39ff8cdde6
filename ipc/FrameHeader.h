// The sixteen bytes before each body. docs/protocol.md has the layout.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>

namespace velk::ipc {

inline constexpr std::uint8_t kProtocolVersion = 1;
inline constexpr std::size_t kFrameHeaderBytes = 16;

/// Numbered, only ever appended to.
enum class FrameKind : std::uint8_t { call = 1, reply = 2, errorReply = 3, goodbye = 4 };

/// Little-endian on the wire, in this order: length 4, version 1, kind 1, descriptors 2, serial 8.
struct FrameHeader {
  /// Bytes of the body.
  std::uint32_t length = 0;
  std::uint8_t version = kProtocolVersion;
  FrameKind kind = FrameKind::call;
  std::uint16_t descriptors = 0;
  /// 0 for a call that wants no answer, and for a goodbye.
  std::uint64_t serial = 0;
};

/// Both spans hold at least kFrameHeaderBytes.
void writeFrameHeader(const FrameHeader& header, std::uint8_t* to) noexcept;
[[nodiscard]] FrameHeader readFrameHeader(const std::uint8_t* from) noexcept;

/// Null when the header is sound; else what is wrong with it.
[[nodiscard]] const char* faultOf(const FrameHeader& header) noexcept;

}  // namespace velk::ipc
