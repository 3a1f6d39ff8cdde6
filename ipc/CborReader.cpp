#include "ipc/CborReader.h"

#include <cbor/callbacks.h>
#include <cbor/streaming.h>

#include "foundation/Text.h"
#include "ipc/Limits.h"

namespace velk {

/// One item's head as the decoder reports it, with its bytes where it has any.
struct CborReader::Item {
  enum class Kind : std::uint8_t {
    none,
    unsignedInteger,
    negativeInteger,
    real,
    boolean,
    null,
    text,
    bytes,
    array,
    map,
    tag,
    indefinite,
    strayBreak
  };
  Kind kind = Kind::none;
  bool truth = false;
  std::uint64_t number = 0;
  double real = 0;
  const std::uint8_t* data = nullptr;
};

/// The decoder's callbacks: each fills the item that the context points at.
struct ItemSink {
  using Item = CborReader::Item;
  using Kind = Item::Kind;

  static void put(void* context, Kind kind, std::uint64_t number) {
    auto& item = *static_cast<Item*>(context);
    item.kind = kind;
    item.number = number;
  }
  template <Kind kind, class Number>
  static void number(void* context, Number value) {
    put(context, kind, value);
  }
  template <Kind kind>
  static void string(void* context, cbor_data data, std::size_t size) {
    put(context, kind, size);
    static_cast<Item*>(context)->data = data;
  }
  template <class Real>
  static void real(void* context, Real value) {
    put(context, Kind::real, 0);
    static_cast<Item*>(context)->real = static_cast<double>(value);
  }
  static void truth(void* context, bool value) {
    put(context, Kind::boolean, 0);
    static_cast<Item*>(context)->truth = value;
  }
  template <Kind kind>
  static void simple(void* context) {
    put(context, kind, 0);
  }

