// Turns a client's payload into the event that is posted: stamped with what is known of session and device, and made
// of values that JSON has. Used by the HTTPS post backend on its session's queue; nothing is kept.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "foundation/PropertyValue.h"
#include "foundation/TimeValue.h"

namespace velk {

/// What every event of a backend carries. The references are its backend's own.
struct EventAttributes {
  double startTimestamp = 0;  ///< seconds since 1970
  bool isInternal = false;
  std::int32_t compType = 0;
  std::uint32_t sessionID = 0;
  std::uint16_t clientVersion = 0;
  std::optional<std::string> combinedSessionID;
  const std::optional<std::string>& productFamily;
  const std::optional<std::string>& hardwareType;
  const std::optional<std::string>& productVersion;
  const std::optional<std::string>& buildVersion;
  const std::string& reportVersion;
  std::int32_t timeZoneOffset = 0;  ///< seconds
};

/// What one event carries.
struct EventStamp {
  TimeValue timestamp;
  std::uint16_t method = 0;
  std::uint16_t respCode = 0;
  std::uint16_t eventID = 0;
};

/// The session's start in whole seconds. On builds that are not internal, the minute's: it blurs when the device did
/// something, while the distances between its events stay exact.
[[nodiscard]] std::int64_t roundedStart(double startTimestamp, bool isInternal) noexcept;

/// A copy of the payload with the event's fields set over it, and room for `furtherEntries` more.
[[nodiscard]] PropertyDictionary newEventDict(const PropertyDictionary& payload, EventAttributes attributes,
                                              const EventStamp& stamp, std::size_t furtherEntries);

/// Dates become seconds; what JSON cannot hold is removed with an error line: byte data, numbers that are not finite,
/// and containers, unless nested data is allowed and JSON can hold all of theirs. So a value costs its own key at most.
void makeEventRepresentableInJson(PropertyDictionary& event, bool allowNestedData);

}  // namespace velk
