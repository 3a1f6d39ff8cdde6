#include "platform/EventLoop.h"

#include <asio/post.hpp>
#include <cerrno>
#include <system_error>

#include "platform/EventLoopState.h"
#include "platform/Log.h"
#include "platform/NativeThread.h"
#include "platform/QueueTimer.h"

namespace velk {
namespace {

thread_local const EventLoop::State* loopOfThread = nullptr;

}  // namespace

bool EventLoop::State::isCurrent() const noexcept { return loopOfThread == this; }

bool EventLoop::State::tryPost(Task& task) {
  if (forked()) return false;
  Guard guard(_lock);
  if (!startLocked()) return false;
  _posted.push_back(std::move(task));
  if (!std::exchange(_drainScheduled, true)) asio::post(_io->context, [this] { drain(); });
  return true;
}

Result<void> EventLoop::State::start() {
  if (forked()) return failure("EventLoop", EPERM, "it belongs to the process that this one was forked from");
  Guard guard(_lock);
  return startLocked();
}

Result<void> EventLoop::State::startLocked() {
  if (_stopped) return failure("EventLoop", ECANCELED, "it was stopped");
  if (_started) return {};
  try {
    if (!_io) _io.emplace();
  } catch (const std::system_error& error) {
    return failure("EventLoop", error.code().value(), error.what());
  }
  auto started = startThread(_threadName, [self = shared_from_this()] { self->run(); });
  if (!started) return Failure(started.error());
  _thread = std::move(*started);
  _started = true;
  return {};
}

void EventLoop::State::run() {
  loopOfThread = this;
  const auto work = asio::make_work_guard(_io->context);
  _io->context.run();
  dropEverything();
  loopOfThread = nullptr;
}

/// One turn: what is posted meanwhile waits for the next, so that sockets get theirs in between.
void EventLoop::State::drain() {
  {
    Guard guard(_lock);
    _running.swap(_posted);
  }
  for (auto& task : _running) {
    task();
    task = nullptr;
  }
  _running.clear();
  Guard guard(_lock);
  if (!_posted.empty()) {
    asio::post(_io->context, [this] { drain(); });
  } else {
    _drainScheduled = false;
    if (_stopped) _io->context.stop();
  }
}

void EventLoop::State::stop() {
  std::thread ended;
  {
    Guard guard(_lock);
    if (!std::exchange(_stopped, true) && _started && !std::exchange(_drainScheduled, true)) {
      asio::post(_io->context, [this] { drain(); });
    }
    ended = std::move(_thread);
  }
  if (!ended.joinable()) return;
  if (isCurrent()) {
    ended.detach();
  } else {
    BlockingScope blocking;
    ended.join();
  }
}

TimerSchedule::Identifier EventLoop::State::add(SteadyTime deadline, Duration leeway, TimerSchedule::Action action) {
  if (forked()) return 0;
  TimerSchedule::Identifier identifier = 0;
  {
    Guard guard(_lock);
    if (_stopped) return 0;
    identifier = _schedule.add(deadline, leeway, std::move(action));
  }
  Task arm = [this] { armTimer(); };
  static_cast<void>(tryPost(arm));
  return identifier;
}

void EventLoop::State::remove(TimerSchedule::Identifier identifier) {
  if (forked()) return;
  TimerSchedule::Action removed;
  Guard guard(_lock);
  removed = _schedule.remove(identifier);
}

void EventLoop::State::armTimer() {
  std::optional<SteadyTime> wake;
  {
    Guard guard(_lock);
    wake = _schedule.nextWake();
  }
  if (!wake || (_armedFor && *_armedFor <= *wake)) return;
  _armedFor = wake;
  _io->timer.expires_at(*wake);
  _io->timer.async_wait([this](const std::error_code& error) {
    if (!error) fireTimer();
  });
}

void EventLoop::State::fireTimer() {
  _armedFor.reset();
  std::vector<TimerSchedule::Action> due;
  const auto time = now();
  {
    Guard guard(_lock);
    due = _schedule.takeDue(time);
  }
  for (auto& action : due) action(time);
  armTimer();
}

EventLoop::EventLoop(std::string threadName) : _state(std::make_shared<State>(std::move(threadName))) {}

EventLoop::~EventLoop() { stop(); }

void EventLoop::post(Task task) { static_cast<void>(_state->tryPost(task)); }

void EventLoop::postAfter(Duration delay, Task task) {
  _state->add(TimerSchedule::after(_state->now(), delay), {}, [task = std::move(task)](SteadyTime) mutable { task(); });
}

bool EventLoop::isCurrent() const noexcept { return _state->isCurrent(); }

Result<void> EventLoop::start() { return _state->start(); }

void EventLoop::stop() {
  if (!_state->forked()) _state->stop();
}

std::unique_ptr<DescriptorWatch> EventLoop::watch(int descriptor) { return makeLoopWatch(_state, descriptor); }

std::shared_ptr<Queue> EventLoop::makeLoopQueue(std::string label) { return makeQueueOfLoop(_state, std::move(label)); }

std::shared_ptr<Queue> EventLoop::makeSerialQueue(std::string label) { return makeLoopQueue(std::move(label)); }

std::unique_ptr<Timer> EventLoop::makeTimer(std::shared_ptr<Queue> queue, Task handler) {
  return makeQueueTimer(_state, std::move(queue), std::move(handler));
}

const Clock& EventLoop::clock() const { return systemClock(); }

}  // namespace velk
