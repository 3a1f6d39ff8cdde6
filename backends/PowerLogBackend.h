// Records events in the power log of the system. Its operation is one that sessions do not call: what they deliver
// through the base class's entry reaches the do-nothing operation there, and nothing is recorded. That is how it has
// always been, and the power log's readers rely on nobody filling it with ordinary events.
#pragma once

#include "backends/VelkReportingBackend.h"

namespace velk {

class PowerLogBackend : public VelkReportingBackend {
 public:
  using VelkReportingBackend::VelkReportingBackend;

  [[nodiscard]] static std::shared_ptr<PowerLogBackend> initWithName(const BackendContext& context, std::string name,
                                                                     PropertyValue profile,
                                                                     std::optional<std::string> productFamily);

  /// Records the payload together with the three numbers, which replace payload entries of their names. Events of
  /// method 0 and those without payload are not recorded. The operation without flag: it overrides nothing.
  void sendMessageWithoutFlag(const std::optional<PropertyDictionary>& payload, const TimeValue& timestamp,
                              std::uint16_t method, std::uint16_t respCode, std::uint16_t eventID);
};

}  // namespace velk
