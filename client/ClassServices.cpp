// The services of the class that need no client object: identifiers, hierarchy tokens, one-shot messages.

#include "client/Border.h"
#include "client/ClientRuntime.h"
#include "client/DaemonConnection.h"
#include "client/LogTexts.h"
#include "client/SessionInfoValidation.h"
#include "client/VelkReporting.h"
#include "client/VelkReportingImplementation.h"
#include "foundation/Uuid.h"
#include "ipc/SessionProxies.h"
#include "ipc/Vocabulary.h"
#include "platform/Log.h"
#include "platform/PersistentIdentifier.h"

namespace velk {

std::string VelkReporting::getPersistentIdentifierForDNU(bool respectConsent) {
  return guarded("getPersistentIdentifierForDNU", {}, [&] {
    return velk::getPersistentIdentifierForDNU(ClientRuntime::shared().defaults(), respectConsent);
  });
}

void VelkReporting::regeneratePersistentIdentifierForDNU(bool respectConsent) {
  guardedVoid("regeneratePersistentIdentifierForDNU",
              [&] { velk::regeneratePersistentIdentifierForDNU(ClientRuntime::shared().defaults(), respectConsent); });
}

std::optional<PropertyDictionary> VelkReporting::newHierarchyTokenFromParentToken(
    const std::optional<PropertyValue>& parentToken) {
  return guarded("newHierarchyTokenFromParentToken", std::nullopt, [&]() -> std::optional<PropertyDictionary> {
    PropertyDictionary token;
    if (!parentToken) {
      token.set(kVelkReportingHierarchyTokenTokenID, randomUuidText());
      token.set(kVelkReportingHierarchyTokenLevel, 0);
      return token;
    }
    const PropertyDictionary* parent = parentToken->dictionary();
    const PropertyValue* identifier = parent != nullptr ? parent->find(kVelkReportingHierarchyTokenTokenID) : nullptr;
    if (identifier == nullptr) return std::nullopt;
    const std::int64_t level = integerValue(parent->find(kVelkReportingHierarchyTokenLevel));
    token.set(kVelkReportingHierarchyTokenTokenID, *identifier);
    token.set(kVelkReportingHierarchyTokenLevel, static_cast<std::int64_t>(static_cast<std::uint64_t>(level) + 1));
    return token;
  });
}

namespace {

/// One-shot messages that wait for their reply: each has a connection of its own.
constexpr int kMaximumOneShots = 256;

/// Counts one message for as long as its connection is needed.
class OneShotSlot {
 public:
  explicit OneShotSlot(ClientRuntime& runtime) : _runtime(runtime) {}
  OneShotSlot(const OneShotSlot&) = delete;
  OneShotSlot& operator=(const OneShotSlot&) = delete;
  ~OneShotSlot() { _runtime.endOneMessage(); }

 private:
  ClientRuntime& _runtime;
};

struct OneMessage {
  PropertyDictionary sessionInfo;
  std::optional<PropertyDictionary> userInfo;
  std::uint16_t category;
  std::uint16_t type;
  std::optional<PropertyDictionary> payload;
};

void sendOneMessage(ClientRuntime& runtime, const OneMessage& message, std::shared_ptr<OneShotSlot> slot) {
  log::standard(texts::kClientStartsLogging);
  auto made = connectToDaemon(runtime, runtime.oneMessageQueue());
  if (!made) {
    log::standard(texts::kOneMessageFailedToConnect);
    if (isLasting(made.error())) return log::error("sendOneMessageWithSessionInfo: %s", made.error());
    return log::standard("sendOneMessageWithSessionInfo: %s", made.error());
  }
  const std::shared_ptr<Connection> connection = std::move(*made);
  connection->setInvalidationHandler([slot] { log::standard(texts::kOneMessageInvalidated); });
  connection->setInterruptionHandler([] { log::standard(texts::kOneMessageInterrupted); });
  connection->resume();
  const auto failed = [connection](const Error& error) {
    log::standard(texts::kOneMessageNoProxy);
    log::debug("sendOneMessageWithSessionInfo: %s", error);
    connection->invalidate();
  };
  SessionInterfaceProxy(connection, failed)
      .sendMessageWithSessionInfo(message.sessionInfo, message.userInfo, message.category, message.type,
                                  message.payload, [connection](const std::optional<std::string>& text) {
                                    log::standard(texts::kOneMessageReply, text);
                                    connection->invalidate();
                                  });
}

}  // namespace

bool VelkReporting::sendOneMessageWithSessionInfo(const std::optional<PropertyDictionary>& sessionInfo,
                                                  const std::optional<PropertyDictionary>& userInfo,
                                                  std::uint16_t category, std::uint16_t type,
                                                  const std::optional<PropertyDictionary>& payload, Error* error) {
  return guarded("sendOneMessageWithSessionInfo", false, [&] {
    ClientRuntime& runtime = ClientRuntime::shared();
    const auto refuse = [error](Error reason) {
      if (error != nullptr) *error = std::move(reason);
      return false;
    };
    if (auto invalid = validateSessionInfo(sessionInfo)) return refuse(std::move(*invalid));
    const std::string domain(kVelkReportingErrorDomain);
    if (category == 0) return refuse({domain, 4, "the category is 0"});
    OneMessage message{*sessionInfo, userInfo, category, type, payload};
    message.sessionInfo.set(kVelkReportingSessionInfoBatchEvent, false);  // the event must go out at once
    if (const char* reason =
            SessionInterfaceProxy::reasonNotToSend(message.sessionInfo, userInfo, category, type, payload)) {
      log::error(texts::kOneMessageIsNotSendable, category, reason);
      return refuse(
          {domain, VelkReportingImplementation::kNotSendable, std::string("the event cannot be sent: ") + reason});
    }
    if (const auto started = runtime.loop().start(); !started) {
      log::error(texts::kNoThread, "sendOneMessageWithSessionInfo", started.error());
      return refuse({domain, VelkReportingImplementation::kNoResources, "the library gets no thread"});
    }
    if (!runtime.beginOneMessage(kMaximumOneShots)) {
      return refuse({domain, VelkReportingImplementation::kOutboxFull, "too many single messages are under way"});
    }
    auto slot = std::make_shared<OneShotSlot>(runtime);
    if (error != nullptr) *error = {};
    runtime.oneMessageQueue()->async([&runtime, message = std::move(message), slot = std::move(slot)]() mutable {
      sendOneMessage(runtime, message, std::move(slot));
    });
    return true;
  });
}

}  // namespace velk
