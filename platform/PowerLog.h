// The power log: a record of what costs power, kept by the system. Here an entry of the journal.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

#include "foundation/PropertyValue.h"

namespace velk {

class PowerLog {
 public:
  virtual ~PowerLog() = default;
  /// Records an event under the number of the client that registered it. What cannot be recorded is lost. Any thread;
  /// waits a moment for a busy service.
  virtual void logRegisteredEvent(std::uint32_t clientIdentifier, std::string_view eventName,
                                  const PropertyDictionary& event) = 0;
};

/// The fields of an entry, always these. Whatever an event's keys are, they stay within the payload's JSON.
namespace power_log_fields {
inline constexpr std::string_view kMessage = "MESSAGE";  ///< the event's name
inline constexpr std::string_view kMessageID = "MESSAGE_ID";
inline constexpr std::string_view kPriority = "PRIORITY";
inline constexpr std::string_view kIdentifier = "SYSLOG_IDENTIFIER";
inline constexpr std::string_view kClient = "VELKREPORTING_CLIENT";
inline constexpr std::string_view kEvent = "VELKREPORTING_EVENT";
inline constexpr std::string_view kPayload = "VELKREPORTING_PAYLOAD";  ///< one line of JSON
}  // namespace power_log_fields

/// What `journalctl MESSAGE_ID=...` finds all entries by.
inline constexpr std::string_view kPowerLogMessageID = "6f0c1f6e2d3b4c0d9a7e5b8141c2f3d7";
inline constexpr const char* kJournalSocket = "/run/systemd/journal/socket";

/// Speaks the journal's native protocol to the datagram socket at `socketPath`. Makes a socket of its own for each
/// entry: they are rare, and the journal may come and go.
[[nodiscard]] std::unique_ptr<PowerLog> makeJournalPowerLog(const std::string& socketPath = kJournalSocket);

}  // namespace velk
