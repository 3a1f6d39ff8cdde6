#include "client/SessionLink.h"

#include <algorithm>

#include "client/ClientRuntime.h"
#include "client/DaemonConnection.h"
#include "client/EventLists.h"
#include "client/LogTexts.h"
#include "platform/Log.h"

namespace velk {

namespace {

constexpr Duration kFirstPause = std::chrono::milliseconds(100);
constexpr Duration kLongestPause = std::chrono::seconds(10);

}  // namespace

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
  static_cast<void>(connect());
}

std::shared_ptr<Connection> SessionLink::connect() {
  auto connection = current();
  if (connection && !connection->hasEnded()) return connection;
  if (_isClosed || pauseLeft() > Duration::zero()) return nullptr;
  connection = makeConnection();
  if (!connection) {
    _pause = std::clamp(2 * _pause, kFirstPause, kLongestPause);
    _nextAttempt = _runtime.loop().clock().steadyTime() + _pause;
    return nullptr;
  }
  _pause = Duration::zero();
  setCurrent(connection);
  describeSession(connection);
  return connection;
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
  return std::max<Duration>(Duration::zero(), _nextAttempt - _runtime.loop().clock().steadyTime());
}

std::shared_ptr<Connection> SessionLink::makeConnection() {
  auto made = connectToDaemon(_runtime, _queue);
  if (!made && isDistrust(made.error())) {
    log::error("initWithSessionInfo: %s", made.error());
    return nullptr;
  }
  if (!made) {
    log::standard(texts::kFailedToConnect);
    log::debug("initWithSessionInfo: %s", made.error());
    return nullptr;
  }
  const std::shared_ptr<Connection> connection = std::move(*made);
  connection->setExportedDispatcher(std::make_shared<ReplyInterfaceDispatcher>(_exported));
  connection->setInvalidationHandler([] { log::standard(texts::kConnectionInvalidated); });
  connection->setInterruptionHandler([self = weak_from_this(), interrupted = std::weak_ptr(connection)] {
    log::standard(texts::kConnectionInterrupted);
    if (const auto link = self.lock()) link->wasInterrupted(interrupted);
  });
  connection->resume();
  return connection;
}

void SessionLink::describeSession(const std::shared_ptr<Connection>& connection) {
  SessionInterfaceProxy proxy(connection, loggingHandler(texts::kInitProxyFailure));
  proxy.setSessionInfo(_description.sessionInfo, _description.userInfo, _description.frameworksToCheck,
                       _description.hasAggregationBlock);
  if (_description.digestKey) proxy.setDigestKey(*_description.digestKey, _description.digestAlgorithm);
  if (!_description.isConfigured) return;
  proxy.startConfigWithCompletionHandler([lists = _lists](const std::optional<PropertyArray>& enabled,
                                                          const std::optional<PropertyArray>& whitelist,
                                                          const std::optional<PropertyArray>& blacklist) {
    lists->replace(std::make_shared<const EventLists>(enabled, whitelist, blacklist));
    log::standard(texts::kCachedLists, enabled ? enabled->size() : 0, whitelist, blacklist);
  });
}

void SessionLink::wasInterrupted(const std::weak_ptr<Connection>& connection) {
  const auto interrupted = connection.lock();
  if (!interrupted) return;
  interrupted->invalidate();  // drops its handlers
  if (current() == interrupted) setCurrent(nullptr);
  _whenInterrupted();
}

void SessionLink::close() {
  _isClosed = true;
  if (const auto connection = current()) connection->closeAfterSending();
}

}  // namespace velk
