#include "client/SessionLink.h"

#include <algorithm>
#include <utility>

#include "client/ClientRuntime.h"
#include "client/DaemonConnection.h"
#include "client/EventLists.h"
#include "client/LogTexts.h"
#include "ipc/Vocabulary.h"
#include "platform/Log.h"

namespace velk {

namespace {

constexpr Duration kFirstPause = std::chrono::milliseconds(100);
/// Of somebody who is about to end.
constexpr Duration kLongestLastPause = std::chrono::milliseconds(200);
/// Of somebody who only wants to be known: a device without a daemon is not kept awake.
constexpr Duration kLongestQuietPause = std::chrono::minutes(5);
/// A connection that ends sooner was not wanted: this session is one too many, or the daemon cannot live.
constexpr Duration kFairLife = std::chrono::seconds(1);
/// What a service manager, or somebody who installs another version, may take to bring a daemon back.
constexpr Duration kRestartTime = std::chrono::seconds(30);

}  // namespace

void SessionDescription::receiveUserInfo(const std::optional<PropertyDictionary>& newUserInfo) {
  const PropertyValue* required = sessionInfo.find(kVelkReportingSessionInfoRequireUserInfo);
  // None takes the place of one only where none is required.
  if (newUserInfo || (required != nullptr && !booleanValue(required))) userInfo = newUserInfo;
}

SessionLink::SessionLink(ClientRuntime& runtime, std::shared_ptr<Queue> queue, SessionDescription description,
                         std::shared_ptr<ClientSessionReplyInterface> exported,
                         std::shared_ptr<CurrentEventLists> lists)
    : _runtime(runtime),
      _queue(std::move(queue)),
      _exported(std::move(exported)),
      _lists(std::move(lists)),
      _description(std::move(description)) {}

void SessionLink::open(std::function<void()> whenInterrupted) {
  _whenInterrupted = std::move(whenInterrupted);
  if (!tryToConnect() && _description.hasAggregationBlock) reconnectLater();
}

std::shared_ptr<Connection> SessionLink::connect() {
  auto connection = tryToConnect();
  if (!connection) reconnectLater();
  return connection;
}

std::shared_ptr<Connection> SessionLink::tryToConnect() {
  auto connection = current();
  if (connection && !connection->hasEnded()) return connection;
  if (connection) forgetConnection();
  if (_isClosed || pauseLeft() > Duration::zero()) return nullptr;
  connection = makeConnection();
  if (!connection) {
    growPause();
    return nullptr;
  }
  _connectedAt = now();
  setCurrent(connection);
  describeSession(connection);
  // From here on the queue deals with what comes: the first time this is another thread, which touches nothing of the
  // queue's any more.
  connection->resume();
  return connection;
}

SteadyTime SessionLink::now() const { return _runtime.loop().clock().steadyTime(); }

void SessionLink::forgetConnection() {
  setCurrent(nullptr);
  _lostAt = now();
  if (now() - _connectedAt < kFairLife) return growPause();
  _pause = Duration::zero();
  _quietPause = Duration::zero();
}

void SessionLink::growPause() {
  _pause = std::clamp(2 * _pause, kFirstPause, _longestPause);
  _nextAttempt = now() + _pause;
}

std::shared_ptr<Connection> SessionLink::current() const {
  Guard guard(_lock);
  return _connection;
}

void SessionLink::setCurrent(std::shared_ptr<Connection> connection) {
  Guard guard(_lock);
  _connection.swap(connection);
}

Duration SessionLink::pauseLeft() const {
  if (_pause == Duration::zero()) return Duration::zero();
  return std::max<Duration>(Duration::zero(), _nextAttempt - now());
}

void SessionLink::retryAtOnce() {
  _longestPause = kLongestLastPause;
  _pause = std::min(_pause, _longestPause);
  _nextAttempt = now();
}

bool SessionLink::mayComeBack() const { return _lostAt && now() - *_lostAt < kRestartTime; }

std::shared_ptr<Connection> SessionLink::makeConnection() {
  auto made = connectToDaemon(_runtime, _queue);
  if (!made) {
    reportNoConnection(made.error());
    return nullptr;
  }
  _reportedProblem.clear();
  const std::shared_ptr<Connection> connection = std::move(*made);
  connection->setExportedDispatcher(std::make_shared<ReplyInterfaceDispatcher>(_exported));
  connection->setInvalidationHandler([self = weak_from_this(), invalidated = std::weak_ptr(connection)] {
    log::standard(texts::kConnectionInvalidated);
    if (const auto link = self.lock()) link->wasInvalidated(invalidated);
  });
  connection->setInterruptionHandler([self = weak_from_this(), interrupted = std::weak_ptr(connection)] {
    log::standard(texts::kConnectionInterrupted);
    if (const auto link = self.lock()) link->wasInterrupted(interrupted);
  });
  return connection;
}

/// A daemon that is not there is no error; what somebody has to put right is one, told once and not at each attempt.
void SessionLink::reportNoConnection(const Error& error) {
  log::standard(texts::kFailedToConnect);
  if (!isLasting(error)) return log::standard("initWithSessionInfo: %s", error);
  if (error.description == _reportedProblem) return;
  _reportedProblem = error.description;
  log::error("initWithSessionInfo: %s", error);
}

void SessionLink::describeSession(const std::shared_ptr<Connection>& connection) {
  SessionInterfaceProxy proxy(connection, loggingHandler(texts::kInitProxyFailure));
  proxy.setSessionInfo(_description.sessionInfo, _description.userInfo, _description.frameworksToCheck,
                       _description.hasAggregationBlock);
  if (_description.isConfigured) {
    proxy.startConfigWithCompletionHandler([lists = _lists](const std::optional<PropertyArray>& enabled,
                                                            const std::optional<PropertyArray>& whitelist,
                                                            const std::optional<PropertyArray>& blacklist) {
      lists->replace(std::make_shared<const EventLists>(enabled, whitelist, blacklist));
      log::standard(texts::kCachedLists, enabled ? enabled->size() : 0, whitelist, blacklist);
    });
  }
  // Backends take a digest key when it arrives, and are made by the configuration.
  if (_description.digestKey) proxy.setDigestKey(*_description.digestKey, _description.digestAlgorithm);
}

void SessionLink::wasInterrupted(const std::weak_ptr<Connection>& connection) {
  const auto interrupted = connection.lock();
  if (!interrupted) return;
  interrupted->invalidate();  // drops its handlers
  if (current() == interrupted) forgetConnection();
  _whenInterrupted();
  reconnectLater();
}

// Ends that were asked for here, and interruptions, need nothing more.
void SessionLink::wasInvalidated(const std::weak_ptr<Connection>& connection) {
  const auto invalidated = connection.lock();
  if (!invalidated) return;
  const auto end = invalidated->end();
  if (end != Connection::End::goodbye && end != Connection::End::badFrame) return;
  if (current() == invalidated) forgetConnection();
  _whenInterrupted();
  reconnectLater();
}

// Even when there is nothing to say: this session's relatives need it, and its aggregation block listens.
void SessionLink::reconnectLater() {
  if (_isClosed || std::exchange(_reconnects, true)) return;
  _quietPause = std::clamp(2 * _quietPause, kFirstPause, kLongestQuietPause);
  _queue->asyncAfter(std::max(_quietPause, pauseLeft()), [self = weak_from_this()] {
    const auto link = self.lock();
    if (!link) return;
    link->_reconnects = false;
    if (!link->tryToConnect()) link->reconnectLater();
  });
}

void SessionLink::close(Duration drainTime) {
  _isClosed = true;
  if (const auto connection = current()) connection->closeAfterSending(drainTime);
}

}  // namespace velk
