#include "daemon/IdleWatch.h"

#include "platform/Process.h"

namespace velk {

namespace {
// Nobody minds when an idle process goes a little later, together with other timers of the system.
constexpr Duration kLeeway = std::chrono::seconds(1);
}  // namespace

IdleWatch::IdleWatch(Scheduler& scheduler, std::optional<Duration> limit, std::function<bool()> isOccupied,
                     std::function<void()> whenIdle)
    : _limit(limit),
      _isOccupied(std::move(isOccupied)),
      _whenIdle(std::move(whenIdle)),
      _queue(scheduler.makeSerialQueue("com.tavrin.velkreportingd.idle")),
      _timer(scheduler.makeTimer(_queue, [this] { limitPassed(); })) {}

IdleWatch::~IdleWatch() {
  stop();
  // A tick that is on its way would find nothing.
  _queue->sync([this] { _timer->cancel(); });
}

void IdleWatch::start() {
  Guard guard(_lock);
  _started = true;
  if (!_held) arm();
}

void IdleWatch::stop() {
  BlockingScope blocking;
  Guard guard(_lock);
  _started = false;
  _timer->cancel();
  while (_calling) _changed.wait(_lock);
}

void IdleWatch::beginTransaction() {
  Guard guard(_lock);
  _held = true;
  _timer->cancel();
}

void IdleWatch::endTransaction() {
  {
    Guard guard(_lock);
    _held = false;
    if (_started) arm();
  }
  _changed.notifyAll();
  _queue->async([] { process::returnFreeMemory(); });  // nobody needs what the last sessions left behind
}

void IdleWatch::arm() {
  if (_limit) _timer->start(*_limit, std::nullopt, kLeeway);
}

void IdleWatch::limitPassed() {
  {
    Guard guard(_lock);
    if (_held || !_started) return;
    _calling = true;
  }
  if (!_isOccupied()) _whenIdle();
  {
    Guard guard(_lock);
    _calling = false;
    if (!_held && _started) arm();
  }
  _changed.notifyAll();
}

bool IdleWatch::isReleased() const {
  Guard guard(_lock);
  return !_held;
}

bool IdleWatch::waitUntilReleased(Duration limit) {
  BlockingScope blocking;
  const auto deadline = std::chrono::steady_clock::now() + limit;
  Guard guard(_lock);
  while (_held) {
    if (!_changed.waitUntil(_lock, deadline) && _held) return false;
  }
  return true;
}

}  // namespace velk
