#include "backends/ClientEntryMatching.h"

#include <algorithm>
#include <array>

#include "foundation/Format.h"
#include "foundation/Text.h"
#include "unicode/CaseFolding.h"

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

/// The names of a comma-separated value.
PropertyArray namesOf(const std::string& text) {
  PropertyArray names;
  for (const auto name : split(text, ',')) names.append(PropertyValue(name));
  return names;
}

using Test = bool (*)(const PropertyValue&);

bool isText(const PropertyValue& value) { return value.string() != nullptr; }

bool isVersion(const PropertyValue& value) { return isText(value) || (value.isNumber() && value.boolean() == nullptr); }

/// Text counts when a number is read from its beginning.
bool readsAsNumber(const PropertyValue& value) {
  const std::string* text = value.string();
  if (text == nullptr) return value.isNumber();
  const auto first = text->find_first_not_of(" \t+-.");
  return first != std::string::npos && (*text)[first] >= '0' && (*text)[first] <= '9';
}

template <Test isElement>
bool isArrayOf(const PropertyValue& value) {
  const PropertyArray* array = value.array();
  return array != nullptr && std::all_of(array->begin(), array->end(), isElement);
}

/// Whether the value is absent or passes.
bool mayStand(const PropertyDictionary& entry, std::string_view key, Test test) {
  const PropertyValue* value = entry.find(key);
  return value == nullptr || test(*value);
}

bool isCountryThreshold(const PropertyValue& value) {
  const PropertyDictionary* entry = value.dictionary();
  return entry != nullptr && mayStand(*entry, "country", isArrayOf<isText>) &&
         mayStand(*entry, "threshold", readsAsNumber);
}

bool isFilter(const PropertyValue& value) {
  const PropertyDictionary* entry = value.dictionary();
  const PropertyValue* key = entry != nullptr ? entry->find("key") : nullptr;
  if (key == nullptr || !isText(*key)) return false;
  if (!mayStand(*entry, "method", readsAsNumber) || !mayStand(*entry, "status", readsAsNumber)) return false;
  const std::string* action = entry->string("action");
  const bool needsValues = action != nullptr && (*action == "blacklistValues" || *action == "whitelistValues");
  const PropertyValue* values = needsValues ? entry->find("value") : nullptr;
  return !needsValues || (values != nullptr && isArrayOf<isText>(*values));
}

struct Rule {
  const char* key;
  const char* expected;
  Test test;
};

constexpr std::array kChoosingRules{Rule{"client", "a string", isText}, Rule{"service", "a string", isText},
                                    Rule{"enabledSince", "a version", isVersion}};
constexpr std::array kRestrictingRules{
    Rule{"locale_whitelist", "an array of strings", isArrayOf<isText>},
    Rule{"device_whitelist", "an array of strings", isArrayOf<isText>},
    Rule{"device_blacklist", "an array of strings", isArrayOf<isText>},
    Rule{"sampling_threshold", "a number", readsAsNumber},
    Rule{"per_country_sampling_thresholds", "an array of country arrays with their thresholds",
         isArrayOf<isCountryThreshold>},
    Rule{"event_whitelist", "an array of numbers", isArrayOf<readsAsNumber>},
    Rule{"event_blacklist", "an array of numbers", isArrayOf<readsAsNumber>},
    Rule{"use_wifi_only", "a number", readsAsNumber},
};
constexpr Rule kFiltersRule{"filters", "an array of filters, each with a key and the values that its action needs",
                            isArrayOf<isFilter>};

template <class Rules>
std::optional<WrongType> firstBroken(const PropertyDictionary& entry, const Rules& rules) {
  for (const Rule& rule : rules) {
    if (!mayStand(entry, rule.key, rule.test)) return WrongType{rule.key, rule.expected};
  }
  return std::nullopt;
}

}  // namespace

bool matchExactStringWithList(const PropertyArray* list, const std::string* wholeString, bool whitelist) {
  return matchWithList(list, wholeString, whitelist, equalsCaseFolded);
}

bool matchStringWithList(const PropertyArray* list, const std::string* wholeString, bool whitelist) {
  return matchWithList(list, wholeString, whitelist, containsCaseFolded);
}

std::optional<WrongType> wrongTypeOfChoice(const PropertyDictionary& entry) {
  return firstBroken(entry, kChoosingRules);
}

std::optional<WrongType> wrongTypeOfRestriction(const PropertyDictionary& entry) {
  return firstBroken(entry, kRestrictingRules);
}

std::optional<WrongType> wrongTypeOfFilters(const PropertyDictionary& entry) {
  return firstBroken(entry, std::array{kFiltersRule});
}

bool matchClientNameAndServiceID(const PropertyDictionary& entry, const std::string* clientName,
                                 const std::string* serviceID) {
  const auto matches = [&entry](std::string_view key, const std::string* name, auto match) {
    const PropertyValue* names = entry.find(key);
    if (names == nullptr) return true;
    if (names->string() == nullptr) return false;
    const PropertyArray list = namesOf(*names->string());
    return match(&list, name, true);
  };
  return matches("client", clientName, matchExactStringWithList) && matches("service", serviceID, matchStringWithList);
}

bool isFrameworkEnabledForClient(const PropertyDictionary& entry, const DottedVersion& selfVersion) {
  const PropertyValue* since = entry.find("enabledSince");
  if (since == nullptr) return true;
  // A version given as a number reads like its text.
  return isVersion(*since) && parseDottedVersion(description(since)) <= selfVersion;
}

bool containsText(const PropertyArray* list, const std::string* text) {
  if (list == nullptr || text == nullptr) return false;
  return std::any_of(list->begin(), list->end(), [text](const PropertyValue& element) {
    const std::string* candidate = element.string();
    return candidate != nullptr && *candidate == *text;
  });
}

}  // namespace velk
