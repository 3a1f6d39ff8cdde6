// A process that reports periodically through the installed library:
//   periodic_client NUMBER
// Reads from its standard input until that ends:
//   register MODULE KEY N       its statistics are {KEY: N}
//   block MODULE / unblock      the module's callback does not return meanwhile
//   releasing MODULE            the module's callback drops the client
//   unregister MODULE / start INTERVAL MULTIPLIER CATEGORY TYPE / stop / send CATEGORY N / threads / release
// Writes a line for each of them when it is done, flushed at once ("threads" and the names of all), "update MODULE" and
// "report MODULE" when a callback is called, "ended MODULE" when what it owns has ended.

#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <future>
#include <iostream>
#include <map>
#include <memory>
#include <mutex>
#include <sstream>
#include <string>

#include "client/VelkReporting.h"
#include "tests/integration/clients/HostItself.h"

namespace {

using velk::PropertyDictionary;
using velk::VelkReporting;

void say(const std::string& line) {
  std::printf("%s\n", line.c_str());
  std::fflush(stdout);
}

/// What stops callbacks of one module at a time.
class Gate {
 public:
  void close(std::uint32_t module) {
    const std::lock_guard guard(_lock);
    _module = module;
    _isClosed = true;
  }
  void open() {
    const std::lock_guard guard(_lock);
    _isClosed = false;
    _opened.notify_all();
  }
  void pass(std::uint32_t module) {
    std::unique_lock guard(_lock);
    _opened.wait(guard, [&] { return !_isClosed || module != _module; });
  }

 private:
  std::mutex _lock;
  std::condition_variable _opened;
  bool _isClosed = false;
  std::uint32_t _module = 0;
};

class Host {
 public:
  explicit Host(std::shared_ptr<VelkReporting> client) : _client(std::move(client)) {}

  void obey(const std::string& line) {
    std::istringstream words(line);
    std::string command;
    std::uint32_t module = 0;
    words >> command;
    if (command == "register") {
      std::string key;
      int n = 0;
      words >> module >> key >> n;
      registerModule(module, [key, n](PropertyDictionary* statistics) {
        if (statistics != nullptr) statistics->set(key, n);
      });
    } else if (command == "releasing" && words >> module) {
      registerModule(module, [this](PropertyDictionary* statistics) {
        if (statistics != nullptr) statistics->set("last", true);
        _client.reset();
      });
    } else if (command == "block" && words >> module) {
      _gate->close(module);
    } else if (command == "unblock") {
      _gate->open();
    } else if (command == "unregister" && words >> module) {
      if (!_client->unregisterPeriodTaskForModule(module)) say("false");
    } else if (command == "start") {
      std::uint32_t interval = 0, multiplier = 0;
      std::uint16_t category = 0, type = 0;
      words >> interval >> multiplier >> category >> type;
      _client->startLogTimerWithInterval(interval, multiplier, category, type);
    } else if (command == "stop") {
      _client->stopLogTimer();
    } else if (command == "send") {
      std::uint16_t category = 0;
      int n = 0;
      words >> category >> n;
      _client->sendMessageWithCategory(category, 1, PropertyDictionary{{"n", n}});
    } else if (command == "threads") {
      return say("threads" + host::threadNames());
    } else if (command == "release") {
      _client.reset();
    }
    say(line);
  }

 private:
  template <class Service>
  void registerModule(std::uint32_t module, Service service) {
    std::shared_ptr<void> owned(nullptr, [module](void*) { say("ended " + std::to_string(module)); });
    const bool registered = _client->registerPeriodicTaskForModule(
        module, true, true, [module, service, gate = _gate, owned](PropertyDictionary* statistics) {
          say((statistics == nullptr ? "update " : "report ") + std::to_string(module));
          gate->pass(module);
          service(statistics);
        });
    if (!registered) say("false");
  }

  std::shared_ptr<VelkReporting> _client;
  const std::shared_ptr<Gate> _gate = std::make_shared<Gate>();
};

}  // namespace

int main(int argc, char** argv) {
  if (argc != 2) return 64;
  auto client = VelkReporting::initWithSessionInfo(
      PropertyDictionary{
          {"ComponentType", 9}, {"ClientVersion", 3}, {"SessionID", std::atoi(argv[1])}, {"BatchEvents", true}},
      PropertyDictionary{{"_clientName", "Library"}, {"_serviceName", "periodic"}}, {});
  if (!client) return 69;
  auto configured = std::make_shared<std::promise<bool>>();
  auto enabled = configured->get_future();
  client->startConfigurationWithCompletionHandler(
      [configured](const auto& backends) { configured->set_value(backends.has_value()); });
  if (!enabled.get()) return 69;
  say("ready");
  Host host(std::move(client));
  for (std::string line; std::getline(std::cin, line);) host.obey(line);
  return 0;
}
