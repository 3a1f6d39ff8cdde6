// A session with the daemon from within the test's own process, over the real wire, without the library's own
// filtering and without a process for each: for tests that need hundreds.
#pragma once

#include <optional>

#include "ipc/Connection.h"
#include "ipc/SessionProxies.h"
#include "platform/EventLoop.h"
#include "tests/integration/Daemon.h"

namespace velk::test {

/// Used by one thread of the test, which must not be the loop's.
class WireSession {
 public:
  /// Fails the test when nobody takes the connection.
  WireSession(const Daemon& daemon, EventLoop& loop);
  /// Says goodbye behind everything that was sent, and lets go at once.
  ~WireSession();
  WireSession(const WireSession&) = delete;
  WireSession& operator=(const WireSession&) = delete;

  void describe(const PropertyDictionary& sessionInfo, const std::optional<PropertyDictionary>& userInfo);
  /// Asks for the configuration and does not wait for it.
  void startConfiguration();
  /// The enabled backends, nothing when there is no answer in time.
  [[nodiscard]] std::optional<PropertyArray> configure();
  /// An event, and no answer.
  void send(int category, int type, const PropertyDictionary& payload);
  void finish();
  /// For any other call.
  [[nodiscard]] SessionInterfaceProxy proxy() const { return SessionInterfaceProxy(_connection); }
  /// Everything was handed to the system.
  [[nodiscard]] bool waitUntilSent();

 private:
  std::shared_ptr<Connection> _connection;
};

/// What `velkreportingctl status` reads; empty when it cannot.
[[nodiscard]] PropertyDictionary statusOf(const Daemon& daemon);
/// Waits until the daemon holds no hierarchy, transport or active client, and no session and keep-alive reference but
/// those of `bystanders`: connections that say nothing. The last status when that did not come in time, for the
/// message; empty otherwise.
[[nodiscard]] PropertyDictionary whatIsLeft(const Daemon& daemon, int bystanders = 0);

}  // namespace velk::test
