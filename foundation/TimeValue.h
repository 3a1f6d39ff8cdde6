// Wall-clock times as the events carry them.
#pragma once

#include <chrono>
#include <cstdint>

namespace velk {

using Duration = std::chrono::nanoseconds;

/// A wall-clock time since 1970-01-01 00:00:00 UTC: whole seconds and microseconds (0 to 999,999).
struct TimeValue {
  std::int64_t seconds = 0;
  std::int32_t microseconds = 0;

  bool operator==(const TimeValue&) const = default;
};

/// The time in seconds as a double, which is exact to the microsecond for the next centuries.
[[nodiscard]] constexpr double secondsFromTimeValue(const TimeValue& time) noexcept {
  return static_cast<double>(time.seconds) + static_cast<double>(time.microseconds) / 1'000'000.0;
}

}  // namespace velk
