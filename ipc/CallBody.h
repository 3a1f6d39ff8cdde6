// What the body of a call consists of: one piece of code for who sends it and for who asks beforehand whether it can be
// sent at all.
#pragma once

#include <cstddef>
#include <cstdint>

#include "ipc/CborWriter.h"
#include "ipc/Limits.h"

namespace velk::ipc {

/// `encode(CborWriter&)` writes so many arguments.
template <class Encode>
void writeCallBody(CborWriter& writer, std::uint32_t method, std::size_t argumentCount, const Encode& encode) {
  writer.beginArray(argumentCount + 1);
  writer.unsignedInteger(method);
  encode(writer);
}

/// Why no frame can carry this call (too large, too deep, no text), in words; null when one can. Writes nothing.
template <class Encode>
[[nodiscard]] const char* reasonNotToCall(std::uint32_t method, std::size_t argumentCount, const Encode& encode) {
  CborWriter writer(kMaximumFrameBytes);
  writeCallBody(writer, method, argumentCount, encode);
  return writer.fault() == CborWriter::Fault::none ? nullptr : CborWriter::description(writer.fault());
}

}  // namespace velk::ipc
