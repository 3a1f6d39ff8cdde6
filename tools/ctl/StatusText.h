// The daemon's status in words.
#pragma once

#include <string>

#include "foundation/PropertyValue.h"

namespace velk::ctl {

/// One line for each plain value, and for each list a heading with its count and a line for each of its entries.
/// Knows no particular key, so that it shows whatever a daemon tells. Nothing in it can steer a terminal.
[[nodiscard]] std::string statusText(const PropertyDictionary& status);

}  // namespace velk::ctl
