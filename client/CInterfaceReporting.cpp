// The C interface: what a client reports, and the services that need no client.

#include <cstring>

#include "client/CInterfaceCallbacks.h"
#include "client/CInterfaceHandles.h"
#include "foundation/Text.h"
#include "ipc/Vocabulary.h"

using velk::Error;
using velk::PropertyDictionary;
using velk::VelkReporting;
using velk::cinterface::blockOf;
using velk::cinterface::dictionaryOf;
using velk::cinterface::guarded;
using velk::cinterface::guardedVoid;
using velk::cinterface::handOut;
using velk::cinterface::newError;
using velk::cinterface::newValueOrNull;
using velk::cinterface::optionalDictionary;
using velk::cinterface::ownCallback;
using velk::cinterface::Owned;

namespace {

bool refuseType(VelkReportingError** error, const char* name) {
  handOut(error, {std::string(velk::kVelkReportingErrorDomain), kVelkReportingErrorWrongType,
                  std::string(name) + " is no dictionary"});
  return false;
}

bool isOtherThanDictionary(const VelkReportingValue* value) {
  return value != nullptr && dictionaryOf(value) == nullptr;
}

}  // namespace

void VelkReportingSetMessageBlock(VelkReportingClient* client, VelkReportingMessageCallback callback, void* context,
                                  VelkReportingDestroyFunction destroy) {
  auto shared = ownCallback(callback, context, destroy);
  if (client == nullptr) return;
  guardedVoid(__func__, [&] {
    client->client->setMessageLoggingBlock(blockOf<VelkReporting::LoggingBlock>(std::move(shared), [](auto owner) {
      return [owner = std::move(owner)](const std::string& text) { (*owner)(text.c_str()); };
    }));
  });
}

bool VelkReportingSendMessageWithError(VelkReportingClient* client, uint16_t category, uint16_t type,
                                       const VelkReportingValue* payload, VelkReportingError** error) {
  if (client == nullptr) return false;
  if (error != nullptr) *error = nullptr;
  return guarded(__func__, false, [&] {
    if (isOtherThanDictionary(payload)) return refuseType(error, "the payload");
    Error reason;
    const bool sent = client->client->sendMessageWithCategory(category, type, optionalDictionary(payload), &reason);
    handOut(error, reason);
    return sent;
  });
}

bool VelkReportingSendMessageWithDictionary(VelkReportingClient* client, const VelkReportingValue* message,
                                            VelkReportingError** error) {
  if (client == nullptr) return false;
  if (error != nullptr) *error = nullptr;
  return guarded(__func__, false, [&] {
    const PropertyDictionary* dictionary = dictionaryOf(message);
    if (dictionary == nullptr) return refuseType(error, "the message");
    Error reason;
    const bool sent = client->client->sendMessageWithDictionary(*dictionary, &reason);
    handOut(error, reason);
    return sent;
  });
}

void VelkReportingFlushMessages(VelkReportingClient* client) {
  if (client == nullptr) return;
  guardedVoid(__func__, [&] { client->client->flushMessages(); });
}

void VelkReportingFlushMessagesWithCompletion(VelkReportingClient* client, VelkReportingFlushCallback callback,
                                              void* context, VelkReportingDestroyFunction destroy) {
  auto shared = ownCallback(callback, context, destroy);
  if (client == nullptr) return;
  guardedVoid(__func__, [&] {
    client->client->flushMessagesWithCompletion(
        blockOf<VelkReporting::FlushCallback>(std::move(shared), [](auto owner) {
          return [owner = std::move(owner)](const std::optional<Error>& error) {
            const Owned<VelkReportingError> handle(error ? newError(*error) : nullptr);
            (*owner)(handle.get());
          };
        }));
  });
}

void VelkReportingClientFinishSession(VelkReportingClient* client) {
  if (client == nullptr) return;
  guardedVoid(__func__, [&] { client->client->finishSession(); });
}

void VelkReportingUpdateSharedDataWithDictionary(VelkReportingClient* client, const VelkReportingValue* dictionary) {
  const PropertyDictionary* entries = dictionaryOf(dictionary);
  if (client == nullptr || entries == nullptr) return;
  guardedVoid(__func__, [&] { client->client->updateSharedDataWithDictionary(*entries); });
}

