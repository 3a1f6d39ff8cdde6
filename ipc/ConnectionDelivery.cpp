// How a connection's frames are run: on its delivery queue, in order.
#include <cstdint>
#include <limits>

#include "ipc/CborReader.h"
#include "ipc/ConnectionCore.h"
#include "ipc/Limits.h"
#include "ipc/LogTexts.h"
#include "ipc/MethodTable.h"
#include "platform/Log.h"

namespace velk::ipc {
namespace {

/// Refused calls that one peer may put into the log.
constexpr int kLoggedRefusals = 16;

/// How long an answer may wait for others while further calls of its batch run.
constexpr std::chrono::milliseconds kAnswerDelay{1};

std::size_t wireBytes(const FrameBatch::Frame& frame) { return kFrameHeaderBytes + frame.header.length; }

bool readArray(CborReader& reader, PropertyArray& values) {
  std::size_t count = 0;
  if (!reader.readArrayHead(count)) return false;
  if (count != 0) values.reserve(count);
  for (std::size_t number = 0; number < count; ++number) {
    PropertyValue value;
    if (!reader.readValue(value)) return false;
    values.append(std::move(value));
  }
  return reader.readEnd();
}

Error errorFrom(const PropertyArray& values) {
  const std::string* domain = values.size() == 3 ? values[0].string() : nullptr;
  const std::string* text = values.size() == 3 ? values[2].string() : nullptr;
  if (domain == nullptr || text == nullptr || values[1].integer() == nullptr) {
    return connectionError(ConnectionError::badReply, "an error that cannot be read");
  }
  return {*domain, int32Value(&values[1]), *text};
}

}  // namespace

void ConnectionCore::scheduleDelivery() {
  {
    Guard guard(_inboxLock);
    if (std::exchange(_deliveryScheduled, true)) return;
  }
  queue->async([self = shared_from_this()] { self->deliver(); });
}

/// One turn. `_deliveryScheduled` stays set until everything received has been run, or while the turn is paused.
void ConnectionCore::deliver() {
  const DeliveryScope scope(this);
  for (std::size_t ran = 0;; ++ran) {
    if (_nextFrame == _current.frames.size() && !takeInbox()) break;
    if (_discarding.load()) {
      discardCurrent();
      continue;
    }
    const auto frame = _current.frames[_nextFrame];
    if (mustPauseFor(frame)) return;
    if (ran == kMaximumFramesPerTurn) {
      flushAnswers();
      return queue->async([self = shared_from_this()] { self->deliver(); });
    }
    sendAnswersSoon();
    ++_nextFrame;
    runFrame(frame);
    frameDone(frame);
  }
  flushAnswers();
}

/// False when nothing is left to run; then the end, if it has come, has been dealt with.
bool ConnectionCore::takeInbox() {
  _current.clear();
  _nextFrame = 0;
  _nextDescriptor = 0;
  shrinkUnread();
  askForRoomAgain();
  End end = End::none;
  {
    Guard guard(_inboxLock);
    if (!_inbox.empty()) {
      std::swap(_inbox, _current);
      return true;
    }
    _deliveryScheduled = false;
    end = _receivedEnd;
  }
  if (end != End::none) reachedEnd(end);
  return false;
}

/// A peer that does not read its replies is not served. Whoever sends them lets delivery go on.
bool ConnectionCore::mustPauseFor(const FrameBatch::Frame& frame) {
  if (frame.header.serial == 0 || frame.header.kind != FrameKind::call) return false;
  if (mayRunCalls(kOutboxBytesToPauseCalls)) return false;
  flushAnswers();
  _deliveryPaused = true;
  return !(mayRunCalls(kOutboxBytesToPauseCalls / 2) && _deliveryPaused.exchange(false));
}

void ConnectionCore::runFrame(const FrameBatch::Frame& frame) {
  if (frame.header.kind == FrameKind::call) {
    takeDescriptors(frame);
    runCall(frame);
    _call.reply = Reply();
    _call.arguments.clear();
    _call.descriptors.clear();
  } else {
    runReply(frame);
  }
}

void ConnectionCore::takeDescriptors(const FrameBatch::Frame& frame) {
  for (std::size_t count = 0; count < frame.header.descriptors; ++count) {
    _call.descriptors.push_back(std::move(_current.descriptors[_nextDescriptor++]));
  }
}

void ConnectionCore::runCall(const FrameBatch::Frame& frame) {
  if (!decodeCall(frame)) return;
  if (!dispatcher) return refuse(connectionError(ConnectionError::refused, "nothing is exported here"));
  if (const auto result = dispatcher->dispatch(_call); !result) refuse(result.error());
}

bool ConnectionCore::decodeCall(const FrameBatch::Frame& frame) {
  CborReader reader(_current.body(frame));
  std::size_t count = 0;
  std::uint64_t method = 0;
  bool sound = reader.readArrayHead(count) && reader.readUnsigned(method);
  for (std::size_t number = 1; sound && number < count; ++number) {
    sound = reader.readValue(_call.arguments.emplace_back());
  }
  sound = sound && reader.readEnd();
  if (!sound && reader.severity() == CborReader::Severity::malformed) {
    badFrame(reader.fault());
    return false;
  }
  _call.method = static_cast<std::uint32_t>(method);
  if (frame.header.serial != 0) {
    // The call that most are answers to ends with its answer; others may go on for long after theirs.
    const bool prompt = method != static_cast<std::uint32_t>(Method::sendMessageWithDictionary);
    _call.reply = Reply(weak_from_this(), frame.header.serial, prompt);
  }
  if (!sound) {
    refuse(connectionError(ConnectionError::refused, reader.fault()));
  } else if (method > std::numeric_limits<std::uint32_t>::max()) {
    sound = false;
    refuse(connectionError(ConnectionError::refused, "unknown method"));
  }
  return sound;
}

void ConnectionCore::refuse(const Error& error) {
  ++_refusals;
  if (_refusals <= kLoggedRefusals) log::error(texts::kRefusedCall, _call.method, description, error.description);
  if (_refusals == kLoggedRefusals) log::error(texts::kFurtherRefusals, description);
  _call.reply.fail(error);
}

void ConnectionCore::runReply(const FrameBatch::Frame& frame) {
  ReplyHandler handler;
  {
    Guard guard(_lock);
    handler = _pending.take(frame.header.serial);
  }
  if (!handler) return badFrame("reply to no call");
  CborReader reader(_current.body(frame));
  PropertyArray values;
  if (!readArray(reader, values)) {
    if (reader.severity() == CborReader::Severity::malformed) badFrame(reader.fault());
    return handler(Failure(connectionError(ConnectionError::badReply, reader.fault())));
  }
  if (frame.header.kind == FrameKind::errorReply) return handler(Failure(errorFrom(values)));
  handler(std::move(values));
}

/// The peer cannot be trusted to frame anything else: what it sent after this is discarded.
void ConnectionCore::badFrame(const char* reason) {
  if (_reachedEnd || _discarding.exchange(true)) return;
  {
    Guard guard(_inboxLock);
    _endReason = reason;
  }
  reachedEnd(End::badFrame);
}

void ConnectionCore::frameDone(const FrameBatch::Frame& frame) {
  _unreadBytes.fetch_sub(wireBytes(frame));
  _unclaimedDescriptors.fetch_sub(frame.header.descriptors);
  if (_readingPaused.load() && mayResumeReading() && _readingPaused.exchange(false)) {
    _loop.post([self = shared_from_this()] { self->awaitReadable(); });
  }
}

bool ConnectionCore::mayResumeReading() const noexcept {
  return _unreadBytes.load() <= kMaximumUnreadBytes / 2 &&
         _unclaimedDescriptors.load() <= kMaximumUnclaimedDescriptors / 2;
}

void ConnectionCore::discardCurrent() {
  while (_nextFrame < _current.frames.size()) frameDone(_current.frames[_nextFrame++]);
}

/// Answers that were kept back to leave together must not wait for a call that takes long.
void ConnectionCore::sendAnswersSoon() {
  if (!_answersWait || _answerTimerRuns.exchange(true)) return;
  _loop.postAfter(kAnswerDelay, [self = shared_from_this()] {
    self->_answerTimerRuns = false;
    bool send = false;
    {
      Guard guard(self->_lock);
      send = self->claimSenderLocked();
    }
    if (send) self->pump(Sender::loop);
  });
}

void ConnectionCore::flushAnswers() {
  if (!std::exchange(_answersWait, false)) return;
  {
    Guard guard(_lock);
    if (!claimSenderLocked()) return;
    _sender = Sender::deliveryQueue;
  }
  pump(Sender::deliveryQueue);
}

/// Everything that the peer sent has been run, or will never be. Once.
void ConnectionCore::reachedEnd(End end) {
  if (std::exchange(_reachedEnd, true)) return;
  const bool endedHere = _closingHere.load();
  _end = endedHere ? End::here : end;
  _ended = true;
  const char* reason = "";
  {
    Guard guard(_inboxLock);
    reason = _endReason;
  }
  if (end == End::badFrame) log::error(texts::kBadFrame, description, reason);
  {
    Guard guard(_lock);
    if (end == End::badFrame) appendGoodbyeLocked();
    _accepting = false;
  }
  _answersWait = false;
  _loop.post([self = shared_from_this()] { self->closeWhenSent(); });
  failPendingReplies("the connection ended before the reply came");
  if (end == End::endOfFile && !endedHere) {
    if (auto handler = std::move(interruptionHandler)) handler();
    if (!_accepted) return;
  }
  finish();
}

/// What `invalidate` posted.
void ConnectionCore::endHere() {
  if (_reachedEnd) return finish();
  {
    Guard guard(_lock);
    appendGoodbyeLocked();
  }
  _loop.post([self = shared_from_this()] { self->closeWhenSent(); });
  resumeDelivery();
}

/// Stops sending: what is still here never leaves. On the loop's thread, where the sender of such a connection works.
std::vector<PropertyArray> ConnectionCore::takeUnsentCalls(std::uint32_t method) {
  std::vector<std::uint8_t> frames;
  {
    Guard guard(_lock);
    failSendingLocked();
    frames.swap(_unsent);
  }
  _allSent.notifyAll();
  std::vector<PropertyArray> calls;
  for (std::span<const std::uint8_t> rest(frames); !rest.empty();) {
    const FrameHeader header = readFrameHeader(rest.data());
    CborReader reader(rest.subspan(kFrameHeaderBytes, header.length));
    rest = rest.subspan(kFrameHeaderBytes + header.length);
    PropertyArray values;
    if (header.kind != FrameKind::call || !readArray(reader, values) || integerValue(&values[0]) != method) continue;
    values.removeAt(0);
    calls.push_back(std::move(values));
  }
  return calls;
}

void ConnectionCore::failPendingReplies(const char* reason) {
  std::vector<ReplyHandler> handlers;
  {
    Guard guard(_lock);
    handlers = _pending.takeAll();
  }
  for (auto& handler : handlers) handler(Failure(connectionError(ConnectionError::ended, reason)));
}

/// The last that is heard of the connection. Whatever its handlers hold is let go of.
void ConnectionCore::finish() {
  if (std::exchange(_finished, true)) return;
  if (auto handler = std::move(invalidationHandler)) handler();
  interruptionHandler = nullptr;
  dispatcher.reset();
}

}  // namespace velk::ipc
