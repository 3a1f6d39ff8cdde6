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

/// For a program that is no service: the same, whatever service variables it was started with. The environment is read
/// with secure_getenv.
[[nodiscard]] Directories clientDirectories();

/// Where a process that links the library keeps what it remembers, in which no daemon looks, be it of the same user: a
/// folder of its own, "velkreporting-client", in XDG_STATE_HOME, else in ".local/state" of the home (HOME, else what
/// the user database knows). For root each of them counts only if it is a directory of root's. Empty when there is
/// none: then nothing can be kept. Asks the user database, which may block, where HOME does not tell.
[[nodiscard]] std::string libraryStateDirectory();

/// The daemon's socket: `VELKREPORTING_SOCKET`, else "com.tavrin.velkreportingd" in the system's runtime directory
/// (and, for a user who is not root, in the user's own if that one exists).
[[nodiscard]] std::string daemonSocketPath();

}  // namespace velk
