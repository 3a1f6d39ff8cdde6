#include "backends/PowerLogBackend.h"

#include <utility>

#include "platform/PowerLog.h"

namespace velk {

namespace {

/// The number and the name under which the power log knows these events.
constexpr std::uint32_t kClientIdentifier = 28;
constexpr std::string_view kEventName = "Orlenad-Velk";

}  // namespace

std::shared_ptr<PowerLogBackend> PowerLogBackend::initWithName(const BackendContext& context, std::string name,
                                                               PropertyValue profile,
                                                               std::optional<std::string> productFamily) {
  return std::make_shared<PowerLogBackend>(context, std::move(name), std::move(profile), std::move(productFamily));
}

void PowerLogBackend::sendMessageWithoutFlag(const std::optional<PropertyDictionary>& payload, const TimeValue&,
                                             std::uint16_t method, std::uint16_t respCode, std::uint16_t eventID) {
  if (method == 0 || !payload || payload->empty()) return;
  PowerLog* const powerLog = _context.platform.powerLog;
  if (powerLog == nullptr) return;
  PropertyDictionary event = *payload;
  event.set("method", std::uint32_t{method});
  event.set("respCode", std::uint32_t{respCode});
  event.set("event", std::uint32_t{eventID});
  powerLog->logRegisteredEvent(kClientIdentifier, kEventName, event);
}

}  // namespace velk
