#include "foundation/Base64.h"

#include <array>

namespace velk {

namespace {

constexpr std::string_view kAlphabet = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

constexpr std::array<std::int8_t, 256> makeDigitValues() {
  std::array<std::int8_t, 256> values{};
  for (auto& value : values) value = -1;
  for (std::size_t digit = 0; digit < kAlphabet.size(); ++digit) {
    values[static_cast<std::uint8_t>(kAlphabet[digit])] = static_cast<std::int8_t>(digit);
  }
  return values;
}

constexpr std::array<std::int8_t, 256> kDigitValues = makeDigitValues();

}  // namespace

std::string base64Encoded(std::span<const std::uint8_t> bytes) {
  std::string text;
  text.reserve((bytes.size() + 2) / 3 * 4);
  std::size_t at = 0;
  for (; at + 3 <= bytes.size(); at += 3) {
    const std::uint32_t group =
        static_cast<std::uint32_t>(bytes[at]) << 16U | static_cast<std::uint32_t>(bytes[at + 1]) << 8U | bytes[at + 2];
    for (int shift = 18; shift >= 0; shift -= 6) text.push_back(kAlphabet[group >> shift & 63U]);
  }
  const std::size_t left = bytes.size() - at;
  if (left == 0) return text;
  std::uint32_t group = static_cast<std::uint32_t>(bytes[at]) << 16U;
  if (left == 2) group |= static_cast<std::uint32_t>(bytes[at + 1]) << 8U;
  text.push_back(kAlphabet[group >> 18U & 63U]);
  text.push_back(kAlphabet[group >> 12U & 63U]);
  text.push_back(left == 2 ? kAlphabet[group >> 6U & 63U] : '=');
  text.push_back('=');
  return text;
}

std::optional<ByteData> base64Decoded(std::string_view text) {
  ByteData bytes;
  bytes.reserve(text.size() / 4 * 3 + 3);
  std::uint32_t group = 0;
  unsigned bits = 0;
  std::size_t digits = 0;
  for (const char character : text) {
    const std::int8_t value = kDigitValues[static_cast<std::uint8_t>(character)];
    if (value < 0) continue;
    ++digits;
    group = group << 6U | static_cast<std::uint32_t>(value);
    bits += 6;
    if (bits >= 8) {
      bits -= 8;
      bytes.push_back(static_cast<std::uint8_t>(group >> bits));
    }
  }
  if (digits % 4 == 1) return std::nullopt;  // six bits make no byte
  return bytes;
}

}  // namespace velk
