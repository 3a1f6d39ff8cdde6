// What the kernel's routing tables say about the way out, and when they change (rtnetlink).
// Used by the HTTP engine on its own thread.
#pragma once

#include <optional>
#include <string>

#include "platform/FileDescriptor.h"

namespace velk {

/// Hears of changes to links, addresses and routes while it lives. Opened only while somebody waits for a network:
/// a process that does not wait is not woken by them. One thread.
class RouteMonitor {
 public:
  RouteMonitor();

  /// Readable when something has changed; -1 when the kernel gave no socket (then nothing is ever heard).
  [[nodiscard]] int descriptor() const noexcept { return _socket.get(); }
  /// Takes the messages away. False when there were none.
  bool drain();

 private:
  FileDescriptor _socket;
};

/// The best default routes of this moment.
struct DefaultRoutes {
  /// The interface's name of the preferred usable default route, by family; nothing when there is none. Empty when
  /// the route names no single interface.
  std::optional<std::string> ipv4;
  std::optional<std::string> ipv6;

  [[nodiscard]] bool any() const noexcept { return ipv4 || ipv6; }
};

/// Asks the kernel; a few system calls. A kernel that does not answer counts as one that has routes.
[[nodiscard]] DefaultRoutes defaultRoutes();

/// A mobile modem, by what the kernel's device model says of the interface.
[[nodiscard]] bool isMobileInterface(const std::string& name, const std::string& sysfs = "/sys/class/net");

}  // namespace velk
