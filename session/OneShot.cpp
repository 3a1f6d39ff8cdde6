// Messages that bring their session info with them and configure the session on the way.
#include "connectivity/ReportingSessionConnectivityHelper.h"
#include "device/DeviceEnvironment.h"
#include "foundation/Format.h"
#include "ipc/Vocabulary.h"
#include "platform/Clock.h"
#include "platform/Log.h"
#include "session/ClientSession.h"
#include "session/LogTexts.h"
#include "session/SessionConstants.h"

namespace velk {

namespace {

bool passesLists(const SessionBackends::Entry& entry, std::uint16_t category) {
  if (!entry.backend->isWhitelistedEvent(category)) {
    log::standard(session_texts::kSingleNotWhitelisted, category, entry.name);
    return false;
  }
  if (entry.backend->isBlacklistedEvent(category)) {
    log::standard(session_texts::kSingleBlacklisted, category, entry.name);
    return false;
  }
  return true;
}

/// A payload that was never given stays absent.
std::optional<PropertyDictionary> singleMessage(const std::optional<PropertyDictionary>& payload,
                                                const DeviceEnvironment& environment) {
  std::optional<PropertyDictionary> message = payload;
  if (message && environment.isInternalBuild()) {
    message->set(kSerialNumberKey, environment.serialNumber().value_or(std::string(kUnknown)));
  }
  return message;
}

}  // namespace

void ClientSession::sendMessageWithSessionInfo(PropertyDictionary sessionInfo,
                                               std::optional<PropertyDictionary> userInfo, std::uint16_t category,
                                               std::uint16_t type, std::optional<PropertyDictionary> payload,
                                               TextReply reply) {
  storeSessionInfo(sessionInfo);
  // Before the limit, which would end a session that names no client type.
  if (!sessionInfo.contains(kVelkReportingSessionInfoClientType) ||
      !sessionInfo.contains(kVelkReportingSessionInfoSessionID)) {
    log::error(session_texts::kNoIdentifiers);
    reply(std::string(session_texts::kReplyNoIdentifiers));
    return;
  }
  if (_delegate.isActiveClientLimitReachedForSession(*this, sessionInfo)) {
    reply(formatText(session_texts::kReplyLimitExceeded, {userInfo}));
    return;
  }
  _sessionID = uint32Value(sessionInfo.find(kVelkReportingSessionInfoSessionID));
  storeHierarchy();
  _delegate.updateCorrelatedSessions(*this);
  log::standard(session_texts::kSendingWithSessionInfo, sessionID());
  const auto storebag = _delegate.storebagForSession(*this);
  if (!storebag) {
    reply(std::string(session_texts::kReplyNoStorebag));
    return;
  }
  sendOneMessageWithSessionInfo(std::move(sessionInfo), userInfo, storebag, category, type, payload);
  reply(std::string(session_texts::kReplyFinished));
}

void ClientSession::sendOneMessageWithSessionInfo(const std::optional<PropertyDictionary>& sessionInfo,
                                                  const std::optional<PropertyDictionary>& userInfo,
                                                  const std::optional<PropertyDictionary>& storebag,
                                                  std::uint16_t category, std::uint16_t type,
                                                  const std::optional<PropertyDictionary>& payload) {
  log::standard(session_texts::kSendingSingleMessage, sessionID());
  if (!sessionInfo || !storebag) {
    log::error(session_texts::kSingleWithNilParameters);
    return;
  }
  if (!userInfo) {
    log::error(session_texts::kSingleWithoutUserInfo);
    return;
  }
  readDeviceIdentifier();
  createBackendsWithStorebag(*storebag);
  const SessionBackends* backends = ownBackends().get();
  if (backends == nullptr || backends->empty()) {
    log::error(session_texts::kNoBackendsForSingle);
    return;
  }
  receivedUserInfo(userInfo);
  waitForRoom();
  const TimeValue now = _services.backends.platform.clock.wallTime();
  const auto message = singleMessage(payload, _services.backends.environment);
  for (const auto& entry : *backends) {
    entry.backend->updateState();
    entry.backend->setReportingSessionConnectivityDelegate(ownHelper());
    if (!passesLists(entry, category)) continue;
    const auto text = entry.backend->sendMessage(message, now, category, type, 0);
    if (!text) continue;
    _services.messageLog.writeToLogFile(formatText(session_texts::kMessageLogSingleMessage, {entry.name, *text}));
  }
}

}  // namespace velk
