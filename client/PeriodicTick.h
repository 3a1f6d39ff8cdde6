// One tick of a client's periodic tasks: calls a snapshot of modules, at most four at once, and gathers what they
// report. It blocks no thread; it ends once, on the reporting queue, when all calls have returned or a wait passed its
// limit. Calls that are still under way then own the tick to their end, and what they bring is dropped.
//
//   start -> [worker: call a module, add its statistics, take the next] x 4 ... -> over -> whenOver
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <vector>

#include "client/PeriodicModules.h"
#include "platform/Queue.h"

namespace velk {

/// Adds a module's statistics to those of others: dictionaries and arrays that meet their like under one key extend it,
/// anything else replaces what was there.
void addStatistics(PropertyDictionary& result, const PropertyDictionary& statistics);

class PeriodicTick : public std::enable_shared_from_this<PeriodicTick> {
 public:
  /// The most callbacks of one tick that run at once.
  static constexpr std::size_t kSlots = 4;

  enum class Kind { update, report };
  enum class End { complete, timeoutWhileScheduling, timeoutWhileWaiting };
  /// Runs on the queue, once.
  using WhenOver = UniqueFunction<void(End end, PropertyDictionary result)>;
  /// Hands work to a thread on which callbacks may take their time.
  using Runner = std::function<void(Task)>;

  PeriodicTick(Kind kind, std::vector<PeriodicModules::Module> modules, std::shared_ptr<Queue> queue, Runner runner,
               const void* owner, WhenOver whenOver);

  /// On the queue, once. `limit` is how long the tick waits for one of its slots, and in the end for the calls that
  /// are under way; nothing: for ever.
  void start(Scheduler& timers, std::optional<Duration> limit);

 private:
  void work(PeriodicModules::Module module);
  [[nodiscard]] PeriodicModules::Module takeModule();
  void call(PeriodicModule& module);
  void hasReturned();
  void waitAnew();
  void timeout();
  void finish(End end);
  void dropRest();

  // Constant once started.
  const Kind _kind;
  const std::shared_ptr<Queue> _queue;
  const Runner _runner;
  /// What `CurrentQueueScope` calls the client's callbacks by.
  const void* const _owner;
  std::optional<Duration> _limit;
  /// Only with a limit. Self-synchronised.
  std::unique_ptr<Timer> _timer;

  // On the queue.
  WhenOver _whenOver;

  Lock _lock;
  std::vector<PeriodicModules::Module> _modules VELK_GUARDED_BY(_lock);
  /// The first of those that wait for a slot.
  std::size_t _next VELK_GUARDED_BY(_lock) = 0;
  std::size_t _workers VELK_GUARDED_BY(_lock) = 0;
  PropertyDictionary _result VELK_GUARDED_BY(_lock);
};

}  // namespace velk
