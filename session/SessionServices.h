// What a session is handed at its creation besides its delegate and its connection.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "backends/VelkReportingBackend.h"
#include "foundation/Error.h"
#include "ipc/SessionInterface.h"

namespace velk {

/// The session's end of its IPC connection.
class SessionConnection {
 public:
  virtual ~SessionConnection() = default;
  /// Later frames are discarded, the reply of the call in progress is still delivered, then the connection ends and
  /// its invalidation handler runs. Only posts: may be called under the agent's lock.
  virtual void invalidate() = 0;
  /// Appends a call of the client's reply interface to the bounded outbox. Never waits for the peer. The error says
  /// why it could not be appended (gone, full, too large).
  [[nodiscard]] virtual Result<void> sendMessageToClient(const std::optional<PropertyDictionary>& sessionInfo,
                                                         double timestamp, std::uint16_t category, std::uint16_t type,
                                                         const std::optional<PropertyDictionary>& payload) = 0;
  [[nodiscard]] virtual std::string description() const = 0;
  /// The user (a uid) that the peer runs as. Constant.
  [[nodiscard]] virtual std::uint32_t user() const = 0;
};

/// The record of what the daemon did with messages.
class MessageLog {
 public:
  virtual ~MessageLog() = default;
  /// One entry. Blocks for file work. Any thread.
  virtual void writeToLogFile(std::string_view text) = 0;
};

/// Makes the backend of a storebag section, or null for a name that is none.
using BackendFactory = std::function<std::shared_ptr<VelkReportingBackend>(
    const BackendContext& context, const std::string& name, const PropertyValue& profile,
    const std::optional<std::string>& productFamily, std::int32_t clientType)>;

/// Outlives every session, and the flushes that sessions leave behind.
struct SessionServices {
  BackendContext backends;
  MessageLog& messageLog;
  /// Tests put their own here.
  BackendFactory newBackend = newBackendWithName;
};

}  // namespace velk
