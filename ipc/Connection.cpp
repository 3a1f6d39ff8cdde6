#include "ipc/Connection.h"

#include <cerrno>

#include "ipc/ConnectionCore.h"
#include "ipc/Limits.h"
#include "platform/LocalSocket.h"

namespace velk {

Error connectionError(ConnectionError code, std::string description) {
  return {std::string(kConnectionErrorDomain), static_cast<int>(code), std::move(description)};
}

Reply::~Reply() {
  if (_serial != 0) fail(connectionError(ConnectionError::dropped, "the call was given up unanswered"));
}

void Reply::sendEncoded(std::size_t count, ipc::BodyEncoder encode) {
  const auto serial = std::exchange(_serial, 0);
  if (serial == 0) return;
  if (const auto connection = _connection.lock()) connection->sendReply(serial, count, encode, _prompt);
}

void Reply::sendValues(const PropertyArray& values) {
  send(values.size(), [&](CborWriter& writer) {
    for (const auto& value : values) writer.value(value);
  });
}

void Reply::fail(const Error& error) {
  const auto serial = std::exchange(_serial, 0);
  if (serial == 0) return;
  if (const auto connection = _connection.lock()) connection->sendErrorReply(serial, error, _prompt);
}

Result<std::shared_ptr<Connection>> Connection::connect(const std::string& path, EventLoop& loop,
                                                        std::shared_ptr<Queue> deliveryQueue) {
  auto socket = connectLocalSocket(path, ipc::kConnectTime);
  if (!socket) {
    const bool refused = socket.error().code == EACCES || socket.error().code == EPERM;
    return Failure(connectionError(refused ? ConnectionError::notAllowed : ConnectionError::notConnected,
                                   socket.error().description));
  }
  auto peer = credentialsOfPeer(socket->get());
  if (!peer) return Failure(connectionError(ConnectionError::notConnected, path + ": nobody knows who answers there"));
  return adopt(std::move(*socket), std::move(*peer), false, loop, std::move(deliveryQueue));
}

std::shared_ptr<Connection> Connection::adopt(FileDescriptor socket, PeerCredentials peer, bool accepted,
                                              EventLoop& loop, std::shared_ptr<Queue> deliveryQueue, Task whenClosed) {
  return std::make_shared<Connection>(std::make_shared<ipc::ConnectionCore>(
      std::move(socket), std::move(peer), accepted, loop, std::move(deliveryQueue), std::move(whenClosed)));
}

Connection::~Connection() = default;

void Connection::setExportedDispatcher(std::shared_ptr<CallDispatcher> dispatcher) {
  _core->dispatcher = std::move(dispatcher);
}

void Connection::setInterruptionHandler(Task handler) { _core->interruptionHandler = std::move(handler); }

void Connection::setInvalidationHandler(Task handler) { _core->invalidationHandler = std::move(handler); }

void Connection::setDepartureHandler(Task handler) { _core->departureHandler = std::move(handler); }

void Connection::resume() { _core->resume(); }

void Connection::invalidate() { _core->invalidate(); }

void Connection::closeAfterSending(Duration drainTime) { _core->closeAfterSending(drainTime); }

Result<void> Connection::callMethod(std::uint32_t method, const PropertyArray& arguments, ReplyHandler reply,
                                    std::vector<FileDescriptor> descriptors) {
  const auto encode = [&](CborWriter& writer) {
    for (const auto& argument : arguments) writer.value(argument);
  };
  return sendCall(method, arguments.size(), ipc::BodyEncoder(encode), std::move(descriptors), reply);
}

bool Connection::waitUntilSent(Duration timeout) { return _core->waitUntilSent(timeout); }

void Connection::keepUnsent() { _core->keepsUnsent = true; }

bool Connection::hasRoomForAnyCall() const noexcept { return _core->hasRoomForAnyCall(); }

std::vector<PropertyArray> Connection::takeUnsentCalls(std::uint32_t method) { return _core->takeUnsentCalls(method); }

bool Connection::hasEnded() const noexcept { return _core->hasEnded(); }

Connection::End Connection::end() const noexcept { return _core->end(); }

const PeerCredentials& Connection::peer() const noexcept { return _core->peer; }

const std::string& Connection::description() const noexcept { return _core->description; }

const std::shared_ptr<Queue>& Connection::deliveryQueue() const noexcept { return _core->queue; }

Result<void> Connection::sendCall(std::uint32_t method, std::size_t argumentCount, ipc::BodyEncoder encode,
                                  std::vector<FileDescriptor> descriptors, ReplyHandler& reply) {
  return _core->sendCall(method, argumentCount, encode, std::move(descriptors), reply);
}

Result<void> Connection::sendFirmCall(std::uint32_t method, std::size_t argumentCount, ipc::BodyEncoder encode) {
  ReplyHandler none;
  return _core->sendCall(method, argumentCount, encode, {}, none, ipc::kMaximumOutboxBytesWithReplies);
}

}  // namespace velk
