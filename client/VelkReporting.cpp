#include "client/VelkReporting.h"

#include <algorithm>
#include <cerrno>

#include "client/Border.h"
#include "client/LogTexts.h"
#include "client/SessionInfoValidation.h"
#include "client/VelkReportingImplementation.h"
#include "foundation/FileUrl.h"
#include "foundation/Text.h"
#include "ipc/SessionProxies.h"
#include "ipc/Vocabulary.h"
#include "platform/Log.h"

namespace velk {

namespace {

using Implementation = VelkReportingImplementation;

void assign(Error* out, Error error) {
  if (out != nullptr) *out = std::move(error);
}

std::string errorDomain() { return std::string(kVelkReportingErrorDomain); }

Error invalidCategory() { return {errorDomain(), 4, "the category is 0"}; }

/// Why the daemon cannot be told that address, as an error number of the system; 0 when it can: it travels as text.
int reasonToRefuseAddress(const std::string& url) {
  constexpr std::size_t kMaximumBytes = 16 * 1024;  // the longest path with every byte escaped, and a host
  if (url.size() > kMaximumBytes) return ENAMETOOLONG;
  return isUtf8(url) ? 0 : EILSEQ;
}

/// Throws only for want of memory: then the event has not been taken.
bool sendMessage(Implementation& implementation, const PropertyDictionary& dictionary, Error* error) {
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
  using Sent = Implementation::Sent;
  const Sent sent = implementation.sendMessage(category, dictionary);
  if (sent == Sent::notFromForkedChild) {
    assign(error,
           {errorDomain(), Implementation::kForkedChild, "this process was forked from the one that made the client"});
  } else if (sent == Sent::outboxFull) {
    assign(error, {errorDomain(), Implementation::kOutboxFull,
                   "the outbox is full: the daemon is away or too slow, and the event was not taken"});
  } else if (sent == Sent::notSendable) {
    const char* reason = SessionInterfaceProxy::reasonNotToSend(dictionary);
    assign(error, {errorDomain(), Implementation::kNotSendable,
                   std::string("the event cannot be sent: ") + (reason != nullptr ? reason : "")});
  }
  return sent == Sent::taken;
}

}  // namespace

VelkReporting::VelkReporting(std::shared_ptr<VelkReportingImplementation> implementation)
    : _implementation(std::move(implementation)) {}

VelkReporting::~VelkReporting() {
  guardedVoid("aboutToDealloc", [this] {
    if (_implementation->isOpen() && !_implementation->isForeign()) _implementation->endOfLife(this);
  });
}

std::shared_ptr<VelkReporting> VelkReporting::initWithSessionInfo(const std::optional<PropertyDictionary>& sessionInfo,
                                                                  const std::optional<PropertyDictionary>& userInfo,
                                                                  const PropertyArray& frameworksToCheck,
                                                                  VelkReportingAggregationBlock aggregationBlock) {
  return guarded("initWithSessionInfo", nullptr, [&]() -> std::shared_ptr<VelkReporting> {
    ClientRuntime& runtime = ClientRuntime::shared();
    if (validateSessionInfo(sessionInfo)) return nullptr;
    log::standard(texts::kClientStartsLogging);
    const PropertyValue* enableFlag = sessionInfo->find(kVelkReportingSessionInfoEnableFlag);
    if (enableFlag != nullptr && integerValue(enableFlag) == 0) {
      log::standard(texts::kSessionDisabled);
      return nullptr;
    }
    if (const auto started = runtime.loop().start(); !started) {
      log::standard(texts::kFailedToCreateQueue);
      log::error(texts::kNoThread, "initWithSessionInfo", started.error());
      return nullptr;
    }
    SessionDescription description;
    description.sessionInfo = *sessionInfo;
    description.userInfo = userInfo;
    for (const PropertyValue& framework : frameworksToCheck) {
      if (framework.string() != nullptr) description.frameworksToCheck.append(framework);
    }
    auto implementation = std::make_shared<Implementation>(runtime, std::move(description),
                                                           sharedForUser(runtime, std::move(aggregationBlock)));
    const std::shared_ptr<VelkReporting> client(new VelkReporting(implementation));
    implementation->open(client);
    return client;
  });
}

void VelkReporting::startConfigurationWithCompletionHandler(StatesCallback completionHandler) {
  guardedVoid("startConfigurationWithCompletionHandler", [&] {
    if (_implementation->isForeign()) return;
    const Implementation::StatesCallback callback(_implementation->runtime(), std::move(completionHandler));
    _implementation->callInOrder([callback](Implementation& self) { self.startConfiguration(callback); });
  });
}

void VelkReporting::fetchReportingStatesWithUserInfo(const std::optional<PropertyDictionary>& userInfo,
                                                     StatesCallback fetchComplete) {
  guardedVoid("fetchReportingStatesWithUserInfo", [&] {
    if (_implementation->isForeign()) return;
    const Implementation::StatesCallback callback(_implementation->runtime(), std::move(fetchComplete));
    _implementation->callInOrder(
        [userInfo, callback](Implementation& self) { self.fetchReportingStates(userInfo, callback); });
  });
}

bool VelkReporting::sendMessageWithCategory(std::uint16_t category, std::uint16_t type,
                                            const std::optional<PropertyDictionary>& payload, Error* error) {
  return guarded("sendMessageWithCategory", false, [&] {
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
    // A filtered event is no failure of this form; one for which there is no memory is.
    static_cast<void>(sendMessage(*_implementation, message, error));
    return true;
  });
}

bool VelkReporting::sendMessageWithDictionary(const PropertyDictionary& dictionary, Error* error) {
  return guarded("sendMessageWithDictionary", false, [&] { return sendMessage(*_implementation, dictionary, error); });
}

bool VelkReporting::flushMessages() {
  guardedVoid("flushMessages", [] { log::standard(texts::kFlushMessages); });
  flushMessagesWithCompletion(nullptr);
  return true;
}

void VelkReporting::flushMessagesWithCompletion(FlushCallback completion) {
  guardedVoid("flushMessagesWithCompletion", [&] {
    if (_implementation->isForeign()) return;
    const Implementation::FlushCallback callback(_implementation->runtime(), std::move(completion));
    _implementation->callInOrder([callback](Implementation& self) { self.flush(callback); });
  });
}

void VelkReporting::finishSession() {
  guardedVoid("finishSession", [&] {
    if (!_implementation->isForeign()) _implementation->finishSession();
  });
}

void VelkReporting::updateSharedDataWithDictionary(const PropertyDictionary& dictionary) {
  guardedVoid("updateSharedDataWithDictionary", [&] {
    if (_implementation->isForeign()) return;
    _implementation->callInOrder(
        [dictionary](Implementation& self) { self.updateSharedDataWithDictionary(dictionary); });
  });
}

void VelkReporting::updateSharedDataForKey(const std::string& key, const std::optional<PropertyValue>& value) {
  guardedVoid("updateSharedDataForKey", [&] {
    if (_implementation->isForeign()) return;
    _implementation->callInOrder([key, value](Implementation& self) { self.updateSharedDataForKey(key, value); });
  });
}

void VelkReporting::setMessageSentDelegate(std::weak_ptr<VelkReportingMessageSentDelegate> delegate) {
  guardedVoid("setMessageSentDelegate", [&] {
    if (_implementation->isForeign()) return;
    const auto identity = reinterpret_cast<std::uintptr_t>(delegate.lock().get());
    if (identity != 0) _implementation->expectMessageSentDelegate();
    _implementation->onQueue([delegate = std::move(delegate), identity](Implementation& self) mutable {
      self.setMessageSentDelegate(std::move(delegate), identity);
    });
  });
}

std::shared_ptr<VelkReportingMessageSentDelegate> VelkReporting::messageSentDelegate() const {
  return guarded("messageSentDelegate", nullptr, [&]() -> std::shared_ptr<VelkReportingMessageSentDelegate> {
    if (_implementation->isForeign()) return nullptr;
    auto delegate = _implementation->weakMessageSentDelegate().lock();
    log::standard(texts::kDelegateReads, reinterpret_cast<std::uintptr_t>(delegate.get()));
    return delegate;
  });
}

void VelkReporting::setMessageLoggingBlock(LoggingBlock block) {
  guardedVoid("setMessageLoggingBlock", [&] {
    if (_implementation->isForeign()) return;
    Implementation::LoggingBlock shared;
    if (block) shared = shareForUser(_implementation->runtime(), std::move(block));
    _implementation->onQueue(
        [shared = std::move(shared)](Implementation& self) mutable { self.setMessageLoggingBlock(std::move(shared)); });
  });
}

VelkReporting::LoggingBlock VelkReporting::messageLoggingBlock() const {
  return guarded("messageLoggingBlock", nullptr, [&]() -> LoggingBlock {
    if (_implementation->isForeign()) return nullptr;
    const auto block = _implementation->loggingBlock();
    return block ? *block : LoggingBlock();
  });
}

bool VelkReporting::isWhitelistedEvent(std::uint16_t category) const {
  return _implementation->isForeign() || _implementation->lists().get()->isWhitelisted(category);
}

bool VelkReporting::isBlacklistedEvent(std::uint16_t category) const {
  return !_implementation->isForeign() && _implementation->lists().get()->isBlacklisted(category);
}

bool VelkReporting::serverSupportsFileUpload() const {
  return guarded("serverSupportsFileUpload", false, [&] {
    if (_implementation->isForeign()) return false;
    const auto lists = _implementation->lists().get();
    bool supported = false;
    for (const auto& name : lists->enabledBackends()) {
      supported = supported || (name.string() != nullptr && *name.string() == kVelkReportingBackendUploadServer);
    }
    log::standard(texts::kServerSupportsFileUpload, supported ? "YES" : "NO", lists->enabledBackends().size());
    return supported;
  });
}

bool VelkReporting::uploadFileWithURL(const std::optional<std::string>& fileURL, UploadCallback completionHandler) {
  return guarded("uploadFileWithURL", false, [&] {
    if (!fileURL) {
      log::standard(texts::kFileUrlIsNil);
      return false;
    }
    if (_implementation->isForeign()) return false;
    const std::string path = fileSystemPath(*fileURL);
    if (const int reason = reasonToRefuseAddress(*fileURL); reason != 0) {
      log::standard(texts::kNoExtension, path, reason);
      return false;
    }
    auto file = _implementation->openForUpload(path);
    if (!file) {
      log::standard(texts::kNoExtension, path, file.error().code);
      return false;
    }
    const Implementation::UploadCallback callback(_implementation->runtime(), std::move(completionHandler));
    _implementation->callInOrder([url = *fileURL, opened = std::move(*file), callback](Implementation& self) {
      self.uploadFile(url, opened, callback);
    });
    return true;
  });
}

bool VelkReporting::uploadDataArray(const std::optional<PropertyArray>& logData, UploadCallback completionHandler) {
  return guarded("uploadDataArray", false, [&] {
    if (!logData || logData->empty()) {
      log::standard(texts::kLogDataArrayIsEmpty);
      return false;
    }
    if (!std::all_of(logData->begin(), logData->end(), [](const auto& each) { return each.dictionary() != nullptr; })) {
      log::error(texts::kLogDataIsNoDictionary);
      return false;
    }
    if (_implementation->isForeign()) return false;
    const Implementation::UploadCallback callback(_implementation->runtime(), std::move(completionHandler));
    _implementation->callInOrder(
        [logData = *logData, callback](Implementation& self) { self.uploadLogData(logData, callback); });
    return true;
  });
}

bool VelkReporting::registerPeriodicTaskForModule(std::uint32_t module, bool needToUpdate, bool needToReport,
                                                  VelkReportingServiceBlock serviceBlock) {
  return guarded("registerPeriodicTaskForModule", false, [&] {
    if (_implementation->isForeign()) return false;
    return _implementation->periodicTasks().registerModule(
        module, needToUpdate, needToReport, sharedForUser(_implementation->runtime(), std::move(serviceBlock)));
  });
}

bool VelkReporting::unregisterPeriodTaskForModule(std::uint32_t module) {
  guardedVoid("unregisterPeriodTaskForModule", [&] {
    if (!_implementation->isForeign()) _implementation->unregisterPeriodicTask(module);
  });
  return true;
}

void VelkReporting::startLogTimerWithInterval(std::uint32_t interval, std::uint32_t reportingMultiplier,
                                              std::uint16_t category, std::uint16_t type) {
  guardedVoid("startLogTimerWithInterval", [&] {
    if (_implementation->isForeign()) return;
    _implementation->periodicTasks().startLogTimer(interval, reportingMultiplier, category, type);
  });
}

void VelkReporting::stopLogTimer() {
  guardedVoid("stopLogTimer", [&] {
    if (!_implementation->isForeign()) _implementation->periodicTasks().stopLogTimer();
  });
}

bool VelkReporting::setDigestKey(const std::optional<ByteData>& digestKey, std::uint32_t algorithm) {
  return guarded("setDigestKey", false, [&] {
    if (!digestKey) {
      log::standard(texts::kDigestKeyIsNil);
      return false;
    }
    if (_implementation->isForeign()) return false;
    _implementation->callInOrder([key = *digestKey, algorithm](Implementation& self) {
      self.setDigestKey(key, static_cast<std::int32_t>(algorithm));
    });
    return true;
  });
}

}  // namespace velk
