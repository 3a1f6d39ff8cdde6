#include "client/EventOutbox.h"

namespace velk {

namespace {

constexpr std::size_t kEntryOverhead = 16;

std::size_t sizeOf(const PropertyValue& value, int depth) {
  if (const auto* text = value.string()) return kEntryOverhead + text->size();
  if (const auto* bytes = value.data()) return kEntryOverhead + bytes->size();
  if (depth == 0) return kEntryOverhead;  // deeper than the wire carries: it will be refused there
  std::size_t size = kEntryOverhead;
  if (const auto* array = value.array()) {
    for (const auto& element : *array) size += sizeOf(element, depth - 1);
  } else if (const auto* dictionary = value.dictionary()) {
    for (const auto& entry : *dictionary) size += entry.key.size() + sizeOf(entry.value, depth - 1);
  }
  return size;
}

}  // namespace

std::size_t estimatedSize(const PropertyDictionary& message) {
  constexpr int kDepth = 32;
  std::size_t size = kEntryOverhead;
  for (const auto& entry : message) size += entry.key.size() + sizeOf(entry.value, kDepth);
  return size;
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
