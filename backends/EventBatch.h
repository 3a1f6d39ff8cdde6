// The events that a backend holds back, and the counters that say when they have waited long enough.
// Guarded by the backend's state queue: every method runs on it, except where a method says otherwise.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

#include "backends/BatchMemory.h"
#include "foundation/PropertyValue.h"

namespace velk {

/// Events in little memory. Most events of a session have the same keys and differ in few values: of each such kind the
/// first event is kept whole, of the others only what differs. Not synchronised.
class CompactEvents {
 public:
  void append(PropertyDictionary event);
  /// As it is.
  void appendWhole(PropertyDictionary event);
  /// The events, as they were appended; none are left.
  [[nodiscard]] std::vector<PropertyDictionary> take();
  [[nodiscard]] std::size_t count() const noexcept { return _kinds.size(); }

 private:
  [[nodiscard]] std::size_t kindOf(const PropertyDictionary& event) const;
  void appendDifferences(const PropertyDictionary& first, const PropertyDictionary& event);
  void appendValue(const PropertyValue& value);
  void appendNumber(std::uint64_t number);
  void appendBytes(const void* bytes, std::size_t count);

  /// The first event of each kind.
  std::vector<PropertyDictionary> _firsts;
  /// Of the event that was appended last: the next one often is of the same.
  std::size_t _lastKind = 0;
  /// Of each event.
  std::vector<std::uint8_t> _kinds;
  /// Of each event that is not kept whole: values that differ, each behind its distance from the one before; then 0.
  std::vector<std::uint8_t> _differences;
  /// Arrays and dictionaries among them, in their order.
  std::vector<PropertyValue> _containers;
  /// Those that are of no kind.
  std::vector<PropertyDictionary> _whole;
};

class EventBatch {
 public:
  /// So many methods are counted; further ones never reach a threshold by themselves.
  static constexpr std::size_t kMaximumCounters = 65'536;

  /// While the batches of the process hold no more than this (estimated), their events are kept as dictionaries, which
  /// is quickest; beyond it in little memory. So a few busy sessions pay no time, and many idle ones little memory.
  static constexpr std::uint64_t kMaximumBytesAsDictionaries = 1024U * 1024;

  enum class Appended : std::uint8_t { kept, full, stillFull };

  explicit EventBatch(std::shared_ptr<BatchMemory> memory) : _memory(std::move(memory)) {}
  ~EventBatch() { _memory->giveBack(_bytes); }
  EventBatch(const EventBatch&) = delete;
  EventBatch& operator=(const EventBatch&) = delete;

  /// From the first event, kept or not, to the next `take` or `discard`.
  [[nodiscard]] bool exists() const noexcept { return _exists; }
  void create() noexcept { _exists = true; }

  /// Counts an event of this method. True when more than `threshold` had been counted: the count then begins anew.
  [[nodiscard]] bool countReaches(const PropertyValue* method, std::int32_t threshold);
  void clearCounters() { _counters.clear(); }

  /// Refuses an event for which the batches of the process have no room (estimated), until this one is emptied or
  /// others are. An ordinary batch holds some kilobytes; only one that can neither post nor discard comes here.
  /// `stillFull` when this is not the first event that is refused.
  Appended append(PropertyDictionary event);
  /// The events; the batch no longer exists. The counters stay.
  [[nodiscard]] std::vector<PropertyDictionary> take();
  void discard() { static_cast<void>(take()); }

  /// Sets "_sessionID" in every event.
  void setSessionID(const std::string& sessionID);
  /// Of all events, without looking at any.
  [[nodiscard]] std::uint64_t estimatedSize() const noexcept { return _bytes; }
  [[nodiscard]] std::size_t count() const noexcept { return _events.count(); }

 private:
  void keep(PropertyDictionary event, std::uint64_t size);

  CompactEvents _events;
  // By the method's number; a method that is not a whole number is counted under its text's hash.
  std::unordered_map<std::int64_t, std::int64_t> _counters;
  const std::shared_ptr<BatchMemory> _memory;
  std::uint64_t _bytes = 0;
  bool _exists = false;
  bool _refused = false;
};

}  // namespace velk
