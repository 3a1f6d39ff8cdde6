// A client's periodic tasks: its modules, its log timer, and what happens at each tick of it.
//
//   timer fires -> a turn on the reporting queue -> myPeriodicTask: the queue is held -> PeriodicTick: modules are
//   called
//     -> over: a report is sent, the queue goes on
//
// A timer that fires while a tick lasts queues one turn, however often it does. Owned by the implementation, and by a
// tick for as long as it lasts.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>

#include "client/PeriodicModules.h"
#include "client/PeriodicTick.h"
#include "client/ReportingQueue.h"
#include "platform/Fork.h"

namespace velk {

/// How long a tick waits that was given that time-out; nothing: for ever.
[[nodiscard]] std::optional<Duration> waitLimit(std::uint64_t updateTimeout);

class PeriodicTasks : public std::enable_shared_from_this<PeriodicTasks> {
 public:
  /// Runs on the queue; validates, filters and queues the message.
  using Sender = std::function<void(const PropertyDictionary& message)>;

  /// `timers` outlives it.
  PeriodicTasks(std::shared_ptr<ReportingQueue> queue, Scheduler& timers, PeriodicTick::Runner runner, Sender sender);
  ~PeriodicTasks();
  PeriodicTasks(const PeriodicTasks&) = delete;
  PeriodicTasks& operator=(const PeriodicTasks&) = delete;

  // Any thread.

  /// False without a callback, and when there are too many.
  [[nodiscard]] bool registerModule(std::uint32_t module, bool needToUpdate, bool needToReport,
                                    VelkReportingServiceBlock serviceBlock);
  /// Waits for its turn and then for calls that a tick left running, unless `mayWait` is false or this is one of them.
  void unregisterModule(std::uint32_t module, bool mayWait);
  void startLogTimer(std::uint32_t interval, std::uint32_t reportingMultiplier, std::uint16_t category,
                     std::uint16_t type);
  void stopLogTimer();
  /// True in a callback of one of the modules, on its thread, and while what it owned ends there.
  [[nodiscard]] bool isInCallback() const noexcept;
  /// The client is going: no tick begins any more, and no callback is called any more, but for calls that have begun.
  /// The timer stops at once, also while a tick lasts that never ends.
  /// What callbacks own ends here if the caller may wait, else where callbacks run.
  void withdrawAll(bool mayWait);

  // On the reporting queue.

  /// The tick. `updateTimeout` is scaled from seconds to nanoseconds once more, although the timer gives nanoseconds:
  /// ticks of the timer wait without a limit, and only who comes here with seconds sees one.
  void myPeriodicTask(std::uint16_t category, std::uint16_t type, std::uint32_t intervalMultiplier,
                      std::uint64_t updateTimeout);
  /// The end, after `withdrawAll`.
  void end();

 private:
  struct LogTimer {
    std::uint32_t interval;
    std::uint32_t multiplier;
    std::uint16_t category;
    std::uint16_t type;
  };

  void store(std::uint64_t ticket, std::uint32_t module, bool needToUpdate, bool needToReport);
  [[nodiscard]] std::vector<PeriodicModules::Module> takeModule(std::uint32_t module);
  void dispose(std::vector<PeriodicModules::Module> modules);
  void startTimer(const LogTimer& settings);
  void fired(const LogTimer& settings);
  void updatesAreOver(PeriodicTick::End end);
  void reportIsOver(PeriodicTick::End end, std::uint16_t category, std::uint16_t type, PropertyDictionary result);

  // Constant after construction.
  const ForkGuard _forkGuard;
  const std::shared_ptr<ReportingQueue> _queue;
  Scheduler& _timers;
  const PeriodicTick::Runner _runner;
  const Sender _send;

  // Self-synchronised.
  PeriodicModules _modules;
  std::atomic<bool> _isEnding{false};

  // On the queue beneath the reporting queue.
  std::unique_ptr<Timer> _timer;
  /// Grows with each timer that is stopped: turns that it had queued are void.
  std::uint64_t _generation = 0;
  bool _turnIsQueued = false;
  std::uint32_t _counter = 0;
};

}  // namespace velk
