// Two modules report their statistics together, in one event: periodic_modules [CLIENT-TYPE [REPORTS]]
//
// Each second the library asks the modules to measure; every other second it asks for what they have instead, merges
// it and sends it. Ends after as many reports as it was told, 1 if not.

#include <velkreporting/VelkReporting.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <latch>
#include <memory>
#include <string>

using velk::PropertyDictionary;

namespace {

/// What it has measured, updated and reported on threads of the library.
class Module {
 public:
  Module(std::string name, std::shared_ptr<std::latch> reports)
      : _name(std::move(name)), _reports(std::move(reports)) {}

  void serve(PropertyDictionary* statistics) {
    if (statistics == nullptr) {
      ++_measurements;
      return;
    }
    statistics->set(_name, _measurements.load());
    if (_left.fetch_sub(1) > 0) _reports->count_down();
  }
  void expectReports(int count) { _left = count; }

 private:
  const std::string _name;
  const std::shared_ptr<std::latch> _reports;
  std::atomic<int> _measurements{0};
  std::atomic<int> _left{0};
};

}  // namespace

int main(int argumentCount, char** arguments) {
  const int wanted = argumentCount > 2 ? std::atoi(arguments[2]) : 1;
  const auto client = velk::VelkReporting::initWithSessionInfo(
      PropertyDictionary{
          {"ComponentType", argumentCount > 1 ? std::atoi(arguments[1]) : 9}, {"ClientVersion", 1}, {"SessionID", 4}},
      PropertyDictionary{{"_clientName", "Example"}, {"_serviceName", "modules"}}, {});
  if (!client) {
    std::fprintf(stderr, "periodic_modules: the session info was refused\n");
    return EXIT_FAILURE;
  }
  client->startConfigurationWithCompletionHandler(nullptr);

  const auto reports = std::make_shared<std::latch>(2 * wanted);
  std::uint32_t number = 0;
  for (const char* name : {"reader", "writer"}) {
    const auto module = std::make_shared<Module>(name, reports);
    module->expectReports(wanted);
    const auto serve = [module](PropertyDictionary* statistics) { module->serve(statistics); };
    if (!client->registerPeriodicTaskForModule(++number, true, true, serve)) {
      std::fprintf(stderr, "periodic_modules: module %s was refused\n", name);
      return EXIT_FAILURE;
    }
  }
  client->startLogTimerWithInterval(1, 2, 103, 1);
  reports->wait();
  client->stopLogTimer();
  while (number > 0) client->unregisterPeriodTaskForModule(number--);  // waits until the tick is over
  std::printf("reported %d times\n", wanted);
  return EXIT_SUCCESS;
}
