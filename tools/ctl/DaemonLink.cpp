#include "tools/ctl/DaemonLink.h"

#include <chrono>
#include <optional>

#include "platform/Directories.h"

namespace velk::ctl {
namespace {

// The connection itself gives up draining after a second.
constexpr std::chrono::seconds kLongestClose{5};
constexpr std::chrono::seconds kLongestSend{60};

}  // namespace

DaemonLink::DaemonLink(const std::string& socketPath) : _loop("velk.ctl") {
  auto connection = Connection::connect(socketPath, _loop, _loop.makeLoopQueue("com.tavrin.velkreportingctl"));
  if (connection) {
    _connection = std::move(*connection);
  } else {
    _whyNot = std::move(connection.error());
  }
}

Result<std::unique_ptr<DaemonLink>> DaemonLink::open(const std::string& socketPath) {
  auto link = std::make_unique<DaemonLink>(socketPath);
  if (link->_connection != nullptr) return link;
  const auto code = static_cast<ConnectionError>(link->_whyNot.code);
  if (code == ConnectionError::notAllowed) {
    return Failure(connectionError(code, "this user may not use the daemon's socket (" + link->_whyNot.description +
                                             "): it and the directories above it are to be open to everybody who "
                                             "reports"));
  }
  return Failure(connectionError(ConnectionError::notConnected,
                                 "no daemon answers at " + socketPath + " (" + link->_whyNot.description +
                                     "). Start velkreportingd, with `systemctl start velkreportingd.socket` where it "
                                     "is installed as a service; a socket elsewhere is named with --socket or "
                                     "VELKREPORTING_SOCKET"));
}

DaemonLink::~DaemonLink() {
  close();
  _loop.stop();
}

void DaemonLink::resume(std::shared_ptr<CallDispatcher> dispatcher, EndHandler handler) {
  _endHandler = std::move(handler);
  _connection->setExportedDispatcher(std::move(dispatcher));
  _connection->setInterruptionHandler([this] { connectionEnded(End::interrupted); });
  _connection->setInvalidationHandler([this] {
    connectionEnded(End::invalidated);
    connectionDropped();
  });
  _connection->resume();
}

void DaemonLink::connectionEnded(End end) {
  bool isNews = false;
  {
    Guard guard(_lock);
    isNews = !_closing && !_told;
  }
  if (isNews && _endHandler) _endHandler(end);
  Guard guard(_lock);
  _told = true;
  _changed.notifyAll();
}

void DaemonLink::connectionDropped() {
  Guard guard(_lock);
  _dropped = true;
  _changed.notifyAll();
}

Result<void> DaemonLink::call(const MethodDescription& method, const PropertyArray& arguments, ReplyHandler reply,
                              std::vector<FileDescriptor> descriptors) {
  // A daemon that reads slowly slows us down; a call that still does not fit says so itself.
  (void)_connection->waitUntilSent(kLongestSend);
  return _connection->callMethod(static_cast<std::uint32_t>(method.method), arguments, std::move(reply),
                                 std::move(descriptors));
}

Result<PropertyArray> DaemonLink::callAndWait(Method method, const PropertyArray& arguments,
                                              std::chrono::seconds limit) {
  struct Answer {
    Lock lock;
    Condition changed;
    std::optional<Result<PropertyArray>> reply VELK_GUARDED_BY(lock);
  };
  const auto answer = std::make_shared<Answer>();
  const Result<void> sent =
      _connection->callMethod(static_cast<std::uint32_t>(method), arguments, [answer](Result<PropertyArray> reply) {
        Guard guard(answer->lock);
        answer->reply = std::move(reply);
        answer->changed.notifyAll();
      });
  if (!sent) return Failure(sent.error());
  const auto deadline = std::chrono::steady_clock::now() + limit;
  Guard guard(answer->lock);
  while (!answer->reply) {
    if (answer->changed.waitUntil(answer->lock, deadline) || answer->reply) continue;
    return Failure(connectionError(ConnectionError::dropped,
                                   "the daemon did not answer within " + std::to_string(limit.count()) + " s"));
  }
  return *answer->reply;
}

bool DaemonLink::hasEnded() {
  if (!_connection->hasEnded()) return false;
  const auto deadline = std::chrono::steady_clock::now() + kLongestClose;
  Guard guard(_lock);
  while (!_told && std::chrono::steady_clock::now() < deadline) _changed.waitUntil(_lock, deadline);
  return true;
}

void DaemonLink::close() {
  if (_connection == nullptr) return;
  {
    Guard guard(_lock);
    _closing = true;
  }
  _connection->closeAfterSending();
  // After an interruption there is nothing left to send, and nobody to send it to.
  if (_connection->end() == Connection::End::endOfFile) _connection->invalidate();
  const auto deadline = std::chrono::steady_clock::now() + kLongestClose;
  Guard guard(_lock);
  while (!_dropped && std::chrono::steady_clock::now() < deadline) _changed.waitUntil(_lock, deadline);
  _connection.reset();
}

std::string socketPathOr(const std::string& given) { return given.empty() ? daemonSocketPath() : given; }

tools::ExitCode exitCodeForDaemon(const Error& error) {
  const auto code = static_cast<ConnectionError>(error.code);
  const bool refused = error.domain == kConnectionErrorDomain &&
                       (code == ConnectionError::refused || code == ConnectionError::notAllowed);
  return refused ? tools::ExitCode::noPermission : tools::ExitCode::unavailable;
}

}  // namespace velk::ctl
