#include "unicode/CaseFolding.h"

#include <utf8proc.h>

#include <array>
#include <cstdlib>
#include <memory>
#include <new>
#include <optional>
#include <utility>

namespace velk {

namespace {

/// Nothing for text that is not UTF-8.
std::optional<std::string> mapped(std::string_view text, int options) {
  utf8proc_uint8_t* bytes = nullptr;
  const auto length =
      utf8proc_map(reinterpret_cast<const utf8proc_uint8_t*>(text.data()), static_cast<utf8proc_ssize_t>(text.size()),
                   &bytes, static_cast<utf8proc_option_t>(options));
  if (length == UTF8PROC_ERROR_NOMEM) throw std::bad_alloc();
  if (length < 0) return std::nullopt;
  const std::unique_ptr<utf8proc_uint8_t, decltype(&std::free)> owner(bytes, &std::free);
  return std::string(reinterpret_cast<const char*>(bytes), static_cast<std::size_t>(length));
}

}  // namespace

std::string caseFolded(std::string_view text) {
  if (isAscii(text)) return lowerCased(text);
  // Decomposed first: a letter's marks fold by themselves, and what they fold to depends on their order.
  const auto decomposed = mapped(text, UTF8PROC_STABLE | UTF8PROC_DECOMPOSE);
  auto folded = decomposed ? mapped(*decomposed, UTF8PROC_STABLE | UTF8PROC_COMPOSE | UTF8PROC_CASEFOLD) : std::nullopt;
  return folded ? std::move(*folded) : lowerCased(text);
}

bool equalsCaseFolded(std::string_view left, std::string_view right) {
  if (isAscii(left) && isAscii(right)) return equalsIgnoringCase(left, right);
  return caseFolded(left) == caseFolded(right);
}

bool containsCaseFolded(std::string_view text, std::string_view part) {
  if (isAscii(text) && isAscii(part)) return containsIgnoringCase(text, part);
  return caseFolded(text).find(caseFolded(part)) != std::string::npos;
}

std::string lowerCasedText(std::string_view text) {
  if (isAscii(text) || !isUtf8(text)) return lowerCased(text);
  std::string lowered;
  lowered.reserve(text.size());
  std::array<utf8proc_uint8_t, 4> bytes{};
  while (!text.empty()) {
    utf8proc_int32_t character = 0;
    const auto length = utf8proc_iterate(reinterpret_cast<const utf8proc_uint8_t*>(text.data()),
                                         static_cast<utf8proc_ssize_t>(text.size()), &character);
    if (length <= 0) break;
    const auto written = utf8proc_encode_char(utf8proc_tolower(character), bytes.data());
    lowered.append(reinterpret_cast<const char*>(bytes.data()), static_cast<std::size_t>(written));
    text.remove_prefix(static_cast<std::size_t>(length));
  }
  return lowered;
}

const std::string& Foldable::folded() {
  if (!_folded) _folded = caseFolded(_text);
  return *_folded;
}

}  // namespace velk
