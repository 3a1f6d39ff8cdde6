// A daemon that remembers what clients ask of it: the real listener and wire, sessions that the test answers for.
#pragma once

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "ipc/Listener.h"
#include "ipc/SessionProxies.h"
#include "platform/EventLoop.h"
#include "platform/Lock.h"
#include "tests/support/TemporaryDirectory.h"

namespace velk::test {

/// Its socket is what VELKREPORTING_SOCKET names from its construction on. Answers and records run on its own thread.
class FakeDaemon {
 public:
  struct Call {
    std::string method;
    PropertyArray arguments;
    std::size_t connection = 0;
  };

  FakeDaemon();
  ~FakeDaemon();
  FakeDaemon(const FakeDaemon&) = delete;
  FakeDaemon& operator=(const FakeDaemon&) = delete;

  /// Listens (again). Construction does not.
  void start();
  /// Goes away as a crash would: connections end without a goodbye.
  void stop();
  /// Ends every connection with a goodbye, and goes on.
  void endConnections();
  /// From now on every session is ended as soon as it is described.
  void refuseSessions();

  /// What configuration calls answer from now on.
  void setConfiguration(std::optional<PropertyArray> enabled, std::optional<PropertyArray> whitelist,
                        std::optional<PropertyArray> blacklist);
  /// Whether a server is said to have the files that are uploaded.
  void setDeliversUploads(bool delivers);
  void setMessageReply(std::optional<std::string> text);
  /// Where reports are said to be seen.
  void setDisplayUrl(std::optional<std::string> url);
  void setFlushError(std::optional<Error> error);
  enum class SingleMessages { answered, dropped, kept };
  /// What becomes of single messages from now on: answered at once, given up unanswered, or kept.
  void setSingleMessages(SingleMessages fate);
  /// Answers the single message that has been kept longest. Whatever is still kept in the end gets no answer.
  void answerKeptMessage();
  /// Held back while true: no call is answered or even run.
  void holdCalls(bool hold);

  [[nodiscard]] std::vector<Call> calls() const;
  /// Waits until `count` calls of that method have come; false when they did not in time.
  [[nodiscard]] bool waitForCalls(const std::string& method, std::size_t count) const;
  [[nodiscard]] std::size_t count(const std::string& method) const;
  /// Waits until that many connections have ended.
  [[nodiscard]] bool waitForEnds(std::size_t count) const;
  /// Calls the client of the newest connection back.
  void sendToClient(const std::optional<PropertyDictionary>& sessionInfo, double timestamp, std::uint16_t category,
                    std::uint16_t type, const std::optional<PropertyDictionary>& payload);

 private:
  class Session;
  struct State;

  const TemporaryDirectory _directory;
  const std::shared_ptr<State> _state;
  std::unique_ptr<EventLoop> _loop;
  std::unique_ptr<Listener> _listener;
};

}  // namespace velk::test
