#include "daemon/SharedDataTable.h"

namespace velk {

namespace {

std::size_t memoryOfEntry(std::string_view key, const PropertyValue& value) noexcept {
  return sizeof(PropertyDictionary::Entry) - sizeof(PropertyValue) + key.size() + SharedDataTable::memoryOf(value);
}

}  // namespace

std::size_t SharedDataTable::memoryOf(const PropertyValue& value) noexcept {
  std::size_t bytes = sizeof(PropertyValue);
  if (const auto* text = value.string()) bytes += text->size();
  if (const auto* data = value.data()) bytes += data->size();
  if (const auto* array = value.array()) {
    for (const auto& element : *array) bytes += memoryOf(element);
  }
  if (const auto* dictionary = value.dictionary()) {
    for (const auto& entry : *dictionary) bytes += memoryOfEntry(entry.key, entry.value);
  }
  return bytes;
}

bool SharedDataTable::merge(const Token& token, const PropertyDictionary& values) {
  if (!token) return true;
  const auto found = _entries.find(*token);
  std::size_t bytes = found != _entries.end() ? found->second.bytes : 0;
  for (const auto& entry : values) {
    bytes += memoryOfEntry(entry.key, entry.value);
    const auto* replaced = found != _entries.end() ? found->second.values.find(entry.key) : nullptr;
    if (replaced != nullptr) bytes -= memoryOfEntry(entry.key, *replaced);
  }
  if (bytes > kMaximumBytes) return false;
  auto& changed = found != _entries.end() ? found->second : _entries[*token];
  changed.values.merge(values);
  changed.bytes = bytes;
  return true;
}

void SharedDataTable::removeKey(const Token& token, const std::string& key) {
  if (!token) return;
  const auto found = _entries.find(*token);
  if (found == _entries.end()) return;
  const auto* removed = found->second.values.find(key);
  if (removed == nullptr) return;
  found->second.bytes -= memoryOfEntry(key, *removed);
  found->second.values.remove(key);
}

std::optional<PropertyDictionary> SharedDataTable::values(const Token& token) const {
  if (!token) return std::nullopt;
  const auto found = _entries.find(*token);
  return found != _entries.end() ? std::optional(found->second.values) : std::nullopt;
}

}  // namespace velk
