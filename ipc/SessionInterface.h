// The two interfaces that a connection carries. The daemon's session implements the first, and each client exports
// the second back; proxies and dispatchers for both are in SessionProxies.h.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "foundation/Completion.h"
#include "foundation/Error.h"
#include "foundation/PropertyValue.h"
#include "platform/FileDescriptor.h"

namespace velk {

/// Enabled backend names, event whitelist, event blacklist; each may be absent.
using ConfigurationReply =
    Completion<std::optional<PropertyArray>, std::optional<PropertyArray>, std::optional<PropertyArray>>;
/// A text, or none.
using TextReply = Completion<std::optional<std::string>>;
/// The result text and the error, either may be absent.
using FlushReply = Completion<std::optional<std::string>, std::optional<Error>>;
/// Whether the file was taken in hand, and whether a server says that it has it: its owner may then remove it.
using UploadReply = Completion<bool, bool>;
using LogDataReply = Completion<bool, std::optional<Error>>;
using StatusReply = Completion<PropertyDictionary>;

/// What a client asks of its session in the daemon. The calls of one connection arrive one at a time, in order, on
/// that connection's queue. Replies may be absent, are called at most once, and fail the caller's side when dropped.
class ClientSessionInterface {
 public:
  virtual ~ClientSessionInterface() = default;

  virtual void setSessionInfo(PropertyDictionary sessionInfo, std::optional<PropertyDictionary> userInfo,
                              PropertyArray frameworksToCheck, bool hasAggregationBlock) = 0;
  virtual void startConfigWithCompletionHandler(ConfigurationReply reply) = 0;
  virtual void fetchStatesWithUserInfo(std::optional<PropertyDictionary> userInfo, ConfigurationReply reply) = 0;
  virtual void fetchDisplayURL(TextReply reply) = 0;
  virtual void sendMessageWithDictionary(PropertyDictionary dictionary, TextReply reply) = 0;
  virtual void flushMessagesWithCompletion(FlushReply reply) = 0;
  virtual void finishSessionGracefully() = 0;
  /// `file` is the descriptor that came with the call: `extensionToken` names it. `url` is never opened.
  virtual void uploadFileAtPath(std::string url, std::string extensionToken, FileDescriptor file,
                                UploadReply reply) = 0;
  virtual void uploadLogData(PropertyArray logData, LogDataReply reply) = 0;
  virtual void sendMessageWithSessionInfo(PropertyDictionary sessionInfo, std::optional<PropertyDictionary> userInfo,
                                          std::uint16_t category, std::uint16_t type,
                                          std::optional<PropertyDictionary> payload, TextReply reply) = 0;
  virtual void updateSharedDataWithDictionary(PropertyDictionary dictionary) = 0;
  /// Without a value the key is removed.
  virtual void updateSharedDataForKey(std::string key, std::optional<PropertyValue> value) = 0;
  virtual void setDigestKey(ByteData key, std::int32_t algorithm) = 0;
};

/// What the daemon asks of a client: events of other sessions, handed to the one that aggregates them.
class ClientSessionReplyInterface {
 public:
  virtual ~ClientSessionReplyInterface() = default;
  /// `timestamp` in seconds since 1970. Session info and payload absent, everything else 0: aggregation has ended.
  virtual void sendMessageToClient(std::optional<PropertyDictionary> sessionInfo, double timestamp,
                                   std::uint16_t category, std::uint16_t type,
                                   std::optional<PropertyDictionary> payload) = 0;
};

}  // namespace velk
