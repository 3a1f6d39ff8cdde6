// One client connection as the daemon sees it: what the agent and other sessions may read of it and ask it to do.
// The one implementation is ClientSession; the agent knows no more than this.
//
// Made by the agent when a connection is accepted; its interface methods run on the connection's queue, one at a
// time. Other sessions and status readers look at it from other threads through the snapshot getters.
//   created -> configured (session info stored) -> started (backends exist) -> invalidated -> torn down
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "ipc/SessionInterface.h"
#include "session/ReportingdSessionDelegate.h"
#include "session/SessionServices.h"

namespace velk {

class SessionBackends;

class ReportingdSession : public ClientSessionInterface, public std::enable_shared_from_this<ReportingdSession> {
 public:
  /// `delegate` and `services` outlive the session's teardown.
  [[nodiscard]] static std::shared_ptr<ReportingdSession> initWithSessionDelegate(
      ReportingdSessionDelegate& delegate, std::shared_ptr<SessionConnection> connection,
      const SessionServices& services);

  // What the agent reads, from any thread.
  [[nodiscard]] virtual std::optional<PropertyDictionary> sessionInfo() const = 0;
  [[nodiscard]] virtual std::optional<PropertyDictionary> userInfo() const = 0;
  [[nodiscard]] virtual std::uint32_t sessionID() const = 0;
  [[nodiscard]] virtual const std::string& sessionIDString() const = 0;
  /// Nothing for a standalone session.
  [[nodiscard]] virtual std::optional<std::string> hierarchyToken() const = 0;
  [[nodiscard]] virtual std::uint32_t hierarchyLevel() const = 0;
  [[nodiscard]] virtual bool hasAggregator() const = 0;
  [[nodiscard]] virtual bool hasValidUserInfoKeys() const = 0;
  /// Changed under the agent's lock only.
  [[nodiscard]] virtual bool isCounted() const = 0;
  virtual void setCounted(bool counted) = 0;
  /// Waits for the backends' state queues.
  [[nodiscard]] virtual std::uint64_t batchedEventsSize() const = 0;
  /// For `velkreportingctl status`. Waits for the backends' state queues: call it with no lock held.
  [[nodiscard]] virtual PropertyDictionary statusDictionary() const = 0;
  [[nodiscard]] virtual std::string description() const = 0;
  /// The backends of this moment, which never change their number; null before they are made and after teardown.
  [[nodiscard]] virtual std::shared_ptr<const SessionBackends> backends() const { return nullptr; }

  // What the agent and other sessions ask it to do. Any thread, the agent's lock held or not.
  virtual void updateCombinedSessionID() = 0;
  /// Waits for state queues (this session's and the parent's).
  virtual void syncReportingStates() = 0;
  virtual void shutdownSessionAggregation() = 0;
  /// Hands an event to this session's own client, unless aggregation has ended. Only appends to the connection's
  /// outbox; the error, for the caller to log once it holds no lock, says why that failed.
  [[nodiscard]] virtual Result<void> sendToAggregator(const std::optional<PropertyDictionary>& /*sessionInfo*/,
                                                      double /*timestamp*/, std::uint16_t /*category*/,
                                                      std::uint16_t /*type*/,
                                                      const std::optional<PropertyDictionary>& /*payload*/) {
    return {};
  }
  /// The peer has hung up. What it sent before still runs, and waits for no room in the transport. Waits for nothing.
  virtual void clientHasGone() {}
  /// Whether a failure of `sendToAggregator` is to be logged: one a minute for each aggregator. Asked with no lock
  /// held.
  [[nodiscard]] virtual bool takesAggregatorFailureLine() { return true; }
  /// Ends the connection. Only posts: may be called under the agent's lock.
  virtual void invalidate() = 0;
  /// The end: health message, flush, keep-alive, clean-up. Exactly once, on the connection's queue, after the agent
  /// has let the session go, with no lock held. Later calls do nothing.
  virtual void teardown() = 0;
};

}  // namespace velk
