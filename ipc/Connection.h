// One connection between a client and the daemon: calls both ways, replies, descriptors that ride along, and an end
// that is told to each side once. Both ends use this class; the daemon gets it from a Listener, a client from
// `connect`.
//
//   made -> resume() -> open -> { closeAfterSending() | invalidate() | peer's goodbye | bare end of file | bad frame }
//        -> ended: pending replies failed, handlers called once, then dropped
//
// Threads. Bytes move on the event loop's thread, which never decodes and never runs a method. Frames are decoded and
// run, in order and many per wake-up, on the connection's delivery queue: handlers, reply handlers of calls and the
// exported dispatcher all run there. Sending encodes into the outbox on the caller's thread and never blocks.
//
// Life. An open connection keeps itself alive until it has ended, so whoever made it must end it: a client calls
// `closeAfterSending` or `invalidate`. Handlers may hold the connection: they are dropped when it has ended.
// After `fork` the child's copy is inert: calls fail, nothing is sent; a client's socket is closed there.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "foundation/Error.h"
#include "foundation/Function.h"
#include "foundation/PropertyValue.h"
#include "foundation/TimeValue.h"
#include "ipc/CborWriter.h"
#include "platform/Entitlements.h"
#include "platform/FileDescriptor.h"
#include "platform/Queue.h"

namespace velk {

class EventLoop;

/// The domain of errors that the connection itself makes; the codes are ConnectionError.
inline constexpr std::string_view kConnectionErrorDomain = "VelkConnectionErrorDomain";

/// Codes of errors, also on the wire: numbered, only ever appended to.
enum class ConnectionError : int {
  ended = 1,         ///< the connection has ended, or ended before the reply came
  outboxFull = 2,    ///< the peer reads too slowly; nothing was sent
  tooLarge = 3,      ///< the body exceeds a frame
  notEncodable = 4,  ///< text that is not UTF-8, nesting too deep, too many entries
  refused = 5,       ///< the peer does not know the method, or its arguments have the wrong types
  dropped = 6,       ///< the method ran and gave its reply up unanswered
  badReply = 7,      ///< the reply's values have the wrong types
  forked = 8,        ///< this process is a fork of the one that made the connection
  notConnected = 9,  ///< nobody answers at the path
  notAllowed = 10,   ///< the system does not let this process use the socket at the path
};
[[nodiscard]] Error connectionError(ConnectionError code, std::string description);

namespace ipc {
class ConnectionCore;
}

/// The right to answer one call, once, from any thread. Destroyed unanswered it answers with an error. It does not
/// keep the connection alive; answers to a connection that has ended go nowhere.
class Reply {
 public:
  Reply() noexcept = default;
  Reply(std::weak_ptr<ipc::ConnectionCore> connection, std::uint64_t serial, bool prompt) noexcept
      : _connection(std::move(connection)), _serial(serial), _prompt(prompt) {}
  Reply(Reply&& other) noexcept
      : _connection(std::move(other._connection)), _serial(std::exchange(other._serial, 0)), _prompt(other._prompt) {}
  Reply& operator=(Reply&& other) noexcept {
    std::swap(_connection, other._connection);
    std::swap(_serial, other._serial);
    std::swap(_prompt, other._prompt);
    return *this;
  }
  Reply(const Reply&) = delete;
  Reply& operator=(const Reply&) = delete;
  ~Reply();

  /// False for a one-way call, and after the answer: answering then does nothing.
  [[nodiscard]] explicit operator bool() const noexcept { return _serial != 0; }

  /// Answers with `count` values, which `encode(CborWriter&)` writes. A reply too large for a frame becomes an error.
  template <class Encode>
  void send(std::size_t count, Encode&& encode) {
    sendEncoded(count, ipc::BodyEncoder(encode));
  }
  void sendValues(const PropertyArray& values);
  void fail(const Error& error);

 private:
  void sendEncoded(std::size_t count, ipc::BodyEncoder encode);

