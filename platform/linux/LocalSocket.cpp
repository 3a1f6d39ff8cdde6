#include "platform/LocalSocket.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>

namespace velk {
namespace {

/// The most descriptors that the system lets ride with one message: with room for all of them none is ever lost.
constexpr std::size_t kSystemDescriptorLimit = 253;
constexpr std::size_t kDescriptorsToSend = 16;

Failure systemFailure(const std::string& what, int error) {
  return failure(std::string(kLocalSocketErrorDomain), error, what + ": " + std::strerror(error));
}

Result<sockaddr_un> addressOf(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.empty() || path.size() >= sizeof(address.sun_path)) {
    return failure(std::string(kLocalSocketErrorDomain), ENAMETOOLONG,
                   "a socket's path has 1 to " + std::to_string(sizeof(address.sun_path) - 1) + " bytes: " + path);
  }
  std::memcpy(address.sun_path, path.data(), path.size());
  return address;
}

FileDescriptor newSocket(int flags) { return FileDescriptor(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | flags, 0)); }

int connectTo(int descriptor, const sockaddr_un& address) {
  while (::connect(descriptor, reinterpret_cast<const sockaddr*>(&address), sizeof(address)) != 0) {
    if (errno != EINTR) return errno;
  }
  return 0;
}

/// Removes what a daemon that died left at the path. Somebody may answer there although we hold the lock: a service
/// manager that listens for us.
Result<void> removeStaleSocket(const std::string& path, const sockaddr_un& address, const std::string& taken) {
  struct stat status {};
  if (::lstat(path.c_str(), &status) != 0) {
    return errno == ENOENT ? Result<void>() : systemFailure(path, errno);
  }
  if (!S_ISSOCK(status.st_mode)) return systemFailure(path + " is there and is no socket", ENOTSOCK);
  const auto probe = newSocket(SOCK_NONBLOCK);
  const int error = connectTo(probe.get(), address);
  if (error == 0 || error == EAGAIN) return failure(std::string(kLocalSocketErrorDomain), EADDRINUSE, taken);
  if (error != ECONNREFUSED) return systemFailure(path, error);
  if (::unlink(path.c_str()) != 0 && errno != ENOENT) return systemFailure(path, errno);
  return {};
}

Result<FileDescriptor> lockBeside(const std::string& path, const std::string& taken) {
  const auto lockPath = path + ".lock";
  FileDescriptor lock(::open(lockPath.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600));
  if (!lock) return systemFailure(lockPath, errno);
  if (::flock(lock.get(), LOCK_EX | LOCK_NB) == 0) return lock;
  if (errno == EWOULDBLOCK) return failure(std::string(kLocalSocketErrorDomain), EADDRINUSE, taken);
  return systemFailure(lockPath, errno);
}

void takeDescriptors(msghdr& message, std::vector<FileDescriptor>& descriptors) {
  for (auto* control = CMSG_FIRSTHDR(&message); control != nullptr; control = CMSG_NXTHDR(&message, control)) {
    if (control->cmsg_level != SOL_SOCKET || control->cmsg_type != SCM_RIGHTS) continue;
    const std::size_t count = (control->cmsg_len - CMSG_LEN(0)) / sizeof(int);
    for (std::size_t number = 0; number < count; ++number) {
      int descriptor = -1;
      std::memcpy(&descriptor, CMSG_DATA(control) + number * sizeof(int), sizeof(int));
      descriptors.emplace_back(descriptor);
    }
  }
}

Transfer failedTransfer() {
  if (errno == EAGAIN || errno == EWOULDBLOCK) return {Transfer::Status::wouldBlock, 0, 0};
  return {Transfer::Status::failed, 0, errno};
}

}  // namespace

Result<BoundLocalSocket> bindLocalSocket(const std::string& path, std::string_view program) {
  const auto address = addressOf(path);
  if (!address) return Failure(address.error());
  const auto taken = "another " + std::string(program) + " is listening on " + path;
  auto lock = lockBeside(path, taken);
  if (!lock) return Failure(lock.error());
  if (auto removed = removeStaleSocket(path, *address, taken); !removed) return Failure(removed.error());

  auto socket = newSocket(SOCK_NONBLOCK);
  if (!socket) return systemFailure("socket", errno);
  if (::bind(socket.get(), reinterpret_cast<const sockaddr*>(&*address), sizeof(*address)) != 0) {
    return systemFailure(path, errno);
  }
  if (::chmod(path.c_str(), 0666) != 0) return systemFailure(path, errno);
  if (::listen(socket.get(), SOMAXCONN) != 0) return systemFailure(path, errno);
  return BoundLocalSocket{std::move(socket), std::move(*lock)};
}

void removeLocalSocket(const std::string& path) { ::unlink(path.c_str()); }

