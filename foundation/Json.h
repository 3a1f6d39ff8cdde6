// Property values as JSON (RFC 8259). Writing is on the path of every post; reading serves the tools.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "foundation/Error.h"
#include "foundation/PropertyValue.h"

namespace velk::json {

/// What to do with dates and byte data, for which JSON has no form.
enum class Extensions {
  refuse,  ///< the value cannot be written
  tagged,  ///< {"$date": seconds}, {"$data": "base64"}: read back as what they were
};

/// Writes compactly, in insertion order: doubles in the shortest form that reads back the same, integral ones with
/// ".0"; "/" is not escaped; text is UTF-8 as it is. Fails (false, `out` is then of no use) on a number that is not
/// finite, on text that is not UTF-8, and on dates and data unless they are `tagged`. Appends to `out`.
[[nodiscard]] bool write(const PropertyValue& value, std::string& out, Extensions extensions = Extensions::refuse);
/// The same without wrapping the dictionary in a value first.
[[nodiscard]] bool write(const PropertyDictionary& value, std::string& out, Extensions extensions = Extensions::refuse);

/// As `write`, for people: indented by two blanks, one entry a line.
[[nodiscard]] bool writePretty(const PropertyValue& value, std::string& out,
                               Extensions extensions = Extensions::refuse);

/// Appends compact JSON in the form of `writePretty`, without walking the value again. `compact` is what `write` wrote.
void appendPretty(std::string_view compact, std::string& out);

/// Reads one JSON value (nothing but white space may follow). Integers become integers, other numbers doubles; of a
/// key given twice the last value counts. Containers nest at most 64 deep. The error names the byte offset.
[[nodiscard]] Result<PropertyValue> parse(std::string_view text, Extensions extensions = Extensions::refuse);

}  // namespace velk::json
