// The C interface: periodic tasks and the log timer.

#include "client/CInterfaceCallbacks.h"
#include "client/CInterfaceHandles.h"

using velk::PropertyDictionary;
using velk::cinterface::blockOf;
using velk::cinterface::guarded;
using velk::cinterface::guardedVoid;
using velk::cinterface::ownCallback;
using velk::cinterface::Owned;

namespace {

/// The statistics go in and out as a value of their own: the callback may keep the handle.
void callService(const velk::cinterface::CallbackOwner<VelkReportingServiceCallback>& callback,
                 PropertyDictionary* statistics) {
  if (statistics == nullptr) return callback(static_cast<VelkReportingValue*>(nullptr));
  const Owned<VelkReportingValue> value(velk::cinterface::newValue(*statistics));
  callback(value.get());
  *statistics = *velk::cinterface::dictionaryOf(value.get());
}

}  // namespace

bool VelkReportingClientRegisterPeriodicTask(VelkReportingClient* client, uint32_t module, bool needToUpdate,
                                             bool needToReport, VelkReportingServiceCallback callback, void* context,
                                             VelkReportingDestroyFunction destroy) {
  auto shared = ownCallback(callback, context, destroy);
  if (client == nullptr) return false;
  return guarded(__func__, false, [&] {
    return client->client->registerPeriodicTaskForModule(
        module, needToUpdate, needToReport, blockOf<velk::VelkReportingServiceBlock>(std::move(shared), [](auto owner) {
          return [owner = std::move(owner)](PropertyDictionary* statistics) { callService(*owner, statistics); };
        }));
  });
}

bool VelkReportingClientUnregisterPeriodicTask(VelkReportingClient* client, uint32_t module) {
  if (client == nullptr) return false;
  return guarded(__func__, false, [&] { return client->client->unregisterPeriodTaskForModule(module); });
}

void VelkReportingClientStartLogTimer(VelkReportingClient* client, uint32_t interval, uint32_t reportingMultiplier,
                                      uint16_t category, uint16_t type) {
  if (client == nullptr) return;
  guardedVoid(__func__,
              [&] { client->client->startLogTimerWithInterval(interval, reportingMultiplier, category, type); });
}

void VelkReportingClientStopLogTimer(VelkReportingClient* client) {
  if (client == nullptr) return;
  guardedVoid(__func__, [&] { client->client->stopLogTimer(); });
}
