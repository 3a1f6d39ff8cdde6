// A connection to the daemon as the commands use it: opened, used, closed, all within one command.
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <string>

#include "ipc/Connection.h"
#include "platform/EventLoop.h"
#include "platform/Lock.h"
#include "tools/ctl/Context.h"
#include "tools/ctl/Conversation.h"

namespace velk::ctl {

/// Lifecycle: open -> (dispatcher, end handler) -> resume -> calls -> close, or the daemon's end of it.
/// Made and destroyed by the main thread; everything of the connection runs on one thread of its own.
class DaemonLink final : public SessionWire {
 public:
  /// How a connection ended that was not closed here.
  enum class End { interrupted, invalidated };
  using EndHandler = std::function<void(End)>;

  [[nodiscard]] static Result<std::unique_ptr<DaemonLink>> open(const std::string& socketPath);
  explicit DaemonLink(const std::string& socketPath);
  /// As `close`.
  ~DaemonLink() override;
  DaemonLink(const DaemonLink&) = delete;
  DaemonLink& operator=(const DaemonLink&) = delete;

  /// `handler` runs at most once, on the connection's thread, and only for an end that came from elsewhere.
  void resume(std::shared_ptr<CallDispatcher> dispatcher, EndHandler handler);

  Result<void> call(const MethodDescription& method, const PropertyArray& arguments, ReplyHandler reply,
                    std::vector<FileDescriptor> descriptors) override;

  /// The daemon may have to fetch a configuration first, for several callers one after the other.
  static constexpr std::chrono::seconds kLongestAnswer{300};

  /// Calls and blocks until the reply is there, or the reason why there is none.
  [[nodiscard]] Result<PropertyArray> callAndWait(Method method, const PropertyArray& arguments,
                                                  std::chrono::seconds limit = kLongestAnswer);

  /// True once the daemon's side is gone; then the end handler has run, or this waits until it has.
  [[nodiscard]] bool hasEnded();

  /// Behind everything sent so far. Blocks until the connection has been taken apart, for some seconds at most.
  void close();

 private:
  void connectionEnded(End end);
  void connectionDropped();

  EventLoop _loop;
  std::shared_ptr<Connection> _connection;
  EndHandler _endHandler;
  /// Why there is no connection.
  Error _whyNot;

  Lock _lock;
  Condition _changed;
  bool _closing VELK_GUARDED_BY(_lock) = false;
  bool _told VELK_GUARDED_BY(_lock) = false;
  bool _dropped VELK_GUARDED_BY(_lock) = false;
};

/// The socket's path: `given`, or the daemon's own when that is empty.
[[nodiscard]] std::string socketPathOr(const std::string& given);
/// The status for a daemon that cannot be reached or does not answer.
[[nodiscard]] tools::ExitCode exitCodeForDaemon(const Error& error);

}  // namespace velk::ctl
