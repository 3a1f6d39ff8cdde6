// How many accepted connections have not been torn down yet. The agent counts; whoever stops the process waits.
#pragma once

#include <cstddef>

#include "foundation/TimeValue.h"
#include "platform/BlockingScope.h"
#include "platform/Lock.h"

namespace velk {

/// Any thread.
class SessionCensus {
 public:
  void add() {
    Guard guard(_lock);
    ++_count;
  }
  void remove() {
    {
      Guard guard(_lock);
      --_count;
    }
    _none.notifyAll();
  }
  [[nodiscard]] std::size_t count() const {
    Guard guard(_lock);
    return _count;
  }
  /// False when some were left after `limit`.
  [[nodiscard]] bool waitUntilNone(Duration limit) {
    BlockingScope blocking;
    const auto deadline = std::chrono::steady_clock::now() + limit;
    Guard guard(_lock);
    while (_count > 0) {
      if (!_none.waitUntil(_lock, deadline) && _count > 0) return false;
    }
    return true;
  }

 private:
  mutable Lock _lock;
  Condition _none;
  std::size_t _count VELK_GUARDED_BY(_lock) = 0;
};

}  // namespace velk
