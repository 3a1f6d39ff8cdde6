// Reads bodies (CBOR, RFC 8949) straight into values. Used by the connection's delivery queue for every frame, and by
// the fuzzer; not synchronised. docs/protocol.md has the grammar.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <vector>

#include "foundation/PropertyValue.h"

namespace velk {

/// The first fault ends the reading: every later call answers false.
///
/// Two kinds of fault. `malformed`: these bytes are no body of ours (not CBOR, a break without a beginning among that,
/// cut short, trailing bytes, nested too deep, more entries than a body may have); whoever sent them cannot be trusted
/// to frame the next one. `unacceptable`: sound CBOR with a content that we refuse (text that is not UTF-8, a key given
/// twice or not a text, indefinite lengths, tags and simple values without a meaning here); it costs the sender this
/// one call.
class CborReader {
 public:
  enum class Severity : std::uint8_t { none, unacceptable, malformed };

  explicit CborReader(std::span<const std::uint8_t> bytes) noexcept : _bytes(bytes) {}

  /// The head of an array; its elements are read next, one by one.
  [[nodiscard]] bool readArrayHead(std::size_t& count);
  [[nodiscard]] bool readUnsigned(std::uint64_t& value);
  [[nodiscard]] bool readValue(PropertyValue& value);
  /// Nothing may be left.
  [[nodiscard]] bool readEnd();

  [[nodiscard]] Severity severity() const noexcept { return _severity; }
  /// What is wrong, for logs and errors: a fixed text.
  [[nodiscard]] const char* fault() const noexcept { return _fault; }

 private:
  struct Item;
  friend struct ItemSink;

  [[nodiscard]] bool next(Item& item);
  [[nodiscard]] bool readValue(PropertyValue& value, int depth);
  [[nodiscard]] bool readArray(PropertyValue& value, std::uint64_t count, int depth);
  [[nodiscard]] bool readDictionary(PropertyValue& value, std::uint64_t count, int depth);
  [[nodiscard]] bool readDate(PropertyValue& value, std::uint64_t tag);
  [[nodiscard]] bool checkCount(std::uint64_t count, std::size_t leastBytesEach, int depth);
  bool fail(Severity severity, const char* fault) noexcept;

  std::span<const std::uint8_t> _bytes;
  std::size_t _entries = 0;
  Severity _severity = Severity::none;
  const char* _fault = "";
};

}  // namespace velk
