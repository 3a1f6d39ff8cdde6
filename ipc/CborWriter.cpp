#include "ipc/CborWriter.h"

#include <cbor/encoding.h>

#include "foundation/Text.h"
#include "ipc/Limits.h"

namespace velk {
namespace {

/// The longest head of an item: its first byte and a number of 64 bits.
constexpr std::size_t kLongestHead = 9;
constexpr std::uint64_t kTagOfDates = 1;

}  // namespace

CborWriter::CborWriter(std::vector<std::uint8_t>& out, std::size_t maximumBytes) noexcept
    : _out(&out), _left(maximumBytes) {}

CborWriter::CborWriter(std::size_t maximumBytes) noexcept : _out(nullptr), _left(maximumBytes) {}

const char* CborWriter::description(Fault fault) noexcept {
  switch (fault) {
    case Fault::none:
      return "nothing";
    case Fault::notUtf8:
      return "text that is not UTF-8";
    case Fault::tooDeep:
      return "values nested too deep";
    case Fault::tooManyEntries:
      return "too many values";
    case Fault::tooLarge:
      return "too large for a frame";
  }
  return "unknown";
}

bool CborWriter::countEntry() noexcept {
  if (_fault != Fault::none) return false;
  if (++_entries <= ipc::kMaximumEntries) return true;
  _fault = Fault::tooManyEntries;
  return false;
}

void CborWriter::payload(const void* data, std::size_t count) {
  if (_fault != Fault::none) return;
  if (count > _left) {
    _fault = Fault::tooLarge;
    return;
  }
  _left -= count;
  if (_out == nullptr) return;
  const auto* bytes = static_cast<const std::uint8_t*>(data);
  _out->insert(_out->end(), bytes, bytes + count);
}

template <class EncodeHead>
void CborWriter::head(EncodeHead encode) {
  unsigned char bytes[kLongestHead];
  payload(bytes, encode(bytes));
}

void CborWriter::beginArray(std::size_t count) {
  if (countEntry()) head([&](unsigned char* to) { return cbor_encode_array_start(count, to, kLongestHead); });
}

void CborWriter::null() {
  if (countEntry()) head([](unsigned char* to) { return cbor_encode_null(to, kLongestHead); });
}

void CborWriter::boolean(bool value) {
  if (countEntry()) head([&](unsigned char* to) { return cbor_encode_bool(value, to, kLongestHead); });
}

void CborWriter::integer(std::int64_t value) {
  if (value >= 0) return unsignedInteger(static_cast<std::uint64_t>(value));
  const auto absolute = static_cast<std::uint64_t>(-(value + 1));
  if (countEntry()) head([&](unsigned char* to) { return cbor_encode_negint(absolute, to, kLongestHead); });
}

void CborWriter::unsignedInteger(std::uint64_t value) {
  if (countEntry()) head([&](unsigned char* to) { return cbor_encode_uint(value, to, kLongestHead); });
}

void CborWriter::real(double value) {
  if (countEntry()) head([&](unsigned char* to) { return cbor_encode_double(value, to, kLongestHead); });
}

void CborWriter::date(Date value) {
  if (!countEntry()) return;
  head([](unsigned char* to) { return cbor_encode_tag(kTagOfDates, to, kLongestHead); });
  head([&](unsigned char* to) { return cbor_encode_double(value.secondsSince1970, to, kLongestHead); });
}

void CborWriter::text(std::string_view value) {
  if (countEntry()) textOf(value);
}

void CborWriter::textOf(std::string_view value) {
  if (!isUtf8(value)) {
    _fault = Fault::notUtf8;
    return;
  }
  head([&](unsigned char* to) { return cbor_encode_string_start(value.size(), to, kLongestHead); });
  payload(value.data(), value.size());
}

void CborWriter::bytes(std::span<const std::uint8_t> value) {
  if (!countEntry()) return;
  head([&](unsigned char* to) { return cbor_encode_bytestring_start(value.size(), to, kLongestHead); });
  payload(value.data(), value.size());
}

void CborWriter::write(const PropertyValue& value, int depth) {
  switch (value.type()) {
    case PropertyValue::Type::null:
      return null();
    case PropertyValue::Type::boolean:
      return boolean(*value.boolean());
    case PropertyValue::Type::integer:
      return integer(*value.integer());
    case PropertyValue::Type::unsignedInteger:
      return unsignedInteger(*value.unsignedInteger());
    case PropertyValue::Type::real:
      return real(*value.real());
    case PropertyValue::Type::date:
      return date(*value.date());
    case PropertyValue::Type::string:
      return text(*value.string());
    case PropertyValue::Type::data:
      return bytes(*value.data());
    case PropertyValue::Type::array:
      return write(*value.array(), depth);
    case PropertyValue::Type::dictionary:
      return write(*value.dictionary(), depth);
  }
}

bool CborWriter::enter(int depth) noexcept {
  if (!countEntry()) return false;
  if (depth < ipc::kMaximumDepth) return true;
  _fault = Fault::tooDeep;
  return false;
}

void CborWriter::write(const PropertyArray& value, int depth) {
  if (!enter(depth)) return;
  head([&](unsigned char* to) { return cbor_encode_array_start(value.size(), to, kLongestHead); });
  for (const auto& element : value) {
    if (_fault != Fault::none) return;
    write(element, depth + 1);
  }
}

void CborWriter::write(const PropertyDictionary& value, int depth) {
  if (!enter(depth)) return;
  if (value.size() > ipc::kMaximumKeysInMap) _fault = Fault::tooManyEntries;
  head([&](unsigned char* to) { return cbor_encode_map_start(value.size(), to, kLongestHead); });
  for (const auto& entry : value) {
    if (_fault != Fault::none) return;
    textOf(entry.key);
    write(entry.value, depth + 1);
  }
}

}  // namespace velk
