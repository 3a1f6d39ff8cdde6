// Everything that a session needs of the daemon at large. The agent implements it; unit tests fake it.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "foundation/PropertyValue.h"
#include "platform/Lock.h"

namespace velk {

class ReportingdSession;
class ReportingSessionConnectivityHelper;

/// What a health report counts: the live sessions and the storebags in memory, by storebag name.
struct ReportingAgentState {
  std::vector<std::shared_ptr<ReportingdSession>> sessions;
  PropertyDictionary cachedStorebags;
};

/// Any thread; each method takes the agent's (re-entrant) lock where it needs it.
class ReportingdSessionDelegate {
 public:
  virtual ~ReportingdSessionDelegate() = default;

  /// The section of the session's client type, or nothing. May block for seconds in a cold fetch.
  [[nodiscard]] virtual std::optional<PropertyDictionary> storebagForSession(ReportingdSession& session) = 0;
  /// Never fetches.
  [[nodiscard]] virtual std::optional<std::string> storebagVersionForSession(ReportingdSession& session) = 0;

  [[nodiscard]] virtual std::optional<std::string> parentSessionIDStringForSession(ReportingdSession& session) = 0;
  virtual void updateCorrelatedSessions(ReportingdSession& session) = 0;
  [[nodiscard]] virtual std::shared_ptr<ReportingdSession> getAncestorWithAggregatorForSession(
      ReportingdSession& session) = 0;
  virtual void updateDownstreamSessions(ReportingdSession& session) = 0;
  [[nodiscard]] virtual std::shared_ptr<ReportingdSession> parentSessionForChild(ReportingdSession& session) = 0;

  virtual void updateSharedDataForSession(ReportingdSession& session, const PropertyDictionary& sharedData) = 0;
  virtual void removeObjectFromSharedDataForSession(ReportingdSession& session, const std::string& key) = 0;
  /// Nothing for a session without token or a token without data; an empty dictionary is data.
  [[nodiscard]] virtual std::optional<PropertyDictionary> sharedDataForSession(ReportingdSession& session) = 0;

  [[nodiscard]] virtual ReportingAgentState copyReportingAgentState() = 0;
  virtual void releaseIPCTransactions(std::uint32_t count) = 0;

  /// Null without valid user info. Waits for the agent's state queue: never call it with the agent's lock held.
  [[nodiscard]] virtual std::shared_ptr<ReportingSessionConnectivityHelper>
  copySharedConnectivityHelperForReportingSession(ReportingdSession& session, std::int32_t mode) = 0;
  /// Asynchronous. Called while `session.userInfo()` still is the one that a helper was asked for. A session whose user
  /// info was not valid, and which therefore holds none, calls it all the same: that gives nothing back.
  virtual void releaseSharedConnectivityHelperForReportingSession(ReportingdSession& session) = 0;

  /// True: the session has been terminated.
  [[nodiscard]] virtual bool isActiveClientLimitReachedForSession(ReportingdSession& session,
                                                                  const PropertyDictionary& sessionInfo) = 0;
  /// The agent's lock, for the few steps that a session makes under it.
  [[nodiscard]] virtual Monitor& monitor() = 0;
  /// For log lines.
  [[nodiscard]] virtual std::string description() const = 0;
};

}  // namespace velk
