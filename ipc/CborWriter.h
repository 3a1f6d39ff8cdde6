// Writes values as CBOR (RFC 8949) straight into a buffer: no tree, no intermediate text. Used by the connection for
// every frame; not synchronised. docs/protocol.md has the grammar.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string_view>
#include <type_traits>
#include <vector>

#include "foundation/PropertyValue.h"

namespace velk {

/// Appends to a buffer that it does not own. The first fault (text that is not UTF-8, nesting too deep, too many
/// entries, more bytes than allowed) sticks: everything after it is ignored, and `fault` names it.
class CborWriter {
 public:
  enum class Fault : std::uint8_t { none, notUtf8, tooDeep, tooManyEntries, tooLarge };

  /// At most `maximumBytes` are appended to `out`.
  CborWriter(std::vector<std::uint8_t>& out, std::size_t maximumBytes) noexcept;
  /// Writes nothing and finds the same faults: whether a body could be written at all.
  explicit CborWriter(std::size_t maximumBytes) noexcept;

  void beginArray(std::size_t count);
  void null();
  void boolean(bool value);
  void integer(std::int64_t value);
  void unsignedInteger(std::uint64_t value);
  void real(double value);
  void date(Date value);
  void text(std::string_view value);
  void bytes(std::span<const std::uint8_t> value);

  // The body's own array is the first level.
  void value(const PropertyValue& value) { write(value, 1); }
  void value(const PropertyDictionary& value) { write(value, 1); }
  void value(const PropertyArray& value) { write(value, 1); }
  /// Null for none.
  template <class Value>
  void optional(const std::optional<Value>& content) {
    if (!content) return null();
    if constexpr (std::is_convertible_v<const Value&, std::string_view>) {
      text(*content);
    } else {
      value(*content);
    }
  }

  [[nodiscard]] Fault fault() const noexcept { return _fault; }
  /// What `fault` means, for an error's text.
  [[nodiscard]] static const char* description(Fault fault) noexcept;

 private:
  void write(const PropertyValue& value, int depth);
  void write(const PropertyDictionary& value, int depth);
  void write(const PropertyArray& value, int depth);
  [[nodiscard]] bool countEntry() noexcept;
  [[nodiscard]] bool enter(int depth) noexcept;
  template <class EncodeHead>
  void head(EncodeHead encode);
  /// Text that is no value of its own but a key.
  void textOf(std::string_view value);
  void payload(const void* data, std::size_t count);

  std::vector<std::uint8_t>* const _out;
  std::size_t _left;
  std::size_t _entries = 0;
  Fault _fault = Fault::none;
};

namespace ipc {

/// A reference to a callable `void(CborWriter&)` that lives for the duration of a call.
class BodyEncoder {
 public:
  template <class Encode, class = std::enable_if_t<!std::is_same_v<std::decay_t<Encode>, BodyEncoder>>>
  explicit BodyEncoder(Encode& encode) noexcept
      : _context(const_cast<void*>(static_cast<const void*>(&encode))),
        _encode([](void* context, CborWriter& writer) { (*static_cast<Encode*>(context))(writer); }) {}
  void operator()(CborWriter& writer) const { _encode(_context, writer); }

 private:
  void* _context;
  void (*_encode)(void*, CborWriter&);
};

}  // namespace ipc
}  // namespace velk
