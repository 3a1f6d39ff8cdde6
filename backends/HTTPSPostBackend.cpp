// The sending half of the HTTPS post backend: what becomes of an event, of a batch and of an answer.
#include "backends/HTTPSPostBackend.h"

#include <utility>

#include "backends/Compression.h"
#include "backends/EventBuilder.h"
#include "backends/LogTexts.h"
#include "backends/PostRequest.h"
#include "device/DeviceEnvironment.h"
#include "foundation/Format.h"
#include "foundation/Json.h"
#include "ipc/Vocabulary.h"
#include "platform/Clock.h"
#include "platform/DeviceInformation.h"
#include "platform/Log.h"

namespace velk {

namespace {

constexpr int kReportingError = -1;
constexpr std::uint32_t kPeriodicReport = 4;

bool isRealtime(std::uint32_t flag) noexcept { return flag == 1 || flag == 3; }
bool wakes(std::uint32_t flag) noexcept { return flag == 2 || flag == 3; }
bool isSessionStop(std::uint16_t method, std::uint16_t respCode) noexcept { return method == 0 && respCode == 1; }

/// What the client sent, or the whole message when that is all there is; null for no message at all.
const PropertyDictionary* payloadOf(const std::optional<PropertyDictionary>& message) {
  if (!message) return nullptr;
  const PropertyDictionary* clientData = message->dictionary(kVelkReportingMessageBlobClientData);
  return clientData != nullptr ? clientData : &*message;
}

PropertyValue numberOrMinusOne(const std::optional<double>& number) {
  return number ? PropertyValue(*number) : PropertyValue(-1);
}

}  // namespace

HTTPSPostBackend::~HTTPSPostBackend() = default;

std::optional<std::string> HTTPSPostBackend::sendMessageWithEventID(const std::optional<PropertyDictionary>& message,
                                                                    const TimeValue& timestamp, std::uint16_t method,
                                                                    std::uint16_t respCode, std::uint16_t eventID,
                                                                    std::uint32_t flag) {
  const std::int32_t before = state();
  if (before == kBackendDisabled) return std::nullopt;
  const PropertyDictionary* given = payloadOf(message);
  if (given == nullptr) log::error(backend_texts::kNoMessage);
  PropertyDictionary payload = given != nullptr ? *given : PropertyDictionary();
  if (isSessionStop(method, respCode)) addStopFields(payload);
  const PropertyDictionary* sharedData = message ? message->dictionary(kVelkReportingMessageBlobSharedData) : nullptr;
  PropertyDictionary event = newEvent(payload, sharedData, timestamp, method, respCode, eventID);
  if (wakes(flag) && before == kBackendWaiting) setState(kBackendEnabled);
  const bool realtime = isRealtime(flag);
  log::standard(backend_texts::kRealtime, realtime);
  if (flag == kPeriodicReport && _isInternal) {
    event.set("_bytesSentSinceLastReport", _bytesSentSinceLastReport.exchange(0));
  }
  const bool mayPost = before != kBackendNotConfigured && before != kBackendWaiting;
  if (mayPost && (realtime || !_batchEvents) && hasUserInfoIfRequired()) {
    return sendNow(std::move(event), before, realtime, method, respCode, flag);
  }
  log::standard(backend_texts::kBatching, before, _batchEvents, _requireUserInfo);
  return batchEvent(std::move(event));
}

void HTTPSPostBackend::addStopFields(PropertyDictionary& payload) {
  log::standard(backend_texts::kAddingStopFields);
  payload.set("Opt", _dnuType);
  payload.set("SamplingThreshold", numberOrMinusOne(samplingThreshold()));
  payload.set("OverrideSampling", numberOrMinusOne(_overrideSampling));
  payload.set("Batch", static_cast<std::uint8_t>(_batchEvents));
  payload.set("_totalBytesSent", _totalBytesSent.exchange(0));
}

PropertyDictionary HTTPSPostBackend::newEvent(const PropertyDictionary& payload, const PropertyDictionary* sharedData,
                                              const TimeValue& timestamp, std::uint16_t method, std::uint16_t respCode,
                                              std::uint16_t eventID) const {
  EventAttributes attributes{.startTimestamp = _startTimestamp,
                             .isInternal = _isInternal,
                             .compType = _compType,
                             .sessionID = _sessionID,
                             .clientVersion = _clientVersion,
                             .combinedSessionID = combinedSessionIDString(),
                             .productFamily = _productFamily,
                             .hardwareType = _hardwareType,
                             .productVersion = _productVersion,
                             .buildVersion = _buildVersion,
                             .reportVersion = _reportVersion,
                             .timeZoneOffset = _context.platform.locale.timeZoneOffset()};
  const std::size_t merged =
      (_userInfoDict ? _userInfoDict->size() : 0) + (sharedData != nullptr ? sharedData->size() : 0);
  PropertyDictionary event =
      newEventDict(payload, std::move(attributes), EventStamp{timestamp, method, respCode, eventID}, merged);
  prepareEventForMessage(event, sharedData);
  return event;
}

void HTTPSPostBackend::prepareEventForMessage(PropertyDictionary& event,
                                              const PropertyDictionary* frameworkData) const {
  if (_userInfoDict) event.merge(*_userInfoDict);
  if (frameworkData != nullptr) event.merge(*frameworkData);
}

std::optional<std::string> HTTPSPostBackend::sendNow(PropertyDictionary event, std::int32_t state, bool realtime,
                                                     std::uint16_t method, std::uint16_t respCode, std::uint32_t flag) {
  std::optional<std::string> flushed;
  if (state == kBackendEnabled && realtime && _state.queue().sync([this] { return _batch->exists(); })) {
    log::standard(backend_texts::kForcingFlush);
    flushed = flushMessagesWithCompletion({});
  }
  log::standard(backend_texts::kSending, state, _batchEvents, _requireUserInfo);
  if (isDropped(flag)) return flushed;
  std::vector<PropertyDictionary> events;
  events.push_back(std::move(event));
  auto body = createMessageForPostAndLogging(std::move(events));
  if (!body) return std::nullopt;
  postJSONMessage(std::move(body->json), flag, method, respCode, {});
  if (!flushed) return std::move(body->pretty);
  _immutable = true;
  return formatText(backend_texts::kFlushedAndStandalone, {flushed, body->pretty});
}

std::optional<std::string> HTTPSPostBackend::batchEvent(PropertyDictionary event) {
  // Counting and appending take one turn of the queue, unless a flush comes between them.
  const bool reached = _state.queue().sync([&] {
    _batch->create();
    const bool full = _batch->countReaches(event.find("_method"), _eventThreshold);
    if (!full) appendToBatch(std::move(event));
    return full;
  });
  if (!reached) return std::nullopt;
  log::standard(backend_texts::kThresholdReached, int32Value(event.find("_method")));
  auto flushed = flushMessagesWithCompletion({});
  _state.queue().sync([&] { appendToBatch(std::move(event)); });
  return flushed;
}

void HTTPSPostBackend::appendToBatch(PropertyDictionary event) {
  if (_batch->append(std::move(event)) == EventBatch::Appended::full) log::error(backend_texts::kBatchFull, _name);
}

HTTPSPostBackend::Taken HTTPSPostBackend::takeBatch() {
  return _state.queue().sync([this] {
    Taken taken;
    if (!_batch->exists()) return taken;
    if (_state.raw() != kBackendEnabled) {
      _batch->discard();
    } else if (!hasUserInfoIfRequired()) {
      taken.outcome = Taken::Outcome::userInfoMissing;
    } else {
      taken.outcome = Taken::Outcome::events;
      taken.events = _batch->take();
      _batch->clearCounters();
    }
    return taken;
  });
}

std::optional<std::string> HTTPSPostBackend::flushMessagesWithCompletion(BackendFlushCompletion completion) {
  Taken taken = takeBatch();
  switch (taken.outcome) {
    case Taken::Outcome::nothing:
      completion(std::nullopt, errorObject(backend_texts::kNothingToFlush, kReportingError));
      return std::nullopt;
    case Taken::Outcome::userInfoMissing:
      completion(std::nullopt, errorObject(backend_texts::kUserInfoRequired, kReportingError));
      return std::nullopt;
    case Taken::Outcome::events:
      break;
  }
  log::standard(backend_texts::kFlushCalled);
  return postBatch(withoutUnlistedEvents(std::move(taken.events)), std::move(completion));
}

/// The events that pass the lists, with the user info merged over them once more: over shared data this time.
std::vector<PropertyDictionary> HTTPSPostBackend::withoutUnlistedEvents(std::vector<PropertyDictionary> events) const {
  PropertyDictionary userInfo = _userInfoDict.value_or(PropertyDictionary());
  _filter.apply(userInfo);
  std::vector<PropertyDictionary> kept;
  kept.reserve(events.size());
  for (auto& event : events) {
    const std::uint16_t category = uint16Value(event.find("_method"));
    if (!isWhitelistedEvent(category)) {
      log::standard(backend_texts::kFlushNotWhitelisted, category, _name);
    } else if (isBlacklistedEvent(category)) {
      log::standard(backend_texts::kFlushBlacklisted, category, _name);
    } else {
      event.merge(userInfo);
      kept.push_back(std::move(event));
    }
  }
  return kept;
}

std::optional<std::string> HTTPSPostBackend::postBatch(std::vector<PropertyDictionary> events,
                                                       BackendFlushCompletion completion) {
  if (!events.empty() && isDropped(0)) return std::nullopt;
  auto body = events.empty() ? std::nullopt : createMessageForPostAndLogging(std::move(events));
  if (!body) {
    completion(std::nullopt, errorObject(backend_texts::kEverythingFiltered, kReportingError));
    return std::nullopt;
  }
  PostCompletion posted;
  if (completion) {
    posted = [text = body->pretty, flushed = std::move(completion)](std::optional<Error> error) mutable {
      flushed(std::move(text), std::move(error));
    };
  }
  postJSONMessage(std::move(body->json), 0, std::nullopt, std::nullopt, std::move(posted));
  if (body->pretty) _immutable = true;
  return std::move(body->pretty);
}

std::optional<HTTPSPostBackend::Body> HTTPSPostBackend::createMessageForPostAndLogging(
    std::vector<PropertyDictionary> events) {
  const double now = secondsFromTimeValue(_context.platform.clock.wallTime());
  const std::size_t count = events.size();
  PropertyArray array;
  array.reserve(count);
  for (auto& event : events) {
    makeEventRepresentableInJson(event, _allowNestedData);
    _filter.apply(event);
    array.append(std::move(event));
  }
  PropertyDictionary message{{"postTime", finiteOrMinusOne(now)}, {"clientId", clientIdentifier()}};
  message.appendUnique("events", std::move(array));
  _filter.apply(message);
  Body body;
  body.json.reserve(_lastBodySize);
  if (!json::write(message, body.json)) {
    log::error(backend_texts::kNoBody, count, _name);
    return std::nullopt;
  }
  _lastBodySize = body.json.size();
  if (mayLogEvents()) {
    auto& pretty = body.pretty.emplace();
    pretty.reserve(2 * body.json.size());
    json::appendPretty(body.json, pretty);
  }
  return body;
}

bool HTTPSPostBackend::mayLogEvents() const {
  if (_dnuType == kConsentRespected && _dnuEnabled) return true;
  if (!_forceEventLogging) return false;
  const std::uint32_t environment = _context.environment.userDefaultsEnvironment();
  return environment == kEnvironmentDevelopment || environment == kEnvironmentInternal;
}

const std::optional<std::string>& HTTPSPostBackend::urlFor(std::uint32_t flag) const {
  return isRealtime(flag) ? _realtimePostURL : _postURL;
}

bool HTTPSPostBackend::isDropped(std::uint32_t flag) const {
  if (!urlFor(flag)) return false;
  const auto poster = transport();
  return !poster || !poster->takesPosts();
}

void HTTPSPostBackend::postJSONMessage(std::string json, std::uint32_t flag, std::optional<std::uint16_t> method,
                                       std::optional<std::uint16_t> responseCode, PostCompletion completion) {
  const auto& url = urlFor(flag);
  if (!url) {
    completion(errorObject(backend_texts::kPostURLMissing, kReportingError));
    return;
  }
  auto compressed = gzipDeflate(std::string_view(json));
  const bool isCompressed = compressed && !compressed->empty() && compressed->size() < json.size();
  const auto plain = std::make_shared<const std::string>(std::move(json));
  const auto sent = isCompressed ? std::make_shared<const std::string>(std::move(*compressed)) : plain;
  _totalBytesSent += static_cast<std::uint32_t>(sent->size());
  _bytesSentSinceLastReport += static_cast<std::uint32_t>(sent->size());
  const auto sessionID = _includeSessionIDInHeader ? combinedSessionIDString() : std::nullopt;
  const bool isDigested = _digestKey && _digestAlgorithm == 0;
  auto request = makePostRequest({.url = *url,
                                  .body = sent,
                                  .isCompressed = isCompressed,
                                  .json = &*plain,
                                  .userInfo = _userInfoDict ? &*_userInfoDict : nullptr,
                                  .isInternal = _isInternal,
                                  .selfVersion = _selfVersion,
                                  .hardwareType = _hardwareType ? &*_hardwareType : nullptr,
                                  .productVersion = _productVersion ? &*_productVersion : nullptr,
                                  .clientVersion = _clientVersion,
                                  .compType = _compType,
                                  .method = method,
                                  .respCode = responseCode,
                                  .sessionID = sessionID ? &*sessionID : nullptr,
                                  .digestKey = isDigested ? &*_digestKey : nullptr,
                                  .wifiOnly = _shouldUseWiFiOnly});
  // A transport that has gone, or that drops the request, drops the completion as well: whoever waits learns of it.
  const auto poster = transport();
  if (!poster) return;
  request.sender = _sender->number;
  _sender->hasPosted = true;
  poster->postURLRequestWithCompletionHandler(
      std::move(request), [state = _state, name = _name, completion = std::move(completion)](
                              const ByteData&, const std::shared_ptr<const HttpResponse>& response,
                              const std::optional<Error>& error) mutable {
        if (error) log::error(backend_texts::kPostError, *error);
        const int status = response ? response->statusCode : 0;
        if (status < 500 || status > 599) return completion(error);
        const std::string text = formatText(backend_texts::kDisabledByServer, {name, status});
        log::standard(backend_texts::kPostJSONMessage, text);
        state.write(kBackendDisabled);
        completion(errorObject(text, status));
      });
}

void HTTPSPostBackend::setCorrelatedSessionID(const std::string& combinedSessionID) {
  VelkReportingBackend::setCorrelatedSessionID(combinedSessionID);
  // Asynchronously: the caller may be another session that holds the agent's lock.
  _state.queue().async([batch = _batch, combinedSessionID] { batch->setSessionID(combinedSessionID); });
}

std::uint64_t HTTPSPostBackend::batchedEventsSize() const {
  return _state.queue().sync([this] { return _batch->estimatedSize(); });
}

std::uint64_t HTTPSPostBackend::batchedEventsCount() const {
  return _state.queue().sync([this] { return _batch->count(); });
}

}  // namespace velk
