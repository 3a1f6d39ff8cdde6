#include "backends/MacroExpansion.h"

#include <string>
#include <vector>

#include "backends/LogTexts.h"
#include "platform/Log.h"

namespace velk {

namespace {

/// What the data set holds under a macro text; null for every other value.
const PropertyValue* replacementFor(const PropertyValue& value, const PropertyDictionary& dataSet) {
  const std::string* text = value.string();
  if (text == nullptr || !text->starts_with("==")) return nullptr;
  const PropertyValue* replacement = dataSet.find(*text);
  if (replacement != nullptr) log::standard(backend_texts::kExpandingMacro, *text, *replacement);
  return replacement;
}

void expandBelow(PropertyDictionary& dictionary, const PropertyDictionary& dataSet) {
  std::vector<std::string> keys;
  keys.reserve(dictionary.size());
  for (const auto& entry : dictionary) keys.push_back(entry.key);
  for (const auto& key : keys) expandMacroForDataSet(dictionary, key, dataSet);
}

void expandBelow(PropertyArray& array, const PropertyDictionary& dataSet) {
  for (std::size_t index = 0; index < array.size(); ++index) expandMacroForDataSet(array, index, dataSet);
}

void expand(PropertyValue& value, const PropertyDictionary& dataSet) {
  if (PropertyDictionary* dictionary = value.dictionary()) return expandBelow(*dictionary, dataSet);
  if (PropertyArray* array = value.array()) return expandBelow(*array, dataSet);
  if (const PropertyValue* replacement = replacementFor(value, dataSet)) value = PropertyValue(*replacement);
}

}  // namespace

void expandMacroForDataSet(PropertyDictionary& container, std::string_view key, const PropertyDictionary& dataSet) {
  if (PropertyValue* value = container.findMutable(key)) expand(*value, dataSet);
}

void expandMacroForDataSet(PropertyArray& container, std::size_t index, const PropertyDictionary& dataSet) {
  if (index < container.size()) expand(container.mutableAt(index), dataSet);
}

}  // namespace velk
