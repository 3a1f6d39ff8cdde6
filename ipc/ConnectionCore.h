// The inside of a connection. Its three concerns stand in three files: ConnectionCore.cpp (life and calls),
// ConnectionTransport.cpp (bytes, on the event loop's thread) and ConnectionDelivery.cpp (frames, on the delivery
// queue). Private to ipc/.
#pragma once

#include <atomic>
#include <optional>
#include <string>
#include <vector>

#include "ipc/Connection.h"
#include "ipc/FrameReader.h"
#include "ipc/Limits.h"
#include "ipc/Outbox.h"
#include "ipc/PendingReplies.h"
#include "ipc/SharedRoom.h"
#include "platform/EventLoop.h"
#include "platform/Fork.h"
#include "platform/Lock.h"

namespace velk::ipc {

class ConnectionCore : public std::enable_shared_from_this<ConnectionCore> {
 public:
  using End = Connection::End;

  ConnectionCore(FileDescriptor socket, PeerCredentials peer, bool accepted, EventLoop& loop,
                 std::shared_ptr<Queue> queue, Task whenClosed);
  ~ConnectionCore();

  /// Before anything else, for connections that share them with others.
  void share(std::shared_ptr<SharedRoom> unread, std::shared_ptr<SharedRoom> unsent);
  void resume();
  void invalidate();
  void closeAfterSending(Duration drainTime);
  [[nodiscard]] Result<void> sendCall(std::uint32_t method, std::size_t argumentCount, BodyEncoder encode,
                                      std::vector<FileDescriptor> descriptors, ReplyHandler& reply,
                                      std::size_t outboxLimit = kMaximumOutboxBytes);
  /// `prompt`: the method may go on for long after it has answered, so the answer must not wait for its end.
  void sendReply(std::uint64_t serial, std::size_t count, BodyEncoder encode, bool prompt);
  void sendErrorReply(std::uint64_t serial, const Error& error, bool prompt);
  [[nodiscard]] bool waitUntilSent(Duration timeout);
  [[nodiscard]] bool hasRoomForAnyCall() const noexcept {
    return _outboxBytes.load() + kFrameHeaderBytes + kMaximumFrameBytes <= kMaximumOutboxBytes;
  }
  [[nodiscard]] std::vector<PropertyArray> takeUnsentCalls(std::uint32_t method);

  // Handlers are set before `resume`, then used on the delivery queue.
  std::shared_ptr<CallDispatcher> dispatcher;
  Task interruptionHandler;
  Task invalidationHandler;
  Task departureHandler;  ///< used on the loop's thread
  /// Set before `resume`: what did not leave is kept for `takeUnsentCalls`.
  bool keepsUnsent = false;

  [[nodiscard]] bool hasEnded() const noexcept { return _ended.load(std::memory_order_acquire); }
  [[nodiscard]] End end() const noexcept { return _end.load(std::memory_order_acquire); }

  // Constant after construction.
  const PeerCredentials peer;
  const std::string description;
  const std::shared_ptr<Queue> queue;

 private:
  /// Marks the current thread as running frames of `core`.
  class DeliveryScope {
   public:
    explicit DeliveryScope(const ConnectionCore* core) noexcept;
    ~DeliveryScope();
    DeliveryScope(const DeliveryScope&) = delete;
    DeliveryScope& operator=(const DeliveryScope&) = delete;

   private:
    const ConnectionCore* const _outer;
  };

  /// Who moves bytes out of the outbox just now.
  enum class Sender : std::uint8_t { nobody, loop, deliveryQueue };

  // Any thread.
  /// Why a frame did not fit.
  struct Refusal {
    ConnectionError code;
    const char* text;
  };
  [[nodiscard]] std::optional<Refusal> appendLocked(FrameHeader header, BodyEncoder encode,
                                                    std::vector<FileDescriptor>& descriptors, std::size_t outboxLimit)
      VELK_REQUIRES(_lock);
  [[nodiscard]] bool takesRoomLocked(std::size_t outboxLimit) VELK_REQUIRES(_lock);
  void makeRoomForReplies();
  void sendAnswer(FrameHeader header, BodyEncoder encode, bool prompt);
  /// True: the caller must `wakeSender` once it has released the lock.
  [[nodiscard]] bool claimSenderLocked() VELK_REQUIRES(_lock);
  void wakeSender();
  void appendGoodbyeLocked() VELK_REQUIRES(_lock);
  void endForUnreadReplies();

  // On the loop's thread.
  void startReading();
  void awaitReadable();
  void receive();
  [[nodiscard]] bool receiveOnce();
  [[nodiscard]] bool received(std::span<const std::uint8_t> bytes);
  [[nodiscard]] bool pausesReading();
  void awaitHangUp();
  void peerHasGone();
  [[nodiscard]] bool hasRoomToRead();
  void awaitRoom();
  void readIfRoomCame();
  void endWhereOthersWait();
  void frameIsOverdue();
  void readingEnded(End end, const char* reason);
  [[nodiscard]] bool openWatch();
  void awaitWritable();
  void closeWhenSent(Duration drainTime = kDrainTime);
  void closeNow();

