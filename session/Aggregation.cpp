// Events on their way to the client that aggregates them. An event is only ever appended to the aggregator's bounded
// outbox: a peer that hangs costs its relatives a log line a minute, never time. Nothing is logged under a lock.
#include "platform/Log.h"
#include "session/ClientSession.h"
#include "session/LogTexts.h"

namespace velk {

namespace {

/// A client that does not read fails every event of its relatives in the same way.
constexpr Duration kFailureLineInterval = std::chrono::minutes(1);

void logFailure(const Result<void>& sent) {
  if (!sent) log::standard(session_texts::kProxyFailure, sent.error());
}

}  // namespace

void ClientSession::aggregateMessage(double timestamp, std::uint16_t category, std::uint16_t type,
                                     const PropertyDictionary* payload) {
  const bool mayHaveAncestors = ownHierarchy().token && ownHierarchy().level > 0;
  if (!mayHaveAncestors && !hasAggregator()) return;  // nobody could listen: spare the merge and the agent's lock
  std::optional<PropertyDictionary> merged;
  if (payload != nullptr) {
    merged = *payload;
    if (ownUserInfo()) merged->merge(*ownUserInfo());
  }
  Result<void> sent;
  std::shared_ptr<ReportingdSession> ancestor;
  if (mayHaveAncestors) {
    Guard guard(_delegate.monitor());
    ancestor = _delegate.getAncestorWithAggregatorForSession(*this);
    if (ancestor) sent = ancestor->sendToAggregator(ownSessionInfo(), timestamp, category, type, merged);
  }
  if (!ancestor && hasAggregator()) sent = sendToAggregator(ownSessionInfo(), timestamp, category, type, merged);
  if (sent) return;
  const bool isNews = ancestor ? ancestor->takesAggregatorFailureLine() : takesAggregatorFailureLine();
  if (isNews) logFailure(sent);
}

Result<void> ClientSession::sendToAggregator(const std::optional<PropertyDictionary>& sessionInfo, double timestamp,
                                             std::uint16_t category, std::uint16_t type,
                                             const std::optional<PropertyDictionary>& payload) {
  Guard guard(_aggregationLock);
  if (!_hasAggregator) return {};  // ended since the caller looked: nothing follows the end marker
  return appendToConnection(sessionInfo, timestamp, category, type, payload);
}

bool ClientSession::takesAggregatorFailureLine() {
  const auto now = _services.backends.platform.clock.steadyTime();
  Guard guard(_aggregationLock);
  if (_lastFailureLine && now - *_lastFailureLine < kFailureLineInterval) return false;
  _lastFailureLine = now;
  return true;
}

void ClientSession::shutdownSessionAggregation() {
  log::standard(session_texts::kDisableAggregation, sessionID());
  Result<void> sent;
  {
    Guard guard(_aggregationLock);
    if (_hasAggregator) sent = appendToConnection(std::nullopt, 0, 0, 0, std::nullopt);
    _hasAggregator = false;
  }
  logFailure(sent);
}

Result<void> ClientSession::appendToConnection(const std::optional<PropertyDictionary>& sessionInfo, double timestamp,
                                               std::uint16_t category, std::uint16_t type,
                                               const std::optional<PropertyDictionary>& payload) {
  std::shared_ptr<SessionConnection> connection;
  {
    Guard guard(_lock);
    connection = _connection;
  }
  if (!connection) return {};  // ended by ourselves: there is nobody left to tell
  return connection->sendMessageToClient(sessionInfo, timestamp, category, type, payload);
}

}  // namespace velk
