// The bounded place in which a client's events wait: for the reporting queue, for room in the connection, for a daemon
// that is not there yet. Decides at once, on the sender's thread, whether one more fits.
#pragma once

#include <atomic>
#include <cstddef>
#include <deque>
#include <memory>

#include "foundation/Function.h"
#include "foundation/PropertyValue.h"

namespace velk {

/// What one event will cost while it waits, in bytes; cheap, and never below the truth by much. Walks no further than
/// to what the outbox could not hold in any case.
struct EventEstimate {
  std::size_t size = 0;
  /// Plain and small enough to be sent for sure; else only `SessionInterfaceProxy::reasonNotToSend` knows.
  bool isSurelySendable = true;
};
[[nodiscard]] EventEstimate estimateEvent(const PropertyDictionary& message);
[[nodiscard]] inline std::size_t estimatedSize(const PropertyDictionary& message) {
  return estimateEvent(message).size;
}

/// Room for so many events and bytes, taken and given back by whoever hands events on. Any thread.
class EventRoom {
 public:
  /// Events and bytes that may wait at once: enough for a daemon's restart at a lively pace, and little enough for
  /// the smallest host.
  static constexpr std::size_t kMaximumEvents = 16'384;
  static constexpr std::size_t kMaximumBytes = 8 * 1024 * 1024;

  /// Takes room for an event of `size` bytes. False, and counted as overflow, when there is none.
  [[nodiscard]] bool reserve(std::size_t size) noexcept;
  /// Gives the room of an event back.
  void release(std::size_t size) noexcept;

  /// The number of events refused since this was last asked.
  [[nodiscard]] std::size_t takeOverflowCount() noexcept { return _overflow.exchange(0, std::memory_order_relaxed); }

 private:
  std::atomic<std::size_t> _events{0};
  std::atomic<std::size_t> _bytes{0};
  std::atomic<std::size_t> _overflow{0};
};

class EventOutbox : public EventRoom {
 public:
  /// An event, or a call that was made after events that wait and must not overtake them.
  struct Waiting {
    PropertyDictionary message;
    std::size_t size = 0;
    UniqueFunction<void()> call;
  };
  /// What has passed the reporting queue and waits for room in a connection, oldest first. On the reporting queue.
  std::deque<Waiting> held;
};

}  // namespace velk
