// Serial queues whose tasks run on an event loop's thread.
#include <deque>

#include "platform/CurrentQueue.h"
#include "platform/EventLoopState.h"
#include "platform/Semaphore.h"

namespace velk {
namespace {

/// Tasks of one queue run in one turn of the loop, before its sockets and other queues get theirs.
constexpr int kTasksPerTurn = 64;

class LoopQueue final : public Queue, public std::enable_shared_from_this<LoopQueue> {
 public:
  LoopQueue(std::shared_ptr<EventLoop::State> loop, std::string label)
      : _loop(std::move(loop)), _label(std::move(label)) {}

  [[nodiscard]] std::string_view label() const override { return _label; }
  [[nodiscard]] bool isCurrent() const override { return CurrentQueueScope::contains(this); }

  void async(Task task) override {
    if (_loop->forked()) return;
    std::deque<Task> refused;
    {
      Guard guard(_lock);
      _tasks.push_back(std::move(task));
      if (!scheduleLocked()) refused.swap(_tasks);
    }
  }

  void asyncAfter(Duration delay, Task task) override {
    _loop->add(
        TimerSchedule::after(_loop->now(), delay), {},
        [self = shared_from_this(), task = std::move(task)](SteadyTime) mutable { self->async(std::move(task)); });
  }

 protected:
  void runSync(void (*work)(void*), void* context) override {
    if (isCurrent() || _loop->forked()) return work(context);
    const auto self = shared_from_this();  // `work` may drop the queue's last reference.
    if (beginInline()) {
      runInline(work, context);
    } else if (_loop->isCurrent()) {
      runWhatIsPending();
      runInline(work, context);
    } else {
      waitForTurn(work, context);
    }
  }

 private:
  /// What a waiting caller shares with its task; the task's end wakes it even if it never ran.
  struct Turn {
    Semaphore ended;
    bool ran = false;
  };
  struct EndOfTurn {
    explicit EndOfTurn(std::shared_ptr<Turn> ending) noexcept : turn(std::move(ending)) {}
    EndOfTurn(EndOfTurn&&) noexcept = default;
    ~EndOfTurn() {
      if (turn) turn->ended.signal();
    }
    std::shared_ptr<Turn> turn;
  };

  bool scheduleLocked() VELK_REQUIRES(_lock) {
    if (_scheduled || _busy || _tasks.empty()) return true;
    Task turn = [self = shared_from_this()] { self->runTurn(); };
    _scheduled = _loop->tryPost(turn);
    return _scheduled;
  }

  void runTurn() {
    for (int count = 0; count < kTasksPerTurn; ++count) {
      Task task;
      {
        Guard guard(_lock);
        if (_busy || _tasks.empty()) {
          _scheduled = false;
          return;
        }
        task = takeLocked();
      }
      run(task);
    }
    std::deque<Task> refused;
    {
      Guard guard(_lock);
      _scheduled = false;
      if (!scheduleLocked()) refused.swap(_tasks);
    }
  }

  Task takeLocked() VELK_REQUIRES(_lock) {
    Task task = std::move(_tasks.front());
    _tasks.pop_front();
    _busy = true;
    return task;
  }

  void run(Task& task) {
    {
      CurrentQueueScope scope(this);
      task();
      task = nullptr;
    }
    end();
  }

  void end() {
    std::deque<Task> refused;
    {
      Guard guard(_lock);
      _busy = false;
      if (!scheduleLocked()) refused.swap(_tasks);
    }
    _idle.notifyAll();
  }

  bool beginInline() {
    Guard guard(_lock);
    if (_busy || !_tasks.empty()) return false;
    return _busy = true;
  }

  void runInline(void (*work)(void*), void* context) {
    {
      CurrentQueueScope scope(this);
      work(context);
    }
    end();
  }

  /// On the loop's thread, which must not wait for itself. Leaves the queue busy on behalf of the caller.
  void runWhatIsPending() {
    for (;;) {
      Task task;
      {
        Guard guard(_lock);
        while (_busy) _idle.wait(_lock);
        if (_tasks.empty()) {
          _busy = true;
          return;
        }
        task = takeLocked();
      }
      run(task);
    }
  }

  void waitForTurn(void (*work)(void*), void* context) {
    const auto turn = std::make_shared<Turn>();
    async([work, context, ending = EndOfTurn(turn)] {
      work(context);
      ending.turn->ran = true;
    });
    turn->ended.wait();
    if (!turn->ran) work(context);
  }

  // Constant after construction.
  const std::shared_ptr<EventLoop::State> _loop;
  const std::string _label;
  // Guarded by _lock, which comes before the loop's.
  Lock _lock;
  Condition _idle;
  std::deque<Task> _tasks VELK_GUARDED_BY(_lock);
  bool _scheduled VELK_GUARDED_BY(_lock) = false;
  bool _busy VELK_GUARDED_BY(_lock) = false;
};

}  // namespace

std::shared_ptr<Queue> makeQueueOfLoop(std::shared_ptr<EventLoop::State> state, std::string label) {
  return std::make_shared<LoopQueue>(std::move(state), std::move(label));
}

}  // namespace velk
