// A serial queue over threads that belong to somebody else: the pool implements QueueRunner.
#pragma once

#include <cstddef>
#include <cstdint>
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
/// the runner (while it has no thread for it), or a thread, in a turn or in `runSync`; an idle queue has no owner.
///
///     idle --async--> runner --a thread takes its turn--> thread --nothing left--> idle
///     idle, runner --sync--> the caller, which runs what stands before its work
///     thread, at the work of a sync that waits --> the caller of that sync
///     thread, its turn or its work over --> the first sync that waits, or else runner if there are tasks, or else idle
///
/// So a sync waits only for a thread that is at work on the queue, never for one that the runner has yet to find.
///
/// In a forked child it locks nothing and runs no more than the task that forked: see ThreadPool.
class SerialQueueCore : public std::enable_shared_from_this<SerialQueueCore> {
 public:
  SerialQueueCore(std::shared_ptr<QueueRunner> runner, std::string label, bool isPatient);

  [[nodiscard]] const std::string& label() const noexcept { return _label; }
  /// What a thread is called while it works for the queue: the label's last component.
  [[nodiscard]] std::string_view shortName() const noexcept { return _shortName; }
  /// Its tasks wait for those of other queues: see ThreadPoolOptions.
  [[nodiscard]] bool isPatient() const noexcept { return _isPatient; }

  void async(Task task);
  void runSync(void (*work)(void*), void* context) noexcept;
  /// Runs a bounded number of tasks, or more while no other queue waits. By the runner; does nothing when a sync has
  /// taken the queue over meanwhile.
  void runTurn() noexcept;

 private:
  enum class Owner : std::uint8_t { nobody, runner, thread };
  enum class Next : std::uint8_t { waiter, runner, runnerThatKnows };
  struct Waiter {
    Semaphore owns;
    bool isNext = false;  ///< everything before its work has run
  };
  class HandOver;
  using Tasks = std::vector<Task>;

  bool beginsTurn();
  bool leavesTurn();
  Next wakesWaiterOrEntersRunner();
  bool entersRunnerLocked() VELK_REQUIRES(_lock);
  void scheduleTurn(bool runsWhenStopped);
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
  const bool _isPatient;
  const ForkGuard _fork;

  // The owner's: tasks taken from `_incoming`, the first one that has not run, and who is to own the queue next.
  Tasks _batch;
  std::size_t _next = 0;
  Waiter* _handOverTo = nullptr;

  // Guarded by _lock.
  Lock _lock;
  Tasks _incoming VELK_GUARDED_BY(_lock);
  Owner _owner VELK_GUARDED_BY(_lock) = Owner::nobody;
  /// The runner is to call `runTurn`, whoever owns the queue by then: it is told once, however often a sync comes
  /// first.
  bool _isScheduled VELK_GUARDED_BY(_lock) = false;
  /// The syncs that sleep, in order. None while the runner owns the queue.
  std::vector<Waiter*> _waiters VELK_GUARDED_BY(_lock);
};

/// `timers` carries the delayed tasks.
[[nodiscard]] std::shared_ptr<Queue> makeSerialQueue(std::shared_ptr<QueueRunner> runner,
                                                     std::shared_ptr<TimerService> timers, std::string label,
                                                     bool isPatient = false);

}  // namespace velk
