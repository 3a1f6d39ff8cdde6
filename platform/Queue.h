// Serial queues, timers, and the scheduler that makes them. Everything that the system serialises by a named queue
// runs on these; the label is the thread's name while it works for the queue.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>

#include "foundation/Function.h"
#include "foundation/TimeValue.h"
#include "platform/Clock.h"

namespace velk {

using Task = UniqueFunction<void()>;

/// Runs its tasks one at a time, in the order in which they were handed over. Tasks may block (see BlockingScope).
/// All methods may be called from any thread. Tasks that are pending when the last reference goes still run.
/// An exception that leaves a task ends the process: nothing below is allowed to throw.
class Queue {
 public:
  virtual ~Queue() = default;

  [[nodiscard]] virtual std::string_view label() const = 0;

  /// Appends a task and returns at once. Tasks should be small: bounds belong to whoever hands them over.
  virtual void async(Task task) = 0;

  /// Appends a task after `delay`. It is dropped, never run, if the scheduler is stopped before.
  virtual void asyncAfter(Duration delay, Task task) = 0;

  /// Runs `work` after everything handed over so far and returns its result. An idle queue runs it inline on the
  /// calling thread, without a hop; called from a task of this queue it runs at once. The pool's queues run it on the
  /// calling thread in every case, which therefore keeps the re-entrant locks and the other queues that it holds.
  template <class Work, class Returned = std::invoke_result_t<Work&>>
  Returned sync(Work&& work) {
    if constexpr (std::is_void_v<Returned>) {
      runSync([](void* context) { (*static_cast<std::remove_reference_t<Work>*>(context))(); }, &work);
    } else {
      struct Call {
        std::remove_reference_t<Work>* work;
        std::optional<Returned> returned;
      } call{&work, std::nullopt};
      runSync(
          [](void* context) {
            auto* current = static_cast<Call*>(context);
            current->returned.emplace((*current->work)());
          },
          &call);
      return std::move(*call.returned);
    }
  }

  /// True on a thread that is running a task (or a `sync`) of this queue.
  [[nodiscard]] virtual bool isCurrent() const = 0;

 protected:
  virtual void runSync(void (*work)(void*), void* context) = 0;
};

/// Aborts in every build unless called on `queue`: a method that is bound to a queue opens with it.
void assertOnQueue(const Queue& queue);

/// A timer that hands its handler to a queue. Made stopped. Bound to no thread; its methods may be called from any.
class Timer {
 public:
  virtual ~Timer() = default;
  /// Fires after `first`, then every `period` if there is one. `leeway` lets the system fire it that much later, in
  /// company of others. Missed periods are coalesced into one. Starting a running timer sets it anew.
  virtual void start(Duration first, std::optional<Duration> period, Duration leeway) = 0;
  /// After it returned on the timer's own queue the handler no longer runs; called elsewhere, a handler that has
  /// begun may still be running. Idempotent. The destructor cancels.
  virtual void cancel() = 0;
};

/// Makes queues and timers, and owns the threads behind them. One a process (tests make their own by hand).
class Scheduler {
 public:
  virtual ~Scheduler() = default;
  [[nodiscard]] virtual std::shared_ptr<Queue> makeSerialQueue(std::string label) = 0;
  /// `handler` runs on `queue`.
  [[nodiscard]] virtual std::unique_ptr<Timer> makeTimer(std::shared_ptr<Queue> queue, Task handler) = 0;
  [[nodiscard]] virtual const Clock& clock() const = 0;
};

}  // namespace velk
