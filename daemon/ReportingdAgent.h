// The daemon's one agent: it takes connections, makes a session for each, and keeps what sessions share - hierarchies,
// shared data, storebags, transports, the keep-alive transaction and the counts of active clients. It is the delegate
// of every session and of every shared transport.
//
// Made by the daemon's process before the listener is resumed; outlives all sessions and transports. All methods may
// be called from any thread. Its lock is re-entrant and held during a cold storebag fetch: who waits for it may wait
// for seconds. Lock order: this lock, then the storebag lock; never a wait for the state queue of the transports under
// this lock.
//
// A connection: offered -> refused | accepted (session made, listed) -> counted at its first session info
//   -> its client gone (no longer active, while what it left behind still runs) -> invalidated (out of all tables) ->
//   torn down (on the connection's queue, no lock held)
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "connectivity/ConnectivityInterface.h"
#include "daemon/ActiveClientCounter.h"
#include "daemon/CorrelatedSessions.h"
#include "daemon/IncomingConnection.h"
#include "daemon/KeepAliveCounter.h"
#include "daemon/SessionCensus.h"
#include "daemon/SharedConnectivityHelpers.h"
#include "daemon/SharedDataTable.h"
#include "daemon/StatusReport.h"
#include "daemon/StorebagMemoryCache.h"
#include "platform/Platform.h"
#include "session/ReportingdSession.h"

namespace velk {

class StorebagService;

class ReportingdAgent final : public ReportingdSessionDelegate,
                              public ConnectivityHelperDelegate,
                              public std::enable_shared_from_this<ReportingdAgent> {
 public:
  using SessionFactory =
      std::function<std::shared_ptr<ReportingdSession>(ReportingdSessionDelegate&, std::shared_ptr<SessionConnection>)>;

  /// What `platform` refers to outlives the agent.
  [[nodiscard]] static std::shared_ptr<ReportingdAgent> make(const Platform& platform,
                                                             std::shared_ptr<StorebagService> storebagService,
                                                             SessionFactory makeSession);

  /// The listener's question. True: the connection has a session and was resumed. False: nothing was touched, and the
  /// listener closes it. May wait for the agent's lock.
  [[nodiscard]] bool shouldAcceptNewConnection(const std::shared_ptr<IncomingConnection>& connection);

  [[nodiscard]] std::shared_ptr<ReportingdSession> createReportingSessionWithDelegate(
      ReportingdSessionDelegate& delegate, std::shared_ptr<SessionConnection> connection);
  /// Takes the session out of every table. Its teardown follows, without the lock.
  void invalidateReportingSession(const std::shared_ptr<ReportingdSession>& session);

  /// The storebags in memory are fetched again when next asked for, by a transport that has asked for nothing before.
  void refreshStorebags();

  /// Ends every connection. Only posts.
  void invalidateAllSessions();
  /// False when sessions were left after `limit`. Not on a connection's queue.
  [[nodiscard]] bool waitForTeardowns(Duration limit) { return _census.waitUntilNone(limit); }
  /// After the teardowns: transports finish their tasks and give back what they hold. Only posts.
  void invalidateAllConnectivityHelpers() { _connectivityHelpers->invalidateAll(); }

  /// Sessions, transports, storebags and counters, for people. Waits for the lock, and works without it. `reader` is
  /// the session that asks, if one does: see `statusReport`.
  [[nodiscard]] PropertyDictionary copyStatus(const ReportingdSession* reader = nullptr);

  // ReportingdSessionDelegate
  [[nodiscard]] std::optional<PropertyDictionary> storebagForSession(ReportingdSession& session) override;
  [[nodiscard]] std::optional<std::string> storebagVersionForSession(ReportingdSession& session) override;
  [[nodiscard]] std::optional<std::string> parentSessionIDStringForSession(ReportingdSession& session) override;
  void updateCorrelatedSessions(ReportingdSession& session) override;
  [[nodiscard]] std::shared_ptr<ReportingdSession> getAncestorWithAggregatorForSession(
      ReportingdSession& session) override;
  void updateDownstreamSessions(ReportingdSession& session) override;
  [[nodiscard]] std::shared_ptr<ReportingdSession> parentSessionForChild(ReportingdSession& session) override;
  void updateSharedDataForSession(ReportingdSession& session, const PropertyDictionary& sharedData) override;
  void removeObjectFromSharedDataForSession(ReportingdSession& session, const std::string& key) override;
  [[nodiscard]] std::optional<PropertyDictionary> sharedDataForSession(ReportingdSession& session) override;
  [[nodiscard]] ReportingAgentState copyReportingAgentState() override;
  /// Of ConnectivityHelperDelegate as well.
  void releaseIPCTransactions(std::uint32_t count) override;
  [[nodiscard]] std::shared_ptr<ReportingSessionConnectivityHelper> copySharedConnectivityHelperForReportingSession(
      ReportingdSession& session, std::int32_t mode) override;
  void releaseSharedConnectivityHelperForReportingSession(ReportingdSession& session) override;
  [[nodiscard]] bool isActiveClientLimitReachedForSession(ReportingdSession& session,
                                                          const PropertyDictionary& sessionInfo) override;
  [[nodiscard]] Monitor& monitor() override VELK_RETURN_CAPABILITY(_monitor) { return _monitor; }
  [[nodiscard]] std::string description() const override { return "<ReportingdAgent>"; }

 private:
  ReportingdAgent(const Platform& platform, std::shared_ptr<StorebagService> storebagService,
                  SessionFactory makeSession);

  [[nodiscard]] AgentSnapshot snapshot();
  void clientHasGone(const std::shared_ptr<ReportingdSession>& session);
  void connectionWasInvalidated(const std::shared_ptr<ReportingdSession>& session);
  /// True when the session names a client type.
  bool decrementActiveClientsLocked(const ReportingdSession& session) VELK_REQUIRES(_monitor);

  // Constant after construction.
  const Platform _platform;
  const std::shared_ptr<StorebagService> _storebagService;
  const SessionFactory _makeSession;
  /// Takes the lock for the thread that moves bytes, which must not.
  const std::shared_ptr<Queue> _departures;

  // Self-synchronised.
  const std::shared_ptr<SharedConnectivityHelpers> _connectivityHelpers;
  SessionCensus _census;

  // The agent's lock, and what it guards.
  Monitor _monitor;
  std::vector<std::shared_ptr<ReportingdSession>> _sessionList VELK_GUARDED_BY(_monitor);
  StorebagMemoryCache _cachedStorebags VELK_GUARDED_BY(_monitor);
  CorrelatedSessions _correlatedSessions VELK_GUARDED_BY(_monitor);
  SharedDataTable _sharedData VELK_GUARDED_BY(_monitor);
  KeepAliveCounter _keepAlive VELK_GUARDED_BY(_monitor);
  ActiveClientCounter _activeClients VELK_GUARDED_BY(_monitor);
  /// Listed sessions whose client has gone; true: its place among the active ones has been given back.
  std::unordered_map<const ReportingdSession*, bool> _departed VELK_GUARDED_BY(_monitor);
};

}  // namespace velk
