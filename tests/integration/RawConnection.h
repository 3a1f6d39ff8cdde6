// A client that speaks, or misspells, the daemon's frames byte by byte.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/FileDescriptor.h"
#include "tests/integration/Daemon.h"

namespace velk::test {

enum class FrameKind : std::uint8_t { call = 1, reply = 2, error = 3, goodbye = 4 };

/// One test's thread uses it.
class RawConnection {
 public:
  struct Frame {
    FrameKind kind;
    std::uint64_t serial;
    /// CBOR.
    std::string body;
  };

  /// Not connected (see `isConnected`) when the daemon does not take the connection.
  explicit RawConnection(const Daemon& daemon);

  [[nodiscard]] bool isConnected() const { return _socket.get() >= 0; }
  /// The bytes of a frame around `body`; `length`: what the header claims, when that is not the body's length.
  [[nodiscard]] static std::string frame(FrameKind kind, std::uint64_t serial, std::string_view body,
                                         std::optional<std::uint32_t> length = std::nullopt, std::uint8_t version = 1,
                                         std::uint16_t descriptors = 0);
  /// False when the daemon has closed the connection. Blocks while the daemon does not read.
  bool send(std::string_view bytes);
  /// The same with descriptors riding along with the first byte. They stay the caller's.
  bool sendWith(std::string_view bytes, const std::vector<int>& descriptors);
  /// Sent, and not yet taken from the socket by the daemon: bytes as the system counts them.
  [[nodiscard]] int bytesUntaken() const;
  /// As much as fits within the time; the number of bytes.
  std::size_t sendWhatFits(std::string_view bytes, std::chrono::milliseconds patience);
  /// The next frame that the daemon sends; nothing when it closes the connection first or none comes in time.
  [[nodiscard]] std::optional<Frame> receive(std::chrono::milliseconds patience = kPatience);
  /// True when the daemon closes the connection in time; what it sends until then is dropped.
  [[nodiscard]] bool waitForEnd(std::chrono::milliseconds patience = kPatience);
  void close() { _socket = FileDescriptor(); }

 private:
  bool waitReadable(std::chrono::milliseconds patience) const;
  bool readMore(std::chrono::milliseconds patience);

  FileDescriptor _socket;
  std::string _received;
};

}  // namespace velk::test
