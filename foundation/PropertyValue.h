// The value type of the system: what clients send, what storebags hold, what events are made of.
// Session info, user info, messages, storebags, event dictionaries and shared data are property dictionaries.
// Values are copied freely: arrays and dictionaries share their contents until one copy writes.
// A value object is used by one thread at a time; copies on different threads may share contents safely.
// When memory is short, what makes or changes contents throws std::bad_alloc, as the standard containers do.
#pragma once

#include <cstddef>
#include <cstdint>
#include <initializer_list>
#include <optional>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>
#include <variant>
#include <vector>

#include "foundation/Export.h"
#include "foundation/SharedStorage.h"

namespace velk {

class PropertyValue;

/// A moment, in seconds since 1970 (UTC), with fractions.
struct Date {
  double secondsSince1970 = 0;
  bool operator==(const Date&) const = default;
};

using ByteData = std::vector<std::uint8_t>;

/// An ordered list of values.
class VELK_EXPORT PropertyArray {
 public:
  using const_iterator = const PropertyValue*;

  PropertyArray() noexcept = default;
  PropertyArray(std::initializer_list<PropertyValue> values);

  [[nodiscard]] std::size_t size() const noexcept;
  [[nodiscard]] bool empty() const noexcept { return size() == 0; }
  [[nodiscard]] const_iterator begin() const noexcept;
  [[nodiscard]] const_iterator end() const noexcept;
  [[nodiscard]] const PropertyValue& operator[](std::size_t index) const noexcept;

  void reserve(std::size_t count);
  void append(PropertyValue value);
  /// The element for writing; `index` must be below `size()`.
  [[nodiscard]] PropertyValue& mutableAt(std::size_t index);
  /// Removes the element at `index`, which must be below `size()`.
  void removeAt(std::size_t index);
  void clear() noexcept { _storage = {}; }

  bool operator==(const PropertyArray& other) const;

 private:
  SharedStorage<std::vector<PropertyValue>> _storage;
};

/// A string-keyed map that keeps the order of insertion: that order is what every enumeration shows.
class VELK_EXPORT PropertyDictionary {
 public:
  struct Entry;
  using const_iterator = const Entry*;

  PropertyDictionary() noexcept = default;
  PropertyDictionary(std::initializer_list<std::pair<std::string_view, PropertyValue>> entries);

  [[nodiscard]] std::size_t size() const noexcept;
  [[nodiscard]] bool empty() const noexcept { return size() == 0; }
  [[nodiscard]] const_iterator begin() const noexcept;
  [[nodiscard]] const_iterator end() const noexcept;

  /// The value under `key`, or null. Allocates nothing. Valid until the dictionary is next changed.
  [[nodiscard]] const PropertyValue* find(std::string_view key) const noexcept;
  [[nodiscard]] bool contains(std::string_view key) const noexcept { return find(key) != nullptr; }
  /// The value under `key` for writing, or null.
  [[nodiscard]] PropertyValue* findMutable(std::string_view key);

  /// Replaces the value under `key` in its place, or appends it.
  void set(std::string_view key, PropertyValue value);
  /// Appends without looking for the key first. The caller knows that the key is not there (decoders check it).
  void appendUnique(std::string key, PropertyValue value);
  /// Removes the entry; the others keep their order. False when there was none.
  bool remove(std::string_view key);
  /// Sets every entry of `other`, in its order: later values replace earlier ones.
  void merge(const PropertyDictionary& other);
  void reserve(std::size_t count);
  void clear() noexcept { _storage = {}; }

  /// Equal when both hold the same keys with equal values, in whatever order.
  bool operator==(const PropertyDictionary& other) const;
  /// True when both share one storage, that is, when comparing them would be a waste.
  [[nodiscard]] bool sharesStorageWith(const PropertyDictionary& other) const noexcept {
    return _storage.sharesWith(other._storage);
  }

  // The convenience getters below answer nothing when the key is absent or its value is of another type.
  [[nodiscard]] const std::string* string(std::string_view key) const noexcept;
  [[nodiscard]] const PropertyDictionary* dictionary(std::string_view key) const noexcept;
  [[nodiscard]] const PropertyArray* array(std::string_view key) const noexcept;

 private:
  struct Storage {
    std::vector<Entry> entries;
    // Open-addressed table of entry numbers plus one (0: free slot); empty while a walk is quicker.
    std::vector<std::uint32_t> index;
    [[nodiscard]] std::size_t position(std::string_view key) const noexcept;
    void append(std::string key, PropertyValue value);
    void rebuildIndex();
    void insertIntoIndex(std::uint32_t entryNumber);
  };
  SharedStorage<Storage> _storage;
};

/// One value: nothing, a boolean, an integer of 64 bits with or without sign, a double, a date, text, byte data,
/// an array or a dictionary. Integers that fit into 63 bits are always held as signed ones, so that equal
/// numbers are equal values; booleans stay booleans.
class PropertyValue {
 public:
  enum class Type : std::uint8_t {
    null,
    boolean,
    integer,
    unsignedInteger,
    real,
    date,
    string,
    data,
    array,
    dictionary
  };

