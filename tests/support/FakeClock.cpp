#include "tests/support/FakeClock.h"

namespace velk::test {

TimeValue FakeClock::wallTime() const {
  using namespace std::chrono;
  Guard guard(_lock);
  const auto whole = floor<seconds>(_wall);
  return TimeValue{whole.count(), static_cast<std::int32_t>(duration_cast<microseconds>(_wall - whole).count())};
}

SteadyTime FakeClock::steadyTime() const {
  Guard guard(_lock);
  return _steady;
}

void FakeClock::setWallTime(TimeValue time) {
  Guard guard(_lock);
  _wall = std::chrono::seconds(time.seconds) + std::chrono::microseconds(time.microseconds);
}

void FakeClock::setSteadyTime(SteadyTime time) {
  Guard guard(_lock);
  _steady = time;
}

void FakeClock::advance(Duration duration) {
  Guard guard(_lock);
  _wall += duration;
  _steady += duration;
}

}  // namespace velk::test
