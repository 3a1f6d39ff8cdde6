#include "ipc/ConnectionCore.h"

#include <algorithm>
#include <string>

#include "foundation/Text.h"
#include "ipc/CallBody.h"
#include "ipc/Limits.h"
#include "ipc/LogTexts.h"
#include "platform/BlockingScope.h"
#include "platform/Log.h"

namespace velk::ipc {
namespace {

/// The core whose frames the current thread is running.
thread_local const ConnectionCore* deliveringCore = nullptr;

std::string describe(const PeerCredentials& peer) {
  static std::atomic<std::uint64_t> last{0};
  return "<connection " + std::to_string(++last) + " pid " + std::to_string(peer.pid) + " uid " +
         std::to_string(peer.uid) + ">";
}

/// Error texts end up in frames, which hold only so much and only UTF-8.
std::string wireText(std::string_view text) {
  if (!isUtf8(text)) return "(a text that is not UTF-8)";
  return std::string(utf8Prefix(text, kMaximumErrorTextBytes));
}

}  // namespace

ConnectionCore::DeliveryScope::DeliveryScope(const ConnectionCore* core) noexcept : _outer(deliveringCore) {
  deliveringCore = core;
}
ConnectionCore::DeliveryScope::~DeliveryScope() { deliveringCore = _outer; }

ConnectionCore::ConnectionCore(FileDescriptor socket, PeerCredentials credentials, bool accepted, EventLoop& loop,
                               std::shared_ptr<Queue> deliveryQueue, Task whenClosed)
    : peer(std::move(credentials)),
      description(describe(peer)),
      queue(std::move(deliveryQueue)),
      _loop(loop),
      _accepted(accepted),
      _socket(std::move(socket)),
      _whenClosed(std::move(whenClosed)) {
  if (!_accepted) _socketStays.emplace(_socket.get());
}

ConnectionCore::~ConnectionCore() {
  if (_fork.forked()) {
    // The number may be somebody else's by now.
    if (_socketStays && *_socketStays) static_cast<void>(_socket.release());
    return;
  }
  failPendingReplies("the connection was given up");
  if (_whenClosed) _whenClosed();
}

void ConnectionCore::share(std::shared_ptr<SharedRoom> unread, std::shared_ptr<SharedRoom> unsent) {
  const std::weak_ptr<ConnectionCore> weak = weak_from_this();
  _unreadPart = std::make_unique<SharedRoom::Part>(std::move(unread), peer.uid, [weak] {
    const auto self = weak.lock();
    if (self) self->_loop.post([self] { self->frameIsOverdue(); });
  });
  _unsentPart = std::make_unique<SharedRoom::Part>(std::move(unsent), peer.uid, [weak] {
    if (const auto self = weak.lock()) self->endForUnreadReplies();
  });
}

void ConnectionCore::resume() {
  if (_fork.forked()) return;
  _loop.post([self = shared_from_this()] { self->startReading(); });
}

void ConnectionCore::invalidate() {
  if (_fork.forked() || _discarding.exchange(true)) return;
  _closingHere = true;
  _ended = true;
  queue->async([self = shared_from_this()] { self->endHere(); });
}

void ConnectionCore::closeAfterSending(Duration drainTime) {
  if (_fork.forked() || _closingHere.exchange(true)) return;
  _ended = true;
  bool wake = false;
  {
    Guard guard(_lock);
    appendGoodbyeLocked();
    wake = claimSenderLocked();
  }
  if (wake) wakeSender();
  const auto longer = std::max<Duration>(drainTime, kDrainTime);
  _loop.post([self = shared_from_this(), longer] { self->closeWhenSent(longer); });
  queue->async([self = shared_from_this()] {
    if (self->_reachedEnd) self->finish();
  });
}

std::optional<ConnectionCore::Refusal> ConnectionCore::appendLocked(FrameHeader header, BodyEncoder encode,
                                                                    std::vector<FileDescriptor>& descriptors,
                                                                    std::size_t outboxLimit) {
  constexpr Refusal full{ConnectionError::outboxFull, "the outbox is full: the peer reads too slowly"};
  if (_outboxBytes.load() >= outboxLimit) return full;
  const std::size_t start = _outbox.size();
  const auto fault = _outbox.append(header, encode, descriptors);
  if (fault == CborWriter::Fault::tooLarge) return Refusal{ConnectionError::tooLarge, CborWriter::description(fault)};
  if (fault != CborWriter::Fault::none) return Refusal{ConnectionError::notEncodable, CborWriter::description(fault)};
  const std::size_t added = _outbox.size() - start;
  if (_outboxBytes.load() + added > outboxLimit) {
    _outbox.truncate(start, descriptors);
    return full;
  }
  _outboxBytes.fetch_add(added);
  if (_unsentPart && _outboxBytes.load() > kFreeOutboxBytes && !takesRoomLocked(outboxLimit)) {
    _outboxBytes.fetch_sub(added);
    _outbox.truncate(start, descriptors);
    return full;
  }
  return std::nullopt;
}

/// Replies get their room in any case, at the cost of a peer that has long not read its own.
bool ConnectionCore::takesRoomLocked(std::size_t outboxLimit) {
  const auto bytes = [this] { return unsentBytesToShare(); };
  if (!_unsentPart->tryResize(bytes)) {
    if (outboxLimit < kMaximumOutboxBytesWithReplies) return false;
    _unsentPart->resize(bytes);
    _isCrowdedOut = true;
  }
  _unsentPart->owesSince(_loop.clock().steadyTime());
  return true;
}

void ConnectionCore::makeRoomForReplies() {
  if (_isCrowdedOut.exchange(false)) _unsentPart->endOverdue(SteadyTime::max(), true);
}

bool ConnectionCore::claimSenderLocked() {
  if (_sender != Sender::nobody || _sendFailed || _outbox.empty()) return false;
  _sender = Sender::loop;
  return true;
}

void ConnectionCore::wakeSender() {
  _loop.post([self = shared_from_this()] { self->pump(Sender::loop); });
}

/// The last frame that is ever appended.
void ConnectionCore::appendGoodbyeLocked() {
  if (!std::exchange(_accepting, false) || _sendFailed) return;
  _outbox.appendBare({0, kProtocolVersion, FrameKind::goodbye, 0, 0});
  _outboxBytes.fetch_add(kFrameHeaderBytes);
}

Result<void> ConnectionCore::sendCall(std::uint32_t method, std::size_t argumentCount, BodyEncoder encode,
                                      std::vector<FileDescriptor> descriptors, ReplyHandler& reply,
                                      std::size_t outboxLimit) {
  if (_fork.forked()) return Failure(connectionError(ConnectionError::forked, "the connection belongs to the parent"));
  std::optional<Refusal> refusal = Refusal{ConnectionError::ended, "the connection has ended"};
  if (hasEnded()) return Failure(connectionError(refusal->code, refusal->text));
  if (descriptors.size() > kMaximumDescriptorsPerFrame) {
    return Failure(connectionError(ConnectionError::notEncodable, "too many descriptors"));
  }
  const auto body = [&](CborWriter& writer) { writeCallBody(writer, method, argumentCount, encode); };
  bool wake = false;
  {
    Guard guard(_lock);
    if (_accepting && !_sendFailed) {
      const bool wantsReply = static_cast<bool>(reply);
      const std::uint64_t serial = wantsReply ? _pending.add(reply) : 0;
      if (wantsReply && serial == 0) {
        refusal = Refusal{ConnectionError::outboxFull, "too many calls wait for a reply"};
      } else {
        refusal = appendLocked({0, kProtocolVersion, FrameKind::call, 0, serial}, BodyEncoder(body), descriptors,
                               outboxLimit);
        if (refusal && serial != 0) reply = _pending.take(serial);
      }
      wake = claimSenderLocked();
    }
  }
  if (wake) wakeSender();
  makeRoomForReplies();
  if (!refusal) return {};
  return Failure(connectionError(refusal->code, refusal->text));
}

void ConnectionCore::sendReply(std::uint64_t serial, std::size_t count, BodyEncoder encode, bool prompt) {
  const auto body = [&](CborWriter& writer) {
    writer.beginArray(count);
    encode(writer);
  };
  sendAnswer({0, kProtocolVersion, FrameKind::reply, 0, serial}, BodyEncoder(body), prompt);
}

void ConnectionCore::sendErrorReply(std::uint64_t serial, const Error& error, bool prompt) {
  const auto body = [&](CborWriter& writer) {
    writer.beginArray(3);
    writer.text(wireText(error.domain));
    writer.integer(error.code);
    writer.text(wireText(error.description));
  };
  sendAnswer({0, kProtocolVersion, FrameKind::errorReply, 0, serial}, BodyEncoder(body), prompt);
}

/// A reply that cannot be sent becomes an error; an error always fits, unless the peer reads nothing at all.
void ConnectionCore::sendAnswer(FrameHeader header, BodyEncoder encode, bool prompt) {
  if (_fork.forked()) return;
  std::vector<FileDescriptor> none;
  std::optional<Refusal> refusal;
  bool wake = false;
  {
    Guard guard(_lock);
    if (!_accepting || _sendFailed) return;
    refusal = appendLocked(header, encode, none, kMaximumOutboxBytesWithReplies);
    if (!refusal && deliveringCore == this && !prompt) {
      _answersWait = true;
    } else {
      wake = claimSenderLocked();
    }
  }
  if (wake) wakeSender();
  makeRoomForReplies();
  if (!refusal) return;
  if (refusal->code == ConnectionError::outboxFull) return endForUnreadReplies();
  log::error(texts::kReplyNotSent, description, refusal->text);
  sendErrorReply(header.serial, connectionError(refusal->code, refusal->text), prompt);
}

void ConnectionCore::endForUnreadReplies() {
  if (!hasEnded()) log::error(texts::kUnreadReplies, description);
  invalidate();
}

bool ConnectionCore::waitUntilSent(Duration timeout) {
  if (_fork.forked()) return true;
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  BlockingScope blocking;
  Guard guard(_lock);
  while (!_sendFailed && !(_sender == Sender::nobody && _outbox.empty())) {
    if (!_allSent.waitUntil(_lock, deadline) && std::chrono::steady_clock::now() >= deadline) return false;
  }
  return true;
}

}  // namespace velk::ipc
