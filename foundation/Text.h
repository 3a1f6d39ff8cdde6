// Small operations on UTF-8 text that the standard library lacks.
#pragma once

#include <cstdint>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace velk {

/// The parts between `separator`s; a text without one is a single part, an empty text one empty part. No trimming.
[[nodiscard]] std::vector<std::string_view> split(std::string_view text, char separator);

/// ASCII letters lowered; other bytes stay, so UTF-8 stays UTF-8.
[[nodiscard]] std::string lowerCased(std::string_view text);

/// Comparison without regard to the case of ASCII letters.
[[nodiscard]] bool equalsIgnoringCase(std::string_view left, std::string_view right) noexcept;
[[nodiscard]] bool containsIgnoringCase(std::string_view text, std::string_view part) noexcept;

/// Well-formed UTF-8 (RFC 3629): no overlong forms, no surrogates, nothing above U+10FFFF.
[[nodiscard]] bool isUtf8(std::string_view text) noexcept;
/// How many bytes the character takes with which `text` begins; 0 when it begins with none, or with no UTF-8.
[[nodiscard]] std::size_t utf8CharacterLength(std::string_view text) noexcept;
/// The first bytes of well-formed UTF-8, at most `most` of them, without a part of a character at their end.
[[nodiscard]] std::string_view utf8Prefix(std::string_view text, std::size_t most) noexcept;
/// How many UTF-16 code units well-formed UTF-8 takes.
[[nodiscard]] std::size_t utf16Length(std::string_view text) noexcept;

/// The value of a hexadecimal digit of either case; -1 when it is none.
[[nodiscard]] constexpr int hexadecimalDigit(char character) noexcept {
  if (character >= '0' && character <= '9') return character - '0';
  if (character >= 'a' && character <= 'f') return character - 'a' + 10;
  if (character >= 'A' && character <= 'F') return character - 'A' + 10;
  return -1;
}
/// Lower-case hexadecimal, two digits a byte.
[[nodiscard]] std::string hexadecimal(std::span<const std::uint8_t> bytes);

}  // namespace velk
