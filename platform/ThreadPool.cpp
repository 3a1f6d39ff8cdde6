#include "platform/ThreadPool.h"

#include <algorithm>
#include <cstdint>
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

/// When the system refused a thread and work waits, it is asked again after this.
constexpr Duration kPauseAfterRefusal = std::chrono::milliseconds(100);

/// The queues that wait for a thread, in order. Not synchronised.
class ReadyQueues {
 public:
  using QueuePointer = std::shared_ptr<SerialQueueCore>;

  void push(QueuePointer queue) {
    auto& line = queue->isPatient() ? _patient : _others;
    line.push_back({++_last, std::move(queue)});
  }
  [[nodiscard]] bool empty() const noexcept { return _patient.empty() && _others.empty(); }
  /// Without a patient queue unless one `mayBePatient`.
  [[nodiscard]] bool hasOne(bool mayBePatient) const noexcept {
    return !_others.empty() || (mayBePatient && !_patient.empty());
  }
  /// There is one.
  QueuePointer take(bool mayBePatient) {
    const bool isPatient =
        mayBePatient && !_patient.empty() && (_others.empty() || _patient.front().number < _others.front().number);
    auto& line = isPatient ? _patient : _others;
    auto queue = std::move(line.front().queue);
    line.pop_front();
    return queue;
  }

 private:
  struct Entry {
    std::uint64_t number;
    QueuePointer queue;
  };
  std::uint64_t _last = 0;
  std::deque<Entry> _others;
  std::deque<Entry> _patient;
};

/// The pool's threads and the queues that wait for one. Its counts are exact: whoever wakes or starts a thread counts
/// it as running at once. What holds whenever nobody has the lock: while queues wait, `runningThreads` threads run,
/// or all that may exist do, or (with emergency threads) at least one does, or the queues are patient and the threads
/// that are left are kept from them, or the system refused a thread.
///
/// A task may fork. The child has that task's thread alone, and perhaps the lock as another thread held it: there the
/// pool does nothing, and the thread ends with its task.
class PoolCore final : public QueueRunner, public BlockingObserver, public std::enable_shared_from_this<PoolCore> {
 public:
  PoolCore(const ThreadPoolOptions& options, std::function<void(Task)> retryLater)
      : _runningThreads(options.runningThreads != 0 ? options.runningThreads
                                                    : std::max(2u, std::thread::hardware_concurrency())),
        _maximumThreads(std::max<std::size_t>(options.maximumThreads, 1)),
        _maximumWhenBlocked(_maximumThreads + options.emergencyThreads),
        _idleThreadLifetime(options.idleThreadLifetime),
        _keptThreads(options.keptThreads),
        _isNeverStopped(options.isNeverStopped),
        _retryLater(std::move(retryLater)) {}

  /// Once, before anything else.
  void startKeptThreads();

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
  [[nodiscard]] bool mayRunPatientLocked() const VELK_REQUIRES(_lock);
  [[nodiscard]] bool isKeptLocked() const VELK_REQUIRES(_lock);
  void endPatientTurn();
  bool parksLocked() VELK_REQUIRES(_lock);
  void endThread();

  // Constant after construction.
  const std::size_t _runningThreads;
  const std::size_t _maximumThreads;
  const std::size_t _maximumWhenBlocked;
  const Duration _idleThreadLifetime;
  const std::size_t _keptThreads;
  const bool _isNeverStopped;
  const std::function<void(Task)> _retryLater;
  const ForkGuard _fork;

