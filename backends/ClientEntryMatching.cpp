#include "backends/ClientEntryMatching.h"

#include <algorithm>
#include <optional>

#include "foundation/Format.h"
#include "foundation/Text.h"

namespace velk {

namespace {

template <class Matches>
bool matchWithList(const PropertyArray* list, const std::string* wholeString, bool whitelist, Matches matches) {
  if (list == nullptr || list->empty()) return whitelist;
  if (wholeString == nullptr) return !whitelist;
  return std::any_of(list->begin(), list->end(), [&](const PropertyValue& element) {
    const std::string* text = element.string();
    return text != nullptr && matches(*wholeString, *text);
  });
}

/// The names of a comma-separated value; nothing when the entry has none.
std::optional<PropertyArray> namesOf(const PropertyDictionary& entry, std::string_view key) {
  const std::string* text = entry.string(key);
  if (text == nullptr) return std::nullopt;
  PropertyArray names;
  for (const auto name : split(*text, ',')) names.append(PropertyValue(name));
  return names;
}

}  // namespace

bool matchExactStringWithList(const PropertyArray* list, const std::string* wholeString, bool whitelist) {
  return matchWithList(list, wholeString, whitelist, equalsIgnoringCase);
}

bool matchStringWithList(const PropertyArray* list, const std::string* wholeString, bool whitelist) {
  return matchWithList(list, wholeString, whitelist, containsIgnoringCase);
}

bool matchClientNameAndServiceID(const PropertyDictionary& entry, const std::string* clientName,
                                 const std::string* serviceID) {
  const auto clients = namesOf(entry, "client");
  if (!matchExactStringWithList(clients ? &*clients : nullptr, clientName, true)) return false;
  const auto services = namesOf(entry, "service");
  return matchStringWithList(services ? &*services : nullptr, serviceID, true);
}

bool isFrameworkEnabledForClient(const PropertyDictionary& entry, const DottedVersion& selfVersion) {
  const PropertyValue* since = entry.find("enabledSince");
  if (since == nullptr) return true;
  // A version given as a number reads like its text.
  return parseDottedVersion(description(since)) <= selfVersion;
}

bool containsText(const PropertyArray* list, const std::string* text) {
  if (list == nullptr || text == nullptr) return false;
  return std::any_of(list->begin(), list->end(), [text](const PropertyValue& element) {
    const std::string* candidate = element.string();
    return candidate != nullptr && *candidate == *text;
  });
}

}  // namespace velk
