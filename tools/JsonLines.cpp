#include "tools/JsonLines.h"

#include <cmath>
#include <ostream>

#include "foundation/Json.h"
#include "foundation/Text.h"

namespace velk::tools {
namespace {

PropertyValue writable(const PropertyValue& value);

PropertyValue writable(const PropertyArray& array) {
  PropertyArray result;
  result.reserve(array.size());
  for (const PropertyValue& element : array) result.append(writable(element));
  return result;
}

PropertyValue writable(const PropertyDictionary& dictionary) {
  PropertyDictionary result;
  result.reserve(dictionary.size());
  for (const PropertyDictionary::Entry& entry : dictionary) {
    result.set(isUtf8(entry.key) ? entry.key : "(not text)", writable(entry.value));
  }
  return result;
}

// What JSON can hold of a value: foreign numbers and bytes must not cost the whole line.
PropertyValue writable(const PropertyValue& value) {
  if (const double* real = value.real(); real != nullptr && !std::isfinite(*real)) return nullptr;
  if (const Date* date = value.date(); date != nullptr && !std::isfinite(date->secondsSince1970)) return nullptr;
  if (const std::string* text = value.string(); text != nullptr && !isUtf8(*text)) {
    return ByteData(text->begin(), text->end());
  }
  if (value.array() != nullptr) return writable(*value.array());
  if (value.dictionary() != nullptr) return writable(*value.dictionary());
  return value;
}

}  // namespace

std::string jsonText(const PropertyDictionary& object) {
  std::string text;
  if (json::write(object, text, json::Extensions::tagged)) return text;
  text.clear();
  if (json::write(writable(object), text, json::Extensions::tagged)) return text;
  return "{}";
}

std::string prettyJsonText(const PropertyValue& value) {
  std::string text;
  if (json::writePretty(value, text, json::Extensions::tagged)) return text;
  text.clear();
  if (json::writePretty(writable(value), text, json::Extensions::tagged)) return text;
  return "null";
}

void JsonLines::write(const PropertyDictionary& object) { writeText(jsonText(object) + "\n"); }

void JsonLines::writeText(std::string_view lines) {
  Guard guard(_lock);
  _stream.write(lines.data(), static_cast<std::streamsize>(lines.size()));
  _stream.flush();
}

bool JsonLines::good() const {
  Guard guard(_lock);
  return _stream.good();
}

}  // namespace velk::tools
