#include "client/ClientRuntime.h"

#include <algorithm>
#include <cstdlib>

#include "platform/Directories.h"
#include "platform/Log.h"
#include "platform/LogSinks.h"

namespace velk {

namespace {

/// How soon the system is asked again for a thread that it refused.
constexpr Duration kThreadPause = std::chrono::milliseconds(100);

// Callbacks block in ways that the pool cannot see, so it has to be generous with threads from the start.
ThreadPoolOptions callbackThreads(EventLoop& loop) {
  ThreadPoolOptions options;
  options.runningThreads = 64;
  options.maximumThreads = 64;
  options.idleThreadLifetime = std::chrono::seconds(2);
  options.isNeverStopped = true;
  options.retryLater = [&loop](Task task) { loop.postAfter(kThreadPause, std::move(task)); };
  return options;
}

constinit PerProcess<ClientRuntime> runtimes;

/// Exit handlers are inherited by forked children: one is enough.
std::atomic<bool> watchesExit{false};

/// The suite of a user without a home: it keeps nothing.
class NoUserDefaults final : public UserDefaults {
 public:
  [[nodiscard]] std::optional<PropertyValue> value(std::string_view) const override { return std::nullopt; }
  [[nodiscard]] PropertyDictionary allValues() const override { return {}; }
  [[nodiscard]] Result<void> set(std::string_view, PropertyValue) override { return noHome(); }
  [[nodiscard]] Result<void> remove(std::string_view) override { return {}; }
  [[nodiscard]] Result<PropertyValue> valueOrStore(std::string_view, const std::function<PropertyValue()>&) override {
    return noHome();
  }

 private:
  static Failure noHome() { return failure("UserDefaults", 5, "the user has no home directory"); }
};

/// Without the administrator's defaults: identifiers are each user's own.
std::unique_ptr<UserDefaults> openDefaults() {
  std::string directory = libraryStateDirectory();
  if (directory.empty()) return std::make_unique<NoUserDefaults>();
  return openUserDefaults(kVelkReportingDefaultsSuite, std::move(directory), {});
}

}  // namespace

/// What is under way when the process exits has no other end: nobody releases it.
void ClientRuntime::processExits() {
  if (ClientRuntime* const runtime = runtimes.existing()) runtime->sendBeforeExit();
}

ClientRuntime& ClientRuntime::shared() {
  return runtimes.get([] { return new ClientRuntime; });
}

bool ClientRuntime::isOnLoop() {
  const ClientRuntime* const runtime = runtimes.existing();
  return runtime != nullptr && runtime->_loop.isCurrent();
}

ClientRuntime::ClientRuntime()
    : _loop("velkreporting"),
      _callbackThreads(makeThreadPool(callbackThreads(_loop))),
      _periodicTaskThreads(makeThreadPool(callbackThreads(_loop))),
      _oneMessageQueue(_loop.makeLoopQueue("com.tavrin.VelkReporting.sendOneMessageQueue")) {
  log::setSinkIfNone(log::makeLibrarySink(), log::librarySinkLevel());
  if (!watchesExit.exchange(true)) static_cast<void>(std::atexit(&ClientRuntime::processExits));
}

bool ClientRuntime::beginOneMessage(int maximum) {
  Guard guard(_lock);
  if (_oneMessagesUnderWay >= maximum) return false;
  ++_oneMessagesUnderWay;
  return true;
}

void ClientRuntime::endOneMessage() {
  Guard guard(_lock);
  if (--_oneMessagesUnderWay == 0) _noOneMessage.notifyAll();
}

bool ClientRuntime::waitForOneMessages(SteadyTime deadline) {
  Guard guard(_lock);
  while (_oneMessagesUnderWay != 0) {
    if (!_noOneMessage.waitUntil(_lock, deadline)) return _oneMessagesUnderWay == 0;
  }
  return true;
}

void ClientRuntime::addClient(std::weak_ptr<LeavingClient> client) {
  Guard guard(_lock);
  if (_clients.size() >= _clientsToSweep) {
    std::erase_if(_clients, [](const auto& other) { return other.expired(); });
    _clientsToSweep = 2 * _clients.size() + 64;
  }
  _clients.push_back(std::move(client));
}

bool ClientRuntime::hasClients() {
  Guard guard(_lock);
  return std::any_of(_clients.begin(), _clients.end(), [](const auto& client) { return !client.expired(); });
}

SteadyTime ClientRuntime::deadlineFor(Duration bound) const {
  return std::min(_loop.clock().steadyTime(), _exitBegun.load()) + bound;
}

void ClientRuntime::sendBeforeExit() {
  if (_loop.isCurrent()) return;  // it would wait for itself
  const SteadyTime begun = _loop.clock().steadyTime();
  _exitBegun = begun;
  std::vector<std::weak_ptr<LeavingClient>> clients;
  {
    Guard guard(_lock);
    clients = _clients;
  }
  for (const auto& client : clients) {
    if (const auto strong = client.lock()) strong->sendBeforeExit(begun);
  }
  if (!waitForOneMessages(begun + kEndOfLifeBound)) log::error("sendOneMessageWithSessionInfo: the process ends first");
}

void ClientRuntime::runCallback(Task callback) {
  _callbackThreads->makeSerialQueue("velkreporting.callback")->async(std::move(callback));
}

void ClientRuntime::runPeriodicTask(Task task) {
  _periodicTaskThreads->makeSerialQueue("com.tavrin.VelkReporting.PeriodicTask")->async(std::move(task));
}

std::shared_ptr<Queue> ClientRuntime::makeCallbackQueue(std::string label) {
  return _callbackThreads->makeSerialQueue(std::move(label));
}

UserDefaults& ClientRuntime::defaults() {
  {
    Guard guard(_lock);
    if (_defaults) return *_defaults;
  }
  auto opened = openDefaults();  // not under the lock: it may ask the user database
  Guard guard(_lock);
  if (!_defaults) _defaults = std::move(opened);
  return *_defaults;
}

}  // namespace velk
