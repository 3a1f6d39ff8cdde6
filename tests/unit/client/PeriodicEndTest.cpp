// What the last release leaves of a client's periodic tasks while a module does not return: nothing that wakes the
// library's thread.
#include "tests/unit/client/PeriodicFixture.h"

namespace velk::test {
namespace {

using namespace std::chrono_literals;

class PeriodicEndTest : public PeriodicFixture {
 protected:
  /// A tick that lasts until the test runs its callback.
  void beginTick() {
    registerModule(7, true, false, [](PropertyDictionary*) {});
    start(1, 0);
    ASSERT_EQ(_workers.size(), 1U);
    ASSERT_EQ(_scheduler.pendingDeadlines(), 1U);
  }
};

TEST_F(PeriodicEndTest, TheTimerStopsAtOnceAlthoughATickLasts) {
  beginTick();
  _tasks->withdrawAll(true);
  _scheduler.runUntilIdle();
  EXPECT_TRUE(_queue->isHeld());
  EXPECT_EQ(_scheduler.pendingDeadlines(), 0U);
}

TEST_F(PeriodicEndTest, ATickThatWaitsForItsTurnDoesNotBegin) {
  beginTick();
  advance(5s);
  _tasks->withdrawAll(true);
  runAll();
  passInterval(10s);
  EXPECT_EQ(ticks(), 1U);
  EXPECT_EQ(_scheduler.pendingDeadlines(), 0U);
}

TEST_F(PeriodicEndTest, ATimerThatIsStartedBehindATickNeverRuns) {
  registerModule(7, true, false, [](PropertyDictionary*) {});
  tick(100, 0);
  ASSERT_TRUE(_queue->isHeld());
  _tasks->startLogTimer(1, 0, 3, 4);
  _scheduler.runUntilIdle();
  _tasks->withdrawAll(true);
  runAll();
  EXPECT_EQ(_log.count("startLogTimerWithInterval: 1, 0"), 0);
  EXPECT_EQ(_scheduler.pendingDeadlines(), 0U);
}

TEST_F(PeriodicEndTest, AStopThatWaitedForTheTickFindsTheTimerThatItStops) {
  beginTick();
  _tasks->stopLogTimer();
  _tasks->withdrawAll(true);
  runAll();
  EXPECT_EQ(_log.count(texts::kTimerStopped), 1);
  EXPECT_EQ(_log.count(texts::kNoTimer), 0);
}

}  // namespace
}  // namespace velk::test
