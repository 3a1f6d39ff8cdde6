#include "platform/QueueTimer.h"

#include <algorithm>
#include <cstdint>

#include "platform/Lock.h"

namespace velk {
namespace {

/// What a timer shares with the ticks that it has on their way: they outlive it, and then find that it moved on.
class TimerCore : public std::enable_shared_from_this<TimerCore> {
 public:
  TimerCore(std::shared_ptr<TimerService> service, std::shared_ptr<Queue> queue, Task handler)
      : _service(std::move(service)), _queue(std::move(queue)), _handler(std::move(handler)) {}

  void start(Duration first, std::optional<Duration> period, Duration leeway) {
    Setting setting{period ? std::optional(std::max(*period, kShortestPeriod)) : std::nullopt, leeway};
    const auto deadline = TimerSchedule::after(_service->now(), first);
    TimerSchedule::Identifier former = 0;
    {
      Guard guard(_lock);
      former = std::exchange(_scheduled, 0);
      setting.generation = ++_generation;
      _tickPending = false;
      scheduleLocked(deadline, setting);
    }
    if (former != 0) _service->remove(former);
  }

  void cancel() {
    TimerSchedule::Identifier former = 0;
    {
      Guard guard(_lock);
      ++_generation;
      former = std::exchange(_scheduled, 0);
    }
    if (former != 0) _service->remove(former);
  }

 private:
  /// A period of nothing would keep a thread busy for ever.
  static constexpr Duration kShortestPeriod = std::chrono::milliseconds(1);

  struct Setting {
    std::optional<Duration> period;
    Duration leeway;
    std::uint64_t generation = 0;
  };

  void scheduleLocked(SteadyTime deadline, const Setting& setting) VELK_REQUIRES(_lock) {
    _scheduled = _service->add(deadline, setting.leeway, [weak = weak_from_this(), deadline, setting](SteadyTime now) {
      if (auto core = weak.lock()) core->fire(deadline, now, setting);
    });
  }

  /// On the service's thread. A tick that has not run yet stands for the ones missed meanwhile.
  void fire(SteadyTime deadline, SteadyTime now, const Setting& setting) {
    {
      Guard guard(_lock);
      if (_generation != setting.generation) return;
      _scheduled = 0;
      if (setting.period) {
        const auto missed = (now - deadline) / *setting.period;
        scheduleLocked(TimerSchedule::after(deadline, (missed + 1) * *setting.period), setting);
      }
      if (std::exchange(_tickPending, true)) return;
    }
    _queue->async([core = shared_from_this(), generation = setting.generation] { core->tick(generation); });
  }

  /// On the queue.
  void tick(std::uint64_t generation) {
    {
      Guard guard(_lock);
      if (_generation != generation) return;
      _tickPending = false;
    }
    _handler();
  }

  // Constant after construction. The handler is called on the queue alone.
  const std::shared_ptr<TimerService> _service;
  const std::shared_ptr<Queue> _queue;
  Task _handler;
  // Guarded by _lock, which comes before the service's own.
  Lock _lock;
  std::uint64_t _generation VELK_GUARDED_BY(_lock) = 0;
  TimerSchedule::Identifier _scheduled VELK_GUARDED_BY(_lock) = 0;
  bool _tickPending VELK_GUARDED_BY(_lock) = false;
};

class QueueTimer final : public Timer {
 public:
  explicit QueueTimer(std::shared_ptr<TimerCore> core) : _core(std::move(core)) {}
  ~QueueTimer() override { _core->cancel(); }

  void start(Duration first, std::optional<Duration> period, Duration leeway) override {
    _core->start(first, period, leeway);
  }
  void cancel() override { _core->cancel(); }

 private:
  const std::shared_ptr<TimerCore> _core;
};

}  // namespace

std::unique_ptr<Timer> makeQueueTimer(std::shared_ptr<TimerService> service, std::shared_ptr<Queue> queue,
                                      Task handler) {
  return std::make_unique<QueueTimer>(
      std::make_shared<TimerCore>(std::move(service), std::move(queue), std::move(handler)));
}

}  // namespace velk
