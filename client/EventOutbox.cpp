#include "client/EventOutbox.h"

#include <cstdint>
#include <cstring>
#include <string_view>

#include "ipc/Limits.h"

namespace velk {

namespace {

constexpr std::size_t kEntryOverhead = 16;
/// Below it there are neither too many values in the event nor too many keys in one dictionary, since each takes the
/// overhead; and it is far from filling a frame.
constexpr std::size_t kSurelySmall = ipc::kMaximumKeysInMap * kEntryOverhead;

bool isAscii(std::string_view text) noexcept {
  constexpr std::uint64_t kHighBits = 0x8080808080808080U;
  std::uint64_t seen = 0;
  for (; text.size() >= sizeof(seen); text.remove_prefix(sizeof(seen))) {
    std::uint64_t chunk = 0;
    std::memcpy(&chunk, text.data(), sizeof(chunk));
    seen |= chunk;
  }
  std::uint64_t rest = 0;
  std::memcpy(&rest, text.data(), text.size());
  return ((seen | rest) & kHighBits) == 0;
}

void add(EventEstimate& estimate, const PropertyValue& value, int depth);

void addText(EventEstimate& estimate, std::string_view text) {
  estimate.size += text.size();
  if (estimate.isSurelySendable) estimate.isSurelySendable = isAscii(text);
}

void add(EventEstimate& estimate, const PropertyArray& array, int depth) {
  for (const auto& element : array) {
    if (estimate.size > EventRoom::kMaximumBytes) return;
    add(estimate, element, depth);
  }
}

void add(EventEstimate& estimate, const PropertyDictionary& dictionary, int depth) {
  for (const auto& entry : dictionary) {
    if (estimate.size > EventRoom::kMaximumBytes) return;
    addText(estimate, entry.key);
    add(estimate, entry.value, depth);
  }
}

/// `depth` counts the containers that may still stand within each other.
void add(EventEstimate& estimate, const PropertyValue& value, int depth) {
  estimate.size += kEntryOverhead;
  if (const auto* text = value.string()) return addText(estimate, *text);
  if (const auto* bytes = value.data()) {
    estimate.size += bytes->size();
    return;
  }
  const auto* array = value.array();
  const auto* dictionary = value.dictionary();
  if (array == nullptr && dictionary == nullptr) return;
  if (depth == 0) {
    estimate.isSurelySendable = false;  // deeper than the wire carries
  } else if (array != nullptr) {
    add(estimate, *array, depth - 1);
  } else {
    add(estimate, *dictionary, depth - 1);
  }
}

}  // namespace

EventEstimate estimateEvent(const PropertyDictionary& message) {
  EventEstimate estimate{kEntryOverhead, true};
  add(estimate, message, ipc::kMaximumDepth - 2);  // within the body's array and the message itself
  if (estimate.size >= kSurelySmall) estimate.isSurelySendable = false;
  return estimate;
}

bool EventRoom::reserve(std::size_t size) noexcept {
  const std::size_t events = _events.fetch_add(1, std::memory_order_relaxed) + 1;
  const std::size_t bytes = _bytes.fetch_add(size, std::memory_order_relaxed) + size;
  if (events <= kMaximumEvents && bytes <= kMaximumBytes) return true;
  release(size);
  _overflow.fetch_add(1, std::memory_order_relaxed);
  return false;
}

void EventRoom::release(std::size_t size) noexcept {
  _events.fetch_sub(1, std::memory_order_relaxed);
  _bytes.fetch_sub(size, std::memory_order_relaxed);
}

}  // namespace velk
