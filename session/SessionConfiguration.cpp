// How a session takes in its description and its user, and how it gets its backends.
#include <array>
#include <cstring>

#include "connectivity/ReportingSessionConnectivityHelper.h"
#include "device/DeviceEnvironment.h"
#include "ipc/Vocabulary.h"
#include "platform/Log.h"
#include "session/ClientSession.h"
#include "session/LogTexts.h"
#include "session/SessionConstants.h"

namespace velk {

namespace {

constexpr std::string_view kReleaseTimeoutKey = "release_timeout";
/// 40 digits and an end.
constexpr std::size_t kDeviceIdentifierSize = 41;

/// An absent new value counts as changed, even when there was none before.
bool hasChanged(const PropertyDictionary& before, const std::optional<PropertyDictionary>& after,
                std::string_view key) {
  const PropertyValue* newValue = after ? after->find(key) : nullptr;
  if (newValue == nullptr) return true;
  const PropertyValue* oldValue = before.find(key);
  return oldValue == nullptr || *oldValue != *newValue;
}

}  // namespace

void ClientSession::setSessionInfo(PropertyDictionary sessionInfo, std::optional<PropertyDictionary> userInfo,
                                   PropertyArray frameworksToCheck, bool hasAggregationBlock) {
  storeSessionInfo(sessionInfo);
  if (_delegate.isActiveClientLimitReachedForSession(*this, sessionInfo)) return;
  _sessionID = uint32Value(sessionInfo.find(kVelkReportingSessionInfoSessionID));
  log::standard(session_texts::kConfiguringSession, sessionID());
  // For this warning alone an absent key counts as false.
  if (userInfo && !booleanValue(sessionInfo.find(kVelkReportingSessionInfoRequireUserInfo))) {
    log::error(session_texts::kUserInfoNotRequired);
  }
  storeHierarchy();
  _delegate.updateCorrelatedSessions(*this);
  _frameworks = std::move(frameworksToCheck);
  updateUserInfo(std::move(userInfo));
  setAggregator(hasAggregationBlock);
}

void ClientSession::startConfigWithCompletionHandler(ConfigurationReply reply) {
  log::standard(session_texts::kStartingConfiguration, sessionID());
  const auto storebag = _delegate.storebagForSession(*this);
  if (!storebag) {
    reply(std::nullopt, std::nullopt, std::nullopt);
    return;
  }
  if (ownBackends()) {
    log::error(session_texts::kConfiguredMoreThanOnce, sessionID());
  } else {
    _storebagVersion = _delegate.storebagVersionForSession(*this);
    createBackendsWithStorebag(*storebag);
    updateSessionWithDefaultSessionInfo();
    sendStartMessage();
  }
  replyWithStates(std::move(reply));
}

void ClientSession::fetchStatesWithUserInfo(std::optional<PropertyDictionary> userInfo, ConfigurationReply reply) {
  if (_delegate.isActiveClientLimitReachedForSession(*this, ownSessionInfo().value_or(PropertyDictionary()))) {
    reply(std::nullopt, std::nullopt, std::nullopt);
    return;
  }
  log::standard(session_texts::kFetchingStates, sessionID());
  receivedUserInfo(userInfo);
  replyWithStates(std::move(reply));
}

void ClientSession::setDigestKey(ByteData key, std::int32_t algorithm) {
  _digestKey = std::move(key);
  const auto& backends = ownBackends();
  if (!backends) return;
  if (auto* backend = backends->find(kVelkReportingBackendQRS)) backend->setDigestKey(_digestKey, algorithm);
}

void ClientSession::storeSessionInfo(PropertyDictionary sessionInfo) {
  std::optional<PropertyDictionary> stored(std::move(sessionInfo));
  Guard guard(_lock);
  _sessionInfo.swap(stored);
}

void ClientSession::storeHierarchy() {
  Hierarchy hierarchy;
  if (const auto* dictionary = ownSessionInfo()->dictionary(kVelkReportingSessionInfoHierarchyToken)) {
    if (const auto* token = dictionary->string(kVelkReportingHierarchyTokenTokenID)) hierarchy.token = *token;
    hierarchy.level = uint32Value(dictionary->find(kVelkReportingHierarchyTokenLevel));
  }
  Guard guard(_lock);
  std::swap(_hierarchy, hierarchy);
}

void ClientSession::storeUserInfo(std::optional<PropertyDictionary> userInfo) {
  Guard guard(_lock);
  _userInfo.swap(userInfo);
}

void ClientSession::storeHelper(std::shared_ptr<ReportingSessionConnectivityHelper> helper) {
  Guard guard(_lock);
  _connectivityHelper.swap(helper);
}

void ClientSession::readDeviceIdentifier() {
  std::array<char, kDeviceIdentifierSize> buffer{};
  _services.backends.environment.uniqueDeviceIdentifier(buffer);
  const std::size_t length = strnlen(buffer.data(), buffer.size());
  // Without an answer what was read before stands.
  if (length > 0) _deviceIdentifier.assign(buffer.data(), length);
}

void ClientSession::releaseUserInfo() {
  // The agent finds the helper by the user info that is still stored.
  if (ownUserInfo()) _delegate.releaseSharedConnectivityHelperForReportingSession(*this);
  storeUserInfo(std::nullopt);
  storeHelper(nullptr);
}

void ClientSession::updateUserInfo(std::optional<PropertyDictionary> userInfo) {
  releaseUserInfo();
  storeUserInfo(std::move(userInfo));
  if (!hasValidUserInfoKeys()) return;
  storeHelper(_delegate.copySharedConnectivityHelperForReportingSession(
      *this, ReportingSessionConnectivityHelper::POSTRequestMode()));
  if (!ownHelper()) return;
  ownHelper()->setReleaseTimeout(_connectivityHelperReleaseTimeout);
  if (!ownBackends()) return;
  for (const auto& entry : *ownBackends()) entry.backend->setReportingSessionConnectivityDelegate(ownHelper());
}

void ClientSession::receivedUserInfo(const std::optional<PropertyDictionary>& userInfo) {
  bool changed = true;
  if (const auto& held = ownUserInfo()) {
    if (!userInfo && requiresUserInfo(ownSessionInfo().value_or(PropertyDictionary()))) return;
    changed = hasChanged(*held, userInfo, kVelkReportingUserInfoClientName) ||
              hasChanged(*held, userInfo, kVelkReportingUserInfoServiceName);
  } else if (!userInfo) {
    return;
  }
  updateUserInfo(userInfo);
  updateUserInfoForBackends();
  if (!changed) return;
  log::standard(session_texts::kReceivedUserInfo, sessionID());
  updateSessionWithDefaultSessionInfo();
}

void ClientSession::createBackendsWithStorebag(const PropertyDictionary& storebag) {
  log::standard(session_texts::kCreatingBackends, sessionID());
  const PropertyValue* releaseTimeout = storebag.find(kReleaseTimeoutKey);
  _connectivityHelperReleaseTimeout = releaseTimeout != nullptr ? uint32Value(releaseTimeout) : kDefaultReleaseTimeout;
  // For backends that become enabled later, on whatever thread.
  if (ownHelper()) ownHelper()->setReleaseTimeout(_connectivityHelperReleaseTimeout);
  const auto& info = ownSessionInfo();
  auto backends = createBackends(&storebag, info ? &*info : nullptr, ownUserInfo(), _deviceIdentifier, _services);
  if (backends) {
    for (const auto& entry : *backends) {
      entry.backend->setSender(_sender);
      entry.backend->setReportingSessionConnectivityDelegate(ownHelper());
      entry.backend->setCorrelatedSessionID(_sessionIDString);
    }
  }
  // The batches of the old ones would go with them.
  if (ownBackends() && !ownBackends()->empty()) flushBackends(FlushReply());
  publishBackends(std::move(backends));
}

void ClientSession::publishBackends(std::shared_ptr<const SessionBackends> backends) {
  {
    Guard guard(_lock);
    _backends.swap(backends);
  }
  // What they replace has nobody else to end its timers and sockets.
  if (!backends) return;
  for (const auto& entry : *backends) entry.backend->cleanup();
}

void ClientSession::setAggregator(bool hasAggregator) {
  Guard guard(_aggregationLock);
  _hasAggregator = hasAggregator;
}

}  // namespace velk
