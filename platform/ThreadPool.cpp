#include "platform/ThreadPool.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <iterator>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "platform/BlockingObserver.h"
#include "platform/Fork.h"
#include "platform/Log.h"
#include "platform/NativeThread.h"
#include "platform/QueueTimer.h"
#include "platform/SerialQueue.h"
#include "platform/TimerThread.h"

namespace velk {
namespace {

/// The pool's threads and the queues that wait for one. Its counts are exact: whoever wakes or starts a thread counts
/// it as running at once. What holds whenever nobody has the lock: while queues wait, `runningThreads` threads run,
/// or all that may exist do, or (with emergency threads) at least one does.
///
/// A task may fork. The child has that task's thread alone, and perhaps the lock as another thread held it: there the
/// pool does nothing, and the thread ends with its task.
class PoolCore final : public QueueRunner, public BlockingObserver, public std::enable_shared_from_this<PoolCore> {
 public:
  explicit PoolCore(const ThreadPoolOptions& options)
      : _runningThreads(options.runningThreads != 0 ? options.runningThreads
                                                    : std::max(2u, std::thread::hardware_concurrency())),
        _maximumThreads(std::max<std::size_t>(options.maximumThreads, 1)),
        _maximumWhenBlocked(_maximumThreads + options.emergencyThreads),
        _idleThreadLifetime(options.idleThreadLifetime),
        _isNeverStopped(options.isNeverStopped),
        _retryLater(options.retryLater) {}

  bool schedule(std::shared_ptr<SerialQueueCore> queue) override;
  bool yield(const std::shared_ptr<SerialQueueCore>& queue) override;
  void willBlock() noexcept override;
  void didBlock() noexcept override;

  /// Returns when everything has run and all threads have ended.
  void stop();
  [[nodiscard]] std::size_t threadCount() const;

 private:
  /// A thread without work. On that thread's stack; reached through `_idle` alone.
  struct IdleThread {
    Condition woken;
    bool isWoken = false;
  };

  bool wakesOneLocked() VELK_REQUIRES(_lock);
  std::shared_ptr<SerialQueueCore> waitUntilIdle();
  void startOne();
  void retryStarting();
  void work();
  std::shared_ptr<SerialQueueCore> nextQueue();
  bool parksLocked() VELK_REQUIRES(_lock);
  void endThread();

  // Constant after construction.
  const std::size_t _runningThreads;
  const std::size_t _maximumThreads;
  const std::size_t _maximumWhenBlocked;
  const Duration _idleThreadLifetime;
  const bool _isNeverStopped;
  const std::function<void(Task)> _retryLater;
  const ForkGuard _fork;

