#include "tests/support/NetworkNamespace.h"

#include <arpa/inet.h>
#include <net/if.h>
#include <sched.h>
#include <sys/ioctl.h>
#include <sys/socket.h>

#include <cerrno>
#include <cstring>
#include <stdexcept>
#include <string>
#include <thread>

#include "platform/FileDescriptor.h"
#include "tests/support/TlsTestServer.h"

namespace velk::test {
namespace {

constexpr const char* kLoopback = "lo";
/// A second address of the same interface.
constexpr const char* kAlias = "lo:1";

void change(const char* interface, unsigned long operation, const std::function<void(ifreq&)>& fill) {
  const FileDescriptor socket(::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  ifreq request{};
  std::strcpy(request.ifr_name, interface);
  fill(request);
  if (::ioctl(socket.get(), operation, &request) != 0) {
    throw std::runtime_error(std::string("changing ") + interface + ": " + std::strerror(errno));
  }
}

void setFlags(const char* interface, int flags) {
  change(interface, SIOCSIFFLAGS, [flags](ifreq& request) { request.ifr_flags = static_cast<short>(flags); });
}

}  // namespace

bool runInEmptyNetworkNamespace(const std::function<void()>& body) {
  bool allowed = false;
  std::thread([&] {
    allowed = ::unshare(CLONE_NEWNET) == 0;
    if (allowed) body();
  }).join();
  return allowed;
}

void startLoopback() { setFlags(kLoopback, IFF_UP); }

void connectNetwork() {
  startLoopback();
  change(kAlias, SIOCSIFADDR, [](ifreq& request) {
    auto* address = reinterpret_cast<sockaddr_in*>(&request.ifr_addr);
    address->sin_family = AF_INET;
    ::inet_pton(AF_INET, TlsTestServer::kOtherAddress, &address->sin_addr);
  });
}

void disconnectNetwork() { setFlags(kAlias, 0); }

}  // namespace velk::test
