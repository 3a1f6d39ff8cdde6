// The C interface: arrays, dictionaries, and their form as JSON.

#include <algorithm>
#include <cstdlib>
#include <cstring>

#include "client/CInterfaceHandles.h"
#include "foundation/Json.h"
#include "foundation/Text.h"
#include "ipc/Vocabulary.h"

using velk::PropertyArray;
using velk::PropertyDictionary;
using velk::PropertyValue;
using velk::cinterface::arrayOf;
using velk::cinterface::dictionaryOf;
using velk::cinterface::Extent;
using velk::cinterface::extentOf;
using velk::cinterface::guarded;
using velk::cinterface::handOut;
using velk::cinterface::kMaximumDepth;
using velk::cinterface::kMaximumValues;
using velk::cinterface::newValue;

namespace {

/// A bound on what stands in `container`.
Extent boundWithin(const VelkReportingValue* container, const PropertyValue& value) {
  if (value.array() == nullptr && value.dictionary() == nullptr) return {};
  return {container->extent.depth - 1, container->extent.values - 1};
}

/// The extent of a container with a value more.
Extent withOneMore(Extent container, Extent added) {
  return {std::max(container.depth, added.depth + 1), container.values + added.values};
}

bool isWithinBounds(Extent extent) { return extent.depth <= kMaximumDepth && extent.values <= kMaximumValues; }

/// Makes room in a container's extent for a value, whose own is `added` at most. False when there is none. What was
/// taken out or replaced since is told apart only where it matters: `remaining` answers what the container then holds.
template <class Remaining>
bool makeRoom(Extent& container, const PropertyValue& value, Extent added, Remaining remaining) {
  Extent grown = withOneMore(container, added);
  if (!isWithinBounds(grown)) grown = withOneMore(extentOf(remaining()), extentOf(value));
  if (!isWithinBounds(grown)) return false;
  container = grown;
  return true;
}

bool setInDictionary(const char* function, VelkReportingValue* dictionary, const char* key, const PropertyValue& value,
                     Extent extent) {
  return guarded(function, false, [&] {
    if (dictionaryOf(dictionary) == nullptr || key == nullptr || !velk::isUtf8(key)) return false;
    PropertyValue copy(value);  // the value may be the dictionary itself
    const auto remaining = [&]() -> PropertyValue {
      PropertyDictionary others(*dictionaryOf(dictionary));
      others.remove(key);
      return others;
    };
    if (!makeRoom(dictionary->extent, copy, extent, remaining)) return false;
    dictionary->value.dictionary()->set(key, std::move(copy));
    return true;
  });
}

const PropertyValue* find(const VelkReportingValue* dictionary, const char* key) noexcept {
  const PropertyDictionary* within = dictionaryOf(dictionary);
  return within != nullptr && key != nullptr ? within->find(key) : nullptr;
}

velk::Error invalidJson(std::string description) {
  return {std::string(velk::kVelkReportingErrorDomain), kVelkReportingErrorInvalidJSON, std::move(description)};
}

VelkReportingValue* fromJson(const char* function, const char* text, bool needsDictionary, VelkReportingError** error) {
  if (error != nullptr) *error = nullptr;
  return guarded(function, nullptr, [&]() -> VelkReportingValue* {
    const auto refuse = [error](std::string description) {
      handOut(error, invalidJson(std::move(description)));
      return nullptr;
    };
    if (text == nullptr) return refuse("there is no text");
    auto parsed = velk::json::parse(text, velk::json::Extensions::tagged);
    if (!parsed) return refuse(parsed.error().description);
    if (needsDictionary && parsed->dictionary() == nullptr) return refuse("the text is no JSON object");
    const Extent extent = extentOf(*parsed);
    if (extent.values > kMaximumValues) return refuse("there are too many values");
    return newValue(std::move(*parsed), extent);
  });
}

}  // namespace

bool VelkReportingArrayAppend(VelkReportingValue* array, const VelkReportingValue* value) {
  return guarded(__func__, false, [&] {
    if (arrayOf(array) == nullptr || value == nullptr) return false;
    PropertyValue copy(value->value);  // the value may be the array itself
    if (!makeRoom(array->extent, copy, value->extent, [array] { return array->value; })) return false;
    array->value.array()->append(std::move(copy));
    return true;
  });
}

