// Text from a format in the printf manner with object placeholders, checked at run time and never at fault:
// the fixed log texts of the system are written in it. Used by the log, the message log and error texts.
#pragma once

#include <cstdint>
#include <initializer_list>
#include <optional>
#include <string>
#include <string_view>
#include <variant>

#include "foundation/Error.h"
#include "foundation/PropertyValue.h"

namespace velk {

/// One argument of a format. Views must outlive the call. Absent texts and values read "(null)".
class FormatArgument {
 public:
  template <class Integer, std::enable_if_t<std::is_integral_v<Integer>, int> = 0>
  FormatArgument(Integer value) noexcept {
    if constexpr (std::is_signed_v<Integer> || std::is_same_v<Integer, bool>) {
      _value = static_cast<std::int64_t>(value);
    } else {
      _value = static_cast<std::uint64_t>(value);
    }
  }
  FormatArgument(double value) noexcept : _value(value) {}
  FormatArgument(std::string_view value) noexcept : _value(value) {}
  FormatArgument(const std::string& value) noexcept : _value(std::string_view(value)) {}
  FormatArgument(const char* value) noexcept {
    if (value != nullptr) _value = std::string_view(value);
  }
  FormatArgument(const std::optional<std::string>& value) noexcept {
    if (value) _value = std::string_view(*value);
  }
  FormatArgument(const std::string* value) noexcept {
    if (value != nullptr) _value = std::string_view(*value);
  }
  FormatArgument(std::nullptr_t) noexcept {}
  FormatArgument(const void* value) noexcept : _value(value) {}
  FormatArgument(const Error& value) : _value(value.description) {}
  FormatArgument(const PropertyValue& value);
  FormatArgument(const PropertyValue* value);
  FormatArgument(const PropertyDictionary& value);
  FormatArgument(const PropertyArray& value);
  FormatArgument(const std::optional<PropertyDictionary>& value);
  FormatArgument(const std::optional<PropertyArray>& value);

 private:
  friend std::string formatText(std::string_view, std::initializer_list<FormatArgument>);
  std::variant<std::monostate, std::int64_t, std::uint64_t, double, std::string_view, std::string, const void*> _value;
};

/// Fills `format` with the arguments in order. Understands %d %i %u %x %X %c %s %@ %f %g %p %% with flags, width,
/// precision and the length modifiers (which are ignored: arguments know their width). %s and %@ take any
/// argument. A placeholder without an argument stays as it is; arguments without a placeholder are ignored.
[[nodiscard]] std::string formatText(std::string_view format, std::initializer_list<FormatArgument> arguments);

/// The value on one line: JSON with everything unprintable escaped, in insertion order. Dates and byte data stand
/// as {"$date": seconds} and {"$data": "base64"}. A null pointer reads "(null)". A bare string is not quoted.
[[nodiscard]] std::string description(const PropertyValue* value);

/// `text` with each control character, line separator of Unicode and byte that is no UTF-8 replaced by an escape (\n,
/// \x1b, \xff ...), so that it cannot begin a new line or steer a terminal, and is text whatever it was.
[[nodiscard]] std::string withoutControlCharacters(std::string_view text);

}  // namespace velk
