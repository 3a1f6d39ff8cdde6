#include "daemon/ReportingdAgent.h"

#include <algorithm>

#include "daemon/LogTexts.h"
#include "daemon/StorebagService.h"
#include "device/DeviceEnvironment.h"
#include "ipc/Vocabulary.h"
#include "platform/Log.h"

namespace velk {

namespace {

// The session info's client type; nothing when there is none.
const PropertyValue* clientTypeIn(const PropertyDictionary& sessionInfo) {
  const auto* value = sessionInfo.find(kVelkReportingSessionInfoClientType);
  return value != nullptr && !value->isNull() ? value : nullptr;
}

}  // namespace

std::shared_ptr<ReportingdAgent> ReportingdAgent::make(const Platform& platform,
                                                       std::shared_ptr<StorebagService> storebagService,
                                                       SessionFactory makeSession) {
  return std::shared_ptr<ReportingdAgent>(
      new ReportingdAgent(platform, std::move(storebagService), std::move(makeSession)));
}

ReportingdAgent::ReportingdAgent(const Platform& platform, std::shared_ptr<StorebagService> storebagService,
                                 SessionFactory makeSession)
    : _platform(platform),
      _storebagService(std::move(storebagService)),
      _makeSession(std::move(makeSession)),
      _departures(platform.scheduler.makeSerialQueue("com.tavrin.velkreportingd.departures")),
      _connectivityHelpers(std::make_shared<SharedConnectivityHelpers>(platform)),
      _cachedStorebags(*_storebagService, platform.clock),
      _keepAlive(platform.keepAlive) {}

// ---- Connections

bool ReportingdAgent::shouldAcceptNewConnection(const std::shared_ptr<IncomingConnection>& connection) {
  if (!connection->valueOfEntitlement(kServiceEntitlement)) {
    log::standard(daemontexts::kConnectionRefused, connection->description());
    return false;
  }
  {
    Guard guard(_monitor);
    log::standard(daemontexts::kConnectionAccepted, connection->description(), _sessionList.size(),
                  _correlatedSessions.tokenCount());
  }
  _census.add();
  const auto session = createReportingSessionWithDelegate(*this, connection);
  StatusHandler status;
  if (connection->valueOfEntitlement(kStatusEntitlement)) {
    // The reply is encoded and sent on the reader's queue, when no lock is held any more.
    status = [weak = weak_from_this(), reader = std::weak_ptr(session)](StatusReply reply) {
      if (const auto agent = weak.lock()) reply(agent->copyStatus(reader.lock().get()));
    };
  }
  connection->setExportedObject(session, std::move(status));
  connection->setInterruptionHandler(
      [session] { log::standard(daemontexts::kConnectionInterrupted, session->description()); });
  connection->setInvalidationHandler(
      [agent = shared_from_this(), session] { agent->connectionWasInvalidated(session); });
  connection->setDepartureHandler([weak = weak_from_this(), gone = std::weak_ptr(session), queue = _departures] {
    queue->async([weak, gone] {
      const auto agent = weak.lock();
      const auto itsSession = gone.lock();
      if (agent && itsSession) agent->clientHasGone(itsSession);
    });
  });
  connection->resume();
  return true;
}

// A client that has gone is not active, however long what it left behind takes to run. A session that has not been
// counted yet gives its place back when it is.
void ReportingdAgent::clientHasGone(const std::shared_ptr<ReportingdSession>& session) {
  session->clientHasGone();
  Guard guard(_monitor);
  const bool isListed = std::find(_sessionList.begin(), _sessionList.end(), session) != _sessionList.end();
  if (isListed) _departed[session.get()] = session->isCounted() && decrementActiveClientsLocked(*session);
}

// On the connection's queue, behind everything that the peer had sent.
void ReportingdAgent::connectionWasInvalidated(const std::shared_ptr<ReportingdSession>& session) {
  log::standard(daemontexts::kConnectionInvalidated, session->description());
  invalidateReportingSession(session);
  session->teardown();
  _census.remove();
}

std::shared_ptr<ReportingdSession> ReportingdAgent::createReportingSessionWithDelegate(
    ReportingdSessionDelegate& delegate, std::shared_ptr<SessionConnection> connection) {
  auto session = _makeSession(delegate, std::move(connection));
  Guard guard(_monitor);
  _keepAlive.beginIfUnused(session->description());
  _sessionList.push_back(session);
  _keepAlive.retain();
  return session;
}

void ReportingdAgent::invalidateReportingSession(const std::shared_ptr<ReportingdSession>& session) {
  Guard guard(_monitor);
  for (const auto& token : _correlatedSessions.remove(*session)) _sharedData.drop(token);
  const auto description = session->description();
  std::erase(_sessionList, session);
  log::standard(daemontexts::kSessionInvalidated, description);
  const auto departed = _departed.extract(session.get());
  const bool isGivenBack = !departed.empty() && departed.mapped();
  // Whether this session was counted is not asked: one that never was still lowers its type's counter.
  if (!isGivenBack) decrementActiveClientsLocked(*session);
}

bool ReportingdAgent::decrementActiveClientsLocked(const ReportingdSession& session) {
  const auto sessionInfo = session.sessionInfo();
  const auto* value = sessionInfo ? clientTypeIn(*sessionInfo) : nullptr;
  if (value == nullptr) return false;
  const auto clientType = int32Value(value);
  if (const auto count = _activeClients.decrement(clientType)) {
    log::debug(daemontexts::kActiveCountDecremented, clientType, *count);
  }
  return true;
}

void ReportingdAgent::invalidateAllSessions() {
  for (const auto& session : copyReportingAgentState().sessions) session->invalidate();
}

// ---- Keep-alive and the active-client limit

void ReportingdAgent::releaseIPCTransactions(std::uint32_t count) {
  Guard guard(_monitor);
  _keepAlive.release(count);
}

bool ReportingdAgent::isActiveClientLimitReachedForSession(ReportingdSession& session,
                                                           const PropertyDictionary& sessionInfo) {
  Guard guard(_monitor);
  if (session.isCounted()) return false;
  session.setCounted(true);
  const auto* value = clientTypeIn(sessionInfo);
  if (value == nullptr) {
    log::error(daemontexts::kMissingClientType, session.sessionID(), sessionInfo);
    session.invalidate();
    return true;
  }
  const auto clientType = int32Value(value);
  const bool limitReached = _activeClients.isLimitReached(clientType);
  if (limitReached) log::error(daemontexts::kActiveLimitExceeded, session.sessionID(), *value);
  // The refused session is counted as well; its invalidation brings the counter down again.
  if (const auto count = _activeClients.increment(clientType)) {
    log::debug(daemontexts::kActiveCountIncremented, clientType, *count);
  }
  if (const auto departed = _departed.find(&session); departed != _departed.end()) {
    departed->second = decrementActiveClientsLocked(session);
  }
  if (limitReached) session.invalidate();
  return limitReached;
}

// ---- Storebags

std::optional<PropertyDictionary> ReportingdAgent::storebagForSession(ReportingdSession& session) {
  Guard guard(_monitor);
  return _cachedStorebags.storebagForSession(session);
}

std::optional<std::string> ReportingdAgent::storebagVersionForSession(ReportingdSession& session) {
  Guard guard(_monitor);
  return _cachedStorebags.storebagVersionForSession(session);
}

void ReportingdAgent::refreshStorebags() {
  _storebagService->startAfresh();
  Guard guard(_monitor);
  _cachedStorebags.expireAll();
}

// ---- Hierarchies

void ReportingdAgent::updateCorrelatedSessions(ReportingdSession& session) {
  Guard guard(_monitor);
  for (const auto& token : _correlatedSessions.add(session)) _sharedData.drop(token);
}

std::optional<std::string> ReportingdAgent::parentSessionIDStringForSession(ReportingdSession& session) {
  Guard guard(_monitor);
  return _correlatedSessions.parentSessionIDString(session);
}

std::shared_ptr<ReportingdSession> ReportingdAgent::parentSessionForChild(ReportingdSession& session) {
  Guard guard(_monitor);
  return _correlatedSessions.parent(session);
}

std::shared_ptr<ReportingdSession> ReportingdAgent::getAncestorWithAggregatorForSession(ReportingdSession& session) {
  Guard guard(_monitor);
  return _correlatedSessions.ancestorWithAggregator(session);
}

void ReportingdAgent::updateDownstreamSessions(ReportingdSession& session) {
  const auto token = session.hierarchyToken();
  if (!token) return;
  Guard guard(_monitor);
  // Every session below asks for its parent and its chain.
  const CorrelatedSessions::Survey survey(_correlatedSessions, *token);
  session.updateCombinedSessionID();
  session.syncReportingStates();
  const bool ancestorAggregates =
      session.hierarchyLevel() >= 1 && _correlatedSessions.ancestorWithAggregator(session) != nullptr;
  if (ancestorAggregates) session.shutdownSessionAggregation();
  for (const auto& deeper : _correlatedSessions.descendants(session)) {
    log::standard(daemontexts::kUpdatingDownstream, deeper->sessionID());
    deeper->updateCombinedSessionID();
    deeper->syncReportingStates();
    // Only the topmost aggregator of a hierarchy stays active.
    if ((ancestorAggregates || session.hasAggregator()) && deeper->hasAggregator()) {
      deeper->shutdownSessionAggregation();
    }
  }
}

// ---- Shared data and transports

void ReportingdAgent::updateSharedDataForSession(ReportingdSession& session, const PropertyDictionary& sharedData) {
  Guard guard(_monitor);
  if (_sharedData.merge(session.hierarchyToken(), sharedData)) return;
  log::error(
      "updateSharedDataForSession: session %u's data are not taken: those of its hierarchy would exceed %u bytes",
      session.sessionID(), SharedDataTable::kMaximumBytes);
}

void ReportingdAgent::removeObjectFromSharedDataForSession(ReportingdSession& session, const std::string& key) {
  Guard guard(_monitor);
  _sharedData.removeKey(session.hierarchyToken(), key);
}

std::optional<PropertyDictionary> ReportingdAgent::sharedDataForSession(ReportingdSession& session) {
  Guard guard(_monitor);
  return _sharedData.values(session.hierarchyToken());
}

std::shared_ptr<ReportingSessionConnectivityHelper> ReportingdAgent::copySharedConnectivityHelperForReportingSession(
    ReportingdSession& session, std::int32_t mode) {
  const auto userInfo = session.hasValidUserInfoKeys() ? session.userInfo() : std::nullopt;
  if (!userInfo) return nullptr;
  return _connectivityHelpers->request(*userInfo, mode, weak_from_this());
}

void ReportingdAgent::releaseSharedConnectivityHelperForReportingSession(ReportingdSession& session) {
  const auto userInfo = session.userInfo();
  if (!userInfo) return;
  if (session.hasValidUserInfoKeys()) {
    _connectivityHelpers->release(*userInfo);
  } else {
    // A session whose user info names nobody was given no transport and has none to give back, even though its
    // identifier reads like somebody's whose names are empty.
    log::standard(daemontexts::kReleasingHelper, userInfoIdentifierString(*userInfo));
  }
}

// ---- Snapshots

ReportingAgentState ReportingdAgent::copyReportingAgentState() {
  constexpr std::size_t kRoomForNewSessions = 8;
  std::size_t sessionCount = 0;
  {
    Guard guard(_monitor);
    sessionCount = _sessionList.size();
  }
  ReportingAgentState state;
  state.sessions.reserve(sessionCount + kRoomForNewSessions);
  Guard guard(_monitor);
  state.sessions.assign(_sessionList.begin(), _sessionList.end());
  state.cachedStorebags = _cachedStorebags.snapshot();
  return state;
}

AgentSnapshot ReportingdAgent::snapshot() {
  AgentSnapshot snapshot;
  Guard guard(_monitor);
  snapshot.sessions = _sessionList;
  snapshot.hierarchies = _correlatedSessions.snapshot();
  snapshot.storebags = _cachedStorebags.status();
  for (std::int32_t type = 0; type < ActiveClientCounter::kFirstUncountedType; ++type) {
    if (const auto count = _activeClients.count(type)) snapshot.activeClients.set(std::to_string(type), count);
  }
  snapshot.keepAliveCount = _keepAlive.count();
  return snapshot;
}

// The lock is free again while everybody is asked: a backend may have to be waited for.
PropertyDictionary ReportingdAgent::copyStatus(const ReportingdSession* reader) {
  return statusReport(snapshot(), reader, *_connectivityHelpers, _platform.process.anonymousMemory());
}

}  // namespace velk
