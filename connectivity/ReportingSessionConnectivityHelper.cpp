#include "connectivity/ReportingSessionConnectivityHelper.h"

#include <algorithm>

#include "connectivity/LogTexts.h"
#include "connectivity/UploadStorage.h"
#include "device/DeviceEnvironment.h"
#include "foundation/Uuid.h"
#include "platform/Files.h"
#include "platform/Log.h"

namespace velk {
namespace {

namespace texts = connectivity_texts;

constexpr const char* kStateQueueLabel = "com.tavrin.ConnectivityHelperStateQueue";
constexpr const char* kDelegateQueueLabel = "com.tavrin.ConnectivityHelperDelegateQueue";
constexpr const char* kSourceApplication = "com.tavrin.system.diagnostics";
constexpr std::uint32_t kInitialReleaseTimeout = 30;
constexpr Duration kReleaseTimerLeeway = std::chrono::milliseconds(100);
constexpr std::int32_t kBackgroundModes = 3;
constexpr int kBackgroundServiceType = 3;
constexpr std::size_t kExpectedTasks = 5;

/// How a helper is called in a log line.
std::string helperDescription(const std::optional<std::string>& identifier) {
  return formatText("ReportingSessionConnectivityHelper <%@>", {identifier});
}

}  // namespace

std::string ReportingSessionConnectivityHelper::storageRootFolder() { return std::string(kUploadStorageRootFolder); }

std::string ReportingSessionConnectivityHelper::composeUniqueContainerURL() {
  return uniqueUploadContainer(kUploadStorageRootFolder);
}

void ReportingSessionConnectivityHelper::deleteContainerAtURL(const std::string& path) { (void)files::remove(path); }

void ReportingSessionConnectivityHelper::cleanupStorageRootFolder() {
  if (POSTRequestMode() != kBackgroundUploadMode) return;
  cleanUploadStorage(storageRootFolder());
}

std::shared_ptr<ReportingSessionConnectivityHelper> ReportingSessionConnectivityHelper::initWithDelegate(
    const Platform& platform, std::weak_ptr<ConnectivityHelperDelegate> delegate, std::int32_t mode,
    PropertyDictionary userInfo) {
  return std::make_shared<ReportingSessionConnectivityHelper>(Private{}, platform, std::move(delegate), mode,
                                                              std::move(userInfo));
}

ReportingSessionConnectivityHelper::ReportingSessionConnectivityHelper(
    Private, const Platform& platform, std::weak_ptr<ConnectivityHelperDelegate> delegate, std::int32_t mode,
    PropertyDictionary userInfo)
    : _platform(platform),
      _reportingdSessionDelegate(std::move(delegate)),
      _userInfo(std::move(userInfo)),
      _mode(mode),
      _stateQueue(platform.scheduler.makeSerialQueue(kStateQueueLabel)),
      _releaseTimeout(kInitialReleaseTimeout) {
  log::standard(texts::kCreated, hasDelegate());
}

// The last reference may go on any thread; nobody else can reach the helper then.
ReportingSessionConnectivityHelper::~ReportingSessionConnectivityHelper() {
  log::standard(texts::kDealloced, sessionIdentifier());
  stopConnectivityHelperReleaseTimer();
}

template <class Work>
void ReportingSessionConnectivityHelper::onStateQueue(Work&& work) {
  _stateQueue->async([self = shared_from_this(), work = std::forward<Work>(work)]() mutable { work(*self); });
}

void ReportingSessionConnectivityHelper::activate(std::uint32_t releaseTimeout) {
  _service = Service::awake;
  log::standard(texts::kActivating, sessionIdentifier().value_or(texts::kInactiveIdentifier));
  onStateQueue([releaseTimeout](auto& self) { self.activateOnQueue(releaseTimeout); });
}

void ReportingSessionConnectivityHelper::activate() {
  // A helper that its owner has invalidated stays inactive: it would never be invalidated again.
  Service asleep = Service::asleep;
  if (!_service.compare_exchange_strong(asleep, Service::awake)) return;
  log::standard(texts::kActivating, sessionIdentifier().value_or(texts::kInactiveIdentifier));
  onStateQueue([](auto& self) { self.activateOnQueue(self._releaseTimeout); });
}

void ReportingSessionConnectivityHelper::activateOnQueue(std::uint32_t releaseTimeout) {
  _releaseTimeout = releaseTimeout;
  if (_isActive) {
    log::standard(texts::kAlreadyActive, sessionIdentifier());
    return;
  }
  auto configuration = privateURLSessionConfigWithMode(_mode);
  auto identifier =
      (_mode & kBackgroundModes) == 0 ? randomUuidText() : configuration.backgroundIdentifier.value_or("");
  _urlDelegateQueue = _platform.scheduler.makeSerialQueue(kDelegateQueueLabel);
  _privateURLSession = _platform.http.makeSession(std::move(configuration), shared_from_this(), _urlDelegateQueue);
  _privateURLSession->setSessionDescription(identifier);
  setSessionIdentifier(std::move(identifier));
  _tasks.clear();
  _tasks.reserve(kExpectedTasks);
  _runningTasks = 0;
  _isActive = true;
  _hasBecomeInvalid = false;
  _window->open();
  log::standard(texts::kActivated, sessionIdentifier(), hasDelegate());
}

HttpSessionConfiguration ReportingSessionConnectivityHelper::privateURLSessionConfigWithMode(std::int32_t mode) const {
  HttpSessionConfiguration configuration;
  if (mode == kBackgroundUploadMode || mode == kBackgroundGETMode) {
    configuration.backgroundIdentifier = randomUuidText();
    configuration.discretionary = true;
  }
  if (mode == kBackgroundUploadMode) {
    configuration.networkServiceType = kBackgroundServiceType;
    configuration.requiresExternalPower = true;
  }
  configuration.sourceApplicationBundleIdentifier = kSourceApplication;
  configuration.waitsForConnectivity = true;
  configuration.sourceApplicationSecondaryIdentifier = userInfoIdentifierString(_userInfo);
  return configuration;
}

void ReportingSessionConnectivityHelper::invalidate() {
  _service = Service::ended;
  _window->close();
  onStateQueue([](auto& self) { self.invalidateOnQueue(); });
}

void ReportingSessionConnectivityHelper::invalidateOnQueue() {
  if (_isActive) {
    _isActive = false;
    _privateURLSession->finishTasksAndInvalidate();
    log::standard(texts::kInvalidate, sessionIdentifier());
  } else {
    log::standard(texts::kInvalidateInactive, _totalSessionsServedCount.load());
    _hasBecomeInvalid = true;
    releaseAllIPCTransactions();
  }
}

// The count is taken in one step with giving it back: a session that ends meanwhile is counted for the next time.
void ReportingSessionConnectivityHelper::releaseAllIPCTransactions() {
  const auto delegate = _reportingdSessionDelegate.lock();
  if (!delegate) {
    _totalSessionsServedCount = 0;
    return;
  }
  Guard guard(delegate->monitor());
  delegate->releaseIPCTransactions(_totalSessionsServedCount.exchange(0));
}

// Counted first and asked afterwards, while becoming invalid is noted first and the count taken afterwards: whichever
// way the two meet, one of them gives the reference back, and the count is taken once.
void ReportingSessionConnectivityHelper::incrementTotalSessionsServedCount() {
  ++_totalSessionsServedCount;
  log::standard(texts::kServedCountIncremented, sessionIdentifier());
  if (_hasBecomeInvalid) releaseAllIPCTransactions();
}

// A timer that is about to fire, or has and was not served yet, has nothing left.
PropertyValue ReportingSessionConnectivityHelper::secondsUntil(SteadyTime time) const {
  const std::chrono::duration<double> left = time - _platform.clock.steadyTime();
  return std::max(left.count(), 0.0);
}

PropertyDictionary ReportingSessionConnectivityHelper::status() const {
  PropertyDictionary status;
  const auto identifier = sessionIdentifier();
  status.set("identifier", identifier ? PropertyValue(*identifier) : PropertyValue());
  status.set("mode", _mode);
  status.set("usageCount", _usageCount.load());
  status.set("totalSessionsServedCount", _totalSessionsServedCount.load());
  status.set("active", _isActive.load());
  const SteadyTime releaseTime = _releaseTime;
  status.set("releaseTimeout", _releaseTimeout.load());
  status.set("releaseTimerRuns", releaseTime != kNoTimer);
  status.set("releaseInSeconds", releaseTime != kNoTimer ? secondsUntil(releaseTime) : PropertyValue());
  status.set("runningTasks", _runningTasks.load());
  return status;
}

std::optional<std::string> ReportingSessionConnectivityHelper::sessionIdentifier() const {
  Guard guard(_identifierLock);
  return _sessionIdentifier;
}

void ReportingSessionConnectivityHelper::setSessionIdentifier(std::string identifier) {
  Guard guard(_identifierLock);
  _sessionIdentifier = std::move(identifier);
}

// Usage and release.

void ReportingSessionConnectivityHelper::setReleaseTimeout(std::uint32_t releaseTimeout) {
  onStateQueue([releaseTimeout](auto& self) { self._releaseTimeout = releaseTimeout; });
}

void ReportingSessionConnectivityHelper::ownerIncrementUsageCount() {
  onStateQueue([](auto& self) {
    ++self._usageCount;
    self.stopConnectivityHelperReleaseTimer();
    log::standard(texts::kUsageIncremented, self.sessionIdentifier(), self._usageCount.load(),
                  self._totalSessionsServedCount.load());
  });
}

void ReportingSessionConnectivityHelper::ownerDecrementUsageCountWithBlock(ReleaseBlock block,
                                                                           std::shared_ptr<Queue> queue) {
  onStateQueue([block = std::move(block), queue = std::move(queue)](auto& self) mutable {
    self.decrementUsageCount(std::move(block), std::move(queue));
  });
}

void ReportingSessionConnectivityHelper::decrementUsageCount(ReleaseBlock block, std::shared_ptr<Queue> queue) {
  const auto identifier = sessionIdentifier();
  if (_usageCount > 0) {
    --_usageCount;
    log::standard(texts::kUsageDecremented, identifier, _usageCount.load(), _totalSessionsServedCount.load());
  }
  const std::uint32_t count = _usageCount;
  if (count > 0) {
    log::standard(texts::kUsageAboveZero, identifier, count, _totalSessionsServedCount.load());
    callOwner(std::move(block), std::move(queue), count);
  } else {
    log::standard(texts::kUsageZero, identifier);
    startConnectivityHelperReleaseTimerWithBlock(std::move(block), std::move(queue));
  }
}

// A timer that still runs is set anew: its owner's callback gives way to the new one, and hears nothing before time.
void ReportingSessionConnectivityHelper::startConnectivityHelperReleaseTimerWithBlock(ReleaseBlock block,
                                                                                      std::shared_ptr<Queue> queue) {
  if (_releaseTimeout == 0) {
    leaveEverLasting(std::move(block), queue);
    return;
  }
  _releaseTimer = _platform.scheduler.makeTimer(_stateQueue, [weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->releaseTimerFired();
  });
  _releaseTimerBlock = std::move(block);
  _releaseTimerQueue = std::move(queue);
  const std::chrono::seconds timeout(_releaseTimeout.load());
  _releaseTime = _platform.clock.steadyTime() + timeout;
  _releaseTimer->start(timeout, std::nullopt, kReleaseTimerLeeway);
  log::standard(texts::kTimerStarted, sessionIdentifier());
}

// To its owner such a helper is always in use; what it holds of the process's life it gives back all the same.
void ReportingSessionConnectivityHelper::leaveEverLasting(ReleaseBlock block, const std::shared_ptr<Queue>& queue) {
  const auto description = helperDescription(sessionIdentifier());
  log::standard(texts::kEverLasting, description);
  callOwner(std::move(block), queue, 1);
  log::standard(texts::kEverLastingRelease, _totalSessionsServedCount.load(), description);
  releaseAllIPCTransactions();
}

void ReportingSessionConnectivityHelper::stopConnectivityHelperReleaseTimer() {
  log::standard(texts::kTimerStopping, sessionIdentifier());
  if (_releaseTimer) cancelReleaseTimer();
}

void ReportingSessionConnectivityHelper::releaseTimerFired() {
  if (!_releaseTimer) return;
  log::standard(texts::kTimerFired, sessionIdentifier(), _releaseTimeout.load());
  cancelReleaseTimer();
}

// However the timer ends, the owner hears of it, with the count of this moment: above 0 when a new user stopped it.
void ReportingSessionConnectivityHelper::cancelReleaseTimer() {
  const auto timer = std::move(_releaseTimer);
  timer->cancel();
  _releaseTime = kNoTimer;
  auto block = std::move(_releaseTimerBlock);
  auto queue = std::move(_releaseTimerQueue);
  if (!block) return;
  const std::uint32_t count = _usageCount;
  log::standard(texts::kTimerCallsOwner, count);
  callOwner(std::move(block), std::move(queue), count);
}

void ReportingSessionConnectivityHelper::callOwner(ReleaseBlock block, std::shared_ptr<Queue> queue,
                                                   std::uint32_t usageCount) {
  if (!block) return;
  const auto& target = queue ? queue : _stateQueue;
  target->async([block = std::move(block), usageCount]() mutable { block(usageCount); });
}

}  // namespace velk
