// A connection as the agent sees it while it decides whether to take it, and as the session sees it afterwards.
// One stands on the IPC layer's connection; unit tests bring their own.
#pragma once

#include <functional>
#include <memory>
#include <string_view>

#include "ipc/SessionInterface.h"
#include "platform/Queue.h"
#include "session/SessionServices.h"

namespace velk {

class Connection;

/// Answers `copyStatus`.
using StatusHandler = std::function<void(StatusReply)>;

class IncomingConnection : public SessionConnection {
 public:
  /// The boolean value of the peer's entitlement; false when it has none.
  [[nodiscard]] virtual bool valueOfEntitlement(std::string_view name) const = 0;
  /// Exports the session interface and takes the client's reply interface. Without a status handler the peer may not
  /// read the status. The session is held until the connection has been invalidated.
  virtual void setExportedObject(std::shared_ptr<ClientSessionInterface> session, StatusHandler status) = 0;
  // Handlers run on the connection's queue, once, and are dropped after the invalidation.
  virtual void setInterruptionHandler(Task handler) = 0;
  virtual void setInvalidationHandler(Task handler) = 0;
  /// Runs as soon as the peer is known to have gone, whatever it left behind still has to run; at most once, on the
  /// thread that moves bytes: it only posts.
  virtual void setDepartureHandler(Task handler) = 0;
  /// Nothing is read before.
  virtual void resume() = 0;
};

/// Whether the peer of a connection has an entitlement.
using EntitlementCheck = std::function<bool(std::string_view entitlement, const Connection& connection)>;

[[nodiscard]] std::shared_ptr<IncomingConnection> makeIncomingConnection(std::shared_ptr<Connection> connection,
                                                                         EntitlementCheck hasEntitlement);

}  // namespace velk
