// The payload filters of a client entry: which keys leave the device, and which only hashed. Owned by an HTTPS post
// backend and used on its session's queue.
#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string_view>
#include <vector>

#include "foundation/PropertyValue.h"
#include "unicode/CaseFolding.h"

namespace velk {

enum class FilterAction : std::uint8_t { none, remove, sha256, blacklistValues, whitelistValues };

struct FilterRecord {
  std::int32_t method = -1;  ///< -1: every method
  std::int32_t status = -1;  ///< -1: every status
  FilterAction action = FilterAction::none;
  std::optional<FoldedText> key;   ///< none: no key matches
  std::vector<FoldedText> values;  ///< the texts among the action's argument
};

class EventFilter {
 public:
  /// Replaces the records; an empty array keeps them as they are. Elements that are no dictionaries match nothing.
  void createFiltersFromArray(const PropertyArray& filters);
  [[nodiscard]] std::size_t size() const noexcept { return _records.size(); }

  /// Applies to each key the first record that matches it, in place. The event's own "_method" and "_status" decide
  /// which records apply.
  void apply(PropertyDictionary& event) const;

 private:
  /// Whether some record may match: its key is as long, or letters of the key may fold to others.
  [[nodiscard]] bool mayMatch(std::string_view key) const noexcept {
    return ((_keySizes >> sizeBit(key)) & 1U) != 0 || !isAscii(key);
  }
  [[nodiscard]] static std::size_t sizeBit(std::string_view key) noexcept {
    return std::min<std::size_t>(key.size(), 63);
  }

  std::vector<FilterRecord> _records;
  std::uint64_t _keySizes = 0;  ///< a bit for each size of a folded key
};

}  // namespace velk
