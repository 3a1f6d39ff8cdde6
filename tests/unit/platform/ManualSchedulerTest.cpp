#include "tests/support/ManualScheduler.h"

#include <gtest/gtest.h>

#include <vector>

namespace velk {
namespace {

using namespace std::chrono_literals;
using test::ManualScheduler;

TEST(ManualScheduler, RunsNothingBeforeItIsTold) {
  ManualScheduler scheduler;
  const auto queue = scheduler.makeSerialQueue("queue");
  int ran = 0;
  queue->async([&] { ++ran; });
  EXPECT_EQ(ran, 0);
  EXPECT_EQ(scheduler.runUntilIdle(), 1u);
  EXPECT_EQ(ran, 1);
}

TEST(ManualScheduler, RunsTasksOfAllQueuesInTheOrderOfHandingOver) {
  ManualScheduler scheduler;
  const auto first = scheduler.makeSerialQueue("first");
  const auto second = scheduler.makeSerialQueue("second");
  std::vector<int> order;
  first->async([&] {
    order.push_back(1);
    first->async([&] { order.push_back(4); });
  });
  second->async([&] { order.push_back(2); });
  first->async([&] { order.push_back(3); });
  scheduler.runUntilIdle();
  EXPECT_EQ(order, (std::vector{1, 2, 3, 4}));
}

TEST(ManualScheduler, SyncRunsWhatIsPendingThenInline) {
  ManualScheduler scheduler;
  const auto queue = scheduler.makeSerialQueue("queue");
  const auto other = scheduler.makeSerialQueue("other");
  std::vector<int> order;
  other->async([&] { order.push_back(3); });
  queue->async([&] { order.push_back(1); });
  queue->sync([&] {
    order.push_back(2);
    EXPECT_TRUE(queue->isCurrent());
    queue->sync([&] { EXPECT_TRUE(queue->isCurrent()); });
    other->sync([&] { EXPECT_TRUE(queue->isCurrent() && other->isCurrent()); });
  });
  EXPECT_FALSE(queue->isCurrent());
  EXPECT_EQ(order, (std::vector{1, 2, 3}));
}

TEST(ManualScheduler, AdvanceFiresInTimeOrderWithTheClockAtEachDeadline) {
  ManualScheduler scheduler;
  const auto queue = scheduler.makeSerialQueue("queue");
  const auto begin = scheduler.clock().steadyTime();
  const auto wall = scheduler.clock().wallTime();
  std::vector<std::chrono::seconds> times;
  const auto note = [&] {
    times.push_back(std::chrono::duration_cast<std::chrono::seconds>(scheduler.clock().steadyTime() - begin));
  };
  const auto timer = scheduler.makeTimer(queue, note);
  timer->start(2s, 2s, 1s);
  queue->asyncAfter(3s, note);
  scheduler.advance(5s);
  EXPECT_EQ(times, (std::vector{2s, 3s, 4s}));
  EXPECT_EQ(scheduler.clock().wallTime().seconds, wall.seconds + 5);
  EXPECT_EQ(scheduler.timeToNextDeadline(), 1s);
  timer->cancel();
  scheduler.advance(10s);
  EXPECT_EQ(times.size(), 3u);
  EXPECT_EQ(scheduler.pendingDeadlines(), 0u);
}

TEST(ManualScheduler, JumpOfTheClockCoalescesMissedPeriods) {
  ManualScheduler scheduler;
  const auto queue = scheduler.makeSerialQueue("queue");
  int fired = 0;
  const auto timer = scheduler.makeTimer(queue, [&] { ++fired; });
  timer->start(1s, 1s, 0s);
  scheduler.fakeClock().advance(10'500ms);
  scheduler.advance(0s);
  EXPECT_EQ(fired, 1);
  EXPECT_EQ(scheduler.timeToNextDeadline(), 500ms);
}

TEST(ManualScheduler, QueuesAndTimersMayOutliveIt) {
  auto scheduler = std::make_unique<ManualScheduler>();
  const auto queue = scheduler->makeSerialQueue("queue");
  bool ran = false;
  const auto timer = scheduler->makeTimer(queue, [&] { ran = true; });
  timer->start(1s, std::nullopt, 0s);
  queue->async([&] { ran = true; });
  scheduler.reset();
  queue->async([&] { ran = true; });
  timer->start(1s, std::nullopt, 0s);
  EXPECT_FALSE(ran);
  EXPECT_EQ(queue->sync([] { return 7; }), 7);
}

}  // namespace
}  // namespace velk
