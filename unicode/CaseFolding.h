// Comparison of user text without regard to case: full case folding and canonical normalisation. ASCII takes a short
// way, without tables and without memory. Text that is not UTF-8 is compared byte by byte, ASCII letters without
// regard to case. No language has rules of its own. Any thread.
#pragma once

#include <cstdint>
#include <cstring>
#include <optional>
#include <string>
#include <string_view>

#include "foundation/Text.h"

namespace velk {

[[nodiscard]] inline bool isAscii(std::string_view text) noexcept {
  // Every key of every filtered event comes here, so several bytes are looked at together; the last ones twice.
  const auto bits = [&text]<class Word>(Word word, std::size_t at) {
    std::memcpy(&word, text.data() + at, sizeof(word));
    return static_cast<std::uint64_t>(word);
  };
  const std::size_t size = text.size();
  std::uint64_t all = 0;
  if (size >= 8) {
    for (std::size_t at = 0; at + 8 < size; at += 8) all |= bits(std::uint64_t{}, at);
    all |= bits(std::uint64_t{}, size - 8);
  } else if (size >= 4) {
    all = bits(std::uint32_t{}, 0) | bits(std::uint32_t{}, size - 4);
  } else {
    for (const char byte : text) all |= static_cast<unsigned char>(byte);
  }
  return (all & 0x8080808080808080U) == 0;
}

/// The form in which texts that differ in case alone are equal. Composed, so that "e" is no part of "é".
[[nodiscard]] std::string caseFolded(std::string_view text);

[[nodiscard]] bool equalsCaseFolded(std::string_view left, std::string_view right);
[[nodiscard]] bool containsCaseFolded(std::string_view text, std::string_view part);

/// Each letter's own lower-case form; nothing is folded or normalised. For keys, which stay as they are once lower.
[[nodiscard]] std::string lowerCasedText(std::string_view text);

/// A text that is compared with many others: it is folded once.
class FoldedText {
 public:
  explicit FoldedText(std::string_view text) : _folded(caseFolded(text)) {}
  [[nodiscard]] const std::string& folded() const noexcept { return _folded; }

 private:
  std::string _folded;
};

/// A text that is compared with many `FoldedText`s: it is folded at most once, and never when it is ASCII.
class Foldable {
 public:
  /// `text` outlives this object.
  explicit Foldable(std::string_view text) : _text(text), _isAscii(isAscii(text)) {}

  [[nodiscard]] bool equals(const FoldedText& other) {
    // What equals folded text but for the case of ASCII letters folds to it as well.
    if (_text.size() == other.folded().size() && equalsIgnoringCase(_text, other.folded())) return true;
    return !_isAscii && folded() == other.folded();
  }
  [[nodiscard]] bool contains(const FoldedText& part) {
    // Folded text that is not ASCII holds bytes that no ASCII text has.
    if (_isAscii) return containsIgnoringCase(_text, part.folded());
    return folded().find(part.folded()) != std::string::npos;
  }

 private:
  [[nodiscard]] const std::string& folded();

  std::string_view _text;
  std::optional<std::string> _folded;
  bool _isAscii;
};

}  // namespace velk
