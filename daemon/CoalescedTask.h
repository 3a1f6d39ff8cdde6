// Work that may be asked for much faster than it can be done, where doing it once answers all who asked before it
// began: reading configuration again. Owned by the daemon's process.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <utility>

#include "platform/Queue.h"

namespace velk {

/// Any thread. The queue's tasks refer to it: it outlives them.
class CoalescedTask {
 public:
  CoalescedTask(std::shared_ptr<Queue> queue, std::function<void()> work)
      : _queue(std::move(queue)), _work(std::move(work)) {}

  /// Runs the work on the queue, once for all requests that are made before it begins. Only posts.
  void request() {
    if (_isPosted.exchange(true)) return;
    _queue->async([this] {
      _isPosted = false;
      _work();
    });
  }

 private:
  const std::shared_ptr<Queue> _queue;
  const std::function<void()> _work;
  std::atomic<bool> _isPosted{false};
};

}  // namespace velk