  PropertyValue() noexcept = default;
  PropertyValue(std::nullptr_t) noexcept {}
  template <class Integer, std::enable_if_t<std::is_integral_v<Integer>, int> = 0>
  PropertyValue(Integer value) noexcept {
    if constexpr (std::is_same_v<Integer, bool>) {
      _value = value;
    } else if constexpr (std::is_unsigned_v<Integer> && sizeof(Integer) == 8) {
      if (value <= static_cast<Integer>(INT64_MAX)) {
        _value = static_cast<std::int64_t>(value);
      } else {
        _value = static_cast<std::uint64_t>(value);
      }
    } else {
      _value = static_cast<std::int64_t>(value);
    }
  }
  PropertyValue(double value) noexcept : _value(value) {}
  PropertyValue(Date value) noexcept : _value(value) {}
  PropertyValue(std::string value) noexcept : _value(std::move(value)) {}
  PropertyValue(std::string_view value) : _value(std::string(value)) {}
  PropertyValue(const char* value) : _value(std::string(value)) {}
  PropertyValue(ByteData value) noexcept : _value(std::move(value)) {}
  PropertyValue(PropertyArray value) noexcept : _value(std::move(value)) {}
  PropertyValue(PropertyDictionary value) noexcept : _value(std::move(value)) {}

  [[nodiscard]] Type type() const noexcept { return static_cast<Type>(_value.index()); }
  [[nodiscard]] bool isNull() const noexcept { return type() == Type::null; }
  [[nodiscard]] bool isNumber() const noexcept { return type() >= Type::boolean && type() <= Type::real; }

  // Each answers null when the value is of another type.
  [[nodiscard]] const bool* boolean() const noexcept { return std::get_if<bool>(&_value); }
  [[nodiscard]] const std::int64_t* integer() const noexcept { return std::get_if<std::int64_t>(&_value); }
  [[nodiscard]] const std::uint64_t* unsignedInteger() const noexcept { return std::get_if<std::uint64_t>(&_value); }
  [[nodiscard]] const double* real() const noexcept { return std::get_if<double>(&_value); }
  [[nodiscard]] const Date* date() const noexcept { return std::get_if<Date>(&_value); }
  [[nodiscard]] const std::string* string() const noexcept { return std::get_if<std::string>(&_value); }
  [[nodiscard]] const ByteData* data() const noexcept { return std::get_if<ByteData>(&_value); }
  [[nodiscard]] const PropertyArray* array() const noexcept { return std::get_if<PropertyArray>(&_value); }
  [[nodiscard]] const PropertyDictionary* dictionary() const noexcept {
    return std::get_if<PropertyDictionary>(&_value);
  }
  [[nodiscard]] PropertyArray* array() noexcept { return std::get_if<PropertyArray>(&_value); }
  [[nodiscard]] PropertyDictionary* dictionary() noexcept { return std::get_if<PropertyDictionary>(&_value); }

  bool operator==(const PropertyValue& other) const = default;

 private:
  std::variant<std::monostate, bool, std::int64_t, std::uint64_t, double, Date, std::string, ByteData, PropertyArray,
               PropertyDictionary>
      _value;
};

struct PropertyDictionary::Entry {
  std::string key;
  PropertyValue value;
};

inline const PropertyValue& PropertyArray::operator[](std::size_t index) const noexcept { return begin()[index]; }

// Lenient readings, one rule for messages, storebags and suites. Doubles truncate toward zero, booleans are 0 and
// 1, strings give their leading digits (after blanks, with a sign), everything else and nothing gives 0. Doubles and
// digits outside 64 bits stay at the nearest bound; unsigned integers above 2^63-1 give their low bits, and so a number
// below 0. Callers cut the result to the width that they need.
[[nodiscard]] VELK_EXPORT std::int64_t integerValue(const PropertyValue* value) noexcept;
[[nodiscard]] inline std::int64_t integerValue(const PropertyValue& value) noexcept { return integerValue(&value); }
/// Numbers are true when they are not zero; strings when they begin with Y, y, T, t or a digit from 1 to 9 (after
/// blanks, a sign and zeros); nothing and everything else is false.
[[nodiscard]] VELK_EXPORT bool booleanValue(const PropertyValue* value) noexcept;
/// Numbers as they are, strings by their leading number, everything else 0.
[[nodiscard]] VELK_EXPORT double doubleValue(const PropertyValue* value) noexcept;

/// The low 32 bits, as the many 32-bit fields of events and configurations take them.
[[nodiscard]] inline std::int32_t int32Value(const PropertyValue* value) noexcept {
  return static_cast<std::int32_t>(static_cast<std::uint64_t>(integerValue(value)));
}
[[nodiscard]] inline std::uint32_t uint32Value(const PropertyValue* value) noexcept {
  return static_cast<std::uint32_t>(static_cast<std::uint64_t>(integerValue(value)));
}
[[nodiscard]] inline std::uint16_t uint16Value(const PropertyValue* value) noexcept {
  return static_cast<std::uint16_t>(static_cast<std::uint64_t>(integerValue(value)));
}

}  // namespace velk
