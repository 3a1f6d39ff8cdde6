// Property lists in their XML and binary forms.
#pragma once

#include <cstdint>
#include <span>

#include "foundation/Error.h"
#include "foundation/PropertyValue.h"

namespace velk::propertylist {

/// Reads either form. Bounded in size (16 MiB), depth (64) and entries; the error says what is wrong.
[[nodiscard]] Result<PropertyValue> parse(std::span<const std::uint8_t> bytes);

enum class Form { xml, binary };
/// Null values cannot be written (an error says where).
[[nodiscard]] Result<ByteData> serialize(const PropertyValue& value, Form form);

}  // namespace velk::propertylist
