// Which client entry of a storebag section applies to a session: matching of names, countries, devices and versions.
// Used by the HTTPS post backend's configuration. A restricting value of the wrong type makes the entry apply
// to nothing: a mistake in a storebag reports too little, never too much. Any thread;
// nothing is kept.
#pragma once

#include <optional>
#include <string>

#include "backends/DottedVersion.h"
#include "foundation/PropertyValue.h"

namespace velk {

/// Whether some element equals the text, without regard to case. An absent or empty list answers `whitelist`, an
/// absent text the opposite: nothing can be compared then.
[[nodiscard]] bool matchExactStringWithList(const PropertyArray* list, const std::string* wholeString, bool whitelist);

/// The same with "contains" for "equals": "us" matches both "US" and "Russia".
[[nodiscard]] bool matchStringWithList(const PropertyArray* list, const std::string* wholeString, bool whitelist);

/// A value of an entry, and what it should have been.
struct WrongType {
  const char* key;
  const char* expected;
};

/// The first value of the wrong type among those that choose the entry: "client", "service", "enabledSince".
[[nodiscard]] std::optional<WrongType> wrongTypeOfChoice(const PropertyDictionary& entry);
/// The same among those that restrict what a chosen entry reports: lists, their elements, numbers.
[[nodiscard]] std::optional<WrongType> wrongTypeOfRestriction(const PropertyDictionary& entry);
/// The same for "filters": a filter without a key, or with values that its action cannot use, would never act.
[[nodiscard]] std::optional<WrongType> wrongTypeOfFilters(const PropertyDictionary& entry);

/// Whether the entry's "client" names the client and its "service" a part of the service. An entry without them is for
/// everybody, one with names that are no text matches no client. Blanks around the commas belong to the names.
[[nodiscard]] bool matchClientNameAndServiceID(const PropertyDictionary& entry, const std::string* clientName,
                                               const std::string* serviceID);

/// Whether the daemon's own version has reached the entry's "enabledSince". Never that of something that is no version.
[[nodiscard]] bool isFrameworkEnabledForClient(const PropertyDictionary& entry, const DottedVersion& selfVersion);

/// Whether the list holds exactly this text.
[[nodiscard]] bool containsText(const PropertyArray* list, const std::string* text);

}  // namespace velk
