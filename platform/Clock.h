// The two times of a process, by name: the wall's, which jumps, and the steady one, which does not.
#pragma once

#include <chrono>
#include <memory>

#include "foundation/TimeValue.h"

namespace velk {

using SteadyTime = std::chrono::steady_clock::time_point;

/// Any thread. Never blocks.
class Clock {
 public:
  virtual ~Clock() = default;
  /// The wall clock: what events are stamped with.
  [[nodiscard]] virtual TimeValue wallTime() const = 0;
  /// The monotonic clock: what waits and ages within one process are measured with.
  [[nodiscard]] virtual SteadyTime steadyTime() const = 0;
};

/// The operating system's clocks.
[[nodiscard]] Clock& systemClock();

}  // namespace velk
