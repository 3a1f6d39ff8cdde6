#include "ipc/Listener.h"

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstring>
#include <deque>
#include <map>
#include <utility>

#include "ipc/ConnectionCore.h"
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

  [[nodiscard]] Result<void> resume() {
    if (auto started = _options.loop->start(); !started) return started;
    Result<void> result = failure("listener", ECANCELED, "the event loop has ended");
    Semaphore done;
    _options.loop->post(
        [self = shared_from_this(), &result, signal = Signal(done)] { result = self->startAccepting(); });
    done.wait();
    return result;
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

  [[nodiscard]] bool waitUntilDecided(Duration limit) {
    BlockingScope blocking;
    const auto deadline = std::chrono::steady_clock::now() + limit;
    Guard guard(_lock);
    while (_deciding) {
      if (!_decided.waitUntil(_lock, deadline) && _deciding) return false;
    }
    return true;
  }

  // Accepting happens on the loop's thread alone, so nobody is taken while it looks.
  [[nodiscard]] static bool stopIfUnused(std::span<const std::unique_ptr<Listener>> listeners) {
    if (listeners.empty()) return true;
    std::atomic<bool> unused{false};
    Semaphore looked;
    listeners.front()->_core->_options.loop->post([listeners, &unused, signal = Signal(looked)] {
      for (const auto& listener : listeners) {
        if (listener->openConnections() != 0 || listener->hasWaitingConnection()) return;
      }
      for (const auto& listener : listeners) listener->_core->_watch.reset();
      unused = true;
    });
    looked.wait();
    if (unused) {
      for (const auto& listener : listeners) listener->stop();
    }
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

  struct Pending;
  /// Of one user's peers.
  struct LookUps {
    std::size_t underWay = 0;
    std::deque<std::unique_ptr<Pending>> waiting;
  };

  // On the loop's thread.

  [[nodiscard]] Result<void> startAccepting() {
    if (_watch) return {};
    if (isStopped()) return failure("listener", ECANCELED, "the listener has been stopped");
    _watch = _options.loop->watch(_socket.get());
    if (!_watch)
      return failure("listener", errno, std::string("the socket cannot be watched: ") + std::strerror(errno));
    accept();
    return {};
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
        [self = shared_from_this(), pending = std::make_unique<Pending>(
                                        Pending{std::move(accepted.socket), std::move(*peer), nullptr})]() mutable {
          self->examine(std::move(pending));
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
    std::shared_ptr<Queue> queue;
  };

  void examine(std::unique_ptr<Pending> pending) {
    pending->queue = _options.makeDeliveryQueue();
    if (!_options.dependsOnExecutable || !_options.dependsOnExecutable(pending->peer)) {
      return decide(std::move(pending));
    }
    {
      Guard guard(_lock);
      auto& lookUps = _lookUps[pending->peer.uid];
      if (lookUps.underWay == ipc::kMaximumLookUpsPerUser) {
        lookUps.waiting.push_back(std::move(pending));
        return;
      }
      ++lookUps.underWay;
    }
    lookUp(std::move(pending));
  }

  void decide(std::unique_ptr<Pending> pending) {
    const auto uid = pending->peer.uid;
    if (!beginsToDecide()) {
      pending->socket = FileDescriptor();
      release(uid);
      addUndecided(-1);
      return;
    }
    auto core = std::make_shared<ipc::ConnectionCore>(std::move(pending->socket), std::move(pending->peer), true,
                                                      *_options.loop, std::move(pending->queue),
                                                      [self = shared_from_this(), uid] { self->release(uid); });
    core->share(_unread, _unsent);
    const auto connection = std::make_shared<Connection>(std::move(core));
    if (!_options.shouldAcceptNewConnection(connection)) connection->invalidate();
    addUndecided(-1);
    {
      Guard guard(_lock);
      _deciding = false;
    }
    _decided.notifyAll();
  }

  /// False once the listener has been stopped: `waitUntilDecided` has nothing left to wait for.
  [[nodiscard]] bool beginsToDecide() {
    Guard guard(_lock);
    _deciding = !_stopped;
    return _deciding;
  }

  // Any thread.

  /// May take for ever, on the connection's own queue.
  void lookUp(std::unique_ptr<Pending> pending) {
    const auto queue = pending->queue;
    queue->async([self = shared_from_this(), pending = std::move(pending)]() mutable {
      const auto uid = pending->peer.uid;
      {
        const BlockingScope blocking;
        pending->peer.executable = self->_options.findExecutable(pending->peer.pid, uid).value_or("");
      }
      self->_options.acceptQueue->async(
          [self, pending = std::move(pending)]() mutable { self->decide(std::move(pending)); });
      if (auto next = self->nextToLookUp(uid)) self->lookUp(std::move(next));
    });
  }

  /// Who waited for the look-up that has just ended; null when none did.
  [[nodiscard]] std::unique_ptr<Pending> nextToLookUp(std::uint32_t uid) {
    Guard guard(_lock);
    const auto lookUps = _lookUps.find(uid);
    if (!lookUps->second.waiting.empty()) {
      auto next = std::move(lookUps->second.waiting.front());
      lookUps->second.waiting.pop_front();
      return next;
    }
    if (--lookUps->second.underWay == 0) _lookUps.erase(lookUps);
    return nullptr;
  }

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
  // Self-synchronised.
  const std::shared_ptr<ipc::SharedRoom> _unread =
      std::make_shared<ipc::SharedRoom>(ipc::kMaximumUnreadBytesOfAll, ipc::kMaximumUnreadBytesOfUser);
  const std::shared_ptr<ipc::SharedRoom> _unsent =
      std::make_shared<ipc::SharedRoom>(ipc::kMaximumOutboxBytesOfAll, ipc::kMaximumOutboxBytesOfUser);

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
  std::map<std::uint32_t, LookUps> _lookUps VELK_GUARDED_BY(_lock);
  bool _stopped VELK_GUARDED_BY(_lock) = false;
  /// A decision is under way on the accept queue.
  bool _deciding VELK_GUARDED_BY(_lock) = false;
  Condition _decided;
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

Result<void> Listener::resume() { return _core->resume(); }

void Listener::stop() { _core->stop(); }

bool Listener::waitUntilDecided(Duration limit) { return _core->waitUntilDecided(limit); }

bool Listener::stopIfUnused(std::span<const std::unique_ptr<Listener>> listeners) {
  return Core::stopIfUnused(listeners);
}

bool Listener::hasWaitingConnection() const { return _core->hasWaitingConnection(); }

std::size_t Listener::openConnections() const { return _core->openConnections(); }

}  // namespace velk
