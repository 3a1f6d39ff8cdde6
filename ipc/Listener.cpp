#include "ipc/Listener.h"

#include <atomic>
#include <cerrno>
#include <cstring>
#include <map>

#include "ipc/LogTexts.h"
#include "platform/Entitlements.h"
#include "platform/EventLoop.h"
#include "platform/LocalSocket.h"
#include "platform/Lock.h"
#include "platform/Log.h"
#include "platform/Semaphore.h"

namespace velk {
namespace {

/// Connections taken in one turn of the loop, before others get theirs.
constexpr int kAcceptsPerTurn = 32;

}  // namespace

class Listener::Core : public std::enable_shared_from_this<Listener::Core> {
 public:
  Core(FileDescriptor socket, FileDescriptor lock, std::string path, Options options)
      : _options(std::move(options)), _path(std::move(path)), _pathLock(std::move(lock)), _socket(std::move(socket)) {}

  void resume() {
    _options.loop->post([self = shared_from_this()] { self->startAccepting(); });
  }

  void stop() {
    {
      Guard guard(_lock);
      if (std::exchange(_stopped, true)) return;
    }
    Semaphore closed;
    _options.loop->post([self = shared_from_this(), signal = Signal(closed)] { self->_watch.reset(); });
    closed.wait();
    Guard guard(_lock);
    if (!_path.empty()) removeLocalSocket(_path);
    _socket = FileDescriptor();
    _pathLock = FileDescriptor();
  }

  // Accepting happens on the loop's thread alone, so nobody is taken while it looks.
  [[nodiscard]] bool stopIfUnused() {
    std::atomic<bool> unused{false};
    Semaphore looked;
    _options.loop->post([self = shared_from_this(), &unused, signal = Signal(looked)] {
      if (self->openConnections() != 0 || self->hasWaitingConnection()) return;
      self->_watch.reset();
      unused = true;
    });
    looked.wait();
    if (unused) stop();
    return unused;
  }

  [[nodiscard]] bool hasWaitingConnection() const {
    Guard guard(_lock);
    return _undecided != 0 || (!_stopped && isReadable(_socket.get()));
  }

  [[nodiscard]] std::size_t openConnections() const {
    Guard guard(_lock);
    return _open;
  }

 private:
  /// Signals when it goes, whether or not its task has run.
  class Signal {
   public:
    explicit Signal(Semaphore& semaphore) noexcept : _semaphore(&semaphore) {}
    Signal(Signal&& other) noexcept : _semaphore(std::exchange(other._semaphore, nullptr)) {}
    ~Signal() {
      if (_semaphore != nullptr) _semaphore->signal();
    }

   private:
    Semaphore* _semaphore;
  };

  struct User {
    std::size_t connections = 0;
    bool told = false;
  };

  // On the loop's thread.

  void startAccepting() {
    if (_watch || isStopped()) return;
    _watch = _options.loop->watch(_socket.get());
    if (_watch) return accept();
    log::error(ipc::texts::kAcceptRests, std::strerror(errno));
  }

  void accept() {
    for (int count = 0; count < kAcceptsPerTurn; ++count) {
      if (!_watch || isStopped()) return;
      const int error = acceptOne();
      if (error == 0) continue;
      if (error == EAGAIN || error == EWOULDBLOCK) break;
      return rest(error);
    }
    _watch->whenReadable([self = shared_from_this()] { self->accept(); });
  }

  /// Counts before it takes: a connection is always either in the socket's queue or in a count.
  int acceptOne() {
    addUndecided(1);
    auto accepted = acceptLocalSocket(_socket.get());
    if (accepted.error != 0) {
      addUndecided(-1);
      return accepted.error;
    }
    _resting = false;
    auto peer = credentialsOfPeer(accepted.socket.get());
    if (!peer || !admit(peer->uid)) {
      addUndecided(-1);
      return 0;
    }
    _options.acceptQueue->async(
        [self = shared_from_this(),
         pending = std::make_unique<Pending>(Pending{std::move(accepted.socket), std::move(*peer)})]() mutable {
          self->decide(std::move(*pending));
        });
    return 0;
  }