  std::weak_ptr<ipc::ConnectionCore> _connection;
  std::uint64_t _serial = 0;
  bool _prompt = true;
};

/// A call as it was received. The dispatcher may move everything out of it.
struct IncomingCall {
  std::uint32_t method = 0;
  std::vector<PropertyValue> arguments;
  /// The descriptors that rode with it; those left here are closed.
  std::vector<FileDescriptor> descriptors;
  Reply reply;
};

/// Whoever runs the calls that a peer makes.
class CallDispatcher {
 public:
  virtual ~CallDispatcher() = default;
  /// On the delivery queue, one at a time, in the order in which they were sent. Returns an error when the method is
  /// unknown or its arguments have the wrong types: then it has run nothing, the connection logs it once and answers
  /// with it.
  [[nodiscard]] virtual Result<void> dispatch(IncomingCall& call) = 0;
};

/// What became of a call: the reply's values, or why there are none.
using ReplyHandler = UniqueFunction<void(Result<PropertyArray>)>;

class Connection {
 public:
  /// How an end of the connection came about, for whoever wants to know more than the two handlers tell.
  enum class End : std::uint8_t { none, here, goodbye, endOfFile, badFrame };

  /// Connects to the socket at `path`. Handlers are set on the result before `resume`. Waits at most a second when the
  /// daemon's queue is full; fails with `notConnected` or `notAllowed`. `deliveryQueue` may be a queue of `loop`.
  [[nodiscard]] static Result<std::shared_ptr<Connection>> connect(const std::string& path, EventLoop& loop,
                                                                   std::shared_ptr<Queue> deliveryQueue);
  /// Over a connected, non-blocking stream socket. `accepted`: this is the daemon's end, where a bare end of file ends
  /// in invalidation. `whenClosed` runs once, on any thread, when the socket has been closed.
  [[nodiscard]] static std::shared_ptr<Connection> adopt(FileDescriptor socket, PeerCredentials peer, bool accepted,
                                                         EventLoop& loop, std::shared_ptr<Queue> deliveryQueue,
                                                         Task whenClosed = {});

  explicit Connection(std::shared_ptr<ipc::ConnectionCore> core) noexcept : _core(std::move(core)) {}
  ~Connection();
  Connection(const Connection&) = delete;
  Connection& operator=(const Connection&) = delete;

  // Set before `resume`; not synchronised.

  /// Without a dispatcher every call of the peer is refused.
  void setExportedDispatcher(std::shared_ptr<CallDispatcher> dispatcher);
  /// The peer went away without a goodbye (it crashed, or its machine's service was stopped hard). Runs once, after
  /// everything that it had sent. A client's connection then stays as it is, every call failing, until it is
  /// invalidated; an accepted connection is invalidated at once.
  void setInterruptionHandler(Task handler);
  /// The last that is heard of the connection: it was ended here, or the peer said goodbye. Runs once.
  void setInvalidationHandler(Task handler);

  /// The peer has hung up or said goodbye, or can no longer be understood; frames that it sent before may still have to
  /// run, and the other two handlers come behind them. Runs at most once, on the loop's thread: it only posts.
  void setDepartureHandler(Task handler);

  /// Keeps what could not be sent for `takeUnsentCalls`. For a connection whose delivery queue is one of its loop's.
  void keepUnsent();

  /// Begins to read. Until then nothing is received; sending works.
  void resume();

  // From here on: any thread, any time, any number of times.

  /// Ends the connection from this side: frames that have not run yet are discarded, the call that is running now
  /// still gets its reply delivered, then a goodbye is sent and the socket closed (after at most a second), and the
  /// invalidation handler runs. Only posts: may be called under any lock.
  void invalidate();
  /// Ends the connection behind everything sent so far: nothing that was queued is lost, later calls are refused.
  /// Frames received meanwhile still run; pending replies fail. The invalidation handler runs as above. A peer that
  /// does not read is waited for as long as for one that is invalidated, or for `drainTime` if that is longer.
  void closeAfterSending(Duration drainTime = {});

