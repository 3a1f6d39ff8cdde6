// How many requests of one transport may be under way. Without a bound a slow server would let finished batches pile up
// in memory; with it the senders are made to wait, their sockets are no longer read, and it is felt at last in the
// clients' bounded outboxes. Owned by a connectivity helper, shared with the completions of its requests. Any thread.
#pragma once

#include <cstddef>

#include "platform/BlockingScope.h"
#include "platform/Lock.h"

namespace velk {

class RequestWindow {
 public:
  /// Several times what the HTTP service sends at once to one host, and a few megabytes at the worst.
  static constexpr std::size_t kMaximumRequests = 64;

  /// Waits until one more request may be made. At the latest that is when the oldest one has timed out. Never under
  /// the agent's lock, and never on a queue that completions need.
  void waitForRoom() {
    {
      Guard guard(_lock);
      if (_underWay < kMaximumRequests || _isClosed) return;
    }
    BlockingScope blocking;
    Guard guard(_lock);
    while (_underWay >= kMaximumRequests && !_isClosed) _changed.wait(_lock);
  }

  void enter() {
    Guard guard(_lock);
    ++_underWay;
  }

  /// A request has been answered, has failed, or was dropped.
  void leave() {
    Guard guard(_lock);
    --_underWay;
    _changed.notifyOne();
  }

  /// The transport takes no more requests: nobody has to wait for it.
  void close() {
    Guard guard(_lock);
    _isClosed = true;
    _changed.notifyAll();
  }
  void open() {
    Guard guard(_lock);
    _isClosed = false;
  }

 private:
  Lock _lock;
  Condition _changed;
  std::size_t _underWay VELK_GUARDED_BY(_lock) = 0;
  bool _isClosed VELK_GUARDED_BY(_lock) = false;
};

}  // namespace velk
