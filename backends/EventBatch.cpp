#include "backends/EventBatch.h"

#include <algorithm>
#include <cstring>
#include <functional>
#include <utility>

#include "backends/MemoryEstimate.h"
#include "foundation/Format.h"

namespace velk {

namespace {

std::int64_t counterKey(const PropertyValue* method) {
  if (method == nullptr) return 0;
  if (const auto* number = method->integer()) return *number;
  return static_cast<std::int64_t>(std::hash<std::string>{}(description(method)));
}

/// Events of further kinds are kept whole, and so are larger ones.
constexpr std::size_t kMaximumKinds = 16;
constexpr std::uint8_t kOfNoKind = 255;
constexpr std::uint64_t kMaximumCompactBytes = 16 * 1024;

/// Stricter than `==`: zeros have signs, and containers an order.
bool isSame(const PropertyValue& left, const PropertyValue& right) {
  if (left.type() != right.type()) return false;
  switch (left.type()) {
    case PropertyValue::Type::real:
      return std::memcmp(left.real(), right.real(), sizeof(double)) == 0;
    case PropertyValue::Type::date:
      return std::memcmp(left.date(), right.date(), sizeof(Date)) == 0;
    case PropertyValue::Type::array:
      return false;
    case PropertyValue::Type::dictionary:
      return left.dictionary()->sharesStorageWith(*right.dictionary());
    default:
      return left == right;
  }
}

/// Reads what CompactEvents wrote.
class DifferencesReader {
 public:
  DifferencesReader(const std::vector<std::uint8_t>& bytes, std::vector<PropertyValue>& containers)
      : _next(bytes.data()), _container(containers.begin()) {}

  /// Into a copy of the first event of its kind.
  void readInto(PropertyDictionary& event, const PropertyDictionary& first) {
    const auto* entry = first.begin() - 1;
    while (const auto distance = number()) {
      entry += distance;
      *event.findMutable(entry->key) = value();
    }
  }

 private:
  std::uint64_t number() {
    std::uint64_t result = 0;
    for (unsigned shift = 0;; shift += 7) {
      const std::uint8_t byte = *_next++;
      result |= static_cast<std::uint64_t>(byte & 0x7f) << shift;
      if ((byte & 0x80) == 0) return result;
    }
  }
  template <class Simple>
  Simple simple() {
    Simple result;
    std::memcpy(&result, _next, sizeof result);
    _next += sizeof result;
    return result;
  }
  const std::uint8_t* skip(std::size_t count) { return std::exchange(_next, _next + count); }

  PropertyValue value() {
    switch (static_cast<PropertyValue::Type>(*_next++)) {
      case PropertyValue::Type::null:
        break;
      case PropertyValue::Type::boolean:
        return simple<bool>();
      case PropertyValue::Type::integer:
        return simple<std::int64_t>();
      case PropertyValue::Type::unsignedInteger:
        return simple<std::uint64_t>();
      case PropertyValue::Type::real:
        return simple<double>();
      case PropertyValue::Type::date:
        return simple<Date>();
      case PropertyValue::Type::string: {
        const std::size_t size = number();
        return std::string(reinterpret_cast<const char*>(skip(size)), size);
      }
      case PropertyValue::Type::data: {
        const std::size_t size = number();
        const auto* bytes = skip(size);
        return ByteData(bytes, bytes + size);
      }
      case PropertyValue::Type::array:
      case PropertyValue::Type::dictionary:
        return std::move(*_container++);
    }
    return {};
  }

