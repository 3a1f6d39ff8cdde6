#include "daemon/IncomingConnection.h"

#include "ipc/Connection.h"
#include "ipc/SessionProxies.h"

namespace velk {

namespace {

class IpcIncomingConnection : public IncomingConnection {
 public:
  IpcIncomingConnection(std::shared_ptr<Connection> connection, EntitlementCheck hasEntitlement)
      : _connection(std::move(connection)), _hasEntitlement(std::move(hasEntitlement)), _client(_connection) {}

  bool valueOfEntitlement(std::string_view name) const override { return _hasEntitlement(name, *_connection); }

  void setExportedObject(std::shared_ptr<ClientSessionInterface> session, StatusHandler status) override {
    _connection->setExportedDispatcher(
        std::make_shared<SessionInterfaceDispatcher>(std::move(session), std::move(status)));
  }

  void setInterruptionHandler(Task handler) override { _connection->setInterruptionHandler(std::move(handler)); }
  void setInvalidationHandler(Task handler) override { _connection->setInvalidationHandler(std::move(handler)); }
  void setDepartureHandler(Task handler) override { _connection->setDepartureHandler(std::move(handler)); }
  void resume() override { _connection->resume(); }
  void invalidate() override { _connection->invalidate(); }

  // The proxy logs what does not fit into the outbox.
  Result<void> sendMessageToClient(const std::optional<PropertyDictionary>& sessionInfo, double timestamp,
                                   std::uint16_t category, std::uint16_t type,
                                   const std::optional<PropertyDictionary>& payload) override {
    return _client.sendMessageToClient(sessionInfo, timestamp, category, type, payload);
  }

  std::string description() const override { return _connection->description(); }
  std::uint32_t user() const override { return _connection->peer().uid; }

 private:
  const std::shared_ptr<Connection> _connection;
  const EntitlementCheck _hasEntitlement;
  ReplyInterfaceProxy _client;
};

}  // namespace

std::shared_ptr<IncomingConnection> makeIncomingConnection(std::shared_ptr<Connection> connection,
                                                           EntitlementCheck hasEntitlement) {
  return std::make_shared<IpcIncomingConnection>(std::move(connection), std::move(hasEntitlement));
}

}  // namespace velk
