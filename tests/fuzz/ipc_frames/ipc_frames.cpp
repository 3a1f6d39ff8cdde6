// What a hostile peer can send: bytes cut into frames at places of its choice, each body read. Whatever is read is
// written and read again, and must come out the same.
#include <algorithm>
#include <cstdlib>

#include "ipc/CborReader.h"
#include "ipc/CborWriter.h"
#include "ipc/FrameReader.h"
#include "ipc/Limits.h"

namespace {

using namespace velk;

void readBody(std::span<const std::uint8_t> body) {
  CborReader reader(body);
  PropertyValue value;
  if (!reader.readValue(value) || !reader.readEnd()) return;
  std::vector<std::uint8_t> first;
  CborWriter writer(first, 16 * ipc::kMaximumFrameBytes);
  writer.value(value);
  if (writer.fault() != CborWriter::Fault::none) std::abort();
  // Compared as bytes: NaN equals nothing.
  CborReader again(first);
  PropertyValue copy;
  if (!again.readValue(copy) || !again.readEnd()) std::abort();
  std::vector<std::uint8_t> second;
  CborWriter rewriter(second, 16 * ipc::kMaximumFrameBytes);
  rewriter.value(copy);
  if (first != second) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  if (size == 0) return 0;
  const std::size_t step = data[0] == 0 ? size : data[0];
  const std::span<const std::uint8_t> stream(data + 1, size - 1);
  readBody(stream);
  ipc::FrameReader frames;
  ipc::FrameBatch batch;
  for (std::size_t at = 0; at < stream.size(); at += step) {
    if (frames.consume(stream.subspan(at, std::min(step, stream.size() - at)), batch) != nullptr) break;
  }
  for (const auto& frame : batch.frames) readBody(batch.body(frame));
  return 0;
}