  const std::uint8_t* _next;
  std::vector<PropertyValue>::iterator _container;
};

}  // namespace

void CompactEvents::appendWhole(PropertyDictionary event) {
  _kinds.push_back(kOfNoKind);
  _whole.push_back(std::move(event));
}

void CompactEvents::append(PropertyDictionary event) {
  const std::size_t kind = event.empty() ? kOfNoKind : kindOf(event);
  if (kind == kOfNoKind) return appendWhole(std::move(event));
  _kinds.push_back(static_cast<std::uint8_t>(kind));
  _lastKind = kind;
  if (kind == _firsts.size()) {
    _firsts.push_back(std::move(event));
    return appendNumber(0);
  }
  appendDifferences(_firsts[kind], event);
}

/// The number of kinds for a new one.
std::size_t CompactEvents::kindOf(const PropertyDictionary& event) const {
  const auto fits = [&](const PropertyDictionary& first) {
    return first.size() == event.size() &&
           std::equal(first.begin(), first.end(), event.begin(),
                      [](const auto& left, const auto& right) { return left.key == right.key; });
  };
  if (_lastKind < _firsts.size() && fits(_firsts[_lastKind])) return _lastKind;
  for (std::size_t kind = 0; kind < _firsts.size(); ++kind) {
    if (kind != _lastKind && fits(_firsts[kind])) return kind;
  }
  return _firsts.size() < kMaximumKinds ? _firsts.size() : kOfNoKind;
}

void CompactEvents::appendDifferences(const PropertyDictionary& first, const PropertyDictionary& event) {
  std::size_t distance = 1;
  const auto* other = first.begin();
  for (const auto& entry : event) {
    if (isSame(entry.value, (other++)->value)) {
      ++distance;
      continue;
    }
    appendNumber(std::exchange(distance, 1));
    appendValue(entry.value);
  }
  appendNumber(0);
}

void CompactEvents::appendValue(const PropertyValue& value) {
  const auto type = value.type();
  _differences.push_back(static_cast<std::uint8_t>(type));
  switch (type) {
    case PropertyValue::Type::null:
      return;
    case PropertyValue::Type::boolean:
      return appendBytes(value.boolean(), sizeof(bool));
    case PropertyValue::Type::integer:
      return appendBytes(value.integer(), sizeof(std::int64_t));
    case PropertyValue::Type::unsignedInteger:
      return appendBytes(value.unsignedInteger(), sizeof(std::uint64_t));
    case PropertyValue::Type::real:
      return appendBytes(value.real(), sizeof(double));
    case PropertyValue::Type::date:
      return appendBytes(value.date(), sizeof(Date));
    case PropertyValue::Type::string:
      appendNumber(value.string()->size());
      return appendBytes(value.string()->data(), value.string()->size());
    case PropertyValue::Type::data:
      appendNumber(value.data()->size());
      return appendBytes(value.data()->data(), value.data()->size());
    case PropertyValue::Type::array:
    case PropertyValue::Type::dictionary:
      return _containers.push_back(value);
  }
}

void CompactEvents::appendNumber(std::uint64_t number) {
  for (; number >= 0x80; number >>= 7) _differences.push_back(static_cast<std::uint8_t>(number | 0x80));
  _differences.push_back(static_cast<std::uint8_t>(number));
}

void CompactEvents::appendBytes(const void* bytes, std::size_t count) {
  const auto* first = static_cast<const std::uint8_t*>(bytes);
  _differences.insert(_differences.end(), first, first + count);
}

std::vector<PropertyDictionary> CompactEvents::take() {
  CompactEvents taken;
  std::swap(*this, taken);
  if (taken._whole.size() == taken._kinds.size()) return std::move(taken._whole);
  std::vector<PropertyDictionary> events;
  events.reserve(taken._kinds.size());
  DifferencesReader reader(taken._differences, taken._containers);
  auto whole = taken._whole.begin();
  for (const auto kind : taken._kinds) {
    if (kind == kOfNoKind) {
      events.push_back(std::move(*whole++));
    } else {
      reader.readInto(events.emplace_back(taken._firsts[kind]), taken._firsts[kind]);
    }
  }
  return events;
}

bool EventBatch::countReaches(const PropertyValue* method, std::int32_t threshold) {
  const std::int64_t key = counterKey(method);
  auto counter = _counters.find(key);
  if (counter == _counters.end()) {
    if (_counters.size() >= kMaximumCounters) return false;
    counter = _counters.emplace(key, 0).first;
  }
  const bool reached = counter->second > threshold;
  counter->second = reached ? 1 : counter->second + 1;
  return reached;
}

EventBatch::Appended EventBatch::append(PropertyDictionary event) {
  _exists = true;
  const std::uint64_t size = memoryEstimate(event);
  if (!_memory->take(size, _bytes)) return std::exchange(_refused, true) ? Appended::stillFull : Appended::full;
  keep(std::move(event), size);
  return Appended::kept;
}

void EventBatch::keep(PropertyDictionary event, std::uint64_t size) {
  _bytes += size;
  if (size > kMaximumCompactBytes || _memory->taken() <= kMaximumBytesAsDictionaries) {
    _events.appendWhole(std::move(event));
  } else {
    _events.append(std::move(event));
  }
}

std::vector<PropertyDictionary> EventBatch::take() {
  _exists = false;
  _refused = false;
  _memory->giveBack(std::exchange(_bytes, 0));
  return _events.take();
}

void EventBatch::setSessionID(const std::string& sessionID) {
  const std::uint64_t before = std::exchange(_bytes, 0);
  for (auto& event : _events.take()) {
    event.set("_sessionID", sessionID);
    const std::uint64_t size = memoryEstimate(event);
    keep(std::move(event), size);
  }
  _memory->replace(before, _bytes);
}

}  // namespace velk
