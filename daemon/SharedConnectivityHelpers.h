// The HTTP transports that sessions of one client and service share: made at the first request, counted, and let go
// when a transport reports that its last user has left. One, in the agent. The table is touched on the agent's state
// queue only: requests wait for that queue (never call them with the agent's lock held, nor from that queue), releases
// and the transports' answers are queued. Any thread.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <string>

#include "connectivity/ConnectivityInterface.h"
#include "foundation/PropertyValue.h"
#include "platform/Platform.h"
#include "platform/Queue.h"

namespace velk {

class ReportingSessionConnectivityHelper;

class SharedConnectivityHelpers : public std::enable_shared_from_this<SharedConnectivityHelpers> {
 public:
  /// Transports without users that wait for the next one or for their time. Clients that keep changing their names
  /// could leave any number behind; of more, those without users for longest are let go at once.
  static constexpr std::size_t kMaximumUnused = 256;

  explicit SharedConnectivityHelpers(const Platform& platform);

  /// The transport of this user info, whatever mode it was made with; a new one in `mode` when there is none.
  [[nodiscard]] std::shared_ptr<ReportingSessionConnectivityHelper> request(
      const PropertyDictionary& userInfo, std::int32_t mode, const std::weak_ptr<ConnectivityHelperDelegate>& delegate);
  /// Gives one use back. The transport is invalidated when it reports that nobody uses it any more and nobody has
  /// taken it again since that report was made.
  void release(const PropertyDictionary& userInfo);

  /// For the process's end: every transport finishes its tasks and gives its keep-alive references back. Asynchronous.
  void invalidateAll();

  /// Key and usage of each, and what it says of itself; no more than `limit` of them. Waits for the state queue.
  [[nodiscard]] PropertyArray status(std::size_t limit = SIZE_MAX);
  /// Waits for the state queue.
  [[nodiscard]] std::size_t count();

 private:
  struct Entry {
    std::shared_ptr<ReportingSessionConnectivityHelper> helper;
    /// Our own tally: a transport's report of zero may be older than the latest request.
    std::uint32_t uses = 0;
    /// Of those without users: the smallest has been without for longest.
    std::uint64_t unusedSince = 0;
  };
  using Helpers = std::map<std::string, Entry>;

  std::shared_ptr<ReportingSessionConnectivityHelper> requestOnQueue(
      const std::string& key, const PropertyDictionary& userInfo, std::int32_t mode,
      const std::weak_ptr<ConnectivityHelperDelegate>& delegate);
  void releaseOnQueue(const std::string& key);
  void usageReported(const std::string& key, const std::weak_ptr<ReportingSessionConnectivityHelper>& helper,
                     std::uint32_t usage);
  void letGo(Helpers::iterator entry);
  void boundUnused();

  // Constant after construction.
  const Platform _platform;
  const std::shared_ptr<Queue> _stateQueue;
  // Touched on _stateQueue only.
  Helpers _helpers;
  std::uint64_t _releases = 0;
};

}  // namespace velk
