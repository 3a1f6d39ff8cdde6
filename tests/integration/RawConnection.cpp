#include "tests/integration/RawConnection.h"

#include <linux/sockios.h>
#include <poll.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cstring>

namespace velk::test {

namespace {

constexpr std::size_t kHeaderSize = 16;

void appendLittleEndian(std::string& bytes, std::uint64_t value, int size) {
  for (int i = 0; i < size; ++i) bytes.push_back(static_cast<char>(value >> (8 * i)));
}

std::uint64_t littleEndian(std::string_view bytes) {
  std::uint64_t value = 0;
  for (std::size_t i = bytes.size(); i > 0; --i) value = value << 8 | static_cast<unsigned char>(bytes[i - 1]);
  return value;
}

}  // namespace

RawConnection::RawConnection(const Daemon& daemon) : _socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, daemon.socketPath().c_str(), sizeof address.sun_path - 1);
  if (::connect(_socket.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) close();
}

std::string RawConnection::frame(FrameKind kind, std::uint64_t serial, std::string_view body,
                                 std::optional<std::uint32_t> length, std::uint8_t version, std::uint16_t descriptors) {
  std::string bytes;
  appendLittleEndian(bytes, length.value_or(static_cast<std::uint32_t>(body.size())), 4);
  appendLittleEndian(bytes, version, 1);
  appendLittleEndian(bytes, static_cast<std::uint8_t>(kind), 1);
  appendLittleEndian(bytes, descriptors, 2);
  appendLittleEndian(bytes, serial, 8);
  return bytes.append(body);
}

bool RawConnection::send(std::string_view bytes) {
  while (!bytes.empty()) {
    const ssize_t count = ::send(_socket.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
    if (count <= 0) return false;
    bytes.remove_prefix(static_cast<std::size_t>(count));
  }
  return true;
}

bool RawConnection::sendWith(std::string_view bytes, const std::vector<int>& descriptors) {
  const std::size_t size = descriptors.size() * sizeof(int);
  std::vector<char> control(CMSG_SPACE(size));
  iovec part{const_cast<char*>(bytes.data()), bytes.size()};
  msghdr message{};
  message.msg_iov = &part;
  message.msg_iovlen = 1;
  message.msg_control = control.data();
  message.msg_controllen = control.size();
  cmsghdr* const header = CMSG_FIRSTHDR(&message);
  header->cmsg_level = SOL_SOCKET;
  header->cmsg_type = SCM_RIGHTS;
  header->cmsg_len = CMSG_LEN(size);
  std::memcpy(CMSG_DATA(header), descriptors.data(), size);
  const ssize_t count = ::sendmsg(_socket.get(), &message, MSG_NOSIGNAL);
  return count > 0 && send(bytes.substr(static_cast<std::size_t>(count)));
}

int RawConnection::bytesUntaken() const {
  int bytes = 0;
  return ::ioctl(_socket.get(), SIOCOUTQ, &bytes) == 0 ? bytes : -1;
}

std::size_t RawConnection::sendWhatFits(std::string_view bytes, std::chrono::milliseconds patience) {
  std::size_t sent = 0;
  while (sent < bytes.size()) {
    pollfd writable{_socket.get(), POLLOUT, 0};
    if (::poll(&writable, 1, static_cast<int>(patience.count())) != 1) break;
    const ssize_t count = ::send(_socket.get(), bytes.data() + sent, bytes.size() - sent, MSG_NOSIGNAL | MSG_DONTWAIT);
    if (count <= 0) break;
    sent += static_cast<std::size_t>(count);
  }
  return sent;
}

std::optional<RawConnection::Frame> RawConnection::receive(std::chrono::milliseconds patience) {
  while (_received.size() < kHeaderSize) {
    if (!readMore(patience)) return std::nullopt;
  }
  const std::size_t size = kHeaderSize + littleEndian(std::string_view(_received).substr(0, 4));
  while (_received.size() < size) {
    if (!readMore(patience)) return std::nullopt;
  }
  Frame frame{static_cast<FrameKind>(_received[5]), littleEndian(std::string_view(_received).substr(8, 8)),
              _received.substr(kHeaderSize, size - kHeaderSize)};
  _received.erase(0, size);
  return frame;
}

bool RawConnection::waitForEnd(std::chrono::milliseconds patience) {
  while (waitReadable(patience)) {
    if (!readMore(patience)) return true;
  }
  return false;
}

bool RawConnection::waitReadable(std::chrono::milliseconds patience) const {
  pollfd readable{_socket.get(), POLLIN, 0};
  return ::poll(&readable, 1, static_cast<int>(patience.count())) == 1;
}

bool RawConnection::readMore(std::chrono::milliseconds patience) {
  if (!waitReadable(patience)) return false;
  char buffer[65536];
  const ssize_t count = ::recv(_socket.get(), buffer, sizeof buffer, 0);
  if (count <= 0) return false;
  _received.append(buffer, static_cast<std::size_t>(count));
  return true;
}

}  // namespace velk::test
