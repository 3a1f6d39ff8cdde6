#include "foundation/Text.h"
#include "ipc/ArgumentReader.h"
#include "ipc/Limits.h"
#include "ipc/MethodTable.h"
#include "ipc/SessionProxies.h"
#include "ipc/Vocabulary.h"

namespace velk {
namespace {

using ipc::ArgumentReader;

Failure refused(std::string why) { return Failure(connectionError(ConnectionError::refused, std::move(why))); }

/// The method of a call that an interface has, with as many arguments as it takes.
Result<Method> methodOf(const IncomingCall& call) {
  const auto* description = methodWithNumber(call.method);
  if (description == nullptr) return refused("unknown method");
  if (description->argumentCount == call.arguments.size()) return description->method;
  return refused("wrong number of arguments for " + std::string(description->name));
}

void writeError(CborWriter& writer, const std::optional<Error>& error) {
  if (!error) return writer.null();
  writer.beginArray(3);
  writer.text(error->domain);
  writer.integer(error->code);
  writer.text(error->description);
}

void writeText(CborWriter& writer, const std::optional<std::string>& text) {
  if (!text || text->size() <= ipc::kMaximumReplyTextBytes) return writer.optional(text);
  const auto kept = utf8Prefix(*text, ipc::kMaximumReplyTextBytes);
  writer.text(std::string(kept) + "\n(" + std::to_string(text->size() - kept.size()) + " more bytes are left out)");
}

// Typed completions over a reply. A call that wants no answer gives an absent one; a completion that is dropped
// drops the reply, which then answers with an error.

TextReply textReply(Reply& reply) {
  if (!reply) return nullptr;
  return [reply = std::move(reply)](const std::optional<std::string>& text) mutable {
    reply.send(1, [&](CborWriter& writer) { writeText(writer, text); });
  };
}

ConfigurationReply configurationReply(Reply& reply) {
  if (!reply) return nullptr;
  return [reply = std::move(reply)](const std::optional<PropertyArray>& backends,
                                    const std::optional<PropertyArray>& whitelist,
                                    const std::optional<PropertyArray>& blacklist) mutable {
    reply.send(3, [&](CborWriter& writer) {
      writer.optional(backends);
      writer.optional(whitelist);
      writer.optional(blacklist);
    });
  };
}

FlushReply flushReply(Reply& reply) {
  if (!reply) return nullptr;
  return [reply = std::move(reply)](const std::optional<std::string>& text, const std::optional<Error>& error) mutable {
    reply.send(2, [&](CborWriter& writer) {
      writeText(writer, text);
      writeError(writer, error);
    });
  };
}

UploadReply uploadReply(Reply& reply) {
  if (!reply) return nullptr;
  return [reply = std::move(reply)](bool success, bool isDelivered) mutable {
    reply.send(2, [&](CborWriter& writer) {
      writer.boolean(success);
      writer.boolean(isDelivered);
    });
  };
}

LogDataReply logDataReply(Reply& reply) {
  if (!reply) return nullptr;
  return [reply = std::move(reply)](bool success, const std::optional<Error>& error) mutable {
    reply.send(2, [&](CborWriter& writer) {
      writer.boolean(success);
      writeError(writer, error);
    });
  };
}

StatusReply statusReply(Reply& reply) {
  if (!reply) return nullptr;
  return [reply = std::move(reply)](const PropertyDictionary& status) mutable {
    reply.send(1, [&](CborWriter& writer) { writer.value(status); });
  };
}

bool areTexts(const PropertyArray& values) {
  for (const auto& value : values) {
    if (value.string() == nullptr) return false;
  }
  return true;
}

bool areDictionaries(const PropertyArray& values) {
  for (const auto& value : values) {
    if (value.dictionary() == nullptr) return false;
  }
  return true;
}

/// Runs one call on the session; each method answers whether the arguments were sound, and runs nothing otherwise.
class SessionCall {
 public:
  SessionCall(IncomingCall& call, ClientSessionInterface& session)
      : _call(call), _session(session), _arguments(call.arguments.data(), call.arguments.size()) {}