  static cbor_callbacks make() {
    cbor_callbacks callbacks{};
    callbacks.uint8 = number<Kind::unsignedInteger, std::uint8_t>;
    callbacks.uint16 = number<Kind::unsignedInteger, std::uint16_t>;
    callbacks.uint32 = number<Kind::unsignedInteger, std::uint32_t>;
    callbacks.uint64 = number<Kind::unsignedInteger, std::uint64_t>;
    callbacks.negint8 = number<Kind::negativeInteger, std::uint8_t>;
    callbacks.negint16 = number<Kind::negativeInteger, std::uint16_t>;
    callbacks.negint32 = number<Kind::negativeInteger, std::uint32_t>;
    callbacks.negint64 = number<Kind::negativeInteger, std::uint64_t>;
    callbacks.byte_string = string<Kind::bytes>;
    callbacks.string = string<Kind::text>;
    callbacks.array_start = number<Kind::array, std::size_t>;
    callbacks.map_start = number<Kind::map, std::size_t>;
    callbacks.tag = number<Kind::tag, std::uint64_t>;
    callbacks.float2 = real<float>;
    callbacks.float4 = real<float>;
    callbacks.float8 = real<double>;
    callbacks.null = simple<Kind::null>;
    callbacks.undefined = simple<Kind::null>;
    callbacks.boolean = truth;
    callbacks.byte_string_start = simple<Kind::indefinite>;
    callbacks.string_start = simple<Kind::indefinite>;
    callbacks.indef_array_start = simple<Kind::indefinite>;
    callbacks.indef_map_start = simple<Kind::indefinite>;
    callbacks.indef_break = simple<Kind::strayBreak>;
    return callbacks;
  }
};

namespace {

constexpr std::uint64_t kTagOfDates = 1;

using Severity = CborReader::Severity;

}  // namespace

bool CborReader::fail(Severity severity, const char* fault) noexcept {
  if (_severity == Severity::none) {
    _severity = severity;
    _fault = fault;
  }
  _bytes = {};
  return false;
}

bool CborReader::next(Item& item) {
  static const cbor_callbacks callbacks = ItemSink::make();
  if (_severity != Severity::none) return false;
  const auto result = cbor_stream_decode(_bytes.data(), _bytes.size(), &callbacks, &item);
  if (result.status == CBOR_DECODER_NEDATA) return fail(Severity::malformed, "body cut short");
  if (result.status != CBOR_DECODER_FINISHED) return fail(Severity::malformed, "not CBOR");
  _bytes = _bytes.subspan(result.read);
  if (item.kind == Item::Kind::indefinite) return fail(Severity::unacceptable, "indefinite length");
  // Nothing that it could end has been begun: whatever is read here has a length.
  if (item.kind == Item::Kind::strayBreak) return fail(Severity::malformed, "not CBOR");
  return true;
}

bool CborReader::readArrayHead(std::size_t& count) {
  Item item;
  if (!next(item)) return false;
  if (item.kind != Item::Kind::array) return fail(Severity::malformed, "body is no array");
  if (!checkCount(item.number, 1, 0)) return false;
  count = item.number;
  return true;
}

bool CborReader::readUnsigned(std::uint64_t& value) {
  Item item;
  if (!next(item)) return false;
  if (item.kind != Item::Kind::unsignedInteger) return fail(Severity::malformed, "number missing");
  value = item.number;
  return true;
}

bool CborReader::readValue(PropertyValue& value) { return readValue(value, 1); }

bool CborReader::readEnd() {
  if (_severity != Severity::none) return false;
  return _bytes.empty() || fail(Severity::malformed, "bytes after the body");
}

bool CborReader::readValue(PropertyValue& value, int depth) {
  Item item;
  if (!next(item)) return false;
  switch (item.kind) {
    case Item::Kind::null:
      value = nullptr;
      return true;
    case Item::Kind::boolean:
      value = item.truth;
      return true;
    case Item::Kind::unsignedInteger:
      value = item.number;
      return true;
    case Item::Kind::negativeInteger:
      if (item.number > static_cast<std::uint64_t>(INT64_MAX)) {
        return fail(Severity::unacceptable, "integer out of range");
      }
      value = -1 - static_cast<std::int64_t>(item.number);
      return true;
    case Item::Kind::real:
      value = item.real;
      return true;
    case Item::Kind::text: {
      const std::string_view text(reinterpret_cast<const char*>(item.data), item.number);
      if (!isUtf8(text)) return fail(Severity::unacceptable, "text is not UTF-8");
      value = text;
      return true;
    }
    case Item::Kind::bytes:
      value = ByteData(item.data, item.data + item.number);
      return true;
    case Item::Kind::array:
      return readArray(value, item.number, depth);
    case Item::Kind::map:
      return readDictionary(value, item.number, depth);
    case Item::Kind::tag:
      return readDate(value, item.number);
    case Item::Kind::none:
    case Item::Kind::indefinite:
    case Item::Kind::strayBreak:
      break;
  }
  return fail(Severity::unacceptable, "unknown simple value");
}

/// Refuses counts that the bytes left cannot hold before any room is made for them.
bool CborReader::checkCount(std::uint64_t count, std::size_t leastBytesEach, int depth) {
  if (depth >= ipc::kMaximumDepth) return fail(Severity::malformed, "nested too deep");
  if (count > _bytes.size() / leastBytesEach) return fail(Severity::malformed, "body cut short");
  _entries += count;
  return _entries <= ipc::kMaximumEntries || fail(Severity::malformed, "too many entries");
}

bool CborReader::readArray(PropertyValue& value, std::uint64_t count, int depth) {
  if (!checkCount(count, 1, depth)) return false;
  PropertyArray array;
  if (count != 0) array.reserve(count);
  for (std::uint64_t number = 0; number < count; ++number) {
    PropertyValue element;
    if (!readValue(element, depth + 1)) return false;
    array.append(std::move(element));
  }
  value = std::move(array);
  return true;
}

bool CborReader::readDictionary(PropertyValue& value, std::uint64_t count, int depth) {
  if (!checkCount(count, 2, depth)) return false;
  if (count > ipc::kMaximumKeysInMap) return fail(Severity::malformed, "too many keys in a map");
  PropertyDictionary dictionary;
  if (count != 0) dictionary.reserve(count);
  for (std::uint64_t number = 0; number < count; ++number) {
    Item key;
    if (!next(key)) return false;
    if (key.kind != Item::Kind::text) return fail(Severity::unacceptable, "key is no text");
    const std::string_view text(reinterpret_cast<const char*>(key.data), key.number);
    if (!isUtf8(text)) return fail(Severity::unacceptable, "text is not UTF-8");
    if (dictionary.contains(text)) return fail(Severity::unacceptable, "key given twice");
    PropertyValue content;
    if (!readValue(content, depth + 1)) return false;
    dictionary.appendUnique(std::string(text), std::move(content));
  }
  value = std::move(dictionary);
  return true;
}

bool CborReader::readDate(PropertyValue& value, std::uint64_t tag) {
  if (tag != kTagOfDates) return fail(Severity::unacceptable, "unknown tag");
  Item item;
  if (!next(item)) return false;
  if (item.kind == Item::Kind::real) {
    value = Date{item.real};
  } else if (item.kind == Item::Kind::unsignedInteger) {
    value = Date{static_cast<double>(item.number)};
  } else if (item.kind == Item::Kind::negativeInteger) {
    value = Date{-1.0 - static_cast<double>(item.number)};
  } else {
    return fail(Severity::unacceptable, "date is no number");
  }
  return true;
}

}  // namespace velk
