#include "client/VelkReporting.h"

#include "client/LogTexts.h"
#include "client/SessionInfoValidation.h"
#include "client/VelkReportingImplementation.h"
#include "ipc/Vocabulary.h"
#include "platform/Log.h"

namespace velk {

namespace {

void assign(Error* out, Error error) {
  if (out != nullptr) *out = std::move(error);
}

std::string errorDomain() { return std::string(kVelkReportingErrorDomain); }

Error invalidCategory() { return {errorDomain(), 4, "the category is 0"}; }

int digitValue(char character) {
  constexpr std::string_view kDigits = "0123456789abcdef";
  const char lower = character >= 'A' && character <= 'F' ? static_cast<char>(character - 'A' + 'a') : character;
  const auto at = kDigits.find(lower);
  return at == std::string_view::npos ? -1 : static_cast<int>(at);
}

/// The path of a file URL, or the text itself. A byte of zero would end the path early: it is left in its escaped form.
std::string pathOfFileUrl(const std::string& url) {
  constexpr std::string_view kScheme = "file://";
  if (!url.starts_with(kScheme)) return url;
  const std::size_t slash = url.find('/', kScheme.size());
  std::string path;
  for (std::size_t at = slash == std::string::npos ? url.size() : slash; at < url.size(); ++at) {
    const bool isEscape = url[at] == '%' && at + 2 < url.size();
    const int high = isEscape ? digitValue(url[at + 1]) : -1;
    const int low = isEscape ? digitValue(url[at + 2]) : -1;
    if (high < 0 || low < 0 || high + low == 0) {
      path += url[at];
      continue;
    }
    path += static_cast<char>(16 * high + low);
    at += 2;
  }
  return path;
}

}  // namespace

VelkReporting::VelkReporting(std::shared_ptr<VelkReportingImplementation> implementation)
    : _implementation(std::move(implementation)) {}

VelkReporting::~VelkReporting() {
  if (!_implementation->isForeign()) _implementation->endOfLife(this);
}

std::shared_ptr<VelkReporting> VelkReporting::initWithSessionInfo(const std::optional<PropertyDictionary>& sessionInfo,
                                                                  const std::optional<PropertyDictionary>& userInfo,
                                                                  const PropertyArray& frameworksToCheck,
                                                                  VelkReportingAggregationBlock aggregationBlock) {
  ClientRuntime& runtime = ClientRuntime::shared();
  if (validateSessionInfo(sessionInfo)) return nullptr;
  log::standard(texts::kClientStartsLogging);
  const PropertyValue* enableFlag = sessionInfo->find(kVelkReportingSessionInfoEnableFlag);
  if (enableFlag != nullptr && integerValue(enableFlag) == 0) {
    log::standard(texts::kSessionDisabled);
    return nullptr;
  }
  SessionDescription description;
  description.sessionInfo = *sessionInfo;
  description.userInfo = userInfo;
  description.frameworksToCheck = frameworksToCheck;
  auto implementation =
      std::make_shared<VelkReportingImplementation>(runtime, std::move(description), std::move(aggregationBlock));
  const std::shared_ptr<VelkReporting> client(new VelkReporting(implementation));
  implementation->open(client);
  return client;
}

void VelkReporting::startConfigurationWithCompletionHandler(StatesCallback completionHandler) {
  if (_implementation->isForeign()) return;
  _implementation->callInOrder([handler = std::move(completionHandler)](VelkReportingImplementation& self) mutable {
    self.startConfiguration(std::move(handler));
  });
}

void VelkReporting::fetchReportingStatesWithUserInfo(const std::optional<PropertyDictionary>& userInfo,
                                                     StatesCallback fetchComplete) {
  if (_implementation->isForeign()) return;
  _implementation->callInOrder(
      [userInfo, handler = std::move(fetchComplete)](VelkReportingImplementation& self) mutable {
        self.fetchReportingStates(userInfo, std::move(handler));
      });
}

bool VelkReporting::sendMessageWithCategory(std::uint16_t category, std::uint16_t type,
                                            const std::optional<PropertyDictionary>& payload, Error* error) {
  if (category == 0) {
    assign(error, invalidCategory());
    return false;
  }
  PropertyDictionary message;
  message.reserve(4);
  message.appendUnique(std::string(kVelkReportingMessageParametersCategory), category);
  message.appendUnique(std::string(kVelkReportingMessageParametersType), type);
  if (payload) message.appendUnique(std::string(kVelkReportingMessageParametersPayload), *payload);
  message.appendUnique(std::string(kVelkReportingMessageParametersFlag), 0);
  static_cast<void>(sendMessageWithDictionary(message, error));  // a filtered event is no failure of this form
  return true;
}

bool VelkReporting::sendMessageWithDictionary(const PropertyDictionary& dictionary, Error* error) {
  const PropertyValue* categoryValue = dictionary.find(kVelkReportingMessageParametersCategory);
  if (categoryValue == nullptr) {
    assign(error, {std::string(texts::kMissingCategory), 7, {}});  // the text stands in the domain
    return false;
  }
  if (!dictionary.contains(kVelkReportingMessageParametersType)) {
    assign(error, {std::string(texts::kMissingType), 7, {}});
    return false;
  }
  const std::uint16_t category = uint16Value(categoryValue);
  if (category == 0) {
    assign(error, invalidCategory());
    return false;
  }
  assign(error, {});
  using Sent = VelkReportingImplementation::Sent;
  const Sent sent = _implementation->sendMessage(category, dictionary);
  if (sent == Sent::notFromForkedChild) {
    assign(error, {errorDomain(), VelkReportingImplementation::kForkedChild,
                   "this process was forked from the one that made the client"});
  } else if (sent == Sent::outboxFull) {
    assign(error, {errorDomain(), VelkReportingImplementation::kOutboxFull,
                   "the outbox is full: the daemon is away or too slow, and the event was not taken"});
  }
  return sent == Sent::taken;
}

bool VelkReporting::flushMessages() {
  log::standard(texts::kFlushMessages);
  flushMessagesWithCompletion(nullptr);
  return true;
}

void VelkReporting::flushMessagesWithCompletion(FlushCallback completion) {
  if (_implementation->isForeign()) return;
  _implementation->callInOrder([completion = std::move(completion)](VelkReportingImplementation& self) mutable {
    self.flush(std::move(completion));
  });
}

void VelkReporting::finishSession() {
  if (!_implementation->isForeign()) _implementation->finishSession();
}

void VelkReporting::updateSharedDataWithDictionary(const PropertyDictionary& dictionary) {
  if (_implementation->isForeign()) return;
  _implementation->callInOrder(
      [dictionary](VelkReportingImplementation& self) { self.updateSharedDataWithDictionary(dictionary); });
}

void VelkReporting::updateSharedDataForKey(const std::string& key, const std::optional<PropertyValue>& value) {
  if (_implementation->isForeign()) return;
  _implementation->callInOrder(
      [key, value](VelkReportingImplementation& self) { self.updateSharedDataForKey(key, value); });
}

void VelkReporting::setMessageSentDelegate(std::weak_ptr<VelkReportingMessageSentDelegate> delegate) {
  if (_implementation->isForeign()) return;
  if (!delegate.expired()) _implementation->expectMessageSentDelegate();
  _implementation->onQueue([delegate = std::move(delegate)](VelkReportingImplementation& self) mutable {
    self.setMessageSentDelegate(std::move(delegate));
  });
}

std::shared_ptr<VelkReportingMessageSentDelegate> VelkReporting::messageSentDelegate() const {
  if (_implementation->isForeign()) return nullptr;
  auto delegate = _implementation->messageSentDelegate();
  log::standard(texts::kDelegateReads, reinterpret_cast<std::uintptr_t>(delegate.get()));
  return delegate;
}

void VelkReporting::setMessageLoggingBlock(LoggingBlock block) {
  if (_implementation->isForeign()) return;
  _implementation->onQueue([block = std::move(block)](VelkReportingImplementation& self) mutable {
    self.setMessageLoggingBlock(std::move(block));
  });
}

bool VelkReporting::isWhitelistedEvent(std::uint16_t category) const {
  return _implementation->isForeign() || _implementation->lists().get()->isWhitelisted(category);
}

bool VelkReporting::isBlacklistedEvent(std::uint16_t category) const {
  return !_implementation->isForeign() && _implementation->lists().get()->isBlacklisted(category);
}

bool VelkReporting::serverSupportsFileUpload() const {
  if (_implementation->isForeign()) return false;
  const auto lists = _implementation->lists().get();
  bool supported = false;
  for (const auto& name : lists->enabledBackends()) {
    supported = supported || (name.string() != nullptr && *name.string() == kVelkReportingBackendUploadServer);
  }
  log::standard(texts::kServerSupportsFileUpload, supported ? "YES" : "NO", lists->enabledBackends().size());
  return supported;
}

bool VelkReporting::uploadFileWithURL(const std::optional<std::string>& fileURL, UploadCallback completionHandler) {
  if (!fileURL) {
    log::standard(texts::kFileUrlIsNil);
    return false;
  }
  if (_implementation->isForeign()) return false;
  const std::string path = pathOfFileUrl(*fileURL);
  auto file = _implementation->openForUpload(path);
  if (!file) {
    log::standard(texts::kNoExtension, path, file.error().code);
    return false;
  }
  _implementation->callInOrder([url = *fileURL, opened = std::move(*file),
                                handler = std::move(completionHandler)](VelkReportingImplementation& self) mutable {
    self.uploadFile(url, opened, std::move(handler));
  });
  return true;
}

bool VelkReporting::uploadDataArray(const std::optional<PropertyArray>& logData, UploadCallback completionHandler) {
  if (!logData || logData->empty()) {
    log::standard(texts::kLogDataArrayIsEmpty);
    return false;
  }
  if (_implementation->isForeign()) return false;
  _implementation->callInOrder(
      [logData = *logData, handler = std::move(completionHandler)](VelkReportingImplementation& self) mutable {
        self.uploadLogData(logData, std::move(handler));
      });
  return true;
}

bool VelkReporting::registerPeriodicTaskForModule(std::uint32_t module, bool needToUpdate, bool needToReport,
                                                  VelkReportingServiceBlock serviceBlock) {
  return !_implementation->isForeign() &&
         _implementation->periodicTasks().registerModule(module, needToUpdate, needToReport, std::move(serviceBlock));
}

bool VelkReporting::unregisterPeriodTaskForModule(std::uint32_t module) {
  if (!_implementation->isForeign()) _implementation->unregisterPeriodicTask(module);
  return true;
}

void VelkReporting::startLogTimerWithInterval(std::uint32_t interval, std::uint32_t reportingMultiplier,
                                              std::uint16_t category, std::uint16_t type) {
  if (_implementation->isForeign()) return;
  _implementation->periodicTasks().startLogTimer(interval, reportingMultiplier, category, type);
}

void VelkReporting::stopLogTimer() {
  if (!_implementation->isForeign()) _implementation->periodicTasks().stopLogTimer();
}

bool VelkReporting::setDigestKey(const std::optional<ByteData>& digestKey, std::uint32_t algorithm) {
  if (!digestKey) {
    log::standard(texts::kDigestKeyIsNil);
    return false;
  }
  if (_implementation->isForeign()) return false;
  _implementation->callInOrder([key = *digestKey, algorithm](VelkReportingImplementation& self) {
    self.setDigestKey(key, static_cast<std::int32_t>(algorithm));
  });
  return true;
}

}  // namespace velk
