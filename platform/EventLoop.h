// The thread that waits for sockets. The IPC layer moves bytes on it; a client process runs its queues and timers on
// it as well, so that the library needs one thread only. It starts with the first work, and sleeps when there is none.
#pragma once

#include <memory>
#include <string>
#include <string_view>

#include "foundation/Error.h"
#include "platform/Queue.h"

namespace velk {

/// Tells when a descriptor can be read or written. Made and used on its loop's thread only; destroyed there or, once
/// the loop stops, on any thread: whoever has its owner last lets go of both. Does not own the descriptor, which must
/// stay open for as long as the watch lives. Destroying it drops handlers uncalled.
class DescriptorWatch {
 public:
  virtual ~DescriptorWatch() = default;
  /// Calls `handler` once, from the loop, when the descriptor can be read (or has failed, which a read then tells).
  /// At most one of each kind may be outstanding.
  virtual void whenReadable(Task handler) = 0;
  virtual void whenWritable(Task handler) = 0;
  /// The other end has gone (or the descriptor has failed), although what it sent may not have been read. Only sockets
  /// tell.
  virtual void whenHungUp(Task handler) = 0;
};

/// One thread over the system's readiness interface. All methods may be called from any thread unless they say
/// otherwise. All signals are blocked on the thread. After `fork` the child's copy does nothing: work handed to it is
/// destroyed unrun.
///
/// As a scheduler it makes queues whose tasks run on the loop's thread, one after the other. Such tasks must not block
/// for long: everything of the loop waits behind them. (`sync` runs inline on the caller's thread when the queue is
/// idle, as on any queue.)
class EventLoop final : public Scheduler {
 public:
  /// `threadName` is cut to 15 characters by the system.
  explicit EventLoop(std::string threadName);
  /// As `stop`.
  ~EventLoop() override;
  EventLoop(const EventLoop&) = delete;
  EventLoop& operator=(const EventLoop&) = delete;

  /// Runs `task` on the loop's thread, after what was posted before. After `stop`, or when no thread can be had, it is
  /// destroyed unrun. Many posts cost one wake-up.
  void post(Task task);
  /// As `post`, after `delay`; dropped when the loop is stopped before.
  void postAfter(Duration delay, Task task);

  /// Has the thread started now, by those who must know beforehand that what they post will run. An error, and nothing
  /// is lost by trying again, when the system gives no thread or no descriptors.
  [[nodiscard]] Result<void> start();

  /// True on the loop's own thread.
  [[nodiscard]] bool isCurrent() const noexcept;

  /// Runs what was posted before the call, drops delayed work and watches, and joins the thread. Called on the loop's
  /// own thread it does not wait: the thread ends by itself after the current task. Idempotent.
  void stop();

  /// On the loop's thread only; `descriptor` must be non-blocking. Null (with errno set) when the system refuses.
  [[nodiscard]] std::unique_ptr<DescriptorWatch> watch(int descriptor);

  /// A serial queue whose tasks run on this thread. It may outlive the loop; tasks handed over after `stop` are
  /// destroyed unrun.
  [[nodiscard]] std::shared_ptr<Queue> makeLoopQueue(std::string label);

  // Scheduler. The serial queues are loop queues; a timer may belong to any queue.
  [[nodiscard]] std::shared_ptr<Queue> makeSerialQueue(std::string label) override;
  [[nodiscard]] std::unique_ptr<Timer> makeTimer(std::shared_ptr<Queue> queue, Task handler) override;
  [[nodiscard]] const Clock& clock() const override;

  class State;

 private:
  std::shared_ptr<State> _state;
};

}  // namespace velk
