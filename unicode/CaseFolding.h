// Comparison of user text without regard to case: full case folding and canonical normalisation. ASCII takes a short
// way, without tables and without memory. Text that is not UTF-8 is compared byte by byte, ASCII letters without
// regard to case. No language has rules of its own. Any thread.
#pragma once

#include <string>
#include <string_view>

namespace velk {

[[nodiscard]] bool isAscii(std::string_view text) noexcept;

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

  [[nodiscard]] bool equals(const FoldedText& other);
  [[nodiscard]] bool contains(const FoldedText& part);

 private:
  [[nodiscard]] const std::string& folded();

  std::string_view _text;
  std::string _folded;
  bool _isAscii;
  bool _isFolded = false;
};

}  // namespace velk
