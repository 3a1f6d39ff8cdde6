// How many requests of one sender may be under way in a transport. Without a bound a slow server would let finished
// batches pile up in memory; with it the sender is made to wait, its socket is no longer read, and it is felt at last
// in its client's bounded outbox. Each sender has a share of its own, so that none waits for another's requests. Owned
// by a connectivity helper, shared with the completions of its requests. Any thread.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <memory>
#include <unordered_map>

#include "platform/Lock.h"

namespace velk {

class RequestWindow {
 public:
  /// Twice what the HTTP service sends at once to one host: its line does not run dry while a sender builds its next
  /// request.
  static constexpr std::size_t kMaximumRequests = 16;

  /// Waits until the sender may make one more request. A request that waits for a route does not count. Never under the
  /// agent's lock, and never on a queue that completions need.
  void waitForRoom(std::uint64_t sender);
  void enter(std::uint64_t sender);
  /// A request has been answered, has failed, was dropped, or waits for a route.
  void leave(std::uint64_t sender);

  /// The sender's client has gone: it waits no more.
  void stopWaiting(std::uint64_t sender);
  /// The transport takes no more requests: nobody has to wait for it.
  void close();
  void open();

  /// Senders with requests under way.
  [[nodiscard]] std::size_t senderCount();

 private:
  [[nodiscard]] bool isFullLocked(std::uint64_t sender) const VELK_REQUIRES(_lock);

  Lock _lock;
  Condition _changed;
  /// Requests under way, for senders that have any.
  std::unordered_map<std::uint64_t, std::size_t> _underWay VELK_GUARDED_BY(_lock);
  /// The last senders whose clients have gone: many more than have calls left behind at once.
  std::deque<std::uint64_t> _stopped VELK_GUARDED_BY(_lock);
  bool _isClosed VELK_GUARDED_BY(_lock) = false;
};

/// A request's place in its window: given up once, by whatever path the request ends or begins to wait. Any thread.
class PlaceInWindow {
 public:
  PlaceInWindow(std::shared_ptr<RequestWindow> window, std::uint64_t sender);
  ~PlaceInWindow() { leave(); }
  PlaceInWindow(const PlaceInWindow&) = delete;
  PlaceInWindow& operator=(const PlaceInWindow&) = delete;

  void leave();

 private:
  const std::shared_ptr<RequestWindow> _window;
  const std::uint64_t _sender;
  std::atomic<bool> _hasLeft{false};
};

}  // namespace velk
