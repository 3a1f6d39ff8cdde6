#include "ipc/SessionProxies.h"

#include "ipc/ArgumentReader.h"
#include "ipc/CallBody.h"
#include "ipc/ConnectionCore.h"
#include "ipc/LogTexts.h"
#include "ipc/MethodTable.h"
#include "platform/Log.h"

namespace velk {
namespace {

using ipc::ArgumentReader;

constexpr std::uint32_t numberOf(Method method) { return static_cast<std::uint32_t>(method); }

void report(const ProxyErrorHandler& handler, const Error& error) {
  if (handler) handler(error);
}

/// Sends a call without an answer.
template <class Encode>
void sendOneWay(Connection& connection, const ProxyErrorHandler& handler, Method method, std::size_t count,
                Encode encode) {
  if (const auto sent = connection.send(numberOf(method), count, encode); !sent) report(handler, sent.error());
}

/// Sends a call whose answer `deliver(ArgumentReader&, reply)` hands on; it answers false, and leaves the reply alone,
/// when the values have the wrong types.
template <class TypedReply, class Encode, class Deliver>
void sendWithReply(Connection& connection, const ProxyErrorHandler& handler, Method method, std::size_t count,
                   Encode encode, TypedReply reply, Deliver deliver, std::vector<FileDescriptor> descriptors = {}) {
  ReplyHandler onReply;
  if (reply) {
    onReply = [handler, deliver, reply = std::move(reply)](Result<PropertyArray> result) mutable {
      if (!result) return report(handler, result.error());
      auto& values = *result;
      ArgumentReader arguments(values.empty() ? nullptr : &values.mutableAt(0), values.size());
      if (deliver(arguments, reply)) return;
      report(handler, connectionError(ConnectionError::badReply, "the reply has the wrong types"));
    };
  }
  const auto sent = connection.callOrKeep(numberOf(method), count, encode, onReply, std::move(descriptors));
  if (sent) return;
  if (onReply) {
    onReply(Failure(sent.error()));
  } else {
    report(handler, sent.error());
  }
}

void nothing(CborWriter&) {}

auto argumentsOfMessage(const PropertyDictionary& dictionary) {
  return [&dictionary](CborWriter& writer) { writer.value(dictionary); };
}

constexpr std::size_t kSingleMessageArguments = 5;

auto argumentsOfSingleMessage(const PropertyDictionary& sessionInfo, const std::optional<PropertyDictionary>& userInfo,
                              std::uint16_t category, std::uint16_t type,
                              const std::optional<PropertyDictionary>& payload) {
  return [&sessionInfo, &userInfo, category, type, &payload](CborWriter& writer) {
    writer.value(sessionInfo);
    writer.optional(userInfo);
    writer.unsignedInteger(category);
    writer.unsignedInteger(type);
    writer.optional(payload);
  };
}

bool deliverConfiguration(ArgumentReader& values, ConfigurationReply& reply) {
  auto backends = values.optionalArray();
  auto whitelist = values.optionalArray();
  auto blacklist = values.optionalArray();
  if (!values.isSound()) return false;
  reply(std::move(backends), std::move(whitelist), std::move(blacklist));
  return true;
}

bool deliverText(ArgumentReader& values, TextReply& reply) {
  auto text = values.optionalText();
  if (!values.isSound()) return false;
  reply(std::move(text));
  return true;
}

bool deliverFlush(ArgumentReader& values, FlushReply& reply) {
  auto text = values.optionalText();
  auto error = values.optionalError();
  if (!values.isSound()) return false;
  reply(std::move(text), std::move(error));
  return true;
}

bool deliverUpload(ArgumentReader& values, UploadReply& reply) {
  const bool success = values.boolean();
  const bool isDelivered = values.boolean();
  if (!values.isSound()) return false;
  reply(success, isDelivered);
  return true;
}

bool deliverLogData(ArgumentReader& values, LogDataReply& reply) {
  const bool success = values.boolean();
  auto error = values.optionalError();
  if (!values.isSound()) return false;
  reply(success, std::move(error));
  return true;
}

bool deliverStatus(ArgumentReader& values, StatusReply& reply) {
  auto status = values.dictionary();
  if (!values.isSound()) return false;
  reply(std::move(status));
  return true;
}

}  // namespace

SessionInterfaceProxy::SessionInterfaceProxy(std::shared_ptr<Connection> connection, ProxyErrorHandler errorHandler)
    : _connection(std::move(connection)), _errorHandler(std::move(errorHandler)) {}

void SessionInterfaceProxy::setSessionInfo(PropertyDictionary sessionInfo, std::optional<PropertyDictionary> userInfo,
                                           PropertyArray frameworksToCheck, bool hasAggregationBlock) {
  sendOneWay(*_connection, _errorHandler, Method::setSessionInfo, 4, [&](CborWriter& writer) {
    writer.value(sessionInfo);
    writer.optional(userInfo);
    writer.value(frameworksToCheck);
    writer.boolean(hasAggregationBlock);
  });
}

void SessionInterfaceProxy::startConfigWithCompletionHandler(ConfigurationReply reply) {
  sendWithReply(*_connection, _errorHandler, Method::startConfigWithCompletionHandler, 0, nothing, std::move(reply),
                deliverConfiguration);
}

void SessionInterfaceProxy::fetchStatesWithUserInfo(std::optional<PropertyDictionary> userInfo,
                                                    ConfigurationReply reply) {
  sendWithReply(
      *_connection, _errorHandler, Method::fetchStatesWithUserInfo, 1,
      [&](CborWriter& writer) { writer.optional(userInfo); }, std::move(reply), deliverConfiguration);
}

void SessionInterfaceProxy::fetchDisplayURL(TextReply reply) {
  sendWithReply(*_connection, _errorHandler, Method::fetchDisplayURL, 0, nothing, std::move(reply), deliverText);
}

void SessionInterfaceProxy::sendMessageWithDictionary(PropertyDictionary dictionary, TextReply reply) {
  sendWithReply(*_connection, _errorHandler, Method::sendMessageWithDictionary, 1, argumentsOfMessage(dictionary),
                std::move(reply), deliverText);
}

void SessionInterfaceProxy::flushMessagesWithCompletion(FlushReply reply) {
  sendWithReply(*_connection, _errorHandler, Method::flushMessagesWithCompletion, 0, nothing, std::move(reply),
                deliverFlush);
}

void SessionInterfaceProxy::finishSessionGracefully() {
  sendOneWay(*_connection, _errorHandler, Method::finishSessionGracefully, 0, nothing);
}

void SessionInterfaceProxy::uploadFileAtPath(std::string url, std::string extensionToken, FileDescriptor file,
                                             UploadReply reply) {
  std::vector<FileDescriptor> descriptors;
  if (file) descriptors.push_back(std::move(file));
  const auto encode = [&](CborWriter& writer) {
    writer.text(url);
    writer.bytes({reinterpret_cast<const std::uint8_t*>(extensionToken.data()), extensionToken.size()});
  };
  sendWithReply(*_connection, _errorHandler, Method::uploadFileAtPath, 2, encode, std::move(reply), deliverUpload,
                std::move(descriptors));
}

void SessionInterfaceProxy::uploadLogData(PropertyArray logData, LogDataReply reply) {
  sendWithReply(
      *_connection, _errorHandler, Method::uploadLogData, 1, [&](CborWriter& writer) { writer.value(logData); },
      std::move(reply), deliverLogData);
}

void SessionInterfaceProxy::sendMessageWithSessionInfo(PropertyDictionary sessionInfo,
                                                       std::optional<PropertyDictionary> userInfo,
                                                       std::uint16_t category, std::uint16_t type,
                                                       std::optional<PropertyDictionary> payload, TextReply reply) {
  sendWithReply(*_connection, _errorHandler, Method::sendMessageWithSessionInfo, kSingleMessageArguments,
                argumentsOfSingleMessage(sessionInfo, userInfo, category, type, payload), std::move(reply),
                deliverText);
}

const char* SessionInterfaceProxy::reasonNotToSend(const PropertyDictionary& dictionary) {
  return ipc::reasonNotToCall(numberOf(Method::sendMessageWithDictionary), 1, argumentsOfMessage(dictionary));
}

const char* SessionInterfaceProxy::reasonNotToSend(const PropertyDictionary& sessionInfo,
                                                   const std::optional<PropertyDictionary>& userInfo,
                                                   std::uint16_t category, std::uint16_t type,
                                                   const std::optional<PropertyDictionary>& payload) {
  return ipc::reasonNotToCall(numberOf(Method::sendMessageWithSessionInfo), kSingleMessageArguments,
                              argumentsOfSingleMessage(sessionInfo, userInfo, category, type, payload));
}

void SessionInterfaceProxy::updateSharedDataWithDictionary(PropertyDictionary dictionary) {
  sendOneWay(*_connection, _errorHandler, Method::updateSharedDataWithDictionary, 1,
             [&](CborWriter& writer) { writer.value(dictionary); });
}

void SessionInterfaceProxy::updateSharedDataForKey(std::string key, std::optional<PropertyValue> value) {
  sendOneWay(*_connection, _errorHandler, Method::updateSharedDataForKey, 2, [&](CborWriter& writer) {
    writer.text(key);
    writer.optional(value);
  });
}

void SessionInterfaceProxy::setDigestKey(ByteData key, std::int32_t algorithm) {
  sendOneWay(*_connection, _errorHandler, Method::setDigestKey, 2, [&](CborWriter& writer) {
    writer.bytes(key);
    writer.integer(algorithm);
  });
}

void SessionInterfaceProxy::copyStatus(StatusReply reply) {
  sendWithReply(*_connection, _errorHandler, Method::copyStatus, 0, nothing, std::move(reply), deliverStatus);
}

Result<void> ReplyInterfaceProxy::sendMessageToClient(const std::optional<PropertyDictionary>& sessionInfo,
                                                      double timestamp, std::uint16_t category, std::uint16_t type,
                                                      const std::optional<PropertyDictionary>& payload) {
  const auto core = _connection.lock();
  if (!core) return Failure(connectionError(ConnectionError::ended, "the connection has ended"));
  const auto encode = [&](CborWriter& writer) {
    writer.optional(sessionInfo);
    writer.real(timestamp);
    writer.unsignedInteger(category);
    writer.unsignedInteger(type);
    writer.optional(payload);
  };
  const auto method = numberOf(Method::sendMessageToClient);
  // Events may be missed by a client that reads slowly, but not that there will be no more of them.
  const bool isEnd = !sessionInfo && !payload && category == 0 && type == 0;
  Connection connection(core);
  if (isEnd) return connection.sendFirmly(method, 5, encode);
  if (_isBehind && !connection.hasRoomForAnyCall()) {
    return Failure(connectionError(ConnectionError::outboxFull, "the outbox is full: the peer reads too slowly"));
  }
  auto sent = connection.send(method, 5, encode);
  _isBehind = !sent && sent.error().code == static_cast<int>(ConnectionError::outboxFull);
  return sent;
}

}  // namespace velk
