// Cuts received bytes into frames, without looking into their bodies. Used on the event loop's thread, one for each
// connection; the parser that a hostile peer meets first.
#pragma once

#include <cstdint>
#include <span>
#include <vector>

#include "ipc/FrameHeader.h"
#include "platform/FileDescriptor.h"

namespace velk::ipc {

/// Frames that have arrived, their bodies in one buffer. Not synchronised.
struct FrameBatch {
  struct Frame {
    FrameHeader header;
    std::size_t offset = 0;
  };
  std::vector<std::uint8_t> bytes;
  std::vector<Frame> frames;
  /// Of all frames, in their order.
  std::vector<FileDescriptor> descriptors;

  [[nodiscard]] bool empty() const noexcept { return frames.empty(); }
  [[nodiscard]] std::span<const std::uint8_t> body(const Frame& frame) const noexcept {
    return {bytes.data() + frame.offset, frame.header.length};
  }
  /// Keeps ordinary amounts of memory for the next round, gives large ones back.
  void clear();
};

class FrameReader {
 public:
  /// Appends each frame that is now whole to `batch`. Null, or what is wrong: then the connection is beyond repair,
  /// and the frames before the fault are in the batch.
  [[nodiscard]] const char* consume(std::span<const std::uint8_t> received, FrameBatch& batch);

  /// Where descriptors that came with the bytes are put before `consume` is called for those.
  [[nodiscard]] std::vector<FileDescriptor>& arrivedDescriptors() noexcept { return _descriptors; }

  /// A goodbye was the last frame: whatever follows it is ignored.
  [[nodiscard]] bool sawGoodbye() const noexcept { return _sawGoodbye; }
  /// What the frame that has begun will take, once its header is here; else what is here of it.
  [[nodiscard]] std::size_t bytesBegun() const noexcept;
  /// Forgets the frame that has begun, and its memory. Nothing may be consumed after this.
  void dropPartial() noexcept { _partial = {}; }
  /// The end came in the middle of a frame.
  [[nodiscard]] bool hasPartialFrame() const noexcept { return !_partial.empty(); }

 private:
  [[nodiscard]] const char* consumePartial(std::span<const std::uint8_t>& received, FrameBatch& batch);
  [[nodiscard]] const char* take(const std::uint8_t* frame, const FrameHeader& header, FrameBatch& batch);
  [[nodiscard]] const char* checkDescriptors() const;

  std::vector<std::uint8_t> _partial;
  std::vector<FileDescriptor> _descriptors;
  bool _sawGoodbye = false;
};

}  // namespace velk::ipc
