// Checks on foreign property lists before the parsing library sees them. Private to platform/.
#pragma once

#include <cstdint>
#include <span>
#include <string>
#include <string_view>

#include "foundation/Error.h"

namespace velk::propertylist {

inline constexpr std::size_t kMaximumBytes = 16 * 1024 * 1024;
inline constexpr int kMaximumDepth = 64;
/// Values and keys together, each counted as often as it is referred to.
inline constexpr std::size_t kMaximumEntries = 500'000;

[[nodiscard]] bool isBinary(std::span<const std::uint8_t> bytes) noexcept;

/// Walks the binary form from its root as a reader would: every reference must lead to an object inside the file, not
/// deeper than `kMaximumDepth` (so there are no loops), and all walks together stay below `kMaximumEntries` (a few
/// objects that refer to each other many times over may mean millions of values).
[[nodiscard]] Result<void> checkBinary(std::span<const std::uint8_t> bytes);

/// The XML form reduced to its elements: no declarations, comments, processing instructions, attributes or CDATA
/// sections (their text is escaped instead). Depth and number of the elements are checked, and that they are closed.
[[nodiscard]] Result<std::string> checkedMarkup(std::string_view text);

}  // namespace velk::propertylist
