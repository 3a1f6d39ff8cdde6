// Creation, and what other threads read.
#include "session/ReportingdSession.h"

#include "foundation/Base64.h"
#include "foundation/Format.h"
#include "foundation/Uuid.h"
#include "ipc/Vocabulary.h"
#include "platform/Log.h"
#include "session/ClientSession.h"
#include "session/LogTexts.h"
#include "session/SessionConstants.h"

namespace velk {

std::shared_ptr<ReportingdSession> ReportingdSession::initWithSessionDelegate(
    ReportingdSessionDelegate& delegate, std::shared_ptr<SessionConnection> connection,
    const SessionServices& services) {
  return std::make_shared<ClientSession>(delegate, std::move(connection), services);
}

namespace {

std::shared_ptr<PostSender> newSender() {
  static std::atomic<std::uint64_t> last{0};
  return std::make_shared<PostSender>(PostSender{.number = ++last});
}

}  // namespace

ClientSession::ClientSession(ReportingdSessionDelegate& delegate, std::shared_ptr<SessionConnection> connection,
                             const SessionServices& services)
    : _delegate(delegate),
      _services(services),
      _sessionIDString(base64Encoded(randomUuid())),
      _sender(newSender()),
      _connectivityHelperReleaseTimeout(kDefaultReleaseTimeout),
      _uploads(services.backends.platform.scheduler, services.backends.uploads, connection->user()),
      _connection(std::move(connection)) {
  log::standard(session_texts::kSessionInit, _delegate.description());
  readDeviceIdentifier();
  log::standard(session_texts::kSessionInitialized, _sessionIDString);
}

std::optional<PropertyDictionary> ClientSession::sessionInfo() const {
  Guard guard(_lock);
  return _sessionInfo;
}

std::optional<PropertyDictionary> ClientSession::userInfo() const {
  Guard guard(_lock);
  return _userInfo;
}

std::optional<std::string> ClientSession::hierarchyToken() const {
  Guard guard(_lock);
  return _hierarchy.token;
}

std::uint32_t ClientSession::hierarchyLevel() const {
  Guard guard(_lock);
  return _hierarchy.level;
}

std::shared_ptr<const SessionBackends> ClientSession::backends() const {
  Guard guard(_lock);
  return _backends;
}

bool ClientSession::hasValidUserInfoKeys() const {
  const auto info = userInfo();
  return info &&
         (info->contains(kVelkReportingUserInfoClientName) || info->contains(kVelkReportingUserInfoServiceName));
}

std::uint64_t ClientSession::batchedEventsSize() const { return velk::batchedEventsSize(backends().get()); }

std::string ClientSession::description() const {
  return formatText("<ReportingdSession %u, %s>", {sessionID(), _sessionIDString});
}

namespace {

// Clients may send anything under these keys; what is neither a number nor a text says nothing to a reader.
PropertyValue textOrNumber(const std::optional<PropertyDictionary>& dictionary, std::string_view key) {
  const PropertyValue* value = dictionary ? dictionary->find(key) : nullptr;
  const bool isShown = value != nullptr && (value->isNumber() || value->string() != nullptr);
  return isShown ? *value : PropertyValue();
}

PropertyArray statusOfBackends(const SessionBackends* backends) {
  PropertyArray list;
  if (backends == nullptr) return list;
  for (const auto& entry : *backends) {
    list.append(PropertyDictionary{{"name", entry.name},
                                   {"state", entry.backend->state()},
                                   {"batchedEvents", entry.backend->batchedEventsCount()},
                                   {"batchedBytes", entry.backend->batchedEventsSize()}});
  }
  return list;
}

}  // namespace

PropertyDictionary ClientSession::statusDictionary() const {
  const auto info = sessionInfo();
  const auto user = userInfo();
  const auto token = hierarchyToken();
  return PropertyDictionary{{"sessionID", sessionID()},
                            {"sessionIDString", _sessionIDString},
                            {"described", info.has_value()},
                            {"clientType", textOrNumber(info, kVelkReportingSessionInfoClientType)},
                            {"clientVersion", textOrNumber(info, kVelkReportingSessionInfoClientVersion)},
                            {"clientName", textOrNumber(user, kVelkReportingUserInfoClientName)},
                            {"serviceName", textOrNumber(user, kVelkReportingUserInfoServiceName)},
                            {"level", hierarchyLevel()},
                            {"token", token ? PropertyValue(*token) : PropertyValue()},
                            {"counted", isCounted()},
                            {"finished", _hasFinishedGracefully.load()},
                            {"hasAggregator", hasAggregator()},
                            {"backends", statusOfBackends(backends().get())}};
}

}  // namespace velk
