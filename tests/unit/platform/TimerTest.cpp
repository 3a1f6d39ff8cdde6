#include <gtest/gtest.h>

#include <vector>

#include "platform/TimerSchedule.h"
#include "tests/support/ManualScheduler.h"

namespace velk {
namespace {

using namespace std::chrono_literals;
using test::ManualScheduler;

constexpr SteadyTime at(Duration duration) { return SteadyTime(duration); }

class TimerScheduleTest : public testing::Test {
 protected:
  TimerSchedule::Identifier add(SteadyTime deadline, Duration leeway, int number) {
    return schedule.add(deadline, leeway, [this, number](SteadyTime) { called.push_back(number); });
  }
  std::vector<int> due(SteadyTime now) {
    called.clear();
    for (auto& action : schedule.takeDue(now)) action(now);
    return called;
  }

  TimerSchedule schedule;
  std::vector<int> called;
};

TEST_F(TimerScheduleTest, HandsOutByDeadlineThenByOrderOfAdding) {
  add(at(3s), 0s, 3);
  add(at(1s), 0s, 1);
  add(at(3s), 0s, 4);
  add(at(2s), 0s, 2);
  add(at(4s), 0s, 5);
  EXPECT_EQ(due(at(999ms)), std::vector<int>{});
  EXPECT_EQ(due(at(3s)), (std::vector{1, 2, 3, 4}));
  EXPECT_EQ(schedule.size(), 1u);
}

TEST_F(TimerScheduleTest, WakesOnceForDeadlinesWithinOneLeeway) {
  add(at(10s), 2s, 1);
  add(at(11s), 5s, 2);
  add(at(13s), 0s, 3);
  EXPECT_EQ(schedule.nextWake(), at(12s));
  EXPECT_EQ(schedule.nextDeadline(), at(10s));
  EXPECT_EQ(due(at(12s)), (std::vector{1, 2}));
  EXPECT_EQ(schedule.nextWake(), at(13s));
}

TEST_F(TimerScheduleTest, ShortLeewayOfALaterDeadlineDecidesTheWake) {
  add(at(10s), 10s, 1);
  add(at(12s), 1s, 2);
  EXPECT_EQ(schedule.nextWake(), at(13s));
  EXPECT_EQ(due(at(13s)), (std::vector{1, 2}));
  EXPECT_EQ(schedule.nextWake(), std::nullopt);
}

TEST_F(TimerScheduleTest, RemovedActionIsHandedBackOnce) {
  const auto identifier = add(at(1s), 0s, 1);
  EXPECT_TRUE(schedule.remove(identifier));
  EXPECT_FALSE(schedule.remove(identifier));
  EXPECT_FALSE(schedule.remove(0));
  EXPECT_EQ(schedule.nextWake(), std::nullopt);
}

TEST_F(TimerScheduleTest, DelaysBeyondTheEndOfTimeStandAtItsEnd) {
  EXPECT_EQ(TimerSchedule::after(at(10s), Duration::max()), SteadyTime::max());
  EXPECT_EQ(TimerSchedule::after(at(10s), -5s), at(10s));
  add(TimerSchedule::after(at(10s), Duration::max()), Duration::max(), 1);
  EXPECT_EQ(schedule.nextWake(), SteadyTime::max());
}

class TimerTest : public testing::Test {
 protected:
  ManualScheduler scheduler;
  std::shared_ptr<Queue> queue = scheduler.makeSerialQueue("queue");
  int fired = 0;
  std::unique_ptr<Timer> timer = scheduler.makeTimer(queue, [this] { ++fired; });
};

TEST_F(TimerTest, IsMadeStopped) {
  scheduler.advance(24h);
  EXPECT_EQ(fired, 0);
}

TEST_F(TimerTest, WithoutAPeriodFiresOnce) {
  timer->start(5s, std::nullopt, 0s);
  scheduler.advance(4s);
  EXPECT_EQ(fired, 0);
  scheduler.advance(1s);
  EXPECT_EQ(fired, 1);
  scheduler.advance(1h);
  EXPECT_EQ(fired, 1);
}

TEST_F(TimerTest, WithAPeriodFiresFirstThenEveryPeriod) {
  timer->start(1s, 10s, 0s);
  scheduler.advance(1s);
  EXPECT_EQ(fired, 1);
  scheduler.advance(9s);
  EXPECT_EQ(fired, 1);
  scheduler.advance(21s);
  EXPECT_EQ(fired, 4);
}

TEST_F(TimerTest, StartingARunningTimerSetsItAnew) {
  timer->start(5s, 5s, 0s);
  scheduler.advance(4s);
  timer->start(5s, std::nullopt, 0s);
  scheduler.advance(4s);
  EXPECT_EQ(fired, 0);
  scheduler.advance(20s);
  EXPECT_EQ(fired, 1);
}

TEST_F(TimerTest, CancelOnItsQueueStopsATickThatIsOnItsWay) {
  queue->asyncAfter(5s, [this] { timer->cancel(); });
  timer->start(5s, 5s, 0s);
  scheduler.advance(20s);
  EXPECT_EQ(fired, 0);
  timer->start(1s, std::nullopt, 0s);
  scheduler.advance(1s);
  EXPECT_EQ(fired, 1);
}

TEST_F(TimerTest, DestructionCancelsATickThatIsOnItsWay) {
  queue->asyncAfter(5s, [this] { timer.reset(); });
  timer->start(5s, 5s, 0s);
  scheduler.advance(20s);
  EXPECT_EQ(fired, 0);
}

TEST_F(TimerTest, HandlerMayRestartCancelAndDestroyItsTimer) {
  std::unique_ptr<Timer> own;
  int count = 0;
  own = scheduler.makeTimer(queue, [&] {
    if (++count == 1) own->start(2s, 2s, 0s);
    if (count == 3) own.reset();
  });
  own->start(1s, std::nullopt, 0s);
  scheduler.advance(1min);
  EXPECT_EQ(count, 3);
  EXPECT_EQ(scheduler.pendingDeadlines(), 0u);
}

TEST_F(TimerTest, TicksWhileTheQueueIsBusyAreCoalesced) {
  timer->start(1s, 1s, 0s);
  queue->sync([&] { scheduler.advance(10s); });
  EXPECT_EQ(fired, 0);
  EXPECT_EQ(scheduler.pendingTasks(), 1u);
  scheduler.runUntilIdle();
  EXPECT_EQ(fired, 1);
  scheduler.advance(1s);
  EXPECT_EQ(fired, 2);
}

TEST_F(TimerTest, PeriodOfNothingIsHeldApart) {
  timer->start(0s, 0s, 0s);
  scheduler.advance(10ms);
  EXPECT_GE(fired, 2);
  EXPECT_LE(fired, 11);
}

}  // namespace
}  // namespace velk
