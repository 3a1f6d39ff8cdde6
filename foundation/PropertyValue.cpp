#include "foundation/PropertyValue.h"

#include <algorithm>
#include <charconv>
#include <cmath>
#include <functional>
#include <limits>

namespace velk {

namespace {

// Below this size comparing the keys one by one is quicker than hashing one.
constexpr std::size_t kEntriesWithoutIndex = 24;
constexpr std::size_t kNotFound = static_cast<std::size_t>(-1);

std::size_t hashOf(std::string_view key) noexcept { return std::hash<std::string_view>{}(key); }

}  // namespace

PropertyArray::PropertyArray(std::initializer_list<PropertyValue> values) {
  if (values.size() != 0) _storage.write().assign(values.begin(), values.end());
}

std::size_t PropertyArray::size() const noexcept {
  const auto* values = _storage.read();
  return values != nullptr ? values->size() : 0;
}

PropertyArray::const_iterator PropertyArray::begin() const noexcept {
  const auto* values = _storage.read();
  return values != nullptr ? values->data() : nullptr;
}

PropertyArray::const_iterator PropertyArray::end() const noexcept { return begin() + size(); }

void PropertyArray::reserve(std::size_t count) { _storage.write().reserve(count); }

void PropertyArray::append(PropertyValue value) { _storage.write().push_back(std::move(value)); }

PropertyValue& PropertyArray::mutableAt(std::size_t index) { return _storage.write()[index]; }

void PropertyArray::removeAt(std::size_t index) {
  auto& values = _storage.write();
  values.erase(values.begin() + static_cast<std::ptrdiff_t>(index));
}

bool PropertyArray::operator==(const PropertyArray& other) const {
  return _storage.sharesWith(other._storage) || std::equal(begin(), end(), other.begin(), other.end());
}

std::size_t PropertyDictionary::Storage::position(std::string_view key) const noexcept {
  if (index.empty()) {
    for (std::size_t number = 0; number < entries.size(); ++number) {
      if (entries[number].key == key) return number;
    }
    return kNotFound;
  }
  const std::size_t mask = index.size() - 1;
  for (std::size_t slot = hashOf(key) & mask;; slot = (slot + 1) & mask) {
    if (index[slot] == 0) return kNotFound;
    if (entries[index[slot] - 1].key == key) return index[slot] - 1;
  }
}

void PropertyDictionary::Storage::insertIntoIndex(std::uint32_t entryNumber) {
  const std::size_t mask = index.size() - 1;
  std::size_t slot = hashOf(entries[entryNumber].key) & mask;
  while (index[slot] != 0) slot = (slot + 1) & mask;
  index[slot] = entryNumber + 1;
}

void PropertyDictionary::Storage::rebuildIndex() {
  index.clear();
  if (entries.size() <= kEntriesWithoutIndex) return;
  std::size_t slots = 4 * kEntriesWithoutIndex;
  while (slots < 4 * entries.size()) slots *= 2;
  std::size_t powerOfTwo = 1;
  while (powerOfTwo < slots) powerOfTwo *= 2;
  index.assign(powerOfTwo, 0);
  for (std::uint32_t number = 0; number < entries.size(); ++number) insertIntoIndex(number);
}

void PropertyDictionary::Storage::append(std::string key, PropertyValue value) {
  entries.push_back(Entry{std::move(key), std::move(value)});
  if (entries.size() <= kEntriesWithoutIndex) return;
  if (index.empty() || index.size() < 2 * entries.size()) {
    rebuildIndex();
  } else {
    insertIntoIndex(static_cast<std::uint32_t>(entries.size() - 1));
  }
}

PropertyDictionary::PropertyDictionary(std::initializer_list<std::pair<std::string_view, PropertyValue>> entries) {
  for (const auto& [key, value] : entries) set(key, value);
}

std::size_t PropertyDictionary::size() const noexcept {
  const auto* storage = _storage.read();
  return storage != nullptr ? storage->entries.size() : 0;
}

PropertyDictionary::const_iterator PropertyDictionary::begin() const noexcept {
  const auto* storage = _storage.read();
  return storage != nullptr ? storage->entries.data() : nullptr;
}

PropertyDictionary::const_iterator PropertyDictionary::end() const noexcept { return begin() + size(); }

const PropertyValue* PropertyDictionary::find(std::string_view key) const noexcept {
  const auto* storage = _storage.read();
  if (storage == nullptr) return nullptr;
  const std::size_t position = storage->position(key);
  return position != kNotFound ? &storage->entries[position].value : nullptr;
}

PropertyValue* PropertyDictionary::findMutable(std::string_view key) {
  const auto* shared = _storage.read();
  if (shared == nullptr) return nullptr;
  const std::size_t position = shared->position(key);
  return position != kNotFound ? &_storage.write().entries[position].value : nullptr;
}

void PropertyDictionary::set(std::string_view key, PropertyValue value) {
  auto& storage = _storage.write();
  const std::size_t position = storage.position(key);
  if (position != kNotFound) {
    storage.entries[position].value = std::move(value);
  } else {
    storage.append(std::string(key), std::move(value));
  }
}

void PropertyDictionary::appendUnique(std::string key, PropertyValue value) {
  _storage.write().append(std::move(key), std::move(value));
}

bool PropertyDictionary::remove(std::string_view key) {
  const auto* shared = _storage.read();
  if (shared == nullptr) return false;
  const std::size_t position = shared->position(key);
  if (position == kNotFound) return false;
  auto& storage = _storage.write();
  storage.entries.erase(storage.entries.begin() + static_cast<std::ptrdiff_t>(position));
  storage.rebuildIndex();
  return true;
}

void PropertyDictionary::merge(const PropertyDictionary& other) {
  if (other.empty()) return;
  if (empty()) {
    *this = other;
    return;
  }
  // `other` may be part of this dictionary, and go with what it replaces.
  const PropertyDictionary source = other;  // NOLINT(performance-unnecessary-copy-initialization)
  reserve(size() + source.size());
  for (const auto& [key, value] : source) set(key, value);
}

void PropertyDictionary::reserve(std::size_t count) { _storage.write().entries.reserve(count); }

bool PropertyDictionary::operator==(const PropertyDictionary& other) const {
  if (_storage.sharesWith(other._storage)) return true;
  if (size() != other.size()) return false;
  return std::all_of(begin(), end(), [&other](const Entry& entry) {
    const PropertyValue* value = other.find(entry.key);
    return value != nullptr && *value == entry.value;
  });
}

const std::string* PropertyDictionary::string(std::string_view key) const noexcept {
  const PropertyValue* value = find(key);
  return value != nullptr ? value->string() : nullptr;
}

const PropertyDictionary* PropertyDictionary::dictionary(std::string_view key) const noexcept {
  const PropertyValue* value = find(key);
  return value != nullptr ? value->dictionary() : nullptr;
}

const PropertyArray* PropertyDictionary::array(std::string_view key) const noexcept {
  const PropertyValue* value = find(key);
  return value != nullptr ? value->array() : nullptr;
}

namespace {

std::string_view withoutLeadingBlanks(std::string_view text) noexcept {
  const std::size_t start = text.find_first_not_of(" \t\n\r\f\v");
  return start == std::string_view::npos ? std::string_view{} : text.substr(start);
}

std::int64_t truncated(double value) noexcept {
  if (std::isnan(value)) return 0;
  if (value >= 9223372036854775808.0) return std::numeric_limits<std::int64_t>::max();
  if (value <= -9223372036854775808.0) return std::numeric_limits<std::int64_t>::min();
  return static_cast<std::int64_t>(value);
}

std::int64_t leadingInteger(std::string_view text) noexcept {
  text = withoutLeadingBlanks(text);
  if (!text.empty() && text.front() == '+') {
    text.remove_prefix(1);
    if (!text.empty() && text.front() == '-') return 0;
  }
  std::int64_t value = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value);
  if (error != std::errc::result_out_of_range) return value;
  return text.front() == '-' ? std::numeric_limits<std::int64_t>::min() : std::numeric_limits<std::int64_t>::max();
}

bool startsTrue(std::string_view text) noexcept {
  text = withoutLeadingBlanks(text);
  if (!text.empty() && (text.front() == '+' || text.front() == '-')) text.remove_prefix(1);
  while (!text.empty() && text.front() == '0') text.remove_prefix(1);
  if (text.empty()) return false;
  const char first = text.front();
  return first == 'Y' || first == 'y' || first == 'T' || first == 't' || (first >= '1' && first <= '9');
}

}  // namespace

