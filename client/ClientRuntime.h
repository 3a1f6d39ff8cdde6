// What all client objects of a process share: the library's one permanent thread, the threads that run the user's
// callbacks while there are any, and the calling user's suite. Made at first use, never destroyed: queued work and
// forked children may touch it to the end of the process.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "platform/EventLoop.h"
#include "platform/Fork.h"
#include "platform/Lock.h"
#include "platform/ThreadPool.h"
#include "platform/UserDefaults.h"

namespace velk {

/// Who has something to hand over before the process ends.
class LeavingClient {
 public:
  virtual ~LeavingClient() = default;
  /// On the thread that ends the process, while all other threads go on; waits within the client's bound after `begun`.
  virtual void sendBeforeExit(SteadyTime begun) = 0;
};

class ClientRuntime {
 public:
  /// How long the end of a client, and that of the process, wait for events to leave, unless the client says otherwise.
  static constexpr Duration kEndOfLifeBound = std::chrono::seconds(1);

  /// The process's own. A forked child gets a new one for the clients that it makes itself.
  [[nodiscard]] static ClientRuntime& shared();

  /// Whether this is the thread of `loop()`. Makes nothing, unlike `shared()`.
  [[nodiscard]] static bool isOnLoop();

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
  /// Counts one message, until `endOneMessage`. False when `maximum` of them wait for their replies.
  [[nodiscard]] bool beginOneMessage(int maximum);
  void endOneMessage();

  /// From now on `client` is asked to send what it has when the process exits.
  void addClient(std::weak_ptr<LeavingClient> client);
  /// Whether a client is there, or has been released and is not over yet.
  [[nodiscard]] bool hasClients();
  /// The latest moment to which a client with that bound may wait: counted from now or, once the process exits, from
  /// the beginning of that.
  [[nodiscard]] SteadyTime deadlineFor(Duration bound) const;

  /// The calling user's suite, in which the library keeps its identifiers, out of every daemon's sight: a client never
  /// writes what a daemon reads. That of a user without a home keeps nothing.
  [[nodiscard]] UserDefaults& defaults();

 private:
  ClientRuntime();

  static void processExits();
  void sendBeforeExit();
  [[nodiscard]] bool waitForOneMessages(SteadyTime deadline);

  EventLoop _loop;
  const std::unique_ptr<ThreadPool> _callbackThreads;
  const std::unique_ptr<ThreadPool> _periodicTaskThreads;
  const std::shared_ptr<Queue> _oneMessageQueue;
  std::atomic<SteadyTime> _exitBegun{SteadyTime::max()};
  Lock _lock;
  Condition _noOneMessage;
  int _oneMessagesUnderWay VELK_GUARDED_BY(_lock) = 0;
  std::vector<std::weak_ptr<LeavingClient>> _clients VELK_GUARDED_BY(_lock);
  std::size_t _clientsToSweep VELK_GUARDED_BY(_lock) = 64;
  std::unique_ptr<UserDefaults> _defaults VELK_GUARDED_BY(_lock);
};

}  // namespace velk
