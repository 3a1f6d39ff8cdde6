// Registrations, the log timer, and what ticks call and send.
#include "tests/unit/client/PeriodicFixture.h"

namespace velk::test {
namespace {

using namespace std::chrono_literals;

using PeriodicTasksTest = PeriodicFixture;

TEST_F(PeriodicTasksTest, NoCallbackIsRefused) {
  EXPECT_FALSE(_tasks->registerModule(7, true, true, nullptr));
  EXPECT_TRUE(_scheduler.runUntilIdle() == 0 && _log.lines().empty()) << "nothing is stored";
}

TEST_F(PeriodicTasksTest, LogsWhatAModuleWants) {
  const auto nothing = [](PropertyDictionary*) {};
  registerModule(7, true, false, nothing);
  registerModule(8, false, true, nothing);
  registerModule(4294967295, true, true, nothing);
  EXPECT_EQ(_log.count("registerPeriodicTaskForModule: 7, update, no reporting"), 1);
  EXPECT_EQ(_log.count("registerPeriodicTaskForModule: 8, no update, reporting"), 1);
  EXPECT_EQ(_log.count("registerPeriodicTaskForModule: 4294967295, update, reporting"), 1);
}

TEST_F(PeriodicTasksTest, KeepsTheSecondRegistrationOfAModule) {
  registerModule(7, true, true, [](PropertyDictionary*) { ADD_FAILURE() << "it was replaced"; });
  int calls = 0;
  registerModule(7, true, true, [&](PropertyDictionary*) { ++calls; });
  start(10, 2);
  runAll();
  EXPECT_EQ(calls, 1);
}

TEST_F(PeriodicTasksTest, UnregistersAndSaysWhetherItWasThere) {
  registerModule(7, true, true, [](PropertyDictionary*) { ADD_FAILURE() << "it was removed"; });
  unregister(8);
  EXPECT_EQ(_log.count("unregisterPeriodTaskForModule: 8 doesn't exist"), 1);
  unregister(7);
  EXPECT_EQ(_log.count("unregisterPeriodTaskForModule: 7 removed"), 1);
  unregister(7);
  EXPECT_EQ(_log.count("unregisterPeriodTaskForModule: 7 doesn't exist"), 1);
  start(10);
  runAll();
}

TEST_F(PeriodicTasksTest, ReportsOnEachTickOfTheMultipliersNumber) {
  std::vector<bool> reports;
  registerModule(7, true, true, [&](PropertyDictionary* statistics) {
    reports.push_back(statistics != nullptr);
    if (statistics == nullptr) return;
    EXPECT_TRUE(statistics->empty());
    statistics->set("n", reports.size());
  });
  start(10, 3);
  runAll();
  for (int count = 0; count < 6; ++count) passInterval(10s);
  EXPECT_EQ(reports, (std::vector<bool>{false, false, true, false, false, true, false}));
  EXPECT_EQ(_sent, (std::vector<PropertyDictionary>{report({{"n", 3}}), report({{"n", 6}})}));
}

TEST_F(PeriodicTasksTest, LogsEachStep) {
  registerModule(7, true, true, [](PropertyDictionary* statistics) {
    if (statistics != nullptr) statistics->set("n", 1);
  });
  _log.clear();
  start(10, 2);
  runAll();
  passInterval(10s);
  std::vector<std::string> lines;
  for (const auto& line : _log.lines()) lines.push_back(line.text);
  EXPECT_EQ(lines, (std::vector<std::string>{
                       "startLogTimerWithInterval: 10, 2", "_myPeriodicTask: Started RT periodic task",
                       "_myPeriodicTask: Finished RT updates for all registered modules.",
                       "_myPeriodicTask: Started RT periodic task", "_myPeriodicTask: All RT metrics collected",
                       "_myPeriodicTask: Sent realtime event after collection all RT metrics",
                       "_myPeriodicTask: Finished RT metrics collection"}));
}

TEST_F(PeriodicTasksTest, CallsOnlyModulesThatWantIt) {
  std::vector<std::string> calls;
  const auto record = [&](const char* name) {
    return [&calls, name](PropertyDictionary* statistics) {
      calls.push_back(std::string(name) + (statistics != nullptr ? " reports" : " updates"));
    };
  };
  registerModule(9, true, false, record("nine"));
  registerModule(1, false, true, record("one"));
  registerModule(5, false, true, record("five"));
  registerModule(3, false, false, record("three"));
  start(10, 2);
  runAll();
  passInterval(10s);
  EXPECT_EQ(calls, (std::vector<std::string>{"nine updates", "one reports", "five reports"}));
}

TEST_F(PeriodicTasksTest, AReportWithoutStatisticsSendsNothing) {
  registerModule(7, false, true, [](PropertyDictionary*) {});
  start(10);
  runAll();
  EXPECT_TRUE(_sent.empty());
  EXPECT_EQ(_log.count(texts::kMetricsCollected), 1);
  EXPECT_EQ(_log.count(texts::kSentRealtimeEvent), 0);
  EXPECT_EQ(_log.count(texts::kCollectionFinished), 1);
}

TEST_F(PeriodicTasksTest, TicksWithoutModulesAreOverAtOnce) {
  start(10, 2);
  passInterval(10s);
  EXPECT_EQ(_log.count(texts::kUpdatesFinished), 1);
  EXPECT_EQ(_log.count(texts::kCollectionFinished), 1);
  EXPECT_FALSE(_queue->isHeld());
}

TEST_F(PeriodicTasksTest, MergesDictionariesAndArraysUnderOneKey) {
  const auto adds = [](PropertyDictionary statistics) {
    return [statistics](PropertyDictionary* into) { into->merge(statistics); };
  };
  registerModule(1, false, true,
                 adds({{"stats", PropertyDictionary{{"a", 1}, {"b", 1}}}, {"list", PropertyArray{1}}, {"one", 1}}));
  registerModule(2, false, true,
                 adds({{"stats", PropertyDictionary{{"b", 2}, {"c", 2}}}, {"list", PropertyArray{2, 3}}, {"two", 2}}));
  start(10);
  runAll();
  EXPECT_EQ(_sent, std::vector<PropertyDictionary>{report({{"stats", PropertyDictionary{{"a", 1}, {"b", 2}, {"c", 2}}},
                                                           {"list", PropertyArray{1, 2, 3}},
                                                           {"one", 1},
                                                           {"two", 2}})});
}

TEST_F(PeriodicTasksTest, TheLaterFinisherReplacesWhatCannotBeExtended) {
  registerModule(1, false, true, [](PropertyDictionary* statistics) {
    statistics->merge({{"number", 1}, {"mixed", PropertyArray{1}}});
  });
  registerModule(2, false, true, [](PropertyDictionary* statistics) {
    statistics->merge({{"number", 2}, {"mixed", PropertyDictionary{{"a", 2}}}});
  });
  start(10);
  std::swap(_workers.front(), _workers.back());
  runAll();
  EXPECT_EQ(_sent, std::vector<PropertyDictionary>{report({{"number", 1}, {"mixed", PropertyArray{1}}})});
}

TEST_F(PeriodicTasksTest, ACallbackThatThrowsAddsNothing) {
  registerModule(1, true, true, [](PropertyDictionary* statistics) {
    if (statistics != nullptr) statistics->set("lost", 1);
    throw std::runtime_error("of the module");
  });
  registerModule(2, true, true, [](PropertyDictionary* statistics) {
    if (statistics != nullptr) statistics->set("kept", 1);
  });
  start(10, 2);
  runAll();
  passInterval(10s);
  EXPECT_EQ(_sent, std::vector<PropertyDictionary>{report({{"kept", 1}})});
  EXPECT_EQ(_log.count(log::Level::error, "_myPeriodicTask: Exception during invocation of the callback of module 1"),
            2);
}

TEST_F(PeriodicTasksTest, TheTimerIsStartedOnce) {
  start(10, 2);
  _log.clear();
  start(1, 1);
  EXPECT_TRUE(_log.lines().empty());
  passInterval(9s);
  EXPECT_EQ(ticks(), 0U) << "the first interval holds";
  passInterval(1s);
  EXPECT_EQ(ticks(), 1U);
  EXPECT_EQ(_scheduler.pendingDeadlines(), 1U);
}

TEST_F(PeriodicTasksTest, StoppingEndsTheTicksAndStartsTheCountAnew) {
  std::vector<bool> reports;
  registerModule(7, true, true, [&](PropertyDictionary* statistics) { reports.push_back(statistics != nullptr); });
  stop();
  EXPECT_EQ(_log.count("stopLogTimer: No timer is present."), 1);
  start(10, 2);
  runAll();
  stop();
  EXPECT_EQ(_log.count("stopLogTimer."), 1);
  passInterval(100s);
  EXPECT_EQ(ticks(), 1U);
  EXPECT_EQ(_scheduler.pendingDeadlines(), 0U);
  start(10, 2);
  runAll();
  EXPECT_EQ(reports, (std::vector<bool>{false, false})) << "a count that went on would report";
}

TEST_F(PeriodicTasksTest, WithAMultiplierOfZeroThereAreOnlyUpdates) {
  int updates = 0;
  registerModule(7, true, true, [&](PropertyDictionary* statistics) {
    EXPECT_EQ(statistics, nullptr);
    ++updates;
  });
  start(1, 0);
  runAll();
  for (int count = 0; count < 20; ++count) passInterval(1s);
  EXPECT_EQ(updates, 21);
}

TEST_F(PeriodicTasksTest, AnIntervalOfZeroStartsNothing) {
  start(0);
  EXPECT_EQ(_log.count(log::Level::error, texts::kIntervalIsZero), 1);
  EXPECT_EQ(_scheduler.pendingDeadlines(), 0U);
  stop();
  EXPECT_EQ(_log.count(texts::kNoTimer), 1);
}

TEST_F(PeriodicTasksTest, TheLongestIntervalIsNoBurst) {
  start(4294967295);
  runAll();
  EXPECT_EQ(ticks(), 1U);
  passInterval(std::chrono::hours(24 * 365 * 100));
  EXPECT_EQ(ticks(), 1U);
  passInterval(std::chrono::hours(24 * 365 * 40));
  EXPECT_EQ(ticks(), 2U);
}

TEST_F(PeriodicTasksTest, ABlockedModuleShowsNoTimeoutAndNoBurst) {
  registerModule(7, true, false, [](PropertyDictionary*) {});
  start(10, 0);
  ASSERT_EQ(_workers.size(), 1U);
  advance(35s);  // and the callback does not return
  EXPECT_EQ(ticks(), 1U);
  EXPECT_TRUE(_queue->isHeld());
  runAll();
  EXPECT_EQ(ticks(), 2U) << "one stands for those of 10, 20 and 30 seconds";
  passInterval(4s);
  EXPECT_EQ(ticks(), 2U);
  passInterval(1s);
  EXPECT_EQ(ticks(), 3U) << "at 40 seconds, as if nothing had been";
  EXPECT_FALSE(sawTimeout());
}

TEST_F(PeriodicTasksTest, ATimerThatWasStoppedDuringATickDoesNotTickAgain) {
  registerModule(7, true, false, [](PropertyDictionary*) {});
  start(10, 0);
  _tasks->stopLogTimer();
  advance(25s);  // its next tick waits behind the call that stops it
  runAll();
  EXPECT_EQ(ticks(), 1U);
  start(10, 0);
  runAll();
  EXPECT_EQ(ticks(), 2U) << "a new one does";
}

TEST_F(PeriodicTasksTest, CallsThatAreMadeDuringATickWaitForItsEnd) {
  registerModule(7, false, true, [](PropertyDictionary* statistics) { statistics->set("n", 1); });
  start(10);
  std::vector<int> order;
  for (int call = 1; call <= 3; ++call) _queue->async([&order, call] { order.push_back(call); });
  _beneath->async([&order] { order.push_back(0); });
  _scheduler.runUntilIdle();
  EXPECT_EQ(order, std::vector<int>{0}) << "what comes from the daemon does not wait";
  runAll();
  EXPECT_EQ(order, (std::vector<int>{0, 1, 2, 3}));
  EXPECT_EQ(_sent.size(), 1U);
}

TEST_F(PeriodicTasksTest, NoMoreThanACertainNumberOfCallsWaits) {
  registerModule(7, true, false, [](PropertyDictionary*) {});
  start(10, 0);
  std::size_t ran = 0;
  for (std::size_t call = 0; call < ReportingQueue::kMaximumWaiting + 2; ++call) _queue->async([&ran] { ++ran; });
  _scheduler.runUntilIdle();
  EXPECT_EQ(ran, 2U);
  EXPECT_EQ(_log.count(log::Level::error,
                       "_myPeriodicTask: 16384 calls wait for a module's callback; later ones no "
                       "longer do"),
            1);
  advance(10s);
  EXPECT_EQ(ticks(), 1U) << "there is never more than one at a time";
  runAll();
  EXPECT_EQ(ran, ReportingQueue::kMaximumWaiting + 2);
}

TEST_F(PeriodicTasksTest, MoreModulesThanThereIsRoomForAreRefused) {
  const auto nothing = [](PropertyDictionary*) {};
  for (std::uint32_t module = 0; module < PeriodicModules::kMaximumModules; ++module) {
    EXPECT_TRUE(_tasks->registerModule(module, true, true, nothing));
  }
  EXPECT_FALSE(_tasks->registerModule(4096, true, true, nothing));
  _scheduler.runUntilIdle();
  EXPECT_FALSE(_tasks->registerModule(4096, true, true, nothing));
  EXPECT_EQ(_log.count(log::Level::error, "registerPeriodicTaskForModule: 4096 is refused: 4096 modules are there"), 2);
  EXPECT_TRUE(_tasks->registerModule(4095, true, true, nothing)) << "it replaces one";
}

}  // namespace
}  // namespace velk::test
