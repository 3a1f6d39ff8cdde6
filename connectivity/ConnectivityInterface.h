// What backends see of the HTTP transport, and what the transport sees of the agent.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>

#include "foundation/Completion.h"
#include "foundation/Error.h"
#include "foundation/PropertyValue.h"
#include "platform/HttpSession.h"
#include "platform/Lock.h"

namespace velk {

/// Body data, response (none when the server never answered), error (none on success, whatever the status).
/// Dropped uncalled when the request was ignored: whoever waits must give an abandonment handler.
using HttpCompletion = Completion<ByteData, std::shared_ptr<const HttpResponse>, std::optional<Error>>;

/// The transport that a session gives to its backends.
class ReportingSessionConnectivityInterface {
 public:
  virtual ~ReportingSessionConnectivityInterface() = default;
  /// Posts are taken from here on. For backends that become enabled: they hand nothing to a transport that sleeps.
  /// Idempotent, and cheap once it is active. Only posts: may be called under any lock.
  virtual void activate() {}
  /// Whether a post would be made now. For backends, before they build one: what is not taken is not counted as sent.
  [[nodiscard]] virtual bool takesPosts() const { return true; }
  /// Asynchronous; the completion runs on the transport's own queue. Any thread; never blocks.
  virtual void postURLRequestWithCompletionHandler(HttpRequest request, HttpCompletion completion) = 0;
  /// For senders of events, before they build the next request: waits while too many of `sender` are under way. Never
  /// call it with the agent's lock held.
  virtual void waitForRoom(std::uint64_t /*sender*/) {}
  /// The sender's client has gone: its waiters go on, and `waitForRoom(sender)` returns at once from now on. Any
  /// thread; never blocks.
  virtual void stopWaiting(std::uint64_t /*sender*/) {}
};

/// The agent, as the transport knows it.
class ConnectivityHelperDelegate {
 public:
  virtual ~ConnectivityHelperDelegate() = default;
  /// Gives `count` keep-alive references back. Takes the agent's lock, which the caller may hold already.
  virtual void releaseIPCTransactions(std::uint32_t count) = 0;
  /// The agent's own lock.
  [[nodiscard]] virtual Monitor& monitor() = 0;
};

}  // namespace velk
