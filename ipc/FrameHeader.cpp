#include "ipc/FrameHeader.h"

#include "ipc/Limits.h"

namespace velk::ipc {
namespace {

template <class Number>
void put(Number value, std::uint8_t* to) noexcept {
  for (std::size_t byte = 0; byte < sizeof(Number); ++byte) to[byte] = static_cast<std::uint8_t>(value >> (8 * byte));
}

template <class Number>
Number get(const std::uint8_t* from) noexcept {
  Number value = 0;
  for (std::size_t byte = 0; byte < sizeof(Number); ++byte) {
    value = static_cast<Number>(value | (static_cast<Number>(from[byte]) << (8 * byte)));
  }
  return value;
}

}  // namespace

void writeFrameHeader(const FrameHeader& header, std::uint8_t* to) noexcept {
  put(header.length, to);
  to[4] = header.version;
  to[5] = static_cast<std::uint8_t>(header.kind);
  put(header.descriptors, to + 6);
  put(header.serial, to + 8);
}

FrameHeader readFrameHeader(const std::uint8_t* from) noexcept {
  return {get<std::uint32_t>(from), from[4], static_cast<FrameKind>(from[5]), get<std::uint16_t>(from + 6),
          get<std::uint64_t>(from + 8)};
}

const char* faultOf(const FrameHeader& header) noexcept {
  if (header.version != kProtocolVersion) return "unknown protocol version";
  if (header.length > kMaximumFrameBytes) return "frame too large";
  const bool isCall = header.kind == FrameKind::call;
  if (!isCall && (header.kind < FrameKind::call || header.kind > FrameKind::goodbye)) return "unknown kind of frame";
  if (header.descriptors > kMaximumDescriptorsPerFrame) return "too many descriptors in a frame";
  if (header.descriptors != 0 && !isCall) return "descriptors in a frame that takes none";
  const bool isAnswer = header.kind == FrameKind::reply || header.kind == FrameKind::errorReply;
  if (isAnswer && header.serial == 0) return "reply without a serial";
  return nullptr;
}

}  // namespace velk::ipc
