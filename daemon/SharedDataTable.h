// What the sessions of each hierarchy share: values that one of them set and that travel with the messages of all.
// Part of the agent, whose lock guards every call.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>

#include "foundation/PropertyValue.h"

namespace velk {

/// Without a token every operation does nothing.
class SharedDataTable {
 public:
  using Token = std::optional<std::string>;

  /// Far more than fits into an event: what all clients of a hierarchy may keep here together, roughly in bytes.
  static constexpr std::uint32_t kMaximumBytes = 1024 * 1024;

  /// Later values replace earlier ones under the same key. An empty dictionary makes the hierarchy's as well.
  /// False: the hierarchy's data would exceed the bound, and stay as they were.
  [[nodiscard]] bool merge(const Token& token, const PropertyDictionary& values);
  void removeKey(const Token& token, const std::string& key);
  [[nodiscard]] std::optional<PropertyDictionary> values(const Token& token) const;
  /// The hierarchy has ended.
  void drop(const std::string& token) { _values.erase(token); }

 private:
  std::map<std::string, PropertyDictionary, std::less<>> _values;
};

}  // namespace velk