void VelkReportingUpdateSharedDataForKey(VelkReportingClient* client, const char* key,
                                         const VelkReportingValue* value) {
  if (client == nullptr || key == nullptr || !velk::isUtf8(key)) return;
  guardedVoid(__func__, [&] {
    client->client->updateSharedDataForKey(key, value != nullptr ? std::optional(value->value) : std::nullopt);
  });
}

bool VelkReportingUploadLogWithArray(VelkReportingClient* client, const VelkReportingValue* logData) {
  if (client == nullptr) return false;
  return guarded(__func__, false, [&] {
    const velk::PropertyArray* array = velk::cinterface::arrayOf(logData);
    return client->client->uploadDataArray(array != nullptr ? std::optional(*array) : std::nullopt, nullptr);
  });
}

bool VelkReportingClientUploadFile(VelkReportingClient* client, const char* path, VelkReportingUploadCallback callback,
                                   void* context, VelkReportingDestroyFunction destroy) {
  auto shared = ownCallback(callback, context, destroy);
  if (client == nullptr) return false;
  return guarded(__func__, false, [&] {
    return client->client->uploadFileWithURL(
        path != nullptr ? std::optional<std::string>(path) : std::nullopt,
        blockOf<VelkReporting::UploadCallback>(std::move(shared), [](auto owner) {
          return [owner = std::move(owner)](bool uploaded, const std::optional<Error>&) { (*owner)(uploaded); };
        }));
  });
}

bool VelkReportingClientServerSupportsFileUpload(VelkReportingClient* client) {
  if (client == nullptr) return false;
  return guarded(__func__, false, [&] { return client->client->serverSupportsFileUpload(); });
}

bool VelkReportingClientSetDigestKey(VelkReportingClient* client, const void* key, size_t size, uint32_t algorithm) {
  if (client == nullptr) return false;
  return guarded(__func__, false, [&] {
    if (key == nullptr) return client->client->setDigestKey(std::nullopt, algorithm);
    const auto* bytes = static_cast<const std::uint8_t*>(key);
    return client->client->setDigestKey(velk::ByteData(bytes, bytes + size), algorithm);
  });
}

VelkReportingValue* VelkReportingNewHierarchyTokenFromParentToken(const VelkReportingValue* parentToken) {
  return guarded(__func__, nullptr, [&] {
    return newValueOrNull(VelkReporting::newHierarchyTokenFromParentToken(
        parentToken != nullptr ? std::optional(parentToken->value) : std::nullopt));
  });
}

VelkReportingValue* VelkReportingCreateHierarchyTokenFromParentToken(const VelkReportingValue* parentToken) {
  return VelkReportingNewHierarchyTokenFromParentToken(parentToken);
}

bool VelkReportingSendOneMessage(const VelkReportingValue* sessionInfo, const VelkReportingValue* userInfo,
                                 uint16_t category, uint16_t type, const VelkReportingValue* payload,
                                 VelkReportingError** error) {
  if (error != nullptr) *error = nullptr;
  return guarded(__func__, false, [&] {
    if (isOtherThanDictionary(payload)) return refuseType(error, "the payload");
    if (isOtherThanDictionary(userInfo)) return refuseType(error, "the user info");
    Error reason;
    const bool taken =
        VelkReporting::sendOneMessageWithSessionInfo(optionalDictionary(sessionInfo), optionalDictionary(userInfo),
                                                     category, type, optionalDictionary(payload), &reason);
    handOut(error, reason);
    return taken;
  });
}

char* VelkReportingCopyPersistentIdentifier(bool respectConsent) {
  return guarded(__func__, nullptr,
                 [&] { return strdup(VelkReporting::getPersistentIdentifierForDNU(respectConsent).c_str()); });
}

void VelkReportingRegeneratePersistentIdentifier(bool respectConsent) {
  guardedVoid(__func__, [&] { VelkReporting::regeneratePersistentIdentifierForDNU(respectConsent); });
}
