// What the backends' states are, and how they follow the user info and the parent session.
#include "connectivity/ReportingSessionConnectivityHelper.h"
#include "foundation/Format.h"
#include "ipc/Vocabulary.h"
#include "platform/Log.h"
#include "session/ClientSession.h"
#include "session/LogTexts.h"

namespace velk {

namespace {

void reportMissingParent(const SessionBackends& backends, std::uint32_t sessionID, std::uint32_t level) {
  if (level == 0) return;
  for (const auto& entry : backends) log::standard(session_texts::kParentMissing, sessionID, entry.name, level);
}

void followParent(const SessionBackends::Entry& entry, std::int32_t state, const SessionBackends* parentBackends) {
  const auto* parent = parentBackends != nullptr ? parentBackends->find(entry.name) : nullptr;
  if (parent == nullptr) {
    log::standard(session_texts::kParentWithoutBackend, entry.name, state);
    return;
  }
  const std::int32_t newState = parent->state();
  const auto threshold = parent->samplingThreshold();
  entry.backend->setState(newState);
  entry.backend->setSamplingThreshold(threshold);
  log::standard(session_texts::kStateFromParent, entry.name, newState, threshold.value_or(0) * 100);
}

}  // namespace

void ClientSession::updateUserInfoForBackends() {
  const auto& backends = ownBackends();
  if (!backends) return;
  for (const auto& entry : *backends) {
    entry.backend->setUserInfoDict(ownUserInfo());
    // The algorithm of setDigestKey is not kept, so this hands on 0 with the key.
    if (entry.name == kVelkReportingBackendQRS) entry.backend->setDigestKey(_digestKey, _digestAlgorithm);
  }
}

bool ClientSession::updateReportingStates() {
  bool anyEnabled = false;
  const auto& backends = ownBackends();
  if (!backends) return anyEnabled;
  for (const auto& entry : *backends) {
    if (entry.backend->updateState() == kBackendEnabled) anyEnabled = true;
  }
  return anyEnabled;
}

void ClientSession::updateSessionWithDefaultSessionInfo() {
  if (updateReportingStates() && ownHelper()) ownHelper()->activate(_connectivityHelperReleaseTimeout);
  _delegate.updateDownstreamSessions(*this);
}

void ClientSession::replyWithStates(ConfigurationReply reply) const {
  const SessionBackends* backends = ownBackends().get();
  reply(fetchReportingStates(backends), fetchWhitelistedEvents(backends), fetchBlacklistedEvents(backends));
}

void ClientSession::syncReportingStates() {
  // Named before the lock is taken, so that nothing is destroyed under it.
  const auto own = backends();
  std::shared_ptr<ReportingdSession> parent;
  std::shared_ptr<const SessionBackends> parentBackends;
  Guard guard(_delegate.monitor());
  parent = _delegate.parentSessionForChild(*this);
  if (!own) return;
  if (!parent) {
    reportMissingParent(*own, sessionID(), hierarchyLevel());
    return;
  }
  parentBackends = parent->backends();
  for (const auto& entry : *own) {
    const std::int32_t state = entry.backend->state();
    if (state != kBackendWaiting) followParent(entry, state, parentBackends.get());
  }
}

void ClientSession::updateCombinedSessionID() {
  const auto parentID = _delegate.parentSessionIDStringForSession(*this);
  if (!parentID) return;
  const std::string combined = formatText("%@.%@", {*parentID, _sessionIDString});
  log::standard(session_texts::kUpdatingCombinedSessionID, combined, sessionID());
  const auto own = backends();
  if (!own) return;
  for (const auto& entry : *own) entry.backend->setCorrelatedSessionID(combined);
}

}  // namespace velk
