// The one way from the library to the daemon's socket, so that nobody is told anything who should not be.
#pragma once

#include <memory>
#include <string_view>

#include "ipc/Connection.h"
#include "ipc/SessionProxies.h"

namespace velk {

class ClientRuntime;

/// Code of the error for a process that answers at the socket and is none that this user has reason to trust.
inline constexpr int kDistrustedService = 1;
inline constexpr std::string_view kTrustErrorDomain = "VelkReportingTrust";

/// A connection that works, not resumed. Fails as Connection::connect does, or with `kDistrustedService`: then the
/// connection has been ended again. Logs nothing.
[[nodiscard]] Result<std::shared_ptr<Connection>> connectToDaemon(ClientRuntime& runtime,
                                                                  std::shared_ptr<Queue> deliveryQueue);
/// Whether somebody has to put it right (a daemon that is not to be trusted, a socket that this process may not use):
/// no time that passes will.
[[nodiscard]] bool isLasting(const Error& error);

/// An error handler that fills `text`, which outlives it, with the error and logs it: as an error if the call can never
/// be sent, whatever the daemon does, since its owner hears of that in no other way.
[[nodiscard]] ProxyErrorHandler loggingHandler(std::string_view text);

}  // namespace velk
