// A clock that stands until it is told otherwise.
#pragma once

#include "platform/Clock.h"
#include "platform/Lock.h"

namespace velk::test {

/// Any thread. Starts at 2020-09-13 12:26:40 UTC and at an arbitrary steady time.
class FakeClock : public Clock {
 public:
  [[nodiscard]] TimeValue wallTime() const override;
  [[nodiscard]] SteadyTime steadyTime() const override;

  /// Moves the wall alone, as an administrator would.
  void setWallTime(TimeValue time);
  void setSteadyTime(SteadyTime time);
  /// Moves both. Fires nothing: that is ManualScheduler::advance.
  void advance(Duration duration);

 private:
  mutable Lock _lock;
  std::chrono::nanoseconds _wall VELK_GUARDED_BY(_lock) = std::chrono::seconds(1'600'000'000);
  SteadyTime _steady VELK_GUARDED_BY(_lock) = SteadyTime(std::chrono::hours(1000));
};

}  // namespace velk::test
