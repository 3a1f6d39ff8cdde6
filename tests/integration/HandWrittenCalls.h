// Calls written byte by byte, so that what the daemon is sent owes nothing to its own encoder.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "tests/integration/RawConnection.h"

namespace velk::test::cbor {

inline std::string head(unsigned major, std::uint64_t value) {
  const auto first = static_cast<unsigned char>(major << 5);
  if (value < 24) return {static_cast<char>(first | value)};
  std::string bytes{static_cast<char>(first | 27U)};
  for (int i = 7; i >= 0; --i) bytes.push_back(static_cast<char>(value >> (8 * i)));
  return bytes;
}
inline std::string number(std::uint64_t value) { return head(0, value); }
inline std::string text(std::string_view value) { return head(3, value.size()).append(value); }
inline std::string list(const std::vector<std::string>& values) {
  std::string bytes = head(4, values.size());
  for (const auto& value : values) bytes += value;
  return bytes;
}
inline std::string map(const std::vector<std::pair<std::string, std::string>>& entries) {
  std::string bytes = head(5, entries.size());
  for (const auto& [key, value] : entries) bytes += text(key) + value;
  return bytes;
}
inline const std::string kNull = "\xf6";
inline const std::string kFalse = "\xf4";
inline const std::string kTrue = "\xf5";
inline const std::string kEmptyMap = "\xa0";

/// The frame of a call: the method's number, then its arguments. Serial 0: no answer is wanted.
inline std::string call(std::uint64_t serial, const std::vector<std::string>& values) {
  return RawConnection::frame(FrameKind::call, serial, list(values));
}

}  // namespace velk::test::cbor
