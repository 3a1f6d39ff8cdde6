// A dictionary as one line of JSON, whatever it holds: for records that must not be lost over a single odd value, and
// that are read by programs which trust a line to be a line.
#pragma once

#include <string>

#include "foundation/PropertyValue.h"

namespace velk::json {

/// Valid JSON (RFC 8259) in insertion order. Dates and byte data are tagged as `Extensions::tagged` tags them; numbers
/// that are not finite and text that is not UTF-8 become null, entries whose key is not UTF-8 are left out. Control
/// characters and line separators are escaped, those included that JSON lets stand.
[[nodiscard]] std::string line(const PropertyDictionary& dictionary);

}  // namespace velk::json
