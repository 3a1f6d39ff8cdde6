// Takes the values of a call or a reply one by one, each as the type that the method wants. Private to ipc/.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <utility>

#include "foundation/Error.h"
#include "foundation/PropertyValue.h"

namespace velk::ipc {

/// Values that do not fit make the whole reading unsound; what is returned for them is of no use. Moves out of
/// `values`, which must outlive it.
class ArgumentReader {
 public:
  ArgumentReader(PropertyValue* values, std::size_t count) noexcept : _values(values), _count(count) {}

  [[nodiscard]] PropertyDictionary dictionary() {
    return take<PropertyDictionary>(false).value_or(PropertyDictionary());
  }
  [[nodiscard]] std::optional<PropertyDictionary> optionalDictionary() { return take<PropertyDictionary>(true); }
  [[nodiscard]] PropertyArray array() { return take<PropertyArray>(false).value_or(PropertyArray()); }
  [[nodiscard]] std::optional<PropertyArray> optionalArray() { return take<PropertyArray>(true); }
  [[nodiscard]] std::string text() { return take<std::string>(false).value_or(std::string()); }
  [[nodiscard]] std::optional<std::string> optionalText() { return take<std::string>(true); }
  /// Byte data, or text taken as its bytes.
  [[nodiscard]] ByteData bytes();
  /// Byte data or text, as a string of bytes.
  [[nodiscard]] std::string byteString();
  [[nodiscard]] bool boolean() { return take<bool>(false).value_or(false); }
  /// Any integer, or a double.
  [[nodiscard]] double real();
  /// An integer that fits; numbers are never cut on the wire.
  template <class Integer>
  [[nodiscard]] Integer integer() {
    const auto value = take<std::int64_t>(false).value_or(0);
    if (!std::in_range<Integer>(value)) _sound = false;
    return static_cast<Integer>(value);
  }
  /// Anything; null is none.
  [[nodiscard]] std::optional<PropertyValue> optionalValue();
  /// An error as [domain, code, description], or null.
  [[nodiscard]] std::optional<Error> optionalError();

  /// All values were there, none was left, and each had its type.
  [[nodiscard]] bool isSound() const noexcept { return _sound && _next == _count; }

 private:
  [[nodiscard]] PropertyValue* next() noexcept {
    if (_next < _count) return &_values[_next++];
    _sound = false;
    return nullptr;
  }
  template <class Value>
  [[nodiscard]] static Value* contentOf(PropertyValue& value) noexcept {
    const Value* content = nullptr;
    if constexpr (std::is_same_v<Value, PropertyDictionary>) content = std::as_const(value).dictionary();
    if constexpr (std::is_same_v<Value, PropertyArray>) content = std::as_const(value).array();
    if constexpr (std::is_same_v<Value, std::string>) content = value.string();
    if constexpr (std::is_same_v<Value, bool>) content = value.boolean();
    if constexpr (std::is_same_v<Value, std::int64_t>) content = value.integer();
    // The value is not constant: only its getters are.
    return const_cast<Value*>(content);
  }
  template <class Value>
  [[nodiscard]] std::optional<Value> take(bool mayBeAbsent) {
    auto* value = next();
    if (value == nullptr || (mayBeAbsent && value->isNull())) return std::nullopt;
    if (auto* content = contentOf<Value>(*value)) return std::move(*content);
    _sound = false;
    return std::nullopt;
  }

  PropertyValue* const _values;
  const std::size_t _count;
  std::size_t _next = 0;
  bool _sound = true;
};

}  // namespace velk::ipc
