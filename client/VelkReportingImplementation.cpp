#include "client/VelkReportingImplementation.h"

#include "client/DaemonConnection.h"
#include "client/LogTexts.h"
#include "ipc/MethodTable.h"
#include "ipc/SessionProxies.h"
#include "ipc/Vocabulary.h"
#include "platform/Log.h"

namespace velk {

namespace {

/// How soon a connection that was full is tried again.
constexpr Duration kFullConnectionPause = std::chrono::milliseconds(2);
/// While events come more often than this, they are taken together: each wake-up of the library's thread costs more
/// than the sending of several events. No event waits longer for it.
constexpr Duration kLinger = std::chrono::milliseconds(1);

}  // namespace

VelkReportingImplementation::VelkReportingImplementation(ClientRuntime& runtime, SessionDescription description,
                                                         VelkReportingAggregationBlock aggregationBlock)
    : _runtime(runtime),
      _queue(runtime.loop().makeLoopQueue("com.tavrin.VelkReporting.main")),
      _reporting(std::make_shared<ReportingQueue>(_queue)),
      _orderedCallbacks(runtime.makeCallbackQueue("com.tavrin.VelkReporting.callbacks")),
      _lists(std::make_shared<CurrentEventLists>()),
      _aggregation(std::make_shared<VelkReportingAggregationObject>(std::move(aggregationBlock), _orderedCallbacks)),
      _mayLinger(booleanValue(description.sessionInfo.find(kVelkReportingSessionInfoBatchEvent))),
      _roomForMessages(std::make_shared<CallbackRoom>(texts::kDelegateIsSlow, texts::kDelegateWasSlow)),
      _roomForTexts(std::make_shared<CallbackRoom>(texts::kLoggingBlockIsSlow, texts::kLoggingBlockWasSlow)) {
  description.hasAggregationBlock = _aggregation->hasAggregationBlock();
  _link = std::make_shared<SessionLink>(runtime, _queue, std::move(description), _aggregation, _lists);
}

void VelkReportingImplementation::open(std::weak_ptr<VelkReporting> client) {
  _client = std::move(client);
  _periodicTasks = std::make_shared<PeriodicTasks>(
      _reporting, _runtime.loop(), [&runtime = _runtime](Task task) { runtime.runPeriodicTask(std::move(task)); },
      [weak = weak_from_this()](const PropertyDictionary& message) {
        const auto self = weak.lock();
        const std::uint16_t category = uint16Value(message.find(kVelkReportingMessageParametersCategory));
        if (self && category != 0) self->sendMessage(category, message);
      });
  _link->open([self = weak_from_this()](SessionLink::UnsentEvents unsent) {
    if (const auto strong = self.lock()) strong->connectionWasLost(std::move(unsent));
  });
  _runtime.addClient(weak_from_this());
}

VelkReportingImplementation::Sent VelkReportingImplementation::sendMessage(std::uint16_t category,
                                                                           const PropertyDictionary& message) {
  if (isForeign()) return Sent::notFromForkedChild;
  if (_mayHaveDelegate.load(std::memory_order_relaxed)) notifyMessageWasSent(message);
  const auto lists = _lists->get();
  if (!lists->isWhitelisted(category) || lists->isBlacklisted(category)) {
    log::standard(texts::kEventIsFiltered, category);
    return Sent::filtered;
  }
  const EventEstimate estimate = estimateEvent(message);
  if (const char* reason = estimate.isSurelySendable ? nullptr : SessionInterfaceProxy::reasonNotToSend(message)) {
    log::error(texts::kEventIsNotSendable, category, reason);
    return Sent::notSendable;
  }
  return enqueueEvent(message, estimate.size) ? Sent::taken : Sent::outboxFull;
}

bool VelkReportingImplementation::enqueueEvent(const PropertyDictionary& message, std::size_t size) {
  if (!_outbox.reserve(size)) return false;
  IncomingEvents::Ticket ticket = 0;
  try {
    ticket = _incoming.add(message, size);
  } catch (...) {
    _outbox.release(size);
    throw;
  }
  try {
    if (ticket != 0) _reporting->async([self = shared_from_this(), ticket] { self->takeIncoming(ticket); });
  } catch (...) {
    _incoming.takerIsNotComing(ticket);  // the event is taken all the same: the next one's taker will find it
  }
  return true;
}

void VelkReportingImplementation::takeIncoming(IncomingEvents::Ticket ticket) {
  const SteadyTime now = _runtime.loop().clock().steadyTime();
  const bool lingers = _mayLinger && now - _lastTaken < 2 * kLinger;
  auto events = _incoming.take(ticket, lingers);
  if (events.empty()) return;
  _lastTaken = now;
  if (lingers) _reporting->asyncAfter(kLinger, [self = shared_from_this(), ticket] { self->takeIncoming(ticket); });
  sendEvents(std::move(events));
}

void VelkReportingImplementation::sendEvents(std::vector<IncomingEvents::Event> events) {
  for (auto& event : events) {
    if (_outbox.held.empty() && trySending(event.message)) {
      _outbox.release(event.size);
      continue;
    }
    _outbox.held.push_back({std::move(event.message), event.size, nullptr});
    retryLater(std::max(_link->pauseLeft(), kFullConnectionPause));
  }
  if (!events.empty() && _outbox.held.empty()) reportOverflow();
}

bool VelkReportingImplementation::trySending(const PropertyDictionary& message) {
  const auto connection = _link->connect();
  if (!connection) return false;
  // Nobody looks at the reply unless it is logged, and asking for none saves both ends most of its cost.
  const bool wantsReply = loggingBlock() != nullptr || log::isEnabled(log::Level::standard);
  ReplyHandler handler;
  if (wantsReply) {
    handler = [self = weak_from_this()](Result<PropertyArray> reply) {
      if (!reply) return log::standard(texts::kSendMessageProxyFailure, reply.error());
      const std::string* text = reply->empty() ? nullptr : (*reply)[0].string();
      log::standard(texts::kSentMessage, text);
      if (const auto strong = self.lock(); strong && text != nullptr) strong->logText(*text);
    };
  }
  const auto encode = [&message](CborWriter& writer) { writer.value(message); };
  const auto method = static_cast<std::uint32_t>(Method::sendMessageWithDictionary);
  const auto sent =
      wantsReply ? connection->call(method, 1, encode, std::move(handler)) : connection->send(method, 1, encode);
  if (sent) return true;
  const auto code = static_cast<ConnectionError>(sent.error().code);
  if (code == ConnectionError::outboxFull || code == ConnectionError::ended) return false;
  log::error(texts::kSendMessageProxyFailure, sent.error());  // it can never be sent
  return true;
}

void VelkReportingImplementation::sendWhatFits() {
  auto& held = _outbox.held;
  while (!held.empty()) {
    auto& first = held.front();
    if (first.call) {
      const auto connection = _link->connect();
      if (connection && !connection->hasRoomForAnyCall()) return;
      first.call();
    } else if (trySending(first.message)) {
      _outbox.release(first.size);
    } else {
      return;
    }
    held.pop_front();
  }
}

void VelkReportingImplementation::runBehindHeldEvents(Task call) {
  auto& held = _outbox.held;
  if (!held.empty()) sendHeldEvents();
  // With nobody there it fails at once, as it would without events; and what waits is bounded.
  const auto connection = _link->connect();
  if (!connection || held.size() >= EventOutbox::kMaximumEvents) return call();
  if (held.empty() && connection->hasRoomForAnyCall()) return call();
  held.push_back({{}, 0, std::move(call)});
  retryLater(kFullConnectionPause);
}

void VelkReportingImplementation::sendHeldEvents() {
  sendWhatFits();
  if (_outbox.held.empty()) return reportOverflow();
  retryLater(std::max(_link->pauseLeft(), kFullConnectionPause));
}

void VelkReportingImplementation::retryLater(Duration delay) {
  if (std::exchange(_retryIsPending, true)) return;
  _queue->asyncAfter(delay, [self = weak_from_this()] {
    const auto strong = self.lock();
    if (!strong) return;
    strong->_retryIsPending = false;
    if (!strong->_isFinished) strong->sendHeldEvents();
  });
}

void VelkReportingImplementation::reportOverflow() {
  const std::size_t lost = _outbox.takeOverflowCount();
  if (lost != 0)
    log::error("sendMessageWithDictionary: %u events were refused while the daemon was away or slow", lost);
}

/// What had not left goes to the front again, the oldest first.
void VelkReportingImplementation::connectionWasLost(SessionLink::UnsentEvents unsent) {
  for (auto event = unsent.rbegin(); event != unsent.rend(); ++event) {
    const std::size_t size = estimatedSize(*event);
    if (_outbox.reserve(size)) _outbox.held.push_front({std::move(*event), size, nullptr});
  }
  if (!_outbox.held.empty()) retryLater(kFullConnectionPause);
}

void VelkReportingImplementation::finishSession() {
  if (_link->current()) return finishSessionNow();
  // The first connection may be about to be made.
  _queue->async([self = shared_from_this()] { self->finishSessionNow(); });
}

void VelkReportingImplementation::finishSessionNow() {
  const auto connection = _link->current();
  if (!connection) return log::standard(texts::kFinishSessionProxyFailure, "no daemon answers");
  SessionInterfaceProxy(connection, loggingHandler(texts::kFinishSessionProxyFailure)).finishSessionGracefully();
}

void VelkReportingImplementation::setMessageSentDelegate(std::weak_ptr<VelkReportingMessageSentDelegate> delegate,
                                                         std::uintptr_t identity) {
  log::standard(texts::kDelegateIsSet, identity);
  Guard guard(_lock);
  _weakMessageSentDelegate.swap(delegate);
}

std::weak_ptr<VelkReportingMessageSentDelegate> VelkReportingImplementation::weakMessageSentDelegate() const {
  Guard guard(_lock);
  return _weakMessageSentDelegate;
}

void VelkReportingImplementation::unregisterPeriodicTask(std::uint32_t module) {
  _periodicTasks->unregisterModule(module, !_runtime.loop().isCurrent());
}

void VelkReportingImplementation::notifyMessageWasSent(const PropertyDictionary& message) {
  auto place = _roomForMessages->reserve(estimatedSize(message));
  if (!place) return;
  onQueue([message = message, place = std::move(place)](VelkReportingImplementation& self) mutable {
    auto weakDelegate = self.weakMessageSentDelegate();
    if (weakDelegate.expired()) return;
    log::standard(texts::kNotifyCalled);
    self._orderedCallbacks->async([weakClient = self._client, message = std::move(message),
                                   weakDelegate = std::move(weakDelegate), place = std::move(place)] {
      if (const auto delegate = weakDelegate.lock()) {
        delegate->didSendMessageForReportingClient(weakClient.lock(), message);
      }
    });
  });
}

void VelkReportingImplementation::logText(const std::string& text) {
  auto block = loggingBlock();
  if (!block) return;
  auto place = _roomForTexts->reserve(text.size());
  if (!place) return;
  _orderedCallbacks->async([block = std::move(block), text, place = std::move(place)] { (*block)(text); });
}

void VelkReportingImplementation::setMessageLoggingBlock(LoggingBlock block) {
  log::standard(texts::kLoggingBlockSet);
  setLoggingBlock(std::move(block));
}

void VelkReportingImplementation::setLoggingBlock(LoggingBlock block) {
  Guard guard(_lock);
  _loggingBlock.swap(block);
}

VelkReportingImplementation::LoggingBlock VelkReportingImplementation::loggingBlock() const {
  Guard guard(_lock);
  return _loggingBlock;
}

}  // namespace velk
