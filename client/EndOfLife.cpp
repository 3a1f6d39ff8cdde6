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
/// How soon a connection is tried again that took nothing although it had room.
constexpr Duration kStuckPause = std::chrono::milliseconds(10);

}  // namespace

void VelkReporting::setEndOfLifeBound(std::chrono::milliseconds bound) {
  if (_implementation->isForeign()) return;
  _implementation->setEndOfLifeBound(std::clamp(bound, std::chrono::milliseconds::zero(), kLongestBound));
}

void VelkReportingImplementation::endOfLife(const void* client) {
  const SteadyTime deadline = _runtime.deadlineFor(_endOfLifeBound.load(std::memory_order_relaxed));
  const bool isOnLoop = _runtime.loop().isCurrent();
  const bool mayWait = !isOnLoop && !_periodicTasks->isInCallback();  // a tick does not end before its callbacks do
  _periodicTasks->withdrawAll(!isOnLoop);
  if (mayWait) return leave(client, deadline);
  _runtime.runCallback([self = shared_from_this(), client, deadline] { self->leave(client, deadline); });
  // Where no such thread is to be had, all of them being the user's just now, the session ends all the same.
  _reporting->asyncAfter(deadline - _runtime.loop().clock().steadyTime(), [weak = weak_from_this(), client, deadline] {
    if (const auto self = weak.lock()) self->finishAndClose(client, deadline);
  });
}

void VelkReportingImplementation::leave(const void* client, SteadyTime deadline) {
  const Clock& clock = _runtime.loop().clock();
  retryAtOnce();
  sendHeldEventsWithin(deadline, Turn::behindTicks);
  auto done = std::make_shared<Semaphore>();
  onQueue([client, done, deadline](VelkReportingImplementation& self) {
    self.finishAndClose(client, deadline);
    done->signal();
  });
  if (!done->waitFor(deadline - clock.steadyTime())) return;
  waitForConnection(deadline);
}

void VelkReportingImplementation::waitForConnection(SteadyTime deadline) const {
  const auto connection = _link->current();
  const Duration left = deadline - _runtime.loop().clock().steadyTime();
  if (connection && left > Duration::zero()) static_cast<void>(connection->waitUntilSent(left));
}

/// Off the queue: makes room in the connection, again and again, for what did not fit into it, and waits for a daemon
/// that was there a moment ago.
std::size_t VelkReportingImplementation::sendHeldEventsWithin(SteadyTime deadline, Turn turn) {
  const Clock& clock = _runtime.loop().clock();
  std::size_t events = 0;
  std::size_t heldBefore = 0;
  for (Duration pause{};;) {
    struct Look {
      Semaphore over;
      std::size_t events = 0;
      std::size_t held = 0;
      std::shared_ptr<Connection> connection;
      std::optional<Duration> retriesAfter;
    };
    auto look = std::make_shared<Look>();
    const auto work = [self = shared_from_this(), look] {
      self->sendEvents(self->_incoming.takeAll());
      self->sendHeldEvents();
      look->events = self->heldEvents();
      look->held = self->_outbox.held.size();
      look->connection = self->_link->current();
      if (look->connection || self->_link->mayComeBack()) look->retriesAfter = self->_link->pauseLeft();
      look->over.signal();
    };
    turn == Turn::behindTicks ? _reporting->asyncAfter(pause, work) : _queue->asyncAfter(pause, work);
    if (!look->over.waitFor(deadline - clock.steadyTime())) return events;
    events = look->events;
    if (look->held == 0 || !look->retriesAfter) return events;
    if (look->connection && !look->connection->waitUntilSent(deadline - clock.steadyTime())) return events;
    // One that takes nothing more may not know yet that it has ended.
    const bool isStuck = std::exchange(heldBefore, look->held) == look->held;
    pause = std::max(*look->retriesAfter, isStuck ? kStuckPause : Duration::zero());
  }
}

void VelkReportingImplementation::finishAndClose(const void* client, SteadyTime deadline) {
  if (std::exchange(_isFinished, true)) return;
  _periodicTasks->end();
  sendEvents(_incoming.takeAll());  // what a tick reported that was not over yet when the last reference went
  sendWhatFits();
  const std::size_t lost = heldEvents();
  for (auto& waiting : _outbox.held) {
    if (waiting.call) waiting.call();  // its callback learns that it failed
  }
  _outbox.held.clear();
  if (lost != 0) log::error(texts::kEventsAreLost, lost);
  reportOverflow();
  log::standard(texts::kAboutToDealloc, client);
  finishSessionNow();
  _aggregation->releaseAggregationBlock();
  setLoggingBlock(nullptr);
  _link->close(deadline - _runtime.loop().clock().steadyTime());
}

void VelkReportingImplementation::retryAtOnce() {
  _queue->async([self = shared_from_this()] { self->_link->retryAtOnce(); });
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
  retryAtOnce();
  // What is queued has its turn first, while there is hope that a tick ends: a process that a module's callback ends
  // has none. Nothing is taken along to where it would be stuck.
  if (!_periodicTasks->isInCallback()) {
    auto turn = std::make_shared<Semaphore>();
    _reporting->async([turn] { turn->signal(); });
    static_cast<void>(turn->waitFor(begun + 3 * bound / 4 - clock.steadyTime()));
  }
  const std::size_t lost = sendHeldEventsWithin(deadline, Turn::pastTicks);
  if (lost != 0) log::error("aboutToExit: %u events are lost: no daemon takes them", lost);
  reportOverflow();
  waitForConnection(deadline);
}

}  // namespace velk
