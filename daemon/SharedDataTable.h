// What the sessions of each hierarchy share: values that one of them set and that travel with the messages of all.
// Part of the agent, whose lock guards every call.
#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <optional>
#include <string>

#include "foundation/PropertyValue.h"

namespace velk {

/// Without a token every operation does nothing. A change costs what it changes, whatever else the hierarchy holds;
/// while a reader still holds the result of `values`, the next change copies the dictionary first.
class SharedDataTable {
 public:
  using Token = std::optional<std::string>;

  /// Far more than fits into an event: what all clients of a hierarchy may keep here together, by `memoryOf`.
  static constexpr std::uint32_t kMaximumBytes = 1024 * 1024;

  /// Later values replace earlier ones under the same key. An empty dictionary makes the hierarchy's as well.
  /// False: the hierarchy's data would exceed the bound, and stay as they were.
  [[nodiscard]] bool merge(const Token& token, const PropertyDictionary& values);
  void removeKey(const Token& token, const std::string& key);
  [[nodiscard]] std::optional<PropertyDictionary> values(const Token& token) const;
  /// The hierarchy has ended.
  void drop(const std::string& token) { _entries.erase(token); }

  /// Bytes of memory that a value takes, with everything in it: its length, that of its keys, and what the system
  /// needs to keep each of them.
  [[nodiscard]] static std::size_t memoryOf(const PropertyValue& value) noexcept;

 private:
  struct Entry {
    PropertyDictionary values;
    std::size_t bytes = 0;
  };
  std::map<std::string, Entry, std::less<>> _entries;
};

}  // namespace velk
