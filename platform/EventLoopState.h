// The inside of the event loop, shared by its thread, its queues and its watches. Private to platform/.
#pragma once

#include <asio/executor_work_guard.hpp>
#include <asio/io_context.hpp>
#include <asio/steady_timer.hpp>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "platform/EventLoop.h"
#include "platform/Fork.h"
#include "platform/Lock.h"
#include "platform/TimerSchedule.h"

namespace velk {

class LoopWatchState;

/// Lives until the thread has ended and the last queue, timer and watch has gone.
class EventLoop::State final : public TimerService, public std::enable_shared_from_this<EventLoop::State> {
 public:
  explicit State(std::string threadName) : _threadName(std::move(threadName)) {}

  /// False, and `task` untouched, when it will never run.
  [[nodiscard]] bool tryPost(Task& task);
  [[nodiscard]] Result<void> start();
  void stop();
  [[nodiscard]] bool isCurrent() const noexcept;
  [[nodiscard]] bool forked() const noexcept { return _fork.forked(); }

  // TimerService.
  TimerSchedule::Identifier add(SteadyTime deadline, Duration leeway, TimerSchedule::Action action) override;
  void remove(TimerSchedule::Identifier identifier) override;
  [[nodiscard]] SteadyTime now() const override { return std::chrono::steady_clock::now(); }

  // On the loop's thread only.
  [[nodiscard]] asio::io_context& io() noexcept { return _io->context; }
  void enlist(LoopWatchState* watch);

  // Any thread.
  void forget(LoopWatchState* watch);

 private:
  /// What waits for sockets and deadlines: it takes descriptors, so it is made with the thread.
  struct Io {
    Io() : context(1), timer(context) {}
    asio::io_context context;
    asio::steady_timer timer;
  };

  [[nodiscard]] Result<void> startLocked() VELK_REQUIRES(_lock);
  void run();
  void drain();
  void dropEverything();
  [[nodiscard]] std::shared_ptr<LoopWatchState> takeLastWatch();
  void armTimer();
  void fireTimer();

  // Constant after construction, or self-synchronised.
  const std::string _threadName;
  const ForkGuard _fork;
  /// Constant once started.
  std::optional<Io> _io;

  // Used on the loop's thread only.
  std::optional<SteadyTime> _armedFor;
  std::vector<Task> _running;

  // Guarded by _lock.
  Lock _lock;
  std::vector<Task> _posted VELK_GUARDED_BY(_lock);
  bool _drainScheduled VELK_GUARDED_BY(_lock) = false;
  bool _started VELK_GUARDED_BY(_lock) = false;
  bool _stopped VELK_GUARDED_BY(_lock) = false;
  std::thread _thread VELK_GUARDED_BY(_lock);
  std::vector<LoopWatchState*> _watches VELK_GUARDED_BY(_lock);
  TimerSchedule _schedule VELK_GUARDED_BY(_lock);
};

[[nodiscard]] std::unique_ptr<DescriptorWatch> makeLoopWatch(std::shared_ptr<EventLoop::State> state, int descriptor);
[[nodiscard]] std::shared_ptr<Queue> makeQueueOfLoop(std::shared_ptr<EventLoop::State> state, std::string label);

}  // namespace velk
