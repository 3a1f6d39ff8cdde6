// What all client objects of a process share: the library's one permanent thread, the threads that run the user's
// callbacks while there are any, and the calling user's suite. Made at first use, never destroyed: queued work and
// forked children may touch it to the end of the process.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>

#include "platform/EventLoop.h"
#include "platform/Fork.h"
#include "platform/Lock.h"
#include "platform/ThreadPool.h"
#include "platform/UserDefaults.h"

namespace velk {

class ClientRuntime {
 public:
  /// The process's own. A forked child gets a new one for the clients that it makes itself.
  [[nodiscard]] static ClientRuntime& shared();

  /// The library's thread, which never runs the user's code.
  [[nodiscard]] EventLoop& loop() { return _loop; }

  /// Runs a callback of the user on a thread of its own choice; it may block for as long as it likes.
  void runCallback(Task callback);
  /// The same for a module's periodic task, out of the way of the other callbacks: modules may block for long.
  void runPeriodicTask(Task task);
  /// A queue for callbacks that must arrive in order.
  [[nodiscard]] std::shared_ptr<Queue> makeCallbackQueue(std::string label);

  /// One-shot messages are made one after the other on this queue of the loop's.
  [[nodiscard]] const std::shared_ptr<Queue>& oneMessageQueue() const { return _oneMessageQueue; }
  /// How many of them wait for their reply.
  [[nodiscard]] std::atomic<int>& oneMessagesUnderWay() { return _oneMessagesUnderWay; }

  /// The calling user's suite, in which the library keeps its identifiers.
  [[nodiscard]] UserDefaults& defaults();

 private:
  ClientRuntime();

  const std::uint64_t _generation = processGeneration();
  EventLoop _loop;
  const std::unique_ptr<ThreadPool> _callbackThreads;
  const std::unique_ptr<ThreadPool> _periodicTaskThreads;
  const std::shared_ptr<Queue> _oneMessageQueue;
  std::atomic<int> _oneMessagesUnderWay{0};
  Lock _lock;
  std::unique_ptr<UserDefaults> _defaults VELK_GUARDED_BY(_lock);
};

}  // namespace velk
