// The named service: takes connections on a socket and offers each to the daemon. Made by the daemon's process, one for
// each socket; lives until the daemon stops.
#pragma once

#include <cstddef>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>

#include "foundation/Error.h"
#include "ipc/Connection.h"
#include "ipc/Limits.h"
#include "platform/Entitlements.h"
#include "platform/Queue.h"

namespace velk {

class EventLoop;

/// Accepting happens on the event loop's thread; the decision is taken on the accept queue, one connection at a time.
/// Nothing is read from a connection before the handler has accepted and resumed it. Connections beyond a user's
/// share (of this socket) are closed before anybody is asked. Running out of descriptors lets accepting rest for a
/// moment. The loop's thread asks the kernel alone. Where a decision needs the peer's program, the look-up runs on the
/// delivery queue of that connection, a few at a time for one user: one that takes for ever holds up that user's peers
/// alone.
class Listener {
 public:
  struct Options {
    /// Outlives the listener and all its connections.
    EventLoop* loop = nullptr;
    /// Where `shouldAcceptNewConnection` runs; it may block there.
    std::shared_ptr<Queue> acceptQueue;
    /// Makes the queue on which one connection's frames run. Called on the accept queue.
    std::function<std::shared_ptr<Queue>()> makeDeliveryQueue;
    /// True: the handler has set the connection up and resumed it. False: the connection is closed.
    std::function<bool(const std::shared_ptr<Connection>&)> shouldAcceptNewConnection;
    /// Whether the decision depends on the program that the peer runs. Called on the accept queue; none: never.
    std::function<bool(const PeerCredentials&)> dependsOnExecutable;
    std::function<std::optional<std::string>(std::int32_t pid, std::uint32_t uid)> findExecutable = executableOfProcess;
    std::size_t maximumConnectionsPerUser = ipc::kMaximumConnectionsPerUser;
    /// The service's name in the error that a second daemon gets.
    std::string program = "velkreportingd";
  };

  /// Binds `path` itself (see bindLocalSocket) and removes the socket when it is stopped. Fails with "another
  /// velkreportingd is listening on PATH" if so. Listens from here on, but takes nothing before `resume`.
  [[nodiscard]] static Result<std::unique_ptr<Listener>> bind(const std::string& path, Options options);
  /// Takes over a listening socket that was inherited from the service manager, which keeps its path.
  [[nodiscard]] static Result<std::unique_ptr<Listener>> adopt(FileDescriptor socket, Options options);

  ~Listener();
  Listener(const Listener&) = delete;
  Listener& operator=(const Listener&) = delete;

  /// Returns once connections are being taken, or with the reason why they cannot be. Not on the loop's thread.
  [[nodiscard]] Result<void> resume();
  /// Takes no further connection: waits for the loop to let go of the socket, removes the path if it was bound here.
  /// Not on the loop's thread. Connections that were accepted stay open; a decision under way still finishes.
  /// Idempotent; the destructor calls it.
  void stop();

  /// After `stop`: waits for the decision that is under way, if one is. Connections that were not being decided on by
  /// then are closed. False when it was not taken within `limit`.
  [[nodiscard]] bool waitUntilDecided(Duration limit);

  /// Stops all of these, which share a loop, if none of them has an open or waiting connection; otherwise nothing
  /// happens and the result is false. Looking and stopping are one step: nobody is taken in between. Who connects to a
  /// socket of the service manager afterwards waits for the next daemon.
  [[nodiscard]] static bool stopIfUnused(std::span<const std::unique_ptr<Listener>> listeners);

  /// Somebody waits in the socket's queue, or has been taken from it and not been decided on. With this false and no
  /// connection open the daemon may go without anybody noticing. Any thread.
  [[nodiscard]] bool hasWaitingConnection() const;
  /// Connections whose socket is open here, undecided ones included. Any thread.
  [[nodiscard]] std::size_t openConnections() const;

  class Core;

 private:
  explicit Listener(std::shared_ptr<Core> core) noexcept;
  const std::shared_ptr<Core> _core;
};

}  // namespace velk
