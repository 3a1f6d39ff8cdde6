// The command line of the daemon.
#pragma once

#include <optional>
#include <string>
#include <variant>

#include "foundation/TimeValue.h"
#include "platform/Log.h"

namespace velk {

// Exit codes, those of sysexits: what scripts and people look up.
inline constexpr int kExitOk = 0;
inline constexpr int kExitUsage = 64;
inline constexpr int kExitUnavailable = 69;
inline constexpr int kExitSoftware = 70;
inline constexpr int kExitOsError = 71;
inline constexpr int kExitCannotCreate = 73;
inline constexpr int kExitConfiguration = 78;

struct DaemonOptions {
  /// Empty: the service's name in the runtime directory. Of no use when the service manager hands the socket over.
  std::string socketPath;
  /// Nothing: 30 seconds when the service manager hands the socket over, off otherwise. 0: off.
  std::optional<long> idleExitSeconds;
  log::Level logLevel = log::Level::standard;
  /// Lines go to the standard error stream even when the system's journal listens.
  bool foreground = false;
};

/// The options, or the status to exit with at once: the help, the version, or what is wrong has been printed.
[[nodiscard]] std::variant<DaemonOptions, int> parseDaemonOptions(int argumentCount, const char* const* arguments);

}  // namespace velk
