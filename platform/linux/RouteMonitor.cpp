#include "platform/linux/RouteMonitor.h"

#include <linux/rtnetlink.h>
#include <net/if.h>
#include <sys/socket.h>
#include <sys/time.h>

#include <cerrno>
#include <cstdint>
#include <cstring>
#include <fstream>

namespace velk {
namespace {

FileDescriptor openNetlink(std::uint32_t groups, int flags) {
  FileDescriptor socket(::socket(AF_NETLINK, SOCK_RAW | SOCK_CLOEXEC | flags, NETLINK_ROUTE));
  if (!socket) return socket;
  sockaddr_nl address{};
  address.nl_family = AF_NETLINK;
  address.nl_groups = groups;
  if (::bind(socket.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) return FileDescriptor();
  return socket;
}

/// The preferred default route of one family as it is found in the messages of a dump.
struct BestRoute {
  bool found = false;
  std::uint32_t metric = 0;
  std::uint32_t interface = 0;

  void consider(std::uint32_t otherMetric, std::uint32_t otherInterface) {
    if (found && metric <= otherMetric) return;
    found = true;
    metric = otherMetric;
    interface = otherInterface;
  }
};

bool isUsableDefault(const rtmsg& route) {
  return route.rtm_dst_len == 0 && route.rtm_type == RTN_UNICAST &&
         (route.rtm_flags & (RTNH_F_DEAD | RTNH_F_LINKDOWN | RTM_F_CLONED)) == 0;
}

void readRoute(const nlmsghdr* message, BestRoute& best) {
  const auto* route = static_cast<const rtmsg*>(NLMSG_DATA(message));
  if (!isUsableDefault(*route)) return;
  std::uint32_t metric = 0;
  std::uint32_t interface = 0;
  auto size = static_cast<int>(RTM_PAYLOAD(message));
  for (const rtattr* attribute = RTM_RTA(route); RTA_OK(attribute, size); attribute = RTA_NEXT(attribute, size)) {
    if (RTA_PAYLOAD(attribute) < sizeof(std::uint32_t)) continue;
    if (attribute->rta_type == RTA_PRIORITY) std::memcpy(&metric, RTA_DATA(attribute), sizeof metric);
    if (attribute->rta_type == RTA_OIF) std::memcpy(&interface, RTA_DATA(attribute), sizeof interface);
  }
  best.consider(metric, interface);
}

bool sendDumpRequest(int socket, unsigned char family) {
  struct {
    nlmsghdr header;
    rtmsg route;
  } request{};
  request.header.nlmsg_len = sizeof request;
  request.header.nlmsg_type = RTM_GETROUTE;
  request.header.nlmsg_flags = NLM_F_REQUEST | NLM_F_DUMP;
  request.route.rtm_family = family;
  return ::send(socket, &request, sizeof request, 0) == static_cast<ssize_t>(sizeof request);
}

/// False when the kernel did not answer to the end.
bool readDump(int socket, BestRoute& best) {
  alignas(nlmsghdr) char buffer[16384];
  for (;;) {
    const auto received = ::recv(socket, buffer, sizeof buffer, 0);
    if (received <= 0) {
      if (received < 0 && errno == EINTR) continue;
      return false;
    }
    auto size = static_cast<unsigned>(received);
    for (const auto* message = reinterpret_cast<const nlmsghdr*>(buffer); NLMSG_OK(message, size);
         message = NLMSG_NEXT(message, size)) {
      if (message->nlmsg_type == NLMSG_DONE) return true;
      if (message->nlmsg_type == NLMSG_ERROR) return false;
      if (message->nlmsg_type == RTM_NEWROUTE) readRoute(message, best);
    }
  }
}

/// Nothing when the kernel was not asked or did not answer: errno says why.
std::optional<BestRoute> bestRoute(unsigned char family) {
  const auto socket = openNetlink(0, 0);
  BestRoute best;
  const timeval patience{1, 0};
  if (!socket || ::setsockopt(socket.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience) != 0 ||
      !sendDumpRequest(socket.get(), family) || !readDump(socket.get(), best)) {
    return std::nullopt;
  }
  return best;
}

void look(unsigned char family, std::optional<std::string>& interface, bool& isMobile, int& failure) {
  errno = EIO;
  const auto best = bestRoute(family);
  if (!best) {
    failure = errno;
  } else if (best->found) {
    char name[IF_NAMESIZE];
    interface = best->interface != 0 && ::if_indextoname(best->interface, name) != nullptr ? name : "";
    isMobile = isMobileInterface(*interface);
  }
}

}  // namespace

RouteMonitor::RouteMonitor()
    : _socket(openNetlink(RTMGRP_LINK | RTMGRP_IPV4_IFADDR | RTMGRP_IPV4_ROUTE | RTMGRP_IPV6_IFADDR | RTMGRP_IPV6_ROUTE,
                          SOCK_NONBLOCK)) {}

bool RouteMonitor::drain() {
  bool changed = false;
  char buffer[16384];
  for (;;) {
    const auto received = ::recv(_socket.get(), buffer, sizeof buffer, MSG_DONTWAIT);
    // Messages that did not fit were changes as well.
    if (received < 0 && errno == ENOBUFS) {
      changed = true;
      continue;
    }
    if (received <= 0) return changed;
    changed = true;
  }
}

DefaultRoutes defaultRoutes() {
  DefaultRoutes routes;
  look(AF_INET, routes.ipv4, routes.isMobile4, routes.failure);
  look(AF_INET6, routes.ipv6, routes.isMobile6, routes.failure);
  return routes;
}

bool isMobileInterface(const std::string& name, const std::string& sysfs) {
  if (name.empty()) return false;
  std::ifstream uevent(sysfs + "/" + name + "/uevent");
  for (std::string line; std::getline(uevent, line);) {
    if (line == "DEVTYPE=wwan") return true;
  }
  return false;
}

}  // namespace velk
