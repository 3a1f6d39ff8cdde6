// The path of one event from the client to the backends.
#include "connectivity/ReportingSessionConnectivityHelper.h"
#include "device/DeviceEnvironment.h"
#include "foundation/Format.h"
#include "ipc/Vocabulary.h"
#include "platform/Clock.h"
#include "platform/DeviceInformation.h"
#include "platform/Log.h"
#include "session/ClientSession.h"
#include "session/LogTexts.h"
#include "session/SessionConstants.h"

namespace velk {

namespace {

bool passesLists(const SessionBackends::Entry& entry, std::uint16_t category) {
  if (!entry.backend->isWhitelistedEvent(category)) {
    log::standard(session_texts::kDroppingNotWhitelisted, category, entry.name);
    return false;
  }
  if (entry.backend->isBlacklistedEvent(category)) {
    log::standard(session_texts::kDroppingBlacklisted, category, entry.name);
    return false;
  }
  return true;
}

/// A later post backend wins over an earlier one; the dashboard speaks only while nobody else has.
void chooseReply(std::optional<std::string>& chosen, SessionBackends::Kind kind, std::string text) {
  if (kind == SessionBackends::Kind::post || (kind == SessionBackends::Kind::dashboard && !chosen)) {
    chosen = std::move(text);
  }
}

std::string orUnknown(std::optional<std::string> answer) { return answer ? std::move(*answer) : std::string(kUnknown); }

}  // namespace

void ClientSession::sendMessageWithDictionary(PropertyDictionary dictionary, TextReply reply) {
  log::standard(session_texts::kSendingMessage, sessionID());
  if (_sender->hasPosted) waitForRoom();
  reply(sendMessageWithDictionary(dictionary));
}

void ClientSession::waitForRoom() {
  _sender->hasPosted = false;
  if (ownHelper() && !_clientHasGone) ownHelper()->waitForRoom(_sender->number);
}

std::optional<std::string> ClientSession::sendMessageWithDictionary(const PropertyDictionary& dictionary) {
  const SessionBackends* backends = ownBackends().get();
  if (backends == nullptr) {
    log::standard(session_texts::kNoBackendsForMessage);
    return std::nullopt;
  }
  const PropertyValue* categoryValue = dictionary.find(kVelkReportingMessageParametersCategory);
  if (categoryValue == nullptr) {
    log::standard(session_texts::kMissingCategory);
    return std::nullopt;
  }
  const PropertyValue* typeValue = dictionary.find(kVelkReportingMessageParametersType);
  if (typeValue == nullptr) {
    log::standard(session_texts::kMissingType);
    return std::nullopt;
  }
  const std::uint16_t category = uint16Value(categoryValue);
  const std::uint16_t type = uint16Value(typeValue);
  const PropertyDictionary* payload = dictionary.dictionary(kVelkReportingMessageParametersPayload);
  const std::uint32_t flag = uint32Value(dictionary.find(kVelkReportingMessageParametersFlag));
  const TimeValue now = _services.backends.platform.clock.wallTime();

  aggregateMessage(secondsFromTimeValue(now), category, type, payload);
  const std::optional<PropertyDictionary> blob = makeMessageBlob(payload);
  std::optional<std::string> chosen;
  for (const auto& entry : *backends) {
    if (!passesLists(entry, category)) continue;
    auto text = entry.backend->sendMessage(blob, now, category, type, flag);
    if (!text) continue;
    _services.messageLog.writeToLogFile(formatText(session_texts::kMessageLogMessage, {entry.name, *text}));
    chooseReply(chosen, entry.kind, std::move(*text));
  }
  return chosen;
}

PropertyDictionary ClientSession::makeMessageBlob(const PropertyDictionary* payload) {
  PropertyDictionary blob;
  // Without a token there is no shared data, and no reason to wait for the agent.
  if (ownHierarchy().token) {
    std::optional<PropertyDictionary> shared;
    {
      Guard guard(_delegate.monitor());
      shared = _delegate.sharedDataForSession(*this);
    }
    if (shared) blob.set(kVelkReportingMessageBlobSharedData, std::move(*shared));
  }
  if (payload != nullptr) blob.set(kVelkReportingMessageBlobClientData, *payload);
  return blob;
}

void ClientSession::internalSendMessage(PropertyDictionary payload, std::uint16_t method, std::uint16_t respCode) {
  sendMessageWithDictionary(PropertyDictionary{{kVelkReportingMessageParametersCategory, method},
                                               {kVelkReportingMessageParametersType, respCode},
                                               {kVelkReportingMessageParametersPayload, std::move(payload)},
                                               {kVelkReportingMessageParametersFlag, 0}});
  log::standard(session_texts::kSentInternalMessage, method, respCode);
}

void ClientSession::sendStartMessage() {
  const DeviceEnvironment& environment = _services.backends.environment;
  const Locale& locale = _services.backends.platform.locale;
  PropertyDictionary payload;
  if (environment.isInternalBuild()) {
    payload.set(kSerialNumberKey, orUnknown(environment.serialNumber()));
    payload.set("Version", orUnknown(environment.productVersion()));
    payload.set("Build", orUnknown(environment.buildVersion()));
    payload.set("Hardware", orUnknown(environment.hardwareModel()));
    payload.set("Product", orUnknown(environment.deviceName()));
    payload.set("ReportVers", environment.frameworkVersion());
  }
  payload.set("Locale", orUnknown(locale.countryCode()));
  payload.set("AutomaticTimeSet", locale.automaticTimeZoneEnabled().value_or(true));
  internalSendMessage(std::move(payload), kInternalCategory, kStartMessageType);
}

void ClientSession::updateSharedDataWithDictionary(PropertyDictionary dictionary) {
  Guard guard(_delegate.monitor());
  _delegate.updateSharedDataForSession(*this, dictionary);
}

void ClientSession::updateSharedDataForKey(std::string key, std::optional<PropertyValue> value) {
  Guard guard(_delegate.monitor());
  if (value) {
    _delegate.updateSharedDataForSession(*this, PropertyDictionary{{key, std::move(*value)}});
  } else {
    _delegate.removeObjectFromSharedDataForSession(*this, key);
  }
}

}  // namespace velk
