// How a connection's bytes move: on the event loop's thread, except that the delivery queue may send what it has just
// answered.
#include <algorithm>
#include <cerrno>
#include <cstring>

#include "ipc/ConnectionCore.h"
#include "ipc/Limits.h"
#include "platform/LocalSocket.h"

namespace velk::ipc {
namespace {

/// Reads of one connection in one turn of the loop, before others get theirs.
constexpr int kReadsPerTurn = 4;

/// One for the loop's thread, whatever the number of connections.
std::span<std::uint8_t> receiveBuffer() {
  thread_local std::vector<std::uint8_t> buffer(kReceiveBytes);
  return buffer;
}

}  // namespace

bool ConnectionCore::openWatch() {
  if (!_watch && !_closed) _watch = _loop.watch(_socket.get());
  return _watch != nullptr;
}

void ConnectionCore::startReading() {
  if (_reading || _readingDone || _closed) return;
  _reading = true;
  if (openWatch()) {
    receive();
  } else {
    readingEnded(End::badFrame, "the system cannot watch its socket");
  }
}

void ConnectionCore::awaitReadable() {
  if (_readingDone || _closed) return;
  _watch->whenReadable([self = shared_from_this()] { self->receive(); });
}

void ConnectionCore::receive() {
  if (_readingDone || _closed) return;
  int reads = 0;
  while (reads < kReadsPerTurn && hasRoomToRead() && receiveOnce()) ++reads;
  if (!_readingDone && !pausesReading() && hasRoomToRead()) awaitReadable();
}

std::size_t ConnectionCore::unreadBytesToShare() const noexcept {
  const std::size_t bytes = _unreadBytes.load() + _bytesBegun.load();
  return bytes - std::min(bytes, kFreeUnreadBytes);
}

std::size_t ConnectionCore::unsentBytesToShare() const noexcept {
  const std::size_t bytes = _outboxBytes.load();
  return bytes - std::min(bytes, kFreeOutboxBytes);
}

/// A frame that has begun gets the room for all of it, so that those that have theirs can always be finished.
bool ConnectionCore::hasRoomToRead() {
  if (_waitsForRoom) return false;
  if (!_unreadPart || (unreadBytesToShare() == 0 && _unreadPart->bytes() == 0)) return true;
  if (!_unreadPart->tryResize([this] { return unreadBytesToShare(); })) {
    awaitRoom();
    return false;
  }
  if (_bytesBegun.load() > kFreeUnreadBytes) _unreadPart->owesSince(_loop.clock().steadyTime());
  return true;
}

void ConnectionCore::awaitRoom() {
  _waitsForRoom = true;
  const std::weak_ptr<ConnectionCore> weak = weak_from_this();
  if (!_isInLineForRoom.exchange(true)) {
    const std::size_t wanted = unreadBytesToShare();
    _unreadPart->whenThereIsRoom(wanted - std::min(wanted, _unreadPart->bytes()), [weak] {
      const auto self = weak.lock();
      if (!self) return;
      self->_isInLineForRoom = false;
      self->_loop.post([self] { self->readIfRoomCame(); });
    });
  }
  askForRoomAgain();
  endWhereOthersWait();
}

/// Without what has run meanwhile there may be nothing to wait for. Any thread.
void ConnectionCore::askForRoomAgain() {
  if (_waitsForRoom.load() && unreadBytesToShare() == 0) {
    _loop.post([self = shared_from_this()] { self->readIfRoomCame(); });
  }
}

void ConnectionCore::readIfRoomCame() {
  if (_waitsForRoom.exchange(false)) receive();
}

/// A waiting connection looks now and then for frames whose rest does not come.
void ConnectionCore::endWhereOthersWait() {
  if (!_waitsForRoom || _readingDone) return;
  _unreadPart->endOverdue(_loop.clock().steadyTime() - kFrameTimeWhileOthersWait, false);
  if (std::exchange(_looksForOverdue, true)) return;
  _loop.postAfter(kFrameTimeWhileOthersWait / 4, [weak = weak_from_this()] {
    const auto self = weak.lock();
    if (!self) return;
    self->_looksForOverdue = false;
    self->endWhereOthersWait();
  });
}

void ConnectionCore::frameIsOverdue() {
  if (_bytesBegun.load() != 0) readingEnded(End::badFrame, "the rest of a frame did not come while others waited");
}

void ConnectionCore::shrinkUnread() {
  if (_unreadPart && _unreadPart->bytes() != 0) {
    // What could not grow before does not grow here: the other direction is `hasRoomToRead`.
    static_cast<void>(_unreadPart->tryResize([this] { return std::min(unreadBytesToShare(), _unreadPart->bytes()); }));
  }
}

void ConnectionCore::shrinkUnsent() {
  if (!_unsentPart || _unsentPart->bytes() == 0) return;
  _unsentPart->resize([this] { return unsentBytesToShare(); });
  _unsentPart->owesNothing();
  if (_unsentPart->bytes() != 0) _unsentPart->owesSince(_loop.clock().steadyTime());
}

/// True when there may be more to read at once.
bool ConnectionCore::receiveOnce() {
  const auto buffer = receiveBuffer();
  const auto transfer = receiveFromLocalSocket(_socket.get(), buffer, _reader.arrivedDescriptors());
  switch (transfer.status) {
    case Transfer::Status::wouldBlock:
      return false;
    case Transfer::Status::moved:
      return received(buffer.first(transfer.bytes)) && transfer.bytes == buffer.size();
    case Transfer::Status::failed:
      if (transfer.error == ECONNRESET) break;
      readingEnded(End::badFrame, transfer.error == EMFILE ? "descriptors were lost" : "its socket failed");
      return false;
    case Transfer::Status::ended:
      break;
  }
  // What a client began and did not finish is its fault; when a daemon dies in mid-frame it is one that went away.
  if (_accepted && _reader.hasPartialFrame()) {
    readingEnded(End::badFrame, "frame cut short");
  } else {
    readingEnded(End::endOfFile, "");
  }
  return false;
}

bool ConnectionCore::received(std::span<const std::uint8_t> bytes) {
  const char* fault = nullptr;
  bool anything = false;
  {
    Guard guard(_inboxLock);
    const std::size_t framesBefore = _inbox.frames.size();
    const std::size_t bytesBefore = _inbox.bytes.size();
    const std::size_t descriptorsBefore = _inbox.descriptors.size();
    fault = _reader.consume(bytes, _inbox);
    const std::size_t frames = _inbox.frames.size() - framesBefore;
    anything = frames != 0;
    _unreadBytes.fetch_add(_inbox.bytes.size() - bytesBefore + frames * kFrameHeaderBytes);
    _bytesBegun = _reader.bytesBegun();
    _unclaimedDescriptors.fetch_add(_inbox.descriptors.size() - descriptorsBefore);
  }
  if (fault != nullptr) {
    readingEnded(End::badFrame, fault);
  } else if (_reader.sawGoodbye()) {
    readingEnded(End::goodbye, "");
  } else if (anything) {
    if (_unreadPart && _unreadPart->bytes() != 0) _unreadPart->owesNothing();
    scheduleDelivery();
  }
  return !_readingDone && _unreadBytes.load() < kMaximumUnreadBytes;
}

/// Leaves the socket alone while too much waits to be run; whoever runs it lets reading go on.
bool ConnectionCore::pausesReading() {
  if (_unreadBytes.load() < kMaximumUnreadBytes && _unclaimedDescriptors.load() < kMaximumUnclaimedDescriptors) {
    return false;
  }
  awaitHangUp();
  _readingPaused = true;
  return !(mayResumeReading() && _readingPaused.exchange(false));
}

/// A socket that is not read does not tell of its end by itself.
void ConnectionCore::awaitHangUp() {
  if (!departureHandler || std::exchange(_awaitsHangUp, true)) return;
  _watch->whenHungUp([self = shared_from_this()] { self->peerHasGone(); });
}

void ConnectionCore::peerHasGone() {
  if (auto handler = std::exchange(departureHandler, nullptr)) handler();
}

void ConnectionCore::readingEnded(End end, const char* reason) {
  if (!std::exchange(_readingDone, true)) {
    {
      Guard guard(_inboxLock);
      _receivedEnd = end;
      _endReason = reason;
    }
    _reader.dropPartial();
    _bytesBegun = 0;
    if (_unreadPart) _unreadPart->owesNothing();
    shrinkUnread();
  }
  if (end == End::here) {
    departureHandler = nullptr;
  } else {
    peerHasGone();
  }
  scheduleDelivery();
}

void ConnectionCore::awaitWritable() {
  if (_closed) return;
  if (!openWatch()) return sendingFailed();
  _watch->whenWritable([self = shared_from_this()] { self->pump(Sender::loop); });
}

/// Sends until nothing is left or the socket is full. The caller is the sender, and no longer is on return unless the
/// loop waits for room.
void ConnectionCore::pump(Sender self) {
  if (self == Sender::loop && _closed) return;
  for (;;) {
    if (_sending.allSent() && !refillSending(self)) return;
    const auto part = _sending.next();
    const auto transfer = sendToLocalSocket(_socket.get(), part.bytes, part.descriptors);
    if (transfer.status == Transfer::Status::moved) {
      _sending.sent(transfer.bytes);
      bytesLeft(transfer.bytes);
    } else if (transfer.status == Transfer::Status::failed) {
      return sendingFailed();
    } else if (self == Sender::loop) {
      return awaitWritable();
    } else {
      {
        Guard guard(_lock);
        _sender = Sender::loop;
      }
      return _loop.post([core = shared_from_this()] { core->awaitWritable(); });
    }
  }
}

bool ConnectionCore::refillSending(Sender self) {
  _sending.clear();
  {
    Guard guard(_lock);
    if (!_outbox.empty()) {
      std::swap(_outbox, _sending);
      return true;
    }
    _sender = Sender::nobody;
  }
  _allSent.notifyAll();
  if (!_closeWanted.load()) return false;
  if (self == Sender::loop) {
    closeNow();
  } else {
    _loop.post([core = shared_from_this()] { core->closeNow(); });
  }
  return false;
}

/// Nothing leaves any more: neither what the sender was at nor what waited behind it. By the sender, or where there is
/// none.
void ConnectionCore::failSendingLocked() {
  _sendFailed = true;
  for (Outbox* const outbox : {&_sending, &_outbox}) {
    if (keepsUnsent) {
      const auto frames = outbox->unsentFrames();
      _unsent.insert(_unsent.end(), frames.begin(), frames.end());
    }
    outbox->clear();
  }
  _outboxBytes = 0;
  shrinkUnsent();
}

/// The peer reads no more. What it had sent before may still wait in the socket, so reading goes on.
void ConnectionCore::sendingFailed() {
  {
    Guard guard(_lock);
    failSendingLocked();
    _sender = Sender::nobody;
  }
  _allSent.notifyAll();
  resumeDelivery();
  if (_closeWanted.load()) _loop.post([core = shared_from_this()] { core->closeNow(); });
}

void ConnectionCore::bytesLeft(std::size_t count) {
  _outboxBytes.fetch_sub(count);
  shrinkUnsent();
  if (_deliveryPaused.load() && mayRunCalls(kOutboxBytesToPauseCalls / 2)) resumeDelivery();
}

/// Calls that want replies, while so much or more may wait to be sent.
bool ConnectionCore::mayRunCalls(std::size_t outboxLimit) const {
  if (_outboxBytes.load() > outboxLimit) return false;
  return !_unsentPart || _unsentPart->bytes() == 0 || !_unsentPart->isCrowded();
}

void ConnectionCore::resumeDelivery() {
  if (_deliveryPaused.exchange(false)) queue->async([core = shared_from_this()] { core->deliver(); });
}

void ConnectionCore::closeWhenSent(Duration drainTime) {
  if (_closed) return;
  _closeWanted = true;
  bool idle = false;
  bool send = false;
  {
    Guard guard(_lock);
    send = claimSenderLocked();
    idle = !send && _sender == Sender::nobody;
  }
  if (idle) return closeNow();
  if (drainTime < _drainTime) {
    _drainTime = drainTime;
    // What is to be sent keeps this alive, not a timer that may be set for long.
    _loop.postAfter(drainTime, [weak = weak_from_this()] {
      if (const auto self = weak.lock()) self->closeNow();
    });
  }
  if (send) pump(Sender::loop);
}

void ConnectionCore::closeNow() {
  if (_closed) return;
  {
    Guard guard(_lock);
    if (_sender == Sender::deliveryQueue) {
      // It is about to fail, and calls again.
      return shutDownLocalSocket(_socket.get());
    }
    _closed = true;
    _accepting = false;
    failSendingLocked();
    _sender = Sender::nobody;
  }
  _watch.reset();
  _socketStays.reset();
  _socket = FileDescriptor();
  _allSent.notifyAll();
  if (auto whenClosed = std::move(_whenClosed)) whenClosed();
  resumeDelivery();
  readingEnded(End::here, "");
}

}  // namespace velk::ipc
