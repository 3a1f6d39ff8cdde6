// Which client entry of a storebag section applies to a session: matching of names, countries, devices and versions.
// Used by the HTTPS post backend's configuration. Values of the wrong type count as absent and list elements of the
// wrong type match nothing, so that no storebag can do harm. Any thread; nothing is kept.
#pragma once

#include <string>
#include <string_view>

#include "backends/DottedVersion.h"
#include "foundation/PropertyValue.h"

namespace velk {

/// Whether some element equals the text, without regard to case. An absent or empty list answers `whitelist`, an
/// absent text the opposite: nothing can be compared then.
[[nodiscard]] bool matchExactStringWithList(const PropertyArray* list, const std::string* wholeString, bool whitelist);

/// The same with "contains" for "equals": "us" matches both "US" and "Russia".
[[nodiscard]] bool matchStringWithList(const PropertyArray* list, const std::string* wholeString, bool whitelist);

/// Whether the entry's "client" names the client and its "service" a part of the service. An entry without them is for
/// everybody. Blanks around the commas belong to the names.
[[nodiscard]] bool matchClientNameAndServiceID(const PropertyDictionary& entry, const std::string* clientName,
                                               const std::string* serviceID);

/// Whether the daemon's own version has reached the entry's "enabledSince".
[[nodiscard]] bool isFrameworkEnabledForClient(const PropertyDictionary& entry, const DottedVersion& selfVersion);

/// Whether the list holds exactly this text.
[[nodiscard]] bool containsText(const PropertyArray* list, const std::string* text);

}  // namespace velk
