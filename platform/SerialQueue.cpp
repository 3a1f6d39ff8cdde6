#include "platform/SerialQueue.h"

#include <utility>

#include "platform/CurrentQueue.h"

namespace velk {
namespace {

/// After so many tasks a queue lets others have the thread.
constexpr unsigned kTasksPerTurn = 64;
/// An idle queue keeps room for so many tasks; what a burst needed beyond it is given back.
constexpr std::size_t kKeptCapacity = 256;

std::string_view lastComponent(std::string_view label) {
  const auto dot = label.rfind('.');
  return dot == std::string_view::npos || dot + 1 == label.size() ? label : label.substr(dot + 1);
}

}  // namespace

/// The place of a waiting `sync` among the tasks. Run or dropped, it makes the waiter the next owner.
class SerialQueueCore::HandOver {
 public:
  HandOver(SerialQueueCore& core, Waiter& waiter) noexcept : _core(&core), _waiter(&waiter) {}
  HandOver(HandOver&& other) noexcept : _core(other._core), _waiter(std::exchange(other._waiter, nullptr)) {}
  HandOver(const HandOver&) = delete;
  HandOver& operator=(const HandOver&) = delete;
  HandOver& operator=(HandOver&&) = delete;
  ~HandOver() { (*this)(); }

  void operator()() noexcept {
    if (_waiter == nullptr) return;
    _waiter->isNext = true;
    _core->_handOverTo = std::exchange(_waiter, nullptr);
  }

