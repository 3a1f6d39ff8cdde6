// Where the system keeps its files.
#pragma once

#include <string>

namespace velk {

/// Absolute paths without a trailing slash. They are not created here.
struct Directories {
  std::string runtime;
  std::string state;
  std::string cache;
  std::string logs;
  std::string configuration;
  /// Installed data: `publicKey.der`, the framework's information.
  std::string data;
};

/// For the daemon: the five variables of systemd.exec when set; else /run, /var/lib, /var/cache, /var/log, /etc +
/// "/velkreporting" for root, the XDG base directories for any other user. `VELKREPORTING_DATA_DIRECTORY` wins over
/// the installed data directory.
[[nodiscard]] Directories daemonDirectories();

/// For a process that links the library: its own user's directories, whatever service variables its host has.
/// The environment is read with secure_getenv.
[[nodiscard]] Directories clientDirectories();

/// The daemon's socket: `VELKREPORTING_SOCKET`, else "com.tavrin.velkreportingd" in the system's runtime directory
/// (and, for a user who is not root, in the user's own if that one exists).
[[nodiscard]] std::string daemonSocketPath();

}  // namespace velk
