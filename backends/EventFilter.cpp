#include "backends/EventFilter.h"

#include <algorithm>
#include <string>
#include <utility>

#include "backends/VelkReportingBackend.h"

namespace velk {

namespace {

FilterAction actionNamed(const std::string* word) {
  if (word == nullptr) return FilterAction::none;
  if (*word == "remove") return FilterAction::remove;
  if (*word == "sha256") return FilterAction::sha256;
  if (*word == "blacklistValues") return FilterAction::blacklistValues;
  if (*word == "whitelistValues") return FilterAction::whitelistValues;
  return FilterAction::none;
}

std::int32_t numberOrEvery(const PropertyValue* value) { return value != nullptr ? int32Value(value) : -1; }

std::optional<FoldedText> keyOf(const PropertyDictionary& entry) {
  const std::string* key = entry.string("key");
  return key != nullptr ? std::optional<FoldedText>(*key) : std::nullopt;
}

std::vector<FoldedText> valuesOf(const PropertyDictionary& entry) {
  std::vector<FoldedText> values;
  const PropertyArray* list = entry.array("value");
  if (list == nullptr) return values;
  for (const PropertyValue& element : *list) {
    if (const std::string* text = element.string()) values.emplace_back(*text);
  }
  return values;
}

FilterRecord recordOf(const PropertyValue& filter) {
  const PropertyDictionary* entry = filter.dictionary();
  if (entry == nullptr) return {};
  return FilterRecord{numberOrEvery(entry->find("method")), numberOrEvery(entry->find("status")),
                      actionNamed(entry->string("action")), keyOf(*entry), valuesOf(*entry)};
}

/// Whether the value is text that contains one of the record's values.
bool holdsListedValue(const FilterRecord& record, const PropertyValue& value) {
  const std::string* text = value.string();
  if (text == nullptr) return false;
  Foldable foldable(*text);
  return std::any_of(record.values.begin(), record.values.end(),
                     [&foldable](const FoldedText& part) { return foldable.contains(part); });
}

bool removesKey(const FilterRecord& record, const PropertyValue& value) {
  switch (record.action) {
    case FilterAction::remove:
      return true;
    case FilterAction::sha256:
      // Never plain where a hash was promised.
      return value.string() == nullptr;
    case FilterAction::blacklistValues:
      return holdsListedValue(record, value);
    case FilterAction::whitelistValues:
      return !holdsListedValue(record, value);
    case FilterAction::none:
      break;
  }
  return false;
}

void act(const FilterRecord& record, std::string_view key, PropertyDictionary& event) {
  const PropertyValue* value = event.find(key);
  if (removesKey(record, *value)) {
    event.remove(key);
  } else if (record.action == FilterAction::sha256) {
    event.set(key, VelkReportingBackend::convertIntoSHA256(*value->string()));
  }
}

}  // namespace

void EventFilter::createFiltersFromArray(const PropertyArray& filters) {
  if (filters.empty()) return;
  _records.clear();
  _records.reserve(filters.size());
  _keySizes = 0;
  for (const PropertyValue& filter : filters) {
    _records.push_back(recordOf(filter));
    const auto& key = _records.back().key;
    if (key) _keySizes |= std::uint64_t{1} << sizeBit(key->folded());
  }
}

void EventFilter::apply(PropertyDictionary& event) const {
  if (_records.empty()) return;
  const std::int32_t method = int32Value(event.find("_method"));
  const std::int32_t status = int32Value(event.find("_status"));
  const auto applies = [&](const FilterRecord& record, Foldable& key) {
    return record.key && key.equals(*record.key) && (record.method < 0 || record.method == method) &&
           (record.status < 0 || record.status == status);
  };
  // First find, then act: acting moves the entries.
  std::vector<std::pair<std::string, const FilterRecord*>> matches;
  for (const auto& entry : event) {
    if (!mayMatch(entry.key)) continue;
    Foldable key(entry.key);
    for (const FilterRecord& record : _records) {
      if (!applies(record, key)) continue;
      if (record.action != FilterAction::none) matches.emplace_back(entry.key, &record);
      break;
    }
  }
  for (const auto& match : matches) act(*match.second, match.first, event);
}

}  // namespace velk
