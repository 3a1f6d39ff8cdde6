// The daemon's HTTP transport: runs requests as tasks of one HTTP session of its own, counts its users, and tells its
// owner when the last of them has been gone for a while. The agent shares helpers between sessions of one client and
// service; the storebag service has one for its pulls.
//
//   created --activate--> active --invalidate--> inactive; the running tasks end as they would have, and then the
//   keep-alive references of the sessions that it served go back to the agent.
//
// While it is active its HTTP session owns it, so that a post in flight is never cut off because a session ended.
// Every active helper must therefore be invalidated some day.
#pragma once

#include <atomic>
#include <map>
#include <memory>
#include <string>
#include <unordered_map>

#include "connectivity/ConnectivityHelperTask.h"
#include "connectivity/ConnectivityInterface.h"
#include "connectivity/RequestWindow.h"
#include "foundation/Function.h"
#include "platform/Clock.h"
#include "platform/Platform.h"
#include "platform/Queue.h"

namespace velk {

/// Every operation may be called from any thread and returns at once: the work is done on the helper's state queue,
/// "com.tavrin.ConnectivityHelperStateQueue". Nobody waits for that queue, whatever locks he holds.
class ReportingSessionConnectivityHelper : public ReportingSessionConnectivityInterface,
                                           public HttpSessionDelegate,
                                           public std::enable_shared_from_this<ReportingSessionConnectivityHelper> {
  struct Private {};

 public:
  /// Receives the usage count: above 0 the helper is in use and must be kept; 0: it may be let go.
  using ReleaseBlock = UniqueFunction<void(std::uint32_t usageCount)>;

  // Modes. The first and the second are for background transfers, which the daemon does not make.
  static constexpr std::int32_t kBackgroundUploadMode = 1;
  static constexpr std::int32_t kBackgroundGETMode = 2;
  [[nodiscard]] static constexpr std::int32_t POSTRequestMode() noexcept { return 4; }
  [[nodiscard]] static constexpr std::int32_t GETRequestMode() noexcept { return 8; }
  /// Seconds. The random delay of a pull that is not urgent is less.
  static constexpr std::uint32_t kPullDelayBound = 7200;

  // The folder of file-backed uploads.
  [[nodiscard]] static std::string storageRootFolder();
  [[nodiscard]] static std::string composeUniqueContainerURL();
  static void deleteContainerAtURL(const std::string& path);
  /// Acts only if posts are file-backed, which they are not.
  static void cleanupStorageRootFolder();

  /// An inactive helper without users. `delegate` may be empty; `platform` outlives the helper.
  [[nodiscard]] static std::shared_ptr<ReportingSessionConnectivityHelper> initWithDelegate(
      const Platform& platform, std::weak_ptr<ConnectivityHelperDelegate> delegate, std::int32_t mode,
      PropertyDictionary userInfo);
  /// For `initWithDelegate` alone.
  ReportingSessionConnectivityHelper(Private, const Platform& platform,
                                     std::weak_ptr<ConnectivityHelperDelegate> delegate, std::int32_t mode,
                                     PropertyDictionary userInfo);
  ~ReportingSessionConnectivityHelper() override;

  /// `releaseTimeout` in seconds; 0: the helper lives for ever.
  void activate(std::uint32_t releaseTimeout);
  /// With the release timeout that was set last. Does nothing once the helper has been invalidated.
  void activate() override;
  /// Running tasks end as they would have. Later posts are dropped, later pulls fail.
  void invalidate();
  /// Seconds; counts from the next start of the release timer.
  void setReleaseTimeout(std::uint32_t releaseTimeout);

  /// A new user. Stops the release timer, which calls the owner back with the new count.
  void ownerIncrementUsageCount();
  /// A user has gone. `block` runs on `queue` (null: the state queue): at once while there are other users, else when
  /// the release timer has fired or was stopped.
  void ownerDecrementUsageCountWithBlock(ReleaseBlock block, std::shared_ptr<Queue> queue);
  /// One more keep-alive reference to give back. Takes effect at once: a transport that has become invalid already
  /// gives it back in this call, and takes the agent's lock for it.
  void incrementTotalSessionsServedCount();
  /// Gives the keep-alive references back. Takes the agent's lock.
  void releaseAllIPCTransactions();

  /// False before the activation, from the invalidation on, and (with an error line) in a mode for pulls.
  [[nodiscard]] bool takesPosts() const override;
  /// Dropped, completion uncalled: on an inactive helper, in a mode for pulls, on a session that was invalidated.
  void postURLRequestWithCompletionHandler(HttpRequest request, HttpCompletion completion) override;
  /// Waits while RequestWindow::kMaximumRequests of the sender are under way; not once the helper has been invalidated.
  void waitForRoom(std::uint64_t sender) override;
  void stopWaiting(std::uint64_t sender) override;
  /// Dropped, completion uncalled: an address that this helper has been asked for before, finished or not.
  /// Urgent pulls start at once, others after `delay` seconds; without one, after a random delay below kPullDelayBound.
  /// Returns the delay of a pull that will be made, nothing for one that will not.
  std::optional<std::uint32_t> getURLRequestWithCompletionHandler(HttpRequest request, bool isUrgent,
                                                                  HttpCompletion completion,
                                                                  std::optional<std::uint32_t> delay = std::nullopt);

  [[nodiscard]] HttpSessionConfiguration privateURLSessionConfigWithMode(std::int32_t mode) const;

  /// For people: identifier, counts, whether it is active, its release timeout, whether the release timer runs and the
  /// seconds it has left, running tasks. A snapshot that waits for nothing.
  [[nodiscard]] PropertyDictionary status() const;

  // Events of the HTTP session.
  void didReceiveResponse(HttpSession& session, HttpTask& task) override;
  void didReceiveData(HttpSession& session, HttpTask& task, std::span<const std::uint8_t> data) override;
  void didSendBodyData(HttpSession& session, HttpTask& task, std::int64_t sent, std::int64_t expected) override;
  void didBecomeDownloadTask(HttpSession& session, HttpTask& task) override;
  void didCompleteWithError(HttpSession& session, HttpTask& task, const std::optional<Error>& error) override;
  void taskIsWaitingForConnectivity(HttpSession& session, HttpTask& task) override;
  void didBecomeInvalidWithError(HttpSession& session, const std::optional<Error>& error) override;

 private:
  template <class Work>
  void onStateQueue(Work&& work);

  // On the state queue.
  void activateOnQueue(std::uint32_t releaseTimeout);
  void invalidateOnQueue();
  void decrementUsageCount(ReleaseBlock block, std::shared_ptr<Queue> queue);
  void startConnectivityHelperReleaseTimerWithBlock(ReleaseBlock block, std::shared_ptr<Queue> queue);
  void leaveEverLasting(ReleaseBlock block, const std::shared_ptr<Queue>& queue);
  void stopConnectivityHelperReleaseTimer();
  void releaseTimerFired();
  void cancelReleaseTimer();
  void callOwner(ReleaseBlock block, std::shared_ptr<Queue> queue, std::uint32_t usageCount);
  using Place = std::shared_ptr<PlaceInWindow>;
  void post(HttpRequest request, HttpCompletion completion, Place place);
  void postData(HttpRequest request, HttpCompletion completion, Place place);
  void postFile(HttpRequest request, HttpCompletion completion, Place place);
  void startPost(const Result<std::shared_ptr<HttpTask>>& task, HttpCompletion completion, Place place);
  void pull(HttpRequest request, HttpCompletion completion);
  void cancelPull(const std::string& url, HttpCompletion completion, const char* error, const char* logText);
  [[nodiscard]] HttpCompletion pullWrapper(std::string url, HttpCompletion completion);
  void createHelperForTask(HttpTask& task, HttpCompletion completion, Place place = nullptr);

  void schedulePull(HttpRequest request, bool isUrgent, std::uint32_t delay, HttpCompletion completion);
  void setRequestInProgress(const std::string& url, bool inProgress);
  [[nodiscard]] bool takeRequest(const std::string& url);

  [[nodiscard]] PropertyValue secondsUntil(SteadyTime time) const;
  [[nodiscard]] std::optional<std::string> sessionIdentifier() const;
  void setSessionIdentifier(std::string identifier);
  [[nodiscard]] bool hasDelegate() const { return !_reportingdSessionDelegate.expired(); }

  /// The state that the callers asked for last. The state queue follows.
  enum class Service : std::uint8_t { asleep, awake, ended };

  static constexpr SteadyTime kNoTimer{SteadyTime::duration::min()};

  // Constant after construction.
  const Platform _platform;
  const std::weak_ptr<ConnectivityHelperDelegate> _reportingdSessionDelegate;
  const PropertyDictionary _userInfo;
  const std::int32_t _mode;
  const std::shared_ptr<Queue> _stateQueue;
  /// Shared with the completions of requests, which may outlive the helper.
  const std::shared_ptr<RequestWindow> _window = std::make_shared<RequestWindow>();

  // Self-synchronised. All but the first two change on the state queue; `status` reads them from anywhere.
  std::atomic<Service> _service{Service::asleep};
  std::atomic<std::uint32_t> _totalSessionsServedCount{0};
  std::atomic<std::uint32_t> _usageCount{0};
  std::atomic<bool> _isActive{false};
  /// What was held for sessions has been given back, and nobody will come by to do so again.
  std::atomic<bool> _hasBecomeInvalid{false};
  std::atomic<std::uint32_t> _releaseTimeout;
  /// When the release timer fires; `kNoTimer` while it does not run.
  std::atomic<SteadyTime> _releaseTime{kNoTimer};
  std::atomic<std::uint32_t> _runningTasks{0};

  // On the state queue.
  std::shared_ptr<Queue> _urlDelegateQueue;
  std::shared_ptr<HttpSession> _privateURLSession;
  std::unordered_map<std::string, std::unique_ptr<ConnectivityHelperTask>> _tasks;
  std::unique_ptr<Timer> _releaseTimer;
  ReleaseBlock _releaseTimerBlock;
  std::shared_ptr<Queue> _releaseTimerQueue;

  // One lock for the tables of all helpers.
  static Lock classLock;
  std::map<std::string, bool> _requestInProgress VELK_GUARDED_BY(classLock);
  mutable Lock _identifierLock;
  std::optional<std::string> _sessionIdentifier VELK_GUARDED_BY(_identifierLock);
};

}  // namespace velk
