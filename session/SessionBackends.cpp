#include "session/SessionBackends.h"

#include "device/DeviceEnvironment.h"
#include "ipc/Vocabulary.h"
#include "platform/Clock.h"
#include "platform/Log.h"
#include "session/LogTexts.h"

namespace velk {

namespace {

/// Client types whose events may hold nested containers: the second only on internal builds.
constexpr std::int32_t kNestedDataClientType = 28;
constexpr std::int32_t kInternalNestedDataClientType = 7;

SessionBackends::Kind kindOfName(std::string_view name) noexcept {
  if (name == kVelkReportingBackendHTTPPost2 || name.find(kVelkReportingBackendHTTPPost) != std::string_view::npos) {
    return SessionBackends::Kind::post;
  }
  return name == kVelkReportingBackendDashboard ? SessionBackends::Kind::dashboard : SessionBackends::Kind::other;
}

/// What all backends of one creation have in common, read once.
struct BackendAttributes {
  TimeValue startTimestamp;
  std::optional<std::string> productVersion;
  std::optional<std::string> buildVersion;
  std::optional<std::string> productType;
  std::optional<std::string> deviceName;
  std::string selfVersion;
  std::uint32_t sessionID = 0;
  std::int32_t clientType = 0;
  std::uint16_t clientVersion = 0;
  bool isInternal = false;
  bool requireUserInfo = true;
  bool batchEvents = false;
  bool allowNestedData = false;
};

BackendAttributes readAttributes(const PropertyDictionary& sessionInfo, const BackendContext& context) {
  const DeviceEnvironment& environment = context.environment;
  BackendAttributes attributes;
  attributes.startTimestamp = context.platform.clock.wallTime();
  attributes.productVersion = environment.productVersion();
  attributes.buildVersion = environment.buildVersion();
  attributes.productType = environment.productType();
  attributes.deviceName = environment.deviceName();
  attributes.selfVersion = environment.frameworkVersion();
  attributes.isInternal = environment.isInternalBuild();
  attributes.sessionID = uint32Value(sessionInfo.find(kVelkReportingSessionInfoSessionID));
  attributes.clientType = int32Value(sessionInfo.find(kVelkReportingSessionInfoClientType));
  attributes.clientVersion = uint16Value(sessionInfo.find(kVelkReportingSessionInfoClientVersion));
  attributes.requireUserInfo = requiresUserInfo(sessionInfo);
  attributes.batchEvents = booleanValue(sessionInfo.find(kVelkReportingSessionInfoBatchEvent));
  attributes.allowNestedData = attributes.clientType == kNestedDataClientType ||
                               (attributes.isInternal && attributes.clientType == kInternalNestedDataClientType);
  return attributes;
}

void configure(VelkReportingBackend& backend, const BackendAttributes& attributes,
               const std::optional<PropertyDictionary>& userInfo, const std::string& deviceIdentifier) {
  backend.setSessionID(attributes.sessionID);
  backend.setCompType(attributes.clientType);
  backend.setClientVersion(attributes.clientVersion);
  backend.setUdid(deviceIdentifier);
  backend.setProductVersion(attributes.productVersion);
  backend.setBuildVersion(attributes.buildVersion);
  backend.setHardwareType(attributes.productType);
  backend.setIsInternal(attributes.isInternal);
  backend.setRequireUserInfo(attributes.requireUserInfo);
  backend.setBatchEvents(attributes.batchEvents);
  backend.setAllowNestedData(attributes.allowNestedData);
  backend.setUserInfoDict(userInfo);
  backend.setSelfVersion(attributes.selfVersion);
  backend.setStartTimestamp(attributes.startTimestamp);
}

}  // namespace

void SessionBackends::append(std::string name, std::shared_ptr<VelkReportingBackend> backend) {
  const Kind kind = kindOfName(name);
  _entries.push_back(Entry{std::move(name), std::move(backend), kind});
}

VelkReportingBackend* SessionBackends::find(std::string_view name) const noexcept {
  for (const Entry& entry : _entries) {
    if (entry.name == name) return entry.backend.get();
  }
  return nullptr;
}

bool requiresUserInfo(const PropertyDictionary& sessionInfo) noexcept {
  const PropertyValue* required = sessionInfo.find(kVelkReportingSessionInfoRequireUserInfo);
  return required == nullptr || booleanValue(required);
}

std::shared_ptr<const SessionBackends> createBackends(const PropertyDictionary* storebag,
                                                      const PropertyDictionary* sessionInfo,
                                                      const std::optional<PropertyDictionary>& userInfo,
                                                      const std::string& deviceIdentifier,
                                                      const SessionServices& services) {
  if (storebag == nullptr) {
    log::error(session_texts::kBackendsWithoutStorebag);
    return nullptr;
  }
  if (sessionInfo == nullptr) {
    log::error(session_texts::kBackendsWithoutSessionInfo);
    return nullptr;
  }
  const BackendAttributes attributes = readAttributes(*sessionInfo, services.backends);
  auto backends = std::make_shared<SessionBackends>();
  for (const auto& [name, profile] : *storebag) {
    auto backend = services.newBackend(services.backends, name, profile, attributes.deviceName, attributes.clientType);
    if (!backend) continue;
    configure(*backend, attributes, userInfo, deviceIdentifier);
    backends->append(name, std::move(backend));
  }
  return backends;
}

std::uint64_t batchedEventsSize(const SessionBackends* backends) {
  std::uint64_t size = 0;
  if (backends == nullptr) return size;
  for (const auto& entry : *backends) size += entry.backend->batchedEventsSize();
  return size;
}

}  // namespace velk
