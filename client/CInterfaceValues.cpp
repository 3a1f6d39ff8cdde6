// The C interface: values, and what is common to all handles.

#include <algorithm>
#include <cstring>
#include <new>

#include "client/CInterfaceHandles.h"
#include "foundation/Text.h"

namespace velk::cinterface {

namespace {

void addWithin(Extent& extent, const PropertyValue& value) {
  const Extent within = extentOf(value);
  extent.depth = std::max(extent.depth, within.depth + 1);
  extent.values += within.values;
}

}  // namespace

Extent extentOf(const PropertyValue& value) {
  Extent extent;
  if (const PropertyArray* array = value.array()) {
    extent.depth = 1;
    for (const PropertyValue& element : *array) addWithin(extent, element);
  } else if (const PropertyDictionary* dictionary = value.dictionary()) {
    extent.depth = 1;
    for (const auto& entry : *dictionary) addWithin(extent, entry.value);
  }
  return extent;
}

VelkReportingValue* newValue(PropertyValue value, Extent extent) {
  auto* handle = new VelkReportingValue;
  handle->value = std::move(value);
  handle->extent = extent;
  return handle;
}

VelkReportingValue* newValue(PropertyValue value) {
  const Extent extent = extentOf(value);
  return newValue(std::move(value), extent);
}

const PropertyDictionary* dictionaryOf(const VelkReportingValue* value) noexcept {
  return value != nullptr ? std::as_const(value->value).dictionary() : nullptr;
}

const PropertyArray* arrayOf(const VelkReportingValue* value) noexcept {
  return value != nullptr ? std::as_const(value->value).array() : nullptr;
}

std::int64_t boundedInteger(const PropertyValue* value) noexcept {
  return value != nullptr && value->unsignedInteger() != nullptr ? INT64_MAX : integerValue(value);
}

std::optional<PropertyDictionary> optionalDictionary(const VelkReportingValue* value) {
  const PropertyDictionary* dictionary = dictionaryOf(value);
  return dictionary != nullptr ? std::optional(*dictionary) : std::nullopt;
}

}  // namespace velk::cinterface

using velk::PropertyArray;
using velk::PropertyDictionary;
using velk::PropertyValue;
using velk::cinterface::guarded;
using velk::cinterface::newValue;

namespace {

const PropertyValue* valueOf(const VelkReportingValue* value) { return value != nullptr ? &value->value : nullptr; }

template <class From>
VelkReportingValue* makeValue(const char* function, From from) {
  return guarded(function, nullptr, [&] { return newValue(PropertyValue(std::move(from)), {}); });
}

}  // namespace

VelkReportingValue* VelkReportingValueCreateNull(void) { return makeValue(__func__, nullptr); }
VelkReportingValue* VelkReportingValueCreateBoolean(bool value) { return makeValue(__func__, value); }
VelkReportingValue* VelkReportingValueCreateInteger(int64_t value) { return makeValue(__func__, value); }
VelkReportingValue* VelkReportingValueCreateUnsignedInteger(uint64_t value) { return makeValue(__func__, value); }
VelkReportingValue* VelkReportingValueCreateReal(double value) { return makeValue(__func__, value); }

VelkReportingValue* VelkReportingValueCreateDate(double secondsSince1970) {
  return makeValue(__func__, velk::Date{secondsSince1970});
}

VelkReportingValue* VelkReportingValueCreateString(const char* text) {
  return text != nullptr ? VelkReportingValueCreateStringWithLength(text, std::strlen(text)) : nullptr;
}

VelkReportingValue* VelkReportingValueCreateStringWithLength(const char* text, size_t length) {
  if (text == nullptr || !velk::isUtf8({text, length})) return nullptr;
  return makeValue(__func__, std::string_view(text, length));
}

VelkReportingValue* VelkReportingValueCreateData(const void* bytes, size_t size) {
  if (bytes == nullptr && size != 0) return nullptr;
  return guarded(__func__, nullptr, [&] {
    velk::ByteData data(size);
    if (size != 0) std::memcpy(data.data(), bytes, size);
    return newValue(PropertyValue(std::move(data)), {});
  });
}

VelkReportingValue* VelkReportingArrayCreate(void) {
  return guarded(__func__, nullptr, [] { return newValue(PropertyArray()); });
}

VelkReportingValue* VelkReportingDictionaryCreate(void) {
  return guarded(__func__, nullptr, [] { return newValue(PropertyDictionary()); });
}

VelkReportingValue* VelkReportingValueRetain(const VelkReportingValue* value) {
  // Only what is borrowed is constant; whoever retains it is an owner like any other.
  return velk::cinterface::retain(const_cast<VelkReportingValue*>(value));
}

void VelkReportingValueRelease(VelkReportingValue* value) { velk::cinterface::release(value); }

VelkReportingValue* VelkReportingValueCopy(const VelkReportingValue* value) {
  if (value == nullptr) return nullptr;
  return guarded(__func__, nullptr, [&] { return newValue(value->value, value->extent); });
}

bool VelkReportingValueIsEqual(const VelkReportingValue* left, const VelkReportingValue* right) {
  if (left == nullptr || right == nullptr) return left == right;
  return left->value == right->value;
}

VelkReportingValueType VelkReportingValueGetType(const VelkReportingValue* value) {
  if (value == nullptr) return kVelkReportingValueTypeNull;
  return static_cast<VelkReportingValueType>(value->value.type());
}

bool VelkReportingValueGetBoolean(const VelkReportingValue* value) { return velk::booleanValue(valueOf(value)); }
int64_t VelkReportingValueGetInteger(const VelkReportingValue* value) {
  return velk::cinterface::boundedInteger(valueOf(value));
}
double VelkReportingValueGetReal(const VelkReportingValue* value) { return velk::doubleValue(valueOf(value)); }

uint64_t VelkReportingValueGetUnsignedInteger(const VelkReportingValue* value) {
  if (value == nullptr) return 0;
  if (const std::uint64_t* big = value->value.unsignedInteger()) return *big;
  const std::int64_t* number = value->value.integer();
  return number != nullptr && *number > 0 ? static_cast<std::uint64_t>(*number) : 0;
}

double VelkReportingValueGetDate(const VelkReportingValue* value) {
  const velk::Date* date = value != nullptr ? value->value.date() : nullptr;
  return date != nullptr ? date->secondsSince1970 : 0;
}

const char* VelkReportingValueGetString(const VelkReportingValue* value, size_t* length) {
  const std::string* text = value != nullptr ? value->value.string() : nullptr;
  if (length != nullptr) *length = text != nullptr ? text->size() : 0;
  return text != nullptr ? text->c_str() : nullptr;
}

const void* VelkReportingValueGetData(const VelkReportingValue* value, size_t* size) {
  static constexpr char kNoBytes = 0;
  const velk::ByteData* data = value != nullptr ? value->value.data() : nullptr;
  if (size != nullptr) *size = data != nullptr ? data->size() : 0;
  if (data == nullptr) return nullptr;
  return data->empty() ? static_cast<const void*>(&kNoBytes) : data->data();
}
