#include "backends/EventBatch.h"

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

}  // namespace

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
  _bytes += size;
  _events.push_back(std::move(event));
  return Appended::kept;
}

std::vector<PropertyDictionary> EventBatch::take() {
  _exists = false;
  _refused = false;
  _memory->giveBack(std::exchange(_bytes, 0));
  return std::exchange(_events, {});
}

void EventBatch::setSessionID(const std::string& sessionID) {
  const std::uint64_t before = _bytes;
  for (auto& event : _events) {
    _bytes -= memoryEstimate(event);
    event.set("_sessionID", sessionID);
    _bytes += memoryEstimate(event);
  }
  // What has been kept stays, also above the bound. A difference below zero takes: unsigned numbers wrap.
  _memory->giveBack(before - _bytes);
}

}  // namespace velk
