// The numbers under which methods travel. A number, once given, keeps its meaning for ever.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string_view>

namespace velk {

enum class Method : std::uint32_t {
  // ClientSessionInterface, client to daemon.
  setSessionInfo = 1,
  startConfigWithCompletionHandler = 2,
  fetchStatesWithUserInfo = 3,
  fetchDisplayURL = 4,
  sendMessageWithDictionary = 5,
  flushMessagesWithCompletion = 6,
  finishSessionGracefully = 7,
  uploadFileAtPath = 8,
  uploadLogData = 9,
  sendMessageWithSessionInfo = 10,
  updateSharedDataWithDictionary = 11,
  updateSharedDataForKey = 12,
  setDigestKey = 13,
  // ClientSessionReplyInterface, daemon to client.
  sendMessageToClient = 32,
  // The daemon's status, for peers that may read it.
  copyStatus = 64,
};

struct MethodDescription {
  Method method;
  std::string_view name;
  std::size_t argumentCount;
  /// Values in its reply; methods without one answer with no values when the caller asks for an answer.
  std::size_t replyCount;
};

[[nodiscard]] std::span<const MethodDescription> allMethods() noexcept;
/// Nothing for a number or name that is not in the table.
[[nodiscard]] const MethodDescription* methodWithNumber(std::uint32_t number) noexcept;
[[nodiscard]] const MethodDescription* methodWithName(std::string_view name) noexcept;

}  // namespace velk
