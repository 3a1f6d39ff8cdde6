// A client's periodic tasks on a clock that the test moves, with callbacks that run when the test says so.
#pragma once

#include <gtest/gtest.h>

#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "client/LogTexts.h"
#include "client/PeriodicTasks.h"
#include "tests/support/ManualScheduler.h"
#include "tests/support/RecordingLog.h"

namespace velk::test {

class PeriodicFixture : public ::testing::Test {
 protected:
  using Service = std::function<void(PropertyDictionary*)>;

  PeriodicFixture() {
    _tasks = std::make_shared<PeriodicTasks>(
        _queue, _scheduler, [this](Task task) { _workers.push_back(std::move(task)); },
        [this](const PropertyDictionary& message) { _sent.push_back(message); });
  }
  ~PeriodicFixture() override { runAll(); }

  void registerModule(std::uint32_t module, bool update, bool report, Service service) {
    EXPECT_TRUE(_tasks->registerModule(module, update, report, std::move(service)));
    _scheduler.runUntilIdle();
  }
  void unregister(std::uint32_t module) {
    _beneath->sync([&] { _tasks->unregisterModule(module, true); });
  }
  void start(std::uint32_t interval, std::uint32_t multiplier = 1) {
    _tasks->startLogTimer(interval, multiplier, 3, 4);
    advance(Duration::zero());
  }
  void stop() {
    _tasks->stopLogTimer();
    _scheduler.runUntilIdle();
  }
  /// Without running callbacks.
  void advance(Duration duration) { _scheduler.advance(duration); }
  /// Whoever waits for a thread, one after the other, and what follows from it. Returns how many there were.
  std::size_t runWorkers() {
    std::size_t count = 0;
    for (auto workers = std::exchange(_workers, {}); !workers.empty(); workers.pop_front(), ++count) workers.front()();
    _scheduler.runUntilIdle();
    return count;
  }
  void runAll() {
    while (_scheduler.runUntilIdle() + runWorkers() != 0) {
    }
  }
  /// A tick as the timer makes it, to its end, callbacks included.
  void passInterval(Duration interval) {
    advance(interval);
    runAll();
  }
  /// A tick by hand, with its time-out in seconds.
  void tick(std::uint64_t updateTimeout, std::uint32_t multiplier = 1) {
    _queue->async([=, this] { _tasks->myPeriodicTask(3, 4, multiplier, updateTimeout); });
    advance(Duration::zero());
  }
  [[nodiscard]] std::size_t ticks() const { return static_cast<std::size_t>(_log.count(texts::kTickStarted)); }
  [[nodiscard]] bool sawTimeout() const { return _log.contains("Timeout"); }
  [[nodiscard]] static PropertyDictionary report(const PropertyDictionary& payload) {
    return {{"ParametersFlag", 1}, {"ParametersCategory", 3}, {"ParametersType", 4}, {"ParametersPayload", payload}};
  }

  RecordingLog _log;
  ManualScheduler _scheduler;
  std::deque<Task> _workers;
  std::vector<PropertyDictionary> _sent;
  const std::shared_ptr<Queue> _beneath = _scheduler.makeSerialQueue("com.tavrin.VelkReporting.main");
  const std::shared_ptr<ReportingQueue> _queue = std::make_shared<ReportingQueue>(_beneath);
  std::shared_ptr<PeriodicTasks> _tasks;
};

}  // namespace velk::test
