// The arrays that a configuration reply is made of.
#include <algorithm>
#include <unordered_set>
#include <vector>

#include "session/SessionBackends.h"

namespace velk {

namespace {

// Backends compare categories as 32-bit numbers, so that is what makes two elements the same.
using Categories = std::unordered_set<std::int32_t>;

Categories categoriesOf(const PropertyArray& events) {
  Categories categories;
  for (const PropertyValue& event : events) categories.insert(int32Value(&event));
  return categories;
}

}  // namespace

std::optional<PropertyArray> fetchReportingStates(const SessionBackends* backends) {
  if (backends == nullptr) return std::nullopt;
  PropertyArray names;
  for (const auto& entry : *backends) {
    if (entry.backend->state() == kBackendEnabled) names.append(entry.name);
  }
  return names;
}

std::optional<PropertyArray> fetchWhitelistedEvents(const SessionBackends* backends) {
  if (backends == nullptr || backends->empty()) return std::nullopt;
  PropertyArray united;
  Categories seen;
  for (const auto& entry : *backends) {
    const auto whitelist = entry.backend->eventWhitelist();
    if (!whitelist) {
      if (entry.backend->isHTTPSPostBackend() && entry.backend->state() == kBackendEnabled) return std::nullopt;
      continue;
    }
    for (const PropertyValue& event : *whitelist) {
      if (seen.insert(int32Value(&event)).second) united.append(event);
    }
  }
  return united;
}

std::optional<PropertyArray> fetchBlacklistedEvents(const SessionBackends* backends) {
  if (backends == nullptr) return std::nullopt;
  std::optional<PropertyArray> first;
  std::vector<Categories> others;
  for (const auto& entry : *backends) {
    if (!entry.backend->isHTTPSPostBackend()) continue;
    auto blacklist = entry.backend->eventBlacklist();
    if (!blacklist) continue;
    if (first) {
      others.push_back(categoriesOf(*blacklist));
    } else {
      first = std::move(blacklist);
    }
  }
  if (!first) return std::nullopt;
  PropertyArray common;
  Categories seen;
  for (const PropertyValue& event : *first) {
    const std::int32_t category = int32Value(&event);
    const bool everywhere = std::all_of(others.begin(), others.end(), [category](const Categories& categories) {
      return categories.count(category) != 0;
    });
    if (everywhere && seen.insert(category).second) common.append(event);
  }
  return common;
}

}  // namespace velk