  bool setSessionInfo() {
    auto sessionInfo = _arguments.dictionary();
    auto userInfo = _arguments.optionalDictionary();
    auto frameworks = _arguments.optionalArray().value_or(PropertyArray());
    const bool hasAggregationBlock = _arguments.boolean();
    if (!_arguments.isSound() || !areTexts(frameworks)) return false;
    _session.setSessionInfo(std::move(sessionInfo), std::move(userInfo), std::move(frameworks), hasAggregationBlock);
    return true;
  }
  bool startConfig() {
    _session.startConfigWithCompletionHandler(configurationReply(_call.reply));
    return true;
  }
  bool fetchStates() {
    auto userInfo = _arguments.optionalDictionary();
    if (!_arguments.isSound()) return false;
    _session.fetchStatesWithUserInfo(std::move(userInfo), configurationReply(_call.reply));
    return true;
  }
  bool fetchDisplayURL() {
    _session.fetchDisplayURL(textReply(_call.reply));
    return true;
  }
  bool sendMessage() {
    auto message = _arguments.dictionary();
    if (!_arguments.isSound()) return false;
    _session.sendMessageWithDictionary(std::move(message), textReply(_call.reply));
    return true;
  }
  bool flushMessages() {
    _session.flushMessagesWithCompletion(flushReply(_call.reply));
    return true;
  }
  bool finishSession() {
    _session.finishSessionGracefully();
    return true;
  }
  bool uploadFile() {
    auto url = _arguments.text();
    auto token = _arguments.byteString();
    if (!_arguments.isSound()) return false;
    auto file = _call.descriptors.empty() ? FileDescriptor() : std::move(_call.descriptors.front());
    _session.uploadFileAtPath(std::move(url), std::move(token), std::move(file), uploadReply(_call.reply));
    return true;
  }
  bool uploadLogData() {
    auto logData = _arguments.array();
    if (!_arguments.isSound() || !areDictionaries(logData)) return false;
    _session.uploadLogData(std::move(logData), logDataReply(_call.reply));
    return true;
  }
  bool sendOneMessage() {
    auto sessionInfo = _arguments.dictionary();
    auto userInfo = _arguments.optionalDictionary();
    const auto category = _arguments.integer<std::uint16_t>();
    const auto type = _arguments.integer<std::uint16_t>();
    auto payload = _arguments.optionalDictionary();
    if (!_arguments.isSound()) return false;
    _session.sendMessageWithSessionInfo(std::move(sessionInfo), std::move(userInfo), category, type, std::move(payload),
                                        textReply(_call.reply));
    return true;
  }
  bool updateSharedData() {
    auto entries = _arguments.dictionary();
    if (!_arguments.isSound()) return false;
    _session.updateSharedDataWithDictionary(std::move(entries));
    return true;
  }
  bool updateSharedDataForKey() {
    auto key = _arguments.text();
    auto value = _arguments.optionalValue();
    if (!_arguments.isSound()) return false;
    _session.updateSharedDataForKey(std::move(key), std::move(value));
    return true;
  }
  bool setDigestKey() {
    auto key = _arguments.bytes();
    const auto algorithm = _arguments.integer<std::int32_t>();
    if (!_arguments.isSound()) return false;
    _session.setDigestKey(std::move(key), algorithm);
    return true;
  }

  bool run(Method method) {
    switch (method) {
      case Method::setSessionInfo:
        return setSessionInfo();
      case Method::startConfigWithCompletionHandler:
        return startConfig();
      case Method::fetchStatesWithUserInfo:
        return fetchStates();
      case Method::fetchDisplayURL:
        return fetchDisplayURL();
      case Method::sendMessageWithDictionary:
        return sendMessage();
      case Method::flushMessagesWithCompletion:
        return flushMessages();
      case Method::finishSessionGracefully:
        return finishSession();
      case Method::uploadFileAtPath:
        return uploadFile();
      case Method::uploadLogData:
        return uploadLogData();
      case Method::sendMessageWithSessionInfo:
        return sendOneMessage();
      case Method::updateSharedDataWithDictionary:
        return updateSharedData();
      case Method::updateSharedDataForKey:
        return updateSharedDataForKey();
      case Method::setDigestKey:
        return setDigestKey();
      case Method::sendMessageToClient:
      case Method::copyStatus:
        break;
    }
    return false;
  }

 private:
  IncomingCall& _call;
  ClientSessionInterface& _session;
  ArgumentReader _arguments;
};

Failure wrongType(Method method) {
  const auto* description = methodWithNumber(static_cast<std::uint32_t>(method));
  return refused("wrong argument types for " + std::string(description->name));
}

}  // namespace

SessionInterfaceDispatcher::SessionInterfaceDispatcher(std::shared_ptr<ClientSessionInterface> session,
                                                       StatusHandler status)
    : _session(std::move(session)), _status(std::move(status)) {}

Result<void> SessionInterfaceDispatcher::dispatch(IncomingCall& call) {
  const auto method = methodOf(call);
  if (!method) return Failure(method.error());
  if (*method == Method::sendMessageToClient) return refused("unknown method");
  if (*method == Method::copyStatus) {
    if (!_status) {
      return refused("reading the status takes the entitlement " + std::string(kStatusEntitlement) +
                     ": grant it in entitlements.d of the daemon's configuration directory, reload the daemon, and "
                     "connect again");
    }
    _status(statusReply(call.reply));
    return {};
  }
  if (!SessionCall(call, *_session).run(*method)) return wrongType(*method);
  if (methodWithNumber(call.method)->replyCount == 0) call.reply.sendValues({});
  return {};
}

Result<void> ReplyInterfaceDispatcher::dispatch(IncomingCall& call) {
  const auto method = methodOf(call);
  if (!method) return Failure(method.error());
  if (*method != Method::sendMessageToClient) return refused("unknown method");
  ArgumentReader arguments(call.arguments.data(), call.arguments.size());
  auto sessionInfo = arguments.optionalDictionary();
  const double timestamp = arguments.real();
  const auto category = arguments.integer<std::uint16_t>();
  const auto type = arguments.integer<std::uint16_t>();
  auto payload = arguments.optionalDictionary();
  if (!arguments.isSound()) return wrongType(*method);
  _client->sendMessageToClient(std::move(sessionInfo), timestamp, category, type, std::move(payload));
  call.reply.sendValues({});
  return {};
}

}  // namespace velk
