// A client's queue, "com.tavrin.VelkReporting.main": everything that the client asks for takes its turn here. A
// periodic tick holds it until the tick is over, as if it ran on the queue all that time; but it lets go of the thread
// beneath, which is the only one that the library has: bytes go on moving, other clients go on working, and replies to
// calls that were made before the tick still arrive.
//
// What is held back is bounded: with so many calls waiting for one tick it is stuck, and later calls no longer wait.
#pragma once

#include <cstddef>
#include <deque>
#include <memory>
#include <utility>

#include "platform/Queue.h"

namespace velk {

/// Any thread, but for `runInTurn`, `hold` and `release`, which are bound to the queue beneath. Work that still waits
/// when the last reference goes is dropped.
class ReportingQueue : public std::enable_shared_from_this<ReportingQueue> {
 public:
  static constexpr std::size_t kMaximumWaiting = 16'384;

  explicit ReportingQueue(std::shared_ptr<Queue> beneath) : _beneath(std::move(beneath)) {}

  /// For what does not wait for ticks: what comes from the daemon, and events that had their turn already.
  [[nodiscard]] const std::shared_ptr<Queue>& beneath() const { return _beneath; }

  template <class Work>
  void async(Work work) {
    _beneath->async(
        [self = shared_from_this(), work = std::move(work)]() mutable { self->runInTurn(std::move(work)); });
  }
  template <class Work>
  void asyncAfter(Duration delay, Work work) {
    _beneath->asyncAfter(
        delay, [self = shared_from_this(), work = std::move(work)]() mutable { self->runInTurn(std::move(work)); });
  }

  /// Runs `work` now, or, while the queue is held, behind what waits.
  template <class Work>
  void runInTurn(Work work) {
    if (_isHeld && hasRoom()) {
      _waiting.emplace_back(std::move(work));
    } else {
      work();
    }
  }

  [[nodiscard]] bool isHeld() const { return _isHeld; }
  void hold();
  /// Runs what waited; up to the next tick, if there is one among it.
  void release();

 private:
  [[nodiscard]] bool hasRoom();

  const std::shared_ptr<Queue> _beneath;

  // On the queue beneath.
  bool _isHeld = false;
  bool _overflowed = false;
  std::deque<Task> _waiting;
};

}  // namespace velk
