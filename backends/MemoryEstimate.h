// How much memory a property value takes, roughly: what health reports say of batches and storebags.
// Used by the batching backend and by the session's health report. Any thread.
#pragma once

#include <cstdint>

#include "foundation/PropertyValue.h"

namespace velk {

/// The block that an allocator would give the value itself, without what it holds.
[[nodiscard]] std::uint32_t allocationSize(const PropertyValue& value) noexcept;

/// A dictionary: the allocation size of each key, each value's estimate plus its allocation size once more, plus its
/// own. An array: each element's estimate plus its allocation size, plus its own. Anything else: its allocation size.
/// Counting the values' blocks twice is how the numbers have always been reported. Sums wrap at 32 bits.
[[nodiscard]] std::uint32_t memoryEstimate(const PropertyValue& value) noexcept;
[[nodiscard]] std::uint32_t memoryEstimate(const PropertyDictionary& dictionary) noexcept;
[[nodiscard]] std::uint32_t memoryEstimate(const PropertyArray& array) noexcept;

}  // namespace velk
