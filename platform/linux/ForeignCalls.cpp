#include "platform/linux/ForeignCalls.h"

#include "platform/Clock.h"
#include "platform/TimerSchedule.h"

namespace velk {

bool ForeignCalls::enter() {
  Guard guard(_lock);
  if (_stopped || _underWay == _maximum) return false;
  ++_underWay;
  return true;
}

void ForeignCalls::leave() {
  Guard guard(_lock);
  if (--_underWay == 0) _allReturned.notifyAll();
}

bool ForeignCalls::stop(Duration limit) {
  const BlockingScope blocking;
  const auto end = TimerSchedule::after(systemClock().steadyTime(), limit);
  Guard guard(_lock);
  _stopped = true;
  while (_underWay > 0) {
    if (!_allReturned.waitUntil(_lock, end)) return _underWay == 0;
  }
  return true;
}

}  // namespace velk
