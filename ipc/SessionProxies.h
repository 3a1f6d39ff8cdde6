// Both interfaces of a connection, on both ends: proxies turn methods into calls, dispatchers turn calls into methods.
#pragma once

#include <atomic>
#include <functional>
#include <memory>

#include "ipc/Connection.h"
#include "ipc/SessionInterface.h"

namespace velk {

/// What a proxy could not deliver, or got no usable answer for.
using ProxyErrorHandler = std::function<void(const Error&)>;

/// The client's side: each method becomes a call on the connection. A small value, cheap enough to be made for one
/// call with an error handler of that call's own. Used on any thread, one at a time.
///
/// For each call either the reply is called (on the connection's delivery queue), or the error handler is (on that
/// queue, or on the caller's thread when the call could not even be sent); never both, never neither. On an error the
/// reply is then destroyed uncalled, after the error handler has run. An empty reply asks for no answer.
class SessionInterfaceProxy final : public ClientSessionInterface {
 public:
  explicit SessionInterfaceProxy(std::shared_ptr<Connection> connection, ProxyErrorHandler errorHandler = {});

  void setSessionInfo(PropertyDictionary sessionInfo, std::optional<PropertyDictionary> userInfo,
                      PropertyArray frameworksToCheck, bool hasAggregationBlock) override;
  void startConfigWithCompletionHandler(ConfigurationReply reply) override;
  void fetchStatesWithUserInfo(std::optional<PropertyDictionary> userInfo, ConfigurationReply reply) override;
  void fetchDisplayURL(TextReply reply) override;
  void sendMessageWithDictionary(PropertyDictionary dictionary, TextReply reply) override;
  void flushMessagesWithCompletion(FlushReply reply) override;
  void finishSessionGracefully() override;
  void uploadFileAtPath(std::string url, std::string extensionToken, FileDescriptor file, UploadReply reply) override;
  void uploadLogData(PropertyArray logData, LogDataReply reply) override;
  void sendMessageWithSessionInfo(PropertyDictionary sessionInfo, std::optional<PropertyDictionary> userInfo,
                                  std::uint16_t category, std::uint16_t type, std::optional<PropertyDictionary> payload,
                                  TextReply reply) override;
  void updateSharedDataWithDictionary(PropertyDictionary dictionary) override;
  void updateSharedDataForKey(std::string key, std::optional<PropertyValue> value) override;
  void setDigestKey(ByteData key, std::int32_t algorithm) override;

  /// Why `sendMessageWithDictionary`, or `sendMessageWithSessionInfo`, could never be sent with these arguments,
  /// whatever the connection: too large, too deep, text that is not UTF-8. In words; null when it could. Any thread.
  [[nodiscard]] static const char* reasonNotToSend(const PropertyDictionary& dictionary);
  [[nodiscard]] static const char* reasonNotToSend(const PropertyDictionary& sessionInfo,
                                                   const std::optional<PropertyDictionary>& userInfo,
                                                   std::uint16_t category, std::uint16_t type,
                                                   const std::optional<PropertyDictionary>& payload);

  /// The daemon's status; refused unless this process may read it.
  void copyStatus(StatusReply reply);

 private:
  const std::shared_ptr<Connection> _connection;
  const ProxyErrorHandler _errorHandler;
};

/// The daemon's side: checks the arguments of each call and calls the session. A call with the wrong number or types of
/// arguments is refused as a whole. Holds the session until the connection drops it, after invalidation.
class SessionInterfaceDispatcher final : public CallDispatcher {
 public:
  /// Answers `copyStatus`; given only for peers that may read the status, others are refused.
  using StatusHandler = std::function<void(StatusReply)>;

  explicit SessionInterfaceDispatcher(std::shared_ptr<ClientSessionInterface> session, StatusHandler status = {});
  [[nodiscard]] Result<void> dispatch(IncomingCall& call) override;

 private:
  const std::shared_ptr<ClientSessionInterface> _session;
  const StatusHandler _status;
};

/// The daemon's way to call a client back. Any thread, under any lock: it neither blocks nor logs. Holds the connection
/// weakly, so a session may hold the proxy.
class ReplyInterfaceProxy final {
 public:
  explicit ReplyInterfaceProxy(const std::shared_ptr<Connection>& connection) : _connection(connection->core()) {}
  /// The error says why the event is not on its way: the connection has ended, its outbox is full, the event is larger
  /// than a frame. The end of aggregation (nothing in any argument) fits into an outbox that takes no more events.
  /// After an event that did not fit none is encoded before an event of any size would fit: the caller may hold a lock
  /// that others want, and a client that stands still would cost the work for every event.
  [[nodiscard]] Result<void> sendMessageToClient(const std::optional<PropertyDictionary>& sessionInfo, double timestamp,
                                                 std::uint16_t category, std::uint16_t type,
                                                 const std::optional<PropertyDictionary>& payload);

 private:
  const std::weak_ptr<ipc::ConnectionCore> _connection;
  std::atomic<bool> _isBehind{false};
};

/// The client's side of the same.
class ReplyInterfaceDispatcher final : public CallDispatcher {
 public:
  explicit ReplyInterfaceDispatcher(std::shared_ptr<ClientSessionReplyInterface> client) : _client(std::move(client)) {}
  [[nodiscard]] Result<void> dispatch(IncomingCall& call) override;

 private:
  const std::shared_ptr<ClientSessionReplyInterface> _client;
};

}  // namespace velk
