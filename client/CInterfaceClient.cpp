// The C interface: a client from its creation to its last release.

#include "client/CInterfaceCallbacks.h"
#include "client/CInterfaceHandles.h"
#include "client/ClientRuntime.h"
#include "client/UnexportedFunctions.h"

namespace velk::cinterface {

void destroyContext(VelkReportingDestroyFunction destroy, void* context) noexcept {
  try {
    // A call that does nothing, without a client or in a forked child, makes nothing for it either.
    if (ClientRuntime::isOnLoop()) {
      return ClientRuntime::shared().runCallback([destroy, context] { destroy(context); });
    }
  } catch (...) {  // short of memory it is destroyed here: late would be never
    logException("destroyContext");
  }
  destroy(context);
}

}  // namespace velk::cinterface

using velk::PropertyArray;
using velk::PropertyDictionary;
using velk::VelkReporting;
using velk::cinterface::blockOf;
using velk::cinterface::guarded;
using velk::cinterface::guardedVoid;
using velk::cinterface::newValueOrNull;
using velk::cinterface::optionalDictionary;
using velk::cinterface::ownCallback;
using velk::cinterface::Owned;

namespace {

VelkReportingClient* create(const VelkReportingValue* sessionInfo, const VelkReportingValue* userInfo,
                            const VelkReportingValue* frameworksToCheck, velk::VelkReportingAggregationBlock block) {
  const PropertyArray* frameworks = velk::cinterface::arrayOf(frameworksToCheck);
  auto client =
      VelkReporting::initWithSessionInfo(optionalDictionary(sessionInfo), optionalDictionary(userInfo),
                                         frameworks != nullptr ? *frameworks : PropertyArray(), std::move(block));
  if (!client) return nullptr;
  auto handle = std::make_unique<VelkReportingClient>();
  handle->client = std::move(client);
  return handle.release();
}

VelkReporting::StatesCallback statesBlock(velk::cinterface::SharedCallbackOwner<VelkReportingStatesCallback> callback) {
  return blockOf<VelkReporting::StatesCallback>(std::move(callback), [](auto owner) {
    return [owner = std::move(owner)](const std::optional<PropertyArray>& enabledBackends) {
      const Owned<VelkReportingValue> backends(newValueOrNull(enabledBackends));
      (*owner)(backends.get());
    };
  });
}

}  // namespace

extern "C" {

VelkReportingClient* VelkReportingCreateWithAggregation(const VelkReportingValue* sessionInfo,
                                                        const VelkReportingValue* userInfo,
                                                        const VelkReportingValue* frameworksToCheck,
                                                        VelkReportingAggregationCallback callback, void* context,
                                                        VelkReportingDestroyFunction destroy) {
  auto shared = ownCallback(callback, context, destroy);
  return guarded(__func__, nullptr, [&] {
    auto block = blockOf<velk::VelkReportingAggregationBlock>(std::move(shared), [](auto owner) {
      return [owner = std::move(owner)](const std::optional<PropertyDictionary>& client, double timestamp,
                                        std::uint16_t category, std::uint16_t type,
                                        const std::optional<PropertyDictionary>& payload) {
        const Owned<VelkReportingValue> clientValue(newValueOrNull(client));
        const Owned<VelkReportingValue> payloadValue(newValueOrNull(payload));
        (*owner)(clientValue.get(), timestamp, category, type, payloadValue.get());
      };
    });
    return create(sessionInfo, userInfo, frameworksToCheck, std::move(block));
  });
}

VelkReportingClient* VelkReportingCreate(const VelkReportingValue* sessionInfo, const VelkReportingValue* userInfo,
                                         const VelkReportingValue* frameworksToCheck) {
  return guarded(__func__, nullptr, [&] { return create(sessionInfo, userInfo, frameworksToCheck, nullptr); });
}

void VelkReportingBeginConfiguration(VelkReportingClient* client, VelkReportingStatesCallback callback, void* context,
                                     VelkReportingDestroyFunction destroy) {
  auto shared = ownCallback(callback, context, destroy);
  if (client == nullptr) return;
  guardedVoid(__func__,
              [&] { client->client->startConfigurationWithCompletionHandler(statesBlock(std::move(shared))); });
}

}  // extern "C"

VelkReportingClient* VelkReportingClientCreate(const VelkReportingValue* sessionInfo,
                                               const VelkReportingValue* userInfo,
                                               const VelkReportingValue* frameworksToCheck) {
  return VelkReportingCreate(sessionInfo, userInfo, frameworksToCheck);
}

VelkReportingClient* VelkReportingClientCreateWithAggregation(const VelkReportingValue* sessionInfo,
                                                              const VelkReportingValue* userInfo,
                                                              const VelkReportingValue* frameworksToCheck,
                                                              VelkReportingAggregationCallback callback, void* context,
                                                              VelkReportingDestroyFunction destroy) {
  return VelkReportingCreateWithAggregation(sessionInfo, userInfo, frameworksToCheck, callback, context, destroy);
}

void VelkReportingClientStartConfiguration(VelkReportingClient* client, VelkReportingStatesCallback callback,
                                           void* context, VelkReportingDestroyFunction destroy) {
  VelkReportingBeginConfiguration(client, callback, context, destroy);
}

VelkReportingClient* VelkReportingClientRetain(VelkReportingClient* client) { return velk::cinterface::retain(client); }

void VelkReportingClientRelease(VelkReportingClient* client) {
  guardedVoid(__func__, [&] { velk::cinterface::release(client); });
}

void VelkReportingClientSetEndOfLifeBound(VelkReportingClient* client, uint32_t milliseconds) {
  if (client == nullptr) return;
  guardedVoid(__func__, [&] { client->client->setEndOfLifeBound(std::chrono::milliseconds(milliseconds)); });
}

void VelkReportingFetchStatesWithUserInfo(VelkReportingClient* client, const VelkReportingValue* userInfo,
                                          VelkReportingStatesCallback callback, void* context,
                                          VelkReportingDestroyFunction destroy) {
  auto shared = ownCallback(callback, context, destroy);
  if (client == nullptr) return;
  guardedVoid(__func__, [&] {
    client->client->fetchReportingStatesWithUserInfo(optionalDictionary(userInfo), statesBlock(std::move(shared)));
  });
}
