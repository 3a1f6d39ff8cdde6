// A connection whose entitlements, interruption and end a test decides.
#pragma once

#include <memory>
#include <set>
#include <string>
#include <utility>

#include "daemon/IncomingConnection.h"

namespace velk::test {

class FakeIncomingConnection : public IncomingConnection {
 public:
  explicit FakeIncomingConnection(std::set<std::string, std::less<>> entitlements)
      : _entitlements(std::move(entitlements)) {}

  bool valueOfEntitlement(std::string_view name) const override { return _entitlements.count(name) > 0; }
  void setExportedObject(std::shared_ptr<ClientSessionInterface> session, StatusHandler status) override {
    exported = std::move(session);
    statusHandler = std::move(status);
  }
  void setInterruptionHandler(Task handler) override { _interruption = std::move(handler); }
  void setInvalidationHandler(Task handler) override { _invalidation = std::move(handler); }
  void setDepartureHandler(Task handler) override { _departure = std::move(handler); }
  void resume() override { resumed = true; }
  void invalidate() override { invalidated = true; }
  Result<void> sendMessageToClient(const std::optional<PropertyDictionary>&, double, std::uint16_t, std::uint16_t,
                                   const std::optional<PropertyDictionary>&) override {
    return {};
  }
  std::string description() const override { return "<connection>"; }
  std::uint32_t user() const override { return 1000; }

  void interrupt() { _interruption(); }
  /// The peer has gone; what it sent may still have to run.
  void depart() {
    if (auto handler = std::exchange(_departure, nullptr)) handler();
  }
  /// What the IPC layer does at the end: the handler runs once, then everything is let go.
  void end() {
    if (auto handler = std::exchange(_invalidation, nullptr)) handler();
    _interruption = nullptr;
    exported = nullptr;
  }

  std::shared_ptr<ClientSessionInterface> exported;
  StatusHandler statusHandler;
  bool resumed = false;
  bool invalidated = false;

 private:
  const std::set<std::string, std::less<>> _entitlements;
  Task _interruption;
  Task _invalidation;
  Task _departure;
};

}  // namespace velk::test