  // Guarded by _lock, under which nobody is called.
  mutable Lock _lock;
  Condition _becameIdle;
  std::deque<std::shared_ptr<SerialQueueCore>> _ready VELK_GUARDED_BY(_lock);
  std::vector<IdleThread*> _idle VELK_GUARDED_BY(_lock);
  /// Running, idle and blocked ones.
  std::size_t _total VELK_GUARDED_BY(_lock) = 0;
  std::size_t _running VELK_GUARDED_BY(_lock) = 0;
  /// Counted, but not in `_threads` yet.
  std::size_t _starting VELK_GUARDED_BY(_lock) = 0;
  bool _refused VELK_GUARDED_BY(_lock) = false;
  bool _retryIsDue VELK_GUARDED_BY(_lock) = false;
  std::vector<std::thread> _threads VELK_GUARDED_BY(_lock);
  /// Ended, but not joined: by the next thread that ends, or by `stop`.
  std::vector<std::thread> _ended VELK_GUARDED_BY(_lock);
  bool _stopped VELK_GUARDED_BY(_lock) = false;
};

/// Whether the current thread is one of this pool.
thread_local const PoolCore* currentPool = nullptr;

bool PoolCore::schedule(std::shared_ptr<SerialQueueCore> queue) {
  if (_fork.forked()) return false;
  bool starts = false;
  {
    Guard guard(_lock);
    if (_stopped) return false;
    _ready.push_back(std::move(queue));
    starts = wakesOneLocked();
  }
  if (starts) startOne();
  return true;
}

bool PoolCore::yield(const std::shared_ptr<SerialQueueCore>& queue) {
  if (_fork.forked()) return true;  // nobody runs it: the thread is to end
  Guard guard(_lock);
  if (_ready.empty() && _running <= _runningThreads) return false;
  _ready.push_back(queue);
  return true;
}

void PoolCore::willBlock() noexcept {
  if (_fork.forked()) return;
  bool starts = false;
  {
    Guard guard(_lock);
    --_running;
    if (!_ready.empty()) starts = wakesOneLocked();
  }
  if (starts) startOne();
}

void PoolCore::didBlock() noexcept {
  if (_fork.forked()) return;
  Guard guard(_lock);
  ++_running;
}

/// Wakes an idle thread if one more may run. True when there is none and the caller is to start one.
bool PoolCore::wakesOneLocked() {
  if (_running >= _runningThreads) return false;
  if (_idle.empty()) {
    if (_total >= (_running == 0 ? _maximumWhenBlocked : _maximumThreads)) return false;
    ++_total;
    ++_running;
    ++_starting;
    return true;
  }
  // The one that was last to become idle: the others may age and end.
  auto* const thread = _idle.back();
  _idle.pop_back();
  ++_running;
  thread->isWoken = true;
  thread->woken.notifyOne();
  return false;
}

/// Where the system refuses a thread, the work waits for one that becomes free, or for the next attempt.
void PoolCore::startOne() {
  auto started = startThread("pool", [this] { work(); });
  bool isNews = false;
  bool needsRetry = false;
  {
    Guard guard(_lock);
    --_starting;
    isNews = std::exchange(_refused, !started) != !started;
    if (started) {
      _threads.push_back(std::move(*started));
    } else {
      --_total;
      --_running;
      needsRetry = _retryLater && !_ready.empty() && !std::exchange(_retryIsDue, true);
    }
    _becameIdle.notifyAll();
  }
  if (!started && isNews) log::error("Failed to start a thread: %@", started.error());
  if (!needsRetry) return;
  _retryLater([weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->retryStarting();
  });
}

void PoolCore::retryStarting() {
  if (_fork.forked()) return;
  bool starts = false;
  {
    Guard guard(_lock);
    _retryIsDue = false;
    starts = !_ready.empty() && wakesOneLocked();
  }
  if (starts) startOne();
}

void PoolCore::work() {
  currentPool = this;
  setBlockingObserver(this);
  std::string name;
  while (auto queue = nextQueue()) {
    if (name != queue->shortName()) setCurrentThreadName(name = queue->shortName());
    queue->runTurn();
  }
  setBlockingObserver(nullptr);
  endThread();
}

/// The next queue to run, once there is one and the thread may run. Null: the thread is to end, and counts no more.
std::shared_ptr<SerialQueueCore> PoolCore::nextQueue() {
  if (_fork.forked()) return nullptr;
  Guard guard(_lock);
  for (;;) {
    if (!_ready.empty() && _running <= _runningThreads) {
      auto queue = std::move(_ready.front());
      _ready.pop_front();
      return queue;
    }
    if (!parksLocked()) return nullptr;
  }
}

/// Sleeps until somebody has work for the thread. False when it was not needed for long, or the pool is being stopped.
bool PoolCore::parksLocked() {
  IdleThread self;
  --_running;
  if (!_stopped) {
    _idle.push_back(&self);
    if (_idle.size() == _total) _becameIdle.notifyAll();
    const auto end = TimerSchedule::after(systemClock().steadyTime(), _idleThreadLifetime);
    while (!self.isWoken && !_stopped && self.woken.waitUntil(_lock, end)) {
    }
    if (self.isWoken) return true;
    _idle.erase(std::find(_idle.begin(), _idle.end(), &self));
  }
  --_total;
  return false;
}

void PoolCore::endThread() {
  if (_fork.forked()) return;
  std::vector<std::thread> ended;
  {
    Guard guard(_lock);
    const auto self = std::find_if(_threads.begin(), _threads.end(), [](const std::thread& thread) {
      return thread.get_id() == std::this_thread::get_id();
    });
    if (self == _threads.end()) return;  // `stop` has it, or will.
    ended.swap(_ended);
    if (_isNeverStopped) {
      self->detach();
    } else {
      _ended.push_back(std::move(*self));
    }
    _threads.erase(self);
  }
  for (auto& thread : ended) thread.join();
}

void PoolCore::stop() {
  if (currentPool == this) {
    std::fputs("a pool of threads cannot be stopped by its own task\n", stderr);
    std::abort();
  }
  while (auto orphan = waitUntilIdle()) orphan->runTurn();
  std::vector<std::thread> threads;
  {
    Guard guard(_lock);
    threads.swap(_threads);
    std::move(_ended.begin(), _ended.end(), std::back_inserter(threads));
    _ended.clear();
  }
  for (auto& thread : threads) thread.join();
}

/// Null when everything has run: the pool takes no more. Otherwise a queue that is left without any thread.
std::shared_ptr<SerialQueueCore> PoolCore::waitUntilIdle() {
  Guard guard(_lock);
  while (!_ready.empty() || _idle.size() != _total || _starting != 0) {
    if (_total == 0 && !_ready.empty()) {
      auto orphan = std::move(_ready.front());
      _ready.pop_front();
      return orphan;
    }
    _becameIdle.wait(_lock);
  }
  _stopped = true;
  for (auto* thread : _idle) thread->woken.notifyOne();
  return nullptr;
}

std::size_t PoolCore::threadCount() const {
  if (_fork.forked()) return 0;
  Guard guard(_lock);
  return _total;
}

class ElasticThreadPool final : public ThreadPool {
 public:
  explicit ElasticThreadPool(const ThreadPoolOptions& options)
      : _core(std::make_shared<PoolCore>(options)), _timers(std::make_shared<TimerThread>()) {}
  ~ElasticThreadPool() override {
    if (_fork.forked()) {
      // The child has none of the threads, and their locks may be held for ever: they are left alone, on purpose.
      new auto(_core);
      new auto(_timers);
      return;
    }
    stop();
  }

  [[nodiscard]] std::shared_ptr<Queue> makeSerialQueue(std::string label) override {
    return velk::makeSerialQueue(_core, _timers, std::move(label));
  }
  [[nodiscard]] std::unique_ptr<Timer> makeTimer(std::shared_ptr<Queue> queue, Task handler) override {
    return makeQueueTimer(_timers, std::move(queue), std::move(handler));
  }
  [[nodiscard]] const Clock& clock() const override { return systemClock(); }

  void stop() override {
    if (_fork.forked()) return;
    _timers->stop();
    _core->stop();
  }
  [[nodiscard]] std::size_t threadCount() const override { return _core->threadCount(); }

 private:
  const ForkGuard _fork;
  const std::shared_ptr<PoolCore> _core;
  const std::shared_ptr<TimerThread> _timers;
};

}  // namespace

std::unique_ptr<ThreadPool> makeThreadPool(ThreadPoolOptions options) {
  return std::make_unique<ElasticThreadPool>(options);
}

}  // namespace velk