Result<FileDescriptor> adoptLocalSocket(FileDescriptor descriptor) {
  int listening = 0;
  socklen_t size = sizeof(listening);
  sockaddr_un address{};
  socklen_t addressSize = sizeof(address);
  if (::getsockopt(descriptor.get(), SOL_SOCKET, SO_ACCEPTCONN, &listening, &size) != 0 ||
      ::getsockname(descriptor.get(), reinterpret_cast<sockaddr*>(&address), &addressSize) != 0) {
    return systemFailure("the inherited descriptor", errno);
  }
  if (listening == 0 || address.sun_family != AF_UNIX) {
    return systemFailure("the inherited descriptor is no listening local socket", EINVAL);
  }
  const int flags = ::fcntl(descriptor.get(), F_GETFL);
  if (flags < 0 || ::fcntl(descriptor.get(), F_SETFL, flags | O_NONBLOCK) != 0 ||
      ::fcntl(descriptor.get(), F_SETFD, FD_CLOEXEC) != 0) {
    return systemFailure("the inherited descriptor", errno);
  }
  return descriptor;
}

Result<FileDescriptor> connectLocalSocket(const std::string& path, Duration timeout) {
  const auto address = addressOf(path);
  if (!address) return Failure(address.error());
  auto socket = newSocket(0);
  if (!socket) return systemFailure("socket", errno);
  // The send timeout bounds how long connect waits for room in the listener's queue.
  const auto microseconds = std::chrono::duration_cast<std::chrono::microseconds>(timeout).count();
  const timeval limit{microseconds / 1'000'000, microseconds % 1'000'000};
  static_cast<void>(::setsockopt(socket.get(), SOL_SOCKET, SO_SNDTIMEO, &limit, sizeof(limit)));
  if (const int error = connectTo(socket.get(), *address); error != 0) return systemFailure(path, error);
  const int flags = ::fcntl(socket.get(), F_GETFL);
  if (flags < 0 || ::fcntl(socket.get(), F_SETFL, flags | O_NONBLOCK) != 0) return systemFailure(path, errno);
  return socket;
}

Result<std::pair<FileDescriptor, FileDescriptor>> makeLocalSocketPair() {
  std::array<int, 2> ends{};
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends.data()) != 0) {
    return systemFailure("socketpair", errno);
  }
  return std::pair(FileDescriptor(ends[0]), FileDescriptor(ends[1]));
}

Transfer receiveFromLocalSocket(int socket, std::span<std::uint8_t> buffer, std::vector<FileDescriptor>& descriptors) {
  alignas(cmsghdr) std::array<char, CMSG_SPACE(kSystemDescriptorLimit * sizeof(int))> control;
  iovec part{buffer.data(), buffer.size()};
  msghdr message{};
  message.msg_iov = &part;
  message.msg_iovlen = 1;
  message.msg_control = control.data();
  message.msg_controllen = control.size();
  ssize_t received = 0;
  do {
    received = ::recvmsg(socket, &message, MSG_CMSG_CLOEXEC | MSG_DONTWAIT);
  } while (received < 0 && errno == EINTR);
  if (received < 0) return failedTransfer();
  takeDescriptors(message, descriptors);
  if ((message.msg_flags & MSG_CTRUNC) != 0) return {Transfer::Status::failed, 0, EMFILE};
  if (received == 0) return {Transfer::Status::ended, 0, 0};
  return {Transfer::Status::moved, static_cast<std::size_t>(received), 0};
}

Transfer sendToLocalSocket(int socket, std::span<const std::uint8_t> bytes,
                           std::span<const FileDescriptor> descriptors) {
  alignas(cmsghdr) std::array<char, CMSG_SPACE(kDescriptorsToSend * sizeof(int))> control{};
  iovec part{const_cast<std::uint8_t*>(bytes.data()), bytes.size()};
  msghdr message{};
  message.msg_iov = &part;
  message.msg_iovlen = 1;
  if (!descriptors.empty()) {
    if (descriptors.size() > kDescriptorsToSend) return {Transfer::Status::failed, 0, EINVAL};
    message.msg_control = control.data();
    message.msg_controllen = CMSG_SPACE(descriptors.size() * sizeof(int));
    auto* header = CMSG_FIRSTHDR(&message);
    header->cmsg_level = SOL_SOCKET;
    header->cmsg_type = SCM_RIGHTS;
    header->cmsg_len = CMSG_LEN(descriptors.size() * sizeof(int));
    for (std::size_t number = 0; number < descriptors.size(); ++number) {
      const int descriptor = descriptors[number].get();
      std::memcpy(CMSG_DATA(header) + number * sizeof(int), &descriptor, sizeof(int));
    }
  }
  ssize_t sent = 0;
  do {
    sent = ::sendmsg(socket, &message, MSG_NOSIGNAL | MSG_DONTWAIT);
  } while (sent < 0 && errno == EINTR);
  if (sent < 0) return failedTransfer();
  return {Transfer::Status::moved, static_cast<std::size_t>(sent), 0};
}

AcceptedSocket acceptLocalSocket(int listeningSocket) {
  for (;;) {
    const int accepted = ::accept4(listeningSocket, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
    if (accepted >= 0) return {FileDescriptor(accepted), 0};
    if (errno != EINTR && errno != ECONNABORTED) return {FileDescriptor(), errno};
  }
}

bool isReadable(int descriptor) {
  pollfd wanted{descriptor, POLLIN, 0};
  return ::poll(&wanted, 1, 0) > 0;
}

void shutDownLocalSocket(int socket) { ::shutdown(socket, SHUT_RDWR); }

}  // namespace velk
