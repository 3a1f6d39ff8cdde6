#include "client/SessionLink.h"

#include <algorithm>
#include <utility>

#include "client/ClientRuntime.h"
#include "client/DaemonConnection.h"
#include "client/EventLists.h"
#include "client/LogTexts.h"
#include "ipc/MethodTable.h"
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

SessionLink::UnsentEvents unsentEvents(Connection& connection) {
  SessionLink::UnsentEvents events;
  for (auto& arguments : connection.takeUnsentCalls(static_cast<std::uint32_t>(Method::sendMessageWithDictionary))) {
    if (auto* const message = arguments.empty() ? nullptr : arguments.mutableAt(0).dictionary()) {
      events.push_back(std::move(*message));
    }
  }
  return events;
}

/// For a connection that nothing comes after.
void reportLoss(Connection& connection) {
  const std::size_t lost = unsentEvents(connection).size();
  if (lost != 0) log::error(texts::kEventsAreLost, lost);
}

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

void SessionLink::open(std::function<void(UnsentEvents)> whenLost) {
  _whenLost = std::move(whenLost);
  _queue->async([self = shared_from_this()] {
    if (!self->tryToConnect() && self->_description.hasAggregationBlock) self->reconnectLater();
  });
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
  connection->keepUnsent();
  connection->setInvalidationHandler([self = weak_from_this(), core = std::weak_ptr(connection->core())] {
    log::standard(texts::kConnectionInvalidated);
    tell(self.lock(), core.lock(), &SessionLink::wasInvalidated);
  });
  connection->setInterruptionHandler([self = weak_from_this(), core = std::weak_ptr(connection->core())] {
    log::standard(texts::kConnectionInterrupted);
    tell(self.lock(), core.lock(), &SessionLink::wasInterrupted);
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

void SessionLink::tell(const std::shared_ptr<SessionLink>& link, std::shared_ptr<ipc::ConnectionCore> core,
                       void (SessionLink::*ended)(Connection&)) {
  if (!core) return;
  Connection connection(std::move(core));
  if (link) return (*link.*ended)(connection);
  reportLoss(connection);  // its client has gone before it
}

void SessionLink::wasInterrupted(Connection& connection) {
  connection.invalidate();  // drops its handlers
  wasLost(connection);
}

// An interruption was dealt with already.
void SessionLink::wasInvalidated(Connection& connection) {
  if (connection.end() == Connection::End::here) return reportLoss(connection);
  if (connection.end() != Connection::End::endOfFile) wasLost(connection);
}

void SessionLink::wasLost(Connection& connection) {
  if (const auto latest = current(); latest && latest->core() == connection.core()) forgetConnection();
  if (_isClosed) return reportLoss(connection);
  _whenLost(unsentEvents(connection));
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
