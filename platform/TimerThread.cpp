#include "platform/TimerThread.h"

#include <utility>

#include "platform/Clock.h"
#include "platform/NativeThread.h"

namespace velk {

SteadyTime TimerThread::now() const { return systemClock().steadyTime(); }

void TimerThread::start() {
  Guard guard(_lock);
  if (!_stopped && !_thread.joinable()) startLocked();
}

TimerSchedule::Identifier TimerThread::add(SteadyTime deadline, Duration leeway, TimerSchedule::Action action) {
  if (_fork.forked()) return 0;
  Guard guard(_lock);
  if (_stopped) return 0;
  const auto before = _schedule.nextWake();
  const auto identifier = _schedule.add(deadline, leeway, std::move(action));
  if (!_thread.joinable()) startLocked();
  if (!before || *_schedule.nextWake() < *before) _changed.notifyOne();
  return identifier;
}

void TimerThread::remove(TimerSchedule::Identifier identifier) {
  if (_fork.forked()) return;
  // The thread is not told: it wakes once for nothing at worst, which is cheaper than waking it for every removal.
  TimerSchedule::Action dropped;
  Guard guard(_lock);
  dropped = _schedule.remove(identifier);
}

void TimerThread::stop() {
  if (_fork.forked()) return;
  std::vector<TimerSchedule::Action> dropped;
  std::thread thread;
  {
    Guard guard(_lock);
    _stopped = true;
    dropped = _schedule.takeAll();
    thread.swap(_thread);
    _changed.notifyOne();
  }
  if (thread.joinable()) thread.join();
}

/// A system that refuses the thread is asked again with the next deadline.
void TimerThread::startLocked() {
  auto started = startThread("timers", [this] { run(); });
  if (started) _thread = std::move(*started);
}

void TimerThread::run() {
  for (;;) {
    std::vector<TimerSchedule::Action> due;
    SteadyTime time;
    {
      Guard guard(_lock);
      while (!_stopped) {
        const auto wake = _schedule.nextWake();
        time = now();
        if (wake && *wake <= time) break;
        if (wake) {
          _changed.waitUntil(_lock, *wake);
        } else {
          _changed.wait(_lock);
        }
      }
      if (_stopped) return;
      due = _schedule.takeDue(time);
    }
    for (auto& action : due) action(time);
  }
}

}  // namespace velk