  // On the loop's thread or the delivery queue, by whoever is the sender.
  void pump(Sender self);
  [[nodiscard]] bool refillSending(Sender self);
  void sendingFailed();
  void failSendingLocked() VELK_REQUIRES(_lock);
  void bytesLeft(std::size_t count);
  void resumeDelivery();
  [[nodiscard]] std::size_t unreadBytesToShare() const noexcept;
  [[nodiscard]] std::size_t unsentBytesToShare() const noexcept;
  void shrinkUnread();
  void askForRoomAgain();
  void shrinkUnsent();
  [[nodiscard]] bool mayRunCalls(std::size_t outboxLimit) const;

  // On the delivery queue.
  void scheduleDelivery();
  void deliver();
  [[nodiscard]] bool takeInbox();
  [[nodiscard]] bool mustPauseFor(const FrameBatch::Frame& frame);
  void runFrame(const FrameBatch::Frame& frame);
  void runCall(const FrameBatch::Frame& frame);
  [[nodiscard]] bool decodeCall(const FrameBatch::Frame& frame);
  void runReply(const FrameBatch::Frame& frame);
  void refuse(const Error& error);
  void takeDescriptors(const FrameBatch::Frame& frame);
  void badFrame(const char* reason);
  void frameDone(const FrameBatch::Frame& frame);
  void discardCurrent();
  [[nodiscard]] bool mayResumeReading() const noexcept;
  void sendAnswersSoon();
  void flushAnswers();
  void reachedEnd(End end);
  void endHere();
  void failPendingReplies(const char* reason);
  void finish();

  // Constant after construction.
  EventLoop& _loop;
  const bool _accepted;
  const ForkGuard _fork;

  // Self-synchronised. Null where nothing is shared.
  std::unique_ptr<SharedRoom::Part> _unreadPart;
  std::unique_ptr<SharedRoom::Part> _unsentPart;
  std::atomic<bool> _ended{false};       ///< calls fail from here on
  std::atomic<bool> _discarding{false};  ///< frames that have not run never will
  std::atomic<bool> _closingHere{false};
  std::atomic<bool> _closeWanted{false};
  std::atomic<End> _end{End::none};
  std::atomic<std::size_t> _outboxBytes{0};
  std::atomic<std::size_t> _unreadBytes{0};
  std::atomic<std::size_t> _bytesBegun{0};  ///< of the frame that is not whole yet
  std::atomic<std::size_t> _unclaimedDescriptors{0};
  std::atomic<bool> _readingPaused{false};
  std::atomic<bool> _deliveryPaused{false};
  std::atomic<bool> _answerTimerRuns{false};
  std::atomic<bool> _waitsForRoom{false};     ///< the socket is left alone until there is room for what was begun
  std::atomic<bool> _isInLineForRoom{false};  ///< the room calls back
  std::atomic<bool> _isCrowdedOut{false};     ///< replies took more room than there was

  // Used on the loop's thread only.
  FileDescriptor _socket;  ///< the sender uses it too, and is waited for before it is closed
  /// Of a client's end: a daemon hears of a host's end although a child of it lives on.
  std::optional<NotForChildren> _socketStays;
  std::unique_ptr<DescriptorWatch> _watch;
  FrameReader _reader;
  Task _whenClosed;
  bool _looksForOverdue = false;
  bool _reading = false;
  bool _readingDone = false;
  bool _awaitsHangUp = false;
  bool _closed = false;
  /// The shortest that a timer was started for: it closes the socket, whatever is left to send.
  Duration _drainTime = Duration::max();

  // Used by whoever is the sender.
  Outbox _sending;

  // Used on the delivery queue only.
  FrameBatch _current;
  std::size_t _nextFrame = 0;
  std::size_t _nextDescriptor = 0;
  IncomingCall _call;
  int _refusals = 0;
  bool _answersWait = false;
  bool _reachedEnd = false;
  bool _finished = false;

  // Guarded by _lock.
  Lock _lock;
  Condition _allSent;
  Outbox _outbox VELK_GUARDED_BY(_lock);
  PendingReplies _pending VELK_GUARDED_BY(_lock);
  Sender _sender VELK_GUARDED_BY(_lock) = Sender::nobody;
  bool _accepting VELK_GUARDED_BY(_lock) = true;    ///< frames may be appended
  bool _sendFailed VELK_GUARDED_BY(_lock) = false;  ///< the peer no longer reads, or the socket is closed
  std::vector<std::uint8_t> _unsent VELK_GUARDED_BY(_lock);

  // Guarded by _inboxLock, which is never held together with _lock.
  Lock _inboxLock;
  FrameBatch _inbox VELK_GUARDED_BY(_inboxLock);
  bool _deliveryScheduled VELK_GUARDED_BY(_inboxLock) = false;
  End _receivedEnd VELK_GUARDED_BY(_inboxLock) = End::none;
  const char* _endReason VELK_GUARDED_BY(_inboxLock) = "";
};

}  // namespace velk::ipc