 private:
  SerialQueueCore* const _core;
  Waiter* _waiter;
};

SerialQueueCore::SerialQueueCore(std::shared_ptr<QueueRunner> runner, std::string label, bool isPatient)
    : _runner(std::move(runner)), _label(std::move(label)), _shortName(lastComponent(_label)), _isPatient(isPatient) {}

void SerialQueueCore::async(Task task) {
  if (_fork.forked()) return;
  {
    Guard guard(_lock);
    _incoming.push_back(std::move(task));
    if (_owner != Owner::nobody || !entersRunnerLocked()) return;
  }
  scheduleTurn(false);
}

/// True when the runner is to be told.
bool SerialQueueCore::entersRunnerLocked() {
  _owner = Owner::runner;
  return !std::exchange(_isScheduled, true);
}

void SerialQueueCore::scheduleTurn(bool runsWhenStopped) {
  if (!_runner->schedule(shared_from_this()) && beginsTurn()) drain(runsWhenStopped);
}

void SerialQueueCore::runSync(void (*work)(void*), void* context) noexcept {
  if (CurrentQueueScope::contains(this) || _fork.forked()) return work(context);
  const auto self = shared_from_this();  // `work` may drop the queue's last reference.
  Waiter waiter;
  bool sleeps = false;
  {
    Guard guard(_lock);
    sleeps = _owner == Owner::thread;
    if (_owner == Owner::nobody) {
      waiter.isNext = true;
    } else {
      _incoming.emplace_back(HandOver(*this, waiter));
    }
    if (sleeps) {
      _waiters.push_back(&waiter);
    } else {
      _owner = Owner::thread;
    }
  }
  if (sleeps) waiter.owns.wait();
  {
    CurrentQueueScope current(this);
    while (!waiter.isNext && nextIsReady()) perform(true);
    _handOverTo = nullptr;
    work(context);
  }
  release();
}

void SerialQueueCore::runTurn() noexcept {
  if (!beginsTurn()) return;
  CurrentQueueScope current(this);
  do {
    for (unsigned done = 0; done < kTasksPerTurn; ++done) {
      if (!nextIsReady()) return;
      perform(true);
      if (handsOver()) return;
    }
  } while (!leavesTurn());
}

/// False when the queue is not the runner's any more.
bool SerialQueueCore::beginsTurn() {
  Guard guard(_lock);
  _isScheduled = false;
  if (_owner != Owner::runner) return false;
  _owner = Owner::thread;
  return true;
}

/// False when the turn goes on, since nobody else wants the thread.
bool SerialQueueCore::leavesTurn() {
  if (_fork.forked() || wakesWaiterOrEntersRunner() == Next::waiter) return true;
  return _runner->yield(shared_from_this()) || !beginsTurn();
}

/// The owner lets go, with tasks left. A sync that waits goes on with them: the runner may have no thread for that.
SerialQueueCore::Next SerialQueueCore::wakesWaiterOrEntersRunner() {
  Waiter* first = nullptr;
  {
    Guard guard(_lock);
    if (_waiters.empty()) return entersRunnerLocked() ? Next::runner : Next::runnerThatKnows;
    first = _waiters.front();
    _waiters.erase(_waiters.begin());
  }
  first->owns.signal();
  return Next::waiter;
}

/// False when there is none: the queue has become idle, and is no longer the caller's.
bool SerialQueueCore::nextIsReady() { return !_fork.forked() && (_next < _batch.size() || takesBatch()); }

bool SerialQueueCore::takesBatch() {
  _batch.clear();
  _next = 0;
  if (_batch.capacity() > kKeptCapacity) Tasks().swap(_batch);
  Tasks surplus;
  Guard guard(_lock);
  if (_incoming.empty()) {
    if (_incoming.capacity() > kKeptCapacity) surplus.swap(_incoming);
    _owner = Owner::nobody;
    return false;
  }
  _batch.swap(_incoming);
  return true;
}

/// Runs or drops the next task. What it owns ends here, while the thread still works for the queue.
void SerialQueueCore::perform(bool run) noexcept {
  Task task = std::move(_batch[_next++]);
  if (run && task) task();
}

/// True when a waiting `sync` was next: the queue is its own from now on.
bool SerialQueueCore::handsOver() {
  auto* const waiter = std::exchange(_handOverTo, nullptr);
  if (waiter == nullptr) return false;
  {
    Guard guard(_lock);
    _waiters.erase(_waiters.begin());  // they were told of in the order of their work
  }
  waiter->owns.signal();
  return true;
}

/// The end of a `sync`.
void SerialQueueCore::release() noexcept {
  if (nextIsReady() && wakesWaiterOrEntersRunner() == Next::runner) scheduleTurn(true);
}

/// The end of a queue whose runner was stopped: what was handed over during a `sync` runs, anything later is dropped.
void SerialQueueCore::drain(bool run) noexcept {
  CurrentQueueScope current(this);
  while (nextIsReady()) {
    perform(run);
    if (handsOver()) return;
  }
}

namespace {

class SerialQueue final : public Queue {
 public:
  SerialQueue(std::shared_ptr<SerialQueueCore> core, std::shared_ptr<TimerService> timers)
      : _core(std::move(core)), _timers(std::move(timers)) {}

  [[nodiscard]] std::string_view label() const override { return _core->label(); }
  void async(Task task) override { _core->async(std::move(task)); }
  void asyncAfter(Duration delay, Task task) override {
    if (delay <= Duration::zero()) return _core->async(std::move(task));
    _timers->add(TimerSchedule::after(_timers->now(), delay), Duration::zero(),
                 [core = _core, task = std::move(task)](SteadyTime) mutable { core->async(std::move(task)); });
  }
  [[nodiscard]] bool isCurrent() const override { return CurrentQueueScope::contains(_core.get()); }

 protected:
  void runSync(void (*work)(void*), void* context) override { _core->runSync(work, context); }

 private:
  const std::shared_ptr<SerialQueueCore> _core;
  const std::shared_ptr<TimerService> _timers;
};

}  // namespace

std::shared_ptr<Queue> makeSerialQueue(std::shared_ptr<QueueRunner> runner, std::shared_ptr<TimerService> timers,
                                       std::string label, bool isPatient) {
  return std::make_shared<SerialQueue>(
      std::make_shared<SerialQueueCore>(std::move(runner), std::move(label), isPatient), std::move(timers));
}

}  // namespace velk