size_t VelkReportingArrayGetCount(const VelkReportingValue* array) {
  const PropertyArray* within = arrayOf(array);
  return within != nullptr ? within->size() : 0;
}

VelkReportingValue* VelkReportingArrayCopyValue(const VelkReportingValue* array, size_t index) {
  const PropertyArray* within = arrayOf(array);
  if (within == nullptr || index >= within->size()) return nullptr;
  const PropertyValue& value = (*within)[index];
  return guarded(__func__, nullptr, [&] { return newValue(value, boundWithin(array, value)); });
}

bool VelkReportingDictionarySet(VelkReportingValue* dictionary, const char* key, const VelkReportingValue* value) {
  return value != nullptr && setInDictionary(__func__, dictionary, key, value->value, value->extent);
}

bool VelkReportingDictionarySetBoolean(VelkReportingValue* dictionary, const char* key, bool value) {
  return setInDictionary(__func__, dictionary, key, value, {});
}

bool VelkReportingDictionarySetInteger(VelkReportingValue* dictionary, const char* key, int64_t value) {
  return setInDictionary(__func__, dictionary, key, value, {});
}

bool VelkReportingDictionarySetReal(VelkReportingValue* dictionary, const char* key, double value) {
  return setInDictionary(__func__, dictionary, key, value, {});
}

bool VelkReportingDictionarySetString(VelkReportingValue* dictionary, const char* key, const char* text) {
  if (text == nullptr || !velk::isUtf8(text)) return false;
  return guarded(__func__, false,
                 [&] { return setInDictionary("VelkReportingDictionarySetString", dictionary, key, text, {}); });
}

bool VelkReportingDictionaryRemove(VelkReportingValue* dictionary, const char* key) {
  return guarded(__func__, false,
                 [&] { return find(dictionary, key) != nullptr && dictionary->value.dictionary()->remove(key); });
}

size_t VelkReportingDictionaryGetCount(const VelkReportingValue* dictionary) {
  const PropertyDictionary* within = dictionaryOf(dictionary);
  return within != nullptr ? within->size() : 0;
}

const char* VelkReportingDictionaryGetKey(const VelkReportingValue* dictionary, size_t index) {
  const PropertyDictionary* within = dictionaryOf(dictionary);
  return within != nullptr && index < within->size() ? (within->begin() + index)->key.c_str() : nullptr;
}

VelkReportingValue* VelkReportingDictionaryCopyValue(const VelkReportingValue* dictionary, const char* key) {
  const PropertyValue* value = find(dictionary, key);
  if (value == nullptr) return nullptr;
  return guarded(__func__, nullptr, [&] { return newValue(*value, boundWithin(dictionary, *value)); });
}

bool VelkReportingDictionaryGetBoolean(const VelkReportingValue* dictionary, const char* key) {
  return velk::booleanValue(find(dictionary, key));
}

int64_t VelkReportingDictionaryGetInteger(const VelkReportingValue* dictionary, const char* key) {
  return velk::cinterface::boundedInteger(find(dictionary, key));
}

double VelkReportingDictionaryGetReal(const VelkReportingValue* dictionary, const char* key) {
  return velk::doubleValue(find(dictionary, key));
}

const char* VelkReportingDictionaryGetString(const VelkReportingValue* dictionary, const char* key) {
  const PropertyValue* value = find(dictionary, key);
  const std::string* text = value != nullptr ? value->string() : nullptr;
  return text != nullptr ? text->c_str() : nullptr;
}

VelkReportingValue* VelkReportingValueCreateFromJSON(const char* text, VelkReportingError** error) {
  return fromJson(__func__, text, false, error);
}

VelkReportingValue* VelkReportingDictionaryCreateFromJSON(const char* text, VelkReportingError** error) {
  return fromJson(__func__, text, true, error);
}

char* VelkReportingValueCopyJSON(const VelkReportingValue* value, VelkReportingError** error) {
  if (error != nullptr) *error = nullptr;
  return guarded(__func__, nullptr, [&]() -> char* {
    if (value == nullptr) {
      handOut(error, invalidJson("there is no value"));
      return nullptr;
    }
    std::string text;
    if (velk::json::write(value->value, text, velk::json::Extensions::tagged)) return strdup(text.c_str());
    handOut(error, invalidJson("a number in the value is not finite"));
    return nullptr;
  });
}

void VelkReportingTextFree(char* text) { std::free(text); }