  /// Sends a call that wants no answer. Never blocks. The descriptors are taken in any case.
  template <class Encode>
  [[nodiscard]] Result<void> send(std::uint32_t method, std::size_t argumentCount, Encode&& encode,
                                  std::vector<FileDescriptor> descriptors = {}) {
    ReplyHandler none;
    return sendCall(method, argumentCount, ipc::BodyEncoder(encode), std::move(descriptors), none);
  }
  /// The same with the room that is kept for replies as well: for the few bytes that a peer must not miss although it
  /// reads slowly.
  template <class Encode>
  [[nodiscard]] Result<void> sendFirmly(std::uint32_t method, std::size_t argumentCount, Encode&& encode) {
    return sendFirmCall(method, argumentCount, ipc::BodyEncoder(encode));
  }
  /// Sends a call; `reply` runs exactly once on the delivery queue, with the answer or with an error, unless this
  /// returns an error: then it has been destroyed unrun.
  template <class Encode>
  [[nodiscard]] Result<void> call(std::uint32_t method, std::size_t argumentCount, Encode&& encode, ReplyHandler reply,
                                  std::vector<FileDescriptor> descriptors = {}) {
    return sendCall(method, argumentCount, ipc::BodyEncoder(encode), std::move(descriptors), reply);
  }
  /// As `call`, but when it returns an error, `reply` is still the caller's, untouched.
  template <class Encode>
  [[nodiscard]] Result<void> callOrKeep(std::uint32_t method, std::size_t argumentCount, Encode&& encode,
                                        ReplyHandler& reply, std::vector<FileDescriptor> descriptors = {}) {
    return sendCall(method, argumentCount, ipc::BodyEncoder(encode), std::move(descriptors), reply);
  }
  /// The same with values at hand; an empty handler: no answer is wanted.
  [[nodiscard]] Result<void> callMethod(std::uint32_t method, const PropertyArray& arguments, ReplyHandler reply,
                                        std::vector<FileDescriptor> descriptors = {});

  /// Blocks until everything queued has been handed to the system, the connection has ended, or `timeout` passed
  /// (false). For a process about to exit; not on the loop's thread.
  [[nodiscard]] bool waitUntilSent(Duration timeout);

  /// Whether a call of the largest size would be taken now.
  [[nodiscard]] bool hasRoomForAnyCall() const noexcept;

  /// Of a connection that keeps what is unsent and whose peer went away: the arguments of the calls of this method that
  /// never left this process whole, oldest first. What the system had taken is not among them, read or not. On the
  /// loop's thread; sends nothing any more, and knows no calls the second time.
  [[nodiscard]] std::vector<PropertyArray> takeUnsentCalls(std::uint32_t method);

  /// True once it has ended or is about to: calls fail.
  [[nodiscard]] bool hasEnded() const noexcept;
  [[nodiscard]] End end() const noexcept;

  [[nodiscard]] const PeerCredentials& peer() const noexcept;
  /// "<connection 12 pid 345 uid 1000>": nothing in it was chosen by the peer.
  [[nodiscard]] const std::string& description() const noexcept;
  [[nodiscard]] const std::shared_ptr<Queue>& deliveryQueue() const noexcept;
  /// What lives as long as the connection is open: for whoever must not keep it alive.
  [[nodiscard]] const std::shared_ptr<ipc::ConnectionCore>& core() const noexcept { return _core; }

 private:
  [[nodiscard]] Result<void> sendCall(std::uint32_t method, std::size_t argumentCount, ipc::BodyEncoder encode,
                                      std::vector<FileDescriptor> descriptors, ReplyHandler& reply);
  [[nodiscard]] Result<void> sendFirmCall(std::uint32_t method, std::size_t argumentCount, ipc::BodyEncoder encode);

  const std::shared_ptr<ipc::ConnectionCore> _core;
};

}  // namespace velk
