#include "platform/UdpSocket.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <string>

#include "foundation/Completion.h"
#include "platform/EventLoop.h"
#include "platform/FileDescriptor.h"

namespace velk {
namespace {

sockaddr_in addressOf(std::string_view text, std::uint16_t port) {
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_port = htons(port);
  if (::inet_pton(AF_INET, std::string(text).c_str(), &address.sin_addr) != 1) address.sin_addr.s_addr = INADDR_NONE;
  return address;
}

Transfer failedTransfer() {
  if (errno == EAGAIN || errno == EWOULDBLOCK) return {Transfer::Status::wouldBlock, 0, 0};
  return {Transfer::Status::failed, 0, errno};
}

/// What a read source shares with the work that it has under way. The watch belongs to the loop's thread; the rest is
/// constant, but for the flag. Each round goes from the loop to the queue and back, so there is one at a time.
class ReadSourceState : public std::enable_shared_from_this<ReadSourceState> {
 public:
  ReadSourceState(EventLoop& loop, std::shared_ptr<const FileDescriptor> descriptor, std::shared_ptr<Queue> queue,
                  Task readable, Task failed)
      : _loop(loop),
        _descriptor(std::move(descriptor)),
        _queue(std::move(queue)),
        _readable(std::move(readable)),
        _failed(std::move(failed)) {}

  // By way of the queue: whoever makes the source there may go on to set its socket up before anybody else looks at it.
  void start() {
    _queue->async([self = shared_from_this()] {
      if (!self->_cancelled) self->watch();
    });
  }

  void cancel() {
    _cancelled = true;
    _loop.post([self = shared_from_this()] { self->_watch.reset(); });
  }

 private:
  void watch() {
    const auto fail = [self = shared_from_this()] {
      self->_queue->async([self] {
        if (!self->_cancelled) self->_failed();
      });
    };
    // A loop that cannot start its thread drops the task, and the failure shows all the same.
    Completion<bool> started(
        [fail](bool watched) {
          if (!watched) fail();
        },
        fail);
    _loop.post([self = shared_from_this(), started = std::move(started)]() mutable {
      self->_watch = self->_loop.watch(self->_descriptor->get());
      started(self->_watch != nullptr);
      self->arm();
    });
  }

  /// On the loop's thread.
  void arm() {
    if (_cancelled || !_watch) return;
    _watch->whenReadable([self = shared_from_this()] { self->_queue->async([self] { self->tell(); }); });
  }

  /// On the queue.
  void tell() {
    if (_cancelled) return;
    _readable();
    if (_cancelled) return;
    _loop.post([self = shared_from_this()] { self->arm(); });
  }

  // Constant after construction. The handlers are called on the queue alone.
  EventLoop& _loop;
  const std::shared_ptr<const FileDescriptor> _descriptor;
  const std::shared_ptr<Queue> _queue;
  Task _readable;
  Task _failed;
  // Self-synchronised.
  std::atomic<bool> _cancelled{false};
  // Used on the loop's thread only. Below the descriptor, so that it ends first.
  std::unique_ptr<DescriptorWatch> _watch;
};

class LoopReadSource final : public ReadSource {
 public:
  explicit LoopReadSource(std::shared_ptr<ReadSourceState> state) : _state(std::move(state)) { _state->start(); }
  ~LoopReadSource() override { _state->cancel(); }

 private:
  const std::shared_ptr<ReadSourceState> _state;
};

class LinuxUdpSocket final : public UdpSocket {
 public:
  LinuxUdpSocket(EventLoop& loop, FileDescriptor descriptor)
      : _loop(loop), _descriptor(std::make_shared<const FileDescriptor>(std::move(descriptor))) {}

  int bindToAnyPort() override {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_ANY);
    return ::bind(number(), reinterpret_cast<const sockaddr*>(&address), sizeof(address)) == 0 ? 0 : errno;
  }

  int connectTo(std::string_view address, std::uint16_t port) override {
    const auto peer = addressOf(address, port);
    return ::connect(number(), reinterpret_cast<const sockaddr*>(&peer), sizeof(peer)) == 0 ? 0 : errno;
  }

  Transfer send(std::span<const std::uint8_t> datagram) override {
    ssize_t sent = 0;
    do {
      sent = ::send(number(), datagram.data(), datagram.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
    } while (sent < 0 && errno == EINTR);
    if (sent < 0) return failedTransfer();
    return {Transfer::Status::moved, static_cast<std::size_t>(sent), 0};
  }

  Transfer receive(std::span<std::uint8_t> buffer) override {
    ssize_t received = 0;
    do {
      received = ::recv(number(), buffer.data(), buffer.size(), MSG_DONTWAIT);
    } while (received < 0 && errno == EINTR);
    if (received < 0) return failedTransfer();
    return {Transfer::Status::moved, static_cast<std::size_t>(received), 0};
  }

  std::unique_ptr<ReadSource> makeReadSource(std::shared_ptr<Queue> queue, Task readable, Task failed) override {
    if (!_descriptor) return nullptr;
    return std::make_unique<LoopReadSource>(std::make_shared<ReadSourceState>(_loop, _descriptor, std::move(queue),
                                                                              std::move(readable), std::move(failed)));
  }

  void close() override { _descriptor.reset(); }

 private:
  /// -1 once closed: the system then answers EBADF.
  [[nodiscard]] int number() const { return _descriptor ? _descriptor->get() : -1; }

  EventLoop& _loop;
  std::shared_ptr<const FileDescriptor> _descriptor;
};

class LinuxUdpSocketService final : public UdpSocketService {
 public:
  Result<std::unique_ptr<UdpSocket>> makeSocket() override {
    FileDescriptor descriptor(::socket(AF_INET, SOCK_DGRAM | SOCK_NONBLOCK | SOCK_CLOEXEC, IPPROTO_UDP));
    if (!descriptor) return failure(kUdpSocketErrorDomain, errno, std::string("socket: ") + std::strerror(errno));
    return std::make_unique<LinuxUdpSocket>(_loop, std::move(descriptor));
  }

 private:
  EventLoop _loop{"velk-datagrams"};
};

}  // namespace

bool isIPv4Address(std::string_view text) {
  in_addr address{};
  return ::inet_pton(AF_INET, std::string(text).c_str(), &address) == 1;
}

std::unique_ptr<UdpSocketService> makeUdpSocketService() { return std::make_unique<LinuxUdpSocketService>(); }

}  // namespace velk
