// Waits and their limits, callbacks that change what is registered, and what callbacks own.
#include <limits>

#include "tests/unit/client/PeriodicFixture.h"

namespace velk::test {
namespace {

using namespace std::chrono_literals;

using PeriodicTickTest = PeriodicFixture;

/// Counts how often what a callback owns has ended.
class Owned {
 public:
  [[nodiscard]] VelkReportingServiceBlock block(std::function<void(PropertyDictionary*)> service = nullptr) const {
    std::shared_ptr<void> owner(nullptr, [ends = _ends](void*) { ++*ends; });
    return [owner = std::move(owner), service = std::move(service)](PropertyDictionary* statistics) {
      if (service) service(statistics);
    };
  }
  [[nodiscard]] int ends() const { return *_ends; }

 private:
  std::shared_ptr<int> _ends = std::make_shared<int>(0);
};

TEST_F(PeriodicTickTest, TheTimersTicksWaitWithoutALimit) {
  for (const std::uint64_t interval : {1, 2, 5, 10, 15, 18, 19, 30, 60, 300, 600, 900, 1800, 3600, 7200, 86400}) {
    EXPECT_FALSE(waitLimit(interval * 1'000'000'000)) << interval;
  }
  // Where 64 bits wrap there may be a limit, but nobody lives to see it.
  for (std::uint64_t interval = 1; interval <= 86'400; ++interval) {
    const auto limit = waitLimit(interval * 1'000'000'000);
    ASSERT_TRUE(!limit || *limit > std::chrono::hours(24)) << interval;
  }
}

TEST_F(PeriodicTickTest, OnlySecondsThatAreGivenByHandAreALimit) {
  EXPECT_EQ(waitLimit(0), Duration::zero());
  EXPECT_EQ(waitLimit(1), 950ms);
  EXPECT_EQ(waitLimit(10), 9500ms);
  EXPECT_EQ(waitLimit(1ULL << 55), Duration::zero()) << "64 bits wrap";
  EXPECT_FALSE(waitLimit(std::numeric_limits<std::uint64_t>::max())) << "no conversion out of range";
  EXPECT_FALSE(waitLimit(18'446'744'073));
}

TEST_F(PeriodicTickTest, AnUpdateThatLastsTooLongLetsTheQueueGoOn) {
  int calls = 0;
  registerModule(1, true, true, [&](PropertyDictionary*) { ++calls; });
  tick(1, 2);
  advance(949ms);
  EXPECT_TRUE(_queue->isHeld());
  advance(1ms);
  EXPECT_FALSE(_queue->isHeld());
  EXPECT_EQ(_log.count("_myPeriodicTask: Timeout during RT metrics update"), 1);
  EXPECT_EQ(_log.count(texts::kUpdatesFinished), 1);
  runAll();
  EXPECT_EQ(calls, 1) << "it had its slot";
  EXPECT_EQ(_log.count(texts::kUpdatesFinished), 1);
}

TEST_F(PeriodicTickTest, AModuleThatFindsNoSlotInTimeIsNotCalled) {
  int calls = 0;
  for (std::uint32_t module = 0; module < 6; ++module) {
    registerModule(module, true, true, [&](PropertyDictionary*) { ++calls; });
  }
  tick(1, 2);
  EXPECT_EQ(_workers.size(), 4U);
  advance(950ms);
  EXPECT_EQ(_log.count("_myPeriodicTask: Timeout scheduling RT metrics update tasks"), 1);
  EXPECT_EQ(_log.count(texts::kUpdateTimeout), 0);
  EXPECT_EQ(_log.count(texts::kUpdatesFinished), 1);
  runAll();
  EXPECT_EQ(calls, 4);
}

TEST_F(PeriodicTickTest, AReportThatLastsTooLongSendsWhatIsThere) {
  for (std::uint32_t module = 0; module < 2; ++module) {
    registerModule(module, true, true,
                   [module](PropertyDictionary* statistics) { statistics->set("module" + std::to_string(module), 1); });
  }
  tick(1, 1);
  auto late = std::move(_workers.back());
  _workers.pop_back();
  runWorkers();
  EXPECT_TRUE(_sent.empty());
  advance(950ms);
  EXPECT_EQ(_log.count("_myPeriodicTask: Timeout during periodic tasks metrics collection. Not all stats will be "
                       "reported"),
            1);
  EXPECT_EQ(_sent, std::vector<PropertyDictionary>{report({{"module0", 1}})});
  late();
  runAll();
  EXPECT_EQ(_sent.size(), 1U) << "what comes late is dropped";
}

TEST_F(PeriodicTickTest, AReportThatFindsNoSlotInTimeSendsWhatIsThere) {
  for (std::uint32_t module = 0; module < 5; ++module) {
    registerModule(module, true, true, [](PropertyDictionary* statistics) { statistics->set("n", 1); });
  }
  tick(1, 1);
  advance(950ms);
  EXPECT_EQ(_log.count("_myPeriodicTask: Timeout scheduling RT metrics report tasks"), 1);
  EXPECT_EQ(_log.count(texts::kReportTimeout), 0);
  EXPECT_EQ(_log.count(texts::kMetricsCollected), 1);
  EXPECT_TRUE(_sent.empty());
  tick(1, 1);
  runAll();
  EXPECT_EQ(_sent.size(), 1U) << "the count began anew, and the next report has all";
}

TEST_F(PeriodicTickTest, EachWaitHasTheWholeLimit) {
  for (std::uint32_t module = 0; module < 5; ++module) {
    registerModule(module, true, true, [this, module](PropertyDictionary*) {
      if (module == 0) advance(900ms);
      if (module == 4) advance(900ms);
    });
  }
  tick(1, 2);
  auto first = std::move(_workers.front());
  _workers.pop_front();
  first();  // calls module 0, and then, in its slot, module 4
  EXPECT_FALSE(sawTimeout());
  EXPECT_TRUE(_queue->isHeld());
  advance(50ms);
  EXPECT_EQ(_log.count(texts::kUpdateTimeout), 1);
  runAll();
}

TEST_F(PeriodicTickTest, ALimitOfNothingTimesOutAtOnce) {
  registerModule(1, true, true, [](PropertyDictionary*) {});
  tick(0, 2);
  EXPECT_EQ(_log.count(texts::kUpdateTimeout), 1);
  EXPECT_FALSE(_queue->isHeld());
}

TEST_F(PeriodicTickTest, WhatATimedOutTickLeavesRunningOutlivesTheRest) {
  Owned owned;
  EXPECT_TRUE(_tasks->registerModule(1, true, true, owned.block([](PropertyDictionary* statistics) {
    statistics->set("late", PropertyArray{1, 2, 3});
  })));
  _scheduler.runUntilIdle();
  tick(1, 1);
  advance(1s);
  auto late = std::move(_workers.front());
  _workers.clear();
  _tasks->withdrawAll(true);
  _beneath->sync([this] { _tasks->end(); });
  _tasks.reset();
  EXPECT_EQ(owned.ends(), 0);
  late();
  late = nullptr;
  EXPECT_EQ(owned.ends(), 1);
  EXPECT_TRUE(_sent.empty());
}

TEST_F(PeriodicTickTest, AModuleThatRegistersDuringATickIsNotInIt) {
  int calls = 0;
  registerModule(1, true, false, [&](PropertyDictionary*) {
    if (calls == 0) {
      EXPECT_TRUE(_tasks->registerModule(2, true, false, [&](PropertyDictionary*) { ++calls; }));
    }
  });
  start(10, 0);
  runAll();
  EXPECT_EQ(calls, 0);
  passInterval(10s);
  EXPECT_EQ(calls, 1);
}

TEST_F(PeriodicTickTest, AModuleMayUnregisterItselfAndOthersFromItsCallback) {
  int calls = 0;
  registerModule(1, true, false, [&](PropertyDictionary*) {
    ++calls;
    _tasks->unregisterModule(1, true);
    _tasks->unregisterModule(2, true);
    _tasks->unregisterModule(3, true);
  });
  registerModule(2, true, false, [&](PropertyDictionary*) { ADD_FAILURE() << "its callback was not called yet"; });
  start(10, 0);
  runAll();
  passInterval(10s);
  EXPECT_EQ(calls, 1);
  EXPECT_EQ(_log.count("unregisterPeriodTaskForModule: 1 removed"), 1);
  EXPECT_EQ(_log.count("unregisterPeriodTaskForModule: 2 removed"), 1);
  EXPECT_EQ(_log.count("unregisterPeriodTaskForModule: 3 doesn't exist"), 1);
}

TEST_F(PeriodicTickTest, AModuleMayStopAndStartTheTimerFromItsCallback) {
  std::vector<bool> reports;
  registerModule(1, true, true, [&](PropertyDictionary* statistics) {
    reports.push_back(statistics != nullptr);
    if (reports.size() != 2) return;
    _tasks->stopLogTimer();
    _tasks->startLogTimer(20, 3, 3, 4);
  });
  start(10, 3);
  runAll();
  passInterval(10s);
  passInterval(0s);  // the new timer's first tick, at once
  EXPECT_EQ(reports.size(), 3U);
  passInterval(10s);
  EXPECT_EQ(reports.size(), 3U) << "the new interval holds";
  passInterval(10s);
  passInterval(20s);
  EXPECT_EQ(reports, (std::vector<bool>{false, false, false, false, true})) << "the count began anew";
  stop();
}

TEST_F(PeriodicTickTest, AModuleThatNeverReturnsHoldsUpItsQueueAndNothingElse) {
  registerModule(1, true, true, [](PropertyDictionary*) {});
  start(10, 1);
  auto stuck = std::move(_workers.front());
  _workers.clear();
  bool ran = false;
  _queue->async([&ran] { ran = true; });
  for (int interval = 0; interval < 1000; ++interval) passInterval(10s);
  EXPECT_FALSE(ran);
  EXPECT_EQ(ticks(), 1U);
  EXPECT_LE(_scheduler.pendingTasks(), 1U) << "ticks do not pile up";
  EXPECT_FALSE(sawTimeout());
  stuck();  // it would not: but what it left must end with the test
  stuck = nullptr;
  runAll();
  EXPECT_TRUE(ran);
  stop();
}

TEST_F(PeriodicTickTest, WhatACallbackRegistersItMayTakeBack) {
  Owned owned;
  registerModule(1, true, false, [&](PropertyDictionary*) {
    EXPECT_TRUE(_tasks->registerModule(2, true, false, owned.block([](PropertyDictionary*) { ADD_FAILURE(); })));
    _tasks->unregisterModule(2, true);
    EXPECT_EQ(owned.ends(), 1);
  });
  start(10, 0);
  runAll();
  EXPECT_EQ(_log.count("unregisterPeriodTaskForModule: 2 removed"), 1);
  EXPECT_FALSE(_log.contains("registerPeriodicTaskForModule: 2")) << "its turn came too late";
  stop();
}

TEST_F(PeriodicTickTest, WhatACallbackOwnsMayUnregisterWhenItEnds) {
  bool hasEnded = false;
  std::shared_ptr<void> owner(nullptr, [&](void*) {
    _tasks->unregisterModule(2, true);  // would wait for ever for the tick that waits for this
    hasEnded = true;
  });
  EXPECT_TRUE(_tasks->registerModule(1, true, false, [&, owner = std::move(owner)](PropertyDictionary*) {
    _tasks->unregisterModule(1, true);
    EXPECT_FALSE(hasEnded) << "it is being used";
  }));
  EXPECT_TRUE(_tasks->registerModule(2, true, false, [](PropertyDictionary*) {}));
  start(10, 0);
  runWorkers();
  EXPECT_TRUE(hasEnded);
  EXPECT_EQ(_log.count("unregisterPeriodTaskForModule: 2 removed"), 1);
}

TEST_F(PeriodicTickTest, UnregisteringFromWorkOnTheQueueDoesNotWait) {
  Owned owned;
  EXPECT_TRUE(_tasks->registerModule(1, true, true, owned.block()));
  start(10, 0);
  _beneath->async([this] { _tasks->unregisterModule(1, true); });
  _scheduler.runUntilIdle();
  EXPECT_EQ(_log.count("unregisterPeriodTaskForModule: 1 removed"), 1);
  EXPECT_EQ(owned.ends(), 0) << "not on the thread of the queue, and not before the tick has let go of it";
  runAll();
  EXPECT_EQ(owned.ends(), 1);
}

TEST_F(PeriodicTickTest, WhatACallbackOwnsEndsOnce) {
  Owned never, replaced, removed, withdrawn;
  for (const auto* owned : {&never, &replaced, &removed, &withdrawn}) {
    EXPECT_TRUE(_tasks->registerModule(owned == &never ? 1 : 2, true, true, owned->block()));
    if (owned == &removed) {
      _scheduler.runUntilIdle();
      start(10, 0);
      runAll();
      unregister(2);
      runAll();
      EXPECT_EQ(removed.ends(), 1);
      stop();
    }
  }
  EXPECT_EQ(replaced.ends(), 1);
  EXPECT_FALSE(_tasks->registerModule(3, true, true, nullptr));
  _tasks->withdrawAll(true);
  _beneath->sync([this] { _tasks->end(); });
  EXPECT_EQ(never.ends(), 1);
  EXPECT_EQ(withdrawn.ends(), 1) << "it was still waiting for its turn";
  runAll();
  _tasks.reset();
  for (const auto* owned : {&never, &replaced, &removed, &withdrawn}) EXPECT_EQ(owned->ends(), 1);
}

TEST_F(PeriodicTickTest, AClientThatGoesCallsNobodyAnyMoreAndSendsWhatItHas) {
  for (std::uint32_t module = 0; module < 6; ++module) {
    registerModule(module, true, true, [this, module](PropertyDictionary* statistics) {
      statistics->set("module" + std::to_string(module), 1);
      _tasks->withdrawAll(true);
    });
  }
  start(10, 1);
  runAll();
  EXPECT_EQ(_sent, std::vector<PropertyDictionary>{report({{"module0", 1}})});
  passInterval(100s);
  EXPECT_EQ(ticks(), 1U);
}

}  // namespace
}  // namespace velk::test
