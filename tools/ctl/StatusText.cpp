#include "tools/ctl/StatusText.h"

#include "foundation/Format.h"

namespace velk::ctl {
namespace {

std::string valueText(const PropertyValue& value) {
  return withoutControlCharacters(value.isNull() ? "-" : description(&value));
}

// "keepAliveCount" reads "Keep alive count".
std::string heading(std::string_view key) {
  std::string words;
  for (const char character : key) {
    const bool isUpper = character >= 'A' && character <= 'Z';
    if (isUpper && !words.empty()) words += ' ';
    words += isUpper ? static_cast<char>(character - 'A' + 'a') : character;
  }
  if (!words.empty() && words[0] >= 'a' && words[0] <= 'z') words[0] = static_cast<char>(words[0] - 'a' + 'A');
  return withoutControlCharacters(words);
}

std::string entriesText(const PropertyDictionary& dictionary) {
  std::string text;
  for (const PropertyDictionary::Entry& entry : dictionary) {
    text += (text.empty() ? "" : ", ") + withoutControlCharacters(entry.key) + " " + valueText(entry.value);
  }
  return text.empty() ? "none" : text;
}

std::string elementText(const PropertyValue& element) {
  const PropertyDictionary* dictionary = element.dictionary();
  return "\n  " + (dictionary != nullptr ? entriesText(*dictionary) : valueText(element));
}

}  // namespace

std::string statusText(const PropertyDictionary& status) {
  std::string text;
  for (const PropertyDictionary::Entry& entry : status) {
    text += (text.empty() ? "" : "\n") + heading(entry.key) + ": ";
    if (const PropertyArray* array = entry.value.array()) {
      text += std::to_string(array->size());
      for (const PropertyValue& element : *array) text += elementText(element);
    } else if (const PropertyDictionary* dictionary = entry.value.dictionary()) {
      text += entriesText(*dictionary);
    } else {
      text += valueText(entry.value);
    }
  }
  return text;
}

}  // namespace velk::ctl