  // Guarded by _lock, under which nobody is called.
  mutable Lock _lock;
  Condition _becameIdle;
  ReadyQueues _ready VELK_GUARDED_BY(_lock);
  std::vector<IdleThread*> _idle VELK_GUARDED_BY(_lock);
  /// Running, idle and blocked ones.
  std::size_t _total VELK_GUARDED_BY(_lock) = 0;
  std::size_t _running VELK_GUARDED_BY(_lock) = 0;
  /// Those that have begun to work: a thread that is being started may yet be refused.
  std::size_t _arrived VELK_GUARDED_BY(_lock) = 0;
  /// Those that run a patient queue.
  std::size_t _patient VELK_GUARDED_BY(_lock) = 0;
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

void PoolCore::startKeptThreads() {
  for (std::size_t number = 0; number < _keptThreads; ++number) {
    {
      Guard guard(_lock);
      ++_total;
      ++_running;
      ++_starting;
    }
    startOne();
  }
}

bool PoolCore::schedule(std::shared_ptr<SerialQueueCore> queue) {
  if (_fork.forked()) return false;
  bool starts = false;
  {
    Guard guard(_lock);
    if (_stopped) return false;
    _ready.push(std::move(queue));
    starts = wakesOneLocked();
  }
  if (starts) startOne();
  return true;
}

bool PoolCore::yield(const std::shared_ptr<SerialQueueCore>& queue) {
  if (_fork.forked()) return true;  // nobody runs it: the thread is to end
  Guard guard(_lock);
  if (_ready.empty() && _running <= _runningThreads) return false;
  _ready.push(queue);
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

/// Wakes an idle thread if one more may run. True when there is none for what is ready and the caller is to start one.
bool PoolCore::wakesOneLocked() {
  if (_running >= _runningThreads) return false;
  if (_idle.empty() || !_ready.hasOne(mayRunPatientLocked())) {
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
      needsRetry = !_ready.empty() && !std::exchange(_retryIsDue, true);
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
  {
    Guard guard(_lock);
    ++_arrived;
  }
  std::string name;
  while (auto queue = nextQueue()) {
    if (name != queue->shortName()) setCurrentThreadName(name = queue->shortName());
    queue->runTurn();
    if (queue->isPatient()) endPatientTurn();
  }
  setBlockingObserver(nullptr);
  endThread();
}

/// The next queue to run, once there is one and the thread may run. Null: the thread is to end, and counts no more.
std::shared_ptr<SerialQueueCore> PoolCore::nextQueue() {
  if (_fork.forked()) return nullptr;
  Guard guard(_lock);
  for (;;) {
    const bool mayRunPatient = mayRunPatientLocked();
    if (_ready.hasOne(mayRunPatient) && _running <= _runningThreads) {
      auto queue = _ready.take(mayRunPatient);
      if (queue->isPatient()) ++_patient;
      return queue;
    }
    if (!parksLocked()) return nullptr;
  }
}

/// Before the thread looks for its next queue, which may be a patient one.
void PoolCore::endPatientTurn() {
  if (_fork.forked()) return;
  Guard guard(_lock);
  --_patient;
}

bool PoolCore::mayRunPatientLocked() const { return _patient + _keptThreads < _arrived; }

/// No thread without work may end.
bool PoolCore::isKeptLocked() const { return _keptThreads != 0 && !mayRunPatientLocked(); }

/// Sleeps until somebody has work for the thread. False when it was not needed for long, or the pool is being stopped.
bool PoolCore::parksLocked() {
  IdleThread self;
  --_running;
  if (!_stopped) {
    _idle.push_back(&self);
    if (_idle.size() == _total) _becameIdle.notifyAll();
    const auto end = TimerSchedule::after(systemClock().steadyTime(), _idleThreadLifetime);
    while (!self.isWoken && !_stopped) {
      if (isKeptLocked()) {
        self.woken.wait(_lock);
      } else if (!self.woken.waitUntil(_lock, end) && !isKeptLocked()) {
        break;
      }
    }
    if (self.isWoken) return true;
    _idle.erase(std::find(_idle.begin(), _idle.end(), &self));
  }
  --_total;
  --_arrived;
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

/// Null when everything has run: the pool takes no more. Otherwise a queue for which there may be no thread.
std::shared_ptr<SerialQueueCore> PoolCore::waitUntilIdle() {
  Guard guard(_lock);
  while (!_ready.empty() || _idle.size() != _total || _starting != 0) {
    if (_total == 0 && !_ready.empty()) return _ready.take(true);
    if (_refused && _ready.hasOne(false)) return _ready.take(false);
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
      : _patientQueues(options.patientQueues),
        _timers(std::make_shared<TimerThread>()),
        _core(std::make_shared<PoolCore>(options, options.retryLater ? options.retryLater : byTimer(_timers))) {
    if (options.keptThreads == 0) return;
    _timers->start();
    _core->startKeptThreads();
  }
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
    const bool isPatient = std::find(_patientQueues.begin(), _patientQueues.end(), label) != _patientQueues.end();
    return velk::makeSerialQueue(_core, _timers, std::move(label), isPatient);
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
  static std::function<void(Task)> byTimer(std::shared_ptr<TimerThread> timers) {
    return [timers = std::move(timers)](Task task) {
      timers->add(TimerSchedule::after(timers->now(), kPauseAfterRefusal), Duration::zero(),
                  [task = std::move(task)](SteadyTime) mutable { task(); });
    };
  }

  const ForkGuard _fork;
  const std::vector<std::string> _patientQueues;
  const std::shared_ptr<TimerThread> _timers;
  const std::shared_ptr<PoolCore> _core;
};

}  // namespace

std::unique_ptr<ThreadPool> makeThreadPool(ThreadPoolOptions options) {
  return std::make_unique<ElasticThreadPool>(options);
}

}  // namespace velk
