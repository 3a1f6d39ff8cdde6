#include "ipc/FrameReader.h"

#include <algorithm>
#include <iterator>

#include "ipc/Limits.h"

namespace velk::ipc {
namespace {

constexpr std::size_t kBytesToKeep = 128 * 1024;
constexpr std::size_t kFramesToKeep = 1024;

}  // namespace

void FrameBatch::clear() {
  if (bytes.capacity() > kBytesToKeep) bytes = {};
  if (frames.capacity() > kFramesToKeep) frames = {};
  bytes.clear();
  frames.clear();
  descriptors.clear();
}

const char* FrameReader::consume(std::span<const std::uint8_t> received, FrameBatch& batch) {
  if (!_partial.empty()) {
    if (const char* fault = consumePartial(received, batch)) return fault;
  }
  while (received.size() >= kFrameHeaderBytes && !_sawGoodbye) {
    const auto header = readFrameHeader(received.data());
    if (const char* fault = faultOf(header)) return fault;
    const std::size_t size = kFrameHeaderBytes + header.length;
    if (received.size() < size) break;
    if (const char* fault = take(received.data(), header, batch)) return fault;
    received = received.subspan(size);
  }
  if (_sawGoodbye) return nullptr;
  _partial.insert(_partial.end(), received.begin(), received.end());
  return checkDescriptors();
}

std::size_t FrameReader::bytesBegun() const noexcept {
  if (_partial.size() < kFrameHeaderBytes) return _partial.size();
  return kFrameHeaderBytes + readFrameHeader(_partial.data()).length;
}

/// Completes the frame that the last bytes left unfinished: its header first, then the rest.
const char* FrameReader::consumePartial(std::span<const std::uint8_t>& received, FrameBatch& batch) {
  const auto fillTo = [&](std::size_t size) {
    const auto count = std::min(size - std::min(size, _partial.size()), received.size());
    _partial.insert(_partial.end(), received.begin(), received.begin() + static_cast<std::ptrdiff_t>(count));
    received = received.subspan(count);
    return _partial.size() >= size;
  };
  if (!fillTo(kFrameHeaderBytes)) return nullptr;
  const auto header = readFrameHeader(_partial.data());
  if (const char* fault = faultOf(header)) return fault;
  // Takes memory as bytes come, and no more than the frame needs.
  const std::size_t size = kFrameHeaderBytes + header.length;
  const std::size_t needed = std::min(size, _partial.size() + received.size());
  if (needed > _partial.capacity()) _partial.reserve(std::min(size, std::max(needed, 2 * _partial.capacity())));
  if (!fillTo(size)) return nullptr;
  const char* fault = take(_partial.data(), header, batch);
  if (_partial.capacity() > kBytesToKeep) _partial = {};
  _partial.clear();
  return fault;
}

const char* FrameReader::take(const std::uint8_t* frame, const FrameHeader& header, FrameBatch& batch) {
  if (header.descriptors > _descriptors.size()) return "fewer descriptors than the frame says";
  if (header.kind == FrameKind::goodbye) {
    _sawGoodbye = true;
    return nullptr;
  }
  batch.frames.push_back({header, batch.bytes.size()});
  const auto* body = frame + kFrameHeaderBytes;
  batch.bytes.insert(batch.bytes.end(), body, body + header.length);
  const auto end = _descriptors.begin() + header.descriptors;
  batch.descriptors.insert(batch.descriptors.end(), std::make_move_iterator(_descriptors.begin()),
                           std::make_move_iterator(end));
  _descriptors.erase(_descriptors.begin(), end);
  return nullptr;
}

/// Descriptors that are left must belong to the frame that has begun.
const char* FrameReader::checkDescriptors() const {
  if (_descriptors.empty()) return nullptr;
  std::size_t claimed = 0;
  if (_partial.size() >= kFrameHeaderBytes) {
    const auto header = readFrameHeader(_partial.data());
    if (const char* fault = faultOf(header)) return fault;
    claimed = header.descriptors;
  } else if (!_partial.empty()) {
    claimed = kMaximumDescriptorsPerFrame;
  }
  return _descriptors.size() > claimed ? "more descriptors than the frames say" : nullptr;
}

}  // namespace velk::ipc
