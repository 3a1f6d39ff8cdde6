// The test that every session info passes before the daemon hears of it.
#pragma once

#include <optional>

#include "foundation/ErrorValue.h"
#include "foundation/PropertyValue.h"

namespace velk {

/// Nothing when it is valid; else error 2 (there is none) or 3 ("ComponentType" outside 5 to 30), which is logged here.
[[nodiscard]] std::optional<Error> validateSessionInfo(const std::optional<PropertyDictionary>& sessionInfo);

}  // namespace velk
