// A serial queue over threads that belong to somebody else: the pool implements QueueRunner.
#pragma once

#include <cstddef>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Fork.h"
#include "platform/Lock.h"
#include "platform/Queue.h"
#include "platform/Semaphore.h"
#include "platform/TimerSchedule.h"

namespace velk {

class SerialQueueCore;

/// Gives threads to queues that have tasks. Thread-safe.
class QueueRunner {
 public:
  virtual ~QueueRunner() = default;
  /// Calls `queue->runTurn()` soon, once, on a thread of the runner. False when it was stopped: nothing happens.
  virtual bool schedule(std::shared_ptr<SerialQueueCore> queue) = 0;
  /// Called by a queue at the end of its turn. False: nobody else waits, so it goes on. True: it was put behind the
  /// others, and another thread may be running it already.
  virtual bool yield(const std::shared_ptr<SerialQueueCore>& queue) = 0;
};

/// The state of a queue, which lives until its last task has run. At every moment at most one party owns the queue:
/// the runner (from `schedule` to the end of the turn) or a thread in `runSync`; an idle queue has no owner.
///
///     idle --async--> runner --turn over, nothing left--> idle
///     idle --sync---> caller --work done--> idle, or runner if tasks came meanwhile
///     runner --a sync is next in order--> the caller that waits for it
///
/// In a forked child it locks nothing and runs no more than the task that forked: see ThreadPool.
class SerialQueueCore : public std::enable_shared_from_this<SerialQueueCore> {
 public:
  SerialQueueCore(std::shared_ptr<QueueRunner> runner, std::string label);

  [[nodiscard]] const std::string& label() const noexcept { return _label; }
  /// What a thread is called while it works for the queue: the label's last component.
  [[nodiscard]] std::string_view shortName() const noexcept { return _shortName; }

  void async(Task task);
  void runSync(void (*work)(void*), void* context) noexcept;
  /// Runs a bounded number of tasks, or more while no other queue waits. By the runner, which owns the queue.
  void runTurn() noexcept;

 private:
  struct Waiter {
    Semaphore owns;
  };
  class HandOver;
  using Tasks = std::vector<Task>;

  bool takesBatch();
  bool nextIsReady();
  void perform(bool run) noexcept;
  bool handsOver();
  void release() noexcept;
  void drain(bool run) noexcept;

  // Constant after construction.
  const std::shared_ptr<QueueRunner> _runner;
  const std::string _label;
  const std::string_view _shortName;
  const ForkGuard _fork;

  // The owner's: tasks taken from `_incoming`, the first one that has not run, and who is to own the queue next.
  Tasks _batch;
  std::size_t _next = 0;
  Waiter* _handOverTo = nullptr;

  // Guarded by _lock.
  Lock _lock;
  Tasks _incoming VELK_GUARDED_BY(_lock);
  bool _owned VELK_GUARDED_BY(_lock) = false;
};

/// `timers` carries the delayed tasks.
[[nodiscard]] std::shared_ptr<Queue> makeSerialQueue(std::shared_ptr<QueueRunner> runner,
                                                     std::shared_ptr<TimerService> timers, std::string label);

}  // namespace velk
