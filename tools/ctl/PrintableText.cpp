#include "tools/ctl/PrintableText.h"

#include <array>
#include <cstdint>

#include "foundation/Format.h"
#include "foundation/Text.h"

namespace velk::ctl {
namespace {

struct Character {
  std::uint32_t number;
  std::size_t bytes;
};

// The first character of well-formed UTF-8.
Character firstOf(std::string_view text) noexcept {
  const auto byte = [&](std::size_t index) { return static_cast<unsigned char>(text[index]); };
  const auto rest = [&](std::size_t index) { return static_cast<std::uint32_t>(byte(index) & 0x3FU); };
  if (byte(0) < 0x80) return {byte(0), 1};
  if (byte(0) < 0xE0) return {(byte(0) & 0x1FU) << 6U | rest(1), 2};
  if (byte(0) < 0xF0) return {(byte(0) & 0x0FU) << 12U | rest(1) << 6U | rest(2), 3};
  return {(byte(0) & 0x07U) << 18U | rest(1) << 12U | rest(2) << 6U | rest(3), 4};
}

struct Range {
  std::uint32_t first;
  std::uint32_t last;
};

template <std::size_t count>
bool isIn(const std::array<Range, count>& ranges, std::uint32_t character) noexcept {
  for (const Range& range : ranges) {
    if (character >= range.first && character <= range.last) return true;
  }
  return false;
}

// What turns the direction of writing or hides what stands beside it, tags and byte-order marks among them.
constexpr std::array<Range, 7> kInvisible{{{0xAD, 0xAD},
                                           {0x061C, 0x061C},
                                           {0x200B, 0x200F},
                                           {0x202A, 0x202E},
                                           {0x2060, 0x206F},
                                           {0xFEFF, 0xFEFF},
                                           {0xE0000, 0xE007F}}};
constexpr std::array<Range, 3> kMarks{{{0x0300, 0x036F}, {0x20D0, 0x20FF}, {0xFE00, 0xFE0F}}};
constexpr std::array<Range, 6> kWide{
    {{0x1100, 0x115F}, {0x2E80, 0xA4CF}, {0xAC00, 0xD7A3}, {0xF900, 0xFAFF}, {0xFF00, 0xFF60}, {0x1F300, 0x3FFFD}}};

std::size_t columnsOf(std::uint32_t character) noexcept {
  if (isIn(kMarks, character)) return 0;
  return isIn(kWide, character) ? 2 : 1;
}

std::string withoutInvisibleCharacters(std::string_view text) {
  std::string result;
  while (!text.empty()) {
    const Character character = firstOf(text);
    if (isIn(kInvisible, character.number)) {
      result += formatText("\\u%04x", {character.number});
    } else {
      result += text.substr(0, character.bytes);
    }
    text.remove_prefix(character.bytes);
  }
  return result;
}

std::string withoutForeignBytes(std::string_view text) {
  std::string result;
  for (const char byte : text) {
    const bool isAscii = static_cast<unsigned char>(byte) < 0x80;
    result += isAscii ? std::string(1, byte) : formatText("\\x%02x", {static_cast<unsigned char>(byte)});
  }
  return result;
}

}  // namespace

std::size_t columnsOf(std::string_view text) noexcept {
  std::size_t columns = 0;
  while (!text.empty()) {
    const Character character = firstOf(text);
    columns += columnsOf(character.number);
    text.remove_prefix(character.bytes);
  }
  return columns;
}

std::string printable(std::string_view text, std::size_t columns) {
  const std::string whole = isUtf8(text) ? withoutInvisibleCharacters(withoutControlCharacters(text))
                                         : withoutControlCharacters(withoutForeignBytes(text));
  if (columnsOf(whole) <= columns) return whole;
  std::size_t taken = 0;
  std::string_view rest = whole;
  while (!rest.empty()) {
    const Character character = firstOf(rest);
    taken += columnsOf(character.number);
    if (taken >= columns) break;
    rest.remove_prefix(character.bytes);
  }
  return whole.substr(0, whole.size() - rest.size()) + "\u2026";
}

}  // namespace velk::ctl
