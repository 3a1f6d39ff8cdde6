// The one thread of a scheduler that waits for deadlines.
#pragma once

#include <thread>

#include "platform/Fork.h"
#include "platform/Lock.h"
#include "platform/TimerSchedule.h"

namespace velk {

/// Starts its thread with the first deadline; from then on that sleeps until the next one, and without one for ever.
/// Actions run on it and must only post. `stop` (by the owner, once, from elsewhere) drops what waits and joins it.
/// In a forked child nothing is taken, dropped or locked.
class TimerThread final : public TimerService {
 public:
  TimerThread() = default;
  ~TimerThread() override { stop(); }

  /// Ahead of the first deadline: the system may refuse a thread later.
  void start();
  TimerSchedule::Identifier add(SteadyTime deadline, Duration leeway, TimerSchedule::Action action) override;
  void remove(TimerSchedule::Identifier identifier) override;
  [[nodiscard]] SteadyTime now() const override;
  void stop();

 private:
  void run();
  void startLocked() VELK_REQUIRES(_lock);

  const ForkGuard _fork;

  // Guarded by _lock, which is innermost.
  Lock _lock;
  Condition _changed;
  TimerSchedule _schedule VELK_GUARDED_BY(_lock);
  std::thread _thread VELK_GUARDED_BY(_lock);
  bool _stopped VELK_GUARDED_BY(_lock) = false;
};

}  // namespace velk
