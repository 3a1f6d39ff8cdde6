// What `velkreportingctl session` says and hears: turns lines into calls and replies into lines. Knows nothing of
// sockets and of where lines come from.
#pragma once

#include <cstddef>
#include <string_view>
#include <vector>

#include "ipc/Connection.h"
#include "ipc/SessionInterface.h"
#include "platform/FileDescriptor.h"
#include "platform/HandedFile.h"
#include "platform/Lock.h"
#include "tools/JsonLines.h"
#include "tools/ctl/SessionLine.h"

namespace velk::ctl {

/// The wire, as a conversation needs it.
class SessionWire {
 public:
  virtual ~SessionWire() = default;
  /// As Connection::callMethod. May block while the daemon reads slowly.
  [[nodiscard]] virtual Result<void> call(const MethodDescription& method, const PropertyArray& arguments,
                                          ReplyHandler reply, std::vector<FileDescriptor> descriptors) = 0;
};

/// Lines are handed over by one thread; replies and events come on the connection's queue. Outlives the connection.
class Conversation final : public ClientSessionReplyInterface {
 public:
  explicit Conversation(tools::JsonLines& lines) : _lines(lines) {}

  /// Calls what the line asks for, or writes what is wrong with it. Empty lines do nothing. Answers the seconds to
  /// wait before the next line is read.
  [[nodiscard]] double take(std::string_view line, int lineNumber, SessionWire& wire);

  /// A line that cannot even be read.
  void complain(int lineNumber, const std::string& why);

  /// Blocks until every reply has come (or failed, as all do when the connection ends).
  void waitForReplies();

  /// Writes {"event": name}.
  void announce(std::string_view name);

  void sendMessageToClient(std::optional<PropertyDictionary> sessionInfo, double timestamp, std::uint16_t category,
                           std::uint16_t type, std::optional<PropertyDictionary> payload) override;

 private:
  void call(const SessionCall& call, int lineNumber, SessionWire& wire);
  static void removeIfDelivered(const FileToHandOver& file, PropertyArray& reply);
  void hear(const MethodDescription& method, int lineNumber, const Result<PropertyArray>& reply);
  void countReply(int change);

  tools::JsonLines& _lines;

  Lock _lock;
  Condition _allHeard;
  int _pending VELK_GUARDED_BY(_lock) = 0;
};

}  // namespace velk::ctl
