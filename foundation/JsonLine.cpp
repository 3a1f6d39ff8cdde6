#include "foundation/JsonLine.h"

#include <cmath>
#include <cstdio>
#include <string_view>

#include "foundation/Json.h"
#include "foundation/Text.h"

namespace velk::json {

namespace {

PropertyDictionary writable(const PropertyDictionary& dictionary);

/// The value without what JSON cannot hold.
PropertyValue writable(const PropertyValue& value) {
  if (const auto* real = value.real()) return std::isfinite(*real) ? value : PropertyValue();
  if (const auto* date = value.date()) return std::isfinite(date->secondsSince1970) ? value : PropertyValue();
  if (const auto* string = value.string()) return isUtf8(*string) ? value : PropertyValue();
  if (const auto* dictionary = value.dictionary()) return writable(*dictionary);
  const auto* array = value.array();
  if (array == nullptr) return value;
  PropertyArray copy;
  copy.reserve(array->size());
  for (const auto& element : *array) copy.append(writable(element));
  return copy;
}

PropertyDictionary writable(const PropertyDictionary& dictionary) {
  PropertyDictionary copy;
  for (const auto& [key, value] : dictionary) {
    if (isUtf8(key)) copy.set(key, writable(value));
  }
  return copy;
}

/// The code of the control character or line separator that `text` begins with, among those that JSON lets stand;
/// 0 when it begins with something else.
unsigned strayControl(std::string_view text, std::size_t& length) {
  const auto byte = [&](std::size_t index) { return static_cast<unsigned char>(text[index]); };
  if (byte(0) == 0x7F) return length = 1, 0x7FU;
  if (byte(0) == 0xC2 && text.size() > 1 && byte(1) < 0xA0) return length = 2, byte(1);
  if (text.starts_with("\u2028") || text.starts_with("\u2029")) return length = 3, 0x2000U | (byte(2) & 0x3FU);
  return 0;
}

std::string withoutStrayControls(std::string_view text) {
  std::string result;
  result.reserve(text.size());
  while (!text.empty()) {
    std::size_t length = 1;
    if (const unsigned code = strayControl(text, length); code != 0) {
      char escape[8];
      std::snprintf(escape, sizeof escape, "\\u%04x", code);
      result += escape;
    } else {
      result += text[0];
    }
    text.remove_prefix(length);
  }
  return result;
}

}  // namespace

std::string line(const PropertyDictionary& dictionary) {
  std::string text;
  if (!write(dictionary, text, Extensions::tagged)) {
    text.clear();
    // What is left has a form in JSON.
    static_cast<void>(write(writable(dictionary), text, Extensions::tagged));
  }
  return withoutStrayControls(text);
}

}  // namespace velk::json
