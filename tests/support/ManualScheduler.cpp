#include "tests/support/ManualScheduler.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <deque>

#include "platform/CurrentQueue.h"
#include "platform/Lock.h"
#include "platform/QueueTimer.h"
#include "platform/TimerSchedule.h"

namespace velk::test {
namespace {

/// One queue's part of the core's state. Guarded by the core's lock.
struct Lane {
  bool busy = false;
};

}  // namespace

class ManualScheduler::Core : public TimerService, public std::enable_shared_from_this<ManualScheduler::Core> {
 public:
  TimerSchedule::Identifier add(SteadyTime deadline, Duration leeway, TimerSchedule::Action action) override {
    Guard guard(lock);
    if (stopped) return 0;
    return schedule.add(deadline, leeway, std::move(action));
  }
  void remove(TimerSchedule::Identifier identifier) override {
    TimerSchedule::Action dropped;
    Guard guard(lock);
    dropped = schedule.remove(identifier);
  }
  [[nodiscard]] SteadyTime now() const override { return clock.steadyTime(); }

  void post(const std::shared_ptr<Lane>& lane, Task task) {
    Guard guard(lock);
    if (!stopped) pending.push_back(Entry{lane, std::move(task)});
  }

  /// Runs the first task of a lane that is free (of `only`, if given). False when there is none.
  bool runOne(const Lane* only) {
    Entry entry;
    {
      Guard guard(lock);
      const auto next = std::find_if(pending.begin(), pending.end(), [&](const Entry& candidate) {
        return !candidate.lane->busy && (only == nullptr || candidate.lane.get() == only);
      });
      if (next == pending.end()) return false;
      entry = std::move(*next);
      pending.erase(next);
      entry.lane->busy = true;
    }
    {
      CurrentQueueScope current(entry.lane.get());
      entry.task();
      entry.task = nullptr;
    }
    release(*entry.lane);
    return true;
  }

  void runSync(const std::shared_ptr<Lane>& lane, void (*work)(void*), void* context) {
    if (CurrentQueueScope::contains(lane.get())) return work(context);
    for (;;) {
      while (runOne(lane.get())) {
      }
      Guard guard(lock);
      if (!lane->busy && !hasPendingLocked(*lane)) {
        lane->busy = true;
        break;
      }
      while (lane->busy) released.wait(lock);
    }
    {
      CurrentQueueScope current(lane.get());
      work(context);
    }
    release(*lane);
  }

  void fireDue() {
    std::vector<TimerSchedule::Action> due;
    const auto time = now();
    {
      Guard guard(lock);
      due = schedule.takeDue(time);
    }
    for (auto& action : due) action(time);
  }

  void stop() {
    std::deque<Entry> tasks;
    std::vector<TimerSchedule::Action> actions;
    Guard guard(lock);
    stopped = true;
    tasks.swap(pending);
    actions = schedule.takeAll();
  }

  struct Entry {
    std::shared_ptr<Lane> lane;
    Task task;
  };

  FakeClock clock;
  mutable Lock lock;
  Condition released;
  std::deque<Entry> pending VELK_GUARDED_BY(lock);
  TimerSchedule schedule VELK_GUARDED_BY(lock);
  bool stopped VELK_GUARDED_BY(lock) = false;

 private:
  bool hasPendingLocked(const Lane& lane) const VELK_REQUIRES(lock) {
    return std::any_of(pending.begin(), pending.end(), [&](const Entry& entry) { return entry.lane.get() == &lane; });
  }

  void release(Lane& lane) {
    {
      Guard guard(lock);
      lane.busy = false;
    }
    released.notifyAll();
  }
};

namespace {

class ManualQueue final : public Queue {
 public:
  ManualQueue(std::shared_ptr<ManualScheduler::Core> core, std::string label)
      : _core(std::move(core)), _label(std::move(label)), _lane(std::make_shared<Lane>()) {}

  [[nodiscard]] std::string_view label() const override { return _label; }
  void async(Task task) override { _core->post(_lane, std::move(task)); }
  void asyncAfter(Duration delay, Task task) override {
    // Weak: the core holds the action until it is due.
    _core->add(TimerSchedule::after(_core->now(), delay), Duration::zero(),
               [core = std::weak_ptr(_core), lane = _lane, task = std::move(task)](SteadyTime) mutable {
                 if (auto alive = core.lock()) alive->post(lane, std::move(task));
               });
  }
  [[nodiscard]] bool isCurrent() const override { return CurrentQueueScope::contains(_lane.get()); }

 protected:
  void runSync(void (*work)(void*), void* context) override { _core->runSync(_lane, work, context); }

 private:
  const std::shared_ptr<ManualScheduler::Core> _core;
  const std::string _label;
  const std::shared_ptr<Lane> _lane;
};

}  // namespace

ManualScheduler::ManualScheduler() : _core(std::make_shared<Core>()) {}
ManualScheduler::~ManualScheduler() { _core->stop(); }

std::shared_ptr<Queue> ManualScheduler::makeSerialQueue(std::string label) {
  return std::make_shared<ManualQueue>(_core, std::move(label));
}

std::unique_ptr<Timer> ManualScheduler::makeTimer(std::shared_ptr<Queue> queue, Task handler) {
  return makeQueueTimer(_core, std::move(queue), std::move(handler));
}

const Clock& ManualScheduler::clock() const { return _core->clock; }
FakeClock& ManualScheduler::fakeClock() { return _core->clock; }

std::size_t ManualScheduler::runUntilIdle() {
  constexpr std::size_t kTooMany = 1'000'000;
  std::size_t ran = 0;
  while (_core->runOne(nullptr)) {
    if (++ran < kTooMany) continue;
    std::fputs("ManualScheduler: the queues never become idle\n", stderr);
    std::abort();
  }
  return ran;
}

void ManualScheduler::advance(Duration duration) {
  const auto end = TimerSchedule::after(_core->now(), duration);
  for (;;) {
    _core->fireDue();
    runUntilIdle();
    const auto now = _core->now();
    std::optional<SteadyTime> next;
    {
      Guard guard(_core->lock);
      next = _core->schedule.nextDeadline();
    }
    if (next && *next <= now) continue;
    if (now >= end) return;
    _core->clock.advance((next && *next < end ? *next : end) - now);
  }
}

std::size_t ManualScheduler::pendingTasks() const {
  Guard guard(_core->lock);
  return _core->pending.size();
}

std::size_t ManualScheduler::pendingDeadlines() const {
  Guard guard(_core->lock);
  return _core->schedule.size();
}

std::optional<Duration> ManualScheduler::timeToNextDeadline() const {
  Guard guard(_core->lock);
  const auto next = _core->schedule.nextDeadline();
  if (!next) return std::nullopt;
  return std::max(Duration::zero(), *next - _core->now());
}

}  // namespace velk::test
