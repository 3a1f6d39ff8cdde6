// The words of the dashboard: the key=value text that a datagram carries, and the line that shows a datagram in a log.
#pragma once

#include <cstdint>
#include <span>
#include <string>
#include <string_view>

#include "foundation/PropertyValue.h"

namespace velk {

/// A text or a number in words (booleans are 1 and 0); "null" for everything else.
[[nodiscard]] std::string descriptionForObject(const PropertyValue& value);

/// Without line breaks; backslashes doubled, then "=" escaped by one. What is left empty becomes "empty".
[[nodiscard]] std::string sanitize(std::string_view text);

/// " key=value" for each entry, those with the shortest values first (among equals in the payload's order), so that
/// the cut at 1023 bytes takes the longest.
[[nodiscard]] std::string keyValueText(const PropertyDictionary& payload);

/// A built datagram on one line of at most 1151 bytes; empty when it is shorter than its header. The component's code
/// is looked up as it comes: what the table does not know reads "Unknown".
[[nodiscard]] std::string writeLocalLog(std::span<const std::uint8_t> datagram);

}  // namespace velk
