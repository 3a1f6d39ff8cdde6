// A counting semaphore whose waiters count as blocked (see BlockingScope).
#pragma once

#include "foundation/TimeValue.h"
#include "platform/Lock.h"

namespace velk {

/// Any thread. A semaphore may end as soon as its last waiter has returned: `signal` no longer touches it then. A
/// waiter that gives up by a timeout must share it with the signaller instead.
class Semaphore {
 public:
  explicit Semaphore(unsigned count = 0) : _count(count) {}

  void signal() {
    Guard guard(_lock);
    ++_count;
    // Under the lock: a waiter that sees the count without having slept may destroy the semaphore at once.
    _signalled.notifyOne();
  }

  void wait() {
    if (takesOne()) return;
    BlockingScope blocking;
    Guard guard(_lock);
    while (_count == 0) _signalled.wait(_lock);
    --_count;
  }

  /// False when `timeout` passed first. A timeout beyond a year counts as none.
  [[nodiscard]] bool waitFor(Duration timeout) {
    if (timeout > std::chrono::hours(24 * 365)) {
      wait();
      return true;
    }
    if (takesOne()) return true;
    BlockingScope blocking;
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    Guard guard(_lock);
    while (_count == 0) {
      if (!_signalled.waitUntil(_lock, deadline) && _count == 0) return false;
    }
    --_count;
    return true;
  }

 private:
  bool takesOne() {
    Guard guard(_lock);
    if (_count == 0) return false;
    --_count;
    return true;
  }

  Lock _lock;
  Condition _signalled;
  unsigned _count VELK_GUARDED_BY(_lock);
};

}  // namespace velk
