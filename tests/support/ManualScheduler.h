// A scheduler without threads or time of its own: tasks run when the test says so, on the test's thread.
#pragma once

#include <cstddef>
#include <memory>
#include <optional>
#include <string>

#include "platform/Queue.h"
#include "tests/support/FakeClock.h"

namespace velk::test {

/// Tasks of all its queues run in the order in which they were handed over, within `runUntilIdle`, `advance`, or a
/// `sync` of their queue (which runs that queue's pending tasks first, then its work inline). A queue whose task is
/// being run further up the stack is passed over, as it would be by a pool. Any thread may hand over tasks; a thread
/// that wants a queue which another one is running waits for it. Queues and timers may outlive the scheduler.
class ManualScheduler : public Scheduler {
 public:
  ManualScheduler();
  /// Drops what is pending.
  ~ManualScheduler() override;

  [[nodiscard]] std::shared_ptr<Queue> makeSerialQueue(std::string label) override;
  [[nodiscard]] std::unique_ptr<Timer> makeTimer(std::shared_ptr<Queue> queue, Task handler) override;
  [[nodiscard]] const Clock& clock() const override;
  [[nodiscard]] FakeClock& fakeClock();

  /// Runs tasks until none is left, those included that they hand over. Returns how many ran. Time stands still.
  /// Aborts after a million tasks: something hands itself over for ever.
  std::size_t runUntilIdle();
  /// Moves both times on by `duration`, stopping at every deadline on the way to fire what is due and to run the
  /// queues. Leeway is not made use of. Deadlines that passed while the clock was moved by hand fire first, once each.
  void advance(Duration duration);

  [[nodiscard]] std::size_t pendingTasks() const;
  /// Running timers and delayed tasks.
  [[nodiscard]] std::size_t pendingDeadlines() const;
  /// How long until the next of them; nothing when there is none.
  [[nodiscard]] std::optional<Duration> timeToNextDeadline() const;

  class Core;

 private:
  const std::shared_ptr<Core> _core;
};

}  // namespace velk::test
