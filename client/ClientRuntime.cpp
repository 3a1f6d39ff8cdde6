#include "client/ClientRuntime.h"

#include "platform/Directories.h"
#include "platform/Log.h"
#include "platform/LogSinks.h"

namespace velk {

namespace {

// Callbacks block in ways that the pool cannot see, so it has to be generous with threads from the start.
ThreadPoolOptions callbackThreads() {
  ThreadPoolOptions options;
  options.runningThreads = 64;
  options.maximumThreads = 64;
  options.idleThreadLifetime = std::chrono::seconds(2);
  options.isNeverStopped = true;
  return options;
}

}  // namespace

ClientRuntime& ClientRuntime::shared() {
  // A lock would be of no use in a forked child, where it may be held by a thread that is not there: the pointer is
  // exchanged instead, and whoever loses the race throws its own away before it has started a thread.
  static std::atomic<ClientRuntime*> current{nullptr};
  ClientRuntime* runtime = current.load(std::memory_order_acquire);
  if (runtime != nullptr && runtime->_generation == processGeneration()) return *runtime;
  auto* fresh = new ClientRuntime;
  if (current.compare_exchange_strong(runtime, fresh, std::memory_order_acq_rel)) return *fresh;
  delete fresh;
  return *runtime;
}

ClientRuntime::ClientRuntime()
    : _loop("velkreporting"),
      _callbackThreads(makeThreadPool(callbackThreads())),
      _periodicTaskThreads(makeThreadPool(callbackThreads())),
      _oneMessageQueue(_loop.makeLoopQueue("com.tavrin.VelkReporting.sendOneMessageQueue")) {
  log::setSinkIfNone(log::makeLibrarySink(), log::librarySinkLevel());
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
  Guard guard(_lock);
  if (!_defaults) {
    const Directories directories = clientDirectories();
    _defaults = openUserDefaults(kVelkReportingDefaultsSuite, directories.state, directories.configuration);
  }
  return *_defaults;
}

}  // namespace velk
