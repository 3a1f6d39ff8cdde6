#include "client/EventLists.h"

#include <algorithm>

namespace velk {

namespace {

std::vector<std::int64_t> sortedNumbers(const std::optional<PropertyArray>& list) {
  std::vector<std::int64_t> numbers;
  if (!list) return numbers;
  numbers.reserve(list->size());
  for (const auto& element : *list) numbers.push_back(integerValue(element));
  std::sort(numbers.begin(), numbers.end());
  return numbers;
}

}  // namespace

EventLists::EventLists(const std::optional<PropertyArray>& enabledBackends,
                       const std::optional<PropertyArray>& whitelist, const std::optional<PropertyArray>& blacklist)
    : _enabledBackends(enabledBackends.value_or(PropertyArray())),
      _whitelist(sortedNumbers(whitelist)),
      _blacklist(sortedNumbers(blacklist)) {}

bool EventLists::isWhitelisted(std::uint16_t category) const {
  return _whitelist.empty() || std::binary_search(_whitelist.begin(), _whitelist.end(), category);
}

bool EventLists::isBlacklisted(std::uint16_t category) const {
  return std::binary_search(_blacklist.begin(), _blacklist.end(), category);
}

}  // namespace velk
