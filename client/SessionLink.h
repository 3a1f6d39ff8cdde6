// A client's link to its session in the daemon: connects at first use, and again after the daemon went away, whether or
// not there is something to say. To each connection the session is described with all that has been said of it so far,
// even while no daemon was there to hear of it: its description with the latest user info, its configuration if it was
// asked for, the digest key. Other calls that were already written are not made again.
//
// All methods run on the client's reporting queue, except where they say otherwise. Owned by the implementation.
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "foundation/PropertyValue.h"
#include "ipc/Connection.h"
#include "ipc/SessionProxies.h"
#include "platform/Clock.h"
#include "platform/Lock.h"

namespace velk {

class ClientRuntime;
class CurrentEventLists;

/// What the daemon must know of a session, in the order in which it is told.
struct SessionDescription {
  PropertyDictionary sessionInfo;
  std::optional<PropertyDictionary> userInfo;
  PropertyArray frameworksToCheck;
  bool hasAggregationBlock = false;

  /// Keeps what a daemon that is asked for its states with this user info holds afterwards.
  void receiveUserInfo(const std::optional<PropertyDictionary>& newUserInfo);

  bool isConfigured = false;
  std::optional<ByteData> digestKey;
  std::int32_t digestAlgorithm = 0;
};

class SessionLink : public std::enable_shared_from_this<SessionLink> {
 public:
  /// `lists` and `exported` are shared with the connections made here.
  SessionLink(ClientRuntime& runtime, std::shared_ptr<Queue> queue, SessionDescription description,
              std::shared_ptr<ClientSessionReplyInterface> exported, std::shared_ptr<CurrentEventLists> lists);

  using UnsentEvents = std::vector<PropertyDictionary>;

  /// Queues the first attempt to connect: whoever creates a client does not wait for a daemon whose own queue is full.
  /// Any thread, before anything else is on the queue. Fine when nobody answers. `whenLost` runs on the queue, each
  /// time that a connection was lost, with the events that had not left it, oldest first;
  /// once the link is closed the log hears of them instead.
  void open(std::function<void(UnsentEvents)> whenLost);

  /// A connection that works, made now if need be; null when nobody answers. After an attempt that failed, or a
  /// connection that ended within a second, the next one is made at the earliest after a pause that grows from 100 ms
  /// to 10 s; it is made even if nobody asks for it again.
  [[nodiscard]] std::shared_ptr<Connection> connect();

  /// The connection as it is, or null. Any thread.
  [[nodiscard]] std::shared_ptr<Connection> current() const;

  /// For the description after the next reconnection.
  [[nodiscard]] SessionDescription& description() { return _description; }

  /// How long until `connect` would try again.
  [[nodiscard]] Duration pauseLeft() const;

  /// For a client whose last moments have come: the next `connect` tries at once, and pauses are short from here on.
  void retryAtOnce();
  /// Whether somebody in his last moments should wait for a daemon that does not answer. It was there, and went away no
  /// longer ago than a restart takes: then it should. Where no daemon is, or has been for long, nobody waits for one.
  [[nodiscard]] bool mayComeBack() const;

  /// Says goodbye behind what was sent; a daemon that reads slowly is waited for that long, or for a connection's own
  /// moment if that is longer. No connection is made any more.
  void close(Duration drainTime);

 private:
  [[nodiscard]] std::shared_ptr<Connection> tryToConnect();
  [[nodiscard]] std::shared_ptr<Connection> makeConnection();
  void reportNoConnection(const Error& error);
  void describeSession(const std::shared_ptr<Connection>& connection);
  static void tell(const std::shared_ptr<SessionLink>& link, std::shared_ptr<ipc::ConnectionCore> core,
                   void (SessionLink::*ended)(Connection&));
  void wasInterrupted(Connection& connection);
  void wasInvalidated(Connection& connection);
  void wasLost(Connection& connection);
  void forgetConnection();
  void growPause();
  void reconnectLater();
  [[nodiscard]] SteadyTime now() const;
  void setCurrent(std::shared_ptr<Connection> connection);

  ClientRuntime& _runtime;
  const std::shared_ptr<Queue> _queue;
  const std::shared_ptr<ClientSessionReplyInterface> _exported;
  const std::shared_ptr<CurrentEventLists> _lists;

  mutable Lock _lock;
  std::shared_ptr<Connection> _connection VELK_GUARDED_BY(_lock);

  // On the reporting queue (and in `open`, before anything is on it).
  SessionDescription _description;
  std::function<void(UnsentEvents)> _whenLost;
  bool _isClosed = false;
  SteadyTime _connectedAt{};
  SteadyTime _nextAttempt{};
  std::optional<SteadyTime> _lostAt;
  Duration _pause{};
  Duration _longestPause = std::chrono::seconds(10);  ///< of somebody who has something to say
  Duration _quietPause{};
  bool _reconnects = false;
  /// Why there was no connection last time, where somebody had to be told.
  std::string _reportedProblem;
};

}  // namespace velk
