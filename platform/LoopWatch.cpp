// Descriptors watched by an event loop.
#include <algorithm>
#include <asio/posix/stream_descriptor.hpp>
#include <cerrno>
#include <utility>

#include "platform/EventLoopState.h"

namespace velk {

/// What a watch shares with the operations that it has under way. Those hold neither it nor the handlers: an operation
/// that a stopped loop never completes keeps nothing alive. Waits on the loop's thread; closes on any, since the owner
/// of a watch may be let go of anywhere once the loop stops.
class LoopWatchState : public std::enable_shared_from_this<LoopWatchState> {
 public:
  using Kind = asio::posix::stream_descriptor::wait_type;

  explicit LoopWatchState(std::shared_ptr<EventLoop::State> loop) : _loop(std::move(loop)), _descriptor(_loop->io()) {}

  bool open(int descriptor) {
    std::error_code error;
    _descriptor.assign(descriptor, error);
    if (error) {
      errno = error.value();
      return false;
    }
    _loop->enlist(this);
    return true;
  }

  void wait(Kind kind, Task handler) {
    const Task replaced = exchangeHandler(kind, std::move(handler));
    _descriptor.async_wait(kind, [weak = weak_from_this(), kind](const std::error_code&) {
      const auto self = weak.lock();
      if (!self) return;
      if (auto ready = self->exchangeHandler(kind, nullptr)) ready();
    });
  }

  void close() {
    _loop->forget(this);
    _descriptor.release();
    dropHandlers();
  }

  /// They end outside the lock: what they hold may be the watch itself.
  void dropHandlers() {
    const Task readable = exchangeHandler(Kind::wait_read, nullptr);
    const Task writable = exchangeHandler(Kind::wait_write, nullptr);
    const Task hungUp = exchangeHandler(Kind::wait_error, nullptr);
  }

  [[nodiscard]] bool forked() const noexcept { return _loop->forked(); }

 private:
  [[nodiscard]] Task exchangeHandler(Kind kind, Task handler) {
    Guard guard(_lock);
    Task& held = kind == Kind::wait_read ? _readable : kind == Kind::wait_write ? _writable : _hungUp;
    return std::exchange(held, std::move(handler));
  }

  const std::shared_ptr<EventLoop::State> _loop;
  asio::posix::stream_descriptor _descriptor;

  Lock _lock;
  Task _readable VELK_GUARDED_BY(_lock);
  Task _writable VELK_GUARDED_BY(_lock);
  Task _hungUp VELK_GUARDED_BY(_lock);
};

namespace {

class LoopWatch final : public DescriptorWatch {
 public:
  explicit LoopWatch(std::shared_ptr<LoopWatchState> state) : _state(std::move(state)) {}
  ~LoopWatch() override {
    if (_state->forked()) {
      // The kernel's table of what is watched is shared with the parent: whatever we did here would be done there.
      static_cast<void>(new std::shared_ptr<LoopWatchState>(std::move(_state)));
    } else {
      _state->close();
    }
  }

  void whenReadable(Task handler) override { _state->wait(LoopWatchState::Kind::wait_read, std::move(handler)); }
  void whenWritable(Task handler) override { _state->wait(LoopWatchState::Kind::wait_write, std::move(handler)); }
  void whenHungUp(Task handler) override { _state->wait(LoopWatchState::Kind::wait_error, std::move(handler)); }

 private:
  std::shared_ptr<LoopWatchState> _state;
};

}  // namespace

void EventLoop::State::enlist(LoopWatchState* watch) {
  Guard guard(_lock);
  _watches.push_back(watch);
}

void EventLoop::State::forget(LoopWatchState* watch) {
  Guard guard(_lock);
  _watches.erase(std::remove(_watches.begin(), _watches.end(), watch), _watches.end());
}

/// The last watch that is still there, which leaves the list; none when no more are.
std::shared_ptr<LoopWatchState> EventLoop::State::takeLastWatch() {
  Guard guard(_lock);
  if (_watches.empty()) return nullptr;
  // A watch leaves the list before it ends, and that takes the lock: this one has not ended.
  auto watch = _watches.back()->shared_from_this();
  _watches.pop_back();
  return watch;
}

/// The last thing on the loop's thread. Dropping a handler may destroy watches, here or, where another thread holds
/// their owner, there.
void EventLoop::State::dropEverything() {
  std::vector<TimerSchedule::Action> actions;
  {
    Guard guard(_lock);
    actions = _schedule.takeAll();
  }
  actions.clear();
  while (const auto watch = takeLastWatch()) watch->dropHandlers();
}

std::unique_ptr<DescriptorWatch> makeLoopWatch(std::shared_ptr<EventLoop::State> state, int descriptor) {
  auto watch = std::make_shared<LoopWatchState>(std::move(state));
  if (!watch->open(descriptor)) return nullptr;
  return std::make_unique<LoopWatch>(std::move(watch));
}

}  // namespace velk
