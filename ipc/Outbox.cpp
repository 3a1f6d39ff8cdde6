#include "ipc/Outbox.h"

#include "ipc/Limits.h"

namespace velk::ipc {
namespace {

constexpr std::size_t kBytesToKeep = 128 * 1024;

}  // namespace

CborWriter::Fault Outbox::append(FrameHeader header, BodyEncoder encode, std::vector<FileDescriptor>& descriptors) {
  const std::size_t start = _bytes.size();
  _bytes.resize(start + kFrameHeaderBytes);
  CborWriter writer(_bytes, kMaximumFrameBytes);
  encode(writer);
  if (writer.fault() != CborWriter::Fault::none) {
    _bytes.resize(start);
    return writer.fault();
  }
  header.length = static_cast<std::uint32_t>(_bytes.size() - start - kFrameHeaderBytes);
  header.descriptors = static_cast<std::uint16_t>(descriptors.size());
  writeFrameHeader(header, _bytes.data() + start);
  if (!descriptors.empty()) _riders.push_back({start, std::move(descriptors)});
  return CborWriter::Fault::none;
}

void Outbox::appendBare(FrameHeader header) {
  const std::size_t start = _bytes.size();
  _bytes.resize(start + kFrameHeaderBytes);
  writeFrameHeader(header, _bytes.data() + start);
}

void Outbox::truncate(std::size_t start, std::vector<FileDescriptor>& descriptors) {
  _bytes.resize(start);
  if (_riders.empty() || _riders.back().offset != start) return;
  descriptors = std::move(_riders.back().descriptors);
  _riders.pop_back();
}

Outbox::Part Outbox::next() const noexcept {
  Part part;
  std::size_t end = _bytes.size();
  std::size_t rider = _ridersSent;
  if (rider < _riders.size() && _riders[rider].offset == _sent) part.descriptors = _riders[rider++].descriptors;
  if (rider < _riders.size()) end = _riders[rider].offset;
  part.bytes = std::span(_bytes).subspan(_sent, end - _sent);
  return part;
}

void Outbox::sent(std::size_t count) {
  if (count != 0 && _ridersSent < _riders.size() && _riders[_ridersSent].offset == _sent) {
    _riders[_ridersSent++].descriptors.clear();
  }
  _sent += count;
}

std::span<const std::uint8_t> Outbox::unsentFrames() const noexcept {
  std::size_t start = 0;
  for (std::size_t end = 0; start < _bytes.size(); start = end) {
    end = start + kFrameHeaderBytes + readFrameHeader(_bytes.data() + start).length;
    if (end > _sent) break;
  }
  return std::span(_bytes).subspan(start);
}

void Outbox::clear() {
  if (_bytes.capacity() > kBytesToKeep) _bytes = {};
  _bytes.clear();
  _riders.clear();
  _sent = 0;
  _ridersSent = 0;
}

}  // namespace velk::ipc
