// IPv4 datagram sockets with one peer each, and the sources that tell on a queue when one can be read.
// The dashboard backend is their one user; the tests put fakes in their place.
#pragma once

#include <cstdint>
#include <memory>
#include <span>
#include <string_view>

#include "foundation/Error.h"
#include "platform/Queue.h"
#include "platform/Transfer.h"

namespace velk {

inline constexpr const char* kUdpSocketErrorDomain = "UdpSocket";

/// Calls its handler until it is destroyed. Destroyed on the handler's queue, it calls nothing any more from then on;
/// destroyed elsewhere, a call that has begun may still be running. Its last reference may go from within a call.
class ReadSource {
 public:
  virtual ~ReadSource() = default;
};

/// One descriptor, owned by this object (and by a read source for as long as it needs it) and by nobody else. Never
/// blocks, never raises a signal, is not inherited by programs. Used by one thread at a time.
class UdpSocket {
 public:
  virtual ~UdpSocket() = default;

  /// Any local address, any free port. 0, or the system's error number.
  [[nodiscard]] virtual int bindToAnyPort() = 0;
  /// The only peer from now on. `address` is a dotted quad; anything else stands for the all-ones address, which the
  /// system then refuses. 0, or the system's error number.
  [[nodiscard]] virtual int connectTo(std::string_view address, std::uint16_t port) = 0;

  /// One datagram, whole or not at all. A peer that refused an earlier one may show as a failure of this one.
  [[nodiscard]] virtual Transfer send(std::span<const std::uint8_t> datagram) = 0;
  /// The next datagram (what does not fit is lost), which may be empty; `wouldBlock` when there is none. A failure
  /// says nothing of later datagrams: a refused port shows as one and is forgotten by the system.
  [[nodiscard]] virtual Transfer receive(std::span<std::uint8_t> buffer) = 0;

  /// Calls `readable` on `queue` whenever something can be received: the handler then receives until nothing is left
  /// or until it has done enough for one turn, and is called again. Null when no source can be had; when that shows
  /// only later, `failed` is called instead, on `queue`, once. Both are destroyed with the source.
  [[nodiscard]] virtual std::unique_ptr<ReadSource> makeReadSource(std::shared_ptr<Queue> queue, Task readable,
                                                                   Task failed) = 0;

  /// Later sends and receives fail. Destroy the read source first. Idempotent.
  virtual void close() = 0;
};

/// Whether the text is a dotted quad.
[[nodiscard]] bool isIPv4Address(std::string_view text);

/// Any thread. Outlives the sockets that it made, and the queues of their read sources.
class UdpSocketService {
 public:
  virtual ~UdpSocketService() = default;
  /// The error's code is the system's error number.
  [[nodiscard]] virtual Result<std::unique_ptr<UdpSocket>> makeSocket() = 0;
};

/// The system's sockets. The first read source starts one thread, which watches them all and moves no bytes itself.
[[nodiscard]] std::unique_ptr<UdpSocketService> makeUdpSocketService();

}  // namespace velk
