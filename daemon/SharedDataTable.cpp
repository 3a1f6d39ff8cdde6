#include "daemon/SharedDataTable.h"

#include "backends/MemoryEstimate.h"

namespace velk {

bool SharedDataTable::merge(const Token& token, const PropertyDictionary& values) {
  if (!token) return true;
  auto merged = this->values(token).value_or(PropertyDictionary());
  merged.merge(values);
  if (memoryEstimate(merged) > kMaximumBytes) return false;
  _values[*token] = std::move(merged);
  return true;
}

void SharedDataTable::removeKey(const Token& token, const std::string& key) {
  if (!token) return;
  const auto found = _values.find(*token);
  if (found != _values.end()) found->second.remove(key);
}

std::optional<PropertyDictionary> SharedDataTable::values(const Token& token) const {
  if (!token) return std::nullopt;
  const auto found = _values.find(*token);
  return found != _values.end() ? std::optional(found->second) : std::nullopt;
}

}  // namespace velk
