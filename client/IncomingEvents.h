// Events on their way from the threads that send them to the reporting queue. One task of the queue takes all that
// have come, so that a burst costs one wake-up of the library's thread instead of one for each event.
//
//   add (first one) -> the caller queues a taker -> take -> [lingers: it comes again a moment later] -> nobody
//
// The order of calls holds across both roads: other work that is queued takes along what was handed over before it,
// and a taker that was queued earlier then finds that it is no longer the one who is expected.
#pragma once

#include <cstdint>
#include <utility>
#include <vector>

#include "foundation/PropertyValue.h"
#include "platform/Lock.h"

namespace velk {

/// Any thread. Bounded by the room that its events have reserved in the outbox.
class IncomingEvents {
 public:
  struct Event {
    PropertyDictionary message;
    std::size_t size = 0;
  };
  using Ticket = std::uint64_t;

  /// Adds an event. A ticket other than 0: nobody is on the way, so the caller queues a taker with it.
  [[nodiscard]] Ticket add(PropertyDictionary message, std::size_t size) {
    Guard guard(_lock);
    _events.push_back({std::move(message), size});
    return std::exchange(_takerIsExpected, true) ? 0 : _ticket;
  }

  /// For whoever could not queue the taker with that ticket: the next event needs another one.
  void takerIsNotComing(Ticket ticket) {
    Guard guard(_lock);
    if (ticket == _ticket) _takerIsExpected = false;
  }

  /// For other work: `queue(events)` queues it with everything that was handed over before it. In one step, under the
  /// lock: an event that comes later finds the work queued and goes behind it.
  template <class QueueWork>
  void takeForWork(QueueWork queue) {
    Guard guard(_lock);
    queue(takeAllLocked());
  }

  /// For work that has its turn already.
  [[nodiscard]] std::vector<Event> takeAll() {
    Guard guard(_lock);
    return takeAllLocked();
  }

  /// For the taker with that ticket. With `lingers` it is expected to come again; else, and when it found nothing,
  /// the next event needs another one.
  [[nodiscard]] std::vector<Event> take(Ticket ticket, bool lingers) {
    Guard guard(_lock);
    if (ticket != _ticket) return {};
    if (_events.empty() || !lingers) _takerIsExpected = false;
    return std::exchange(_events, {});
  }

 private:
  [[nodiscard]] std::vector<Event> takeAllLocked() VELK_REQUIRES(_lock) {
    ++_ticket;
    _takerIsExpected = false;
    return std::exchange(_events, {});
  }

  /// Comes before the locks of queues.
  Lock _lock;
  std::vector<Event> _events VELK_GUARDED_BY(_lock);
  /// Grows whenever other work is queued.
  Ticket _ticket VELK_GUARDED_BY(_lock) = 1;
  bool _takerIsExpected VELK_GUARDED_BY(_lock) = false;
};

}  // namespace velk
