// Frames that wait to be sent. The connection's core encodes into it under its lock; whoever sends takes all of it at
// once and works on that without the lock.
#pragma once

#include <cstdint>
#include <span>
#include <vector>

#include "ipc/CborWriter.h"
#include "ipc/FrameHeader.h"
#include "platform/FileDescriptor.h"

namespace velk::ipc {

/// Not synchronised.
class Outbox {
 public:
  /// Appends a frame whose body `encode` writes: an array of what it writes. On a fault nothing is appended and the
  /// descriptors stay with the caller.
  [[nodiscard]] CborWriter::Fault append(FrameHeader header, BodyEncoder encode,
                                         std::vector<FileDescriptor>& descriptors);
  /// A frame without a body.
  void appendBare(FrameHeader header);
  /// Takes the last frame back, which began at `start`.
  void truncate(std::size_t start, std::vector<FileDescriptor>& descriptors);

  [[nodiscard]] std::size_t size() const noexcept { return _bytes.size(); }
  [[nodiscard]] bool empty() const noexcept { return _bytes.empty(); }

  // For the sender, on an outbox of its own.

  /// What goes into the next message: the bytes up to the next frame that carries descriptors, and the descriptors of
  /// the first byte. Empty when all is sent.
  struct Part {
    std::span<const std::uint8_t> bytes;
    std::span<const FileDescriptor> descriptors;
  };
  [[nodiscard]] Part next() const noexcept;
  void sent(std::size_t count);
  [[nodiscard]] bool allSent() const noexcept { return _sent == _bytes.size(); }
  [[nodiscard]] std::size_t unsent() const noexcept { return _bytes.size() - _sent; }
  /// The frames that did not leave whole.
  [[nodiscard]] std::span<const std::uint8_t> unsentFrames() const noexcept;
  /// Forgets everything; keeps ordinary amounts of memory.
  void clear();

 private:
  struct Riders {
    std::size_t offset = 0;
    std::vector<FileDescriptor> descriptors;
  };

  std::vector<std::uint8_t> _bytes;
  std::vector<Riders> _riders;
  std::size_t _sent = 0;
  std::size_t _ridersSent = 0;
};

}  // namespace velk::ipc
