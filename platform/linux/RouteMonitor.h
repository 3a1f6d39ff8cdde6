// What the kernel's routing tables say about the way out, and when they change (rtnetlink).
// The HTTP engine listens on its own thread and asks on that of its RouteLookup.
#pragma once

#include <optional>
#include <string>

#include "platform/FileDescriptor.h"

namespace velk {

/// Hears of changes to links, addresses and routes while it lives. Opened only while there are requests or connections:
/// an idle process is not woken by them. One thread.
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
  bool isMobile4 = false;
  bool isMobile6 = false;
  /// The errno of a question that could not be asked or was not answered, else 0. Such a kernel counts as one that has
  /// routes.
  int failure = 0;

  [[nodiscard]] bool any() const noexcept { return ipv4 || ipv6 || failure != 0; }
};

/// Asks the kernel, which may block for two seconds.
[[nodiscard]] DefaultRoutes defaultRoutes();

/// A mobile modem, by what the kernel's device model says of the interface.
[[nodiscard]] bool isMobileInterface(const std::string& name, const std::string& sysfs = "/sys/class/net");

}  // namespace velk
