// Who is to be called when: the order of deadlines behind all timers and delayed tasks, without a thread or a clock.
// The timer thread of the pool drives one with real time, the tests' scheduler with a fake clock.
#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <optional>
#include <set>
#include <utility>
#include <vector>

#include "foundation/Function.h"
#include "foundation/TimeValue.h"
#include "platform/Clock.h"

namespace velk {

/// Not synchronised: its owner has a lock for it. Calls nobody: it hands out what is due.
class TimerSchedule {
 public:
  using Identifier = std::uint64_t;
  /// Is given the time at which it was found due.
  using Action = UniqueFunction<void(SteadyTime)>;

  /// `action` becomes due at `deadline`; it may wait for company until `deadline + leeway`.
  Identifier add(SteadyTime deadline, Duration leeway, Action action);
  /// Takes an action out, for the caller to destroy outside its lock. Empty when it has been taken already.
  [[nodiscard]] Action remove(Identifier identifier);
  /// The latest moment to look again: nothing that waits may be later than that. Nothing when nothing waits.
  [[nodiscard]] std::optional<SteadyTime> nextWake() const;
  /// The earliest deadline, whatever its leeway.
  [[nodiscard]] std::optional<SteadyTime> nextDeadline() const;
  /// Everything whose deadline has come, in the order of deadlines, then of adding.
  [[nodiscard]] std::vector<Action> takeDue(SteadyTime now);
  /// Everything, due or not.
  [[nodiscard]] std::vector<Action> takeAll();
  [[nodiscard]] std::size_t size() const noexcept { return _entries.size(); }

  /// `base + delay`, held at the end of time where the sum would pass it.
  [[nodiscard]] static SteadyTime after(SteadyTime base, Duration delay) noexcept;

 private:
  struct Entry {
    SteadyTime deadline;
    SteadyTime latest;
    Action action;
  };
  using Key = std::pair<SteadyTime, Identifier>;

  Identifier _last = 0;
  std::map<Identifier, Entry> _entries;
  std::set<Key> _byDeadline;
  std::set<Key> _byLatest;
};

/// Whoever drives a schedule. Thread-safe; the actions run on its thread and must only post.
class TimerService {
 public:
  virtual ~TimerService() = default;
  /// 0 when the service was stopped: the action is dropped.
  virtual TimerSchedule::Identifier add(SteadyTime deadline, Duration leeway, TimerSchedule::Action action) = 0;
  virtual void remove(TimerSchedule::Identifier identifier) = 0;
  [[nodiscard]] virtual SteadyTime now() const = 0;
};

}  // namespace velk