std::int64_t integerValue(const PropertyValue* value) noexcept {
  if (value == nullptr) return 0;
  if (const auto* integer = value->integer()) return *integer;
  if (const auto* boolean = value->boolean()) return *boolean ? 1 : 0;
  if (const auto* large = value->unsignedInteger()) return static_cast<std::int64_t>(*large);
  if (const auto* real = value->real()) return truncated(*real);
  if (const auto* string = value->string()) return leadingInteger(*string);
  return 0;
}

bool booleanValue(const PropertyValue* value) noexcept {
  if (value == nullptr) return false;
  if (const auto* boolean = value->boolean()) return *boolean;
  if (const auto* real = value->real()) return *real != 0;
  if (const auto* string = value->string()) return startsTrue(*string);
  return value->isNumber() && (value->integer() == nullptr || *value->integer() != 0);
}

double doubleValue(const PropertyValue* value) noexcept {
  if (value == nullptr) return 0;
  if (const auto* real = value->real()) return *real;
  if (const auto* large = value->unsignedInteger()) return static_cast<double>(*large);
  if (const auto* string = value->string()) {
    std::string_view text = withoutLeadingBlanks(*string);
    if (!text.empty() && text.front() == '+') text.remove_prefix(1);
    double number = 0;
    std::from_chars(text.data(), text.data() + text.size(), number);
    return number;
  }
  return static_cast<double>(integerValue(value));
}

}  // namespace velk
