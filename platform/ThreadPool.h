// The real scheduler: serial queues over an elastic pool of threads, and one thread for the timers.
#pragma once

#include <cstddef>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/Queue.h"

namespace velk {

struct ThreadPoolOptions {
  /// How many threads run at once while none of them is blocked. 0: the number of processors, at least 2.
  std::size_t runningThreads = 0;
  /// The most threads that may exist, blocked ones included. Work waits once they are all there.
  std::size_t maximumThreads = 512;
  /// How many more may be started, one at a time, while every thread is blocked and work waits: what they all wait for
  /// may be in that work. Without them a process whose threads all want one lock stands still for ever as soon as the
  /// lock's holder waits for a task.
  std::size_t emergencyThreads = 0;
  /// Queues with these labels are patient: their tasks wait, perhaps for seconds, for what tasks of other queues do.
  /// `keptThreads` are left for the others, so that these run when the system gives no further thread.
  std::vector<std::string> patientQueues = {};
  /// So many threads, and the one for timers, are started with the pool and never end.
  std::size_t keptThreads = 0;
  /// A thread without work for this long ends.
  Duration idleThreadLifetime = std::chrono::seconds(5);
  /// Nobody will stop the pool: a thread that ends leaves nothing behind that `stop` would wait for.
  bool isNeverStopped = false;
  /// Runs a task a moment later, on a thread that is none of the pool's: for the next attempt when the system refuses a
  /// thread and work waits. By default the thread for timers does it.
  std::function<void(Task)> retryLater;
};

/// Starts no thread before there is work, but for the kept ones. `stop` runs what was handed over, drops delayed work,
/// joins all threads; it blocks, must not be called from a task, and is called by the destructor.
///
/// In a forked child a pool of the parent's does nothing: tasks are destroyed unrun, `sync` runs its work at once, and
/// nothing is locked, so that a task may fork, and its child may wait, or use a pool of its own. Where the child
/// returns from such a task, its only thread ends, and with it the process.
class ThreadPool : public Scheduler {
 public:
  virtual void stop() = 0;
  /// For status and tests.
  [[nodiscard]] virtual std::size_t threadCount() const = 0;
};

[[nodiscard]] std::unique_ptr<ThreadPool> makeThreadPool(ThreadPoolOptions options = {});

}  // namespace velk
