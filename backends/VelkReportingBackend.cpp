#include "backends/VelkReportingBackend.h"

#include <algorithm>
#include <span>
#include <utility>

#include "foundation/Text.h"
#include "platform/Cryptography.h"

namespace velk {

namespace {

constexpr std::uint32_t kSamplingSteps = 10'000;

}  // namespace

VelkReportingBackend::VelkReportingBackend(const BackendContext& context, std::string name, PropertyValue profile,
                                           std::optional<std::string> productFamily)
    : _context(context),
      _name(std::move(name)),
      _profile(std::move(profile)),
      _productFamily(std::move(productFamily)),
      _samplingFactor(context.platform.random.below(kSamplingSteps) / static_cast<double>(kSamplingSteps)),
      _state(context.platform.scheduler.makeSerialQueue("com.tavrin.VelkReportingBackendStateQueue")) {}

VelkReportingBackend::~VelkReportingBackend() = default;

std::string VelkReportingBackend::convertIntoSHA256(std::string_view text) {
  const auto* bytes = reinterpret_cast<const std::uint8_t*>(text.data());
  return hexadecimal(sha256(std::span(bytes, std::min(utf16Length(text), text.size()))));
}

// The state is written before the transport is read, and `setReportingSessionConnectivityDelegate` goes the other way
// round: when the two meet on different threads, one of them sees both.
void VelkReportingBackend::setState(std::int32_t state) {
  _state.write(state);
  if (state != kBackendEnabled) return;
  if (const auto enabled = transport()) enabled->activate();
}

std::int32_t VelkReportingBackend::updateState() {
  setState(kBackendEnabled);
  return kBackendEnabled;
}

std::optional<std::string> VelkReportingBackend::sendMessage(const std::optional<PropertyDictionary>& message,
                                                             const TimeValue& timestamp, std::uint16_t method,
                                                             std::uint16_t respCode, std::uint32_t flag) {
  return sendMessageWithEventID(message, timestamp, method, respCode, ++_eventID, flag);
}

std::optional<std::string> VelkReportingBackend::sendMessageWithEventID(const std::optional<PropertyDictionary>&,
                                                                        const TimeValue&, std::uint16_t, std::uint16_t,
                                                                        std::uint16_t, std::uint32_t) {
  return std::nullopt;
}

std::optional<std::string> VelkReportingBackend::flushMessagesWithCompletion(BackendFlushCompletion completion) {
  completion(std::nullopt, std::nullopt);
  return std::nullopt;
}

bool VelkReportingBackend::uploadFileAtPath(FileUpload&) { return false; }

bool VelkReportingBackend::uploadLogData(const PropertyArray&) { return false; }

void VelkReportingBackend::setCorrelatedSessionID(const std::string& combinedSessionID) {
  Guard guard(_lock);
  _combinedSessionIDString = combinedSessionID;
}

bool VelkReportingBackend::isWhitelistedEvent(std::int32_t event) const {
  if (!_eventWhitelist) return true;
  return std::any_of(_eventWhitelist->begin(), _eventWhitelist->end(),
                     [event](const PropertyValue& element) { return int32Value(&element) == event; });
}

bool VelkReportingBackend::isBlacklistedEvent(std::uint32_t event) const {
  if (!_eventBlacklist) return false;
  return std::any_of(_eventBlacklist->begin(), _eventBlacklist->end(),
                     [event](const PropertyValue& element) { return uint32Value(&element) == event; });
}

std::uint64_t VelkReportingBackend::batchedEventsSize() const { return 0; }

std::uint64_t VelkReportingBackend::batchedEventsCount() const { return 0; }

void VelkReportingBackend::setReportingSessionConnectivityDelegate(
    const std::shared_ptr<ReportingSessionConnectivityInterface>& transport) {
  {
    Guard guard(_lock);
    _transport = transport;
  }
  if (transport && state() == kBackendEnabled) transport->activate();
}

std::shared_ptr<ReportingSessionConnectivityInterface> VelkReportingBackend::transport() const {
  Guard guard(_lock);
  return _transport.lock();
}

void VelkReportingBackend::setSender(std::shared_ptr<PostSender> sender) { _sender = std::move(sender); }

void VelkReportingBackend::setSelfVersion(std::string_view version) {
  _selfVersion = parseDottedVersion(version);
  _reportVersion = _selfVersion.reportVersion();
}

void VelkReportingBackend::setStartTimestamp(const TimeValue& timestamp) {
  _startTimestamp = secondsFromTimeValue(timestamp);
}

void VelkReportingBackend::setSessionID(std::uint32_t sessionID) { _sessionID = sessionID; }
void VelkReportingBackend::setCompType(std::int32_t compType) { _compType = compType; }
void VelkReportingBackend::setClientVersion(std::uint16_t clientVersion) { _clientVersion = clientVersion; }
void VelkReportingBackend::setUdid(std::string udid) { _udid = std::move(udid); }

void VelkReportingBackend::setProductVersion(std::optional<std::string> productVersion) {
  _productVersion = std::move(productVersion);
}

void VelkReportingBackend::setBuildVersion(std::optional<std::string> buildVersion) {
  _buildVersion = std::move(buildVersion);
}

void VelkReportingBackend::setHardwareType(std::optional<std::string> hardwareType) {
  _hardwareType = std::move(hardwareType);
}

void VelkReportingBackend::setIsInternal(bool isInternal) { _isInternal = isInternal; }
void VelkReportingBackend::setRequireUserInfo(bool requireUserInfo) { _requireUserInfo = requireUserInfo; }
void VelkReportingBackend::setBatchEvents(bool batchEvents) { _batchEvents = batchEvents; }
void VelkReportingBackend::setAllowNestedData(bool allowNestedData) { _allowNestedData = allowNestedData; }

void VelkReportingBackend::setUserInfoDict(std::optional<PropertyDictionary> userInfo) {
  _userInfoDict = std::move(userInfo);
}

void VelkReportingBackend::setDigestKey(std::optional<ByteData> key, std::int32_t algorithm) {
  _digestKey = std::move(key);
  _digestAlgorithm = algorithm;
}

void VelkReportingBackend::setSamplingThreshold(std::optional<double> threshold) {
  Guard guard(_lock);
  _samplingThreshold = threshold;
}

std::optional<double> VelkReportingBackend::samplingThreshold() const {
  Guard guard(_lock);
  return _samplingThreshold;
}

std::optional<std::string> VelkReportingBackend::combinedSessionIDString() const {
  Guard guard(_lock);
  return _combinedSessionIDString;
}

}  // namespace velk