  /// The waiting connection makes the socket readable all the time: looking away for a moment keeps us from spinning.
  void rest(int error) {
    if (!std::exchange(_resting, true)) log::error(ipc::texts::kAcceptRests, std::strerror(error));
    _options.loop->postAfter(ipc::kAcceptRest, [self = shared_from_this()] {
      if (self->_watch) self->accept();
    });
  }

  bool admit(std::uint32_t uid) {
    {
      Guard guard(_lock);
      auto& user = _users[uid];
      if (user.connections < _options.maximumConnectionsPerUser) {
        ++user.connections;
        ++_open;
        return true;
      }
      if (std::exchange(user.told, true)) return false;
    }
    log::error(ipc::texts::kTooManyConnections, uid, _options.maximumConnectionsPerUser);
    return false;
  }

  // On the accept queue.

  struct Pending {
    FileDescriptor socket;
    PeerCredentials peer;
  };

  void decide(Pending pending) {
    const auto uid = pending.peer.uid;
    const auto connection =
        Connection::adopt(std::move(pending.socket), std::move(pending.peer), true, *_options.loop,
                          _options.makeDeliveryQueue(), [self = shared_from_this(), uid] { self->release(uid); });
    if (isStopped() || !_options.shouldAcceptNewConnection(connection)) connection->invalidate();
    addUndecided(-1);
  }

  // Any thread.

  void release(std::uint32_t uid) {
    Guard guard(_lock);
    --_open;
    const auto user = _users.find(uid);
    user->second.told = false;
    if (--user->second.connections == 0) _users.erase(user);
  }

  void addUndecided(int change) {
    Guard guard(_lock);
    _undecided += change;
  }

  [[nodiscard]] bool isStopped() const {
    Guard guard(_lock);
    return _stopped;
  }

  // Constant after construction.
  const Options _options;
  const std::string _path;

  // Used on the loop's thread only.
  std::unique_ptr<DescriptorWatch> _watch;
  bool _resting = false;

  // Guarded by _lock. The socket is closed only when the loop no longer uses it.
  mutable Lock _lock;
  FileDescriptor _pathLock;
  FileDescriptor _socket;
  std::map<std::uint32_t, User> _users VELK_GUARDED_BY(_lock);
  std::size_t _open VELK_GUARDED_BY(_lock) = 0;
  int _undecided VELK_GUARDED_BY(_lock) = 0;
  bool _stopped VELK_GUARDED_BY(_lock) = false;
};

Listener::Listener(std::shared_ptr<Core> core) noexcept : _core(std::move(core)) {}

Listener::~Listener() { stop(); }

Result<std::unique_ptr<Listener>> Listener::bind(const std::string& path, Options options) {
  auto bound = bindLocalSocket(path, options.program);
  if (!bound) return Failure(bound.error());
  return std::unique_ptr<Listener>(
      new Listener(std::make_shared<Core>(std::move(bound->socket), std::move(bound->lock), path, std::move(options))));
}

Result<std::unique_ptr<Listener>> Listener::adopt(FileDescriptor socket, Options options) {
  auto adopted = adoptLocalSocket(std::move(socket));
  if (!adopted) return Failure(adopted.error());
  return std::unique_ptr<Listener>(
      new Listener(std::make_shared<Core>(std::move(*adopted), FileDescriptor(), "", std::move(options))));
}

void Listener::resume() { _core->resume(); }

void Listener::stop() { _core->stop(); }

bool Listener::stopIfUnused() { return _core->stopIfUnused(); }

bool Listener::hasWaitingConnection() const { return _core->hasWaitingConnection(); }

std::size_t Listener::openConnections() const { return _core->openConnections(); }

}  // namespace velk
