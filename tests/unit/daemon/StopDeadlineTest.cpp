#include "daemon/StopDeadline.h"

#include <gtest/gtest.h>

#include <atomic>

#include "daemon/CoalescedTask.h"
#include "platform/Semaphore.h"
#include "tests/support/ManualScheduler.h"
#include "tests/support/RecordingLog.h"

namespace velk {
namespace {

constexpr Duration kPatience = std::chrono::seconds(60);

TEST(StopDeadlineTest, NamesTheWaitThatTakesTooLong) {
  test::RecordingLog log;
  Semaphore passed;
  StopDeadline deadline(std::chrono::milliseconds(1), [&] { passed.signal(); });
  ASSERT_TRUE(deadline.prepare());
  deadline.expect("an earlier wait", "nothing");
  deadline.expect("a disk", "what was not written");
  deadline.begin();
  ASSERT_TRUE(passed.waitFor(kPatience));
  EXPECT_EQ(log.count(log::Level::error,
                      "stop: still waiting for a disk after 1 ms; the process ends without it: what was not written"),
            1);
}

TEST(StopDeadlineTest, SaysHowMuchIsLeft) {
  StopDeadline deadline(std::chrono::hours(1), [] {});
  ASSERT_TRUE(deadline.prepare());
  deadline.begin();
  EXPECT_GT(deadline.leftUntil(std::chrono::hours(1)), std::chrono::minutes(30));
  EXPECT_EQ(deadline.leftUntil(Duration::zero()), Duration::zero());
}

TEST(StopDeadlineTest, EndsNothingOnceItWasCancelled) {
  std::atomic<int> ended{0};
  StopDeadline deadline(std::chrono::hours(1), [&] { ++ended; });
  ASSERT_TRUE(deadline.prepare());
  deadline.begin();
  deadline.cancel();
  EXPECT_EQ(ended, 0);
}

TEST(CoalescedTaskTest, DoesOnceWhatIsAskedForBeforeItBegins) {
  test::ManualScheduler scheduler;
  int done = 0;
  CoalescedTask task(scheduler.makeSerialQueue("reload"), [&] { ++done; });
  for (int request = 0; request < 100; ++request) task.request();
  static_cast<void>(scheduler.runUntilIdle());
  EXPECT_EQ(done, 1);
  task.request();
  static_cast<void>(scheduler.runUntilIdle());
  EXPECT_EQ(done, 2);
}

TEST(CoalescedTaskTest, DoesAgainWhatIsAskedForWhileItRuns) {
  test::ManualScheduler scheduler;
  int done = 0;
  CoalescedTask* self = nullptr;
  CoalescedTask task(scheduler.makeSerialQueue("reload"), [&] {
    if (++done == 1) self->request();
  });
  self = &task;
  task.request();
  static_cast<void>(scheduler.runUntilIdle());
  EXPECT_EQ(done, 2);
}

}  // namespace
}  // namespace velk
