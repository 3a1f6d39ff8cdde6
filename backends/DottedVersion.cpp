#include "backends/DottedVersion.h"

#include "foundation/Format.h"
#include "foundation/PropertyValue.h"
#include "foundation/Text.h"

namespace velk {

std::string DottedVersion::minorSuffix() const { return minor == 0 ? std::string() : "." + std::to_string(minor); }

std::string DottedVersion::reportVersion() const { return formatText("%u.%u%@", {major, middle, minorSuffix()}); }

DottedVersion parseDottedVersion(std::string_view text) {
  const auto parts = split(text, '.');
  const auto component = [&parts](std::size_t number) {
    return number < parts.size() ? static_cast<std::uint8_t>(integerValue(PropertyValue(parts[number])))
                                 : std::uint8_t{0};
  };
  return DottedVersion{component(0), component(1), component(2)};
}

}  // namespace velk
