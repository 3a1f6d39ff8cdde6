// Descriptors watched by an event loop.
#include <algorithm>
#include <asio/posix/stream_descriptor.hpp>
#include <cerrno>

#include "platform/EventLoopState.h"

namespace velk {

/// What a watch shares with the operations that it has under way. Those hold neither it nor the handlers: an operation
/// that a stopped loop never completes keeps nothing alive.
class LoopWatchState : public std::enable_shared_from_this<LoopWatchState> {
 public:
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

  void wait(asio::posix::stream_descriptor::wait_type kind, Task& slot, Task handler) {
    slot = std::move(handler);
    _descriptor.async_wait(kind, [weak = weak_from_this(), &slot](const std::error_code&) {
      const auto self = weak.lock();
      if (!self) return;
      if (auto ready = std::move(slot)) ready();
    });
  }

  void close() {
    _loop->forget(this);
    _descriptor.release();
    dropHandlers();
  }

  void dropHandlers() {
    const Task readable = std::move(_readable);
    const Task writable = std::move(_writable);
  }

  [[nodiscard]] bool forked() const noexcept { return _loop->forked(); }

  Task _readable;
  Task _writable;

 private:
  const std::shared_ptr<EventLoop::State> _loop;
  asio::posix::stream_descriptor _descriptor;
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

  void whenReadable(Task handler) override {
    _state->wait(asio::posix::stream_descriptor::wait_read, _state->_readable, std::move(handler));
  }
  void whenWritable(Task handler) override {
    _state->wait(asio::posix::stream_descriptor::wait_write, _state->_writable, std::move(handler));
  }

 private:
  std::shared_ptr<LoopWatchState> _state;
};

}  // namespace

void EventLoop::State::forget(LoopWatchState* watch) {
  _watches.erase(std::remove(_watches.begin(), _watches.end(), watch), _watches.end());
}

/// The last thing on the loop's thread. Dropping a handler may destroy watches, which leave the list.
void EventLoop::State::dropEverything() {
  std::vector<TimerSchedule::Action> actions;
  {
    Guard guard(_lock);
    actions = _schedule.takeAll();
  }
  actions.clear();
  while (!_watches.empty()) {
    const auto watch = _watches.back()->shared_from_this();
    _watches.pop_back();
    watch->dropHandlers();
  }
}

std::unique_ptr<DescriptorWatch> makeLoopWatch(std::shared_ptr<EventLoop::State> state, int descriptor) {
  auto watch = std::make_shared<LoopWatchState>(std::move(state));
  if (!watch->open(descriptor)) return nullptr;
  return std::make_unique<LoopWatch>(std::move(watch));
}

}  // namespace velk
