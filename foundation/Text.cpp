#include "foundation/Text.h"

#include <algorithm>
#include <cstdint>

namespace velk {

namespace {

constexpr char lowered(char letter) noexcept {
  return letter >= 'A' && letter <= 'Z' ? static_cast<char>(letter - 'A' + 'a') : letter;
}

bool sameIgnoringCase(char left, char right) noexcept { return lowered(left) == lowered(right); }

}  // namespace

std::vector<std::string_view> split(std::string_view text, char separator) {
  std::vector<std::string_view> parts;
  for (;;) {
    const std::size_t end = text.find(separator);
    parts.push_back(text.substr(0, end));
    if (end == std::string_view::npos) return parts;
    text.remove_prefix(end + 1);
  }
}

std::string lowerCased(std::string_view text) {
  std::string result(text);
  std::transform(result.begin(), result.end(), result.begin(), lowered);
  return result;
}

bool equalsIgnoringCase(std::string_view left, std::string_view right) noexcept {
  return std::equal(left.begin(), left.end(), right.begin(), right.end(), sameIgnoringCase);
}

bool containsIgnoringCase(std::string_view text, std::string_view part) noexcept {
  return std::search(text.begin(), text.end(), part.begin(), part.end(), sameIgnoringCase) != text.end() ||
         part.empty();
}

std::size_t utf8CharacterLength(std::string_view text) noexcept {
  if (text.empty()) return 0;
  const auto byte = [&](std::size_t offset) { return static_cast<std::uint8_t>(text[offset]); };
  const auto continues = [&](std::size_t offset) { return (byte(offset) & 0xC0U) == 0x80U; };
  const std::size_t left = text.size();
  const std::uint8_t first = byte(0);
  if (first < 0x80) return 1;
  if (first >= 0xC2 && first <= 0xDF) return left >= 2 && continues(1) ? 2 : 0;
  if (first >= 0xE0 && first <= 0xEF) {
    if (left < 3 || !continues(1) || !continues(2)) return 0;
    if (first == 0xE0 && byte(1) < 0xA0) return 0;  // overlong
    if (first == 0xED && byte(1) > 0x9F) return 0;  // surrogate
    return 3;
  }
  if (first >= 0xF0 && first <= 0xF4) {
    if (left < 4 || !continues(1) || !continues(2) || !continues(3)) return 0;
    if (first == 0xF0 && byte(1) < 0x90) return 0;  // overlong
    if (first == 0xF4 && byte(1) > 0x8F) return 0;  // above U+10FFFF
    return 4;
  }
  return 0;
}

bool isUtf8(std::string_view text) noexcept {
  std::size_t at = 0;
  while (at < text.size()) {
    if (static_cast<std::uint8_t>(text[at]) < 0x80) {
      ++at;
      continue;
    }
    const std::size_t length = utf8CharacterLength(text.substr(at));
    if (length == 0) return false;
    at += length;
  }
  return true;
}

std::string_view utf8Prefix(std::string_view text, std::size_t most) noexcept {
  if (text.size() <= most) return text;
  while (most > 0 && (static_cast<std::uint8_t>(text[most]) & 0xC0U) == 0x80U) --most;
  return text.substr(0, most);
}

std::size_t utf16Length(std::string_view text) noexcept {
  std::size_t units = 0;
  for (const char character : text) {
    const auto byte = static_cast<std::uint8_t>(character);
    if ((byte & 0xC0U) != 0x80U) ++units;  // one for each character
    if (byte >= 0xF0) ++units;             // and one more for a surrogate pair
  }
  return units;
}

std::string hexadecimal(std::span<const std::uint8_t> bytes) {
  constexpr std::string_view kDigits = "0123456789abcdef";
  std::string text;
  text.reserve(2 * bytes.size());
  for (const std::uint8_t byte : bytes) {
    text.push_back(kDigits[byte >> 4U]);
    text.push_back(kDigits[byte & 0xFU]);
  }
  return text;
}

}  // namespace velk
