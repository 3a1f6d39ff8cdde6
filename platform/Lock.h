// Locks that clang's thread-safety analysis knows, and that tell the thread pool when they make a thread wait.
#pragma once

#include <chrono>
#include <condition_variable>
#include <mutex>

#include "platform/BlockingScope.h"
#include "platform/ThreadAnnotations.h"

namespace velk {

/// For short critical sections: nothing that blocks may run under it.
class VELK_CAPABILITY("lock") Lock {
 public:
  void lock() VELK_ACQUIRE() { _mutex.lock(); }
  void unlock() VELK_RELEASE() { _mutex.unlock(); }
  bool try_lock() VELK_TRY_ACQUIRE(true) { return _mutex.try_lock(); }

 private:
  friend class Condition;
  std::mutex _mutex;
};

/// A re-entrant lock that may be held for seconds. Whoever waits for it counts as blocked, so that the pool starts
/// another thread for the work that the holder may be waiting for.
class VELK_CAPABILITY("monitor") Monitor {
 public:
  void lock() VELK_ACQUIRE() {
    if (_mutex.try_lock()) return;
    BlockingScope blocking;
    _mutex.lock();
  }
  void unlock() VELK_RELEASE() { _mutex.unlock(); }

 private:
  std::recursive_mutex _mutex;
};

/// Holds a lock for a scope.
template <class AnyLock>
class VELK_SCOPED_CAPABILITY Guard {
 public:
  explicit Guard(AnyLock& lock) VELK_ACQUIRE(lock) : _lock(lock) { _lock.lock(); }
  ~Guard() VELK_RELEASE() { _lock.unlock(); }
  Guard(const Guard&) = delete;
  Guard& operator=(const Guard&) = delete;

 private:
  AnyLock& _lock;
};

template <class AnyLock>
Guard(AnyLock&) -> Guard<AnyLock>;

/// A condition that goes with `Lock`.
class Condition {
 public:
  /// The caller holds `lock`, which is released while it waits. Wakes spuriously, as conditions do.
  void wait(Lock& lock) VELK_REQUIRES(lock) {
    std::unique_lock held(lock._mutex, std::adopt_lock);
    _condition.wait(held);
    held.release();
  }
  /// False when `deadline` has passed.
  bool waitUntil(Lock& lock, std::chrono::steady_clock::time_point deadline) VELK_REQUIRES(lock) {
    std::unique_lock held(lock._mutex, std::adopt_lock);
    const auto status = _condition.wait_until(held, deadline);
    held.release();
    return status == std::cv_status::no_timeout;
  }
  void notifyOne() noexcept { _condition.notify_one(); }
  void notifyAll() noexcept { _condition.notify_all(); }

 private:
  std::condition_variable _condition;
};

}  // namespace velk
