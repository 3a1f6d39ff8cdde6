#include "platform/Launch.h"

#include <sys/socket.h>
#include <systemd/sd-daemon.h>

#include <string>
#include <system_error>

#include "platform/Log.h"

namespace velk::launch {
namespace {

std::string errorText(int negativeError) { return std::generic_category().message(-negativeError); }

void notify(const std::string& state) {
  const int result = ::sd_notify(0, state.c_str());
  if (result < 0) log::error("Launch: Cannot tell the service manager: %s", errorText(result));
}

std::string statusLine(std::string_view status) {
  std::string line(status);
  for (char& character : line) {
    if (character == '\n' || character == '\r' || character == '\0') character = ' ';
  }
  return "STATUS=" + line;
}

}  // namespace

std::vector<FileDescriptor> takeActivatedSockets() {
  // Sets close-on-exec on each, and removes the variables.
  const int count = ::sd_listen_fds(1);
  if (count < 0) log::error("Launch: Cannot take the sockets that were handed over: %s", errorText(count));
  std::vector<FileDescriptor> sockets;
  for (int index = 0; index < count; ++index) {
    FileDescriptor socket(SD_LISTEN_FDS_START + index);
    if (::sd_is_socket(socket.get(), AF_UNIX, SOCK_STREAM, 1) > 0) {
      sockets.push_back(std::move(socket));
    } else {
      log::error("Launch: Descriptor %d is not a listening local stream socket", socket.get());
    }
  }
  return sockets;
}

void notifyReady(std::string_view status) {
  notify(status.empty() ? std::string("READY=1") : "READY=1\n" + statusLine(status));
}

void notifyStatus(std::string_view status) { notify(statusLine(status)); }

void notifyStopping() { notify("STOPPING=1"); }

}  // namespace velk::launch
