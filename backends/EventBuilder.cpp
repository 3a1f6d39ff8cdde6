#include "backends/EventBuilder.h"

#include <algorithm>
#include <cmath>
#include <limits>
#include <string_view>
#include <utility>
#include <vector>

#include "backends/LogTexts.h"
#include "device/DeviceEnvironment.h"
#include "platform/Log.h"

namespace velk {

namespace {

constexpr std::size_t kFixedFields = 16;
constexpr int kInternalBuild = 3;
constexpr int kOtherBuild = 2;

/// Client types whose events carry the session's number, on internal builds, in place of its identifier.
bool carriesSessionNumber(const EventAttributes& attributes) noexcept {
  return attributes.isInternal && (attributes.compType == 7 || attributes.compType == 11 || attributes.compType == 13);
}

/// Sets fields over a payload. Payloads seldom hold any of the fields' names: then nothing needs looking up.
class FieldSetter {
 public:
  FieldSetter(const PropertyDictionary& payload, std::size_t room) {
    _event.reserve(room);
    for (const auto& entry : payload) {
      _event.appendUnique(entry.key, entry.value);
      _collides = _collides || entry.key.starts_with('_') || entry.key == "eventTime";
    }
  }

  void set(std::string_view key, PropertyValue value) {
    if (_collides) {
      _event.set(key, std::move(value));
    } else {
      _event.appendUnique(std::string(key), std::move(value));
    }
  }
  void setIfAny(std::string_view key, const std::optional<std::string>& text) {
    if (text) set(key, PropertyValue(*text));
  }

  [[nodiscard]] PropertyDictionary take() { return std::move(_event); }

 private:
  PropertyDictionary _event;
  bool _collides = false;
};

PropertyValue sessionIdentifier(EventAttributes& attributes) {
  if (carriesSessionNumber(attributes)) return PropertyValue(attributes.sessionID);
  return attributes.combinedSessionID ? PropertyValue(std::move(*attributes.combinedSessionID)) : PropertyValue();
}

enum class Representation { asItIs, seconds, none };

/// Whether JSON can hold a value below a container; dates have no form there.
bool isPlain(const PropertyValue& value) {
  switch (value.type()) {
    case PropertyValue::Type::date:
    case PropertyValue::Type::data:
      return false;
    case PropertyValue::Type::real:
      return std::isfinite(*value.real());
    case PropertyValue::Type::array:
      return std::all_of(value.array()->begin(), value.array()->end(), isPlain);
    case PropertyValue::Type::dictionary:
      return std::all_of(value.dictionary()->begin(), value.dictionary()->end(),
                         [](const PropertyDictionary::Entry& entry) { return isPlain(entry.value); });
    default:
      return true;
  }
}

Representation representationOf(const PropertyValue& value, bool allowNestedData) {
  switch (value.type()) {
    case PropertyValue::Type::date:
      return Representation::seconds;
    case PropertyValue::Type::real:
      return std::isfinite(*value.real()) ? Representation::asItIs : Representation::none;
    case PropertyValue::Type::array:
    case PropertyValue::Type::dictionary:
      return allowNestedData && isPlain(value) ? Representation::asItIs : Representation::none;
    case PropertyValue::Type::null:
    case PropertyValue::Type::data:
      return Representation::none;
    default:
      return Representation::asItIs;
  }
}

void replace(PropertyDictionary& event, std::string_view key) {
  const PropertyValue* value = event.find(key);
  if (const Date* date = value->date()) {
    event.set(key, finiteOrMinusOne(date->secondsSince1970));
    return;
  }
  log::error(backend_texts::kUnableToSerialize, key, *value);
  event.remove(key);
}

}  // namespace

std::int64_t roundedStart(double startTimestamp, bool isInternal) noexcept {
  constexpr double kBound = 9e15;  // beyond it doubles are no whole seconds any more, and no times
  const auto seconds = static_cast<std::int64_t>(std::clamp(finiteOrMinusOne(startTimestamp), -kBound, kBound));
  return isInternal ? seconds : seconds / 60 * 60;
}

PropertyDictionary newEventDict(const PropertyDictionary& payload, EventAttributes attributes, const EventStamp& stamp,
                                std::size_t furtherEntries) {
  const std::int64_t start = roundedStart(attributes.startTimestamp, attributes.isInternal);
  const double time =
      finiteOrMinusOne(secondsFromTimeValue(stamp.timestamp) - attributes.startTimestamp + static_cast<double>(start));
  FieldSetter fields(payload, payload.size() + kFixedFields + furtherEntries);
  fields.set("_startTS", start);
  fields.set("_sender", componentShortCode(attributes.compType));
  fields.set("_clientVersion", attributes.clientVersion);
  if (auto identifier = sessionIdentifier(attributes); !identifier.isNull()) {
    fields.set("_sessionID", std::move(identifier));
  }
  fields.set("_eventNumber", stamp.eventID);
  fields.set("_method", stamp.method);
  fields.set("_status", stamp.respCode);
  fields.set("_clientTS", time);
  fields.set("eventTime", time);
  fields.setIfAny("_productFamily", attributes.productFamily);
  fields.setIfAny("_productModel", attributes.hardwareType);
  fields.setIfAny("_osVersion", attributes.productVersion);
  fields.setIfAny("_build", attributes.buildVersion);
  fields.set("_internal", attributes.isInternal ? kInternalBuild : kOtherBuild);
  fields.set("_reportVers", attributes.reportVersion);
  fields.set("_timezoneOffset", attributes.timeZoneOffset);
  return fields.take();
}

void makeEventRepresentableInJson(PropertyDictionary& event, bool allowNestedData) {
  std::vector<std::string> others;
  for (const auto& entry : event) {
    if (representationOf(entry.value, allowNestedData) != Representation::asItIs) others.push_back(entry.key);
  }
  for (const auto& key : others) replace(event, key);
}

}  // namespace velk
