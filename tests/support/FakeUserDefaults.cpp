#include "tests/support/FakeUserDefaults.h"

namespace velk::test {

std::optional<PropertyValue> FakeUserDefaults::value(std::string_view key) const {
  ++_reads;
  Guard guard(_lock);
  const auto* found = _values.find(key);
  return found != nullptr ? std::optional(*found) : std::nullopt;
}

PropertyDictionary FakeUserDefaults::allValues() const {
  ++_reads;
  Guard guard(_lock);
  return _values;
}

Result<void> FakeUserDefaults::set(std::string_view key, PropertyValue value) {
  ++_writes;
  if (_failsWrites) return failure("test", 1, "the suite refuses writes");
  put(key, std::move(value));
  return {};
}

Result<void> FakeUserDefaults::remove(std::string_view key) {
  ++_writes;
  if (_failsWrites) return failure("test", 1, "the suite refuses writes");
  Guard guard(_lock);
  _values.remove(key);
  return {};
}

Result<PropertyValue> FakeUserDefaults::valueOrStore(std::string_view key, const std::function<PropertyValue()>& make) {
  Guard guard(_lock);
  if (const auto* found = _values.find(key)) return *found;
  ++_writes;
  if (_failsWrites) return failure("test", 1, "the suite refuses writes");
  auto made = make();
  _values.set(key, made);
  return made;
}

void FakeUserDefaults::put(std::string_view key, PropertyValue value) {
  Guard guard(_lock);
  _values.set(key, std::move(value));
}

void FakeUserDefaults::clear() {
  Guard guard(_lock);
  _values.clear();
}

}  // namespace velk::test
