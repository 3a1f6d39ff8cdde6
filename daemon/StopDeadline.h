// The bound of the process's end. The code that stops the process names each wait; when the time is over the deadline
// names that wait in an error line and ends the process, whatever its threads do. Made by the daemon's process, whose
// other parts it outlives.
#pragma once

#include <functional>
#include <string_view>

#include "foundation/Error.h"
#include "foundation/TimeValue.h"
#include "platform/Clock.h"
#include "platform/EventLoop.h"
#include "platform/Lock.h"

namespace velk {

/// Used by the main thread; its own thread looks at the wait when the time is over.
class StopDeadline {
 public:
  /// `whenPassed` runs on the deadline's thread, after the line. It ends the process, outside of tests.
  StopDeadline(Duration limit, std::function<void()> whenPassed);
  ~StopDeadline() { cancel(); }
  StopDeadline(const StopDeadline&) = delete;
  StopDeadline& operator=(const StopDeadline&) = delete;

  /// Makes the thread, long before it is needed: the end of a process in need is no time to ask for one.
  [[nodiscard]] Result<void> prepare();
  /// The time begins to run.
  void begin();
  /// The wait that follows, and what is lost when it does not end. Both are texts that never go.
  void expect(std::string_view wait, std::string_view loss);
  /// How much is left until `offset` after the beginning; 0 when that is over.
  [[nodiscard]] Duration leftUntil(Duration offset) const;
  /// Nothing is ended any more. Idempotent.
  void cancel() { _thread.stop(); }

 private:
  void pass();

  // Constant after construction.
  const Duration _limit;
  const std::function<void()> _whenPassed;
  // Guarded by _lock.
  mutable Lock _lock;
  SteadyTime _begun VELK_GUARDED_BY(_lock){};
  std::string_view _wait VELK_GUARDED_BY(_lock);
  std::string_view _loss VELK_GUARDED_BY(_lock);
  // Self-synchronised; last, since its thread uses everything above.
  EventLoop _thread{"velk-stop"};
};

}  // namespace velk
