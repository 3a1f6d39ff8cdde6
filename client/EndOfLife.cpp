// The last moments of a client: its last release, and the end of a process that never released it. Both wait for what
// was queued to leave, within a bound that the client sets, and for nothing else.

#include <algorithm>

#include "client/LogTexts.h"
#include "client/VelkReporting.h"
#include "client/VelkReportingImplementation.h"
#include "platform/Log.h"
#include "platform/Semaphore.h"

namespace velk {

namespace {

constexpr std::chrono::milliseconds kLongestBound = std::chrono::hours(1);

}  // namespace

void VelkReporting::setEndOfLifeBound(std::chrono::milliseconds bound) {
  if (_implementation->isForeign()) return;
  _implementation->setEndOfLifeBound(std::clamp(bound, std::chrono::milliseconds::zero(), kLongestBound));
}

void VelkReportingImplementation::endOfLife(const void* client) {
  const Clock& clock = _runtime.loop().clock();
  const SteadyTime deadline = _runtime.deadlineFor(_endOfLifeBound.load(std::memory_order_relaxed));
  const bool isOnLoop = _runtime.loop().isCurrent();
  const bool mayWait = !isOnLoop && !_periodicTasks->isInCallback();  // a tick does not end before its callbacks do
  _periodicTasks->withdrawAll(!isOnLoop);
  if (mayWait) sendHeldEventsWithin(deadline, Turn::behindTicks);
  auto done = std::make_shared<Semaphore>();
  onQueue([client, done](VelkReportingImplementation& self) {
    self.finishAndClose(client);
    done->signal();
  });
  if (!mayWait || !done->waitFor(deadline - clock.steadyTime())) return;
  const auto connection = _link->current();
  const Duration left = deadline - clock.steadyTime();
  if (connection && left > Duration::zero()) static_cast<void>(connection->waitUntilSent(left));
}

/// Off the queue: makes room in the connection, again and again, for what did not fit into it.
std::size_t VelkReportingImplementation::sendHeldEventsWithin(SteadyTime deadline, Turn turn) {
  const Clock& clock = _runtime.loop().clock();
  for (;;) {
    struct Look {
      Semaphore over;
      std::atomic<std::size_t> events{0};
      std::atomic<bool> isLeft{false};
    };
    auto look = std::make_shared<Look>();
    const auto send = [look](VelkReportingImplementation& self) {
      self.sendHeldEvents();
      look->events = self.heldEvents();
      look->isLeft = !self._outbox.held.empty();
      look->over.signal();
    };
    if (turn == Turn::behindTicks) {
      onQueue(send);
    } else {
      _queue->async([self = shared_from_this(), send] {
        self->sendEvents(self->_incoming.takeForWork());
        send(*self);
      });
    }
    if (!look->over.waitFor(deadline - clock.steadyTime()) || !look->isLeft) return look->events;
    const auto connection = _link->current();
    if (!connection || connection->hasEnded()) return look->events;
    if (!connection->waitUntilSent(deadline - clock.steadyTime())) return look->events;
  }
}

void VelkReportingImplementation::finishAndClose(const void* client) {
  _isFinished = true;
  _periodicTasks->end();
  sendEvents(_incoming.takeForWork());  // what a tick reported that was not over yet when the last reference went
  sendWhatFits();
  const std::size_t lost = heldEvents();
  for (auto& waiting : _outbox.held) {
    if (waiting.call) waiting.call();  // its callback learns that it failed
  }
  _outbox.held.clear();
  if (lost != 0) log::error("aboutToDealloc: %u events are lost: no daemon takes them", lost);
  reportOverflow();
  log::standard(texts::kAboutToDealloc, client);
  finishSession();
  _aggregation->releaseAggregationBlock();
  replaceLoggingBlock(nullptr);
  _link->close();
}

std::size_t VelkReportingImplementation::heldEvents() const {
  const auto& held = _outbox.held;
  return static_cast<std::size_t>(
      std::count_if(held.begin(), held.end(), [](const auto& waiting) { return !waiting.call; }));
}

void VelkReportingImplementation::sendBeforeExit(SteadyTime begun) {
  if (isForeign()) return;
  const Clock& clock = _runtime.loop().clock();
  const Duration bound = _endOfLifeBound.load(std::memory_order_relaxed);
  const SteadyTime deadline = begun + bound;
  // What is queued has its turn first, while there is hope that a tick ends: a process that a module's callback ends
  // has none. Nothing is taken along to where it would be stuck.
  if (!_periodicTasks->isInCallback()) {
    auto turn = std::make_shared<Semaphore>();
    _reporting->async([turn] { turn->signal(); });
    static_cast<void>(turn->waitFor(begun + 3 * bound / 4 - clock.steadyTime()));
  }
  const std::size_t lost = sendHeldEventsWithin(deadline, Turn::pastTicks);
  if (lost != 0) log::error("aboutToExit: %u events are lost: no daemon takes them", lost);
  const auto connection = _link->current();
  const Duration left = deadline - clock.steadyTime();
  if (connection && left > Duration::zero()) static_cast<void>(connection->waitUntilSent(left));
}

}  // namespace velk
