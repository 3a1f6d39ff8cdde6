#include "client/PeriodicTick.h"

#include <algorithm>
#include <utility>

#include "platform/CurrentQueue.h"

namespace velk {

void addStatistics(PropertyDictionary& result, const PropertyDictionary& statistics) {
  for (const auto& [key, value] : statistics) {
    PropertyValue* present = result.findMutable(key);
    if (present != nullptr && value.dictionary() != nullptr && present->dictionary() != nullptr) {
      present->dictionary()->merge(*value.dictionary());
    } else if (present != nullptr && value.array() != nullptr && present->array() != nullptr) {
      for (const auto& element : *value.array()) present->array()->append(element);
    } else {
      result.set(key, value);
    }
  }
}

PeriodicTick::PeriodicTick(Kind kind, std::vector<PeriodicModules::Module> modules, std::shared_ptr<Queue> queue,
                           Runner runner, const void* owner, WhenOver whenOver)
    : _kind(kind),
      _queue(std::move(queue)),
      _runner(std::move(runner)),
      _owner(owner),
      _whenOver(std::move(whenOver)),
      _modules(std::move(modules)) {}

void PeriodicTick::start(Scheduler& timers, std::optional<Duration> limit) {
  assertOnQueue(*_queue);
  std::vector<PeriodicModules::Module> first;
  {
    Guard guard(_lock);
    while (_next < std::min(kSlots, _modules.size())) first.push_back(std::move(_modules[_next++]));
    _workers = first.size();
  }
  _limit = limit;
  if (_limit) {
    _timer = timers.makeTimer(_queue, [weak = weak_from_this()] {
      if (const auto self = weak.lock()) self->timeout();
    });
    waitAnew();
  }
  for (auto& module : first) {
    _runner([self = shared_from_this(), module = std::move(module)]() mutable { self->work(std::move(module)); });
  }
  if (first.empty()) finish(End::complete);
}

void PeriodicTick::work(PeriodicModules::Module module) {
  CurrentQueueScope scope(_owner);  // also while what a callback owned ends: that must not wait for the tick either
  while (module) {
    call(*module);
    module = nullptr;  // before the tick can be over: whoever unregistered it is then the last to let go of it
    module = takeModule();
    if (module) waitAnew();
  }
  hasReturned();
}

PeriodicModules::Module PeriodicTick::takeModule() {
  Guard guard(_lock);
  return _next == _modules.size() ? nullptr : std::move(_modules[_next++]);
}

void PeriodicTick::call(PeriodicModule& module) {
  if (_kind == Kind::update) {
    static_cast<void>(module.call(nullptr));
    return;
  }
  PropertyDictionary statistics;
  if (!module.call(&statistics)) return;
  Guard guard(_lock);
  addStatistics(_result, statistics);
}

void PeriodicTick::hasReturned() {
  {
    Guard guard(_lock);
    if (--_workers != 0) return;
  }
  _queue->async([self = shared_from_this()] { self->finish(End::complete); });
}

/// Each wait has the whole limit: for the next slot, and then for the rest to return.
void PeriodicTick::waitAnew() {
  if (_limit) _timer->start(*_limit, std::nullopt, Duration::zero());
}

void PeriodicTick::timeout() {
  bool allHaveSlots = false;
  {
    Guard guard(_lock);
    allHaveSlots = _next == _modules.size();
  }
  finish(allHaveSlots ? End::timeoutWhileWaiting : End::timeoutWhileScheduling);
}

void PeriodicTick::finish(End end) {
  assertOnQueue(*_queue);
  auto whenOver = std::exchange(_whenOver, nullptr);
  if (!whenOver) return;
  if (_timer) _timer->cancel();
  dropRest();
  PropertyDictionary result;
  {
    Guard guard(_lock);
    result = std::move(_result);
  }
  whenOver(end, std::move(result));
}

/// Those that found no slot in time.
void PeriodicTick::dropRest() {
  std::vector<PeriodicModules::Module> rest;
  {
    Guard guard(_lock);
    rest.swap(_modules);
    _next = 0;
  }
  // What their callbacks own may end with them, and that may take its time.
  if (!rest.empty()) _runner([rest = std::move(rest)] {});
}

}  // namespace velk
